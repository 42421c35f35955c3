#include "platform/statenotify/statenotifypublish.h"

#include "platform/statenotify/statestore.h"

HRESULT StateNotifyPublish(WNF_STATE_NAME stateName, const void *pvData, ULONG cbData,
                           WNF_CHANGE_STAMP *pStamp)
{
    // Apart: HRESULT_FROM_WIN32 may evaluate its argument twice.
    LONG lError = StateStoreWrite(stateName, pvData, cbData, pStamp);
    return HRESULT_FROM_WIN32(lError);
}
