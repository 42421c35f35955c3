#include "lib/jsonrequestcontext.h"
#include "inc/lasterror.h"
#include "lib/devicecertificate.h"
#include "lib/jsonreader.h"
#include "lib/orvexjsontrace.h"
#include "platform/connectionmanager/connectionmanager.h"

#include <new>

namespace
{
// Notifications the callback acts on: every completion, plus handle creation and closing.
const DWORD c_dwNotificationMask = 0x7E0C00;
const DWORD c_dwOptionDecompression = 118;
const DWORD c_dwDecompressionGzipDeflate = 3;
const DWORD c_dwOptionCmSession = 117;
const DWORD c_dwOptionSecurityFlags = 31;
const DWORD c_dwIgnoreNameAndDate = 0x3000;
const DWORD c_dwOptionClientCertificate = 47;
// The requirements the connection manager gets for the request's session, in this order.
const DWORD c_rgdwCmRequirements[5] = {2, 1, 3, 2, 0};

const wchar_t c_wszJsonHeaders[] = L"Content-Type: application/json";
const wchar_t c_wszGzipHeaders[] =
    L"Content-Type: application/x-gzip-compressed; application/json\r\nAccept-Encoding: gzip";

PFN_ORVEXJSON_QUERY_CM_SESSION volatile s_pfnQueryCmSessionHook = nullptr;

// The failing call's HRESULT, after writing its event.
HRESULT OrvexJsonTraceLastError(const EVENT_DESCRIPTOR &descriptor)
{
    HRESULT hr = HResultFromLastError();
    OrvexJsonTraceCode(descriptor, static_cast<ULONG>(hr));
    return hr;
}

BOOL OrvexJsonQueryCmSession(HINTERNET hRequest, DWORD *pdwSession)
{
    PFN_ORVEXJSON_QUERY_CM_SESSION pfnHook = s_pfnQueryCmSessionHook;
    if (pfnHook != nullptr)
    {
        return pfnHook(hRequest, pdwSession);
    }
    DWORD cb = sizeof(*pdwSession);
    return WinHttpQueryOption(hRequest, c_dwOptionCmSession, pdwSession, &cb);
}
} // namespace

JsonRequestContext::JsonRequestContext(PFN_JSON_REQUEST_COMPLETION pfnCompletion,
                                       void *pvCompletionContext)
    : m_pfnCompletion(pfnCompletion)
    , m_pvCompletionContext(pvCompletionContext)
{
    InitializeCriticalSection(&m_lock);
    OrvexJsonTraceAddContext();
}

JsonRequestContext::~JsonRequestContext()
{
    m_hRequest.Close();
    m_hConnection.Close();
    m_hSession.Close();
    m_hClosedEvent.Close();
    DeleteCriticalSection(&m_lock);
    OrvexJsonTraceReleaseContext();
}

HRESULT OrvexJsonSend(const JsonRequest *pRequest, PFN_JSON_REQUEST_COMPLETION pfnCompletion,
                      void *pvCompletionContext, JsonRequestContext **ppContext)
{
    if (pRequest == nullptr || pfnCompletion == nullptr || ppContext == nullptr)
    {
        return E_INVALIDARG;
    }
    JsonRequestContext *pContext =
        new (std::nothrow) JsonRequestContext(pfnCompletion, pvCompletionContext);
    if (pContext == nullptr)
    {
        return E_OUTOFMEMORY;
    }
    pContext->m_hClosedEvent.Reset(CreateEventW(nullptr, FALSE, FALSE, nullptr));
    if (!pContext->m_hClosedEvent)
    {
        HRESULT hr = HResultFromLastError();
        delete pContext;
        return hr;
    }
    HRESULT hr;
    try
    {
        hr = pContext->Start(*pRequest);
    }
    catch (const std::bad_alloc &)
    {
        hr = E_OUTOFMEMORY;
    }
    if (FAILED(hr))
    {
        if (pContext->m_cRef > 1)
        {
            // The request handle's callback is set: its closing notification may still come,
            // so only the close protocol may end the context.
            OrvexJsonClose(pContext);
        }
        else
        {
            delete pContext;
        }
        return hr;
    }
    *ppContext = pContext;
    return S_OK;
}

