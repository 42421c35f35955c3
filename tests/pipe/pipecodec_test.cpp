// Decoding of every accepted and faulted message form of both pipes, the two messages the
// service writes, and the joining of parts with its cap.
#include "servicelib/cpipereassembly.h"
#include "servicelib/pipecodec.h"

#include <gtest/gtest.h>
#include <cstring>
#include <list>
#include <string>
#include <vector>

namespace
{
typedef std::vector<uint8_t> Bytes;

// Message builder: little-endian words and raw bytes appended in order.
class CMessage
{
public:
    explicit CMessage(uint32_t ulOpcode) { U32(ulOpcode); }
    CMessage &U32(uint32_t ul)
    {
        for (int i = 0; i < 4; i++)
        {
            m_vb.push_back(static_cast<uint8_t>(ul >> (8 * i)));
        }
        return *this;
    }
    CMessage &Guid(uint8_t bSeed)
    {
        for (uint8_t i = 0; i < 16; i++)
        {
            m_vb.push_back(static_cast<uint8_t>(bSeed + i));
        }
        return *this;
    }
    CMessage &Raw(const std::string &s)
    {
        m_vb.insert(m_vb.end(), s.begin(), s.end());
        return *this;
    }
    CMessage &Fill(size_t cb, uint8_t b)
    {
        m_vb.insert(m_vb.end(), cb, b);
        return *this;
    }
    const Bytes &Get() const { return m_vb; }

private:
    Bytes m_vb;
};

// An event part as a client writes it: payload and the four trailing bytes.
Bytes EventPart(uint8_t bIdSeed, uint32_t ulComplete, const std::string &payload)
{
    return CMessage(TELVANE_ACTIVITY_EVENT_OPCODE)
        .Guid(bIdSeed)
        .U32(ulComplete)
        .U32(static_cast<uint32_t>(payload.size()))
        .Raw(payload)
        .U32(0xDEADBEEF)
        .Get();
}

Bytes ResultPart(uint32_t ulComplete, const std::string &payload, size_t cbExtra = 0)
{
    return CMessage(TELVANE_COLLECTION_COMPLETE_OPCODE)
        .U32(ulComplete)
        .U32(static_cast<uint32_t>(payload.size()))
        .Raw(payload)
        .Fill(cbExtra, 0xEE)
        .Get();
}

// A decoded message points into the bytes it came from; these keep every decoded message's
// bytes alive for the rest of the run, so a test may decode a temporary.
const Bytes &Keep(const Bytes &vb)
{
    static std::list<Bytes> s_kept;
    s_kept.push_back(vb);
    return s_kept.back();
}

PIPE_MESSAGE Activity(const Bytes &vb)
{
    const Bytes &kept = Keep(vb);
    PIPE_MESSAGE message;
    PipeCodecDecodeActivity(kept.empty() ? nullptr : kept.data(), kept.size(), &message);
    return message;
}

PIPE_MESSAGE Collector(const Bytes &vb)
{
    const Bytes &kept = Keep(vb);
    PIPE_MESSAGE message;
    PipeCodecDecodeCollector(kept.empty() ? nullptr : kept.data(), kept.size(), &message);
    return message;
}

std::string Text(const char *sz)
{
    return sz != nullptr ? sz : "(none)";
}

std::string Payload(const PIPE_MESSAGE &message)
{
    return message.cbPayload == 0
               ? std::string()
               : std::string(reinterpret_cast<const char *>(message.pbPayload), message.cbPayload);
}

bool IsSeedGuid(const TELVANE_GUID &guid, uint8_t bSeed)
{
    const uint8_t *pb = reinterpret_cast<const uint8_t *>(&guid);
    for (uint8_t i = 0; i < 16; i++)
    {
        if (pb[i] != static_cast<uint8_t>(bSeed + i))
        {
            return false;
        }
    }
    return true;
}

void ExpectFault(const PIPE_MESSAGE &message, const char *szFault, bool fCode = false)
{
    EXPECT_EQ(Text(szFault), Text(message.szFault));
    EXPECT_EQ(fCode, message.fFaultCode);
}

void ExpectAccepted(const PIPE_MESSAGE &message, PIPE_MESSAGE_KIND kind, const char *szTrace)
{
    EXPECT_EQ(kind, message.kind);
    EXPECT_EQ(Text(szTrace), Text(message.szTrace));
    ExpectFault(message, nullptr);
}

// Shorter than an opcode: no receipt line, only the fault.
void ExpectShortFaults(PIPE_MESSAGE (*pfnDecode)(const Bytes &), const char *szFault)
{
    for (size_t cb = 0; cb < 4; cb++)
    {
        PIPE_MESSAGE message = pfnDecode(Bytes(cb, 1));
        EXPECT_EQ(PipeMessageInvalid, message.kind);
        EXPECT_EQ(0u, message.ulOpcode);
        EXPECT_EQ(nullptr, message.szTrace);
        ExpectFault(message, szFault);
    }
}
} // namespace

