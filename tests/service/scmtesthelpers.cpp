#include "tests/service/scmtesthelpers.h"

#include <stdio.h>

namespace scmtest
{
namespace
{
const DWORD c_dwPollMs = 50;
const DWORD c_dwStopTimeoutMs = 20000;

// A control-manager handle closed on every way out.
class CScHolder
{
public:
    explicit CScHolder(SC_HANDLE h)
        : m_h(h)
    {
    }
    ~CScHolder()
    {
        if (m_h != nullptr)
        {
            CloseServiceHandle(m_h);
        }
    }
    CScHolder(const CScHolder &) = delete;
    CScHolder &operator=(const CScHolder &) = delete;
    SC_HANDLE Get() const { return m_h; }

private:
    SC_HANDLE m_h;
};

SC_HANDLE OpenService(const wchar_t *wszService, DWORD dwAccess)
{
    CScHolder scm(OpenSCManagerW(nullptr, nullptr, SC_MANAGER_CONNECT));
    if (scm.Get() == nullptr)
    {
        return nullptr;
    }
    return OpenServiceW(scm.Get(), wszService, dwAccess);
}
} // namespace

std::wstring UniqueName(const wchar_t *wszPrefix)
{
    // Wine hands out process ids again soon: the start time tells runs apart.
    static LONG s_lCounter = 0;
    static const ULONGLONG s_ullStart = GetTickCount64() % 1000000;
    wchar_t wsz[128];
    swprintf(wsz, 128, L"%ls_%lu_%llu_%ld", wszPrefix, GetCurrentProcessId(), s_ullStart,
             InterlockedIncrement(&s_lCounter));
    return wsz;
}

bool QueryStatus(const wchar_t *wszService, SERVICE_STATUS_PROCESS *pStatus)
{
    CScHolder service(OpenService(wszService, SERVICE_QUERY_STATUS));
    DWORD cbNeeded = 0;
    return service.Get() != nullptr &&
           QueryServiceStatusEx(service.Get(), SC_STATUS_PROCESS_INFO,
                                reinterpret_cast<BYTE *>(pStatus), sizeof(*pStatus), &cbNeeded);
}

bool WaitForState(const wchar_t *wszService, DWORD dwState, DWORD dwTimeoutMs,
                  SERVICE_STATUS_PROCESS *pStatus)
{
    SERVICE_STATUS_PROCESS status = {};
    ULONGLONG ullDeadline = GetTickCount64() + dwTimeoutMs;
    bool fReached = false;
    for (;;)
    {
        if (QueryStatus(wszService, &status) && status.dwCurrentState == dwState)
        {
            fReached = true;
            break;
        }
        if (GetTickCount64() > ullDeadline)
        {
            break;
        }
        Sleep(c_dwPollMs);
    }
    if (pStatus != nullptr)
    {
        *pStatus = status;
    }
    return fReached;
}

bool ServiceExists(const wchar_t *wszService)
{
    CScHolder service(OpenService(wszService, SERVICE_QUERY_STATUS));
    return service.Get() != nullptr;
}

DWORD StartWithArgs(const wchar_t *wszService, const std::vector<std::wstring> &rgArgs)
{
    CScHolder service(OpenService(wszService, SERVICE_START));
    if (service.Get() == nullptr)
    {
        return GetLastError();
    }
    std::vector<LPCWSTR> rgArgv;
    for (const std::wstring &wstr : rgArgs)
    {
        rgArgv.push_back(wstr.c_str());
    }
    if (!StartServiceW(service.Get(), static_cast<DWORD>(rgArgv.size()),
                       rgArgv.empty() ? nullptr : rgArgv.data()))
    {
        return GetLastError();
    }
    return ERROR_SUCCESS;
}

DWORD Control(const wchar_t *wszService, DWORD dwControl, SERVICE_STATUS *pStatus)
{
    CScHolder service(
        OpenService(wszService, SERVICE_STOP | SERVICE_INTERROGATE | SERVICE_USER_DEFINED_CONTROL));
    if (service.Get() == nullptr)
    {
        return GetLastError();
    }
    SERVICE_STATUS status = {};
    DWORD dwError =
        ControlService(service.Get(), dwControl, &status) ? ERROR_SUCCESS : GetLastError();
    if (pStatus != nullptr)
    {
        *pStatus = status;
    }
    return dwError;
}

DWORD Stop(const wchar_t *wszService)
{
    DWORD dwError = Control(wszService, SERVICE_CONTROL_STOP, nullptr);
    return dwError == ERROR_BROKEN_PIPE ? ERROR_SUCCESS : dwError;
}

bool ReadRecord(const wchar_t *wszService, SERVICE_RECORD *pRecord)
{
    CScHolder service(OpenService(wszService, SERVICE_QUERY_CONFIG));
    if (service.Get() == nullptr)
    {
        return false;
    }
    DWORD cbNeeded = 0;
    QueryServiceConfigW(service.Get(), nullptr, 0, &cbNeeded);
    std::vector<BYTE> rgbConfig(cbNeeded);
    QUERY_SERVICE_CONFIGW *pConfig = reinterpret_cast<QUERY_SERVICE_CONFIGW *>(rgbConfig.data());
    if (cbNeeded == 0 || !QueryServiceConfigW(service.Get(), pConfig, cbNeeded, &cbNeeded))
    {
        return false;
    }
    pRecord->dwServiceType = pConfig->dwServiceType;
    pRecord->dwStartType = pConfig->dwStartType;
    pRecord->dwErrorControl = pConfig->dwErrorControl;
    pRecord->wstrBinaryPath = pConfig->lpBinaryPathName ? pConfig->lpBinaryPathName : L"";
    pRecord->wstrDisplayName = pConfig->lpDisplayName ? pConfig->lpDisplayName : L"";
    pRecord->wstrStartName = pConfig->lpServiceStartName ? pConfig->lpServiceStartName : L"";

    cbNeeded = 0;
    QueryServiceConfig2W(service.Get(), SERVICE_CONFIG_DESCRIPTION, nullptr, 0, &cbNeeded);
    std::vector<BYTE> rgbDescription(cbNeeded + sizeof(SERVICE_DESCRIPTIONW));
    SERVICE_DESCRIPTIONW *pDescription =
        reinterpret_cast<SERVICE_DESCRIPTIONW *>(rgbDescription.data());
    if (QueryServiceConfig2W(service.Get(), SERVICE_CONFIG_DESCRIPTION, rgbDescription.data(),
                             static_cast<DWORD>(rgbDescription.size()), &cbNeeded) &&
        pDescription->lpDescription != nullptr)
    {
        pRecord->wstrDescription = pDescription->lpDescription;
    }
    return true;
}

bool CreateOwnProcess(const wchar_t *wszService, const std::wstring &wstrImagePath)
{
    CScHolder scm(OpenSCManagerW(nullptr, nullptr, SC_MANAGER_CREATE_SERVICE));
    if (scm.Get() == nullptr)
    {
        return false;
    }
    CScHolder service(CreateServiceW(scm.Get(), wszService, wszService, SERVICE_ALL_ACCESS,
                                     SERVICE_WIN32_OWN_PROCESS, SERVICE_DEMAND_START,
                                     SERVICE_ERROR_NORMAL, wstrImagePath.c_str(), nullptr, nullptr,
                                     nullptr, nullptr, nullptr));
    return service.Get() != nullptr;
}

bool SetImagePath(const wchar_t *wszService, const std::wstring &wstrImagePath)
{
    CScHolder service(OpenService(wszService, SERVICE_CHANGE_CONFIG));
    return service.Get() != nullptr &&
           ChangeServiceConfigW(service.Get(), SERVICE_NO_CHANGE, SERVICE_NO_CHANGE,
                                SERVICE_NO_CHANGE, wstrImagePath.c_str(), nullptr, nullptr, nullptr,
                                nullptr, nullptr, nullptr);
}

bool Delete(const wchar_t *wszService)
{
    CScHolder service(OpenService(wszService, DELETE));
    return service.Get() != nullptr && DeleteService(service.Get());
}

void StopAndDelete(const wchar_t *wszService)
{
    CScHolder service(OpenService(wszService, SERVICE_STOP | SERVICE_QUERY_STATUS | DELETE));
    if (service.Get() == nullptr)
    {
        return;
    }
    if (Stop(wszService) == ERROR_SUCCESS)
    {
        WaitForState(wszService, SERVICE_STOPPED, c_dwStopTimeoutMs);
    }
    DeleteService(service.Get());
}

CServiceProcess::CServiceProcess(DWORD dwProcessId)
    : m_hProcess(OpenProcess(SYNCHRONIZE | PROCESS_QUERY_LIMITED_INFORMATION, FALSE, dwProcessId))
{
}

CServiceProcess::~CServiceProcess()
{
    if (m_hProcess != nullptr)
    {
        CloseHandle(m_hProcess);
    }
}

std::wstring CServiceProcess::ImageName() const
{
    wchar_t wszImage[MAX_PATH] = L"";
    DWORD cchImage = MAX_PATH;
    if (m_hProcess == nullptr || !QueryFullProcessImageNameW(m_hProcess, 0, wszImage, &cchImage))
    {
        return std::wstring();
    }
    return wszImage;
}

DWORD CServiceProcess::WaitForExitCode(DWORD dwTimeoutMs) const
{
    DWORD dwExitCode = STILL_ACTIVE;
    if (m_hProcess != nullptr && WaitForSingleObject(m_hProcess, dwTimeoutMs) == WAIT_OBJECT_0)
    {
        GetExitCodeProcess(m_hProcess, &dwExitCode);
    }
    return dwExitCode;
}

bool ReadDword(const std::wstring &wstrKey, const wchar_t *wszValue, DWORD *pdw)
{
    DWORD cb = sizeof(*pdw);
    return RegGetValueW(HKEY_LOCAL_MACHINE, wstrKey.c_str(), wszValue, RRF_RT_REG_DWORD, nullptr,
                        pdw, &cb) == ERROR_SUCCESS;
}

bool ReadRaw(const std::wstring &wstrKey, const wchar_t *wszValue, DWORD *pdwType,
             std::wstring *pwstrData)
{
    HKEY hKey = nullptr;
    if (RegOpenKeyExW(HKEY_LOCAL_MACHINE, wstrKey.c_str(), 0, KEY_READ, &hKey) != ERROR_SUCCESS)
    {
        return false;
    }
    DWORD cb = 0;
    LONG lStatus = RegQueryValueExW(hKey, wszValue, nullptr, pdwType, nullptr, &cb);
    std::vector<BYTE> rgb(cb + sizeof(wchar_t));
    if (lStatus == ERROR_SUCCESS)
    {
        lStatus = RegQueryValueExW(hKey, wszValue, nullptr, pdwType, rgb.data(), &cb);
    }
    RegCloseKey(hKey);
    if (lStatus != ERROR_SUCCESS)
    {
        return false;
    }
    pwstrData->assign(reinterpret_cast<const wchar_t *>(rgb.data()), cb / sizeof(wchar_t));
    return true;
}
} // namespace scmtest
