// The shell's ServiceMain under the prefix's real control manager, in a test service of its
// own (servicetest_child.exe) or in telvanehost.exe, under test-only names.
#include "servicelib/reghelper.h"
#include "servicelib/service.h"
#include "tests/common/testsupport.h"
#include "tests/common/scmtest.h"
#include "tests/service/testservice.h"

#include <gtest/gtest.h>

#include <thread>

using testsupport::FailureCapture;

namespace
{
const DWORD c_dwStateWaitMs = 30000;

// The release event of a "hold-stop" service (see childservice.h), signalled and closed however the
// test ends so that the service can stop before the test removes it.
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

std::wstring Quoted(const std::wstring &wstrPath)
{
    return L"\"" + wstrPath + L"\"";
}

// A test-only own-process service running servicetest_child.exe, deleted again at the end.
class CChildServiceHolder
{
public:
    CChildServiceHolder()
        : m_wstrName(testsupport::UniqueName(L"TelvaneTestChild"))
        , m_cleanup(m_wstrName)
    {
        m_fCreated = testsupport::ServiceCreateOwnProcess(
            m_wstrName.c_str(), Quoted(testsupport::BinDir() + L"servicetest_child.exe"));
    }
    const wchar_t *Name() const { return m_wstrName.c_str(); }
    bool Created() const { return m_fCreated; }

    // Starts the service under host globals with OnStop held until the release event, and
    // sends STOP; the status the control returned goes to *pStatus.
    ::testing::AssertionResult StartAndHoldStop(SERVICE_STATUS *pStatus)
    {
        DWORD dwError = testsupport::ServiceStart(Name(), {L"host", L"hold-stop"});
        if (dwError != ERROR_SUCCESS)
        {
            return ::testing::AssertionFailure() << "StartService: " << dwError;
        }
        if (!testsupport::ServiceWaitForState(Name(), SERVICE_RUNNING, c_dwStateWaitMs))
        {
            return ::testing::AssertionFailure() << "never RUNNING";
        }
        dwError = testsupport::ServiceControl(Name(), SERVICE_CONTROL_STOP, pStatus);
        if (dwError != ERROR_SUCCESS)
        {
            return ::testing::AssertionFailure() << "STOP: " << dwError;
        }
        return ::testing::AssertionSuccess();
    }

private:
    std::wstring m_wstrName;
    testsupport::CServiceCleanup m_cleanup;
    bool m_fCreated;
};
} // namespace

TEST(ServiceMainUnderScm, StartPendingReportAndDebugSwitch)
{
    CChildServiceHolder child;
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
        ASSERT_EQ(0u, testsupport::ServiceStart(child.Name(), testCase.rgArgs));
        SERVICE_STATUS_PROCESS status = {};
        ASSERT_TRUE(
            testsupport::ServiceWaitForState(child.Name(), SERVICE_START_PENDING, c_dwStateWaitMs, &status))
            << status.dwCurrentState;
        EXPECT_EQ(static_cast<DWORD>(SERVICE_WIN32_OWN_PROCESS), status.dwServiceType);
        EXPECT_EQ(static_cast<DWORD>(SERVICE_ACCEPT_STOP), status.dwControlsAccepted);
        EXPECT_EQ(0u, status.dwCheckPoint);
        EXPECT_EQ(testCase.dwWaitHint, status.dwWaitHint);

        // Without a host, STOP runs OnStop in the handler, even before RUNNING.
        EXPECT_EQ(0u, testsupport::ServiceStop(child.Name()));
        ASSERT_TRUE(testsupport::ServiceWaitForState(child.Name(), SERVICE_STOPPED, c_dwStateWaitMs, &status));
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
    CChildServiceHolder child;
    ASSERT_TRUE(child.Created());
    ASSERT_EQ(0u, testsupport::ServiceStart(child.Name(), {}));
    SERVICE_STATUS_PROCESS status = {};
    ASSERT_TRUE(testsupport::ServiceWaitForState(child.Name(), SERVICE_RUNNING, c_dwStateWaitMs, &status));
    testsupport::CServiceProcess process(status.dwProcessId);
    ASSERT_TRUE(process.Opened());

    SERVICE_STATUS statusControl = {};
    EXPECT_EQ(0u, testsupport::ServiceControl(child.Name(), 200, &statusControl));
    EXPECT_EQ(static_cast<DWORD>(SERVICE_RUNNING), statusControl.dwCurrentState);

    // Still alive: it stops as usual, with no breakpoint seen, and its process leaves cleanly.
    if (testsupport::ServiceStop(child.Name()) == ERROR_SUCCESS)
    {
        EXPECT_TRUE(testsupport::ServiceWaitForState(child.Name(), SERVICE_STOPPED, c_dwStateWaitMs, &status));
        EXPECT_EQ(0u, status.dwServiceSpecificExitCode);
    }
    DWORD dwExitCode = process.WaitForExitCode(c_dwStateWaitMs);
    EXPECT_EQ(0u, dwExitCode) << std::hex << dwExitCode;
}

