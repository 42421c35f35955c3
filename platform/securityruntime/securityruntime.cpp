#include "platform/securityruntime/securityruntime.h"
#include "inc/lasterror.h"

#include <sddl.h>
#include <stddef.h>
#include <stdio.h>
#include <wchar.h>

namespace
{
// Every local process may read and write the pipe and set its read mode (0x12018b: generic
// read, write data, write attributes); the system and administrators have full control;
// network logons are refused outright (the pipes also reject remote clients). Generic write
// would include the append right, which on a pipe is the right to create an instance of it:
// any process could then serve the pipe's name to the service's clients.
const wchar_t c_wszPipeDescriptor[] = L"D:(D;;GA;;;NU)(A;;GA;;;SY)(A;;GA;;;BA)(A;;0x12018b;;;WD)";
} // namespace

extern "C" HRESULT WINAPI QueryTransientObjectSecurityDescriptor(
    DWORD dwObjectType, PCWSTR pwszObjectName, PSECURITY_DESCRIPTOR *ppSecurityDescriptor)
{
    if (ppSecurityDescriptor == nullptr)
    {
        return E_POINTER;
    }
    *ppSecurityDescriptor = nullptr;
    if (dwObjectType != TRANSIENT_OBJECT_TYPE_NAMED_PIPE || pwszObjectName == nullptr)
    {
        return E_INVALIDARG;
    }
    if (!ConvertStringSecurityDescriptorToSecurityDescriptorW(c_wszPipeDescriptor, SDDL_REVISION_1,
                                                              ppSecurityDescriptor, nullptr))
    {
        *ppSecurityDescriptor = nullptr;
        return HRESULT_FROM_WIN32(GetLastError());
    }
    return S_OK;
}

extern "C" void WINAPI
FreeTransientObjectSecurityDescriptor(PSECURITY_DESCRIPTOR pSecurityDescriptor)
{
    if (pSecurityDescriptor != nullptr)
    {
        LocalFree(pSecurityDescriptor);
    }
}

namespace
{
// Chamber SIDs are app-container SIDs: S-1-15-2 and seven sub-authorities.
const DWORD c_cChamberRids = 7;
const DWORD c_dwChamberRidKind = 2;

// The failure set for this call, or S_OK. The state is read at every call, so a test in
// another process can change it while the service runs.
HRESULT ChamberStandInFailureOf(PCWSTR pwszCall)
{
    WCHAR wszCall[64] = L"";
    DWORD cb = sizeof(wszCall);
    if (RegGetValueW(HKEY_LOCAL_MACHINE, CHAMBER_STANDIN_KEY, L"FailCall", RRF_RT_REG_SZ, nullptr,
                     wszCall, &cb) != ERROR_SUCCESS ||
        wcscmp(wszCall, pwszCall) != 0)
    {
        return S_OK;
    }
    DWORD dwCode = 0;
    cb = sizeof(dwCode);
    RegGetValueW(HKEY_LOCAL_MACHINE, CHAMBER_STANDIN_KEY, L"FailCode", RRF_RT_REG_DWORD, nullptr,
                 &dwCode, &cb);
    HRESULT hr = static_cast<HRESULT>(dwCode);
    return FAILED(hr) ? hr : CHAMBER_STANDIN_FAILURE;
}

bool ChamberSidIsChamber(PSID pSid)
{
    const SID_IDENTIFIER_AUTHORITY authority = SECURITY_APP_PACKAGE_AUTHORITY;
    if (pSid == nullptr || !IsValidSid(pSid) || *GetSidSubAuthorityCount(pSid) < 1)
    {
        return false;
    }
    return memcmp(GetSidIdentifierAuthority(pSid), &authority, sizeof(authority)) == 0 &&
           *GetSidSubAuthority(pSid, 0) == c_dwChamberRidKind;
}

void ChamberRecordString(HKEY hKey, PCWSTR pwszName, PCWSTR pwszValue)
{
    if (pwszValue == nullptr)
    {
        pwszValue = L"";
    }
    RegSetValueExW(hKey, pwszName, 0, REG_SZ, reinterpret_cast<const BYTE *>(pwszValue),
                   static_cast<DWORD>((wcslen(pwszValue) + 1) * sizeof(WCHAR)));
}

// Where tests look for what was started, and in which chamber.
void ChamberRecordLaunch(PSID pSid, PCWSTR pwszInstance, PCWSTR pwszCommandLine, DWORD dwPid)
{
    HKEY hKey = nullptr;
    if (RegCreateKeyExW(HKEY_LOCAL_MACHINE, CHAMBER_STANDIN_KEY, 0, nullptr, 0,
                        KEY_SET_VALUE | KEY_QUERY_VALUE, nullptr, &hKey, nullptr) != ERROR_SUCCESS)
    {
        return;
    }
    PWSTR pwszSid = nullptr;
    if (ConvertSidToStringSidW(pSid, &pwszSid))
    {
        ChamberRecordString(hKey, L"LastChamberSid", pwszSid);
        LocalFree(pwszSid);
    }
    ChamberRecordString(hKey, L"LastChamberInstance", pwszInstance);
    ChamberRecordString(hKey, L"LastCommandLine", pwszCommandLine);
    RegSetValueExW(hKey, L"LastProcessId", 0, REG_DWORD, reinterpret_cast<const BYTE *>(&dwPid),
                   sizeof(dwPid));
    DWORD dwCount = 0;
    DWORD cb = sizeof(dwCount);
    RegGetValueW(hKey, nullptr, L"LaunchCount", RRF_RT_REG_DWORD, nullptr, &dwCount, &cb);
    dwCount++;
    RegSetValueExW(hKey, L"LaunchCount", 0, REG_DWORD, reinterpret_cast<const BYTE *>(&dwCount),
                   sizeof(dwCount));
    RegCloseKey(hKey);
}
} // namespace

