// Installation of the shell's services: the control manager's record, the failure actions,
// and, for a host DLL, the values the host needs to load it and its group entry.
#include "servicelib/service.h"
#include "servicelib/diagnostics.h"
#include "servicelib/reghelper.h"

#include <algorithm>
#include <string>
#include <vector>
#include <wchar.h>

namespace
{
const DWORD c_cFailureActions = 10;
const DWORD c_dwFailureActionDelayMs = 10000;
const DWORD c_dwFailureResetSeconds = 3600;
const HRESULT c_hrInsufficientBuffer = 0x8007007A;
const DWORD c_dwDeleteWaitMs = 30000;
const DWORD c_dwDeletePollMs = 100;

PFN_CHANGE_SERVICE_CONFIG2 volatile s_pfnChangeConfig2Hook = nullptr;

BOOL ServiceChangeConfig2(SC_HANDLE hService, DWORD dwInfoLevel, LPVOID pvInfo)
{
    PFN_CHANGE_SERVICE_CONFIG2 pfnHook = s_pfnChangeConfig2Hook;
    if (pfnHook != nullptr)
    {
        return pfnHook(hService, dwInfoLevel, pvInfo);
    }
    return ChangeServiceConfig2W(hService, dwInfoLevel, pvInfo);
}

// Closes a control-manager handle on every way out, reporting a failing close under the
// operation that opened it.
class CScHandleHolder
{
public:
    CScHandleHolder(SC_HANDLE hHandle, const wchar_t *wszFunction)
        : m_hHandle(hHandle)
        , m_wszFunction(wszFunction)
    {
    }
    ~CScHandleHolder()
    {
        if (m_hHandle != nullptr && !CloseServiceHandle(m_hHandle))
        {
            FATAL_ERROR(m_wszFunction, L"CloseServiceHandle", GetLastError());
        }
    }
    CScHandleHolder(const CScHandleHolder &) = delete;
    CScHandleHolder &operator=(const CScHandleHolder &) = delete;
    SC_HANDLE Get() const { return m_hHandle; }

private:
    SC_HANDLE m_hHandle;
    const wchar_t *m_wszFunction;
};
} // namespace

