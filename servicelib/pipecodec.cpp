#include "servicelib/pipecodec.h"

#include <cstring>

namespace
{
// GUIDs are copied as bytes: the wire layout is the platform's, and the service never looks
// inside one.
TELVANE_GUID PipeCodecReadGuid(const uint8_t *pb)
{
    TELVANE_GUID guid;
    std::memcpy(&guid, pb, sizeof(guid));
    return guid;
}

void PipeCodecWriteGuid(uint8_t *pb, const TELVANE_GUID &guid)
{
    std::memcpy(pb, &guid, sizeof(guid));
}

void PipeCodecReset(PIPE_MESSAGE *pMessage)
{
    std::memset(pMessage, 0, sizeof(*pMessage));
    pMessage->kind = PipeMessageInvalid;
}

void PipeCodecSetPayload(PIPE_MESSAGE *pMessage, const uint8_t *pb, uint32_t ulComplete,
                         uint32_t cbPayload)
{
    pMessage->fComplete = ulComplete != 0;
    pMessage->cbPayload = cbPayload;
    pMessage->pbPayload = cbPayload != 0 ? pb : nullptr;
}
} // namespace

uint32_t PipeCodecReadU32(const uint8_t *pb)
{
    return static_cast<uint32_t>(pb[0]) | (static_cast<uint32_t>(pb[1]) << 8) |
           (static_cast<uint32_t>(pb[2]) << 16) | (static_cast<uint32_t>(pb[3]) << 24);
}

void PipeCodecWriteU32(uint8_t *pb, uint32_t ul)
{
    pb[0] = static_cast<uint8_t>(ul);
    pb[1] = static_cast<uint8_t>(ul >> 8);
    pb[2] = static_cast<uint8_t>(ul >> 16);
    pb[3] = static_cast<uint8_t>(ul >> 24);
}

void PipeCodecDecodeActivity(const uint8_t *pb, size_t cb, PIPE_MESSAGE *pMessage)
{
    PipeCodecReset(pMessage);
    if (cb < sizeof(TELVANE_PACKET))
    {
        pMessage->szFault = c_szPipeFaultActivitySize;
        return;
    }
    pMessage->ulOpcode = PipeCodecReadU32(pb + offsetof(TELVANE_PACKET, Opcode));
    switch (pMessage->ulOpcode)
    {
    case TELVANE_VERSION_NEGOTIATE_OPCODE:
        pMessage->kind = PipeMessageVersion;
        pMessage->szTrace = c_szPipeTraceActivityVersion;
        break;

    case TELVANE_START_ACTIVITY_OPCODE:
        pMessage->kind = PipeMessageStartActivity;
        pMessage->szTrace = c_szPipeTraceActivityStart;
        if (cb != sizeof(TELVANE_START_ACTIVITY))
        {
            pMessage->szFault = c_szPipeFaultActivityStartSize;
            break;
        }
        pMessage->ActivityID = PipeCodecReadGuid(pb + offsetof(TELVANE_START_ACTIVITY, ActivityID));
        pMessage->LogID = PipeCodecReadGuid(pb + offsetof(TELVANE_START_ACTIVITY, LogID));
        break;

    case TELVANE_ACTIVITY_EVENT_OPCODE: {
        pMessage->kind = PipeMessageActivityEvent;
        pMessage->szTrace = c_szPipeTraceActivityEvent;
        if (cb < TELVANE_ACTIVITY_EVENT_OVERHEAD)
        {
            pMessage->szFault = c_szPipeFaultActivityEventSize;
            break;
        }
        uint32_t cbPayload = PipeCodecReadU32(pb + offsetof(TELVANE_ACTIVITY_EVENT, Length));
        // Compared in 64 bits, so that no length can wrap round to the message's size.
        if (static_cast<uint64_t>(cb) !=
            static_cast<uint64_t>(TELVANE_ACTIVITY_EVENT_OVERHEAD) + cbPayload)
        {
            pMessage->szFault = c_szPipeFaultActivityEventSize;
            break;
        }
        pMessage->EventID = PipeCodecReadGuid(pb + offsetof(TELVANE_ACTIVITY_EVENT, EventID));
        PipeCodecSetPayload(pMessage, pb + sizeof(TELVANE_ACTIVITY_EVENT),
                            PipeCodecReadU32(pb + offsetof(TELVANE_ACTIVITY_EVENT, Complete)),
                            cbPayload);
        break;
    }

    case TELVANE_STOP_ACTIVITY_OPCODE:
        pMessage->kind = PipeMessageStopActivity;
        pMessage->szTrace = c_szPipeTraceActivityStop;
        break;

    default:
        pMessage->szFault = c_szPipeFaultActivityOpcode;
        pMessage->fFaultCode = true;
        break;
    }
}

