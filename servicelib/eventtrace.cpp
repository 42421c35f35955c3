#include "servicelib/eventtrace.h"
#include "servicelib/diagnostics.h"

#include <string.h>
#include <wchar.h>

namespace
{
volatile LONG s_rglTelvaneEnableBits[1] = {0};
PFN_TRACE_WRITE volatile s_pfnWriteHook = nullptr;
volatile bool s_fEcho = false;

const char c_szNull[] = "NULL";
const wchar_t c_wszNull[] = L"NULL";

void TraceWrite(REGHANDLE hProvider, const EVENT_DESCRIPTOR *pDescriptor, ULONG cData,
                EVENT_DATA_DESCRIPTOR *pData)
{
    PFN_TRACE_WRITE pfnHook = s_pfnWriteHook;
    if (pfnHook != nullptr)
    {
        pfnHook(hProvider, pDescriptor, cData, pData);
        return;
    }
    EventWrite(hProvider, pDescriptor, cData, pData);
}
} // namespace

TRACE_PROVIDER_CONTEXT g_TelvaneTraceProvider = {0,
                                                 0,
                                                 0,
                                                 0,
                                                 0,
                                                 c_cTelvaneTraceBits,
                                                 s_rglTelvaneEnableBits,
                                                 c_rgullTelvaneTraceKeywords,
                                                 c_rgucTelvaneTraceLevels};

void NTAPI TraceProviderEnableCallback(LPCGUID pSourceId, ULONG ulIsEnabled, UCHAR ucLevel,
                                       ULONGLONG ullMatchAnyKeyword, ULONGLONG ullMatchAllKeyword,
                                       PEVENT_FILTER_DESCRIPTOR pFilterData, PVOID pvContext)
{
    TRACE_PROVIDER_CONTEXT *pContext = static_cast<TRACE_PROVIDER_CONTEXT *>(pvContext);
    if (pContext == nullptr)
    {
        return;
    }
    switch (ulIsEnabled)
    {
    case EVENT_CONTROL_CODE_ENABLE_PROVIDER: {
        pContext->ucLevel = ucLevel;
        pContext->ullMatchAnyKeyword = ullMatchAnyKeyword;
        pContext->ullMatchAllKeyword = ullMatchAllKeyword;
        pContext->ulIsEnabled = 1;
        for (ULONG i = 0; i < pContext->cEnableBits; i++)
        {
            ULONGLONG ullKeyword = pContext->pullEnableKeywords[i];
            bool fLevel = pContext->pucEnableLevels[i] <= ucLevel || ucLevel == 0;
            bool fKeyword =
                ullKeyword == 0 || ((ullKeyword & ullMatchAnyKeyword) != 0 &&
                                    (ullKeyword & ullMatchAllKeyword) == ullMatchAllKeyword);
            LONG lMask = static_cast<LONG>(1u << (i % 32));
            if (fLevel && fKeyword)
            {
                InterlockedOr(&pContext->plEnableBits[i / 32], lMask);
            }
            else
            {
                InterlockedAnd(&pContext->plEnableBits[i / 32], ~lMask);
            }
        }
        break;
    }
    case EVENT_CONTROL_CODE_DISABLE_PROVIDER:
        pContext->ulIsEnabled = 0;
        pContext->ucLevel = 0;
        pContext->ullMatchAnyKeyword = 0;
        pContext->ullMatchAllKeyword = 0;
        for (ULONG i = 0; i < (pContext->cEnableBits + 31) / 32; i++)
        {
            InterlockedExchange(&pContext->plEnableBits[i], 0);
        }
        break;
    default:
        break;
    }
}

bool TraceProviderBitEnabled(const TRACE_PROVIDER_CONTEXT *pContext, ULONG ulBit)
{
    return (pContext->plEnableBits[ulBit / 32] & static_cast<LONG>(1u << (ulBit % 32))) != 0;
}

void TraceProviderRegister(const GUID &guid, TRACE_PROVIDER_CONTEXT *pContext)
{
    if (pContext->hRegistration == 0)
    {
        EventRegister(&guid, TraceProviderEnableCallback, pContext, &pContext->hRegistration);
    }
    if (s_fEcho)
    {
        // The stand-in for a trace session that listens to everything.
        TraceProviderEnableCallback(&guid, EVENT_CONTROL_CODE_ENABLE_PROVIDER, 0, ~0ull, 0, nullptr,
                                    pContext);
    }
}

void TraceProviderUnregister(TRACE_PROVIDER_CONTEXT *pContext)
{
    if (pContext->hRegistration != 0)
    {
        EventUnregister(pContext->hRegistration);
        pContext->hRegistration = 0;
    }
}

void TraceMessage(REGHANDLE hProvider, const EVENT_DESCRIPTOR *pDescriptor, const char *szText)
{
    const char *sz = szText != nullptr ? szText : c_szNull;
    EVENT_DATA_DESCRIPTOR data;
    EventDataDescCreate(&data, sz, static_cast<ULONG>(strlen(sz) + 1));
    TraceWrite(hProvider, pDescriptor, 1, &data);
    if (s_fEcho)
    {
        DebugLog(L"EventTrace", L"%u %S\r\n", pDescriptor->Id, sz);
    }
}

