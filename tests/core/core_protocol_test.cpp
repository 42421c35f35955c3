// Every client fault of the wire protocol ends only that client's connection, with its trace;
// messages a connection's state does not accept yet are dropped before any size check; and a
// client that connects but never identifies itself keeps nobody else out.
#include "tests/core/coretestsupport.h"
#include "servicelib/pipecodec.h"

#include <cstring>

using namespace coretest;

namespace
{
typedef std::vector<BYTE> Message;

void PutU32(Message &m, size_t ib, uint32_t ul)
{
    if (m.size() < ib + 4)
    {
        m.resize(ib + 4);
    }
    PipeCodecWriteU32(m.data() + ib, ul);
}

void PutGuid(Message &m, size_t ib, const GUID &guid)
{
    if (m.size() < ib + sizeof(guid))
    {
        m.resize(ib + sizeof(guid));
    }
    std::memcpy(m.data() + ib, &guid, sizeof(guid));
}

Message Opcode(uint32_t ulOpcode, size_t cb = 4)
{
    Message m(cb);
    PutU32(m, 0, ulOpcode);
    m.resize(cb);
    return m;
}

Message StartMessage(const GUID &activityId, const GUID &logId, size_t cb = 36)
{
    Message m = Opcode(TELVANE_START_ACTIVITY_OPCODE, 36);
    PutGuid(m, 4, activityId);
    PutGuid(m, 20, logId);
    m.resize(cb);
    return m;
}

// An event part: header, payload, trailer; cb overrides the message's length.
Message EventPart(const GUID &eventId, bool fComplete, const std::string &payload,
                  size_t cb = SIZE_MAX)
{
    Message m = Opcode(TELVANE_ACTIVITY_EVENT_OPCODE, 32 + payload.size());
    PutGuid(m, 4, eventId);
    PutU32(m, 20, fComplete ? 1 : 0);
    PutU32(m, 24, static_cast<uint32_t>(payload.size()));
    std::memcpy(m.data() + 28, payload.data(), payload.size());
    if (cb != SIZE_MAX)
    {
        m.resize(cb);
    }
    return m;
}

Message Register(const GUID &collectorId, size_t cb = 20)
{
    Message m = Opcode(TELVANE_REGISTER_COLLECTOR_OPCODE, 20);
    PutGuid(m, 4, collectorId);
    m.resize(cb);
    return m;
}

Message ResultPart(bool fComplete, uint32_t cbLength, size_t cbPayload)
{
    Message m = Opcode(TELVANE_COLLECTION_COMPLETE_OPCODE, 12 + cbPayload);
    PutU32(m, 4, fComplete ? 1 : 0);
    PutU32(m, 8, cbLength);
    return m;
}

// The service ended the connection: reads find the pipe broken (skipping what it sent first).
bool ClosedByService(CPipeClient &pipe)
{
    for (int i = 0; i < 4; i++)
    {
        BYTE rgb[64];
        DWORD cb = 0;
        HRESULT hr = pipe.ReadMessage(rgb, sizeof(rgb), &cb, c_dwWaitMs);
        if (hr == HRESULT_FROM_WIN32(ERROR_BROKEN_PIPE) ||
            hr == HRESULT_FROM_WIN32(ERROR_PIPE_NOT_CONNECTED) ||
            hr == HRESULT_FROM_WIN32(ERROR_NO_DATA))
        {
            return true;
        }
        if (FAILED(hr))
        {
            return false;
        }
    }
    return false;
}

struct FaultCase
{
    const char *szName;
    bool fCollector;
    bool fNegotiate; // answer the version message before sending
    std::vector<Message> rgMessages;
    const char *szTrace; // the fault's trace; null when the transport ends it silently
};

class CoreProtocol : public CCoreTest
{
protected:
    std::wstring PipeOf(bool fCollector) const
    {
        return fCollector ? m_wstrCollectorPipe : m_wstrActivityPipe;
    }

    // A normal run with a collector still works on both pipes.
    void ExpectServing()
    {
        GUID collectorId = NewGuid();
        CCollectorThread collector(m_wstrCollectorPipe, collectorId, "\"alive\"", 1);
        ASSERT_TRUE(collector.WaitRegistered());
        GUID logId = NewGuid();
        GUID eventId = NewGuid();
        // The collector may register after the start; it is offered to running operations.
        std::unique_ptr<CActivityClient> client = StartActivity(NewGuid(), logId);
        EXPECT_EQ(S_OK, client->SendEvent(eventId, "1", 1));
        ASSERT_TRUE(collector.WaitRequests(1));
        EXPECT_EQ(S_OK, client->Stop());
        std::vector<DeliveredLog> rgLogs = WaitForLogs(logId, 1);
        ASSERT_EQ(1u, rgLogs.size());
        EXPECT_EQ((std::vector<std::string>{"1"}), GroupValues(*rgLogs[0].doc, eventId));
        EXPECT_EQ((std::vector<std::string>{"\"alive\""}),
                  GroupValues(*rgLogs[0].doc, collectorId));
    }
};
} // namespace

