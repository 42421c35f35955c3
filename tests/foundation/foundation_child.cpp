// Runs one failure or tracing path in a process of its own, for the tests that need the
// process to end or need a fresh provider registration, and plays the awkward children
// that the test harness itself must judge right.
#include "servicelib/diagnostics.h"
#include "servicelib/eventtrace.h"

#include <string.h>

int wmain(int argc, wchar_t **argv)
{
    if (argc >= 2 && wcscmp(argv[1], L"quiet") == 0)
    {
        // As a benchmark process runs: its debug lines must not reach the output.
        DiagnosticsSetLogQuiet(true);
        DebugLog(L"ChildMain", L"a debug line nobody sees\r\n");
        argc--;
        argv++;
    }
    if (argc < 2)
    {
        return 2;
    }
    if (wcscmp(argv[1], L"figures") == 0)
    {
        const char szFigures[] = "figure 42\n";
        DWORD cbWritten = 0;
        WriteFile(GetStdHandle(STD_OUTPUT_HANDLE), szFigures, sizeof(szFigures) - 1, &cbWritten,
                  nullptr);
        return 0;
    }
    if (wcscmp(argv[1], L"fatal") == 0)
    {
        SetLastError(ERROR_ACCESS_DENIED);
        FATAL_ERROR(L"ChildMain", L"CreateThing", GetLastError());
        return 10; // not reached without a debugger
    }
    if (wcscmp(argv[1], L"assert") == 0)
    {
        int cItems = 2;
        ASSERT_CHECK(L"ChildMain", cItems == 3);
        return 11;
    }
    if (wcscmp(argv[1], L"trace") == 0)
    {
        // Whatever ran before left this behind; registration must not depend on it.
        SetLastError(ERROR_ENVVAR_NOT_FOUND);
        TelvaneTraceRegister();
        TelvaneTrace("ChildMain() - hello");
        TelvaneTraceFailure("***Child - bad opcode", 0x1234);
        TelvaneTraceUdpFailure("CreateFile (read)", 2);
        TelvaneTraceMark(TelvaneEvent_UdpConfigRead);
        TelvaneTraceCommandLine(L"C:\\programs\\app.exe -x");
        TelvaneTraceUnregister();
        return 0;
    }
    if (wcscmp(argv[1], L"passedthenexit") == 0)
    {
        // GoogleTest's closing line, then a failing end.
        const char szPassed[] = "[  PASSED  ] 1 test.\n";
        DWORD cbWritten = 0;
        WriteFile(GetStdHandle(STD_OUTPUT_HANDLE), szPassed, sizeof(szPassed) - 1, &cbWritten,
                  nullptr);
        return 3;
    }
    if (wcscmp(argv[1], L"closeout") == 0)
    {
        // Output ends long before the process does.
        CloseHandle(GetStdHandle(STD_OUTPUT_HANDLE));
        CloseHandle(GetStdHandle(STD_ERROR_HANDLE));
        Sleep(1000);
        return 7;
    }
    if (wcscmp(argv[1], L"env") == 0 && argc >= 3)
    {
        wchar_t wszValue[64] = L"";
        DWORD cch = GetEnvironmentVariableW(argv[2], wszValue, ARRAYSIZE(wszValue));
        char szValue[64];
        int cb = WideCharToMultiByte(CP_ACP, 0, wszValue, -1, szValue, sizeof(szValue), nullptr,
                                     nullptr);
        DWORD cbWritten = 0;
        WriteFile(GetStdHandle(STD_OUTPUT_HANDLE), "value=", 6, &cbWritten, nullptr);
        WriteFile(GetStdHandle(STD_OUTPUT_HANDLE), szValue, cb > 0 ? cb - 1 : 0, &cbWritten,
                  nullptr);
        return cch == 0 ? 3 : 0;
    }
    return 2;
}