TEST(PipeCodec, ActivityPipeAcceptsItsMessages)
{
    // A version reply of 4 bytes, and one of 8 with a version nobody examines.
    for (const Bytes &vb : {CMessage(1).Get(), CMessage(1).U32(2).Get()})
    {
        PIPE_MESSAGE message = Activity(vb);
        ExpectAccepted(message, PipeMessageVersion,
                       "CServiceActivity::IncomingMessage() - TELVANE_VERSION_NEGOTIATE_OPCODE");
        EXPECT_EQ(1u, message.ulOpcode);
    }

    PIPE_MESSAGE start = Activity(CMessage(2).Guid(0x10).Guid(0x40).Get());
    ExpectAccepted(start, PipeMessageStartActivity,
                   "CServiceActivity::IncomingMessage() - TELVANE_START_ACTIVITY_OPCODE");
    EXPECT_TRUE(IsSeedGuid(start.ActivityID, 0x10));
    EXPECT_TRUE(IsSeedGuid(start.LogID, 0x40));

    // 32 bytes, length 0, complete 1: an event with no data.
    PIPE_MESSAGE empty = Activity(EventPart(0x20, 1, ""));
    ExpectAccepted(empty, PipeMessageActivityEvent,
                   "CServiceActivity::IncomingMessage() - TELVANE_ACTIVITY_EVENT_OPCODE");
    EXPECT_TRUE(empty.fComplete);
    EXPECT_EQ(0u, empty.cbPayload);
    EXPECT_EQ(nullptr, empty.pbPayload);
    EXPECT_TRUE(IsSeedGuid(empty.EventID, 0x20));

    // Any non-zero complete value ends the event; the trailing bytes are not payload.
    PIPE_MESSAGE part = Activity(EventPart(0x30, 0, "0123456789"));
    EXPECT_FALSE(part.fComplete);
    EXPECT_EQ("0123456789", Payload(part));
    EXPECT_TRUE(Activity(EventPart(0x30, 0x80000000, "x")).fComplete);

    // The largest part fills the 1200-byte receive buffer exactly.
    Bytes full = EventPart(0x30, 1, std::string(TELVANE_MAX_EVENT_PART, 'f'));
    EXPECT_EQ(1200u, full.size());
    EXPECT_EQ(TELVANE_MAX_EVENT_PART, Activity(full).cbPayload);

    for (const Bytes &vb : {CMessage(4).Get(), CMessage(4).U32(99).Get()})
    {
        PIPE_MESSAGE stop = Activity(vb);
        ExpectAccepted(stop, PipeMessageStopActivity,
                       "CServiceActivity::IncomingMessage() - TELVANE_STOP_ACTIVITY_OPCODE");
    }
}

TEST(PipeCodec, ActivityPipeFaultsCloseWithTheirTrace)
{
    ExpectShortFaults(Activity, "***CServiceActivity - invalid message size, closing pipe");

    const char *szStart =
        "***CServiceActivity - invalid message size(TELVANE_START_ACTIVITY), closing pipe";
    for (const Bytes &vb :
         {CMessage(2).Guid(1).Guid(2).Get(), CMessage(2).Guid(1).Fill(15, 0).Get(),
          CMessage(2).Guid(1).Guid(2).Fill(1, 0).Get()})
    {
        PIPE_MESSAGE message = Activity(vb);
        EXPECT_EQ(Text(vb.size() == 36 ? nullptr : szStart), Text(message.szFault)) << vb.size();
        EXPECT_EQ(PipeMessageStartActivity, message.kind) << "the state check comes first";
    }

    const char *szEvent =
        "***CServiceActivity - invalid message size(TELVANE_ACTIVITY_EVENT), closing pipe";
    Bytes shortEvent = EventPart(1, 1, "");
    shortEvent.pop_back();
    Bytes longByOne = EventPart(1, 1, "0123456789");
    longByOne.push_back(0);
    Bytes shortByOne = EventPart(1, 1, "0123456789");
    shortByOne.pop_back();
    // A length that would wrap round to the message's size in 32 bits.
    Bytes wrapping = CMessage(3).Guid(1).U32(1).U32(0xFFFFFFE0).U32(0).Get();
    Bytes wrapping2 = CMessage(3).Guid(1).U32(1).U32(0xFFFFFFFF).Fill(5, 0).Get();
    for (const Bytes &vb : {shortEvent, longByOne, shortByOne, wrapping, wrapping2})
    {
        PIPE_MESSAGE message = Activity(vb);
        EXPECT_EQ(PipeMessageActivityEvent, message.kind);
        ExpectFault(message, szEvent);
        EXPECT_EQ(0u, message.cbPayload);
    }

    // The collector's opcodes and unknown ones are invalid here, traced with their value.
    for (uint32_t ulOpcode : {0u, 5u, 6u, 7u, 8u, 9u, 0xFFFFFFFFu})
    {
        PIPE_MESSAGE message = Activity(CMessage(ulOpcode).Guid(0).Get());
        EXPECT_EQ(PipeMessageInvalid, message.kind);
        EXPECT_EQ(ulOpcode, message.ulOpcode);
        EXPECT_EQ(nullptr, message.szTrace);
        ExpectFault(message, "***CServiceActivity - invalid opcode, closing pipe", true);
    }
}

