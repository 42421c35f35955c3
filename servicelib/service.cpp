#include "servicelib/service.h"
#include "servicelib/diagnostics.h"

#include <wctype.h>

CService *CService::s_pFirstService = nullptr;
ULONG CService::s_ulNextServiceBit = 1;
bool CService::s_fConsole = false;
bool CService::s_fSvchost = false;
const wchar_t *CService::s_wszSvchostGroup = nullptr;
SVCHOST_GLOBAL_DATA *CService::s_pSvchostGlobals = nullptr;
HANDLE CService::s_hConsoleEvent = nullptr;
const wchar_t *const CService::s_rgwszStateNames[8] = {
    L"(unknown)", L"STOPPED",          L"START_PENDING", L"STOP_PENDING",
    L"RUNNING",   L"CONTINUE_PENDING", L"PAUSE_PENDING", L"PAUSED"};

namespace
{
const DWORD c_dwWaitHint = 10000;
const DWORD c_dwDebugWaitHint = 3600000;
const UINT c_uInvalidCommandLineExitCode = 3;

PFN_SET_SERVICE_STATUS volatile s_pfnSetStatusHook = nullptr;

// Console mode's event may be signalled by a late Ctrl+C while RunAsConsoleExe closes it;
// this lock keeps the two apart. The selection says which services console mode waits for.
SRWLOCK s_srwConsole = SRWLOCK_INIT;
ULONG s_ulConsoleSelection = 0;

BOOL ServiceReportStatus(SERVICE_STATUS_HANDLE hStatus, SERVICE_STATUS *pStatus)
{
    PFN_SET_SERVICE_STATUS pfnHook = s_pfnSetStatusHook;
    if (pfnHook != nullptr)
    {
        return pfnHook(hStatus, pStatus);
    }
    return SetServiceStatus(hStatus, pStatus);
}

// The control handler of a start request for a name the DLL does not serve: it has
// nothing to control.
DWORD WINAPI ServiceUnknownControlHandler(DWORD dwControl, DWORD dwEventType, LPVOID pvEventData,
                                          LPVOID pvContext)
{
    return NO_ERROR;
}

bool ServiceNamesEqual(const wchar_t *wszFirst, const wchar_t *wszSecond)
{
    return wszFirst != nullptr && wszSecond != nullptr &&
           CompareStringOrdinal(wszFirst, -1, wszSecond, -1, TRUE) == CSTR_EQUAL;
}
} // namespace

CService::CService()
    : m_wszServiceName(nullptr)
    , m_idsLocalizedName(0)
    , m_idsDescription(0)
    , m_fAcceptPauseContinue(false)
    , m_fAcceptControl(false)
    , m_fAcceptDeviceEvents(false)
    , m_fAcceptPowerEvents(false)
    , m_fAcceptShutdown(false)
    , m_wszAccount(nullptr)
    , m_ulStartType(SERVICE_AUTO_START)
    , m_wszDependencies(nullptr)
    , m_ulFailureAction(SC_ACTION_RESTART)
    , m_pNextService(nullptr)
    , m_hServiceStatus(nullptr)
    , m_status()
    , m_hStopEvent(nullptr)
    , m_hStopWait(nullptr)
    , m_ulServiceBit(0)
{
    InitializeSRWLock(&m_srwStatus);
}

CService::~CService()
{
    UnregisterService();
}

void CService::OnPause()
{
    ASSERT_CHECK(L"CService::OnPause",
                 false && "When m_fAcceptPauseContinue is true, you MUST override OnPause");
}

void CService::OnContinue()
{
    ASSERT_CHECK(L"CService::OnContinue",
                 false && "When m_fAcceptPauseContinue is true, you MUST override OnContinue");
}

void CService::OnControl(ULONG ulControl, void *pvEventData)
{
    ASSERT_CHECK(L"CService::OnControl",
                 false && "When m_fAcceptControl is true, you MUST override OnControl");
}

