// servicetest.dll: a service DLL for the host tests, exporting the same two entry points as
// telvane.dll around the test service of childservice.h, so that a host's stop path can be
// told from the direct one: with "hold-stop", OnStop runs until the test releases it.
#include "tests/service/childservice.h"

namespace
{
CChildService s_service;
const wchar_t c_wszTestGroup[] = L"TelvaneTestGroup";
} // namespace

extern "C" __declspec(dllexport) void WINAPI SvchostPushServiceGlobals(void *pvGlobals)
{
    CService::HostPushServiceGlobals(&s_service, c_wszTestGroup, pvGlobals);
}

// The service takes the name the host starts it under.
extern "C" __declspec(dllexport) void WINAPI ServiceMain(DWORD argc, LPWSTR *argv)
{
    if (argc >= 1 && argv != nullptr && argv[0] != nullptr)
    {
        s_service.Configure(argc, argv);
    }
    CService::HostServiceMain(&s_service, c_wszTestGroup, argc, argv);
}
