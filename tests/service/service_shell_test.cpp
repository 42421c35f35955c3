// The service shell in-process: command lines, the service list, status reports, control
// requests, the stop callback and console mode. What reaches the control manager is seen
// through the status seam, since a status handle exists only inside a service process.
#include "inc/handleholder.h"
#include "servicelib/diagnostics.h"
#include "tests/common/testsupport.h"
#include "tests/service/testservice.h"
#include "tools/telvanehost/hoststopcallback.h"

#include <gtest/gtest.h>

#include <atomic>
#include <mutex>
#include <thread>
#include <vector>

using testsupport::FailureCapture;

namespace
{
const DWORD c_dwWaitMs = 10000;
SERVICE_STATUS_HANDLE const c_hFakeStatus = reinterpret_cast<SERVICE_STATUS_HANDLE>(0x5eed);

struct REPORT
{
    DWORD dwState;
    DWORD dwCheckPoint;
};

std::mutex s_reportLock;
std::vector<REPORT> s_rgReports;

BOOL WINAPI RecordReport(SERVICE_STATUS_HANDLE hStatus, LPSERVICE_STATUS pStatus)
{
    std::lock_guard<std::mutex> guard(s_reportLock);
    s_rgReports.push_back({pStatus->dwCurrentState, pStatus->dwCheckPoint});
    return TRUE;
}

std::vector<REPORT> Reports()
{
    std::lock_guard<std::mutex> guard(s_reportLock);
    return s_rgReports;
}

// Every test starts with an empty service list and records what would reach the control
// manager; services are the test's locals, driven from the test thread.
class ServiceShell : public ::testing::Test
{
protected:
    void SetUp() override
    {
        ASSERT_EQ(nullptr, CTestService::FirstService()) << "a service leaked from a test";
        std::lock_guard<std::mutex> guard(s_reportLock);
        s_rgReports.clear();
        ServiceSetStatusHook(RecordReport);
    }
    void TearDown() override
    {
        ServiceSetStatusHook(nullptr);
        CTestService::SetHostMode(false, nullptr, nullptr);
    }
};

DWORD ParseArgs(std::vector<const wchar_t *> rgArgs)
{
    std::vector<std::wstring> rgCopies(rgArgs.begin(), rgArgs.end());
    std::vector<LPWSTR> rgArgv;
    for (std::wstring &wstr : rgCopies)
    {
        rgArgv.push_back(&wstr[0]);
    }
    return CService::ParseCommandLine(static_cast<DWORD>(rgArgv.size()), rgArgv.data());
}
} // namespace

TEST_F(ServiceShell, ParseCommandLineTable)
{
    CTestService alpha(L"Alpha");
    CTestService beta(L"Beta");
    CService::RegisterService(&alpha);
    CService::RegisterService(&beta);
    // Listing a service again (the list's tail, which the assertion cannot tell) changes
    // nothing: the list would become a cycle.
    CService::RegisterService(&alpha);
    {
        CTestService gone(L"Gone");
        CService::RegisterService(&gone);
    }
    // A service leaves the list when it is destroyed.
    EXPECT_EQ(&beta, CTestService::FirstService());
    const ULONG a = alpha.m_ulServiceBit;
    const ULONG b = beta.m_ulServiceBit;

    struct
    {
        std::vector<const wchar_t *> rgArgs;
        ULONG ulExpected;
    } rgCases[] = {
        {{}, 0x00FFFFFF},
        {{L"run"}, 0x00FFFFFF},
        {{L"run", L"Alpha"}, a},
        {{L"run", L"aLPHA"}, a},
        {{L"run", L"Alpha", L"BETA"}, a | b},
        {{L"run", L"-r"}, 0x04FFFFFF},
        {{L"run", L"/R"}, 0x04FFFFFF},
        {{L"run", L"/register"}, 0x04FFFFFF},
        {{L"run", L"-u"}, 0x08FFFFFF},
        {{L"run", L"-r", L"-u"}, 0x0CFFFFFF},
        {{L"run", L"-c"}, 0x01FFFFFF},
        {{L"run", L"/D", L"Beta"}, 0x02000000 | b},
        {{L"run", L"-e"}, 0x00FFFFFF},
        {{L"run", L"-x"}, 0x10FFFFFF},
        {{L"run", L"-"}, 0x10FFFFFF},
        {{L"run", L"Gamma"}, 0x10FFFFFF},
        {{L"run", L"Gamma", L"Alpha"}, 0x10000000 | a},
        // Start parameters of a service: argv[0] is the service name and never counts.
        {{L"Beta", L"-d"}, 0x02FFFFFF},
    };
    for (size_t i = 0; i < ARRAYSIZE(rgCases); i++)
    {
        EXPECT_EQ(rgCases[i].ulExpected, ParseArgs(rgCases[i].rgArgs)) << "row " << i;
    }
}