void CService::OnDeviceEvent(ULONG ulEventType, void *pvEventData)
{
    ASSERT_CHECK(L"CService::OnDeviceEvent",
                 false && "When m_fAcceptDeviceEvents is true, you MUST override OnDeviceEvent");
}

void CService::OnPowerEvent(ULONG ulEventType, void *pvEventData)
{
    ASSERT_CHECK(L"CService::OnPowerEvent",
                 false && "When m_fAcceptPowerEvents is true, you MUST override OnPowerEvent");
}

void CService::OnShutdown()
{
    ASSERT_CHECK(L"CService::OnShutdown",
                 false && "When m_fAcceptShutdown is true, you MUST override OnShutdown");
}

void CService::OnRegister() {}

void CService::OnUnregister() {}

void CService::HostPushServiceGlobals(CService *pService, const wchar_t *wszGroup, void *pvGlobals)
{
    // A host that loads the DLL once and starts the service again pushes again.
    if (!IsListed(pService))
    {
        RegisterService(pService);
    }
    s_fSvchost = true;
    s_wszSvchostGroup = wszGroup;

    const SERVICE_COMMAND_LINE *pCommandLine = static_cast<const SERVICE_COMMAND_LINE *>(pvGlobals);
    if (pCommandLine == nullptr || pCommandLine->ulMagic != c_ulCommandLineMagic)
    {
        s_pSvchostGlobals = static_cast<SVCHOST_GLOBAL_DATA *>(pvGlobals);
        return;
    }

    ULONG ulFlags = ParseCommandLine(static_cast<DWORD>(pCommandLine->argc), pCommandLine->argv);
    if ((ulFlags & c_ulInvalidCommandLine) != 0)
    {
        DebugLog(L"CService::SvchostPushServiceGlobals",
                 L"Invalid command line; use [service...] [-r | -u] [-d]\r\n");
        ExitProcess(c_uInvalidCommandLineExitCode);
    }
    if ((ulFlags & c_ulSwitchUnregister) != 0)
    {
        for (CService *p = s_pFirstService; p != nullptr; p = p->m_pNextService)
        {
            if ((p->m_ulServiceBit & ulFlags) != 0)
            {
                p->UnregisterOneService();
            }
        }
    }
    else if ((ulFlags & c_ulSwitchRegister) != 0)
    {
        for (CService *p = s_pFirstService; p != nullptr; p = p->m_pNextService)
        {
            if ((p->m_ulServiceBit & ulFlags) != 0)
            {
                p->RegisterOneService();
            }
        }
    }
    else
    {
        RunAsConsoleExe(ulFlags);
    }
}

void CService::HostServiceMain(CService *pService, const wchar_t *wszGroup, DWORD argc,
                               LPWSTR *argv)
{
    // A host that never pushes its globals (Wine's svchost) still loaded us as a host DLL:
    // list the service here. Without a stop callback, STOP runs OnStop on the dispatcher.
    if (!IsListed(pService))
    {
        RegisterService(pService);
        s_fSvchost = true;
        s_wszSvchostGroup = wszGroup;
    }

    const wchar_t *wszName = (argc >= 1 && argv != nullptr) ? argv[0] : nullptr;
    CService *pFound = FindService(wszName);
    if (pFound != nullptr)
    {
        pFound->ServiceMain(argc, argv);
        return;
    }

    DebugLog(L"CService::ServiceMain", L"No service named %s in this module\r\n",
             wszName != nullptr ? wszName : L"(null)");
    ReportStartFailure(wszName, ServiceType(), ERROR_SERVICE_NOT_IN_EXE);
}

void CService::ReportStartFailure(const wchar_t *wszName, DWORD dwServiceType, DWORD dwError)
{
    if (wszName == nullptr)
    {
        return;
    }
    SERVICE_STATUS_HANDLE hStatus =
        RegisterServiceCtrlHandlerExW(wszName, ServiceUnknownControlHandler, nullptr);
    if (hStatus == nullptr)
    {
        return;
    }
    SERVICE_STATUS status = {};
    status.dwServiceType = dwServiceType;
    status.dwCurrentState = SERVICE_STOPPED;
    status.dwWin32ExitCode = dwError;
    ServiceReportStatus(hStatus, &status);
}

