#include "client/cactivityclient.h"

static_assert(sizeof(GUID) == sizeof(TELVANE_GUID), "a GUID travels as its 16 bytes");

CActivityClient::CActivityClient(DWORD dwTimeoutMs)
    : m_dwTimeoutMs(dwTimeoutMs)
    , m_dwServiceVersion(0)
    , m_fStarted(false)
{
}

HRESULT CActivityClient::Connect(const wchar_t *wszPipeName)
{
    // A live connection keeps its state: forgetting the start would allow a second one.
    if (m_pipe.IsOpen())
    {
        return HRESULT_FROM_WIN32(ERROR_INVALID_STATE);
    }
    m_fStarted = false;
    return m_pipe.Open(wszPipeName, m_dwTimeoutMs, &m_dwServiceVersion);
}

HRESULT CActivityClient::Start(const GUID &activityId, const GUID &logId)
{
    // A second start is a fault the service answers by closing the connection.
    if (m_fStarted || !m_pipe.IsOpen())
    {
        return HRESULT_FROM_WIN32(ERROR_INVALID_STATE);
    }
    TELVANE_START_ACTIVITY message = {TELVANE_START_ACTIVITY_OPCODE, {}, {}};
    CopyMemory(&message.ActivityID, &activityId, sizeof(message.ActivityID));
    CopyMemory(&message.LogID, &logId, sizeof(message.LogID));
    HRESULT hr = m_pipe.WriteMessage(&message, sizeof(message), m_dwTimeoutMs);
    m_fStarted = SUCCEEDED(hr);
    return hr;
}

HRESULT CActivityClient::SendEvent(const GUID &eventId, const void *pv, size_t cb)
{
    // The service drops events that come before the start message.
    if (!m_fStarted)
    {
        return HRESULT_FROM_WIN32(ERROR_INVALID_STATE);
    }
    // Every part carries the event ID; the service names the event after the last one's.
    TELVANE_ACTIVITY_EVENT header = {TELVANE_ACTIVITY_EVENT_OPCODE, {}, 0, 0};
    CopyMemory(&header.EventID, &eventId, sizeof(header.EventID));
    return m_pipe.WriteParts(&header, sizeof(header), offsetof(TELVANE_ACTIVITY_EVENT, Complete),
                             offsetof(TELVANE_ACTIVITY_EVENT, Length),
                             TELVANE_ACTIVITY_EVENT_TRAILER, TELVANE_MAX_EVENT_PART, pv, cb,
                             m_dwTimeoutMs);
}

HRESULT CActivityClient::Stop()
{
    if (!m_pipe.IsOpen())
    {
        return HRESULT_FROM_WIN32(ERROR_INVALID_STATE);
    }
    m_fStarted = false;
    return m_pipe.WriteFinal(TELVANE_STOP_ACTIVITY_OPCODE, m_dwTimeoutMs);
}

void CActivityClient::Close()
{
    m_pipe.Close();
    m_fStarted = false;
}
