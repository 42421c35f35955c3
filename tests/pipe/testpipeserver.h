// The service side of one connection, made of the real AsyncPipe, codec and reassembly, for
// the client-library and tool tests: it sends the version message on connection, decodes
// every message of its pipe, joins parts into items and closes the pipe on a fault, a stop or
// a break request. It keeps no protocol state: what it received is for the test to judge.
// Its sink calls run on the pipe's handlers; the test thread reads under the sink's lock.
#pragma once

#include "servicelib/cpipereassembly.h"
#include "servicelib/pipecodec.h"
#include "tests/pipe/pipetestsupport.h"

#include <string>
#include <vector>

namespace pipetest
{
struct ReceivedItem
{
    TELVANE_GUID id; // the event ID of the last part; zero for results
    std::vector<BYTE> vb;
};

class CTestPipeServer : public CRecordingSink
{
public:
    explicit CTestPipeServer(bool fCollector);

    // A new server listening on the name.
    static CTestPipeServer *Start(bool fCollector, const std::wstring &name);
    void Listen(const std::wstring &name);
    void SendStartCollection(const GUID &activityId, const GUID &logId);
    // Closes the pipe, waits until the pipe is done with this object and drops the pipe.
    void Shutdown();
    // Shutdown, then drops the creator's reference.
    void Finish();

    bool WaitForItems(size_t c, DWORD dwTimeoutMs = c_dwWaitMs);
    bool WaitForRegistration(DWORD dwTimeoutMs = c_dwWaitMs);
    bool WaitForEnd(DWORD dwTimeoutMs = c_dwWaitMs); // a stop or break request arrived

    std::vector<ReceivedItem> Items() const;
    std::vector<std::string> Faults() const;
    int VersionReplies() const;
    TELVANE_GUID ActivityID() const;
    TELVANE_GUID LogID() const;
    TELVANE_GUID CollectorID() const;

protected:
    ~CTestPipeServer() override;
    void OnConnected() override;
    void OnMessage(const BYTE *pb, ULONG cb) override;

private:
    void Fault(const char *szFault);

    bool m_fCollector;
    AsyncPipe *m_pPipe;
    CPipeReassembly m_reassembly;
    std::vector<ReceivedItem> m_rgItems;
    std::vector<std::string> m_rgFaults;
    int m_cVersionReplies;
    bool m_fRegistered;
    bool m_fEnded;
    TELVANE_GUID m_activityId;
    TELVANE_GUID m_logId;
    TELVANE_GUID m_collectorId;
};
} // namespace pipetest
