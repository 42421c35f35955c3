#include "servicelib/diagnostics.h"
#include "inc/taggedrefcount.h"

#include <stdio.h>
#include <wchar.h>

namespace
{
const size_t c_cchLine = 1024;
const size_t c_cchMax = 0x7FFFFFFF;
const HRESULT c_hrInsufficientBuffer = 0x8007007A;

PFN_DIAGNOSTICS_LINE volatile s_pfnLogHook = nullptr;
volatile LONG s_fLogQuiet = FALSE;
PFN_DIAGNOSTICS_LINE volatile s_pfnFailureHook = nullptr;

// Standard output gets the low byte of every character, written straight to the handle so
// that nothing sits in a CRT buffer when a fail-fast exception ends the process.
void DiagnosticsWriteStdout(const wchar_t *wszLine)
{
    HANDLE hOut = GetStdHandle(STD_OUTPUT_HANDLE);
    if (hOut == nullptr || hOut == INVALID_HANDLE_VALUE)
    {
        return;
    }
    char rgch[c_cchLine];
    DWORD cb = 0;
    while (wszLine[cb] != L'\0' && cb < c_cchLine)
    {
        rgch[cb] = static_cast<char>(wszLine[cb]);
        cb++;
    }
    DWORD cbWritten = 0;
    WriteFile(hOut, rgch, cb, &cbWritten, nullptr);
}

void DiagnosticsFailFast()
{
    RaiseFailFastException(nullptr, nullptr, FAIL_FAST_GENERATE_EXCEPTION_ADDRESS);
}
} // namespace

// The string-safe contract on top of the Microsoft CRT's counted formatter, which leaves the
// buffer unterminated when the text fills it exactly or is cut.
template <class TChar, class TFormatter>
HRESULT StringCchVPrintfT(TChar *pszDest, size_t cchDest, const TChar *pszFormat, va_list args,
                          TFormatter pfnFormat)
{
    if (cchDest == 0 || cchDest > c_cchMax)
    {
        if (cchDest != 0)
        {
            pszDest[0] = TChar(0);
        }
        return E_INVALIDARG;
    }
    int cch = pfnFormat(pszDest, cchDest - 1, pszFormat, args);
    if (cch < 0 || static_cast<size_t>(cch) > cchDest - 1)
    {
        pszDest[cchDest - 1] = TChar(0);
        return c_hrInsufficientBuffer;
    }
    pszDest[cch] = TChar(0);
    return S_OK;
}

HRESULT StringCchVPrintf(wchar_t *wszDest, size_t cchDest, const wchar_t *wszFormat, va_list args)
{
    return StringCchVPrintfT(wszDest, cchDest, wszFormat, args, _vsnwprintf);
}

HRESULT StringCchVPrintf(char *szDest, size_t cchDest, const char *szFormat, va_list args)
{
    return StringCchVPrintfT(szDest, cchDest, szFormat, args, _vsnprintf);
}

HRESULT StringCchPrintf(wchar_t *wszDest, size_t cchDest, const wchar_t *wszFormat, ...)
{
    va_list args;
    va_start(args, wszFormat);
    HRESULT hr = StringCchVPrintf(wszDest, cchDest, wszFormat, args);
    va_end(args);
    return hr;
}

HRESULT StringCchPrintf(char *szDest, size_t cchDest, const char *szFormat, ...)
{
    va_list args;
    va_start(args, szFormat);
    HRESULT hr = StringCchVPrintf(szDest, cchDest, szFormat, args);
    va_end(args);
    return hr;
}

