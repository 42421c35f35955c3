#include "service/cudptestlauncher.h"
#include "servicelib/diagnostics.h"
#include "servicelib/eventtrace.h"
#include "service/statesubscription.h"
#include "service/udptestlaunch.h"
#include "service/udptestpolicy.h"

namespace
{
// The mains-power state: 0 while the phone runs on mains power.
const WNF_STATE_NAME c_ullPowerSourceStateName = 0x41C61D22A3BC2875ull;
} // namespace

CUDPTestLauncher::CUDPTestLauncher()
    : m_hProcess(INVALID_HANDLE_VALUE)
    , m_hWait(nullptr)
    , m_hDestroyed(CreateEventW(nullptr, TRUE, FALSE, nullptr))
    , m_hWnfSubscription(nullptr)
    , m_fConfigLoaded(false)
    , m_fDestroying(false)
{
    if (!m_hDestroyed.IsValid())
    {
        FATAL_ERROR(L"CUDPTestLauncher::CUDPTestLauncher", L"CreateEvent", GetLastError());
    }
}

CUDPTestLauncher::~CUDPTestLauncher()
{
    // Only an unload without a stop finds a test still tracked; its wait goes first, so that
    // it never fires on a closed handle.
    if (m_hWait != nullptr)
    {
        UnregisterWaitEx(m_hWait, INVALID_HANDLE_VALUE);
        m_hWait = nullptr;
    }
    if (m_hProcess != INVALID_HANDLE_VALUE)
    {
        CloseHandle(m_hProcess);
        m_hProcess = INVALID_HANDLE_VALUE;
    }
    if (!m_hDestroyed.Close())
    {
        FATAL_ERROR(L"CUDPTestLauncher::~CUDPTestLauncher", L"CloseHandle", GetLastError());
    }
}

NTSTATUS NTAPI CUDPTestLauncher::WnfNotificationCallback(WNF_STATE_NAME stateName,
                                                         WNF_CHANGE_STAMP changeStamp,
                                                         PWNF_TYPE_ID pTypeId, PVOID pvContext,
                                                         const VOID *pvData, ULONG cbData)
{
    TelvaneTrace("CUDPTestLauncher::WnfNotificationCallback() - backlight toggled");
    // Data shorter than one value says nothing about the backlight: taken as "not 1".
    ULONG ulValue = 0;
    if (pvData != nullptr && cbData >= sizeof(ulValue))
    {
        CopyMemory(&ulValue, pvData, sizeof(ulValue));
    }
    static_cast<CUDPTestLauncher *>(pvContext)->Post(EventBacklightChanged, ulValue == 1 ? 1 : 0);
    return 0;
}

void CUDPTestLauncher::RequestDestroy()
{
    Post(EventDestroy);
}

void CUDPTestLauncher::WaitForDestroyComplete()
{
    TelvaneTrace("CUDPTestLauncher::WaitForDestroyComplete()");
    WaitForSingleObject(m_hDestroyed.Get(), INFINITE);
    TelvaneTrace("CUDPTestLauncher::WaitForDestroyComplete() - complete");
}

void CUDPTestLauncher::Dispatch(ULONG ulEventType, ULONG_PTR ulArg1, ULONG_PTR ulArg2,
                                ULONG_PTR ulArg3)
{
    switch (ulEventType)
    {
    case EventDestroy:
        Dispatch_Destroy();
        Dispatch_AdvanceDestruction();
        break;
    case EventBacklightChanged:
        Dispatch_BacklightChanged(ulArg1);
        break;
    case EventCollectionComplete:
        Dispatch_CollectionComplete();
        Dispatch_AdvanceDestruction();
        break;
    default:
        DISPATCH_UNKNOWN_EVENT(L"CUDPTestLauncher::Dispatch", L"CUDPTestLauncher::EventType %u",
                               ulEventType);
        break;
    }
}

void CUDPTestLauncher::Dispatch_Destroy()
{
    m_fDestroying = true;
    if (m_hWnfSubscription != nullptr)
    {
        // May run inside the subscription's own callback (a post to the idle launcher runs
        // there); the facility does not wait for that callback then.
        StateSubscriptionEnd(m_hWnfSubscription);
        m_hWnfSubscription = nullptr;
    }
}

