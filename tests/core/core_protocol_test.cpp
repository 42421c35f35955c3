// Every kind of client fault ends only that client's connection, with its trace (which forms
// are faults is PipeCodec's to judge); messages a connection's state does not accept yet are
// dropped before any size check; and a client that connects but never identifies itself keeps
// nobody else out.
#include "tests/core/coretest.h"
#include "servicelib/pipecodec.h"

#include <algorithm>
#include <cstring>

using namespace coretest;

namespace
{
typedef std::vector<BYTE> Message;

TELVANE_GUID Wire(const GUID &id)
{
    TELVANE_GUID wire;
    std::memcpy(&wire, &id, sizeof(wire));
    return wire;
}

// The header's bytes, then the payload's, cut or padded to cb bytes (SIZE_MAX: as built).
template <typename T>
Message Bytes(const T &header, size_t cb, const std::string &payload = "")
{
    Message m(sizeof(T) + payload.size());
    std::memcpy(m.data(), &header, sizeof(T));
    std::copy(payload.begin(), payload.end(), m.begin() + sizeof(T));
    m.resize(cb == SIZE_MAX ? m.size() : cb);
    return m;
}

Message Opcode(uint32_t ulOpcode, size_t cb = 4)
{
    return Bytes(TELVANE_PACKET{ulOpcode}, cb);
}

Message StartMessage(const GUID &activityId, const GUID &logId, size_t cb = 36)
{
    return Bytes(
        TELVANE_START_ACTIVITY{TELVANE_START_ACTIVITY_OPCODE, Wire(activityId), Wire(logId)}, cb);
}

// An event part: header, payload, trailer.
Message EventPart(const GUID &eventId, bool fComplete, const std::string &payload,
                  size_t cb = SIZE_MAX)
{
    TELVANE_ACTIVITY_EVENT header = {TELVANE_ACTIVITY_EVENT_OPCODE, Wire(eventId), fComplete,
                                     static_cast<uint32_t>(payload.size())};
    return Bytes(header, cb == SIZE_MAX ? TELVANE_ACTIVITY_EVENT_OVERHEAD + payload.size() : cb,
                 payload);
}

Message Register(const GUID &collectorId, size_t cb = 20)
{
    return Bytes(TELVANE_REGISTER_COLLECTOR{TELVANE_REGISTER_COLLECTOR_OPCODE, Wire(collectorId)},
                 cb);
}

Message ResultPart(bool fComplete, uint32_t cbLength, size_t cbPayload)
{
    return Bytes(
        TELVANE_COLLECTION_COMPLETE{TELVANE_COLLECTION_COMPLETE_OPCODE, fComplete, cbLength},
        sizeof(TELVANE_COLLECTION_COMPLETE) + cbPayload);
}

// Where a fault is sent: after the version exchange on either pipe, or on an activity
// connection that has not answered the version yet.
enum FaultPipe
{
    OnActivity,
    OnCollector,
    OnActivityRaw
};

struct FaultCase
{
    const char *szName;
    FaultPipe pipe;
    std::vector<Message> rgMessages;
    const char *szTrace; // the fault's trace; null when the transport ends it silently
};

class CoreProtocol : public CCoreTest
{
protected:
    // A normal run with a collector still works on both pipes.
    void ExpectServing()
    {
        GUID collectorId = NewGuid();
        std::unique_ptr<CCollectorThread> collector =
            StartCollector(collectorId, "\"alive\"", false, 1);
        GUID logId = NewGuid();
        GUID eventId = NewGuid();
        std::unique_ptr<CActivityClient> client = StartActivity(NewGuid(), logId);
        SendEvent(*client, eventId, "1");
        ASSERT_TRUE(collector->WaitRequests(1));
        EXPECT_EQ(S_OK, client->Stop());
        EXPECT_EQ((std::vector<std::string>{"1"}), OnlyLogValues(logId, eventId));
        EXPECT_EQ((std::vector<std::string>{"\"alive\""}), OnlyLogValues(logId, collectorId));
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
        {"activity: 3 bytes", OnActivity, {Message(3)}, c_szPipeFaultActivitySize},
        {"start: 35 bytes", OnActivity, {StartMessage(a, l, 35)}, c_szPipeFaultActivityStartSize},
        {"event: 31 bytes",
         OnActivity,
         {StartMessage(a, l), EventPart(e, true, "", 31)},
         c_szPipeFaultActivityEventSize},
        {"activity opcode 9", OnActivity, {Opcode(9)}, c_szPipeFaultActivityOpcode},
        {"second version reply", OnActivity, {Opcode(1)}, c_szPipeFaultActivityState},
        {"start before version", OnActivityRaw, {StartMessage(a, l)}, c_szPipeFaultActivityState},
        {"second start",
         OnActivity,
         {StartMessage(a, l), StartMessage(a, l)},
         c_szPipeFaultActivityState},
        {"activity message over 1200 bytes", OnActivity, {Opcode(3, 1500)}, nullptr},
        {"collector: 3 bytes", OnCollector, {Message(3)}, c_szPipeFaultCollectorSize},
        {"result past message", OnCollector, {ResultPart(true, 10, 9)}, c_szPipeFaultCollectorSize},
        {"collector opcode 9", OnCollector, {Opcode(9)}, c_szPipeFaultCollectorOpcode},
        {"second register", OnCollector, {Register(k), Register(k)}, c_szPipeFaultCollectorState},
        {"second collector version", OnCollector, {Opcode(1)}, c_szPipeFaultCollectorState},
        {"collector message over 1200 bytes", OnCollector, {Opcode(7, 1500)}, nullptr},
    };
    for (const FaultCase &c : rgCases)
    {
        SCOPED_TRACE(c.szName);
        size_t cBefore = c.szTrace != nullptr ? m_trace.Count(c.szTrace) : 0;
        CPipeClient pipe;
        std::wstring wstrPipe = c.pipe == OnCollector ? CollectorPipe() : ActivityPipe();
        ASSERT_EQ(S_OK, c.pipe == OnActivityRaw ? pipe.Connect(wstrPipe.c_str(), c_dwWaitMs)
                                                : pipe.Open(wstrPipe.c_str(), c_dwWaitMs));
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
    ASSERT_EQ(S_OK, activity.Open(ActivityPipe().c_str(), c_dwWaitMs));
    GUID logId = NewGuid();
    m_rgLogIds.push_back(logId);
    for (const Message &m : {EventPart(e, true, "7"), EventPart(e, true, "", 31),
                             StartMessage(NewGuid(), logId), EventPart(e, true, "8"), Opcode(4)})
    {
        ASSERT_EQ(S_OK, activity.WriteMessage(m.data(), static_cast<DWORD>(m.size()), c_dwWaitMs));
    }
    EXPECT_EQ((std::vector<std::string>{"8"}), OnlyLogValues(logId, e));

    CPipeClient collector;
    ASSERT_EQ(S_OK, collector.Connect(CollectorPipe().c_str(), c_dwWaitMs));
    for (const Message &m : {Register(k, 3 + 4), Register(k), ResultPart(true, 100, 0)})
    {
        ASSERT_EQ(S_OK, collector.WriteMessage(m.data(), static_cast<DWORD>(m.size()), c_dwWaitMs));
    }
    // Still open: the version exchange and a registration work now.
    TELVANE_VERSION_NEGOTIATE version = {};
    ASSERT_EQ(S_OK, collector.ReadExpected(&version, sizeof(version),
                                           TELVANE_VERSION_NEGOTIATE_OPCODE, c_dwWaitMs));
    for (const Message &m : {Opcode(1), Register(k)})
    {
        ASSERT_EQ(S_OK, collector.WriteMessage(m.data(), static_cast<DWORD>(m.size()), c_dwWaitMs));
    }
    EXPECT_TRUE(m_trace.WaitFor(c_szCollectorConnected, 1));

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
    ASSERT_EQ(S_OK, client.Connect(ActivityPipe().c_str()));
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

// One client that connects and then says nothing (or leaves before it identifies itself) must
// not keep the next clients out.
TEST_F(CoreProtocol, UnidentifiedClientsKeepNobodyOut)
{
    const struct
    {
        const char *szName;
        bool fCollector;
        bool fNegotiate;
        bool fLeave;
    } rgCases[] = {
        {"activity client that sends nothing", false, false, false},
        {"activity client that leaves after the version", false, true, true},
        {"activity client that leaves at once", false, false, true},
        {"collector client that sends nothing", true, false, false},
        {"collector client that leaves after the version", true, true, true},
    };
    std::vector<std::unique_ptr<CPipeClient>> rgHeld;
    for (const auto &c : rgCases)
    {
        SCOPED_TRACE(c.szName);
        std::unique_ptr<CPipeClient> pipe(new CPipeClient());
        std::wstring wstrPipe = c.fCollector ? CollectorPipe() : ActivityPipe();
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
    std::unique_ptr<CCollectorThread> collector = StartCollector(zero, "\"zero collector\"");
    GUID eventId = NewGuid();
    RunActivity(zero, zero, {{eventId, "\"zero run\""}});
    EXPECT_EQ((std::vector<std::string>{"\"zero run\""}), OnlyLogValues(zero, eventId));
    EXPECT_EQ((std::vector<std::string>{"\"zero collector\""}), OnlyLogValues(zero, zero));
    std::vector<DeliveredLog> rgLogs = WaitForLogs(zero, 1);
    ASSERT_EQ(1u, rgLogs.size());
    EXPECT_EQ(GuidText(zero), (*rgLogs[0].doc)["ActivityID"].GetString());
}
