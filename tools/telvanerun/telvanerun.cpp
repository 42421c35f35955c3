// Command-line runner of telvane.dll: loads the DLL from its own folder and hands it the
// command line, which runs the service in console mode (no switch), registers it (-r) or
// unregisters it (-u). The DLL ends the process with exit code 3 for a command line it does
// not understand; 2 here means the DLL could not be loaded.
#include "servicelib/service.h"

#include <objbase.h>
#include <stdio.h>
#include <string>

namespace
{
const int c_iExitCannotLoad = 2;

typedef void(WINAPI *PFN_SVCHOST_PUSH_SERVICE_GLOBALS)(void *pvGlobals);

std::wstring TelvaneRunDllPath()
{
    wchar_t wszPath[MAX_PATH];
    DWORD cch = GetModuleFileNameW(nullptr, wszPath, MAX_PATH);
    std::wstring wstrPath(wszPath, cch < MAX_PATH ? cch : 0);
    return wstrPath.substr(0, wstrPath.find_last_of(L"\\/") + 1) + L"telvane.dll";
}
} // namespace

int wmain(int argc, wchar_t **argv)
{
    // The service creates COM objects from thread-pool threads, which join the process's
    // multithreaded apartment only while some thread keeps it alive.
    HRESULT hr = CoInitializeEx(nullptr, COINIT_MULTITHREADED);

    std::wstring wstrDll = TelvaneRunDllPath();
    HMODULE hDll = LoadLibraryW(wstrDll.c_str());
    if (hDll == nullptr)
    {
        fprintf(stderr, "telvanerun: cannot load %ls (error %lu)\n", wstrDll.c_str(),
                GetLastError());
        return c_iExitCannotLoad;
    }
    PFN_SVCHOST_PUSH_SERVICE_GLOBALS pfnPush = reinterpret_cast<PFN_SVCHOST_PUSH_SERVICE_GLOBALS>(
        reinterpret_cast<void *>(GetProcAddress(hDll, "SvchostPushServiceGlobals")));
    if (pfnPush == nullptr)
    {
        fprintf(stderr, "telvanerun: %ls exports no SvchostPushServiceGlobals\n", wstrDll.c_str());
        FreeLibrary(hDll);
        return c_iExitCannotLoad;
    }

    SERVICE_COMMAND_LINE commandLine = {c_ulCommandLineMagic, static_cast<ULONG_PTR>(argc), argv};
    pfnPush(&commandLine);

    FreeLibrary(hDll);
    if (SUCCEEDED(hr))
    {
        CoUninitialize();
    }
    return 0;
}
