// The shell's ServiceMain under the prefix's real control manager, in a test service of its
// own (servicetest_child.exe) or in telvanehost.exe (servicetest.dll, or telvane.dll under a
// name it does not serve), under test-only names.
#include "inc/handleholder.h"
#include "servicelib/reghelper.h"
#include "servicelib/service.h"
#include "tests/common/scmtest.h"
#include "tests/service/testservice.h"

#include <gtest/gtest.h>

#include <atomic>
#include <thread>

using namespace testsupport;

namespace
{
// A test-only service, deleted again at the end: servicetest_child.exe in a process of its own,
// or the DLL given run by telvanehost.exe alone in a test-only group. It holds the release event
// of a "hold-stop" service (see childservice.h) and signals it however the test ends, so that
// the service can stop before it is removed. Test thread only.
class CTestServiceHolder
{
public:
    explicit CTestServiceHolder(const wchar_t *wszDll = nullptr)
        : m_wstrName(UniqueName(wszDll == nullptr ? L"TelvaneTestChild" : L"TelvaneTestHosted"))
        , m_wstrGroup(UniqueName(L"TelvaneTestGroup"))
        , m_cleanup(m_wstrName)
        , m_release(
              CreateEventW(nullptr, TRUE, FALSE, (L"Global\\" + m_wstrName + L"_release").c_str()))
    {
        if (wszDll == nullptr)
        {
            m_fCreated = ServiceCreateOwnProcess(Name(), BinCommand(L"servicetest_child.exe"));
            return;
        }
        m_fCreated =
            ServiceCreateOwnProcess(Name(), BinCommand(L"telvanehost.exe") + L" -k " + m_wstrGroup);
        // Without the service, its key would stay behind with these values.
        if (m_fCreated)
        {
            std::wstring wstrParameters =
                L"SYSTEM\\CurrentControlSet\\Services\\" + m_wstrName + L"\\Parameters";
            RegHelperSetString(wstrParameters.c_str(), L"ServiceDll", BinDir() + wszDll,
                               REG_EXPAND_SZ);
            RegHelperSetMultiString(c_wszSvchostGroupKey, m_wstrGroup.c_str(), {m_wstrName});
        }
    }
    ~CTestServiceHolder()
    {
        Release();
        RegHelperDeleteValue(c_wszSvchostGroupKey, m_wstrGroup.c_str());
    }
    const wchar_t *Name() const { return m_wstrName.c_str(); }
    bool Created() const { return m_fCreated && m_release.Get() != nullptr; }
    void Release() { SetEvent(m_release.Get()); }

    // Starts with the parameters and waits for RUNNING; the service's process id, or 0.
    DWORD StartRunning(const std::vector<std::wstring> &rgArgs)
    {
        SERVICE_STATUS_PROCESS status = {};
        EXPECT_EQ(0u, ServiceStart(Name(), rgArgs));
        EXPECT_TRUE(ServiceWaitForState(Name(), SERVICE_RUNNING, c_dwWaitMs, &status))
            << status.dwCurrentState;
        return status.dwCurrentState == SERVICE_RUNNING ? status.dwProcessId : 0;
    }

private:
    std::wstring m_wstrName;
    std::wstring m_wstrGroup;
    CServiceCleanup m_cleanup;
    CKernelHandle m_release;
    bool m_fCreated = false;
};
} // namespace

TEST(ServiceMainUnderScm, StartPendingReportAndDebugSwitch)
{
    CTestServiceHolder child;
    ASSERT_TRUE(child.Created());
    struct
    {
        std::vector<std::wstring> rgArgs;
        DWORD dwWaitHint;
        DWORD dwBreakpoints;
    } rgCases[] = {
        {{L"hold-start"}, 10000, 0},
        {{L"hold-start", L"-d"}, 3600000, 1},
    };
    for (const auto &testCase : rgCases)
    {
        SCOPED_TRACE(testCase.rgArgs.size());
        ASSERT_EQ(0u, ServiceStart(child.Name(), testCase.rgArgs));
        SERVICE_STATUS_PROCESS status = {};
        ASSERT_TRUE(ServiceWaitForState(child.Name(), SERVICE_START_PENDING, c_dwWaitMs, &status))
            << status.dwCurrentState;
        EXPECT_EQ(static_cast<DWORD>(SERVICE_WIN32_OWN_PROCESS), status.dwServiceType);
        EXPECT_EQ(static_cast<DWORD>(SERVICE_ACCEPT_STOP), status.dwControlsAccepted);
        EXPECT_EQ(0u, status.dwCheckPoint);
        EXPECT_EQ(testCase.dwWaitHint, status.dwWaitHint);

        // Without a host, STOP runs OnStop in the handler, even before RUNNING.
        EXPECT_EQ(0u, ServiceStop(child.Name()));
        ASSERT_TRUE(ServiceWaitForState(child.Name(), SERVICE_STOPPED, c_dwWaitMs, &status));
        // The child reports the breakpoints it saw after START_PENDING.
        EXPECT_EQ(static_cast<DWORD>(ERROR_SERVICE_SPECIFIC_ERROR), status.dwWin32ExitCode);
        EXPECT_EQ(testCase.dwBreakpoints, status.dwServiceSpecificExitCode);
    }
}

