// One subscription to a state's changes. Created and ended by the facility's subscribe and
// unsubscribe calls on the subscriber's threads; its change handler runs on a thread-pool
// thread, one run at a time (the wait is armed again only when a run ends). Owned by the
// subscriber's handle; freed by the unsubscribe call, or by the last callback when the
// subscriber unsubscribed from inside it.
#pragma once

#include "inc/handleholder.h"
#include "platform/statenotify/statenotify.h"

#include <windows.h>

class CWnfSubscription
{
public:
    CWnfSubscription(WNF_STATE_NAME stateName, WNF_CHANGE_STAMP stampSeen,
                     PWNF_USER_CALLBACK pfnCallback, PVOID pvContext, PCWNF_TYPE_ID pTypeId);
    ~CWnfSubscription();

    CWnfSubscription(const CWnfSubscription &) = delete;
    CWnfSubscription &operator=(const CWnfSubscription &) = delete;

    // Opens the state's key, starts watching it and schedules a first look at its value.
    NTSTATUS Start();
    // Returns true when the caller may free the subscription now; false when the caller is
    // this subscription's own callback, whose end frees it.
    bool Stop();

private:
    static VOID CALLBACK WaitCallback(PTP_CALLBACK_INSTANCE pInstance, PVOID pvContext,
                                      PTP_WAIT pWait, TP_WAIT_RESULT waitResult);
    // Delivers what changed; returns true when the subscription must be freed now.
    bool OnChanged(PTP_CALLBACK_INSTANCE pInstance);
    LONG WatchKey();

    const WNF_STATE_NAME m_stateName;
    WNF_CHANGE_STAMP m_stampSeen;
    const PWNF_USER_CALLBACK m_pfnCallback;
    const PVOID m_pvContext;
    WNF_TYPE_ID m_typeId;
    const bool m_fHasTypeId;

    CRITICAL_SECTION m_cs;        // guards the three fields below
    bool m_fStopped;              // no callback may start any more
    bool m_fFreeWhenCallbackEnds; // stopped from inside its own callback
    DWORD m_dwCallbackThread;     // thread inside the subscriber's callback, or 0

    // The module the callback code lives in (this one), pinned while the subscription lives:
    // a subscriber may unload it as soon as its unsubscribe returns, even when that was
    // inside the callback, which still has to return through this code.
    CModuleHandle m_hModule;
    CRegKeyHandle m_hKey;
    CKernelHandle m_hChanged; // auto-reset; set by the registry on a change, and by Start
    CThreadpoolWaitHandle m_hWait;
};