TEST(PipeCodec, CollectorPipeAcceptsItsMessages)
{
    PIPE_MESSAGE version = Collector(CMessage(1).Get());
    ExpectAccepted(version, PipeMessageVersion,
                   "CServiceCollector::IncomingMessage() - TELVANE_VERSION_NEGOTIATE_OPCODE");

    // Bytes after the 20th are ignored.
    for (const Bytes &vb : {CMessage(5).Guid(0x50).Get(), CMessage(5).Guid(0x50).U32(7).Get()})
    {
        PIPE_MESSAGE message = Collector(vb);
        ExpectAccepted(message, PipeMessageRegisterCollector,
                       "CServiceCollector::IncomingMessage() - TELVANE_REGISTER_COLLECTOR_OPCODE");
        EXPECT_TRUE(IsSeedGuid(message.CollectorID, 0x50));
    }

    PIPE_MESSAGE empty = Collector(ResultPart(1, ""));
    ExpectAccepted(empty, PipeMessageCollectionComplete,
                   "CServiceCollector::IncomingMessage() - TELVANE_COLLECTION_COMPLETE_OPCODE");
    EXPECT_TRUE(empty.fComplete);
    EXPECT_EQ(nullptr, empty.pbPayload);

    // The payload must lie inside the message; what follows it is ignored.
    PIPE_MESSAGE part = Collector(ResultPart(0, "result", 9));
    ExpectFault(part, nullptr);
    EXPECT_FALSE(part.fComplete);
    EXPECT_EQ("result", Payload(part));
    Bytes full = ResultPart(2, std::string(TELVANE_MAX_RESULT_PART, 'r'));
    EXPECT_EQ(1200u, full.size());
    EXPECT_EQ(TELVANE_MAX_RESULT_PART, Collector(full).cbPayload);
    EXPECT_TRUE(Collector(full).fComplete);

    for (const Bytes &vb : {CMessage(8).Get(), CMessage(8).U32(1).Get()})
    {
        PIPE_MESSAGE message = Collector(vb);
        ExpectAccepted(message, PipeMessageBreakPipe,
                       "CServiceCollector::IncomingMessage() - asked to break pipe");
    }
}

TEST(PipeCodec, CollectorPipeFaultsCloseWithTheirTrace)
{
    const char *szSize = "***CServiceCollector - invalid size (TELVANE_PACKET), closing pipe";
    ExpectShortFaults(Collector, szSize);

    Bytes shortRegister = CMessage(5).Guid(1).Get();
    shortRegister.pop_back();
    EXPECT_EQ(PipeMessageRegisterCollector, Collector(shortRegister).kind);
    ExpectFault(Collector(shortRegister), szSize);

    Bytes headerOnly = ResultPart(1, "");
    headerOnly.pop_back(); // not even the length field is whole
    Bytes pastEnd = ResultPart(1, "abcde");
    pastEnd.pop_back();
    // Lengths that would wrap round in 32 bits and pass as short payloads.
    Bytes wrapping = CMessage(7).U32(1).U32(0xFFFFFFF8).U32(0).Get();
    Bytes wrapping2 = CMessage(7).U32(1).U32(0xFFFFFFFF).Get();
    for (const Bytes &vb : {headerOnly, pastEnd, wrapping, wrapping2})
    {
        PIPE_MESSAGE message = Collector(vb);
        EXPECT_EQ(PipeMessageCollectionComplete, message.kind);
        ExpectFault(message, szSize);
        EXPECT_EQ(nullptr, message.pbPayload);
    }

    for (uint32_t ulOpcode : {0u, 2u, 3u, 4u, 6u, 9u, 0x80000001u})
    {
        PIPE_MESSAGE message = Collector(CMessage(ulOpcode).Guid(0).Guid(0).Get());
        EXPECT_EQ(PipeMessageInvalid, message.kind);
        EXPECT_EQ(ulOpcode, message.ulOpcode);
        ExpectFault(message, "***CServiceCollector::IncomingMessage() - invalid opcode", true);
    }
}