extern "C" HRESULT WINAPI GetChamberSidFromId(PCWSTR pwszChamberId, PSID *ppSid)
{
    if (ppSid == nullptr)
    {
        return E_POINTER;
    }
    *ppSid = nullptr;
    if (pwszChamberId == nullptr || pwszChamberId[0] == L'\0')
    {
        return E_INVALIDARG;
    }
    HRESULT hr = ChamberStandInFailureOf(L"GetChamberSidFromId");
    if (FAILED(hr))
    {
        return hr;
    }
    // The same name gives the same SID in every process: sub-authorities from an FNV-1a hash
    // of the upper-cased name, a different offset for each.
    DWORD rgdwRids[c_cChamberRids];
    for (DWORD i = 0; i < c_cChamberRids; i++)
    {
        ULONGLONG ullHash = 0xcbf29ce484222325ull + i;
        for (PCWSTR pwch = pwszChamberId; *pwch != L'\0'; pwch++)
        {
            WCHAR wch = (*pwch >= L'a' && *pwch <= L'z') ? static_cast<WCHAR>(*pwch - 32) : *pwch;
            ullHash = (ullHash ^ wch) * 0x100000001b3ull;
        }
        rgdwRids[i] = static_cast<DWORD>(ullHash ^ (ullHash >> 32));
    }
    WCHAR wszSid[128];
    swprintf_s(wszSid, L"S-1-15-%lu-%lu-%lu-%lu-%lu-%lu-%lu-%lu", c_dwChamberRidKind, rgdwRids[0],
               rgdwRids[1], rgdwRids[2], rgdwRids[3], rgdwRids[4], rgdwRids[5], rgdwRids[6]);
    if (!ConvertStringSidToSidW(wszSid, ppSid))
    {
        *ppSid = nullptr;
        return HResultFromLastError();
    }
    return S_OK;
}

extern "C" HRESULT WINAPI CreateProcessInChamber(PSID pChamberSid, PCWSTR pwszChamberInstance,
                                                 PCWSTR pwszApplicationName, PWSTR pwszCommandLine,
                                                 BOOL fInheritHandles, DWORD dwCreationFlags,
                                                 PVOID pvEnvironment, LPSTARTUPINFOW pStartupInfo,
                                                 LPPROCESS_INFORMATION pProcessInformation)
{
    if (pStartupInfo == nullptr || pProcessInformation == nullptr)
    {
        return E_POINTER;
    }
    if (!ChamberSidIsChamber(pChamberSid) || pwszChamberInstance == nullptr ||
        pStartupInfo->cb < offsetof(STARTUPINFOW, cb) + sizeof(DWORD))
    {
        return E_INVALIDARG;
    }
    HRESULT hr = ChamberStandInFailureOf(L"CreateProcessInChamber");
    if (FAILED(hr))
    {
        return hr;
    }
    // The caller's block may be the phone's shorter one: take what it has, zero the rest.
    STARTUPINFOW si = {};
    memcpy(&si, pStartupInfo, pStartupInfo->cb < sizeof(si) ? pStartupInfo->cb : sizeof(si));
    si.cb = sizeof(si);
    if (!CreateProcessW(pwszApplicationName, pwszCommandLine, nullptr, nullptr, fInheritHandles,
                        dwCreationFlags, pvEnvironment, nullptr, &si, pProcessInformation))
    {
        return HResultFromLastError();
    }
    ChamberRecordLaunch(pChamberSid, pwszChamberInstance, pwszCommandLine,
                        pProcessInformation->dwProcessId);
    return S_OK;
}

extern "C" HRESULT WINAPI ChamberStandInSetFailure(PCWSTR pwszCall, HRESULT hr)
{
    if (pwszCall != nullptr && wcscmp(pwszCall, L"GetChamberSidFromId") != 0 &&
        wcscmp(pwszCall, L"CreateProcessInChamber") != 0)
    {
        return E_INVALIDARG;
    }
    HKEY hKey = nullptr;
    LSTATUS ls = RegCreateKeyExW(HKEY_LOCAL_MACHINE, CHAMBER_STANDIN_KEY, 0, nullptr, 0,
                                 KEY_SET_VALUE, nullptr, &hKey, nullptr);
    if (ls != ERROR_SUCCESS)
    {
        return HRESULT_FROM_WIN32(ls);
    }
    DWORD dwCode = static_cast<DWORD>(FAILED(hr) ? hr : CHAMBER_STANDIN_FAILURE);
    PCWSTR pwszValue = pwszCall != nullptr ? pwszCall : L"";
    ls = RegSetValueExW(hKey, L"FailCall", 0, REG_SZ, reinterpret_cast<const BYTE *>(pwszValue),
                        static_cast<DWORD>((wcslen(pwszValue) + 1) * sizeof(WCHAR)));
    if (ls == ERROR_SUCCESS)
    {
        ls = RegSetValueExW(hKey, L"FailCode", 0, REG_DWORD,
                            reinterpret_cast<const BYTE *>(&dwCode), sizeof(dwCode));
    }
    RegCloseKey(hKey);
    return HRESULT_FROM_WIN32(ls);
}
