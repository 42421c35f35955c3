#include "lib/orvexjsontrace.h"

namespace
{
volatile LONG s_rglOrvexJsonEnableBits[1] = {0};

// The count is changed under this lock so that a registration and the unregistration of
// the previous last context cannot interleave and leave a live context unregistered.
SRWLOCK s_contextLock = SRWLOCK_INIT;
volatile LONG s_cLiveContexts = 0;

bool OrvexJsonTraceEnabled(const EVENT_DESCRIPTOR &descriptor)
{
    for (ULONG i = 0; i < c_cOrvexJsonTraceBits; i++)
    {
        if (descriptor.Keyword == c_rgullOrvexJsonTraceKeywords[i])
        {
            return TraceProviderBitEnabled(&g_OrvexJsonTraceProvider, i);
        }
    }
    return false;
}
} // namespace

TRACE_PROVIDER_CONTEXT g_OrvexJsonTraceProvider = {0,
                                                   0,
                                                   0,
                                                   0,
                                                   0,
                                                   c_cOrvexJsonTraceBits,
                                                   s_rglOrvexJsonEnableBits,
                                                   c_rgullOrvexJsonTraceKeywords,
                                                   c_rgucOrvexJsonTraceLevels};

void OrvexJsonTraceAddContext()
{
    AcquireSRWLockExclusive(&s_contextLock);
    if (InterlockedIncrement(&s_cLiveContexts) == 1)
    {
        TraceReadEchoSetting();
        TraceProviderRegister(ORVEXJSON_PROVIDER_GUID, &g_OrvexJsonTraceProvider);
    }
    ReleaseSRWLockExclusive(&s_contextLock);
}

void OrvexJsonTraceReleaseContext()
{
    AcquireSRWLockExclusive(&s_contextLock);
    if (InterlockedDecrement(&s_cLiveContexts) == 0)
    {
        TraceProviderUnregister(&g_OrvexJsonTraceProvider);
    }
    ReleaseSRWLockExclusive(&s_contextLock);
}

void OrvexJsonTraceCode(const EVENT_DESCRIPTOR &descriptor, ULONG ulCode)
{
    if (OrvexJsonTraceEnabled(descriptor))
    {
        TraceCode(g_OrvexJsonTraceProvider.hRegistration, &descriptor, ulCode);
    }
}

void OrvexJsonTraceMark(const EVENT_DESCRIPTOR &descriptor)
{
    if (OrvexJsonTraceEnabled(descriptor))
    {
        TraceMark(g_OrvexJsonTraceProvider.hRegistration, &descriptor);
    }
}

void OrvexJsonTraceText(const EVENT_DESCRIPTOR &descriptor, const char *szText)
{
    if (OrvexJsonTraceEnabled(descriptor))
    {
        TraceMessage(g_OrvexJsonTraceProvider.hRegistration, &descriptor, szText);
    }
}