TEST(ServiceMainUnderScm, StopUnderHostReturnsAtOnceAndStopsWhenOnStopEnds)
{
    CChildServiceHolder child;
    ASSERT_TRUE(child.Created());
    CReleaseOnExit release(child.Name());
    ASSERT_NE(nullptr, release.Get());

    // The handler only signals the stop event: the control returns with RUNNING, and the
    // service stays RUNNING while OnStop works on the host's stop-callback thread.
    SERVICE_STATUS status = {};
    ASSERT_TRUE(child.StartAndHoldStop(&status));
    EXPECT_EQ(static_cast<DWORD>(SERVICE_RUNNING), status.dwCurrentState);
    SERVICE_STATUS_PROCESS statusNow = {};
    ASSERT_TRUE(testsupport::ServiceQueryStatus(child.Name(), &statusNow));
    EXPECT_EQ(static_cast<DWORD>(SERVICE_RUNNING), statusNow.dwCurrentState);

    SetEvent(release.Get());
    EXPECT_TRUE(testsupport::ServiceWaitForState(child.Name(), SERVICE_STOPPED, c_dwStateWaitMs));
}

// Someone deleted the service while it was stopping (sc stop, sc delete): the record stays,
// marked for deletion, until the service is down. Unregistering it then is no error: the
// stopping service cannot take another STOP (1061) and is already marked (1072).
TEST(ServiceMainUnderScm, UnregisterOfAStoppingServiceMarkedForDeletion)
{
    FailureCapture failures;
    CChildServiceHolder child;
    ASSERT_TRUE(child.Created());
    CReleaseOnExit release(child.Name());
    ASSERT_NE(nullptr, release.Get());

    // Stopping (OnStop holds until released), then deleted.
    ASSERT_TRUE(child.StartAndHoldStop(nullptr));
    ASSERT_TRUE(testsupport::ServiceDelete(child.Name()));

    CTestService service(child.Name());
    CService::RegisterService(&service);
    HANDLE hDone = CreateEventW(nullptr, TRUE, FALSE, nullptr);
    std::thread unregister([&] {
        service.UnregisterOneService();
        SetEvent(hDone);
    });
    // Where the record lasts until the service is down (Windows), unregistering waits for
    // it: let the service go after a while. Wine drops the record at once.
    WaitForSingleObject(hDone, 1000);
    SetEvent(release.Get());
    DWORD dwWait = WaitForSingleObject(hDone, c_dwStateWaitMs);
    unregister.join();
    CloseHandle(hDone);
    EXPECT_EQ(static_cast<DWORD>(WAIT_OBJECT_0), dwWait);
    EXPECT_EQ(0u, failures.Count());
    EXPECT_FALSE(testsupport::ServiceExists(child.Name()));
    EXPECT_EQ(1, service.m_cUnregisters);
}

namespace
{
// A test-only service run by telvanehost.exe from the DLL given, alone in a test-only group.
class CHostedServiceHolder
{
public:
    explicit CHostedServiceHolder(const wchar_t *wszDll)
        : m_wstrName(testsupport::UniqueName(L"TelvaneTestHosted"))
        , m_wstrGroup(testsupport::UniqueName(L"TelvaneTestGroup"))
        , m_cleanup(m_wstrName)
    {
        m_fCreated = testsupport::ServiceCreateOwnProcess(m_wstrName.c_str(),
                                               Quoted(testsupport::BinDir() + L"telvanehost.exe") +
                                                   L" -k " + m_wstrGroup);
        // Without the service, its key would stay behind with these values.
        if (!m_fCreated)
        {
            return;
        }
        std::wstring wstrParameters =
            L"SYSTEM\\CurrentControlSet\\Services\\" + m_wstrName + L"\\Parameters";
        RegHelperSetString(wstrParameters.c_str(), L"ServiceDll", testsupport::BinDir() + wszDll,
                           REG_EXPAND_SZ);
        RegHelperSetMultiString(c_wszSvchostGroupKey, m_wstrGroup.c_str(), {m_wstrName});
    }
    ~CHostedServiceHolder() { RegHelperDeleteValue(c_wszSvchostGroupKey, m_wstrGroup.c_str()); }
    const wchar_t *Name() const { return m_wstrName.c_str(); }
    bool Created() const { return m_fCreated; }

private:
    std::wstring m_wstrName;
    std::wstring m_wstrGroup;
    testsupport::CServiceCleanup m_cleanup;
    bool m_fCreated;
};
} // namespace