TEST_F(ServiceShell, SetStatusCheckPointsAndNothingAfterStopped)
{
    CTestService service(L"Steady");
    CService::RegisterService(&service);
    service.m_hServiceStatus = c_hFakeStatus;

    service.SetStatus(SERVICE_START_PENDING);
    service.SetStatus(SERVICE_START_PENDING);
    service.SetStatus(SERVICE_START_PENDING);
    service.SetStatus(SERVICE_RUNNING);
    service.SetStatus(SERVICE_STOPPED);
    EXPECT_EQ(nullptr, service.m_hServiceStatus);
    // Kept, but never reported: the control manager is done with the service.
    service.SetStatus(SERVICE_RUNNING);
    service.SetStatus(SERVICE_RUNNING);

    std::vector<std::pair<DWORD, DWORD>> rgStateAndCheckPoint;
    for (const REPORT &report : Reports())
    {
        rgStateAndCheckPoint.push_back({report.dwState, report.dwCheckPoint});
    }
    EXPECT_EQ((std::vector<std::pair<DWORD, DWORD>>{{2, 0}, {2, 1}, {2, 2}, {4, 0}, {1, 0}}),
              rgStateAndCheckPoint);
    EXPECT_EQ(static_cast<DWORD>(SERVICE_RUNNING), service.m_status.dwCurrentState);
    EXPECT_EQ(1u, service.m_status.dwCheckPoint);

    // States outside 1..7 are refused and change nothing.
    FailureCapture failures;
    service.SetStatus(0);
    service.SetStatus(8);
    EXPECT_EQ(2u, failures.Count());
    EXPECT_TRUE(failures.Contains(L"Assertion failure: 1 <= ulStatus && ulStatus <= 7"));
    EXPECT_EQ(static_cast<DWORD>(SERVICE_RUNNING), service.m_status.dwCurrentState);
}

// Each control reaches its handler and is answered with the current status; a user-defined control
// reaches only a service that takes them, but is answered all the same: any client with the right
// can send one. Without a host, STOP runs OnStop in the handler.
TEST_F(ServiceShell, ControlHandlerDispatchesAndReportsAgain)
{
    CRecordingService service(L"Controlled");
    CService::RegisterService(&service);
    service.m_hServiceStatus = c_hFakeStatus;
    service.SetStatus(SERVICE_RUNNING);
    int iData = 0;

    struct
    {
        DWORD dwControl;
        DWORD dwEventType;
        const wchar_t *wszRecorded;
    } rgCases[] = {
        {SERVICE_CONTROL_PAUSE, 0, L"Pause"},
        {SERVICE_CONTROL_CONTINUE, 0, L"Continue"},
        {SERVICE_CONTROL_SHUTDOWN, 0, L"Shutdown"},
        {SERVICE_CONTROL_DEVICEEVENT, 0x8000, L"DeviceEvent 32768"},
        {SERVICE_CONTROL_POWEREVENT, 10, L"PowerEvent 10"},
        {128, 0, L"Control 128"},
        {255, 0, L"Control 255"},
        {SERVICE_CONTROL_INTERROGATE, 0, L""},
        {256, 0, L""},
        {127, 0, L""},
    };
    for (bool fAcceptControl : {true, false})
    {
        service.m_fAcceptControl = fAcceptControl;
        for (const auto &testCase : rgCases)
        {
            SCOPED_TRACE(testCase.dwControl);
            bool fUser = testCase.dwControl >= 128 && testCase.dwControl <= 255;
            service.m_wstrLast.clear();
            size_t cReports = Reports().size();
            EXPECT_EQ(static_cast<DWORD>(NO_ERROR),
                      CService::ServiceControlHandler(testCase.dwControl, testCase.dwEventType,
                                                      &iData, &service));
            EXPECT_EQ(fUser && !fAcceptControl ? L"" : testCase.wszRecorded, service.m_wstrLast);
            ASSERT_EQ(cReports + 1, Reports().size());
            EXPECT_EQ(static_cast<DWORD>(SERVICE_RUNNING), Reports().back().dwState);
        }
    }
    EXPECT_EQ(&iData, service.m_pvLastData);
    EXPECT_EQ(0, service.m_cStops);

    CService::ServiceControlHandler(SERVICE_CONTROL_STOP, 0, nullptr, &service);
    EXPECT_EQ(1, service.m_cStops);
    EXPECT_EQ(GetCurrentThreadId(), service.m_dwStopThread);
    EXPECT_EQ(static_cast<DWORD>(SERVICE_STOPPED), Reports().back().dwState);
    EXPECT_EQ(nullptr, service.m_hServiceStatus);
}

