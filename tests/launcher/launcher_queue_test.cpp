// The launcher on its own queue, where the order of its events matters: a backlight change
// that reaches the queue after the destroy request, and the destroy request handled on the
// backlight notification's own callback thread, which then ends its own subscription.
#include "tests/launcher/launchertestsupport.h"
#include "service/cudptestlauncher.h"

#include <thread>

using namespace launchertest;

namespace
{
// A launcher whose next event waits, inside the queue, until the test lets it go: the events
// posted meanwhile queue up behind it and run on the same thread afterwards.
class CHeldLauncher : public CUDPTestLauncher
{
public:
    CHeldLauncher()
        : m_hEntered(CreateEventW(nullptr, TRUE, FALSE, nullptr))
        , m_hRelease(CreateEventW(nullptr, TRUE, FALSE, nullptr))
    {
    }
    ~CHeldLauncher() override
    {
        CloseHandle(m_hEntered);
        CloseHandle(m_hRelease);
    }

    void HoldNext() { InterlockedExchange(&m_lHold, 1); }
    bool WaitEntered() { return WaitForSingleObject(m_hEntered, c_dwWaitMs) == WAIT_OBJECT_0; }
    void Let() { SetEvent(m_hRelease); }
    DWORD HeldThread() const { return m_dwHeldThread; }

    void Dispatch(ULONG ulEventType, ULONG_PTR ulArg1, ULONG_PTR ulArg2, ULONG_PTR ulArg3) override
    {
        if (InterlockedExchange(&m_lHold, 0) != 0)
        {
            m_dwHeldThread = GetCurrentThreadId();
            SetEvent(m_hEntered);
            WaitForSingleObject(m_hRelease, c_dwWaitMs);
        }
        CUDPTestLauncher::Dispatch(ulEventType, ulArg1, ulArg2, ulArg3);
    }

private:
    HANDLE m_hEntered;
    HANDLE m_hRelease;
    volatile LONG m_lHold = 0;
    DWORD m_dwHeldThread = 0;
};

class LauncherQueueTest : public CLauncherTest
{
protected:
    void SetUp() override
    {
        CLauncherTest::SetUp();
        WritePolicyFile({{"RelayPort", "47320"}});
    }
};

// The notification was on its way when the destroy request came; with every gate open it
// would start a test whose end nothing waits for any more.
TEST_F(LauncherQueueTest, BacklightQueuedBehindDestroyStartsNothing)
{
    DWORD cLaunches = ChamberLaunchCount();
    CHeldLauncher launcher;
    launcher.HoldNext();
    std::thread destroyer([&] { launcher.RequestDestroy(); });
    ASSERT_TRUE(launcher.WaitEntered());
    const DWORD dwOff = 0;
    CUDPTestLauncher::WnfNotificationCallback(c_ullBacklightStateName, 1, nullptr, &launcher,
                                              &dwOff, sizeof(dwOff));
    launcher.Let();
    destroyer.join();
    launcher.WaitForDestroyComplete();

    EXPECT_TRUE(m_trace.Contains(c_szHandlerToggled));
    EXPECT_TRUE(m_trace.Contains(c_szDestroyingIgnored));
    EXPECT_FALSE(m_trace.Contains(c_szLoadingConfig));
    EXPECT_EQ(cLaunches, ChamberLaunchCount());
}

// The destroy request queued behind a backlight change runs on the notification's callback
// thread and ends that very subscription from inside its callback.
TEST_F(LauncherQueueTest, DestroyEndsSubscriptionFromInsideItsCallback)
{
    // Never freed, as the coordinator's launcher lives as long as its DLL: the callback thread
    // still returns through it (its Release) after the destroy has completed.
    CHeldLauncher &launcher = *new CHeldLauncher();
    launcher.HoldNext();
    // The prefix's backlight (1) is delivered to the new subscription at once.
    ASSERT_EQ(0, StateSubscriptionBegin(launcher.SubscriptionSlot(), c_ullBacklightStateName,
                                        CUDPTestLauncher::WnfNotificationCallback, &launcher));
    ASSERT_TRUE(launcher.WaitEntered());
    EXPECT_NE(GetCurrentThreadId(), launcher.HeldThread());
    launcher.RequestDestroy(); // the launcher is busy: queued, returns at once
    launcher.Let();
    launcher.WaitForDestroyComplete();

    EXPECT_EQ(nullptr, *launcher.SubscriptionSlot());
    EXPECT_EQ(1u, m_trace.CountLines(c_szCallbackToggled));
    EXPECT_TRUE(m_trace.Contains(c_szFinishedDestruction));
}
} // namespace