void CService::RegisterService(CService *pService)
{
    ASSERT_CHECK(L"CService::RegisterService",
                 s_pFirstService != pService && pService->m_pNextService == NULL);
    // Beyond 24 services the bits would run into the switches.
    ASSERT_CHECK(L"CService::RegisterService", (s_ulNextServiceBit & c_ulServiceMask) != 0);
    // Past a refused assertion (under a debugger) the list must not become a cycle.
    if (IsListed(pService) || (s_ulNextServiceBit & c_ulServiceMask) == 0)
    {
        return;
    }
    pService->m_pNextService = s_pFirstService;
    s_pFirstService = pService;
    pService->m_ulServiceBit = s_ulNextServiceBit;
    s_ulNextServiceBit <<= 1;
}

void CService::UnregisterService()
{
    DebugLog(L"CService::UnregisterService",
             L"Attempting to Unregister CService=%p, pFirst=%p...\r\n", this, s_pFirstService);
    for (CService **ppService = &s_pFirstService; *ppService != nullptr;
         ppService = &(*ppService)->m_pNextService)
    {
        if (*ppService == this)
        {
            *ppService = m_pNextService;
            m_pNextService = nullptr;
            DebugLog(L"CService::UnregisterService", L"Successfully Unregistered CService=%p\r\n",
                     this);
            break;
        }
    }
    // An empty list starts over, so bits are never used up by services that came and went.
    if (s_pFirstService == nullptr)
    {
        s_ulNextServiceBit = 1;
    }
}

void CService::ServiceMain(DWORD argc, LPWSTR *argv)
{
    ULONG ulFlags = ParseCommandLine(argc, argv);

    if (s_pSvchostGlobals != nullptr)
    {
        HANDLE hStopEvent = CreateEventW(nullptr, FALSE, FALSE, nullptr);
        if (hStopEvent == nullptr)
        {
            FATAL_ERROR(L"CService::ServiceMain", L"CreateEvent", GetLastError());
        }
        // The stop callback of a previous run may still be clearing these fields: both are
        // stored under the lock. The event cannot fire before the control handler exists.
        HANDLE hStopWait = nullptr;
        DWORD dwResult = s_pSvchostGlobals->RegisterStopCallback(
            &hStopWait, m_wszServiceName, hStopEvent, StopCallbackStatic, this, 0);
        if (dwResult != 0)
        {
            FATAL_ERROR(L"CService::ServiceMain", L"RegisterStopCallback", dwResult);
        }
        AcquireSRWLockExclusive(&m_srwStatus);
        m_hStopEvent = hStopEvent;
        m_hStopWait = hStopWait;
        ReleaseSRWLockExclusive(&m_srwStatus);
    }

    SERVICE_STATUS_HANDLE hStatus =
        RegisterServiceCtrlHandlerExW(m_wszServiceName, ServiceControlHandler, this);
    if (hStatus == nullptr)
    {
        FATAL_ERROR(L"CService::ServiceMain", L"RegisterServiceCtrlHandlerEx", GetLastError());
    }

    AcquireSRWLockExclusive(&m_srwStatus);
    m_status.dwServiceType = ServiceType();
    m_status.dwCurrentState = SERVICE_STOPPED;
    m_status.dwControlsAccepted = SERVICE_ACCEPT_STOP;
    if (m_fAcceptPauseContinue)
    {
        m_status.dwControlsAccepted |= SERVICE_ACCEPT_PAUSE_CONTINUE;
    }
    if (m_fAcceptPowerEvents)
    {
        m_status.dwControlsAccepted |= SERVICE_ACCEPT_POWEREVENT;
    }
    m_status.dwWin32ExitCode = 0;
    m_status.dwServiceSpecificExitCode = 0;
    m_status.dwCheckPoint = 0;
    m_status.dwWaitHint = c_dwWaitHint;
    if ((ulFlags & c_ulSwitchDebug) != 0 || IsDebuggerPresent())
    {
        m_status.dwWaitHint = c_dwDebugWaitHint;
    }
    m_hServiceStatus = hStatus;
    ReleaseSRWLockExclusive(&m_srwStatus);

    // User-defined controls need no accept bit; a service asking for one is mistaken.
    if (m_fAcceptControl)
    {
        ASSERT_CHECK(L"CService::ServiceMain", false);
    }

    SetStatus(SERVICE_START_PENDING);
    if ((ulFlags & c_ulSwitchDebug) != 0)
    {
        DebugBreak();
    }
    if (!QueueUserWorkItem(StartWorkItem, this, WT_EXECUTEDEFAULT))
    {
        FATAL_ERROR(L"CService::ServiceMain", L"QueueUserWorkItem", GetLastError());
    }
}