namespace
{
// Failure reports are written whatever the quiet setting: a benchmark that dies must say why.
void DiagnosticsVLog(bool fFailure, const wchar_t *wszFunction, const wchar_t *wszFormat,
                     va_list args)
{
    SYSTEMTIME st;
    GetLocalTime(&st);
    wchar_t wszLine[c_cchLine];
    StringCchPrintf(wszLine, c_cchLine, L"[%02d:%02d:%02d] %s: ", st.wHour, st.wMinute, st.wSecond,
                    wszFunction != nullptr ? wszFunction : L"(null)");
    size_t cchPrefix = wcslen(wszLine);
    StringCchVPrintf(wszLine + cchPrefix, c_cchLine - cchPrefix, wszFormat, args);

    if (fFailure || !InterlockedCompareExchange(&s_fLogQuiet, FALSE, FALSE))
    {
        OutputDebugStringW(wszLine);
        DiagnosticsWriteStdout(wszLine);
    }
    PFN_DIAGNOSTICS_LINE pfnHook = s_pfnLogHook;
    if (pfnHook != nullptr)
    {
        pfnHook(wszLine);
    }
}

void DiagnosticsFailureLog(const wchar_t *wszFunction, const wchar_t *wszFormat, ...)
{
    va_list args;
    va_start(args, wszFormat);
    DiagnosticsVLog(true, wszFunction, wszFormat, args);
    va_end(args);
}
} // namespace

void DebugLog(const wchar_t *wszFunction, const wchar_t *wszFormat, ...)
{
    va_list args;
    va_start(args, wszFormat);
    DiagnosticsVLog(false, wszFunction, wszFormat, args);
    va_end(args);
}

bool Assert(const wchar_t *wszFunction, const wchar_t *wszFile, ULONG ulLine,
            const wchar_t *wszExpression)
{
    DiagnosticsFailureLog(wszFunction, L"%s(%d): Assertion failure: %s\r\n", wszFile, ulLine,
                          wszExpression);
    PFN_DIAGNOSTICS_LINE pfnHook = s_pfnFailureHook;
    if (pfnHook != nullptr)
    {
        wchar_t wszLine[c_cchLine];
        StringCchPrintf(wszLine, c_cchLine, L"%s(%d): Assertion failure: %s", wszFile, ulLine,
                        wszExpression);
        pfnHook(wszLine);
        return true;
    }
    if (!IsDebuggerPresent())
    {
        DiagnosticsFailFast();
    }
    return false;
}

void FatalError(const wchar_t *wszFunction, const wchar_t *wszFile, ULONG ulLine,
                const wchar_t *wszCall, ULONG ulCode)
{
    wchar_t wszMessage[c_cchLine];
    DWORD cch = FormatMessageW(FORMAT_MESSAGE_FROM_SYSTEM | FORMAT_MESSAGE_IGNORE_INSERTS, nullptr,
                               ulCode, 0, wszMessage, c_cchLine, nullptr);
    if (cch == 0)
    {
        StringCchPrintf(wszMessage, c_cchLine, L"%s", L"(unknown error code)");
    }
    DiagnosticsFailureLog(wszFunction, L"%s(%d): Fatal error 0x%x from %s: %s\r\n", wszFile, ulLine,
                          ulCode, wszCall, wszMessage);
    PFN_DIAGNOSTICS_LINE pfnHook = s_pfnFailureHook;
    if (pfnHook != nullptr)
    {
        wchar_t wszLine[c_cchLine];
        StringCchPrintf(wszLine, c_cchLine, L"%s: Fatal error 0x%x from %s", wszFunction, ulCode,
                        wszCall);
        pfnHook(wszLine);
        return;
    }
    if (IsDebuggerPresent())
    {
        DebugBreak();
        return;
    }
    DiagnosticsFailFast();
}

void DiagnosticsSetLogHook(PFN_DIAGNOSTICS_LINE pfnHook)
{
    s_pfnLogHook = pfnHook;
}

void DiagnosticsSetFailureHook(PFN_DIAGNOSTICS_LINE pfnHook)
{
    s_pfnFailureHook = pfnHook;
}

void DiagnosticsSetLogQuiet(bool fQuiet)
{
    InterlockedExchange(&s_fLogQuiet, fQuiet ? TRUE : FALSE);
}

void TaggedRefFailure(const wchar_t *wszFunction, const wchar_t *wszFile, unsigned long ulLine,
                      const wchar_t *wszCall)
{
    FatalError(wszFunction, wszFile, ulLine, wszCall, GetLastError());
}
