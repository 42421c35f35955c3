// Entry points of telvane.dll: the DLL entry and the two exports the service host (or a
// command-line runner) calls.
#include "service/telvaneservice.h"
#include "servicelib/eventtrace.h"

// The one coordinator of the DLL.
TelvaneService g_TelvaneService;

BOOL WINAPI DllMain(HINSTANCE hInstance, DWORD dwReason, LPVOID pvReserved)
{
    switch (dwReason)
    {
    case DLL_PROCESS_ATTACH:
        DisableThreadLibraryCalls(hInstance);
        TelvaneTraceRegister();
        break;
    case DLL_PROCESS_DETACH:
        TelvaneTraceUnregister();
        break;
    default:
        break;
    }
    return TRUE;
}

// The host's global data block, or a runner's command-line block.
extern "C" __declspec(dllexport) void WINAPI SvchostPushServiceGlobals(void *pvGlobals)
{
    CService::HostPushServiceGlobals(&g_TelvaneService, c_wszTelvaneGroup, pvGlobals);
}

extern "C" __declspec(dllexport) void WINAPI ServiceMain(DWORD argc, LPWSTR *argv)
{
    CService::HostServiceMain(&g_TelvaneService, c_wszTelvaneGroup, argc, argv);
}
