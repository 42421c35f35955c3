// An activity client: announces an activity to the service, streams its events, and stops it
// or simply closes. Failures are the HRESULTs listed in cpipeclient.h. Used by one thread at a
// time; owned by its caller.
#pragma once

#include "client/cpipeclient.h"
#include "inc/telvanepipe.h"

class CActivityClient
{
public:
    // dwTimeoutMs limits each call (connect, negotiation, each message).
    explicit CActivityClient(DWORD dwTimeoutMs = c_dwTelvaneClientTimeoutMs);

    // Connects and answers the service's version message.
    HRESULT Connect(const wchar_t *wszPipeName = c_wszTelvaneActivityPipe);
    // Announces the activity; once per connection.
    HRESULT Start(const GUID &activityId, const GUID &logId);
    // Sends one event of any size up to TELVANE_MAX_ITEM, in as many parts as it needs.
    HRESULT SendEvent(const GUID &eventId, const void *pv, size_t cb);
    // Tells the service the activity is over and closes the connection.
    HRESULT Stop();
    // Ends the connection without a stop message; the service sees the activity end as well.
    void Close();

    DWORD ServiceVersion() const { return m_dwServiceVersion; }
    // The raw connection, for callers that need to send something this class will not.
    CPipeClient &Pipe() { return m_pipe; }

private:
    CPipeClient m_pipe;
    DWORD m_dwTimeoutMs;
    DWORD m_dwServiceVersion;
    bool m_fStarted;
};