// Under telvanehost a STOP reaches OnStop through the host's stop callback: the control
// returns at once with RUNNING while OnStop still works, and the host leaves after STOPPED.
TEST(TelvaneHost, StopGoesThroughTheHostStopCallback)
{
    CHostedServiceHolder hosted(L"servicetest.dll");
    ASSERT_TRUE(hosted.Created());
    CReleaseOnExit release(hosted.Name());
    ASSERT_NE(nullptr, release.Get());

    ASSERT_EQ(0u, testsupport::ServiceStart(hosted.Name(), {L"hold-stop"}));
    SERVICE_STATUS_PROCESS status = {};
    ASSERT_TRUE(testsupport::ServiceWaitForState(hosted.Name(), SERVICE_RUNNING, c_dwStateWaitMs, &status));
    testsupport::CServiceProcess host(status.dwProcessId);
    ASSERT_TRUE(host.Opened());

    SERVICE_STATUS statusControl = {};
    EXPECT_EQ(0u, testsupport::ServiceControl(hosted.Name(), SERVICE_CONTROL_STOP, &statusControl));
    EXPECT_EQ(static_cast<DWORD>(SERVICE_RUNNING), statusControl.dwCurrentState);
    ASSERT_TRUE(testsupport::ServiceQueryStatus(hosted.Name(), &status));
    EXPECT_EQ(static_cast<DWORD>(SERVICE_RUNNING), status.dwCurrentState);

    SetEvent(release.Get());
    EXPECT_TRUE(testsupport::ServiceWaitForState(hosted.Name(), SERVICE_STOPPED, c_dwStateWaitMs));
    EXPECT_EQ(0u, host.WaitForExitCode(c_dwStateWaitMs));
}

// A stopped service is deleted only once its host has left; registering the name again
// must wait for that instead of failing with "marked for delete".
TEST(TelvaneHost, RegistrationWaitsUntilTheOldServiceIsGone)
{
    testsupport::FailureCapture failures;
    CHostedServiceHolder hosted(L"servicetest.dll");
    ASSERT_TRUE(hosted.Created());
    ASSERT_EQ(0u, testsupport::ServiceStart(hosted.Name(), {L"linger"}));
    ASSERT_TRUE(testsupport::ServiceWaitForState(hosted.Name(), SERVICE_RUNNING, c_dwStateWaitMs));

    CTestService service(hosted.Name());
    service.m_idsLocalizedName = 1;
    service.m_idsDescription = 2;
    service.m_ulStartType = SERVICE_DEMAND_START;
    CService::RegisterService(&service);
    service.RegisterOneService();
    EXPECT_EQ(0u, failures.Count());
    testsupport::SERVICE_RECORD record;
    ASSERT_TRUE(testsupport::ServiceReadRecord(hosted.Name(), &record));
    EXPECT_EQ(static_cast<DWORD>(SERVICE_DEMAND_START), record.dwStartType);
    EXPECT_EQ(static_cast<DWORD>(SERVICE_WIN32_OWN_PROCESS), record.dwServiceType);

    // Unregistering returns only once the name is free.
    service.UnregisterOneService();
    EXPECT_FALSE(testsupport::ServiceExists(hosted.Name()));
    EXPECT_EQ(0u, failures.Count());
}

// A host that loads telvane.dll for a name the DLL does not serve gets a prompt STOPPED with
// ERROR_SERVICE_NOT_IN_EXE instead of a start that times out.
TEST(TelvaneHost, TelvaneDllAnswersAnUnknownNameAtOnce)
{
    CHostedServiceHolder hosted(L"telvane.dll");
    ASSERT_TRUE(hosted.Created());
    // Wine's StartService reports 1053 for a service that stops before it ran; Windows
    // reports success. Either way the status tells why.
    DWORD dwStart = testsupport::ServiceStart(hosted.Name(), {});
    EXPECT_TRUE(dwStart == ERROR_SUCCESS || dwStart == ERROR_SERVICE_REQUEST_TIMEOUT) << dwStart;
    SERVICE_STATUS_PROCESS status = {};
    EXPECT_TRUE(testsupport::ServiceWaitForState(hosted.Name(), SERVICE_STOPPED, c_dwStateWaitMs, &status));
    EXPECT_EQ(static_cast<DWORD>(ERROR_SERVICE_NOT_IN_EXE), status.dwWin32ExitCode);
}

TEST(TelvaneRun, InvalidCommandLinesExitWithThree)
{
    std::wstring wstrRunner = Quoted(testsupport::BinDir() + L"telvanerun.exe");
    const wchar_t *rgArgs[] = {L"Nobody", L"-x", L"Telvane -q", L"-"};
    for (const wchar_t *wszArgs : rgArgs)
    {
        testsupport::ChildResult result = testsupport::RunChild(wstrRunner + L" " + wszArgs);
        EXPECT_FALSE(result.fTimedOut) << testsupport::Narrow(wszArgs);
        EXPECT_EQ(3u, result.dwExitCode) << testsupport::Narrow(wszArgs) << "\n"
                                         << result.strOutput;
        EXPECT_NE(std::string::npos, result.strOutput.find("Invalid command line"));
    }
}
