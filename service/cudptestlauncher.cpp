#include "service/cudptestlauncher.h"
#include "servicelib/diagnostics.h"
#include "servicelib/eventtrace.h"
#include "service/statesubscription.h"

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
    // A change queued before the destroy request must not start anything after it. The test
    // policy and the launch come here.
    if (m_fDestroying || ulBacklightOn == 1)
    {
        return;
    }
}

void CUDPTestLauncher::Dispatch_CollectionComplete()
{
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
