#include "service/statesubscription.h"

NTSTATUS StateSubscriptionBegin(PWNF_USER_SUBSCRIPTION *phSubscription, WNF_STATE_NAME stateName,
                                PWNF_USER_CALLBACK pfnCallback, void *pvContext)
{
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
    RtlUnsubscribeWnfNotificationWaitForCompletion(hSubscription);
}
