// Stand-in for the phone's endpoint directory library: resolves a web service role to the
// URL prefix its service answers under. The roles live as values of a registry key that
// tests and "telvanectl platform endpoint" set, so another process can point a role at a
// local service. The functions may be called from any thread.
#pragma once

#include <windows.h>

// HKEY_LOCAL_MACHINE key of the stand-in: one REG_SZ value per role name, holding the URL
// prefix (ending in '/', since callers append their path to it unchanged).
#define ENDPOINT_DIRECTORY_KEY L"Software\\Telvane\\StandIns\\EndpointDirectory"

#ifdef __cplusplus
extern "C"
{
#endif

    // On success *ppwszEndpoint receives the role's URL prefix, which the caller hands to
    // ReleaseEndpoint. dwFlags must be 0. A role without a value fails with 0x80070002;
    // on failure *ppwszEndpoint is null.
    HRESULT WINAPI GetServiceEndpoint(PCWSTR pwszRoleName, PWSTR *ppwszEndpoint, DWORD dwFlags);

    // Frees what GetServiceEndpoint returned; null is accepted.
    void WINAPI ReleaseEndpoint(PWSTR pwszEndpoint);

#ifdef __cplusplus
}
#endif
