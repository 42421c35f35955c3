#include "client/ccollectorclient.h"

static_assert(sizeof(GUID) == sizeof(TELVANE_GUID), "a GUID travels as its 16 bytes");

CCollectorClient::CCollectorClient(DWORD dwTimeoutMs)
    : m_dwTimeoutMs(dwTimeoutMs)
    , m_dwServiceVersion(0)
    , m_fRegistered(false)
    , m_fRequestOpen(false)
{
}

HRESULT CCollectorClient::Connect(const wchar_t *wszPipeName)
{
    // A live connection keeps its state: its registration, and a request awaiting its answer.
    if (m_pipe.IsOpen())
    {
        return HRESULT_FROM_WIN32(ERROR_INVALID_STATE);
    }
    m_fRegistered = false;
    m_fRequestOpen = false;
    return m_pipe.Open(wszPipeName, m_dwTimeoutMs, &m_dwServiceVersion);
}

HRESULT CCollectorClient::Register(const GUID &collectorId)
{
    // The service keeps one registration per connection and closes on a second one.
    if (m_fRegistered || !m_pipe.IsOpen())
    {
        return HRESULT_FROM_WIN32(ERROR_INVALID_STATE);
    }
    TELVANE_REGISTER_COLLECTOR message = {TELVANE_REGISTER_COLLECTOR_OPCODE, {}};
    CopyMemory(&message.CollectorID, &collectorId, sizeof(message.CollectorID));
    HRESULT hr = m_pipe.WriteMessage(&message, sizeof(message), m_dwTimeoutMs);
    m_fRegistered = SUCCEEDED(hr);
    return hr;
}

HRESULT CCollectorClient::WaitForRequest(GUID *pActivityId, GUID *pLogId, DWORD dwTimeoutMs)
{
    if (pActivityId == nullptr || pLogId == nullptr)
    {
        return E_INVALIDARG;
    }
    // The service asks only registered collectors, and never twice before the answer.
    if (!m_fRegistered || m_fRequestOpen)
    {
        return HRESULT_FROM_WIN32(ERROR_INVALID_STATE);
    }
    TELVANE_START_COLLECTION request = {};
    HRESULT hr = m_pipe.ReadExpected(&request, sizeof(request), TELVANE_START_COLLECTION_OPCODE,
                                     dwTimeoutMs);
    if (FAILED(hr))
    {
        return hr;
    }
    CopyMemory(pActivityId, &request.ActivityID, sizeof(*pActivityId));
    CopyMemory(pLogId, &request.LogID, sizeof(*pLogId));
    m_fRequestOpen = true;
    return S_OK;
}

HRESULT CCollectorClient::SendResult(const void *pv, size_t cb)
{
    // Parts sent without a request would be joined to the next result.
    if (!m_fRequestOpen)
    {
        return HRESULT_FROM_WIN32(ERROR_INVALID_STATE);
    }
    TELVANE_COLLECTION_COMPLETE header = {TELVANE_COLLECTION_COMPLETE_OPCODE, 0, 0};
    HRESULT hr =
        m_pipe.WriteParts(&header, sizeof(header), offsetof(TELVANE_COLLECTION_COMPLETE, Complete),
                          offsetof(TELVANE_COLLECTION_COMPLETE, Length), 0, TELVANE_MAX_RESULT_PART,
                          pv, cb, m_dwTimeoutMs);
    // Arguments the parts were never sent for leave the request open for a proper answer.
    if (hr != E_INVALIDARG && hr != HRESULT_FROM_WIN32(ERROR_MESSAGE_EXCEEDS_MAX_SIZE))
    {
        m_fRequestOpen = false;
    }
    return hr;
}

HRESULT CCollectorClient::BreakPipe()
{
    if (!m_pipe.IsOpen())
    {
        return HRESULT_FROM_WIN32(ERROR_INVALID_STATE);
    }
    HRESULT hr = m_pipe.WriteFinal(TELVANE_BREAK_PIPE_OPCODE, m_dwTimeoutMs);
    Close();
    return hr;
}

void CCollectorClient::Close()
{
    m_pipe.Close();
    m_fRegistered = false;
    m_fRequestOpen = false;
}
