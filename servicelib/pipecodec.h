// Reading and writing the messages of the activity and collector pipes. Decoding checks one
// received message against its layout and says what it is, or which fault closes the pipe
// and with what trace text; the endpoints apply their connection state on top (a message the
// state does not accept is dropped before its fault matters). Platform-free and stateless,
// so any thread may call it and the fuzzer can drive it natively.
#pragma once

#include "inc/telvanepipe.h"

#include <cstddef>
#include <cstdint>

enum PIPE_MESSAGE_KIND : uint32_t
{
    PipeMessageInvalid = 0, // shorter than an opcode, or an opcode this pipe does not know
    PipeMessageVersion,
    PipeMessageStartActivity,
    PipeMessageActivityEvent,
    PipeMessageStopActivity,
    PipeMessageRegisterCollector,
    PipeMessageCollectionComplete,
    PipeMessageBreakPipe,
};

// One decoded message. Pointers into the received bytes are valid as long as those are.
struct PIPE_MESSAGE
{
    PIPE_MESSAGE_KIND kind;
    uint32_t ulOpcode;   // 0 when the message is too short to carry one
    const char *szTrace; // receipt line to trace; null when the message has none
    // Non-null: the message is malformed; trace this and close the pipe. With fFaultCode the
    // trace is the failure event carrying ulOpcode as its code.
    const char *szFault;
    bool fFaultCode;

    TELVANE_GUID ActivityID;  // start message
    TELVANE_GUID LogID;       // start message
    TELVANE_GUID EventID;     // event part
    TELVANE_GUID CollectorID; // register message
    bool fComplete;           // event or result part: this is the last part
    const uint8_t *pbPayload; // event or result part: this part's bytes (null when none)
    uint32_t cbPayload;
};

// Activity pipe: version reply, start, event part, stop; anything else is an invalid opcode.
void PipeCodecDecodeActivity(const uint8_t *pb, size_t cb, PIPE_MESSAGE *pMessage);
// Collector pipe: version reply, register, result part, break pipe.
void PipeCodecDecodeCollector(const uint8_t *pb, size_t cb, PIPE_MESSAGE *pMessage);

// The two messages the service sends.
void PipeCodecEncodeVersion(uint8_t (&rgb)[sizeof(TELVANE_VERSION_NEGOTIATE)]);
void PipeCodecEncodeStartCollection(const TELVANE_GUID &activityId, const TELVANE_GUID &logId,
                                    uint8_t (&rgb)[sizeof(TELVANE_START_COLLECTION)]);

// Little-endian fields at any alignment.
uint32_t PipeCodecReadU32(const uint8_t *pb);
void PipeCodecWriteU32(uint8_t *pb, uint32_t ul);

// Trace texts of the receive side, one copy in the program (so a text may be compared by its
// address). Decoding hands out the receipt and fault lines: a receipt line and a fault
// without a code go out as trace messages, a fault with a code as the failure event with the
// opcode. The endpoints trace the reassembly lines as parts and items arrive.
inline constexpr char c_szPipeTraceActivityVersion[] =
    "CServiceActivity::IncomingMessage() - TELVANE_VERSION_NEGOTIATE_OPCODE";
inline constexpr char c_szPipeTraceActivityStart[] =
    "CServiceActivity::IncomingMessage() - TELVANE_START_ACTIVITY_OPCODE";
inline constexpr char c_szPipeTraceActivityEvent[] =
    "CServiceActivity::IncomingMessage() - TELVANE_ACTIVITY_EVENT_OPCODE";
inline constexpr char c_szPipeTraceActivityStop[] =
    "CServiceActivity::IncomingMessage() - TELVANE_STOP_ACTIVITY_OPCODE";
inline constexpr char c_szPipeTraceActivityMultipart[] =
    "CServiceActivity::IncomingMessage() - MULTIPART";
inline constexpr char c_szPipeTraceActivityEventComplete[] =
    "CServiceActivity::IncomingMessage() ----- EVENT COMPLETE";

inline constexpr char c_szPipeFaultActivitySize[] =
    "***CServiceActivity - invalid message size, closing pipe";
inline constexpr char c_szPipeFaultActivityStartSize[] =
    "***CServiceActivity - invalid message size(TELVANE_START_ACTIVITY), closing pipe";
inline constexpr char c_szPipeFaultActivityEventSize[] =
    "***CServiceActivity - invalid message size(TELVANE_ACTIVITY_EVENT), closing pipe";
inline constexpr char c_szPipeFaultActivityOpcode[] =
    "***CServiceActivity - invalid opcode, closing pipe";
// An event whose parts add up to more than the reassembly cap.
inline constexpr char c_szPipeFaultActivityEventTooLarge[] =
    "***CServiceActivity - event too large, closing pipe";
// A part that would take the unfinished items of all connections past their budget.
inline constexpr char c_szPipeFaultActivityOverBudget[] =
    "***CServiceActivity - too much unfinished data across connections, closing pipe";
// A version reply or a start that the connection's state does not expect (a second one).
inline constexpr char c_szPipeFaultActivityState[] =
    "***CServiceActivity - message out of order, closing pipe";
// Events that arrived before the operation was attached, past the per-log bound.
inline constexpr char c_szPipeFaultActivityBacklog[] =
    "***CServiceActivity - too many events before the operation, closing pipe";

inline constexpr char c_szPipeTraceCollectorVersion[] =
    "CServiceCollector::IncomingMessage() - TELVANE_VERSION_NEGOTIATE_OPCODE";
inline constexpr char c_szPipeTraceCollectorRegister[] =
    "CServiceCollector::IncomingMessage() - TELVANE_REGISTER_COLLECTOR_OPCODE";
inline constexpr char c_szPipeTraceCollectorResult[] =
    "CServiceCollector::IncomingMessage() - TELVANE_COLLECTION_COMPLETE_OPCODE";
inline constexpr char c_szPipeTraceCollectorBreak[] =
    "CServiceCollector::IncomingMessage() - asked to break pipe";
inline constexpr char c_szPipeTraceCollectorMultipart[] =
    "CServiceCollector::IncomingMessage() - MULTIPART";
inline constexpr char c_szPipeTraceCollectorWithContent[] =
    "CServiceCollector::IncomingMessage() ----- COLLECTION COMPLETE, with content";
inline constexpr char c_szPipeTraceCollectorNoContent[] =
    "CServiceCollector::IncomingMessage() ----- COLLECTION COMPLETE, no content";

inline constexpr char c_szPipeFaultCollectorSize[] =
    "***CServiceCollector - invalid size (TELVANE_PACKET), closing pipe";
inline constexpr char c_szPipeFaultCollectorOpcode[] =
    "***CServiceCollector::IncomingMessage() - invalid opcode";
// A result whose parts add up to more than the reassembly cap.
inline constexpr char c_szPipeFaultCollectorResultTooLarge[] =
    "***CServiceCollector - result too large, closing pipe";
inline constexpr char c_szPipeFaultCollectorOverBudget[] =
    "***CServiceCollector - too much unfinished data across connections, closing pipe";
// A version reply the connection does not expect, or a second register message.
inline constexpr char c_szPipeFaultCollectorState[] =
    "***CServiceCollector - message out of order, closing pipe";
