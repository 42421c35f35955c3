// Decoding of every accepted and faulted message form of both pipes, and the cap on joined
// parts (their joining shows in the client tests' delivered items). The two messages the service
// writes are read back by the client tests.
#include "servicelib/cpipereassembly.h"
#include "servicelib/pipecodec.h"

#include <gtest/gtest.h>
#include <cstring>
#include <map>
#include <string>
#include <vector>

namespace
{
typedef std::vector<uint8_t> Bytes;

// Message builder: little-endian words and raw bytes appended in order (test thread only).
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

Bytes Start(uint8_t bSeed)
{
    return CMessage(TELVANE_START_ACTIVITY_OPCODE).Guid(bSeed).Guid(bSeed + 0x30).Get();
}

Bytes Cut(Bytes vb, int cb)
{
    vb.resize(vb.size() + cb, 0);
    return vb;
}

bool IsSeedGuid(const TELVANE_GUID &guid, uint8_t bSeed)
{
    return std::memcmp(&guid, CMessage(0).Guid(bSeed).Get().data() + 4, sizeof(guid)) == 0;
}

// One message form: what decoding it on its pipe must give. The receipt line follows from the
// kind, the opcode and the fault's code from the bytes.
struct CodecRow
{
    const char *szName;
    bool fCollector;
    Bytes vb;
    PIPE_MESSAGE_KIND kind;
    const char *szFault;
    std::string strPayload;
    bool fComplete;
    uint8_t bIdSeed; // of the message's GUID (the ActivityID of a start); 0 when none is read
};

std::string Text(const char *sz)
{
    return sz != nullptr ? sz : "(none)";
}

// The receipt line of each kind on its pipe; an invalid message has none.
const char *ReceiptLine(bool fCollector, PIPE_MESSAGE_KIND kind)
{
    const std::map<PIPE_MESSAGE_KIND, const char *> receipts = {
        {PipeMessageVersion,
         fCollector ? c_szPipeTraceCollectorVersion : c_szPipeTraceActivityVersion},
        {PipeMessageStartActivity, c_szPipeTraceActivityStart},
        {PipeMessageActivityEvent, c_szPipeTraceActivityEvent},
        {PipeMessageStopActivity, c_szPipeTraceActivityStop},
        {PipeMessageRegisterCollector, c_szPipeTraceCollectorRegister},
        {PipeMessageCollectionComplete, c_szPipeTraceCollectorResult},
        {PipeMessageBreakPipe, c_szPipeTraceCollectorBreak}};
    auto it = receipts.find(kind);
    return it != receipts.end() ? it->second : nullptr;
}

std::vector<CodecRow> CodecRows()
{
    const char *szStartSize = c_szPipeFaultActivityStartSize;
    const char *szEventSize = c_szPipeFaultActivityEventSize;
    const char *szCollectorSize = c_szPipeFaultCollectorSize;
    const std::string strFullEvent(TELVANE_MAX_EVENT_PART, 'f');
    const std::string strFullResult(TELVANE_MAX_RESULT_PART, 'r');
    const bool A = false;
    const bool C = true;
    std::vector<CodecRow> rgRows = {
        // A version reply of 4 bytes, and one of 8 with a version nobody examines.
        {"version", A, CMessage(1).Get(), PipeMessageVersion, nullptr, "", false, 0},
        {"version 8", A, CMessage(1).U32(2).Get(), PipeMessageVersion, nullptr, "", false, 0},
        {"start", A, Start(0x10), PipeMessageStartActivity, nullptr, "", false, 0x10},
        // The state check comes before the size: the kind is known whatever the length.
        {"start short", A, Cut(Start(1), -1), PipeMessageStartActivity, szStartSize, "", false, 0},
        {"start long", A, Cut(Start(1), 1), PipeMessageStartActivity, szStartSize, "", false, 0},
        // 32 bytes, length 0, complete 1: an event with no data.
        {"empty event", A, EventPart(0x20, 1, ""), PipeMessageActivityEvent, nullptr, "", true,
         0x20},
        // Any non-zero complete value ends the event; the trailing bytes are not payload.
        {"event part", A, EventPart(0x30, 0, "0123456789"), PipeMessageActivityEvent, nullptr,
         "0123456789", false, 0x30},
        {"high complete", A, EventPart(0x30, 0x80000000, "x"), PipeMessageActivityEvent, nullptr,
         "x", true, 0x30},
        // The largest part fills the 1200-byte receive buffer exactly.
        {"full event", A, EventPart(0x31, 1, strFullEvent), PipeMessageActivityEvent, nullptr,
         strFullEvent, true, 0x31},
        {"event short", A, Cut(EventPart(1, 1, ""), -1), PipeMessageActivityEvent, szEventSize, "",
         false, 0},
        {"event long by one", A, Cut(EventPart(1, 1, "0123456789"), 1), PipeMessageActivityEvent,
         szEventSize, "", false, 0},
        {"event short by one", A, Cut(EventPart(1, 1, "0123456789"), -1), PipeMessageActivityEvent,
         szEventSize, "", false, 0},
        // Lengths that would wrap round to the message's size in 32 bits.
        {"event wrapping", A, CMessage(3).Guid(1).U32(1).U32(0xFFFFFFE0).U32(0).Get(),
         PipeMessageActivityEvent, szEventSize, "", false, 0},
        {"event wrapping 2", A, CMessage(3).Guid(1).U32(1).U32(0xFFFFFFFF).Fill(5, 0).Get(),
         PipeMessageActivityEvent, szEventSize, "", false, 0},
        {"stop", A, CMessage(4).Get(), PipeMessageStopActivity, nullptr, "", false, 0},
        {"stop 8", A, CMessage(4).U32(99).Get(), PipeMessageStopActivity, nullptr, "", false, 0},

        {"version", C, CMessage(1).Get(), PipeMessageVersion, nullptr, "", false, 0},
        // Bytes after the 20th are ignored.
        {"register", C, CMessage(5).Guid(0x50).Get(), PipeMessageRegisterCollector, nullptr, "",
         false, 0x50},
        {"register long", C, CMessage(5).Guid(0x50).U32(7).Get(), PipeMessageRegisterCollector,
         nullptr, "", false, 0x50},
        {"register short", C, Cut(CMessage(5).Guid(1).Get(), -1), PipeMessageRegisterCollector,
         szCollectorSize, "", false, 0},
        {"empty result", C, ResultPart(1, ""), PipeMessageCollectionComplete, nullptr, "", true, 0},
        // The payload must lie inside the message; what follows it is ignored.
        {"result part", C, ResultPart(0, "result", 9), PipeMessageCollectionComplete, nullptr,
         "result", false, 0},
        {"full result", C, ResultPart(2, strFullResult), PipeMessageCollectionComplete, nullptr,
         strFullResult, true, 0},
        // Not even the length field is whole.
        {"result header only", C, Cut(ResultPart(1, ""), -1), PipeMessageCollectionComplete,
         szCollectorSize, "", false, 0},
        {"result past end", C, Cut(ResultPart(1, "abcde"), -1), PipeMessageCollectionComplete,
         szCollectorSize, "", false, 0},
        // Lengths that would wrap round in 32 bits and pass as short payloads.
        {"result wrapping", C, CMessage(7).U32(1).U32(0xFFFFFFF8).U32(0).Get(),
         PipeMessageCollectionComplete, szCollectorSize, "", false, 0},
        {"result wrapping 2", C, CMessage(7).U32(1).U32(0xFFFFFFFF).Get(),
         PipeMessageCollectionComplete, szCollectorSize, "", false, 0},
        {"break", C, CMessage(8).Get(), PipeMessageBreakPipe, nullptr, "", false, 0},
        {"break 8", C, CMessage(8).U32(1).Get(), PipeMessageBreakPipe, nullptr, "", false, 0},
    };
    // Shorter than an opcode: no receipt line, only the fault.
    for (uint8_t cb = 0; cb < 4; cb++)
    {
        rgRows.push_back(
            {"short", A, Bytes(cb, 1), PipeMessageInvalid, c_szPipeFaultActivitySize, "", false});
        rgRows.push_back(
            {"short", C, Bytes(cb, 1), PipeMessageInvalid, szCollectorSize, "", false});
    }
    // The other pipe's opcodes and unknown ones are invalid, traced with their value.
    for (uint32_t ulOpcode : {0u, 5u, 6u, 7u, 8u, 9u, 0xFFFFFFFFu})
    {
        rgRows.push_back({"opcode", A, CMessage(ulOpcode).Guid(0).Get(), PipeMessageInvalid,
                          c_szPipeFaultActivityOpcode, "", false});
    }
    for (uint32_t ulOpcode : {0u, 2u, 3u, 4u, 6u, 9u, 0x80000001u})
    {
        rgRows.push_back({"opcode", C, CMessage(ulOpcode).Guid(0).Guid(0).Get(), PipeMessageInvalid,
                          c_szPipeFaultCollectorOpcode, "", false});
    }
    return rgRows;
}
} // namespace

