// One HTTPS JSON request in flight, and the three steps OrvexJsonSendRequest is made of:
// send (creates the context and starts the request), the status callback (drives it on the
// platform HTTP client's threads, one notification at a time) and close (drops the
// sender's reference, closes the handles and destroys the context once the request
// handle's closing notification has dropped the other).
#pragma once

#include "inc/handleholder.h"
#include "lib/jsonvalue.h"
#include "lib/orvexjsonclient.h"

#include <windows.h>
#include <winhttp.h>
#include <string>

// Called exactly once per started request with its outcome: S_OK and the root object
// (which then belongs to the callee), or a failure and null. Runs on a platform thread.
typedef void (*PFN_JSON_REQUEST_COMPLETION)(void *pvCompletionContext, HRESULT hr,
                                            JsonValue *pRoot);

// Created and closed by the sender's thread; its status callback runs on the platform HTTP
// client's threads. m_lock guards m_cRef and m_pfnCompletion; the response is touched only
// by the notifications, which the platform delivers one at a time per request.
class JsonRequestContext
{
public:
    ~JsonRequestContext();

    JsonRequestContext(const JsonRequestContext &) = delete;
    JsonRequestContext &operator=(const JsonRequestContext &) = delete;

private:
    friend HRESULT OrvexJsonSend(const JsonRequest *, PFN_JSON_REQUEST_COMPLETION, void *,
                                 JsonRequestContext **);
    friend HRESULT OrvexJsonClose(JsonRequestContext *);
    friend void CALLBACK OrvexJsonStatusCallback(HINTERNET, DWORD_PTR, DWORD, LPVOID, DWORD);

    JsonRequestContext(PFN_JSON_REQUEST_COMPLETION pfnCompletion, void *pvCompletionContext);

    HRESULT Start(const JsonRequest &request);
    HRESULT SetConnectionRequirements();
    void OnHeadersAvailable();
    void OnDataAvailable(DWORD cbAvailable);
    void OnReadComplete(DWORD cbRead);
    void QueryDataAvailable();
    void Finish();
    void Fail(HRESULT hr);
    void ReleaseReference();

    CRITICAL_SECTION m_lock;
    ULONG m_cRef = 1; // the sender's; plus the request handle's once its callback is set
    CKernelHandle m_hClosedEvent;
    PFN_JSON_REQUEST_COMPLETION m_pfnCompletion;
    void *m_pvCompletionContext;
    CWinHttpHandle m_hSession;
    CWinHttpHandle m_hConnection;
    CWinHttpHandle m_hRequest;
    std::string m_strBody; // always empty: requests go without a body
    std::string m_strResponse;
    size_t m_cbBeforeRead = 0; // response length before the read in flight
};

HRESULT OrvexJsonSend(const JsonRequest *pRequest, PFN_JSON_REQUEST_COMPLETION pfnCompletion,
                      void *pvCompletionContext, JsonRequestContext **ppContext);
// S_OK, or E_INVALIDARG for a null context.
HRESULT OrvexJsonClose(JsonRequestContext *pContext);
void CALLBACK OrvexJsonStatusCallback(HINTERNET hInternet, DWORD_PTR dwContext, DWORD dwStatus,
                                      LPVOID pvInformation, DWORD cbInformation);

// Test seam. Wine's HTTP client cannot answer the query of the connection-manager session
// (option 117); a hook set here answers it in its place.
typedef BOOL (*PFN_ORVEXJSON_QUERY_CM_SESSION)(HINTERNET hRequest, DWORD *pdwSession);
void OrvexJsonSetCmSessionQueryHook(PFN_ORVEXJSON_QUERY_CM_SESSION pfnHook);