DWORD WINAPI CService::StartWorkItem(PVOID pvContext)
{
    static_cast<CService *>(pvContext)->OnStart();
    return 0;
}

DWORD WINAPI CService::ServiceControlHandler(DWORD dwControl, DWORD dwEventType, LPVOID pvEventData,
                                             LPVOID pvContext)
{
    CService *pService = static_cast<CService *>(pvContext);
    switch (dwControl)
    {
    case SERVICE_CONTROL_STOP: {
        // Under a host the stop callback owns OnStop: once it has run, the event is gone and
        // a late STOP finds nothing left to stop.
        bool fStopHere = false;
        AcquireSRWLockExclusive(&pService->m_srwStatus);
        if (pService->m_hStopEvent != nullptr)
        {
            if (!SetEvent(pService->m_hStopEvent))
            {
                FATAL_ERROR(L"CService::ServiceControlHandler", L"SetEvent", GetLastError());
            }
        }
        else
        {
            fStopHere = s_pSvchostGlobals == nullptr;
        }
        ReleaseSRWLockExclusive(&pService->m_srwStatus);
        if (fStopHere)
        {
            pService->OnStop();
        }
        break;
    }
    case SERVICE_CONTROL_PAUSE:
        pService->OnPause();
        break;
    case SERVICE_CONTROL_CONTINUE:
        pService->OnContinue();
        break;
    case SERVICE_CONTROL_INTERROGATE:
        break;
    case SERVICE_CONTROL_SHUTDOWN:
        pService->OnShutdown();
        break;
    case SERVICE_CONTROL_DEVICEEVENT:
        pService->OnDeviceEvent(dwEventType, pvEventData);
        break;
    case SERVICE_CONTROL_POWEREVENT:
        pService->OnPowerEvent(dwEventType, pvEventData);
        break;
    default:
        // The control manager passes user-defined controls from any client with the right
        // to send them, whatever the service accepts; one that never asked for them must not
        // end up in the default OnControl, whose assertion would end the host process.
        if (dwControl >= 128 && dwControl <= 255 && pService->m_fAcceptControl)
        {
            pService->OnControl(dwControl, pvEventData);
        }
        break;
    }

    AcquireSRWLockExclusive(&pService->m_srwStatus);
    if (pService->m_hServiceStatus != nullptr)
    {
        if (!ServiceReportStatus(pService->m_hServiceStatus, &pService->m_status))
        {
            FATAL_ERROR(L"CService::ServiceControlHandler", L"SetServiceStatus", GetLastError());
        }
    }
    ReleaseSRWLockExclusive(&pService->m_srwStatus);
    return NO_ERROR;
}

