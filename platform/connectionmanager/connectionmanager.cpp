#include "platform/connectionmanager/connectionmanager.h"

#include <stdio.h>
#include <string>
#include <vector>

namespace
{
// Calls of one process are recorded one at a time; another process writing at the same
// moment could lose a line, which the tests that read the record never do.
SRWLOCK s_recordLock = SRWLOCK_INIT;

DWORD CmStandInDword(const wchar_t *wszName)
{
    DWORD dw = 0;
    DWORD cb = sizeof(dw);
    if (RegGetValueW(HKEY_LOCAL_MACHINE, CM_STANDIN_KEY, wszName, RRF_RT_REG_DWORD, nullptr, &dw,
                     &cb) != ERROR_SUCCESS)
    {
        return 0;
    }
    return dw;
}

void CmStandInRecord(const std::wstring &wstrCall)
{
    AcquireSRWLockExclusive(&s_recordLock);
    HKEY hKey = nullptr;
    if (RegCreateKeyExW(HKEY_LOCAL_MACHINE, CM_STANDIN_KEY, 0, nullptr, 0,
                        KEY_QUERY_VALUE | KEY_SET_VALUE, nullptr, &hKey, nullptr) == ERROR_SUCCESS)
    {
        // The value is a list of terminated strings followed by one more terminator.
        std::vector<wchar_t> rgwch;
        DWORD cb = 0;
        if (RegGetValueW(hKey, nullptr, L"Calls", RRF_RT_REG_MULTI_SZ, nullptr, nullptr, &cb) ==
                ERROR_SUCCESS &&
            cb >= sizeof(wchar_t))
        {
            rgwch.resize(cb / sizeof(wchar_t) + 1);
            if (RegGetValueW(hKey, nullptr, L"Calls", RRF_RT_REG_MULTI_SZ, nullptr, rgwch.data(),
                             &cb) != ERROR_SUCCESS)
            {
                cb = 0;
            }
            rgwch.resize(cb / sizeof(wchar_t));
        }
        while (!rgwch.empty() && rgwch.back() == L'\0')
        {
            rgwch.pop_back();
        }
        if (!rgwch.empty())
        {
            rgwch.push_back(L'\0');
        }
        rgwch.insert(rgwch.end(), wstrCall.begin(), wstrCall.end());
        rgwch.push_back(L'\0');
        rgwch.push_back(L'\0');
        RegSetValueExW(hKey, L"Calls", 0, REG_MULTI_SZ,
                       reinterpret_cast<const BYTE *>(rgwch.data()),
                       static_cast<DWORD>(rgwch.size() * sizeof(wchar_t)));
        RegCloseKey(hKey);
    }
    ReleaseSRWLockExclusive(&s_recordLock);
}
} // namespace

extern "C" BOOL WINAPI CmApiInit(void)
{
    CmStandInRecord(L"CmApiInit");
    if (CmStandInDword(L"FailInit") != 0)
    {
        SetLastError(ERROR_NOT_READY);
        return FALSE;
    }
    return TRUE;
}

extern "C" DWORD WINAPI CmSetRequirements(CM_SESSION session, const DWORD *pdwRequirements,
                                          DWORD cbRequirements)
{
    wchar_t wszSession[16];
    swprintf(wszSession, 16, L"0x%08lx", static_cast<unsigned long>(session));
    std::wstring wstrCall = L"CmSetRequirements ";
    wstrCall += wszSession;
    if (pdwRequirements == nullptr || cbRequirements % sizeof(DWORD) != 0)
    {
        CmStandInRecord(wstrCall + L" (bad block)");
        return ERROR_INVALID_PARAMETER;
    }
    for (DWORD i = 0; i < cbRequirements / sizeof(DWORD); i++)
    {
        wstrCall += L" " + std::to_wstring(pdwRequirements[i]);
    }
    CmStandInRecord(wstrCall);
    return CmStandInDword(L"RequirementsResult");
}

extern "C" void WINAPI CmCloseSession(CM_SESSION session)
{
    wchar_t wszCall[40];
    swprintf(wszCall, 40, L"CmCloseSession 0x%08lx", static_cast<unsigned long>(session));
    CmStandInRecord(wszCall);
}

extern "C" void WINAPI CmApiDeinit(void)
{
    CmStandInRecord(L"CmApiDeinit");
}