// Under telvanehost a STOP reaches OnStop through the host's stop callback: the control
// returns at once with RUNNING while OnStop still works. Someone then deleted the service while
// it was stopping (sc stop, sc delete): the record stays, marked for deletion, until the service
// is down. Unregistering it then is no error: the stopping service cannot take another STOP
// (1061) and is already marked (1072).
TEST(TelvaneHost, StopThroughTheHostThenUnregisterOfAServiceMarkedForDeletion)
{
    FailureCapture failures;
    CTestServiceHolder hosted(L"servicetest.dll");
    ASSERT_TRUE(hosted.Created());
    ASSERT_NE(0u, hosted.StartRunning({L"hold-stop"}));
    SERVICE_STATUS statusControl = {};
    ASSERT_EQ(0u, ServiceControl(hosted.Name(), SERVICE_CONTROL_STOP, &statusControl));
    EXPECT_EQ(static_cast<DWORD>(SERVICE_RUNNING), statusControl.dwCurrentState);
    ASSERT_TRUE(ServiceDelete(hosted.Name()));

    CTestService service(hosted.Name());
    CService::RegisterService(&service);
    std::atomic<bool> fDone{false};
    std::thread unregister([&] {
        service.UnregisterOneService();
        fDone = true;
    });
    // Where the record lasts until the service is down (Windows), unregistering waits for
    // it: let the service go after a while. Wine drops the record at once.
    WaitUntil([&] { return fDone.load(); }, 1000);
    hosted.Release();
    unregister.join();
    EXPECT_EQ(0u, failures.Count());
    EXPECT_FALSE(ServiceExists(hosted.Name()));
    EXPECT_EQ(1, service.m_cUnregisters);
}

// A stopped service is deleted only once its host has left; registering the name again
// must wait for that instead of failing with "marked for delete".
TEST(TelvaneHost, RegistrationWaitsUntilTheOldServiceIsGone)
{
    FailureCapture failures;
    CTestServiceHolder hosted(L"servicetest.dll");
    ASSERT_TRUE(hosted.Created());
    ASSERT_NE(0u, hosted.StartRunning({L"linger"}));

    CTestService service(hosted.Name());
    service.m_idsLocalizedName = 1;
    service.m_idsDescription = 2;
    service.m_ulStartType = SERVICE_DEMAND_START;
    CService::RegisterService(&service);
    service.RegisterOneService();
    EXPECT_EQ(0u, failures.Count());
    SERVICE_RECORD record;
    ASSERT_TRUE(ServiceReadRecord(hosted.Name(), &record));
    EXPECT_EQ(static_cast<DWORD>(SERVICE_DEMAND_START), record.dwStartType);
    EXPECT_EQ(static_cast<DWORD>(SERVICE_WIN32_OWN_PROCESS), record.dwServiceType);

    // Unregistering returns only once the name is free.
    service.UnregisterOneService();
    EXPECT_FALSE(ServiceExists(hosted.Name()));
    EXPECT_EQ(0u, failures.Count());
}

// A host that loads telvane.dll for a name the DLL does not serve gets a prompt STOPPED with
// ERROR_SERVICE_NOT_IN_EXE instead of a start that times out.
TEST(TelvaneHost, TelvaneDllAnswersAnUnknownNameAtOnce)
{
    CTestServiceHolder hosted(L"telvane.dll");
    ASSERT_TRUE(hosted.Created());
    // Wine's StartService reports 1053 for a service that stops before it ran; Windows
    // reports success. Either way the status tells why.
    DWORD dwStart = ServiceStart(hosted.Name(), {});
    EXPECT_TRUE(dwStart == ERROR_SUCCESS || dwStart == ERROR_SERVICE_REQUEST_TIMEOUT) << dwStart;
    SERVICE_STATUS_PROCESS status = {};
    EXPECT_TRUE(ServiceWaitForState(hosted.Name(), SERVICE_STOPPED, c_dwWaitMs, &status));
    EXPECT_EQ(static_cast<DWORD>(ERROR_SERVICE_NOT_IN_EXE), status.dwWin32ExitCode);
}

TEST(TelvaneRun, InvalidCommandLinesExitWithThree)
{
    for (const wchar_t *wszArgs : {L"Nobody", L"-x", L"Telvane -q", L"-"})
    {
        SCOPED_TRACE(Narrow(wszArgs));
        ChildResult result = RunTelvane(wszArgs);
        EXPECT_FALSE(result.fTimedOut);
        EXPECT_EQ(3u, result.dwExitCode) << result.strOutput;
        EXPECT_NE(std::string::npos, result.strOutput.find("Invalid command line"));
    }
}