void CService::RegisterOneService()
{
    const wchar_t *const wszFunction = L"CService::RegisterOneService";
    ASSERT_CHECK(L"CService::RegisterOneService", m_wszServiceName != NULL);
    ASSERT_CHECK(L"CService::RegisterOneService", m_idsLocalizedName != 0);
    ASSERT_CHECK(L"CService::RegisterOneService", m_idsDescription != 0);
    ASSERT_CHECK(L"CService::RegisterOneService", m_ulStartType != 0);
    if (m_wszServiceName == nullptr || m_idsLocalizedName == 0 || m_idsDescription == 0 ||
        m_ulStartType == 0)
    {
        return;
    }

    // A host DLL registers itself; a program of its own registers the executable.
    HMODULE hModule = nullptr;
    if (s_fSvchost && !GetModuleHandleExW(GET_MODULE_HANDLE_EX_FLAG_FROM_ADDRESS |
                                              GET_MODULE_HANDLE_EX_FLAG_UNCHANGED_REFCOUNT,
                                          reinterpret_cast<LPCWSTR>(&s_pFirstService), &hModule))
    {
        FATAL_ERROR(wszFunction, L"GetModuleHandleEx", GetLastError());
        return;
    }
    wchar_t wszModulePath[MAX_PATH];
    DWORD cchModulePath = GetModuleFileNameW(hModule, wszModulePath, MAX_PATH);
    // A full buffer means a cut path, which would register a file that does not exist.
    if (cchModulePath == 0 || cchModulePath >= MAX_PATH)
    {
        FATAL_ERROR(wszFunction, L"GetModuleFileName",
                    cchModulePath == 0 ? GetLastError() : ERROR_INSUFFICIENT_BUFFER);
        return;
    }

    wchar_t wszDisplayName[MAX_PATH];
    wchar_t wszDescription[MAX_PATH];
    wchar_t wszImagePath[MAX_PATH];
    HRESULT hr = StringCchPrintf(wszDisplayName, MAX_PATH, L"@%s,-%d", wszModulePath,
                                 static_cast<int>(m_idsLocalizedName));
    if (SUCCEEDED(hr))
    {
        hr = StringCchPrintf(wszDescription, MAX_PATH, L"@%s,-%d", wszModulePath,
                             static_cast<int>(m_idsDescription));
    }
    if (SUCCEEDED(hr) && s_fSvchost)
    {
        hr = StringCchPrintf(wszImagePath, MAX_PATH, L"svchost.exe -k %s", s_wszSvchostGroup);
    }
    if (FAILED(hr))
    {
        FATAL_ERROR(wszFunction, L"StringCchPrintf", hr);
        return;
    }
    if (!s_fSvchost)
    {
        if (wcslen(wszModulePath) >= MAX_PATH)
        {
            FATAL_ERROR(wszFunction, L"StringCchCopy", c_hrInsufficientBuffer);
            return;
        }
        wcscpy(wszImagePath, wszModulePath);
    }

    UnregisterOneService();

    CScHandleHolder scm(OpenSCManagerW(nullptr, nullptr, SC_MANAGER_CREATE_SERVICE), wszFunction);
    if (scm.Get() == nullptr)
    {
        FATAL_ERROR(wszFunction, L"OpenSCManager", GetLastError());
        return;
    }
    CScHandleHolder service(CreateServiceW(scm.Get(), m_wszServiceName, wszDisplayName,
                                           SERVICE_ALL_ACCESS, ServiceType(), m_ulStartType,
                                           SERVICE_ERROR_NORMAL, wszImagePath, nullptr, nullptr,
                                           m_wszDependencies, m_wszAccount, nullptr),
                            wszFunction);
    if (service.Get() == nullptr)
    {
        FATAL_ERROR(wszFunction, L"CreateService", GetLastError());
        return;
    }
    SERVICE_DESCRIPTIONW description = {wszDescription};
    if (!ServiceChangeConfig2(service.Get(), SERVICE_CONFIG_DESCRIPTION, &description))
    {
        FATAL_ERROR(wszFunction, L"ChangeServiceConfig2", GetLastError());
    }
    ConfigureRestartOption(service.Get());
    if (s_fSvchost)
    {
        ConfigureSvchostOptions(wszModulePath);
    }
    OnRegister();
}

void CService::ConfigureRestartOption(SC_HANDLE hService)
{
    SC_ACTION rgActions[c_cFailureActions];
    for (DWORD i = 0; i < c_cFailureActions; i++)
    {
        rgActions[i].Type = static_cast<SC_ACTION_TYPE>(m_ulFailureAction);
        rgActions[i].Delay = c_dwFailureActionDelayMs;
    }
    SERVICE_FAILURE_ACTIONSW failureActions = {};
    failureActions.dwResetPeriod = c_dwFailureResetSeconds;
    failureActions.lpRebootMsg = nullptr;
    failureActions.lpCommand = nullptr;
    failureActions.cActions = c_cFailureActions;
    failureActions.lpsaActions = rgActions;
    if (!ServiceChangeConfig2(hService, SERVICE_CONFIG_FAILURE_ACTIONS, &failureActions))
    {
        FATAL_ERROR(L"CService::ConfigureRestartOption", L"ChangeServiceConfig2", GetLastError());
    }
}

void CService::ConfigureSvchostOptions(const wchar_t *wszModulePath)
{
    wchar_t wszParametersKey[MAX_PATH];
    HRESULT hr = StringCchPrintf(wszParametersKey, MAX_PATH, c_wszServiceParametersKeyFormat,
                                 m_wszServiceName);
    if (FAILED(hr))
    {
        FATAL_ERROR(L"CService::ConfigureSvchostOptions", L"StringCchPrintf", hr);
        return;
    }
    RegHelperSetString(wszParametersKey, L"ServiceDll", wszModulePath, REG_EXPAND_SZ);
    RegHelperSetDword(wszParametersKey, L"ServiceDllUnloadOnStop", 1);

    std::vector<std::wstring> rgGroup =
        RegHelperGetMultiString(c_wszSvchostGroupKey, s_wszSvchostGroup);
    rgGroup.push_back(m_wszServiceName);
    RegHelperSetMultiString(c_wszSvchostGroupKey, s_wszSvchostGroup, rgGroup);
}