HRESULT JsonRequestContext::Start(const JsonRequest &request)
{
    m_hSession.Reset(WinHttpOpen(request.userAgent.c_str(), WINHTTP_ACCESS_TYPE_DEFAULT_PROXY,
                                 WINHTTP_NO_PROXY_NAME, WINHTTP_NO_PROXY_BYPASS,
                                 WINHTTP_FLAG_ASYNC));
    if (!m_hSession)
    {
        return OrvexJsonTraceLastError(OrvexJsonEvent_OpenSession);
    }

    URL_COMPONENTS components = {};
    components.dwStructSize = sizeof(components);
    components.dwHostNameLength = static_cast<DWORD>(-1);
    components.dwUrlPathLength = static_cast<DWORD>(-1);
    if (!WinHttpCrackUrl(request.url.c_str(), static_cast<DWORD>(request.url.size()), 0,
                         &components))
    {
        return OrvexJsonTraceLastError(OrvexJsonEvent_CrackUrl);
    }
    // The cracked parts point into the URL and are not terminated.
    std::wstring wstrHost(components.lpszHostName, components.dwHostNameLength);
    std::wstring wstrPath(components.lpszUrlPath, components.dwUrlPathLength);
    m_hConnection.Reset(WinHttpConnect(m_hSession.Get(), wstrHost.c_str(), components.nPort, 0));
    if (!m_hConnection)
    {
        return OrvexJsonTraceLastError(OrvexJsonEvent_Connect);
    }

    if (request.gzip)
    {
        // On the session, which passes it to its requests: the option belongs to session and
        // request handles, and a connection handle refuses it (12018, incorrect handle
        // type), which failed every such request before it was sent.
        DWORD dwDecompression = c_dwDecompressionGzipDeflate;
        if (!WinHttpSetOption(m_hSession.Get(), c_dwOptionDecompression, &dwDecompression,
                              sizeof(dwDecompression)))
        {
            return OrvexJsonTraceLastError(OrvexJsonEvent_Decompression);
        }
    }

    // Secure whatever the scheme: an http URL still goes over TLS on its cracked port.
    m_hRequest.Reset(WinHttpOpenRequest(m_hConnection.Get(), request.verb.c_str(), wstrPath.c_str(),
                                        nullptr, WINHTTP_NO_REFERER, WINHTTP_DEFAULT_ACCEPT_TYPES,
                                        WINHTTP_FLAG_SECURE));
    if (!m_hRequest)
    {
        return OrvexJsonTraceLastError(OrvexJsonEvent_OpenRequest);
    }

    if (!request.skipConnectionRequirements)
    {
        HRESULT hr = SetConnectionRequirements();
        if (FAILED(hr))
        {
            return hr;
        }
    }

    // The context value goes on the handle together with the callback, not only with the
    // send: a request that fails before it is sent still gets its closing notification with
    // the context, which the close protocol waits for.
    DWORD_PTR dwContext = reinterpret_cast<DWORD_PTR>(this);
    if (!WinHttpSetOption(m_hRequest.Get(), WINHTTP_OPTION_CONTEXT_VALUE, &dwContext,
                          sizeof(dwContext)))
    {
        return OrvexJsonTraceLastError(OrvexJsonEvent_StatusCallback);
    }
    if (WinHttpSetStatusCallback(m_hRequest.Get(), OrvexJsonStatusCallback, c_dwNotificationMask,
                                 0) == WINHTTP_INVALID_STATUS_CALLBACK)
    {
        return OrvexJsonTraceLastError(OrvexJsonEvent_StatusCallback);
    }
    EnterCriticalSection(&m_lock);
    m_cRef++;
    LeaveCriticalSection(&m_lock);

    std::wstring wstrHeaders = request.gzip ? c_wszGzipHeaders : c_wszJsonHeaders;
    if (!request.extraHeaders.empty())
    {
        wstrHeaders += L"\r\n";
        wstrHeaders += request.extraHeaders;
    }
    if (!WinHttpAddRequestHeaders(m_hRequest.Get(), wstrHeaders.c_str(), static_cast<DWORD>(-1),
                                  WINHTTP_ADDREQ_FLAG_ADD_IF_NEW))
    {
        return OrvexJsonTraceLastError(OrvexJsonEvent_AddHeaders);
    }

    if (request.ignoreCertErrors)
    {
        DWORD dwFlags = c_dwIgnoreNameAndDate;
        if (!WinHttpSetOption(m_hRequest.Get(), c_dwOptionSecurityFlags, &dwFlags, sizeof(dwFlags)))
        {
            return OrvexJsonTraceLastError(OrvexJsonEvent_SecurityFlags);
        }
    }

    PCCERT_CONTEXT pCertificate = nullptr;
    HRESULT hr = DeviceCertificateFind(&pCertificate);
    if (FAILED(hr))
    {
        return hr;
    }
    BOOL fSet = WinHttpSetOption(m_hRequest.Get(), c_dwOptionClientCertificate,
                                 const_cast<CERT_CONTEXT *>(pCertificate), sizeof(CERT_CONTEXT));
    hr = fSet ? S_OK : OrvexJsonTraceLastError(OrvexJsonEvent_ClientCertificate);
    CertFreeCertificateContext(pCertificate);
    if (FAILED(hr))
    {
        return hr;
    }

    OrvexJsonTraceMark(OrvexJsonEvent_Sending);
    if (!WinHttpSendRequest(m_hRequest.Get(), WINHTTP_NO_ADDITIONAL_HEADERS, 0,
                            WINHTTP_NO_REQUEST_DATA, 0, 0, dwContext))
    {
        return OrvexJsonTraceLastError(OrvexJsonEvent_SendRequest);
    }
    return S_OK;
}

