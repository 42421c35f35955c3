// A collector client: registers with the service under a collector ID, waits for its
// start-collection requests and answers each with a result. Failures are the HRESULTs listed
// in cpipeclient.h. Used by one thread at a time; owned by its caller.
#pragma once

#include "client/cpipeclient.h"
#include "inc/telvanepipe.h"

class CCollectorClient
{
public:
    // dwTimeoutMs limits each call except WaitForRequest, which takes its own limit.
    explicit CCollectorClient(DWORD dwTimeoutMs = c_dwTelvaneClientTimeoutMs);

    // Connects and answers the service's version message.
    HRESULT Connect(const wchar_t *wszPipeName = c_wszTelvaneCollectorPipe);
    // Registers under the collector ID; once per connection.
    HRESULT Register(const GUID &collectorId);
    // Waits for the next start-collection request and returns the IDs of the operation that
    // asks. Running out of time leaves the connection usable.
    HRESULT WaitForRequest(GUID *pActivityId, GUID *pLogId, DWORD dwTimeoutMs);
    // Answers the request taken last with a result of any size up to TELVANE_MAX_ITEM, in as
    // many parts as it needs.
    HRESULT SendResult(const void *pv, size_t cb);
    // Asks the service to end the connection, then closes it.
    HRESULT BreakPipe();
    void Close();

    DWORD ServiceVersion() const { return m_dwServiceVersion; }
    CPipeClient &Pipe() { return m_pipe; }

private:
    CPipeClient m_pipe;
    DWORD m_dwTimeoutMs;
    DWORD m_dwServiceVersion;
    bool m_fRegistered;
    bool m_fRequestOpen;
};
