// A DLL that subscribes to a state, as the service DLL does, for the tests of what a
// subscription does to the lifetime of the module its callback lives in. One subscription at
// a time; the test drives it from its main thread.
#include "platform/statenotify/statenotify.h"

namespace
{
struct SelfEnding
{
    PWNF_USER_SUBSCRIPTION pSubscription;
    HANDLE hUnsubscribed;
    HANDLE hGo;
};
SelfEnding s_selfEnding;
PWNF_USER_SUBSCRIPTION s_pPlain = nullptr;

// Ends its own subscription, says so, and then stays inside the DLL's code until told to go.
NTSTATUS NTAPI SelfEndingCallback(WNF_STATE_NAME, WNF_CHANGE_STAMP, PWNF_TYPE_ID, PVOID pvContext,
                                  const VOID *, ULONG)
{
    SelfEnding *p = static_cast<SelfEnding *>(pvContext);
    RtlUnsubscribeWnfNotificationWaitForCompletion(p->pSubscription);
    SetEvent(p->hUnsubscribed);
    WaitForSingleObject(p->hGo, INFINITE);
    return STATUS_SUCCESS;
}

NTSTATUS NTAPI PlainCallback(WNF_STATE_NAME, WNF_CHANGE_STAMP, PWNF_TYPE_ID, PVOID, const VOID *,
                             ULONG)
{
    return STATUS_SUCCESS;
}
} // namespace

extern "C" __declspec(dllexport) NTSTATUS
    SubscribeSelfEnding(WNF_STATE_NAME stateName, HANDLE hUnsubscribed, HANDLE hGo)
{
    s_selfEnding.hUnsubscribed = hUnsubscribed;
    s_selfEnding.hGo = hGo;
    return RtlSubscribeWnfStateChangeNotification(&s_selfEnding.pSubscription, stateName, 0,
                                                  SelfEndingCallback, &s_selfEnding, nullptr, 0, 0);
}

extern "C" __declspec(dllexport) NTSTATUS SubscribePlain(WNF_STATE_NAME stateName)
{
    return RtlSubscribeWnfStateChangeNotification(&s_pPlain, stateName, 0, PlainCallback, nullptr,
                                                  nullptr, 0, 0);
}

extern "C" __declspec(dllexport) NTSTATUS UnsubscribePlain()
{
    return RtlUnsubscribeWnfNotificationWaitForCompletion(s_pPlain);
}