HRESULT JsonRequestContext::SetConnectionRequirements()
{
    DWORD dwSession = 0;
    if (!OrvexJsonQueryCmSession(m_hRequest.Get(), &dwSession))
    {
        return OrvexJsonTraceLastError(OrvexJsonEvent_QueryCmSession);
    }
    if (!CmApiInit())
    {
        OrvexJsonTraceMark(OrvexJsonEvent_CmApiInit);
        return E_FAIL;
    }
    DWORD dwResult = CmSetRequirements(dwSession, c_rgdwCmRequirements,
                                       static_cast<DWORD>(sizeof(c_rgdwCmRequirements)));
    CmCloseSession(dwSession);
    CmApiDeinit();
    if (dwResult != 0)
    {
        OrvexJsonTraceCode(OrvexJsonEvent_CmSetRequirements, dwResult);
        return E_FAIL;
    }
    return S_OK;
}

void CALLBACK OrvexJsonStatusCallback(HINTERNET hInternet, DWORD_PTR dwContext, DWORD dwStatus,
                                      LPVOID pvInformation, DWORD cbInformation)
{
    JsonRequestContext *pContext = reinterpret_cast<JsonRequestContext *>(dwContext);
    if (pContext == nullptr)
    {
        return;
    }
    try
    {
        switch (dwStatus)
        {
        case WINHTTP_CALLBACK_STATUS_HANDLE_CLOSING:
            pContext->ReleaseReference();
            break;
        case WINHTTP_CALLBACK_STATUS_SENDREQUEST_COMPLETE:
            if (!WinHttpReceiveResponse(hInternet, nullptr))
            {
                pContext->Fail(OrvexJsonTraceLastError(OrvexJsonEvent_ReceiveResponse));
            }
            break;
        case WINHTTP_CALLBACK_STATUS_HEADERS_AVAILABLE:
            pContext->OnHeadersAvailable();
            break;
        case WINHTTP_CALLBACK_STATUS_DATA_AVAILABLE:
            pContext->OnDataAvailable(
                pvInformation != nullptr ? *static_cast<const DWORD *>(pvInformation) : 0);
            break;
        case WINHTTP_CALLBACK_STATUS_READ_COMPLETE:
            pContext->OnReadComplete(cbInformation);
            break;
        case WINHTTP_CALLBACK_STATUS_REQUEST_ERROR: {
            const WINHTTP_ASYNC_RESULT *pResult =
                static_cast<const WINHTTP_ASYNC_RESULT *>(pvInformation);
            if (pResult != nullptr && pResult->dwError != ERROR_SUCCESS)
            {
                OrvexJsonTraceCode(OrvexJsonEvent_RequestError, pResult->dwError);
                pContext->Fail(HRESULT_FROM_WIN32(pResult->dwError));
            }
            break;
        }
        case WINHTTP_CALLBACK_STATUS_SECURE_FAILURE:
            OrvexJsonTraceCode(OrvexJsonEvent_SecureFailure,
                               pvInformation != nullptr ? *static_cast<const DWORD *>(pvInformation)
                                                        : 0);
            pContext->Fail(c_hrOrvexJsonTlsFailure);
            break;
        default:
            break;
        }
    }
    catch (const std::bad_alloc &)
    {
        // A platform thread must not see the exception; the request fails instead.
        pContext->Fail(E_OUTOFMEMORY);
    }
}

void JsonRequestContext::OnHeadersAvailable()
{
    DWORD dwStatusCode = 0;
    DWORD cb = sizeof(dwStatusCode);
    if (!WinHttpQueryHeaders(
            m_hRequest.Get(), WINHTTP_QUERY_STATUS_CODE | WINHTTP_QUERY_FLAG_NUMBER,
            WINHTTP_HEADER_NAME_BY_INDEX, &dwStatusCode, &cb, WINHTTP_NO_HEADER_INDEX))
    {
        Fail(OrvexJsonTraceLastError(OrvexJsonEvent_QueryStatus));
        return;
    }
    if (dwStatusCode != HTTP_STATUS_OK)
    {
        OrvexJsonTraceCode(OrvexJsonEvent_HttpStatus, dwStatusCode);
        Fail(c_hrOrvexJsonHttpStatus);
        return;
    }
    QueryDataAvailable();
}

