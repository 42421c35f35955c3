#include "service/statesubscription.h"

// Until the notification facility's stand-in is built into the service, no subscription is
// made: the launcher then simply never hears of the backlight.
NTSTATUS StateSubscriptionBegin(PWNF_USER_SUBSCRIPTION *phSubscription, WNF_STATE_NAME stateName,
                                PWNF_USER_CALLBACK pfnCallback, void *pvContext)
{
    *phSubscription = nullptr;
    return static_cast<NTSTATUS>(0xC0000002L); // STATUS_NOT_IMPLEMENTED
}

void StateSubscriptionEnd(PWNF_USER_SUBSCRIPTION hSubscription) {}
