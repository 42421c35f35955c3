// The shell's ServiceMain under the prefix's real control manager, in a test service of its
// own (servicetest_child.exe) or in telvanehost.exe (servicetest.dll, or telvane.dll under a
// name it does not serve), under test-only names.
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
// The release event of a "hold-stop" service (see childservice.h), signalled and closed however
// the test ends so that the service can stop before the test removes it. Test thread only.
class CReleaseOnExit
{
public:
    explicit CReleaseOnExit(const wchar_t *wszService)
        : m_hEvent(CreateEventW(nullptr, TRUE, FALSE,
                                (std::wstring(L"Global\\") + wszService + L"_release").c_str()))
    {
    }
    ~CReleaseOnExit()
    {
        if (m_hEvent != nullptr)
        {
            SetEvent(m_hEvent);
            CloseHandle(m_hEvent);
        }
    }
    CReleaseOnExit(const CReleaseOnExit &) = delete;
    CReleaseOnExit &operator=(const CReleaseOnExit &) = delete;
    HANDLE Get() const { return m_hEvent; }

private:
    HANDLE m_hEvent;
};

// A test-only service, deleted again at the end: servicetest_child.exe in a process of its own,
// or the DLL given run by telvanehost.exe alone in a test-only group. Test thread only.
class CTestServiceHolder
{
public:
    explicit CTestServiceHolder(const wchar_t *wszDll = nullptr)
        : m_wstrName(UniqueName(wszDll == nullptr ? L"TelvaneTestChild" : L"TelvaneTestHosted"))
        , m_wstrGroup(UniqueName(L"TelvaneTestGroup"))
        , m_cleanup(m_wstrName)
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
    ~CTestServiceHolder() { RegHelperDeleteValue(c_wszSvchostGroupKey, m_wstrGroup.c_str()); }
    const wchar_t *Name() const { return m_wstrName.c_str(); }
    bool Created() const { return m_fCreated; }

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

// Any client with user-control access (on Windows, interactive users by default) can send
// a control of 128 to 255 to any service, whether it asked for them or not. One it never
// asked for must leave it running: here the default OnControl would end the process.
TEST(ServiceMainUnderScm, UserControlNobodyAskedForLeavesTheServiceRunning)
{
    CTestServiceHolder child;
    ASSERT_TRUE(child.Created());
    CServiceProcess process(child.StartRunning({}));
    ASSERT_TRUE(process.Opened());

    SERVICE_STATUS statusControl = {};
    EXPECT_EQ(0u, ServiceControl(child.Name(), 200, &statusControl));
    EXPECT_EQ(static_cast<DWORD>(SERVICE_RUNNING), statusControl.dwCurrentState);

    // Still alive: it stops as usual, with no breakpoint seen, and its process leaves cleanly.
    SERVICE_STATUS_PROCESS status = {};
    EXPECT_EQ(0u, ServiceStop(child.Name()));
    EXPECT_TRUE(ServiceWaitForState(child.Name(), SERVICE_STOPPED, c_dwWaitMs, &status));
    EXPECT_EQ(0u, status.dwServiceSpecificExitCode);
    DWORD dwExitCode = process.WaitForExitCode(c_dwWaitMs);
    EXPECT_EQ(0u, dwExitCode) << std::hex << dwExitCode;
}

// Under telvanehost a STOP reaches OnStop through the host's stop callback: the control
// returns at once with RUNNING while OnStop still works, and the host leaves after STOPPED.
TEST(TelvaneHost, StopGoesThroughTheHostStopCallback)
{
    CTestServiceHolder hosted(L"servicetest.dll");
    ASSERT_TRUE(hosted.Created());
    CReleaseOnExit release(hosted.Name());
    ASSERT_NE(nullptr, release.Get());
    CServiceProcess host(hosted.StartRunning({L"hold-stop"}));
    ASSERT_TRUE(host.Opened());

    SERVICE_STATUS statusControl = {};
    EXPECT_EQ(0u, ServiceControl(hosted.Name(), SERVICE_CONTROL_STOP, &statusControl));
    EXPECT_EQ(static_cast<DWORD>(SERVICE_RUNNING), statusControl.dwCurrentState);
    SERVICE_STATUS_PROCESS status = {};
    ASSERT_TRUE(ServiceQueryStatus(hosted.Name(), &status));
    EXPECT_EQ(static_cast<DWORD>(SERVICE_RUNNING), status.dwCurrentState);

    SetEvent(release.Get());
    EXPECT_TRUE(ServiceWaitForState(hosted.Name(), SERVICE_STOPPED, c_dwWaitMs));
    EXPECT_EQ(0u, host.WaitForExitCode(c_dwWaitMs));
}

// Someone deleted the service while it was stopping (sc stop, sc delete): the record stays,
// marked for deletion, until the service is down. Unregistering it then is no error: the
// stopping service cannot take another STOP (1061) and is already marked (1072).
TEST(TelvaneHost, UnregisterOfAStoppingServiceMarkedForDeletion)
{
    FailureCapture failures;
    CTestServiceHolder hosted(L"servicetest.dll");
    ASSERT_TRUE(hosted.Created());
    CReleaseOnExit release(hosted.Name());
    ASSERT_NE(nullptr, release.Get());
    ASSERT_NE(0u, hosted.StartRunning({L"hold-stop"}));
    ASSERT_EQ(0u, ServiceStop(hosted.Name()));
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
    SetEvent(release.Get());
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
