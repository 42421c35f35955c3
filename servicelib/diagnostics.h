// Debug log, failure reports and bounded formatting shared by every part of the service.
// All functions may run on any thread at once; each formats into its own stack buffer.
#pragma once

#include <windows.h>
#include <stdarg.h>

// Source file as it is named in failure reports (the build maps the tree root away).
#define TELVANE_WFILE L"" __FILE__

// Bounded formatting with the platform's string-safe results: E_INVALIDARG for a capacity
// of 0 or above 0x7FFFFFFF, 0x8007007A when the text was cut, S_OK otherwise. The output
// is always terminated when the capacity is non-zero. Formats follow the Microsoft CRT
// (%s is a wide string in the wide variant).
HRESULT StringCchPrintf(wchar_t *wszDest, size_t cchDest, const wchar_t *wszFormat, ...);
HRESULT StringCchPrintf(char *szDest, size_t cchDest, const char *szFormat, ...);
HRESULT StringCchVPrintf(wchar_t *wszDest, size_t cchDest, const wchar_t *wszFormat, va_list args);
HRESULT StringCchVPrintf(char *szDest, size_t cchDest, const char *szFormat, va_list args);

// "[hh:mm:ss] function: " followed by the message, cut at 1023 characters; to the debugger
// and, one byte per character, to standard output.
void DebugLog(const wchar_t *wszFunction, const wchar_t *wszFormat, ...);

// Logs the failed assertion and ends the process with a fail-fast exception unless a
// debugger is attached. Returns false when it returns under a debugger.
bool Assert(const wchar_t *wszFunction, const wchar_t *wszFile, ULONG ulLine,
            const wchar_t *wszExpression);

// Logs "Fatal error 0x%x from <call>: <system text>" and ends the process with a fail-fast
// exception unless a debugger is attached; under a debugger it breaks and returns.
void FatalError(const wchar_t *wszFunction, const wchar_t *wszFile, ULONG ulLine,
                const wchar_t *wszCall, ULONG ulCode);

// The assertion check: reports a false condition, and breaks into the debugger when the
// report returns.
#define ASSERT_CHECK(wszFunction, expr)                                                            \
    do                                                                                             \
    {                                                                                              \
        if (!(expr) && !Assert((wszFunction), TELVANE_WFILE, __LINE__, L"" #expr))                 \
        {                                                                                          \
            DebugBreak();                                                                          \
        }                                                                                          \
    } while (0)

#define FATAL_ERROR(wszFunction, wszCall, ulCode)                                                  \
    FatalError((wszFunction), TELVANE_WFILE, __LINE__, (wszCall), (ULONG)(ulCode))

// Test seams. A log hook sees every debug line after it is written. A failure hook takes
// the place of the debugger: Assert and FatalError hand it their line and return to the
// caller instead of ending the process (Assert then returns true, so no break follows).
typedef void (*PFN_DIAGNOSTICS_LINE)(const wchar_t *wszLine);
void DiagnosticsSetLogHook(PFN_DIAGNOSTICS_LINE pfnHook);
void DiagnosticsSetFailureHook(PFN_DIAGNOSTICS_LINE pfnHook);

// For processes whose output is their figures (the benchmarks): debug lines still reach the
// log hook, but neither the debugger nor standard output. Failure reports always do.
void DiagnosticsSetLogQuiet(bool fQuiet);
