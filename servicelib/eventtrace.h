// The service's event-trace providers: registration, the platform's enable-callback logic,
// the four payload writers, and the call-site helpers that test an enable bit before they
// format anything. Enable bits are written by the enable callback (a platform thread) and
// read without a lock: a stale read only writes or skips one event.
#pragma once

#include "inc/telvanetrace.h"

// What the enable callback fills in for one provider.
struct TRACE_PROVIDER_CONTEXT
{
    REGHANDLE hRegistration;
    ULONG ulIsEnabled;
    UCHAR ucLevel;
    ULONGLONG ullMatchAnyKeyword;
    ULONGLONG ullMatchAllKeyword;
    ULONG cEnableBits;
    volatile LONG *plEnableBits; // one bit per entry of the two tables below
    const ULONGLONG *pullEnableKeywords;
    const UCHAR *pucEnableLevels;
};

void NTAPI TraceProviderEnableCallback(LPCGUID pSourceId, ULONG ulIsEnabled, UCHAR ucLevel,
                                       ULONGLONG ullMatchAnyKeyword, ULONGLONG ullMatchAllKeyword,
                                       PEVENT_FILTER_DESCRIPTOR pFilterData, PVOID pvContext);

// Registers only while the handle is 0; unregisters only while it is not, then zeroes it.
void TraceProviderRegister(const GUID &guid, TRACE_PROVIDER_CONTEXT *pContext);
void TraceProviderUnregister(TRACE_PROVIDER_CONTEXT *pContext);
bool TraceProviderBitEnabled(const TRACE_PROVIDER_CONTEXT *pContext, ULONG ulBit);

// Payload writers: they write unconditionally and ignore the result. A null string is
// written as "NULL".
void TraceMessage(REGHANDLE hProvider, const EVENT_DESCRIPTOR *pDescriptor, const char *szText);
void TraceFailure(REGHANDLE hProvider, const EVENT_DESCRIPTOR *pDescriptor, const char *szText,
                  ULONG ulCode);
void TraceMark(REGHANDLE hProvider, const EVENT_DESCRIPTOR *pDescriptor);
void TraceCode(REGHANDLE hProvider, const EVENT_DESCRIPTOR *pDescriptor, ULONG ulCode);
void TraceWideMessage(REGHANDLE hProvider, const wchar_t *wszText);

// The main provider, registered while the DLL is attached.
extern TRACE_PROVIDER_CONTEXT g_TelvaneTraceProvider;
void TelvaneTraceRegister();
void TelvaneTraceUnregister();

inline bool TelvaneTraceEnabled(TELVANE_TRACE_BIT bit)
{
    return TraceProviderBitEnabled(&g_TelvaneTraceProvider, bit);
}

// Call-site helpers of the main provider: each tests its bit first.
void TelvaneTrace(const char *szText);                         // 1001
void TelvaneTraceF(const char *szFormat, ...);                 // 1001, formatted only when enabled
void TelvaneTraceFailure(const char *szText, ULONG ulCode);    // 1002
void TelvaneTraceUdpFailure(const char *szText, ULONG ulCode); // 2001
void TelvaneTraceMark(const EVENT_DESCRIPTOR &descriptor);     // 2005, 2006, 2007
void TelvaneTraceCommandLine(const wchar_t *wszCommandLine);   // 2008

// Where the platform never enables a provider (Wine), setting TELVANE_TRACE_STDOUT before
// registration enables every bit and echoes each event as a debug line. Every provider of
// the process reads the variable through TraceReadEchoSetting before it registers. Tests capture
// the written events through a hook that replaces EventWrite.
typedef void (*PFN_TRACE_WRITE)(REGHANDLE hProvider, const EVENT_DESCRIPTOR *pDescriptor,
                                ULONG cData, const EVENT_DATA_DESCRIPTOR *pData);
void TraceSetWriteHook(PFN_TRACE_WRITE pfnHook);
void TraceReadEchoSetting();
