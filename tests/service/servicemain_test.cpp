// The shell's ServiceMain under the prefix's real control manager, in a test service of its
// own (servicetest_child.exe) or in telvanehost.exe, under test-only names.
#include "servicelib/reghelper.h"
#include "servicelib/service.h"
#include "tests/common/testsupport.h"
#include "tests/service/scmtesthelpers.h"
#include "tests/service/testservice.h"

#include <gtest/gtest.h>

namespace
{
const DWORD c_dwStateWaitMs = 30000;

std::wstring Quoted(const std::wstring &wstrPath)
{
    return L"\"" + wstrPath + L"\"";
}

// A test-only own-process service running servicetest_child.exe, deleted again at the end.
class CChildServiceHolder
{
public:
    CChildServiceHolder()
        : m_wstrName(scmtest::UniqueName(L"TelvaneTestChild"))
        , m_cleanup(m_wstrName)
    {
        m_fCreated = scmtest::CreateOwnProcess(
            m_wstrName.c_str(), Quoted(testsupport::BinDir() + L"servicetest_child.exe"));
    }
    const wchar_t *Name() const { return m_wstrName.c_str(); }
    bool Created() const { return m_fCreated; }

private:
    std::wstring m_wstrName;
    scmtest::CServiceCleanup m_cleanup;
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
        ASSERT_EQ(0u, scmtest::StartWithArgs(child.Name(), testCase.rgArgs));
        SERVICE_STATUS_PROCESS status = {};
        ASSERT_TRUE(
            scmtest::WaitForState(child.Name(), SERVICE_START_PENDING, c_dwStateWaitMs, &status))
            << status.dwCurrentState;
        EXPECT_EQ(static_cast<DWORD>(SERVICE_WIN32_OWN_PROCESS), status.dwServiceType);
        EXPECT_EQ(static_cast<DWORD>(SERVICE_ACCEPT_STOP), status.dwControlsAccepted);
        EXPECT_EQ(0u, status.dwCheckPoint);
        EXPECT_EQ(testCase.dwWaitHint, status.dwWaitHint);

        // Without a host, STOP runs OnStop in the handler, even before RUNNING.
        EXPECT_EQ(0u, scmtest::Control(child.Name(), SERVICE_CONTROL_STOP, nullptr));
        ASSERT_TRUE(scmtest::WaitForState(child.Name(), SERVICE_STOPPED, c_dwStateWaitMs, &status));
        // The child reports the breakpoints it saw after START_PENDING.
        EXPECT_EQ(static_cast<DWORD>(ERROR_SERVICE_SPECIFIC_ERROR), status.dwWin32ExitCode);
        EXPECT_EQ(testCase.dwBreakpoints, status.dwServiceSpecificExitCode);
    }
}

TEST(ServiceMainUnderScm, StopUnderHostReturnsAtOnceAndStopsWhenOnStopEnds)
{
    CChildServiceHolder child;
    ASSERT_TRUE(child.Created());
    std::wstring wstrRelease = std::wstring(L"Global\\") + child.Name() + L"_release";
    HANDLE hRelease = CreateEventW(nullptr, TRUE, FALSE, wstrRelease.c_str());
    ASSERT_NE(nullptr, hRelease);

    ASSERT_EQ(0u, scmtest::StartWithArgs(child.Name(), {L"host", L"hold-stop"}));
    ASSERT_TRUE(scmtest::WaitForState(child.Name(), SERVICE_RUNNING, c_dwStateWaitMs));

    // The handler only signals the stop event: the control returns with RUNNING, and the
    // service stays RUNNING while OnStop works on the host's stop-callback thread.
    SERVICE_STATUS status = {};
    EXPECT_EQ(0u, scmtest::Control(child.Name(), SERVICE_CONTROL_STOP, &status));
    EXPECT_EQ(static_cast<DWORD>(SERVICE_RUNNING), status.dwCurrentState);
    SERVICE_STATUS_PROCESS statusNow = {};
    ASSERT_TRUE(scmtest::QueryStatus(child.Name(), &statusNow));
    EXPECT_EQ(static_cast<DWORD>(SERVICE_RUNNING), statusNow.dwCurrentState);

    SetEvent(hRelease);
    EXPECT_TRUE(scmtest::WaitForState(child.Name(), SERVICE_STOPPED, c_dwStateWaitMs));
    CloseHandle(hRelease);
}