void CService::SetStatus(ULONG ulStatus)
{
    ASSERT_CHECK(L"CService::SetStatus", 1 <= ulStatus && ulStatus <= 7);
    if (ulStatus < 1 || ulStatus > 7)
    {
        return;
    }
    DebugLog(L"CService::SetStatus", L"%s is %s\r\n", m_wszServiceName,
             s_rgwszStateNames[ulStatus]);

    AcquireSRWLockExclusive(&m_srwStatus);
    if (ulStatus != m_status.dwCurrentState)
    {
        m_status.dwCurrentState = ulStatus;
        m_status.dwCheckPoint = 0;
    }
    else
    {
        m_status.dwCheckPoint++;
    }
    if (m_hServiceStatus != nullptr)
    {
        if (!ServiceReportStatus(m_hServiceStatus, &m_status))
        {
            FATAL_ERROR(L"CService::SetStatus", L"SetServiceStatus", GetLastError());
        }
    }
    if (ulStatus == SERVICE_STOPPED)
    {
        m_hServiceStatus = nullptr;
    }
    ReleaseSRWLockExclusive(&m_srwStatus);

    if (ulStatus != SERVICE_STOPPED)
    {
        return;
    }
    AcquireSRWLockExclusive(&s_srwConsole);
    if (s_hConsoleEvent != nullptr)
    {
        bool fAllStopped = true;
        for (CService *p = s_pFirstService; p != nullptr; p = p->m_pNextService)
        {
            if ((p->m_ulServiceBit & s_ulConsoleSelection) != 0 &&
                p->m_status.dwCurrentState != SERVICE_STOPPED)
            {
                fAllStopped = false;
            }
        }
        if (fAllStopped && !SetEvent(s_hConsoleEvent))
        {
            FATAL_ERROR(L"CService::SetStatus", L"SetEvent", GetLastError());
        }
    }
    ReleaseSRWLockExclusive(&s_srwConsole);
}

VOID CALLBACK CService::StopCallbackStatic(PVOID pvContext, BOOLEAN fTimedOut)
{
    CService *pService = static_cast<CService *>(pvContext);
    // Once OnStop has reported STOPPED, a host that keeps its process for other services may
    // start this one again on another thread, and ServiceMain then stores a new event and
    // wait: only the ones this callback belongs to are dropped here. Nothing writes them
    // before that STOPPED, so they are read without the lock the dispatcher may hold.
    HANDLE hStopEvent = pService->m_hStopEvent;
    HANDLE hStopWait = pService->m_hStopWait;

    pService->OnStop();

    // From inside its own callback the wait cannot be waited for: 997 is the expected answer.
    if (!UnregisterWaitEx(hStopWait, nullptr) && GetLastError() != ERROR_IO_PENDING)
    {
        FATAL_ERROR(L"CService::StopCallbackStatic", L"UnregisterWaitEx", GetLastError());
    }

    AcquireSRWLockExclusive(&pService->m_srwStatus);
    if (pService->m_hStopWait == hStopWait)
    {
        pService->m_hStopWait = nullptr;
    }
    if (pService->m_hStopEvent == hStopEvent)
    {
        pService->m_hStopEvent = nullptr;
    }
    ReleaseSRWLockExclusive(&pService->m_srwStatus);
    if (!CloseHandle(hStopEvent))
    {
        FATAL_ERROR(L"CService::StopCallbackStatic", L"CloseHandle", GetLastError());
    }
}

void CService::RunAsConsoleExe(ULONG ulFlags)
{
    s_fConsole = true;
    HANDLE hConsoleEvent = CreateEventW(nullptr, FALSE, FALSE, nullptr);
    if (hConsoleEvent == nullptr)
    {
        FATAL_ERROR(L"CService::RunAsConsoleExe", L"CreateEvent", GetLastError());
        return;
    }
    AcquireSRWLockExclusive(&s_srwConsole);
    s_hConsoleEvent = hConsoleEvent;
    s_ulConsoleSelection = ulFlags & c_ulServiceMask;
    ReleaseSRWLockExclusive(&s_srwConsole);
    if (!SetConsoleCtrlHandler(ConsoleCtrlHandler, TRUE))
    {
        FATAL_ERROR(L"CService::RunAsConsoleExe", L"SetConsoleCtrlHandler", GetLastError());
    }

    for (CService *p = s_pFirstService; p != nullptr; p = p->m_pNextService)
    {
        if ((p->m_ulServiceBit & ulFlags) != 0)
        {
            p->SetStatus(SERVICE_START_PENDING);
            if ((ulFlags & c_ulSwitchDebug) != 0)
            {
                DebugBreak();
            }
            p->OnStart();
        }
    }

    DWORD dwWait = WaitForSingleObject(hConsoleEvent, INFINITE);
    if (dwWait != WAIT_OBJECT_0)
    {
        FATAL_ERROR(L"CService::RunAsConsoleExe", L"WaitForSingleObject",
                    dwWait == WAIT_FAILED ? GetLastError() : dwWait);
    }

    for (CService *p = s_pFirstService; p != nullptr; p = p->m_pNextService)
    {
        if (p->m_status.dwCurrentState == SERVICE_RUNNING)
        {
            p->OnStop();
        }
    }

    AcquireSRWLockExclusive(&s_srwConsole);
    s_hConsoleEvent = nullptr;
    s_ulConsoleSelection = 0;
    ReleaseSRWLockExclusive(&s_srwConsole);
    SetConsoleCtrlHandler(ConsoleCtrlHandler, FALSE);
    if (!CloseHandle(hConsoleEvent))
    {
        FATAL_ERROR(L"CService::RunAsConsoleExe", L"CloseHandle", GetLastError());
    }
}

