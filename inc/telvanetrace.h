// Event-trace definitions of the service's main provider: its identity, the three enable
// bits its call sites test, and the event descriptors it writes.
#pragma once

#include <windows.h>
#include <evntprov.h>

// Enable-callback notification codes (not every SDK declares them).
#ifndef EVENT_CONTROL_CODE_DISABLE_PROVIDER
#define EVENT_CONTROL_CODE_DISABLE_PROVIDER 0
#define EVENT_CONTROL_CODE_ENABLE_PROVIDER 1
#define EVENT_CONTROL_CODE_CAPTURE_STATE 2
#endif

// {D9C3A20F-4386-4651-8DD8-3D6F095C97FB}
constexpr GUID TELVANE_PROVIDER_GUID = {
    0xD9C3A20F, 0x4386, 0x4651, {0x8D, 0xD8, 0x3D, 0x6F, 0x09, 0x5C, 0x97, 0xFB}};

// Enable bits: which session level and keyword turn each group of events on.
enum TELVANE_TRACE_BIT : ULONG
{
    TelvaneTraceBitMessage = 0, // level any, keyword 0x100: 1001, 2005-2008
    TelvaneTraceBitFailure = 1, // level 4,   keyword 0x100: 1002
    TelvaneTraceBitUdp = 2,     // level any, keyword 0x400: 2001
};

const ULONG c_cTelvaneTraceBits = 3;
constexpr ULONGLONG c_rgullTelvaneTraceKeywords[c_cTelvaneTraceBits] = {0x100, 0x100, 0x400};
constexpr UCHAR c_rgucTelvaneTraceLevels[c_cTelvaneTraceBits] = {0, 4, 0};

//                                                   Id  Ver Ch Lvl Op Task Keyword
constexpr EVENT_DESCRIPTOR TelvaneEvent_Message = {1001, 0, 0, 0, 0, 2, 0x100};
constexpr EVENT_DESCRIPTOR TelvaneEvent_Failure = {1002, 0, 0, 4, 0, 1, 0x100};
constexpr EVENT_DESCRIPTOR TelvaneEvent_UdpFailure = {2001, 0, 0, 0, 0, 3, 0x400};
constexpr EVENT_DESCRIPTOR TelvaneEvent_UdpConfigRefresh = {2005, 0, 0, 0, 0, 3, 0x100};
constexpr EVENT_DESCRIPTOR TelvaneEvent_UdpConfigRead = {2006, 0, 0, 0, 0, 3, 0x100};
constexpr EVENT_DESCRIPTOR TelvaneEvent_UdpConfigWritten = {2007, 0, 0, 0, 0, 3, 0x100};
constexpr EVENT_DESCRIPTOR TelvaneEvent_UdpLaunch = {2008, 0, 0, 0, 0, 3, 0x100};
