// Feeds a stream of client messages to both pipes' decoders and joins the accepted parts, the
// way an endpoint does. The input is a sequence of records: a little-endian 16-bit length,
// then that many bytes of one message. A small cap makes the too-large path reachable.
#include "servicelib/cpipereassembly.h"
#include "servicelib/pipecodec.h"

#include <cstdlib>
#include <cstring>

namespace
{
const size_t c_cbFuzzCap = 8192;
// Smaller than two full items, so the two connections together can run out of budget.
const size_t c_cbFuzzBudget = 12288;

void FuzzCheck(bool f)
{
    if (!f)
    {
        std::abort();
    }
}

// Reads every byte handed out, so the sanitizers see any reach past the message.
unsigned FuzzTouch(const uint8_t *pb, size_t cb)
{
    unsigned u = 0;
    for (size_t i = 0; i < cb; i++)
    {
        u += pb[i];
    }
    return u;
}

void FuzzMessage(bool fCollector, const uint8_t *pb, size_t cb, CPipeReassembly *pReassembly)
{
    PIPE_MESSAGE message;
    if (fCollector)
    {
        PipeCodecDecodeCollector(pb, cb, &message);
    }
    else
    {
        PipeCodecDecodeActivity(pb, cb, &message);
    }
    FuzzCheck(message.kind != PipeMessageInvalid || message.szFault != nullptr);
    FuzzCheck(!message.fFaultCode || message.szFault != nullptr);
    if (message.szFault != nullptr)
    {
        FuzzCheck(message.pbPayload == nullptr && message.cbPayload == 0);
        return;
    }
    if (message.kind == PipeMessageActivityEvent)
    {
        FuzzCheck(cb == TELVANE_ACTIVITY_EVENT_OVERHEAD + static_cast<size_t>(message.cbPayload));
    }
    if (message.kind == PipeMessageCollectionComplete)
    {
        FuzzCheck(sizeof(TELVANE_COLLECTION_COMPLETE) + static_cast<size_t>(message.cbPayload) <=
                  cb);
    }
    if (message.kind != PipeMessageActivityEvent && message.kind != PipeMessageCollectionComplete)
    {
        return;
    }
    FuzzCheck((message.pbPayload == nullptr) == (message.cbPayload == 0));
    if (message.pbPayload != nullptr)
    {
        FuzzCheck(message.pbPayload >= pb && message.pbPayload + message.cbPayload <= pb + cb);
        FuzzTouch(message.pbPayload, message.cbPayload);
    }
    size_t cbBefore = pReassembly->Size();
    switch (pReassembly->AddPart(message.pbPayload, message.cbPayload, message.fComplete))
    {
    case PipePartMore:
        FuzzCheck(!message.fComplete && pReassembly->Size() == cbBefore + message.cbPayload);
        break;
    case PipePartComplete: {
        FuzzCheck(message.fComplete && pReassembly->Size() == cbBefore + message.cbPayload);
        FuzzCheck((pReassembly->Data() == nullptr) == (pReassembly->Size() == 0));
        std::vector<uint8_t> vb = pReassembly->Take();
        FuzzTouch(vb.data(), vb.size());
        FuzzCheck(pReassembly->Size() == 0);
        break;
    }
    case PipePartTooLarge:
        FuzzCheck(cbBefore + message.cbPayload > c_cbFuzzCap && pReassembly->Size() == 0);
        break;
    case PipePartOverBudget:
        FuzzCheck(cbBefore + message.cbPayload <= c_cbFuzzCap && message.cbPayload != 0 &&
                  pReassembly->Size() == 0);
        break;
    }
    FuzzCheck(pReassembly->Size() <= c_cbFuzzCap);
}
} // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t *pbData, size_t cbData)
{
    CPipeReassemblyBudget budget(c_cbFuzzBudget);
    CPipeReassembly activity(c_cbFuzzCap, &budget);
    CPipeReassembly collector(c_cbFuzzCap, &budget);
    size_t ib = 0;
    while (ib + 2 <= cbData)
    {
        size_t cb = static_cast<size_t>(pbData[ib]) | (static_cast<size_t>(pbData[ib + 1]) << 8);
        ib += 2;
        if (cb > cbData - ib)
        {
            cb = cbData - ib;
        }
        // Each message in a buffer of its own size, as the pipe copies it, so a read past the
        // end is a heap overflow the address sanitizer reports.
        uint8_t *pbMessage = static_cast<uint8_t *>(std::malloc(cb != 0 ? cb : 1));
        if (cb != 0)
        {
            std::memcpy(pbMessage, pbData + ib, cb);
        }
        FuzzMessage(false, pbMessage, cb, &activity);
        FuzzMessage(true, pbMessage, cb, &collector);
        std::free(pbMessage);
        // The budget counts exactly the bytes held in unfinished items.
        FuzzCheck(budget.Used() == activity.Size() + collector.Size());
        FuzzCheck(budget.Used() <= c_cbFuzzBudget);
        ib += cb;
    }

    uint8_t rgbVersion[sizeof(TELVANE_VERSION_NEGOTIATE)];
    PipeCodecEncodeVersion(rgbVersion);
    FuzzCheck(PipeCodecReadU32(rgbVersion) == TELVANE_VERSION_NEGOTIATE_OPCODE);
    return 0;
}
