// An own-process service for the tests that need the shell's ServiceMain under the real
// control manager without a host (see childservice.h for its start parameters). "-d" is the
// shell's debug switch, whose breakpoints are counted here instead of ending the process.
#include "tests/service/childservice.h"

namespace
{
// DebugBreak without a debugger would end the process: count it and step over the int3.
LONG CALLBACK ChildBreakpointHandler(PEXCEPTION_POINTERS pException)
{
    if (pException->ExceptionRecord->ExceptionCode != EXCEPTION_BREAKPOINT)
    {
        return EXCEPTION_CONTINUE_SEARCH;
    }
    InterlockedIncrement(&g_cChildBreakpoints);
#if defined(_M_X64) || defined(__x86_64__)
    if (*reinterpret_cast<const BYTE *>(pException->ContextRecord->Rip) == 0xCC)
    {
        pException->ContextRecord->Rip++;
    }
#endif
    return EXCEPTION_CONTINUE_EXECUTION;
}

CChildService s_service;

VOID WINAPI ChildServiceMain(DWORD argc, LPWSTR *argv)
{
    s_service.Configure(argc, argv);
    CService::RegisterService(&s_service);
    s_service.ServiceMain(argc, argv);
}
} // namespace

int wmain(int argc, wchar_t **argv)
{
    AddVectoredExceptionHandler(1, ChildBreakpointHandler);
    // An own-process dispatcher serves whatever name the control manager starts it under.
    wchar_t wszName[] = L"TelvaneTestChild";
    SERVICE_TABLE_ENTRYW rgTable[] = {{wszName, ChildServiceMain}, {nullptr, nullptr}};
    return StartServiceCtrlDispatcherW(rgTable) ? 0 : static_cast<int>(GetLastError());
}