namespace
{
// ServiceMain's host path as far as it runs outside a service process: host globals with the
// host's real stop callback, the stop event registered with it, and RUNNING reported. Returns
// the result of the registration.
DWORD RunAsHosted(CTestService &service, SVCHOST_GLOBAL_DATA &globals)
{
    globals.RegisterStopCallback = HostRegisterStopCallback;
    CService::HostPushServiceGlobals(&service, L"TestGroup", &globals);
    service.m_hStopEvent = CreateEventW(nullptr, FALSE, FALSE, nullptr);
    DWORD dwResult = globals.RegisterStopCallback(&service.m_hStopWait, service.ServiceName(),
                                                  service.m_hStopEvent,
                                                  CService::StopCallbackStatic, &service, 0);
    service.m_hServiceStatus = c_hFakeStatus;
    service.SetStatus(SERVICE_RUNNING);
    return dwResult;
}

HANDLE NewManualEvent()
{
    return CreateEventW(nullptr, TRUE, FALSE, nullptr);
}

// Lets a held stop callback (on the host's callback thread) finish and waits for it when the
// test ends, however it ends. Owned by the test.
class CCallbacksDone
{
public:
    CCallbacksDone(HANDLE hRelease, HANDLE hFinish)
        : m_hRelease(hRelease)
        , m_hFinish(hFinish)
    {
    }
    ~CCallbacksDone()
    {
        SetEvent(m_hRelease);
        SetEvent(m_hFinish);
        HostWaitForStopCallbacks(c_dwWaitMs);
    }
    CCallbacksDone(const CCallbacksDone &) = delete;
    CCallbacksDone &operator=(const CCallbacksDone &) = delete;

private:
    HANDLE m_hRelease;
    HANDLE m_hFinish;
};
} // namespace

