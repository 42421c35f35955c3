#include "lib/orvexjsonclient.h"
#include "inc/lasterror.h"
#include "inc/handleholder.h"
#include "lib/jsonrequestcontext.h"

namespace
{
// Where the completion leaves the outcome for the waiting sender; lives on its stack.
struct JsonRequestWaiter
{
    HRESULT hr = S_OK;
    JsonValue *pRoot = nullptr; // owned until handed to the caller
    CKernelHandle hDoneEvent;
};

void OrvexJsonStoreOutcome(void *pvWaiter, HRESULT hr, JsonValue *pRoot)
{
    JsonRequestWaiter *pWaiter = static_cast<JsonRequestWaiter *>(pvWaiter);
    pWaiter->hr = hr;
    pWaiter->pRoot = pRoot;
    SetEvent(pWaiter->hDoneEvent.Get());
}
} // namespace

HRESULT OrvexJsonSendRequest(const JsonRequest *pRequest, JsonValue **ppRoot)
{
    if (pRequest == nullptr || ppRoot == nullptr)
    {
        return E_INVALIDARG;
    }
    JsonRequestWaiter waiter;
    waiter.hDoneEvent.Reset(CreateEventW(nullptr, FALSE, FALSE, nullptr));
    if (!waiter.hDoneEvent)
    {
        return HResultFromLastError();
    }
    JsonRequestContext *pContext = nullptr;
    HRESULT hr = OrvexJsonSend(pRequest, OrvexJsonStoreOutcome, &waiter, &pContext);
    if (FAILED(hr))
    {
        // The send step has already closed what it started.
        return hr;
    }
    HANDLE hDone = waiter.hDoneEvent.Get();
    if (WaitForMultipleObjects(1, &hDone, FALSE, INFINITE) != WAIT_OBJECT_0)
    {
        hr = c_hrOrvexJsonWaitFailed;
    }
    else if (FAILED(waiter.hr))
    {
        hr = waiter.hr;
    }
    else
    {
        *ppRoot = waiter.pRoot;
        waiter.pRoot = nullptr;
        hr = S_OK;
    }
    OrvexJsonClose(pContext);
    // A root still held here belongs to nobody else: the close has ended every notification.
    delete waiter.pRoot;
    return hr;
}
