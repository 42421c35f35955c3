#include "platform/certprovisioning/certprovisioning.h"

extern "C" HRESULT WINAPI GOVCPC_ProvisionGOVCertificate(void)
{
    HKEY hKey = nullptr;
    if (RegCreateKeyExW(HKEY_LOCAL_MACHINE, GOVCPC_STANDIN_KEY, 0, nullptr, 0,
                        KEY_QUERY_VALUE | KEY_SET_VALUE, nullptr, &hKey, nullptr) != ERROR_SUCCESS)
    {
        // Nobody configured the stand-in: the default answer.
        return S_OK;
    }
    DWORD dwCalls = 0;
    DWORD cb = sizeof(dwCalls);
    if (RegGetValueW(hKey, nullptr, L"Calls", RRF_RT_REG_DWORD, nullptr, &dwCalls, &cb) !=
        ERROR_SUCCESS)
    {
        dwCalls = 0;
    }
    dwCalls++;
    RegSetValueExW(hKey, L"Calls", 0, REG_DWORD, reinterpret_cast<const BYTE *>(&dwCalls),
                   sizeof(dwCalls));
    DWORD dwResult = S_OK;
    cb = sizeof(dwResult);
    if (RegGetValueW(hKey, nullptr, L"Result", RRF_RT_REG_DWORD, nullptr, &dwResult, &cb) !=
        ERROR_SUCCESS)
    {
        dwResult = S_OK;
    }
    RegCloseKey(hKey);
    return static_cast<HRESULT>(dwResult);
}