TEST_F(CoreProtocol, EveryClientFaultClosesOnlyThatPipe)
{
    GUID a = NewGuid();
    GUID l = NewGuid();
    GUID e = NewGuid();
    GUID k = NewGuid();
    const std::vector<FaultCase> rgCases = {
        {"activity: 3 bytes", false, true, {Message(3)}, c_szPipeFaultActivitySize},
        {"start of 35 bytes",
         false,
         true,
         {StartMessage(a, l, 35)},
         c_szPipeFaultActivityStartSize},
        {"start of 37 bytes",
         false,
         true,
         {StartMessage(a, l, 37)},
         c_szPipeFaultActivityStartSize},
        {"event of 31 bytes",
         false,
         true,
         {StartMessage(a, l), EventPart(e, true, "", 31)},
         c_szPipeFaultActivityEventSize},
        {"event of 41 bytes with length 10",
         false,
         true,
         {StartMessage(a, l), EventPart(e, true, "0123456789", 41)},
         c_szPipeFaultActivityEventSize},
        {"activity opcode 9", false, true, {Opcode(9)}, c_szPipeFaultActivityOpcode},
        {"activity opcode 8", false, true, {Opcode(8)}, c_szPipeFaultActivityOpcode},
        {"second version reply", false, true, {Opcode(1)}, c_szPipeFaultActivityState},
        {"start before the version reply",
         false,
         false,
         {StartMessage(a, l)},
         c_szPipeFaultActivityState},
        {"second start",
         false,
         true,
         {StartMessage(a, l), StartMessage(a, l)},
         c_szPipeFaultActivityState},
        {"activity message over 1200 bytes", false, true, {Opcode(3, 1500)}, nullptr},
        {"collector: 3 bytes", true, true, {Message(3)}, c_szPipeFaultCollectorSize},
        {"register of 19 bytes", true, true, {Register(k, 19)}, c_szPipeFaultCollectorSize},
        {"result part of 11 bytes", true, true, {Opcode(7, 11)}, c_szPipeFaultCollectorSize},
        {"result payload past the message",
         true,
         true,
         {ResultPart(true, 10, 9)},
         c_szPipeFaultCollectorSize},
        {"collector opcode 9", true, true, {Opcode(9)}, c_szPipeFaultCollectorOpcode},
        {"collector opcode 2", true, true, {Opcode(2)}, c_szPipeFaultCollectorOpcode},
        {"second register", true, true, {Register(k), Register(k)}, c_szPipeFaultCollectorState},
        {"second collector version reply", true, true, {Opcode(1)}, c_szPipeFaultCollectorState},
        {"collector message over 1200 bytes", true, true, {Opcode(7, 1500)}, nullptr},
    };
    for (const FaultCase &c : rgCases)
    {
        SCOPED_TRACE(c.szName);
        size_t cBefore = c.szTrace != nullptr ? m_trace.Count(c.szTrace) : 0;
        CPipeClient pipe;
        if (c.fNegotiate)
        {
            ASSERT_EQ(S_OK, pipe.Open(PipeOf(c.fCollector).c_str(), c_dwWaitMs));
        }
        else
        {
            ASSERT_EQ(S_OK, pipe.Connect(PipeOf(c.fCollector).c_str(), c_dwWaitMs));
        }
        for (const Message &m : c.rgMessages)
        {
            // A write after the service closed may fail; the close is what counts.
            pipe.WriteMessage(m.data(), static_cast<DWORD>(m.size()), c_dwWaitMs);
        }
        EXPECT_TRUE(ClosedByService(pipe));
        if (c.szTrace != nullptr)
        {
            EXPECT_TRUE(m_trace.WaitFor(c.szTrace, cBefore + 1));
        }
    }
    ExpectServing();
}

