#include "platform/statenotify/cwnfsubscription.h"

#include "platform/statenotify/statestore.h"

#ifndef REG_NOTIFY_THREAD_AGNOSTIC
#define REG_NOTIFY_THREAD_AGNOSTIC 0x10000000L
#endif

namespace
{
// Any address inside this module names it to GetModuleHandleExW.
const char s_chModuleAnchor = 0;
} // namespace

CWnfSubscription::CWnfSubscription(WNF_STATE_NAME stateName, WNF_CHANGE_STAMP stampSeen,
                                   PWNF_USER_CALLBACK pfnCallback, PVOID pvContext,
                                   PCWNF_TYPE_ID pTypeId)
    : m_stateName(stateName)
    , m_stampSeen(stampSeen)
    , m_pfnCallback(pfnCallback)
    , m_pvContext(pvContext)
    , m_typeId()
    , m_fHasTypeId(pTypeId != nullptr)
    , m_fStopped(false)
    , m_fFreeWhenCallbackEnds(false)
    , m_dwCallbackThread(0)
{
    if (pTypeId != nullptr)
    {
        m_typeId = *pTypeId;
    }
    InitializeCriticalSection(&m_cs);
}

CWnfSubscription::~CWnfSubscription()
{
    // The wait goes first: nothing may wait on the event or read the key after them.
    m_hWait.Close();
    m_hChanged.Close();
    m_hKey.Close();
    DeleteCriticalSection(&m_cs);
    // Only the owner's thread gets here with the module still held (the callback hands its
    // reference to the pool first), and the owner's own code holds the module meanwhile.
    m_hModule.Close();
}

NTSTATUS CWnfSubscription::Start()
{
    if (!GetModuleHandleExW(GET_MODULE_HANDLE_EX_FLAG_FROM_ADDRESS,
                            reinterpret_cast<LPCWSTR>(&s_chModuleAnchor), m_hModule.Receive()))
    {
        return StateStoreStatusFromError(static_cast<LONG>(GetLastError()));
    }
    // The subscriber creates the state's key when nobody has published yet: a key must exist
    // to be watched.
    LONG lError =
        StateStoreOpenKey(m_stateName, KEY_NOTIFY | KEY_QUERY_VALUE, true, m_hKey.Receive());
    if (lError != ERROR_SUCCESS)
    {
        return StateStoreStatusFromError(lError);
    }
    m_hChanged.Reset(CreateEventW(nullptr, FALSE, FALSE, nullptr));
    if (!m_hChanged)
    {
        return StateStoreStatusFromError(static_cast<LONG>(GetLastError()));
    }
    m_hWait.Reset(CreateThreadpoolWait(WaitCallback, this, nullptr));
    if (!m_hWait)
    {
        return StateStoreStatusFromError(static_cast<LONG>(GetLastError()));
    }
    lError = WatchKey();
    if (lError != ERROR_SUCCESS)
    {
        return StateStoreStatusFromError(lError);
    }
    // The first run looks at the value there is, so that a state published before the
    // subscription (with a stamp above the one the subscriber has seen) is delivered at once.
    // Set only now: watching a key resets its event.
    SetEvent(m_hChanged.Get());
    SetThreadpoolWait(m_hWait.Get(), m_hChanged.Get(), nullptr);
    return STATUS_SUCCESS;
}

bool CWnfSubscription::Stop()
{
    EnterCriticalSection(&m_cs);
    m_fStopped = true;
    if (m_dwCallbackThread == GetCurrentThreadId())
    {
        // Waiting here would wait for this very thread.
        m_fFreeWhenCallbackEnds = true;
        LeaveCriticalSection(&m_cs);
        return false;
    }
    LeaveCriticalSection(&m_cs);
    // A run that has not started is cancelled; one that has started finds m_fStopped at its
    // end and does not arm the wait again, and is waited for here.
    SetThreadpoolWait(m_hWait.Get(), nullptr, nullptr);
    WaitForThreadpoolWaitCallbacks(m_hWait.Get(), TRUE);
    return true;
}

VOID CALLBACK CWnfSubscription::WaitCallback(PTP_CALLBACK_INSTANCE pInstance, PVOID pvContext,
                                             PTP_WAIT pWait, TP_WAIT_RESULT waitResult)
{
    CWnfSubscription *pThis = static_cast<CWnfSubscription *>(pvContext);
    if (pThis->OnChanged(pInstance))
    {
        delete pThis;
    }
}

LONG CWnfSubscription::WatchKey()
{
    // Thread-agnostic: the registration outlives the thread that made it, which here is a
    // subscriber's thread or a pool thread, and either may end at any time.
    return RegNotifyChangeKeyValue(m_hKey.Get(), FALSE,
                                   REG_NOTIFY_CHANGE_LAST_SET | REG_NOTIFY_THREAD_AGNOSTIC,
                                   m_hChanged.Get(), TRUE);
}

bool CWnfSubscription::OnChanged(PTP_CALLBACK_INSTANCE pInstance)
{
    EnterCriticalSection(&m_cs);
    bool fStopped = m_fStopped;
    LeaveCriticalSection(&m_cs);
    if (fStopped)
    {
        return false;
    }

    // Watch again before reading, so that a change after the read sets the event again. A
    // key that can no longer be watched still gets this read; nothing else can be done.
    WatchKey();
    WNF_CHANGE_STAMP stamp = 0;
    BYTE rgbData[WNF_STATE_MAX_DATA_SIZE];
    ULONG cbData = 0;
    // Only the one run of the wait touches m_stampSeen, so it needs no lock.
    if (StateStoreRead(m_hKey.Get(), &stamp, rgbData, &cbData) == ERROR_SUCCESS &&
        stamp > m_stampSeen)
    {
        m_stampSeen = stamp;
        EnterCriticalSection(&m_cs);
        fStopped = m_fStopped;
        m_dwCallbackThread = fStopped ? 0 : GetCurrentThreadId();
        LeaveCriticalSection(&m_cs);
        if (fStopped)
        {
            return false;
        }
        m_pfnCallback(m_stateName, stamp, m_fHasTypeId ? &m_typeId : nullptr, m_pvContext,
                      cbData > 0 ? rgbData : nullptr, cbData);
        EnterCriticalSection(&m_cs);
        m_dwCallbackThread = 0;
        bool fFree = m_fFreeWhenCallbackEnds;
        LeaveCriticalSection(&m_cs);
        if (fFree)
        {
            // The pool lets go of the module once this callback has returned out of it.
            FreeLibraryWhenCallbackReturns(pInstance, m_hModule.Detach());
            return true;
        }
    }

    EnterCriticalSection(&m_cs);
    if (!m_fStopped)
    {
        SetThreadpoolWait(m_hWait.Get(), m_hChanged.Get(), nullptr);
    }
    LeaveCriticalSection(&m_cs);
    return false;
}
