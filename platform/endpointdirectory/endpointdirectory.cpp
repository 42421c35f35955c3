#include "platform/endpointdirectory/endpointdirectory.h"

namespace
{
// Another process may rewrite the value between the size query and the read; a few
// rounds settle it.
const int c_cReadAttempts = 4;
} // namespace

extern "C" HRESULT WINAPI GetServiceEndpoint(PCWSTR pwszRoleName, PWSTR *ppwszEndpoint,
                                             DWORD dwFlags)
{
    if (ppwszEndpoint == nullptr)
    {
        return E_POINTER;
    }
    *ppwszEndpoint = nullptr;
    if (pwszRoleName == nullptr || *pwszRoleName == L'\0' || dwFlags != 0)
    {
        return E_INVALIDARG;
    }
    LSTATUS status = ERROR_MORE_DATA;
    for (int i = 0; i < c_cReadAttempts && status == ERROR_MORE_DATA; i++)
    {
        DWORD cb = 0;
        status = RegGetValueW(HKEY_LOCAL_MACHINE, ENDPOINT_DIRECTORY_KEY, pwszRoleName,
                              RRF_RT_REG_SZ, nullptr, nullptr, &cb);
        if (status != ERROR_SUCCESS)
        {
            break;
        }
        PWSTR pwsz = static_cast<PWSTR>(HeapAlloc(GetProcessHeap(), 0, cb + sizeof(wchar_t)));
        if (pwsz == nullptr)
        {
            return E_OUTOFMEMORY;
        }
        status = RegGetValueW(HKEY_LOCAL_MACHINE, ENDPOINT_DIRECTORY_KEY, pwszRoleName,
                              RRF_RT_REG_SZ, nullptr, pwsz, &cb);
        if (status == ERROR_SUCCESS && pwsz[0] == L'\0')
        {
            // An empty value resolves nothing; callers would request a bare path.
            status = ERROR_FILE_NOT_FOUND;
        }
        if (status != ERROR_SUCCESS)
        {
            HeapFree(GetProcessHeap(), 0, pwsz);
            continue;
        }
        *ppwszEndpoint = pwsz;
    }
    return status == ERROR_SUCCESS ? S_OK : HRESULT_FROM_WIN32(status);
}

extern "C" void WINAPI ReleaseEndpoint(PWSTR pwszEndpoint)
{
    if (pwszEndpoint != nullptr)
    {
        HeapFree(GetProcessHeap(), 0, pwszEndpoint);
    }
}