// The state decides first: these are dropped without a fault, whatever their size, and the
// connection goes on.
TEST_F(CoreProtocol, MessagesBeforeTheirStateAreDroppedWithoutAFault)
{
    GUID k = NewGuid();
    GUID e = NewGuid();

    CPipeClient activity;
    ASSERT_EQ(S_OK, activity.Open(m_wstrActivityPipe.c_str(), c_dwWaitMs));
    for (const Message &m : {EventPart(e, true, "7"), EventPart(e, true, "", 31)})
    {
        ASSERT_EQ(S_OK, activity.WriteMessage(m.data(), static_cast<DWORD>(m.size()), c_dwWaitMs));
    }
    GUID logId = NewGuid();
    m_rgLogIds.push_back(logId);
    for (const Message &m : {StartMessage(NewGuid(), logId), EventPart(e, true, "8"), Opcode(4)})
    {
        ASSERT_EQ(S_OK, activity.WriteMessage(m.data(), static_cast<DWORD>(m.size()), c_dwWaitMs));
    }
    std::vector<DeliveredLog> rgLogs = WaitForLogs(logId, 1);
    ASSERT_EQ(1u, rgLogs.size());
    EXPECT_EQ((std::vector<std::string>{"8"}), GroupValues(*rgLogs[0].doc, e));

    CPipeClient collector;
    ASSERT_EQ(S_OK, collector.Connect(m_wstrCollectorPipe.c_str(), c_dwWaitMs));
    for (const Message &m : {Register(k, 3 + 4), Register(k), ResultPart(true, 100, 0)})
    {
        ASSERT_EQ(S_OK, collector.WriteMessage(m.data(), static_cast<DWORD>(m.size()), c_dwWaitMs));
    }
    // Still open: the version exchange and a registration work now.
    TELVANE_VERSION_NEGOTIATE version = {};
    ASSERT_EQ(S_OK, collector.ReadExpected(&version, sizeof(version),
                                           TELVANE_VERSION_NEGOTIATE_OPCODE, c_dwWaitMs));
    Message reply = Opcode(1);
    ASSERT_EQ(S_OK, collector.WriteMessage(reply.data(), 4, c_dwWaitMs));
    Message reg = Register(k);
    ASSERT_EQ(S_OK, collector.WriteMessage(reg.data(), 20, c_dwWaitMs));
    EXPECT_TRUE(m_trace.WaitFor("TelvaneService::ReportConnectedCollector()", 1));

    for (const char *szFault :
         {c_szPipeFaultActivitySize, c_szPipeFaultActivityEventSize, c_szPipeFaultCollectorSize,
          c_szPipeFaultCollectorState, c_szPipeFaultActivityState})
    {
        EXPECT_EQ(0u, m_trace.Count(szFault)) << szFault;
    }
    // The receipt lines are still written.
    EXPECT_LE(3u, m_trace.Count(c_szPipeTraceActivityEvent));
    EXPECT_LE(3u, m_trace.Count(c_szPipeTraceCollectorRegister));
}

TEST_F(CoreProtocol, EventPastTheItemCapClosesThePipe)
{
    CActivityClient client(c_dwWaitMs);
    ASSERT_EQ(S_OK, client.Connect(m_wstrActivityPipe.c_str()));
    ASSERT_EQ(S_OK, client.Start(NewGuid(), NewGuid()));
    std::string part(TELVANE_MAX_EVENT_PART, 'x');
    Message m = EventPart(NewGuid(), false, part);
    size_t cbSent = 0;
    while (cbSent <= TELVANE_MAX_ITEM)
    {
        if (FAILED(client.Pipe().WriteMessage(m.data(), static_cast<DWORD>(m.size()), c_dwWaitMs)))
        {
            break;
        }
        cbSent += part.size();
    }
    EXPECT_GT(cbSent, TELVANE_MAX_ITEM - part.size());
    EXPECT_TRUE(ClosedByService(client.Pipe()));
    EXPECT_TRUE(m_trace.WaitFor(c_szPipeFaultActivityEventTooLarge));
    ExpectServing();
}

struct SilentClientCase
{
    const char *szName;
    bool fCollector;
    bool fNegotiate;
    bool fLeave;
};

// One client that connects and then says nothing (or leaves before it identifies itself) must
// not keep the next clients out.
TEST_F(CoreProtocol, UnidentifiedClientsKeepNobodyOut)
{
    const SilentClientCase rgCases[] = {
        {"activity client that sends nothing", false, false, false},
        {"activity client that leaves after the version", false, true, true},
        {"activity client that leaves at once", false, false, true},
        {"collector client that sends nothing", true, false, false},
        {"collector client that leaves after the version", true, true, true},
    };
    std::vector<std::unique_ptr<CPipeClient>> rgHeld;
    for (const SilentClientCase &c : rgCases)
    {
        SCOPED_TRACE(c.szName);
        std::unique_ptr<CPipeClient> pipe(new CPipeClient());
        std::wstring wstrPipe = c.fCollector ? m_wstrCollectorPipe : m_wstrActivityPipe;
        ASSERT_EQ(S_OK, c.fNegotiate ? pipe->Open(wstrPipe.c_str(), c_dwWaitMs)
                                     : pipe->Connect(wstrPipe.c_str(), c_dwWaitMs));
        if (c.fLeave)
        {
            pipe->Close();
        }
        else
        {
            rgHeld.push_back(std::move(pipe));
        }
        ExpectServing();
    }
    // The stop at the end destroys the held, never identified, connections too.
}

TEST_F(CoreProtocol, AllZeroIdentifiersAreOrdinary)
{
    const GUID zero = {};
    CCollectorThread zeroCollector(m_wstrCollectorPipe, zero, "\"zero collector\"");
    ASSERT_TRUE(zeroCollector.WaitRegistered());
    ASSERT_TRUE(m_trace.WaitFor("TelvaneService::ReportConnectedCollector()", 1));

    GUID eventId = NewGuid();
    RunActivity(zero, zero, {{eventId, "\"zero run\""}});
    std::vector<DeliveredLog> rgLogs = WaitForLogs(zero, 1);
    ASSERT_EQ(1u, rgLogs.size());
    EXPECT_EQ(GuidText(zero), (*rgLogs[0].doc)["ActivityID"].GetString());
    EXPECT_EQ((std::vector<std::string>{"\"zero run\""}), GroupValues(*rgLogs[0].doc, eventId));
    EXPECT_EQ((std::vector<std::string>{"\"zero collector\""}), GroupValues(*rgLogs[0].doc, zero));
    ExpectServing();
}