void CUDPTestLauncher::Dispatch_BacklightChanged(ULONG_PTR ulBacklightOn)
{
    TelvaneTrace("CUDPTestLauncher::Dispatch_BacklightChangedup  () - backlight toggled");
    if (ulBacklightOn == 1)
    {
        return;
    }
    // A change that was already on its way when the destroy request came runs after it; the
    // destroyed event may be set already, so nothing may start any more.
    if (m_fDestroying)
    {
        TelvaneTrace("CUDPTestLauncher::Dispatch_BacklightChanged() - destroying, ignoring this "
                     "call");
        return;
    }
    if (m_hProcess != INVALID_HANDLE_VALUE)
    {
        TelvaneTrace("CUDPTestLauncher::Dispatch_BacklightChanged() - process is still running, "
                     "ignoring this call");
        return;
    }
    if (!m_fConfigLoaded)
    {
        TelvaneTrace("CUDPTestLauncher::Dispatch_BacklightChangedup  () - loading UDP config");
        m_fConfigLoaded = true;
        ResetUdpConfig(&m_config);
        // A missing or broken file, or an expired policy, is fetched again on top of what the
        // file gave.
        if (FAILED(LoadUdpConfig(&m_config)) || IsConfigExpired(&m_config))
        {
            RefreshUdpConfig(&m_config);
        }
    }
    if (IsConfigExpired(&m_config))
    {
        TelvaneTrace("CUDPTestLauncher::Dispatch_BacklightChangedup  () - config expired, "
                     "refreshing");
        // A refresh that fails here leaves the reset record: no test until the next refresh.
        ResetUdpConfig(&m_config);
        RefreshUdpConfig(&m_config);
    }
    if (!ShouldRunTest())
    {
        TelvaneTrace("CUDPTestLauncher::Dispatch_BacklightChangedup  () - asked not to run test");
        return;
    }

    HANDLE hProcess = INVALID_HANDLE_VALUE;
    HRESULT hr = LaunchUdpTest(&m_config, &hProcess);
    if (hProcess == INVALID_HANDLE_VALUE)
    {
        return;
    }
    // Also when the policy could not be saved afterwards (hr): the process runs, and a second
    // test must not start beside it.
    TelvaneTrace("CUDPTestLauncher::Dispatch_BacklightChangedup  () - UDP app launched");
    if (FAILED(hr))
    {
        TelvaneTrace("CUDPTestLauncher::Dispatch_BacklightChanged() - policy not saved, "
                     "tracking the process anyway");
    }
    if (!RegisterWaitForSingleObject(&m_hWait, hProcess, ProcessExitCallback, this, INFINITE,
                                     WT_EXECUTEONLYONCE))
    {
        FATAL_ERROR(L"CUDPTestLauncher::Dispatch_BacklightChanged", L"RegisterWaitForSingleObject",
                    GetLastError());
    }
    m_hProcess = hProcess;
}

bool CUDPTestLauncher::ShouldRunTest()
{
    if (!m_config.enabled)
    {
        TelvaneTraceUdpFailure("Not enabled", 0);
        return false;
    }
    // A saved empty relay name reads back as null; neither it nor a relay without a port can
    // be tested against.
    if (!UdpConfigHasRelay(m_config) || m_config.relayPort == 0)
    {
        TelvaneTraceUdpFailure("No relay to test against", 0);
        return false;
    }
    if (m_config.acOnly)
    {
        ULONG ulPowerSource = 0;
        ULONG cbPowerSource = sizeof(ulPowerSource);
        NTSTATUS status = NtQueryWnfStateData(&c_ullPowerSourceStateName, nullptr, nullptr, nullptr,
                                              &ulPowerSource, &cbPowerSource);
        if (status != 0 || cbPowerSource != sizeof(ulPowerSource) || ulPowerSource != 0)
        {
            TelvaneTraceUdpFailure("Not on AC, it's required", 0);
            return false;
        }
    }

    if (!UdpTestWiFiActive(&m_config))
    {
        return false;
    }

    if (!UdpTestSpacingPassed(m_config.lastTest, m_config.maxTestDay, UdpConfigNow()))
    {
        TelvaneTraceUdpFailure("Not time to run", 0);
        return false;
    }
    return true;
}

VOID CALLBACK CUDPTestLauncher::ProcessExitCallback(PVOID pvContext, BOOLEAN fTimedOut)
{
    static_cast<CUDPTestLauncher *>(pvContext)->Post(EventCollectionComplete);
}

void CUDPTestLauncher::Dispatch_CollectionComplete()
{
    if (m_hWait != nullptr)
    {
        // This handler may run on the wait's own callback thread (the callback's post found
        // the launcher idle): unregister without waiting, which then reports ERROR_IO_PENDING
        // and frees the wait when the callback returns.
        if (!UnregisterWaitEx(m_hWait, nullptr) && GetLastError() != ERROR_IO_PENDING)
        {
            FATAL_ERROR(L"CUDPTestLauncher::Dispatch_CollectionComplete", L"UnregisterWaitEx",
                        GetLastError());
        }
        m_hWait = nullptr;
    }
    if (m_hProcess != INVALID_HANDLE_VALUE)
    {
        if (!CloseHandle(m_hProcess))
        {
            FATAL_ERROR(L"CUDPTestLauncher::Dispatch_CollectionComplete", L"CloseHandle_Process",
                        GetLastError());
        }
        m_hProcess = INVALID_HANDLE_VALUE;
    }
}

void CUDPTestLauncher::Dispatch_AdvanceDestruction()
{
    if (!m_fDestroying)
    {
        return;
    }
    if (m_hProcess == INVALID_HANDLE_VALUE)
    {
        TelvaneTrace("CUDPTestLauncher::Dispatch_AdvanceDestruction() - finished destruction, "
                     "signaling event");
        if (!SetEvent(m_hDestroyed.Get()))
        {
            FATAL_ERROR(L"CUDPTestLauncher::Dispatch_AdvanceDestruction", L"SetEvent",
                        GetLastError());
        }
    }
    else
    {
        TelvaneTrace("CUDPTestLauncher::Dispatch_AdvanceDestruction() - still waiting on "
                     "outstanding operation");
    }
}