BOOL WINAPI CService::ConsoleCtrlHandler(DWORD dwCtrlType)
{
    DebugLog(L"CService::ConsoleCtrlHandler", L"Console control event %u\r\n", dwCtrlType);
    // A second Ctrl+C may come while console mode is closing its event.
    AcquireSRWLockExclusive(&s_srwConsole);
    if (s_hConsoleEvent != nullptr && !SetEvent(s_hConsoleEvent))
    {
        FATAL_ERROR(L"CService::ConsoleCtrlHandler", L"SetEvent", GetLastError());
    }
    ReleaseSRWLockExclusive(&s_srwConsole);
    return TRUE;
}

ULONG CService::ParseCommandLine(DWORD argc, LPWSTR *argv)
{
    if (argc < 2 || argv == nullptr)
    {
        return c_ulServiceMask;
    }
    ULONG ulFlags = 0;
    for (DWORD i = 1; i < argc; i++)
    {
        const wchar_t *wszArg = argv[i];
        if (wszArg == nullptr)
        {
            ulFlags |= c_ulInvalidCommandLine;
            continue;
        }
        if (wszArg[0] == L'-' || wszArg[0] == L'/')
        {
            // Only the letter after the dash counts: /register is r.
            switch (towlower(wszArg[1]))
            {
            case L'c':
                ulFlags |= c_ulSwitchConsole;
                break;
            case L'd':
                ulFlags |= c_ulSwitchDebug;
                break;
            case L'e':
                break;
            case L'r':
                ulFlags |= c_ulSwitchRegister;
                break;
            case L'u':
                ulFlags |= c_ulSwitchUnregister;
                break;
            default:
                ulFlags |= c_ulInvalidCommandLine;
                break;
            }
            continue;
        }
        CService *pService = FindService(wszArg);
        ulFlags |= pService != nullptr ? pService->m_ulServiceBit : c_ulInvalidCommandLine;
    }
    if ((ulFlags & c_ulServiceMask) == 0)
    {
        ulFlags |= c_ulServiceMask;
    }
    return ulFlags;
}

CService *CService::FindService(const wchar_t *wszName)
{
    for (CService *p = s_pFirstService; p != nullptr; p = p->m_pNextService)
    {
        if (ServiceNamesEqual(p->m_wszServiceName, wszName))
        {
            return p;
        }
    }
    return nullptr;
}

bool CService::IsListed(const CService *pService)
{
    for (CService *p = s_pFirstService; p != nullptr; p = p->m_pNextService)
    {
        if (p == pService)
        {
            return true;
        }
    }
    return false;
}

ULONG CService::ServiceType()
{
    bool fShared =
        s_fSvchost || (s_pFirstService != nullptr && s_pFirstService->m_pNextService != nullptr);
    return fShared ? SERVICE_WIN32_SHARE_PROCESS : SERVICE_WIN32_OWN_PROCESS;
}

void ServiceSetStatusHook(PFN_SET_SERVICE_STATUS pfnHook)
{
    s_pfnSetStatusHook = pfnHook;
}
