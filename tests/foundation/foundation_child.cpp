// Runs one failure or tracing path in a process of its own, for the tests that need the
// process to end or need a fresh provider registration.
#include "servicelib/diagnostics.h"
#include "servicelib/eventtrace.h"

#include <string.h>

int wmain(int argc, wchar_t **argv)
{
    if (argc < 2)
    {
        return 2;
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
        TelvaneTraceRegister();
        TelvaneTrace("ChildMain() - hello");
        TelvaneTraceFailure("***Child - bad opcode", 0x1234);
        TelvaneTraceUdpFailure("CreateFile (read)", 2);
        TelvaneTraceMark(TelvaneEvent_UdpConfigRead);
        TelvaneTraceCommandLine(L"C:\\programs\\app.exe -x");
        TelvaneTraceUnregister();
        return 0;
    }
    return 2;
}
