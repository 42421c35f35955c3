// A service host like the phone's: "telvanehost.exe -k GROUP" serves every service the host
// group key lists for GROUP. Each service's "ServiceDll" is loaded and handed the host's
// global data block through SvchostPushServiceGlobals before the control dispatcher runs;
// the block's RegisterStopCallback is real, so a STOP reaches the service through its stop
// event and callback as it does on the phone. The DLLs are unloaded once the dispatcher has
// returned and no stop callback is running.
#include "tools/telvanehost/hoststopcallback.h"
#include "servicelib/diagnostics.h"
#include "servicelib/reghelper.h"
#include "servicelib/service.h"

#include <objbase.h>
#include <stdio.h>
#include <string>
#include <vector>

namespace
{
const int c_iExitUsage = 3;
const int c_iExitNoService = 1;
const DWORD c_dwStopCallbackWaitMs = 30000;

typedef void(WINAPI *PFN_SVCHOST_PUSH_SERVICE_GLOBALS)(void *pvGlobals);

// One service of the group. Filled by the main thread before the dispatcher starts and only
// read afterwards, from the dispatcher's service threads.
struct HOSTED_SERVICE
{
    std::wstring wstrName;
    HMODULE hDll;
    LPSERVICE_MAIN_FUNCTIONW pfnServiceMain;
    DWORD dwLoadError;
};

std::vector<HOSTED_SERVICE> s_rgServices;
SVCHOST_GLOBAL_DATA s_globals = {};

void HostLoadService(HOSTED_SERVICE &service)
{
    const wchar_t *wszFunction = L"telvanehost";
    wchar_t wszKey[MAX_PATH];
    if (FAILED(StringCchPrintf(wszKey, MAX_PATH, c_wszServiceParametersKeyFormat,
                               service.wstrName.c_str())))
    {
        service.dwLoadError = ERROR_INVALID_NAME;
        return;
    }
    std::wstring wstrDll = RegHelperGetString(wszKey, L"ServiceDll");
    if (wstrDll.empty())
    {
        DebugLog(wszFunction, L"%s has no ServiceDll\r\n", service.wstrName.c_str());
        service.dwLoadError = ERROR_FILE_NOT_FOUND;
        return;
    }
    // A DLL may name its entry point; ServiceMain is the default.
    std::wstring wstrEntry = RegHelperGetString(wszKey, L"ServiceMain");
    std::string strEntry = "ServiceMain";
    if (!wstrEntry.empty())
    {
        strEntry.assign(wstrEntry.begin(), wstrEntry.end());
    }

    service.hDll = LoadLibraryExW(wstrDll.c_str(), nullptr, LOAD_WITH_ALTERED_SEARCH_PATH);
    if (service.hDll == nullptr)
    {
        service.dwLoadError = GetLastError();
        DebugLog(wszFunction, L"Cannot load %s for %s: %u\r\n", wstrDll.c_str(),
                 service.wstrName.c_str(), service.dwLoadError);
        return;
    }
    service.pfnServiceMain = reinterpret_cast<LPSERVICE_MAIN_FUNCTIONW>(
        reinterpret_cast<void *>(GetProcAddress(service.hDll, strEntry.c_str())));
    if (service.pfnServiceMain == nullptr)
    {
        service.dwLoadError = GetLastError();
        DebugLog(wszFunction, L"%s exports no %S\r\n", wstrDll.c_str(), strEntry.c_str());
        return;
    }
    PFN_SVCHOST_PUSH_SERVICE_GLOBALS pfnPush = reinterpret_cast<PFN_SVCHOST_PUSH_SERVICE_GLOBALS>(
        reinterpret_cast<void *>(GetProcAddress(service.hDll, "SvchostPushServiceGlobals")));
    if (pfnPush != nullptr)
    {
        pfnPush(&s_globals);
    }
    DebugLog(wszFunction, L"%s served from %s\r\n", service.wstrName.c_str(), wstrDll.c_str());
}

// The dispatcher's entry for every service of the group: argv[0] names the one to start.
VOID WINAPI HostServiceMain(DWORD argc, LPWSTR *argv)
{
    const wchar_t *wszName = (argc >= 1 && argv != nullptr) ? argv[0] : nullptr;
    DWORD dwError = ERROR_SERVICE_NOT_IN_EXE;
    for (const HOSTED_SERVICE &service : s_rgServices)
    {
        if (wszName != nullptr &&
            CompareStringOrdinal(service.wstrName.c_str(), -1, wszName, -1, TRUE) == CSTR_EQUAL)
        {
            if (service.pfnServiceMain != nullptr)
            {
                service.pfnServiceMain(argc, argv);
                return;
            }
            dwError = service.dwLoadError;
            break;
        }
    }
    CService::ReportStartFailure(wszName, SERVICE_WIN32_SHARE_PROCESS, dwError);
}
} // namespace

int wmain(int argc, wchar_t **argv)
{
    if (argc != 3 || (wcscmp(argv[1], L"-k") != 0 && wcscmp(argv[1], L"/k") != 0))
    {
        fprintf(stderr, "usage: telvanehost -k GROUP\n");
        return c_iExitUsage;
    }
    const wchar_t *wszGroup = argv[2];
    std::vector<std::wstring> rgNames = RegHelperGetMultiString(c_wszSvchostGroupKey, wszGroup);
    if (rgNames.empty())
    {
        fprintf(stderr, "telvanehost: no services in group %ls\n", wszGroup);
        return c_iExitNoService;
    }

    // Services create COM objects from thread-pool threads; those join the multithreaded
    // apartment only while a thread of the process holds it.
    HRESULT hr = CoInitializeEx(nullptr, COINIT_MULTITHREADED);

    s_globals.RegisterStopCallback = HostRegisterStopCallback;
    for (const std::wstring &wstrName : rgNames)
    {
        s_rgServices.push_back(HOSTED_SERVICE{wstrName, nullptr, nullptr, ERROR_SUCCESS});
    }
    for (HOSTED_SERVICE &service : s_rgServices)
    {
        HostLoadService(service);
    }

    std::vector<SERVICE_TABLE_ENTRYW> rgTable;
    for (HOSTED_SERVICE &service : s_rgServices)
    {
        rgTable.push_back(SERVICE_TABLE_ENTRYW{&service.wstrName[0], HostServiceMain});
    }
    rgTable.push_back(SERVICE_TABLE_ENTRYW{nullptr, nullptr});

    int iExit = 0;
    if (!StartServiceCtrlDispatcherW(rgTable.data()))
    {
        fprintf(stderr, "telvanehost: the control dispatcher did not start (error %lu)\n",
                GetLastError());
        iExit = c_iExitNoService;
    }

    if (!HostWaitForStopCallbacks(c_dwStopCallbackWaitMs))
    {
        // Unloading now would pull the code out from under a running callback.
        DebugLog(L"telvanehost", L"A stop callback is still running; DLLs stay loaded\r\n");
    }
    else
    {
        for (HOSTED_SERVICE &service : s_rgServices)
        {
            if (service.hDll != nullptr)
            {
                FreeLibrary(service.hDll);
                service.hDll = nullptr;
            }
        }
    }
    if (SUCCEEDED(hr))
    {
        CoUninitialize();
    }
    return iExit;
}