void JsonRequestContext::QueryDataAvailable()
{
    if (!WinHttpQueryDataAvailable(m_hRequest.Get(), nullptr))
    {
        Fail(OrvexJsonTraceLastError(OrvexJsonEvent_QueryData));
    }
}

void JsonRequestContext::OnDataAvailable(DWORD cbAvailable)
{
    if (cbAvailable == 0)
    {
        Finish();
        return;
    }
    ULONGLONG cbTotal = static_cast<ULONGLONG>(m_strResponse.size()) + cbAvailable;
    if (cbTotal > c_cbOrvexJsonMaxBody)
    {
        OrvexJsonTraceCode(OrvexJsonEvent_BodyTooLarge,
                           cbTotal > 0xFFFFFFFFull ? 0xFFFFFFFFul : static_cast<ULONG>(cbTotal));
        Fail(c_hrOrvexJsonBodyTooLarge);
        return;
    }
    m_cbBeforeRead = m_strResponse.size();
    m_strResponse.resize(static_cast<size_t>(cbTotal));
    if (!WinHttpReadData(m_hRequest.Get(), &m_strResponse[m_cbBeforeRead], cbAvailable, nullptr))
    {
        m_strResponse.resize(m_cbBeforeRead);
        Fail(OrvexJsonTraceLastError(OrvexJsonEvent_ReadData));
    }
}

void JsonRequestContext::OnReadComplete(DWORD cbRead)
{
    // A read may bring less than was announced: keep only what arrived, so no gap of
    // zero bytes ends up inside the body.
    size_t cbKept = m_cbBeforeRead + cbRead;
    if (cbKept < m_strResponse.size())
    {
        m_strResponse.resize(cbKept);
    }
    if (cbRead == 0)
    {
        Finish();
        return;
    }
    QueryDataAvailable();
}

void JsonRequestContext::Finish()
{
    if (m_strResponse.empty())
    {
        OrvexJsonTraceMark(OrvexJsonEvent_EmptyBody);
        Fail(c_hrOrvexJsonEmptyBody);
        return;
    }
    OrvexJsonTraceMark(OrvexJsonEvent_BodyComplete);
    OrvexJsonTraceText(OrvexJsonEvent_Body, m_strResponse.c_str());
    const char *psz = m_strResponse.c_str();
    while (*psz == ' ' || *psz == '\t' || *psz == '\n' || *psz == '\r')
    {
        psz++;
    }
    JsonValue *pRoot = JsonReader::FromJsonString(psz);
    if (pRoot->Type() != JsonNodeType::Object)
    {
        OrvexJsonTraceMark(OrvexJsonEvent_NotObject);
        delete pRoot;
        Fail(c_hrOrvexJsonNotObject);
        return;
    }
    OrvexJsonTraceMark(OrvexJsonEvent_IsObject);
    EnterCriticalSection(&m_lock);
    PFN_JSON_REQUEST_COMPLETION pfnCompletion = m_pfnCompletion;
    m_pfnCompletion = nullptr;
    LeaveCriticalSection(&m_lock);
    if (pfnCompletion != nullptr)
    {
        pfnCompletion(m_pvCompletionContext, S_OK, pRoot);
    }
    else
    {
        delete pRoot;
    }
}

void JsonRequestContext::Fail(HRESULT hr)
{
    OrvexJsonTraceMark(OrvexJsonEvent_Failing);
    EnterCriticalSection(&m_lock);
    PFN_JSON_REQUEST_COMPLETION pfnCompletion = m_pfnCompletion;
    m_pfnCompletion = nullptr;
    LeaveCriticalSection(&m_lock);
    if (pfnCompletion != nullptr)
    {
        pfnCompletion(m_pvCompletionContext, hr, nullptr);
    }
}

void JsonRequestContext::ReleaseReference()
{
    EnterCriticalSection(&m_lock);
    bool fLast = --m_cRef == 0;
    LeaveCriticalSection(&m_lock);
    if (fLast)
    {
        SetEvent(m_hClosedEvent.Get());
    }
}

HRESULT OrvexJsonClose(JsonRequestContext *pContext)
{
    if (pContext == nullptr)
    {
        return E_INVALIDARG;
    }
    OrvexJsonTraceMark(OrvexJsonEvent_Closing);
    pContext->ReleaseReference();
    pContext->m_hRequest.Close();
    pContext->m_hConnection.Close();
    pContext->m_hSession.Close();
    WaitForSingleObject(pContext->m_hClosedEvent.Get(), INFINITE);
    delete pContext;
    return S_OK;
}

void OrvexJsonSetCmSessionQueryHook(PFN_ORVEXJSON_QUERY_CM_SESSION pfnHook)
{
    s_pfnQueryCmSessionHook = pfnHook;
}