// Under a host, STOP only signals the stop event: the handler returns with RUNNING reported
// while OnStop runs on the host's stop-callback thread. A host that serves other services too
// keeps its process after STOPPED and may start the service again at once, on another thread,
// while the first run's callback is still finishing: that callback must drop only its own wait
// and event, not the new run's. A STOP after the last callback finds nothing to stop.
TEST_F(ServiceShell, StopUnderHostGoesThroughTheStopCallback)
{
    FailureCapture failures;
    SVCHOST_GLOBAL_DATA globals = {};
    CTestService service(L"Hosted");
    // Declared after the service: however the test ends, no callback outlives it.
    CKernelHandle stopEntered(NewManualEvent());
    CKernelHandle stopRelease(NewManualEvent());
    CKernelHandle stoppedReported(NewManualEvent());
    CKernelHandle stopFinish(NewManualEvent());
    CKernelHandle startDone(NewManualEvent());
    CCallbacksDone callbacksDone(stopRelease.Get(), stopFinish.Get());
    service.m_hStopEntered = stopEntered.Get();
    service.m_hStopRelease = stopRelease.Get();
    service.m_hStoppedReported = stoppedReported.Get();
    service.m_hStopFinish = stopFinish.Get();
    service.m_hStartDone = startDone.Get();
    ASSERT_EQ(0u, RunAsHosted(service, globals));
    EXPECT_STREQ(L"TestGroup", CTestService::Group());
    // A host that keeps the DLL loaded pushes again at every start: the service is listed.
    CService::HostPushServiceGlobals(&service, L"TestGroup", &globals);
    EXPECT_EQ(0u, failures.Count());

    CService::ServiceControlHandler(SERVICE_CONTROL_STOP, 0, nullptr, &service);
    ASSERT_EQ(WAIT_OBJECT_0, WaitForSingleObject(stopEntered.Get(), c_dwWaitMs));
    EXPECT_EQ(static_cast<DWORD>(SERVICE_RUNNING), Reports().back().dwState);
    EXPECT_NE(GetCurrentThreadId(), service.m_dwStopThread);
    SetEvent(stopRelease.Get());
    ASSERT_EQ(WAIT_OBJECT_0, WaitForSingleObject(stoppedReported.Get(), c_dwWaitMs));
    EXPECT_EQ(static_cast<DWORD>(SERVICE_STOPPED), Reports().back().dwState);

    // The next start, through ServiceMain itself (outside a service process the control
    // handler cannot be registered: that fatal error is expected here, but the status it
    // prepares from the flags still shows; the flag that adds no accept bit is refused).
    service.m_fAcceptPauseContinue = true;
    service.m_fAcceptPowerEvents = true;
    service.m_fAcceptControl = true;
    wchar_t wszName[] = L"Hosted";
    LPWSTR rgArgv[] = {wszName};
    service.ServiceMain(1, rgArgv);
    ASSERT_EQ(WAIT_OBJECT_0, WaitForSingleObject(startDone.Get(), c_dwWaitMs));
    // The control manager reports the type it has on record: only here does the shell's show.
    EXPECT_EQ(static_cast<DWORD>(SERVICE_WIN32_SHARE_PROCESS), service.m_status.dwServiceType);
    EXPECT_EQ(static_cast<DWORD>(SERVICE_ACCEPT_STOP | SERVICE_ACCEPT_PAUSE_CONTINUE |
                                 SERVICE_ACCEPT_POWEREVENT),
              service.m_status.dwControlsAccepted);
    HANDLE hNewStopEvent = service.m_hStopEvent;
    HANDLE hNewStopWait = service.m_hStopWait;
    ASSERT_NE(nullptr, hNewStopEvent);

    // The first run's callback finishes after the new start.
    SetEvent(stopFinish.Get());
    ASSERT_TRUE(HostWaitForStopCallbacks(c_dwWaitMs));
    EXPECT_EQ(hNewStopEvent, service.m_hStopEvent);
    EXPECT_EQ(hNewStopWait, service.m_hStopWait);

    // The new run stops through its own event and callback.
    ResetEvent(stoppedReported.Get());
    CService::ServiceControlHandler(SERVICE_CONTROL_STOP, 0, nullptr, &service);
    EXPECT_EQ(WAIT_OBJECT_0, WaitForSingleObject(stoppedReported.Get(), c_dwWaitMs));
    ASSERT_TRUE(HostWaitForStopCallbacks(c_dwWaitMs));
    EXPECT_EQ(nullptr, service.m_hStopEvent);
    EXPECT_EQ(nullptr, service.m_hStopWait);
    // No third OnStop, and no SetEvent on the closed event.
    CService::ServiceControlHandler(SERVICE_CONTROL_STOP, 0, nullptr, &service);
    EXPECT_EQ(2, service.m_cStops);
    EXPECT_EQ(2u, failures.Count());
    EXPECT_TRUE(failures.Contains(L"from RegisterServiceCtrlHandlerEx"));
    EXPECT_TRUE(failures.Contains(L"Assertion failure: false"));
}

namespace
{
// The stop-callback thread reports STOPPED while the dispatcher is inside its own report of
// the same service; the dispatcher's report must not end after STOPPED.
HANDLE s_hOnStopEntered = nullptr;
HANDLE s_hStoppedReported = nullptr;
DWORD s_dwHandlerThread = 0;
volatile LONG s_cInReport = 0;
volatile LONG s_fOverlap = 0;
volatile LONG s_fReportAfterStopped = 0;
volatile LONG s_fStoppedReported = 0;

BOOL WINAPI RaceReport(SERVICE_STATUS_HANDLE hStatus, LPSERVICE_STATUS pStatus)
{
    if (InterlockedIncrement(&s_cInReport) > 1)
    {
        InterlockedExchange(&s_fOverlap, 1);
    }
    if (s_fStoppedReported)
    {
        InterlockedExchange(&s_fReportAfterStopped, 1);
    }
    if (GetCurrentThreadId() == s_dwHandlerThread)
    {
        // Give the stop thread every chance to report in the middle of this one.
        WaitForSingleObject(s_hOnStopEntered, c_dwWaitMs);
        WaitForSingleObject(s_hStoppedReported, 500);
    }
    if (pStatus->dwCurrentState == SERVICE_STOPPED)
    {
        InterlockedExchange(&s_fStoppedReported, 1);
        SetEvent(s_hStoppedReported);
    }
    InterlockedDecrement(&s_cInReport);
    return TRUE;
}
} // namespace

