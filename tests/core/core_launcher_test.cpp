// The UDP test launcher's lifecycle inside the coordinator: with the platform component
// registered, Start subscribes it to the backlight, a published change reaches its queue, and
// the stop unsubscribes and drains it. Serial: the component's registration is the prefix's.
#include "tests/core/coretestsupport.h"
#include "service/statesubscription.h"
#include "platform/statenotify/statenotifypublish.h"

using namespace coretest;

TEST(CoreLauncher, HearsTheBacklightWhileRunningAndIsDrainedAtStop)
{
    testsupport::FailureCapture failures;
    CTraceSession trace;
    std::wstring wstrComponent = L"\"" + testsupport::BinDir() + L"platformcomponent.dll\"";
    ASSERT_EQ(0u, testsupport::RunChild(L"regsvr32 /s " + wstrComponent).dwExitCode);
    {
        std::wstring wstrActivity = pipetest::UniquePipeName(L"wnfact");
        std::wstring wstrCollector = pipetest::UniquePipeName(L"wnfcol");
        CTestCoordinator service(wstrActivity.c_str(), wstrCollector.c_str());
        service.OnStart();
        ASSERT_TRUE(WaitUntil([&] { return service.State() == SERVICE_RUNNING; }));

        size_t cBefore =
            trace.Count("CUDPTestLauncher::Dispatch_BacklightChangedup  () - backlight toggled");
        ULONG ulOff = 0;
        ASSERT_EQ(S_OK,
                  StateNotifyPublish(c_ullBacklightStateName, &ulOff, sizeof(ulOff), nullptr));
        EXPECT_TRUE(trace.WaitFor("CUDPTestLauncher::WnfNotificationCallback() - backlight toggled",
                                  cBefore + 1));
        EXPECT_TRUE(trace.WaitFor(
            "CUDPTestLauncher::Dispatch_BacklightChangedup  () - backlight toggled", cBefore + 1));

        service.OnStop();
        EXPECT_EQ(1u, trace.Count("CUDPTestLauncher::Dispatch_AdvanceDestruction() - finished "
                                  "destruction, signaling event"));
        // Unsubscribed: a later change reaches nobody.
        size_t cAfterStop = trace.Count("CUDPTestLauncher::WnfNotificationCallback() - backlight "
                                        "toggled");
        ASSERT_EQ(S_OK,
                  StateNotifyPublish(c_ullBacklightStateName, &ulOff, sizeof(ulOff), nullptr));
        Sleep(200);
        EXPECT_EQ(cAfterStop, trace.Count("CUDPTestLauncher::WnfNotificationCallback() - "
                                          "backlight toggled"));
    }
    testsupport::RunChild(L"regsvr32 /s /u " + wstrComponent);
    for (const std::wstring &line : failures.Lines())
    {
        ADD_FAILURE() << testsupport::Narrow(line);
    }
}