void CService::UnregisterOneService()
{
    const wchar_t *const wszFunction = L"CService::UnregisterOneService";
    CScHandleHolder scm(OpenSCManagerW(nullptr, nullptr, SC_MANAGER_CONNECT), wszFunction);
    if (scm.Get() == nullptr)
    {
        FATAL_ERROR(wszFunction, L"OpenSCManager", GetLastError());
        return;
    }

    bool fDeleted = false;
    {
        CScHandleHolder service(OpenServiceW(scm.Get(), m_wszServiceName, DELETE | SERVICE_STOP),
                                wszFunction);
        if (service.Get() != nullptr)
        {
            // A service already stopping (or still starting) cannot take the control; it is
            // deleted all the same once it is down.
            SERVICE_STATUS status = {};
            if (!ControlService(service.Get(), SERVICE_CONTROL_STOP, &status) &&
                GetLastError() != ERROR_SERVICE_NOT_ACTIVE &&
                GetLastError() != ERROR_SERVICE_CANNOT_ACCEPT_CTRL)
            {
                FATAL_ERROR(wszFunction, L"ControlService", GetLastError());
            }
            if (!DeleteService(service.Get()) && GetLastError() != ERROR_SERVICE_MARKED_FOR_DELETE)
            {
                FATAL_ERROR(wszFunction, L"DeleteService", GetLastError());
            }
            fDeleted = true;
        }
        else if (GetLastError() != ERROR_SERVICE_DOES_NOT_EXIST)
        {
            FATAL_ERROR(wszFunction, L"OpenService", GetLastError());
        }
    }
    // The record goes only once the service is down and every handle is closed (ours
    // included); under Wine, only once the stopped service's process has left. Until then
    // the name cannot be registered again.
    if (fDeleted)
    {
        WaitUntilDeleted(scm.Get());
    }

    if (s_fSvchost)
    {
        std::vector<std::wstring> rgGroup =
            RegHelperGetMultiString(c_wszSvchostGroupKey, s_wszSvchostGroup);
        rgGroup.erase(std::remove(rgGroup.begin(), rgGroup.end(), std::wstring(m_wszServiceName)),
                      rgGroup.end());
        if (!rgGroup.empty())
        {
            RegHelperSetMultiString(c_wszSvchostGroupKey, s_wszSvchostGroup, rgGroup);
        }
        else
        {
            RegHelperDeleteValue(c_wszSvchostGroupKey, s_wszSvchostGroup);
            // The parts join without a separator, so a group subkey of host options (which
            // registration never creates) is left alone.
            RegHelperDeleteKey(c_wszSvchostGroupKey, s_wszSvchostGroup);
        }
    }
    OnUnregister();
}

void CService::WaitUntilDeleted(SC_HANDLE hScm)
{
    for (DWORD dwWaited = 0; dwWaited < c_dwDeleteWaitMs; dwWaited += c_dwDeletePollMs)
    {
        SC_HANDLE hService = OpenServiceW(hScm, m_wszServiceName, SERVICE_QUERY_STATUS);
        if (hService == nullptr && GetLastError() != ERROR_SERVICE_MARKED_FOR_DELETE)
        {
            return;
        }
        if (hService != nullptr)
        {
            CloseServiceHandle(hService);
        }
        Sleep(c_dwDeletePollMs);
    }
    DebugLog(L"CService::UnregisterOneService", L"%s is still marked for deletion after %u ms\r\n",
             m_wszServiceName, c_dwDeleteWaitMs);
}

void ServiceSetChangeConfig2Hook(PFN_CHANGE_SERVICE_CONFIG2 pfnHook)
{
    s_pfnChangeConfig2Hook = pfnHook;
}