TEST_F(ServiceShell, ReportsNeverOverlapTheStoppedReport)
{
    SVCHOST_GLOBAL_DATA globals = {};
    CTestService service(L"Racing");
    s_hOnStopEntered = NewManualEvent();
    s_hStoppedReported = NewManualEvent();
    service.m_hStopEntered = s_hOnStopEntered;
    ASSERT_EQ(0u, RunAsHosted(service, globals));

    s_dwHandlerThread = GetCurrentThreadId();
    ServiceSetStatusHook(RaceReport);
    CService::ServiceControlHandler(SERVICE_CONTROL_STOP, 0, nullptr, &service);
    ASSERT_TRUE(HostWaitForStopCallbacks(c_dwWaitMs));
    ServiceSetStatusHook(RecordReport);

    EXPECT_EQ(1, service.m_cStops);
    EXPECT_EQ(1, s_fStoppedReported);
    EXPECT_EQ(0, s_fOverlap);
    EXPECT_EQ(0, s_fReportAfterStopped);
    CloseHandle(s_hOnStopEntered);
    CloseHandle(s_hStoppedReported);
}

namespace
{
// Console mode on a thread of its own, let go with Ctrl+C when the test ends however it ends.
class CConsoleThread
{
public:
    explicit CConsoleThread(ULONG ulFlags)
        : m_thread([this, ulFlags] {
            m_dwThread = GetCurrentThreadId();
            CService::RunAsConsoleExe(ulFlags);
            m_fDone = true;
        })
    {
    }
    ~CConsoleThread()
    {
        if (!m_fDone)
        {
            CService::ConsoleCtrlHandler(CTRL_C_EVENT);
        }
        m_thread.join();
    }
    bool WaitDone(DWORD dwTimeoutMs = c_dwWaitMs)
    {
        return testsupport::WaitUntil([&] { return m_fDone.load(); }, dwTimeoutMs);
    }

    std::atomic<bool> m_fDone{false};
    std::atomic<DWORD> m_dwThread{0};

private:
    std::thread m_thread;
};
} // namespace

// Console mode ends when the selected services stopped by themselves (one never selected never
// starts); with another still running it waits for Ctrl+C, which stops that one on the console
// thread. No status reaches the control manager in console mode.
TEST_F(ServiceShell, ConsoleModeEndsWhenItsServicesStopOrOnCtrlC)
{
    FailureCapture failures;
    CTestService runner(L"Runner");
    CTestService quitter(L"Quitter", CTestService::StartMode::StopItself);
    CService::RegisterService(&runner);
    CService::RegisterService(&quitter);
    {
        CConsoleThread console(quitter.m_ulServiceBit);
        EXPECT_TRUE(console.WaitDone());
    }
    EXPECT_EQ(1, quitter.m_cStarts);
    EXPECT_EQ(0, runner.m_cStarts);
    EXPECT_EQ(nullptr, CTestService::ConsoleEvent());
    {
        CConsoleThread console(CService::c_ulServiceMask);
        ASSERT_TRUE(testsupport::WaitUntil(
            [&] { return runner.m_status.dwCurrentState == SERVICE_RUNNING; }));
        EXPECT_FALSE(console.WaitDone(200));
        EXPECT_TRUE(CService::ConsoleCtrlHandler(CTRL_C_EVENT));
        ASSERT_TRUE(console.WaitDone());
        EXPECT_EQ(console.m_dwThread, runner.m_dwStopThread);
    }
    EXPECT_EQ(1, runner.m_cStops);
    EXPECT_EQ(0, quitter.m_cStops);
    EXPECT_TRUE(Reports().empty());
    // A late Ctrl+C after console mode closed its event is harmless.
    EXPECT_TRUE(CService::ConsoleCtrlHandler(CTRL_C_EVENT));
    EXPECT_EQ(0u, failures.Count());
}
