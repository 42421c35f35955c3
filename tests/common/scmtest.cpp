#include "tests/common/scmtest.h"
#include "inc/handleholder.h"

#include <gtest/gtest.h>
#include <stdio.h>

namespace testsupport
{
namespace
{
const DWORD c_dwPollMs = 50;
const DWORD c_dwStopTimeoutMs = 20000;

SC_HANDLE OpenTestService(const wchar_t *wszService, DWORD dwAccess)
{
    CServiceHandle scm(OpenSCManagerW(nullptr, nullptr, SC_MANAGER_CONNECT));
    if (scm.Get() == nullptr)
    {
        return nullptr;
    }
    return OpenServiceW(scm.Get(), wszService, dwAccess);
}
} // namespace

bool ServiceQueryStatus(const wchar_t *wszService, SERVICE_STATUS_PROCESS *pStatus)
{
    CServiceHandle service(OpenTestService(wszService, SERVICE_QUERY_STATUS));
    DWORD cbNeeded = 0;
    return service.Get() != nullptr &&
           QueryServiceStatusEx(service.Get(), SC_STATUS_PROCESS_INFO,
                                reinterpret_cast<BYTE *>(pStatus), sizeof(*pStatus), &cbNeeded);
}

bool ServiceWaitForState(const wchar_t *wszService, DWORD dwState, DWORD dwTimeoutMs,
                         SERVICE_STATUS_PROCESS *pStatus)
{
    SERVICE_STATUS_PROCESS status = {};
    ULONGLONG ullDeadline = GetTickCount64() + dwTimeoutMs;
    bool fReached = false;
    for (;;)
    {
        if (ServiceQueryStatus(wszService, &status) && status.dwCurrentState == dwState)
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
    CServiceHandle service(OpenTestService(wszService, SERVICE_QUERY_STATUS));
    return service.Get() != nullptr;
}

DWORD ServiceStart(const wchar_t *wszService, const std::vector<std::wstring> &rgArgs)
{
    CServiceHandle service(OpenTestService(wszService, SERVICE_START));
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

DWORD ServiceControl(const wchar_t *wszService, DWORD dwControl, SERVICE_STATUS *pStatus)
{
    CServiceHandle service(OpenTestService(wszService, SERVICE_STOP | SERVICE_INTERROGATE |
                                                           SERVICE_USER_DEFINED_CONTROL));
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

DWORD ServiceStop(const wchar_t *wszService)
{
    DWORD dwError = ServiceControl(wszService, SERVICE_CONTROL_STOP, nullptr);
    return dwError == ERROR_BROKEN_PIPE ? ERROR_SUCCESS : dwError;
}

bool ServiceReadRecord(const wchar_t *wszService, SERVICE_RECORD *pRecord)
{
    CServiceHandle service(OpenTestService(wszService, SERVICE_QUERY_CONFIG));
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

bool ServiceCreateOwnProcess(const wchar_t *wszService, const std::wstring &wstrImagePath)
{
    CServiceHandle scm(OpenSCManagerW(nullptr, nullptr, SC_MANAGER_CREATE_SERVICE));
    if (scm.Get() == nullptr)
    {
        return false;
    }
    CServiceHandle service(CreateServiceW(scm.Get(), wszService, wszService, SERVICE_ALL_ACCESS,
                                          SERVICE_WIN32_OWN_PROCESS, SERVICE_DEMAND_START,
                                          SERVICE_ERROR_NORMAL, wstrImagePath.c_str(), nullptr,
                                          nullptr, nullptr, nullptr, nullptr));
    return service.Get() != nullptr;
}

bool ServiceSetImagePath(const wchar_t *wszService, const std::wstring &wstrImagePath)
{
    CServiceHandle service(OpenTestService(wszService, SERVICE_CHANGE_CONFIG));
    return service.Get() != nullptr &&
           ChangeServiceConfigW(service.Get(), SERVICE_NO_CHANGE, SERVICE_NO_CHANGE,
                                SERVICE_NO_CHANGE, wstrImagePath.c_str(), nullptr, nullptr, nullptr,
                                nullptr, nullptr, nullptr);
}

bool ServiceDelete(const wchar_t *wszService)
{
    CServiceHandle service(OpenTestService(wszService, DELETE));
    return service.Get() != nullptr && DeleteService(service.Get());
}

void ServiceStopAndDelete(const wchar_t *wszService)
{
    CServiceHandle service(
        OpenTestService(wszService, SERVICE_STOP | SERVICE_QUERY_STATUS | DELETE));
    if (service.Get() == nullptr)
    {
        return;
    }
    if (ServiceStop(wszService) == ERROR_SUCCESS)
    {
        ServiceWaitForState(wszService, SERVICE_STOPPED, c_dwStopTimeoutMs);
    }
    DeleteService(service.Get());
}

CServiceProcess::CServiceProcess(DWORD dwProcessId)
    : m_process(OpenProcess(SYNCHRONIZE | PROCESS_QUERY_LIMITED_INFORMATION, FALSE, dwProcessId))
{
}

std::wstring CServiceProcess::ImageName() const
{
    wchar_t wszImage[MAX_PATH] = L"";
    DWORD cchImage = MAX_PATH;
    return Opened() && QueryFullProcessImageNameW(m_process.Get(), 0, wszImage, &cchImage)
               ? wszImage
               : std::wstring();
}

DWORD CServiceProcess::WaitForExitCode(DWORD dwTimeoutMs) const
{
    DWORD dwExitCode = STILL_ACTIVE;
    if (Opened() && WaitForSingleObject(m_process.Get(), dwTimeoutMs) == WAIT_OBJECT_0)
    {
        GetExitCodeProcess(m_process.Get(), &dwExitCode);
    }
    return dwExitCode;
}

const wchar_t c_wszTelvane[] = L"Telvane";

ChildResult RunTelvane(const std::wstring &wstrArguments)
{
    return RunChild(BinCommand(L"telvanerun.exe") + L" " + wstrArguments);
}

void TelvaneInstall(TelvaneHost host)
{
    ChildResult installed = RunTelvane(L"-r");
    ASSERT_EQ(0u, installed.dwExitCode) << installed.strOutput;
    ChildResult registered = RunChild(L"regsvr32 /s " + BinCommand(L"platformcomponent.dll"));
    ASSERT_EQ(0u, registered.dwExitCode) << registered.strOutput;
    if (host == TelvaneHost::TelvaneHost)
    {
        ASSERT_TRUE(ServiceSetImagePath(c_wszTelvane,
                                        BinCommand(L"telvanehost.exe") + L" -k OVTCBNetwork"));
    }
}

void TelvaneUninstall()
{
    RunTelvane(L"-u");
    RunChild(L"regsvr32 /s /u " + BinCommand(L"platformcomponent.dll"));
    ServiceStopAndDelete(c_wszTelvane);
}

DWORD TelvaneStart()
{
    EXPECT_EQ(0u, ServiceStart(c_wszTelvane));
    SERVICE_STATUS_PROCESS status = {};
    bool fRunning = ServiceWaitForState(c_wszTelvane, SERVICE_RUNNING, 2 * c_dwWaitMs, &status);
    EXPECT_TRUE(fRunning) << status.dwCurrentState << " " << status.dwWin32ExitCode;
    return fRunning ? status.dwProcessId : 0;
}

bool TelvaneStop()
{
    EXPECT_EQ(0u, ServiceStop(c_wszTelvane));
    return ServiceWaitForState(c_wszTelvane, SERVICE_STOPPED, 2 * c_dwWaitMs);
}
} // namespace testsupport