TEST(PipeCodec, EncodesTheServiceMessages)
{
    uint8_t rgbVersion[8];
    PipeCodecEncodeVersion(rgbVersion);
    EXPECT_EQ(Bytes({1, 0, 0, 0, 1, 0, 0, 0}), Bytes(rgbVersion, rgbVersion + 8));

    TELVANE_GUID activityId;
    TELVANE_GUID logId;
    std::memcpy(&activityId, CMessage(0).Guid(0x61).Get().data() + 4, 16);
    std::memcpy(&logId, CMessage(0).Guid(0x91).Get().data() + 4, 16);
    uint8_t rgbRequest[36];
    PipeCodecEncodeStartCollection(activityId, logId, rgbRequest);
    EXPECT_EQ(CMessage(6).Guid(0x61).Guid(0x91).Get(), Bytes(rgbRequest, rgbRequest + 36));
}

// Parts are joined in arrival order; the last part names the event.
TEST(PipeReassembly, JoinsPartsIntoOneItem)
{
    CPipeReassembly reassembly;
    PIPE_PART_RESULT rgExpected[] = {PipePartMore, PipePartMore, PipePartComplete};
    const char *rgszPayload[] = {"ab", "cd", "ef"};
    PIPE_MESSAGE last = {};
    for (int i = 0; i < 3; i++)
    {
        last = Activity(EventPart(static_cast<uint8_t>(0x10 * (i + 1)), i == 2, rgszPayload[i]));
        ASSERT_EQ(nullptr, last.szFault);
        EXPECT_EQ(rgExpected[i],
                  reassembly.AddPart(last.pbPayload, last.cbPayload, last.fComplete));
    }
    EXPECT_TRUE(IsSeedGuid(last.EventID, 0x30));
    EXPECT_EQ(6u, reassembly.Size());
    Bytes item = reassembly.Take();
    EXPECT_EQ("abcdef", std::string(item.begin(), item.end()));
    EXPECT_EQ(0u, reassembly.Size());
    EXPECT_EQ(nullptr, reassembly.Data());

    // A result whose parts all carry nothing is no content.
    for (uint32_t ulComplete : {0u, 0u, 1u})
    {
        PIPE_MESSAGE part = Collector(ResultPart(ulComplete, ""));
        reassembly.AddPart(part.pbPayload, part.cbPayload, part.fComplete);
    }
    EXPECT_EQ(0u, reassembly.Size());
    EXPECT_EQ(nullptr, reassembly.Data());

    // A non-final part left over stays in front of the next item until the owner clears it.
    reassembly.AddPart(reinterpret_cast<const uint8_t *>("old"), 3, false);
    EXPECT_EQ(PipePartComplete,
              reassembly.AddPart(reinterpret_cast<const uint8_t *>("new"), 3, true));
    EXPECT_EQ("oldnew", std::string(reinterpret_cast<const char *>(reassembly.Data()), 6));
    reassembly.Clear();
    EXPECT_EQ(0u, reassembly.Size());
}

// One item may reach the cap exactly; a part that would pass it empties the buffer and is the
// fault that closes the pipe, and the buffer is usable again afterwards.
TEST(PipeReassembly, CapsOneItem)
{
    CPipeReassembly reassembly;
    Bytes cap(c_cbPipeReassemblyMax, 0x5A);
    EXPECT_EQ(4u * 1024 * 1024, cap.size());
    EXPECT_EQ(PipePartMore, reassembly.AddPart(cap.data(), cap.size() - 1, false));
    EXPECT_EQ(PipePartComplete, reassembly.AddPart(cap.data(), 1, true));
    EXPECT_EQ(cap.size(), reassembly.Take().size());

    EXPECT_EQ(PipePartMore, reassembly.AddPart(cap.data(), cap.size(), false));
    EXPECT_EQ(PipePartTooLarge, reassembly.AddPart(cap.data(), 1, false));
    EXPECT_EQ(0u, reassembly.Size());

    CPipeReassembly small(100);
    for (int i = 0; i < 9; i++)
    {
        EXPECT_EQ(PipePartMore, small.AddPart(cap.data(), 11, false));
    }
    EXPECT_EQ(PipePartTooLarge, small.AddPart(cap.data(), 2, true)) << "99 + 2 passes 100";
    EXPECT_EQ(PipePartComplete, small.AddPart(cap.data(), 100, true));
    EXPECT_EQ(100u, small.Size());
}
