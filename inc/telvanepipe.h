// Messages of the activity and collector pipes. Every message is one pipe message: the pipe's
// message boundary gives its length, so nothing here carries a frame length. Integers are
// unsigned 32-bit little-endian, every field sits at a 4-byte-aligned offset and no padding
// exists. Platform-free: the codec that reads these builds natively for fuzzing.
#pragma once

#include <cstddef>
#include <cstdint>

// The two pipes of the service.
constexpr wchar_t c_wszTelvaneActivityPipe[] = L"\\\\.\\Pipe\\TelvaneActivity";
constexpr wchar_t c_wszTelvaneCollectorPipe[] = L"\\\\.\\Pipe\\TelvaneCollector";

// A GUID as it travels: Data1, Data2 and Data3 little-endian, then the eight bytes of Data4;
// the same bytes as the platform's GUID. The service copies and compares these bytewise and
// never interprets them.
struct TELVANE_GUID
{
    uint32_t Data1;
    uint16_t Data2;
    uint16_t Data3;
    uint8_t Data4[8];
};

constexpr uint32_t TELVANE_VERSION_NEGOTIATE_OPCODE = 1;   // both pipes, both directions
constexpr uint32_t TELVANE_START_ACTIVITY_OPCODE = 2;      // activity, client to service
constexpr uint32_t TELVANE_ACTIVITY_EVENT_OPCODE = 3;      // activity, client to service
constexpr uint32_t TELVANE_STOP_ACTIVITY_OPCODE = 4;       // activity, client to service
constexpr uint32_t TELVANE_REGISTER_COLLECTOR_OPCODE = 5;  // collector, client to service
constexpr uint32_t TELVANE_START_COLLECTION_OPCODE = 6;    // collector, service to client
constexpr uint32_t TELVANE_COLLECTION_COMPLETE_OPCODE = 7; // collector, client to service
constexpr uint32_t TELVANE_BREAK_PIPE_OPCODE = 8;          // collector, client to service

constexpr uint32_t TELVANE_PROTOCOL_VERSION = 1;

// The service reads one message into a buffer of this size; larger events and results travel
// in parts.
constexpr uint32_t TELVANE_MAX_MESSAGE = 1200;

// What clients can make the service hold, all in one place.
// Largest event or result the service joins from its parts. Without a limit one client could
// stream parts until the service runs out of memory; a part that would go past it closes that
// client's pipe.
constexpr uint32_t TELVANE_MAX_ITEM = 4 * 1024 * 1024;
// Unfinished items of all connections together: many clients each just under the item limit
// would still exhaust the service. A part that would go past it closes its client's pipe.
constexpr uint64_t TELVANE_MAX_PENDING_ITEMS = 64ull * 1024 * 1024;
// Recorded values an open log may hold before it is flushed early (while its activity runs),
// so a long or chatty activity is delivered in several logs instead of pinning memory.
constexpr uint64_t TELVANE_MAX_LOG_BYTES = 4ull * 1024 * 1024;

// Common header of every message. Stop and break-pipe messages are just this; bytes after it
// are ignored.
struct TELVANE_PACKET
{
    uint32_t Opcode;
};

// Sent by the service first on every connection (all 8 bytes); the client answers with at
// least the opcode, and the service never reads the version of the answer.
struct TELVANE_VERSION_NEGOTIATE
{
    uint32_t Opcode;
    uint32_t Version;
};

// Exactly 36 bytes.
struct TELVANE_START_ACTIVITY
{
    uint32_t Opcode;
    TELVANE_GUID ActivityID; // kind of activity: at most one running operation per value
    TELVANE_GUID LogID;      // this run of the activity
};

// One part of an event: this header, Length payload bytes, then four trailing bytes that
// nobody interprets. The whole message is exactly TELVANE_ACTIVITY_EVENT_OVERHEAD + Length.
struct TELVANE_ACTIVITY_EVENT
{
    uint32_t Opcode;
    TELVANE_GUID EventID; // the last part's ID names the event
    uint32_t Complete;    // 0: more parts follow; anything else: last part
    uint32_t Length;
};

constexpr uint32_t TELVANE_ACTIVITY_EVENT_TRAILER = 4;
constexpr uint32_t TELVANE_ACTIVITY_EVENT_OVERHEAD =
    sizeof(TELVANE_ACTIVITY_EVENT) + TELVANE_ACTIVITY_EVENT_TRAILER;