namespace
{
// A test-only service run by telvanehost.exe from the DLL given, alone in a test-only group.
class CHostedServiceHolder
{
public:
    explicit CHostedServiceHolder(const wchar_t *wszDll)
        : m_wstrName(scmtest::UniqueName(L"TelvaneTestHosted"))
        , m_wstrGroup(scmtest::UniqueName(L"TelvaneTestGroup"))
        , m_cleanup(m_wstrName)
    {
        m_fCreated = scmtest::CreateOwnProcess(m_wstrName.c_str(),
                                               Quoted(testsupport::BinDir() + L"telvanehost.exe") +
                                                   L" -k " + m_wstrGroup);
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
    scmtest::CServiceCleanup m_cleanup;
    bool m_fCreated;
};
} // namespace

// Under telvanehost a STOP reaches OnStop through the host's stop callback: the control
// returns at once with RUNNING while OnStop still works, and the host leaves after STOPPED.
TEST(TelvaneHost, StopGoesThroughTheHostStopCallback)
{
    CHostedServiceHolder hosted(L"servicetest.dll");
    ASSERT_TRUE(hosted.Created());
    std::wstring wstrRelease = std::wstring(L"Global\\") + hosted.Name() + L"_release";
    HANDLE hRelease = CreateEventW(nullptr, TRUE, FALSE, wstrRelease.c_str());
    ASSERT_NE(nullptr, hRelease);

    ASSERT_EQ(0u, scmtest::StartWithArgs(hosted.Name(), {L"hold-stop"}));
    SERVICE_STATUS_PROCESS status = {};
    ASSERT_TRUE(scmtest::WaitForState(hosted.Name(), SERVICE_RUNNING, c_dwStateWaitMs, &status));
    HANDLE hHost =
        OpenProcess(SYNCHRONIZE | PROCESS_QUERY_LIMITED_INFORMATION, FALSE, status.dwProcessId);
    ASSERT_NE(nullptr, hHost);

    SERVICE_STATUS statusControl = {};
    EXPECT_EQ(0u, scmtest::Control(hosted.Name(), SERVICE_CONTROL_STOP, &statusControl));
    EXPECT_EQ(static_cast<DWORD>(SERVICE_RUNNING), statusControl.dwCurrentState);
    ASSERT_TRUE(scmtest::QueryStatus(hosted.Name(), &status));
    EXPECT_EQ(static_cast<DWORD>(SERVICE_RUNNING), status.dwCurrentState);

    SetEvent(hRelease);
    EXPECT_TRUE(scmtest::WaitForState(hosted.Name(), SERVICE_STOPPED, c_dwStateWaitMs));
    EXPECT_EQ(static_cast<DWORD>(WAIT_OBJECT_0), WaitForSingleObject(hHost, c_dwStateWaitMs));
    DWORD dwExitCode = 1;
    GetExitCodeProcess(hHost, &dwExitCode);
    EXPECT_EQ(0u, dwExitCode);
    CloseHandle(hHost);
    CloseHandle(hRelease);
}

// A stopped service is deleted only once its host has left; registering the name again
// must wait for that instead of failing with "marked for delete".
TEST(TelvaneHost, RegistrationWaitsUntilTheOldServiceIsGone)
{
    testsupport::FailureCapture failures;
    CHostedServiceHolder hosted(L"servicetest.dll");
    ASSERT_TRUE(hosted.Created());
    ASSERT_EQ(0u, scmtest::StartWithArgs(hosted.Name(), {L"linger"}));
    ASSERT_TRUE(scmtest::WaitForState(hosted.Name(), SERVICE_RUNNING, c_dwStateWaitMs));

    CTestService service(hosted.Name());
    service.m_idsLocalizedName = 1;
    service.m_idsDescription = 2;
    service.m_ulStartType = SERVICE_DEMAND_START;
    CService::RegisterService(&service);
    service.RegisterOneService();
    EXPECT_EQ(0u, failures.Count());
    scmtest::SERVICE_RECORD record;
    ASSERT_TRUE(scmtest::ReadRecord(hosted.Name(), &record));
    EXPECT_EQ(static_cast<DWORD>(SERVICE_DEMAND_START), record.dwStartType);
    EXPECT_EQ(static_cast<DWORD>(SERVICE_WIN32_OWN_PROCESS), record.dwServiceType);

    // Unregistering returns only once the name is free.
    service.UnregisterOneService();
    EXPECT_FALSE(scmtest::ServiceExists(hosted.Name()));
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
    DWORD dwStart = scmtest::StartWithArgs(hosted.Name(), {});
    EXPECT_TRUE(dwStart == ERROR_SUCCESS || dwStart == ERROR_SERVICE_REQUEST_TIMEOUT) << dwStart;
    SERVICE_STATUS_PROCESS status = {};
    EXPECT_TRUE(scmtest::WaitForState(hosted.Name(), SERVICE_STOPPED, c_dwStateWaitMs, &status));
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
