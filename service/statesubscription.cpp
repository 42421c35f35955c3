#include "service/statesubscription.h"

NTSTATUS StateSubscriptionBegin(PWNF_USER_SUBSCRIPTION *phSubscription, WNF_STATE_NAME stateName,
                                PWNF_USER_CALLBACK pfnCallback, void *pvContext)
{
    *phSubscription = nullptr;
    NTSTATUS status = RtlSubscribeWnfStateChangeNotification(phSubscription, stateName, 0,
                                                             pfnCallback, pvContext, nullptr, 0, 0);
    if (!NT_SUCCESS(status))
    {
        *phSubscription = nullptr;
    }
    return status;
}

void StateSubscriptionEnd(PWNF_USER_SUBSCRIPTION hSubscription)
{
    // From inside the subscription's own callback the facility does not wait for it.
    RtlUnsubscribeWnfNotificationWaitForCompletion(hSubscription);
}