void TraceFailure(REGHANDLE hProvider, const EVENT_DESCRIPTOR *pDescriptor, const char *szText,
                  ULONG ulCode)
{
    const char *sz = szText != nullptr ? szText : c_szNull;
    EVENT_DATA_DESCRIPTOR rgData[2];
    EventDataDescCreate(&rgData[0], sz, static_cast<ULONG>(strlen(sz) + 1));
    EventDataDescCreate(&rgData[1], &ulCode, sizeof(ulCode));
    TraceWrite(hProvider, pDescriptor, 2, rgData);
    if (s_fEcho)
    {
        DebugLog(L"EventTrace", L"%u %S 0x%x\r\n", pDescriptor->Id, sz, ulCode);
    }
}

void TraceMark(REGHANDLE hProvider, const EVENT_DESCRIPTOR *pDescriptor)
{
    TraceWrite(hProvider, pDescriptor, 0, nullptr);
    if (s_fEcho)
    {
        DebugLog(L"EventTrace", L"%u\r\n", pDescriptor->Id);
    }
}

void TraceCode(REGHANDLE hProvider, const EVENT_DESCRIPTOR *pDescriptor, ULONG ulCode)
{
    EVENT_DATA_DESCRIPTOR data;
    EventDataDescCreate(&data, &ulCode, sizeof(ulCode));
    TraceWrite(hProvider, pDescriptor, 1, &data);
    if (s_fEcho)
    {
        DebugLog(L"EventTrace", L"%u 0x%x\r\n", pDescriptor->Id, ulCode);
    }
}

void TraceWideMessage(REGHANDLE hProvider, const wchar_t *wszText)
{
    const wchar_t *wsz = wszText != nullptr ? wszText : c_wszNull;
    EVENT_DATA_DESCRIPTOR data;
    EventDataDescCreate(&data, wsz, static_cast<ULONG>((wcslen(wsz) + 1) * sizeof(wchar_t)));
    TraceWrite(hProvider, &TelvaneEvent_UdpLaunch, 1, &data);
    if (s_fEcho)
    {
        DebugLog(L"EventTrace", L"%u %s\r\n", TelvaneEvent_UdpLaunch.Id, wsz);
    }
}

void TraceReadEchoSetting()
{
    // An empty value is read as length 0 without touching the last error, so clear it first
    // or an error left by earlier code would hide the variable.
    wchar_t wszValue[8];
    SetLastError(ERROR_SUCCESS);
    if (GetEnvironmentVariableW(L"TELVANE_TRACE_STDOUT", wszValue, ARRAYSIZE(wszValue)) != 0 ||
        GetLastError() != ERROR_ENVVAR_NOT_FOUND)
    {
        s_fEcho = true;
    }
}

void TelvaneTraceRegister()
{
    TraceReadEchoSetting();
    TraceProviderRegister(TELVANE_PROVIDER_GUID, &g_TelvaneTraceProvider);
}

void TelvaneTraceUnregister()
{
    TraceProviderUnregister(&g_TelvaneTraceProvider);
}

void TelvaneTrace(const char *szText)
{
    if (TelvaneTraceEnabled(TelvaneTraceBitMessage))
    {
        TraceMessage(g_TelvaneTraceProvider.hRegistration, &TelvaneEvent_Message, szText);
    }
}

void TelvaneTraceF(const char *szFormat, ...)
{
    if (!TelvaneTraceEnabled(TelvaneTraceBitMessage))
    {
        return;
    }
    char szText[512];
    va_list args;
    va_start(args, szFormat);
    StringCchVPrintf(szText, ARRAYSIZE(szText), szFormat, args);
    va_end(args);
    TraceMessage(g_TelvaneTraceProvider.hRegistration, &TelvaneEvent_Message, szText);
}

void TelvaneTraceFailure(const char *szText, ULONG ulCode)
{
    if (TelvaneTraceEnabled(TelvaneTraceBitFailure))
    {
        TraceFailure(g_TelvaneTraceProvider.hRegistration, &TelvaneEvent_Failure, szText, ulCode);
    }
}

void TelvaneTraceUdpFailure(const char *szText, ULONG ulCode)
{
    if (TelvaneTraceEnabled(TelvaneTraceBitUdp))
    {
        TraceFailure(g_TelvaneTraceProvider.hRegistration, &TelvaneEvent_UdpFailure, szText,
                     ulCode);
    }
}

void TelvaneTraceMark(const EVENT_DESCRIPTOR &descriptor)
{
    if (TelvaneTraceEnabled(TelvaneTraceBitMessage))
    {
        TraceMark(g_TelvaneTraceProvider.hRegistration, &descriptor);
    }
}

void TelvaneTraceCommandLine(const wchar_t *wszCommandLine)
{
    if (TelvaneTraceEnabled(TelvaneTraceBitMessage))
    {
        TraceWideMessage(g_TelvaneTraceProvider.hRegistration, wszCommandLine);
    }
}

void TraceSetWriteHook(PFN_TRACE_WRITE pfnHook)
{
    s_pfnWriteHook = pfnHook;
}
