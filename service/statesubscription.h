// The backlight subscription of the service, in one place: the state-notification facility's
// subscribe and unsubscribe calls and the state's name. Any thread.
#pragma once

#include "platform/statenotify/statenotify.h"

// The display backlight's state name.
const WNF_STATE_NAME c_ullBacklightStateName = 0x41C61D22A3BC3875ull;

// Subscribes pfnCallback with its context to the state from its current value on;
// *phSubscription is the handle, cleared when the subscription fails. Returns the status.
NTSTATUS StateSubscriptionBegin(PWNF_USER_SUBSCRIPTION *phSubscription, WNF_STATE_NAME stateName,
                                PWNF_USER_CALLBACK pfnCallback, void *pvContext);
// Ends a subscription and waits for its callbacks (but not for the one it is called from).
void StateSubscriptionEnd(PWNF_USER_SUBSCRIPTION hSubscription);
