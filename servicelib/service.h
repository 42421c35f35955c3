// The service shell: the list of services a DLL hosts, their start on the thread pool,
// control requests, status reports to the control manager, the host's stop callback, a
// console mode without the control manager, and installation.
#pragma once

#include <windows.h>

// The global data block the shared service host hands to SvchostPushServiceGlobals. The
// well-known SIDs and the RPC and NetBIOS helpers that precede the stop-callback
// registration are never used here; only the layout matters.
typedef DWORD(WINAPI *PFN_SVCHOST_REGISTER_STOP_CALLBACK)(PHANDLE phNewWaitObject,
                                                          PCWSTR wszServiceName, HANDLE hObject,
                                                          WAITORTIMERCALLBACK pfnCallback,
                                                          PVOID pvContext, DWORD dwFlags);

struct SVCHOST_GLOBAL_DATA
{
    PSID rgpWellKnownSids[18];
    PVOID rgpfnRpcAndNetBios[6];
    PFN_SVCHOST_REGISTER_STOP_CALLBACK RegisterStopCallback;
};

// What a command-line runner passes instead of the host's block. The first word tells the
// two apart: no host block starts with this value.
const ULONG_PTR c_ulCommandLineMagic = 0x87654321;

struct SERVICE_COMMAND_LINE
{
    ULONG_PTR ulMagic;
    ULONG_PTR argc;
    LPWSTR *argv;
};

// Where the shared service host (Wine's svchost.exe and telvanehost.exe alike) looks up the
// services of a group: one REG_MULTI_SZ value per group name. Paths are under
// HKEY_LOCAL_MACHINE.
const wchar_t c_wszSvchostGroupKey[] = L"SOFTWARE\\Microsoft\\Windows NT\\CurrentVersion\\Svchost";
const wchar_t c_wszServiceParametersKeyFormat[] =
    L"SYSTEM\\CurrentControlSet\\Services\\%s\\Parameters";

// One per hosted service: a static object that lives as long as the DLL, listed by the
// DLL's exports before any other thread uses it. ServiceControlHandler runs on the control
// dispatcher thread, OnStart on a thread-pool thread (or the console thread), OnStop on the
// host's stop-callback thread, the dispatcher thread without a host, or the console thread.
// Status reports are serialised by the service's own lock; nothing else is.
class CService
{
public:
    // Flags of ParseCommandLine.
    static constexpr ULONG c_ulServiceMask = 0x00FFFFFF;
    static constexpr ULONG c_ulSwitchConsole = 0x01000000;
    static constexpr ULONG c_ulSwitchDebug = 0x02000000;
    static constexpr ULONG c_ulSwitchRegister = 0x04000000;
    static constexpr ULONG c_ulSwitchUnregister = 0x08000000;
    static constexpr ULONG c_ulInvalidCommandLine = 0x10000000;

    CService();
    virtual ~CService();

    CService(const CService &) = delete;
    CService &operator=(const CService &) = delete;

    // OnStart may return before the service runs; the service reports RUNNING itself.
    // OnStop returns only once the service is down, after reporting STOPPED.
    virtual void OnStart() = 0;
    virtual void OnStop() = 0;
    virtual void OnPause();
    virtual void OnContinue();
    virtual void OnControl(ULONG ulControl, void *pvEventData);
    virtual void OnDeviceEvent(ULONG ulEventType, void *pvEventData);
    virtual void OnPowerEvent(ULONG ulEventType, void *pvEventData);
    virtual void OnShutdown();
    virtual void OnRegister();
    virtual void OnUnregister();

    // The bodies of the DLL's exports SvchostPushServiceGlobals and ServiceMain, given the
    // DLL's service and host group.
    static void HostPushServiceGlobals(CService *pService, const wchar_t *wszGroup,
                                       void *pvGlobals);
    static void HostServiceMain(CService *pService, const wchar_t *wszGroup, DWORD argc,
                                LPWSTR *argv);