void PipeCodecDecodeCollector(const uint8_t *pb, size_t cb, PIPE_MESSAGE *pMessage)
{
    PipeCodecReset(pMessage);
    if (cb < sizeof(TELVANE_PACKET))
    {
        pMessage->szFault = c_szPipeFaultCollectorSize;
        return;
    }
    pMessage->ulOpcode = PipeCodecReadU32(pb + offsetof(TELVANE_PACKET, Opcode));
    switch (pMessage->ulOpcode)
    {
    case TELVANE_VERSION_NEGOTIATE_OPCODE:
        pMessage->kind = PipeMessageVersion;
        pMessage->szTrace = c_szPipeTraceCollectorVersion;
        break;

    case TELVANE_REGISTER_COLLECTOR_OPCODE:
        pMessage->kind = PipeMessageRegisterCollector;
        pMessage->szTrace = c_szPipeTraceCollectorRegister;
        if (cb < sizeof(TELVANE_REGISTER_COLLECTOR))
        {
            pMessage->szFault = c_szPipeFaultCollectorSize;
            break;
        }
        pMessage->CollectorID =
            PipeCodecReadGuid(pb + offsetof(TELVANE_REGISTER_COLLECTOR, CollectorID));
        break;

    case TELVANE_COLLECTION_COMPLETE_OPCODE: {
        pMessage->kind = PipeMessageCollectionComplete;
        pMessage->szTrace = c_szPipeTraceCollectorResult;
        // A part too short for its own header has no length to check the payload against.
        if (cb < sizeof(TELVANE_COLLECTION_COMPLETE))
        {
            pMessage->szFault = c_szPipeFaultCollectorSize;
            break;
        }
        uint32_t cbPayload = PipeCodecReadU32(pb + offsetof(TELVANE_COLLECTION_COMPLETE, Length));
        // In 64 bits: a length near 2^32 must not wrap round and pass as a short payload.
        if (static_cast<uint64_t>(sizeof(TELVANE_COLLECTION_COMPLETE)) + cbPayload > cb)
        {
            pMessage->szFault = c_szPipeFaultCollectorSize;
            break;
        }
        PipeCodecSetPayload(pMessage, pb + sizeof(TELVANE_COLLECTION_COMPLETE),
                            PipeCodecReadU32(pb + offsetof(TELVANE_COLLECTION_COMPLETE, Complete)),
                            cbPayload);
        break;
    }

    case TELVANE_BREAK_PIPE_OPCODE:
        pMessage->kind = PipeMessageBreakPipe;
        pMessage->szTrace = c_szPipeTraceCollectorBreak;
        break;

    default:
        pMessage->szFault = c_szPipeFaultCollectorOpcode;
        pMessage->fFaultCode = true;
        break;
    }
}

void PipeCodecEncodeVersion(uint8_t (&rgb)[sizeof(TELVANE_VERSION_NEGOTIATE)])
{
    PipeCodecWriteU32(rgb + offsetof(TELVANE_VERSION_NEGOTIATE, Opcode),
                      TELVANE_VERSION_NEGOTIATE_OPCODE);
    PipeCodecWriteU32(rgb + offsetof(TELVANE_VERSION_NEGOTIATE, Version), TELVANE_PROTOCOL_VERSION);
}

void PipeCodecEncodeStartCollection(const TELVANE_GUID &activityId, const TELVANE_GUID &logId,
                                    uint8_t (&rgb)[sizeof(TELVANE_START_COLLECTION)])
{
    PipeCodecWriteU32(rgb + offsetof(TELVANE_START_COLLECTION, Opcode),
                      TELVANE_START_COLLECTION_OPCODE);
    PipeCodecWriteGuid(rgb + offsetof(TELVANE_START_COLLECTION, ActivityID), activityId);
    PipeCodecWriteGuid(rgb + offsetof(TELVANE_START_COLLECTION, LogID), logId);
}
