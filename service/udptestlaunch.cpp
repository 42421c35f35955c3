#include "service/udptestlaunch.h"

#include "platform/securityruntime/securityruntime.h"
#include "platform/wifi/wifiuser.h"
#include "service/udptestcommandline.h"
#include "service/udptestpolicy.h"
#include "servicelib/diagnostics.h"
#include "servicelib/eventtrace.h"

namespace
{
const DWORD c_dwNoConsoleWindow = 0x08000000;
const HRESULT c_hrCommandLineTooLong = static_cast<HRESULT>(0x8007007A);

// The adapter's address: the first 16 characters of the block up to a zero, each narrowed
// to its low byte.
std::string UdpTestAdapterAddress(const WiFiAdapterInfo &info)
{
    std::string strAddress;
    for (size_t i = 0; i < ARRAYSIZE(info.wszAddress) && info.wszAddress[i] != L'\0'; i++)
    {
        strAddress += static_cast<char>(info.wszAddress[i] & 0xFF);
    }
    return strAddress;
}
} // namespace

bool UdpTestWiFiActive(UdpTestConfig *pConfig)
{
    bool fActive = false;
    WiFiUserHandle *pHandle = nullptr;
    HRESULT hr = WiFiUserHandle::OpenHandle(c_dwWiFiUserVersion, &pHandle);
    if (FAILED(hr))
    {
        TelvaneTraceUdpFailure("WiFiUserHandle::OpenHandle", static_cast<ULONG>(hr));
    }
    else
    {
        WiFiConnectionState state = WiFiConnectionStateUnknown;
        WiFiNetwork *pNetwork = nullptr;
        hr = pHandle->QueryConnectionState(&state, &pNetwork);
        if (FAILED(hr))
        {
            TelvaneTraceUdpFailure("QueryConnectionState", static_cast<ULONG>(hr));
        }
        else if (state == WiFiConnectionStateConnected)
        {
            WiFiAdapterInfo info;
            ZeroMemory(&info, sizeof(info));
            hr = pHandle->QueryAdapterInfo(&info);
            if (FAILED(hr))
            {
                TelvaneTraceUdpFailure("QueryAdapterInfo", static_cast<ULONG>(hr));
            }
            else
            {
                pConfig->localIp = UdpTestAdapterAddress(info);
                fActive = true;
            }
        }
        delete pNetwork;
        WiFiUserHandle::CloseHandle(pHandle);
    }
    if (!fActive)
    {
        TelvaneTraceUdpFailure("We dont have active WiFi", 0);
    }
    return fActive;
}

HRESULT LaunchUdpTest(UdpTestConfig *pConfig, HANDLE *phProcess)
{
    *phProcess = INVALID_HANDLE_VALUE;
    STARTUPINFOW si;
    ZeroMemory(&si, sizeof(si));
    si.cb = sizeof(si);
    PROCESS_INFORMATION pi;
    ZeroMemory(&pi, sizeof(pi));

    std::string strArguments;
    BuildTestCommandLine(*pConfig, strArguments);
    wchar_t wszCommandLine[c_cchUdpTestCommandLine];
    HRESULT hr = StringCchPrintf(wszCommandLine, ARRAYSIZE(wszCommandLine), L"%s %S",
                                 c_wszUdpTestApplication, strArguments.c_str());
    TelvaneTraceCommandLine(wszCommandLine);
    if (FAILED(hr))
    {
        // Cut, the line could end in a shorter port or name: no test rather than a wrong one.
        TelvaneTraceUdpFailure("StringCchPrintf", static_cast<ULONG>(hr));
        return hr == c_hrCommandLineTooLong ? hr : E_INVALIDARG;
    }

    PSID pSid = nullptr;
    hr = GetChamberSidFromId(c_wszUdpTestChamberId, &pSid);
    if (FAILED(hr))
    {
        TelvaneTraceUdpFailure("GetChamberSidFromId", static_cast<ULONG>(hr));
    }
    else
    {
        hr = CreateProcessInChamber(pSid, c_wszUdpTestChamberInstance, nullptr, wszCommandLine,
                                    FALSE, c_dwNoConsoleWindow, nullptr, &si, &pi);
        if (FAILED(hr))
        {
            TelvaneTraceUdpFailure("CreateProcessInChamber", static_cast<ULONG>(hr));
        }
        else
        {
            CloseHandle(pi.hThread);
            *phProcess = pi.hProcess;
            pConfig->lastTest = UdpConfigNow();
            hr = SaveUdpConfig(pConfig);
        }
    }
    LocalFree(pSid);
    return hr;
}
