// Publishing a state value of the state-notification stand-in: what the phone's own
// components do on the device, and what telvanectl and the tests do here. May be called
// from any thread of any process of the machine (or Wine prefix).
#pragma once

#include "platform/statenotify/statenotify.h"

#include <windows.h>

// Replaces the state's data (at most WNF_STATE_MAX_DATA_SIZE bytes; none is allowed) and
// raises its change stamp by one, which every subscriber of the state then sees. The new
// stamp goes to *pStamp when it is not null. Returns S_OK or the failure as an HRESULT.
HRESULT StateNotifyPublish(WNF_STATE_NAME stateName, const void *pvData, ULONG cbData,
                           WNF_CHANGE_STAMP *pStamp);