constexpr uint32_t TELVANE_MAX_EVENT_PART = TELVANE_MAX_MESSAGE - TELVANE_ACTIVITY_EVENT_OVERHEAD;

// 20 bytes; bytes after them are ignored.
struct TELVANE_REGISTER_COLLECTOR
{
    uint32_t Opcode;
    TELVANE_GUID CollectorID;
};

// Sent by the service, exactly 36 bytes: the IDs of the operation that asks.
struct TELVANE_START_COLLECTION
{
    uint32_t Opcode;
    TELVANE_GUID ActivityID;
    TELVANE_GUID LogID;
};

// One part of a collector's result: this header and Length payload bytes; bytes after the
// payload are ignored.
struct TELVANE_COLLECTION_COMPLETE
{
    uint32_t Opcode;
    uint32_t Complete; // 0: more parts follow; anything else: last part
    uint32_t Length;
};

constexpr uint32_t TELVANE_MAX_RESULT_PART =
    TELVANE_MAX_MESSAGE - sizeof(TELVANE_COLLECTION_COMPLETE);

// The wire layout is fixed; any compiler that pads or reorders these breaks the protocol.
static_assert(sizeof(TELVANE_GUID) == 16, "GUID layout");
static_assert(offsetof(TELVANE_GUID, Data1) == 0 && offsetof(TELVANE_GUID, Data2) == 4 &&
                  offsetof(TELVANE_GUID, Data3) == 6 && offsetof(TELVANE_GUID, Data4) == 8,
              "GUID layout");

static_assert(sizeof(TELVANE_PACKET) == 4, "TELVANE_PACKET");
static_assert(offsetof(TELVANE_PACKET, Opcode) == 0, "TELVANE_PACKET");

static_assert(sizeof(TELVANE_VERSION_NEGOTIATE) == 8, "version message");
static_assert(offsetof(TELVANE_VERSION_NEGOTIATE, Opcode) == 0 &&
                  offsetof(TELVANE_VERSION_NEGOTIATE, Version) == 4,
              "version message");

static_assert(sizeof(TELVANE_START_ACTIVITY) == 36, "TELVANE_START_ACTIVITY");
static_assert(offsetof(TELVANE_START_ACTIVITY, Opcode) == 0 &&
                  offsetof(TELVANE_START_ACTIVITY, ActivityID) == 4 &&
                  offsetof(TELVANE_START_ACTIVITY, LogID) == 20,
              "TELVANE_START_ACTIVITY");

static_assert(sizeof(TELVANE_ACTIVITY_EVENT) == 28, "TELVANE_ACTIVITY_EVENT");
static_assert(offsetof(TELVANE_ACTIVITY_EVENT, Opcode) == 0 &&
                  offsetof(TELVANE_ACTIVITY_EVENT, EventID) == 4 &&
                  offsetof(TELVANE_ACTIVITY_EVENT, Complete) == 20 &&
                  offsetof(TELVANE_ACTIVITY_EVENT, Length) == 24,
              "TELVANE_ACTIVITY_EVENT");
static_assert(TELVANE_ACTIVITY_EVENT_OVERHEAD == 32 && TELVANE_MAX_EVENT_PART == 1168,
              "TELVANE_ACTIVITY_EVENT");

static_assert(sizeof(TELVANE_REGISTER_COLLECTOR) == 20, "register message");
static_assert(offsetof(TELVANE_REGISTER_COLLECTOR, Opcode) == 0 &&
                  offsetof(TELVANE_REGISTER_COLLECTOR, CollectorID) == 4,
              "register message");

static_assert(sizeof(TELVANE_START_COLLECTION) == 36, "start-collection request");
static_assert(offsetof(TELVANE_START_COLLECTION, Opcode) == 0 &&
                  offsetof(TELVANE_START_COLLECTION, ActivityID) == 4 &&
                  offsetof(TELVANE_START_COLLECTION, LogID) == 20,
              "start-collection request");

static_assert(sizeof(TELVANE_COLLECTION_COMPLETE) == 12, "collection-complete message");
static_assert(offsetof(TELVANE_COLLECTION_COMPLETE, Opcode) == 0 &&
                  offsetof(TELVANE_COLLECTION_COMPLETE, Complete) == 4 &&
                  offsetof(TELVANE_COLLECTION_COMPLETE, Length) == 8,
              "collection-complete message");
static_assert(TELVANE_MAX_RESULT_PART == 1188, "collection-complete message");
