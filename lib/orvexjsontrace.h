// The HTTPS JSON client's own event-trace provider: its identity, enable bits and events.
// Registered while at least one request context lives. The writers may run on any thread.
#pragma once

#include "servicelib/eventtrace.h"

// {4637124C-1D40-4B4D-892F-2AAECF24FF06}
constexpr GUID ORVEXJSON_PROVIDER_GUID = {
    0x4637124C, 0x1D40, 0x4B4D, {0x89, 0x2F, 0x2A, 0xAE, 0xCF, 0x24, 0xFF, 0x06}};

// One enable bit per keyword; each event's keyword names its bit.
enum ORVEXJSON_TRACE_BIT : ULONG
{
    OrvexJsonTraceBitError = 0,       // keyword 0x1, level 2
    OrvexJsonTraceBitInformation = 1, // keyword 0x2, level 4
    OrvexJsonTraceBitVerbose = 2,     // keyword 0x4, level 5
};

const ULONG c_cOrvexJsonTraceBits = 3;
constexpr ULONGLONG c_rgullOrvexJsonTraceKeywords[c_cOrvexJsonTraceBits] = {0x1, 0x2, 0x4};
constexpr UCHAR c_rgucOrvexJsonTraceLevels[c_cOrvexJsonTraceBits] = {2, 4, 5};

#define ORVEXJSON_EVENT_ERROR(id)                                                                  \
    {                                                                                              \
        (id), 0, 0, 2, 0, 1, 0x1                                                                   \
    }
#define ORVEXJSON_EVENT_INFORMATION(id)                                                            \
    {                                                                                              \
        (id), 0, 0, 4, 0, 1, 0x2                                                                   \
    }
#define ORVEXJSON_EVENT_VERBOSE(id)                                                                \
    {                                                                                              \
        (id), 0, 0, 5, 0, 1, 0x4                                                                   \
    }

// Payload: "code" is the failure's HRESULT as one 32-bit value.
constexpr EVENT_DESCRIPTOR OrvexJsonEvent_OpenSession = ORVEXJSON_EVENT_ERROR(0);         // code
constexpr EVENT_DESCRIPTOR OrvexJsonEvent_CrackUrl = ORVEXJSON_EVENT_ERROR(1);            // code
constexpr EVENT_DESCRIPTOR OrvexJsonEvent_Connect = ORVEXJSON_EVENT_ERROR(2);             // code
constexpr EVENT_DESCRIPTOR OrvexJsonEvent_Decompression = ORVEXJSON_EVENT_ERROR(3);       // code
constexpr EVENT_DESCRIPTOR OrvexJsonEvent_OpenRequest = ORVEXJSON_EVENT_ERROR(4);         // code
constexpr EVENT_DESCRIPTOR OrvexJsonEvent_QueryCmSession = ORVEXJSON_EVENT_ERROR(5);      // code
constexpr EVENT_DESCRIPTOR OrvexJsonEvent_CmApiInit = ORVEXJSON_EVENT_ERROR(6);           // none
constexpr EVENT_DESCRIPTOR OrvexJsonEvent_CmSetRequirements = ORVEXJSON_EVENT_ERROR(7);   // result
constexpr EVENT_DESCRIPTOR OrvexJsonEvent_StatusCallback = ORVEXJSON_EVENT_ERROR(8);      // code
constexpr EVENT_DESCRIPTOR OrvexJsonEvent_AddHeaders = ORVEXJSON_EVENT_ERROR(9);          // code
constexpr EVENT_DESCRIPTOR OrvexJsonEvent_SecurityFlags = ORVEXJSON_EVENT_ERROR(10);      // code
constexpr EVENT_DESCRIPTOR OrvexJsonEvent_ClientCertificate = ORVEXJSON_EVENT_ERROR(11);  // code
constexpr EVENT_DESCRIPTOR OrvexJsonEvent_Sending = ORVEXJSON_EVENT_INFORMATION(12);      // none
constexpr EVENT_DESCRIPTOR OrvexJsonEvent_SendRequest = ORVEXJSON_EVENT_ERROR(14);        // code
constexpr EVENT_DESCRIPTOR OrvexJsonEvent_Closing = ORVEXJSON_EVENT_VERBOSE(15);          // none
constexpr EVENT_DESCRIPTOR OrvexJsonEvent_SecureFailure = ORVEXJSON_EVENT_ERROR(16);      // flags
constexpr EVENT_DESCRIPTOR OrvexJsonEvent_ReceiveResponse = ORVEXJSON_EVENT_ERROR(17);    // code
constexpr EVENT_DESCRIPTOR OrvexJsonEvent_QueryStatus = ORVEXJSON_EVENT_ERROR(18);        // code
constexpr EVENT_DESCRIPTOR OrvexJsonEvent_HttpStatus = ORVEXJSON_EVENT_ERROR(19);         // status
constexpr EVENT_DESCRIPTOR OrvexJsonEvent_QueryData = ORVEXJSON_EVENT_ERROR(20);          // code
constexpr EVENT_DESCRIPTOR OrvexJsonEvent_ReadData = ORVEXJSON_EVENT_ERROR(21);           // code
constexpr EVENT_DESCRIPTOR OrvexJsonEvent_RequestError = ORVEXJSON_EVENT_ERROR(22);       // error
constexpr EVENT_DESCRIPTOR OrvexJsonEvent_EmptyBody = ORVEXJSON_EVENT_ERROR(23);          // none
constexpr EVENT_DESCRIPTOR OrvexJsonEvent_BodyComplete = ORVEXJSON_EVENT_INFORMATION(24); // none
constexpr EVENT_DESCRIPTOR OrvexJsonEvent_NotObject = ORVEXJSON_EVENT_ERROR(25);          // none
constexpr EVENT_DESCRIPTOR OrvexJsonEvent_IsObject = ORVEXJSON_EVENT_VERBOSE(26);         // none
constexpr EVENT_DESCRIPTOR OrvexJsonEvent_Failing = ORVEXJSON_EVENT_VERBOSE(27);          // none
// The body grew past c_cbOrvexJsonMaxBody; the payload is the size it would have reached
// (saturated at 0xFFFFFFFF).
constexpr EVENT_DESCRIPTOR OrvexJsonEvent_BodyTooLarge = ORVEXJSON_EVENT_ERROR(28);
constexpr EVENT_DESCRIPTOR OrvexJsonEvent_Provision = ORVEXJSON_EVENT_ERROR(30);     // code
constexpr EVENT_DESCRIPTOR OrvexJsonEvent_OpenStore = ORVEXJSON_EVENT_ERROR(31);     // code
constexpr EVENT_DESCRIPTOR OrvexJsonEvent_NoCertificate = ORVEXJSON_EVENT_ERROR(32); // code
constexpr EVENT_DESCRIPTOR OrvexJsonEvent_Body = ORVEXJSON_EVENT_VERBOSE(99); // text, terminated

extern TRACE_PROVIDER_CONTEXT g_OrvexJsonTraceProvider;

// Counts live request contexts: the first registers the provider, the last unregisters it.
void OrvexJsonTraceAddContext();
void OrvexJsonTraceReleaseContext();

// Each writer tests the bit of the event's keyword first.
void OrvexJsonTraceCode(const EVENT_DESCRIPTOR &descriptor, ULONG ulCode);
void OrvexJsonTraceMark(const EVENT_DESCRIPTOR &descriptor);
void OrvexJsonTraceText(const EVENT_DESCRIPTOR &descriptor, const char *szText);