    static void RegisterService(CService *pService);
    void UnregisterService();
    void ServiceMain(DWORD argc, LPWSTR *argv);
    static DWORD WINAPI ServiceControlHandler(DWORD dwControl, DWORD dwEventType,
                                              LPVOID pvEventData, LPVOID pvContext);
    void SetStatus(ULONG ulStatus);
    static VOID CALLBACK StopCallbackStatic(PVOID pvContext, BOOLEAN fTimedOut);
    static void RunAsConsoleExe(ULONG ulFlags);
    static BOOL WINAPI ConsoleCtrlHandler(DWORD dwCtrlType);
    static ULONG ParseCommandLine(DWORD argc, LPWSTR *argv);
    // Answers a start request that cannot be served (no such service here, or its code
    // could not be loaded) with STOPPED and the error, so the control manager need not time
    // out waiting for it.
    static void ReportStartFailure(const wchar_t *wszName, DWORD dwServiceType, DWORD dwError);

    void RegisterOneService();
    void UnregisterOneService();
    void ConfigureSvchostOptions(const wchar_t *wszModulePath);
    void ConfigureRestartOption(SC_HANDLE hService);

    const wchar_t *ServiceName() const { return m_wszServiceName; }

protected:
    const wchar_t *m_wszServiceName;
    ULONG m_idsLocalizedName;
    ULONG m_idsDescription;
    bool m_fAcceptPauseContinue;
    bool m_fAcceptControl;
    bool m_fAcceptDeviceEvents;
    bool m_fAcceptPowerEvents;
    bool m_fAcceptShutdown;
    const wchar_t *m_wszAccount;
    ULONG m_ulStartType;
    const wchar_t *m_wszDependencies;
    ULONG m_ulFailureAction;
    CService *m_pNextService;
    SERVICE_STATUS_HANDLE m_hServiceStatus;
    SERVICE_STATUS m_status;
    HANDLE m_hStopEvent;
    HANDLE m_hStopWait;
    ULONG m_ulServiceBit;
    // Guards m_status, m_hServiceStatus, m_hStopEvent and m_hStopWait between the dispatcher
    // thread and the threads that report status or stop, so that nothing reaches the control
    // manager after STOPPED, no stop request lands on a closed event, and a stop callback
    // never drops the event and wait of the start that follows it.
    SRWLOCK m_srwStatus;

    static CService *s_pFirstService;
    static ULONG s_ulNextServiceBit;
    static bool s_fConsole;
    static bool s_fSvchost;
    static const wchar_t *s_wszSvchostGroup;
    static SVCHOST_GLOBAL_DATA *s_pSvchostGlobals;
    static HANDLE s_hConsoleEvent;
    static const wchar_t *const s_rgwszStateNames[8];

private:
    static DWORD WINAPI StartWorkItem(PVOID pvContext);
    static CService *FindService(const wchar_t *wszName);
    static bool IsListed(const CService *pService);
    static ULONG ServiceType();
    void WaitUntilDeleted(SC_HANDLE hScm);
};

// Test seams for the two calls whose effect the test platform cannot show: what reaches
// the control manager (a status handle exists only inside a service process) and the
// failure actions (Wine accepts them and stores nothing). Each hook replaces the call;
// null restores it.
typedef BOOL(WINAPI *PFN_SET_SERVICE_STATUS)(SERVICE_STATUS_HANDLE hStatus,
                                             LPSERVICE_STATUS pStatus);
typedef BOOL(WINAPI *PFN_CHANGE_SERVICE_CONFIG2)(SC_HANDLE hService, DWORD dwInfoLevel,
                                                 LPVOID pvInfo);
void ServiceSetStatusHook(PFN_SET_SERVICE_STATUS pfnHook);
void ServiceSetChangeConfig2Hook(PFN_CHANGE_SERVICE_CONFIG2 pfnHook);