TEST(PipeCodec, DecodesEveryAcceptedAndFaultedForm)
{
    for (const CodecRow &row : CodecRows())
    {
        SCOPED_TRACE(std::string(row.fCollector ? "collector " : "activity ") + row.szName + ", " +
                     std::to_string(row.vb.size()) + " bytes");
        PIPE_MESSAGE message;
        (row.fCollector ? PipeCodecDecodeCollector : PipeCodecDecodeActivity)(
            row.vb.empty() ? nullptr : row.vb.data(), row.vb.size(), &message);
        EXPECT_EQ(row.kind, message.kind);
        EXPECT_EQ(row.vb.size() < 4 ? 0 : PipeCodecReadU32(row.vb.data()), message.ulOpcode);
        EXPECT_EQ(Text(ReceiptLine(row.fCollector, row.kind)), Text(message.szTrace));
        EXPECT_EQ(Text(row.szFault), Text(message.szFault));
        EXPECT_EQ(row.kind == PipeMessageInvalid && row.vb.size() >= 4, message.fFaultCode);
        EXPECT_EQ(row.strPayload.size(), message.cbPayload);
        EXPECT_EQ(row.strPayload.empty(), message.pbPayload == nullptr);
        if (!row.strPayload.empty() && message.pbPayload != nullptr)
        {
            EXPECT_EQ(row.strPayload, std::string(reinterpret_cast<const char *>(message.pbPayload),
                                                  message.cbPayload));
        }
        EXPECT_EQ(row.fComplete, message.fComplete);
        const TELVANE_GUID *pId = row.kind == PipeMessageStartActivity   ? &message.ActivityID
                                  : row.kind == PipeMessageActivityEvent ? &message.EventID
                                                                         : &message.CollectorID;
        if (row.bIdSeed != 0)
        {
            EXPECT_TRUE(IsSeedGuid(*pId, row.bIdSeed));
            EXPECT_TRUE(row.kind != PipeMessageStartActivity ||
                        IsSeedGuid(message.LogID, row.bIdSeed + 0x30));
        }
    }
    EXPECT_EQ(TELVANE_MAX_MESSAGE,
              EventPart(1, 1, std::string(TELVANE_MAX_EVENT_PART, 'f')).size());
    EXPECT_EQ(TELVANE_MAX_MESSAGE, ResultPart(1, std::string(TELVANE_MAX_RESULT_PART, 'r')).size());
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
