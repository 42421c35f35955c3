#include "tests/launcher/launchertestsupport.h"

#include "platform/endpointdirectory/endpointdirectory.h"
#include "platform/securityruntime/securityruntime.h"
#include "platform/statenotify/statenotifypublish.h"
#include "platform/wifi/wifiuser.h"
#include "service/statesubscription.h"
#include "service/udptestpolicy.h"
#include "tests/common/testsupport.h"

#include <gtest/gtest.h>
#include <algorithm>

namespace launchertest
{
const char c_szCallbackToggled[] =
    "1001|CUDPTestLauncher::WnfNotificationCallback() - backlight toggled";
const char c_szHandlerToggled[] =
    "1001|CUDPTestLauncher::Dispatch_BacklightChangedup  () - backlight toggled";
const char c_szLoadingConfig[] =
    "1001|CUDPTestLauncher::Dispatch_BacklightChangedup  () - loading UDP config";
const char c_szConfigExpired[] =
    "1001|CUDPTestLauncher::Dispatch_BacklightChangedup  () - config expired, refreshing";
const char c_szNotAsked[] =
    "1001|CUDPTestLauncher::Dispatch_BacklightChangedup  () - asked not to run test";
const char c_szLaunched[] =
    "1001|CUDPTestLauncher::Dispatch_BacklightChangedup  () - UDP app launched";
const char c_szStillRunning[] = "1001|CUDPTestLauncher::Dispatch_BacklightChanged() - process is "
                                "still running, ignoring this call";
const char c_szDestroyingIgnored[] =
    "1001|CUDPTestLauncher::Dispatch_BacklightChanged() - destroying, ignoring this call";
const char c_szStillWaiting[] = "1001|CUDPTestLauncher::Dispatch_AdvanceDestruction() - still "
                                "waiting on outstanding operation";
const char c_szFinishedDestruction[] = "1001|CUDPTestLauncher::Dispatch_AdvanceDestruction() - "
                                       "finished destruction, signaling event";

namespace
{
const WNF_STATE_NAME c_ullPowerSourceStateName = 0x41C61D22A3BC2875ull;

std::wstring ComponentCommand(const wchar_t *wszSwitches)
{
    return std::wstring(L"regsvr32.exe ") + wszSwitches + L" \"" + testsupport::BinDir() +
           L"platformcomponent.dll\"";
}

void Publish(WNF_STATE_NAME stateName, const std::vector<BYTE> &vbData)
{
    ASSERT_HRESULT_SUCCEEDED(StateNotifyPublish(stateName, vbData.empty() ? nullptr : vbData.data(),
                                                static_cast<ULONG>(vbData.size()), nullptr));
}

std::vector<BYTE> ValueBytes(DWORD dwValue)
{
    std::vector<BYTE> vb(sizeof(dwValue));
    memcpy(vb.data(), &dwValue, sizeof(dwValue));
    return vb;
}
} // namespace

std::string PolicyFile::Text() const
{
    std::string strExpires = strExpiration;
    if (strExpires.empty())
    {
        strExpires = std::to_string(UdpConfigNow() + 864000000000ull);
    }
    return "{\"Enabled\":" + strEnabled + ",\"RelayFQDN\":" + strRelay +
           ",\"RelayPort\":" + strRelayPort + ",\"Expiration\":" + strExpires +
           ",\"LastTest\":" + strLastTest + ",\"NumPackets\":" + strNumPackets +
           ",\"MaxTestDay\":" + strMaxTestDay + ",\"Policy\":" + strPolicy + "}";
}

void WritePolicyFile(const PolicyFile &policy)
{
    ASSERT_TRUE(udptest::WriteWholeFile(c_wszUdpConfigFile, policy.Text()));
}

std::string ReadPolicyFile()
{
    std::string strText;
    udptest::ReadWholeFile(c_wszUdpConfigFile, &strText);
    return strText;
}

void PreparePrefix()
{
    testsupport::ChildResult result = testsupport::RunChild(ComponentCommand(L"/s"));
    ASSERT_EQ(0u, result.dwExitCode) << result.strOutput;
    testsupport::InstallTestApplication();
    testsupport::PreparePolicyFolder();
    // No web service: a refresh fails at once at the endpoint directory.
    RegDeleteKeyValueW(HKEY_LOCAL_MACHINE, ENDPOINT_DIRECTORY_KEY, c_wszUdpConfigRole);
    ASSERT_HRESULT_SUCCEEDED(WiFiStandInSetConnected(L"127.0.0.1"));
    ASSERT_HRESULT_SUCCEEDED(ChamberStandInSetFailure(nullptr, S_OK));
    PublishPowerSource(0);
    // A backlight that was ever published is delivered to a new subscription at once; 1 makes
    // that first delivery do nothing.
    PublishBacklight(1);
}

void CleanupPrefix()
{
    testsupport::RunChild(ComponentCommand(L"/s /u"));
    WiFiStandInSetDisconnected();
    ChamberStandInSetFailure(nullptr, S_OK);
    RegDeleteKeyValueW(HKEY_LOCAL_MACHINE, ENDPOINT_DIRECTORY_KEY, c_wszUdpConfigRole);
    testsupport::PreparePolicyFolder();
    // Whatever subscribes next (a service the prefix starts) finds nothing to do.
    PublishBacklight(1);
}

void PublishBacklight(const std::vector<BYTE> &vbData)
{
    Publish(c_ullBacklightStateName, vbData);
}

void PublishBacklight(DWORD dwValue)
{
    Publish(c_ullBacklightStateName, ValueBytes(dwValue));
}

void PublishPowerSource(DWORD dwValue)
{
    Publish(c_ullPowerSourceStateName, ValueBytes(dwValue));
}

void PublishPowerSource(const std::vector<BYTE> &vbData)
{
    Publish(c_ullPowerSourceStateName, vbData);
}

DWORD ChamberLaunchCount()
{
    DWORD dw = 0;
    DWORD cb = sizeof(dw);
    RegGetValueW(HKEY_LOCAL_MACHINE, CHAMBER_STANDIN_KEY, L"LaunchCount", RRF_RT_REG_DWORD, nullptr,
                 &dw, &cb);
    return dw;
}

std::wstring ChamberLastCommandLine()
{
    wchar_t wsz[1024] = L"";
    DWORD cb = sizeof(wsz);
    RegGetValueW(HKEY_LOCAL_MACHINE, CHAMBER_STANDIN_KEY, L"LastCommandLine", RRF_RT_REG_SZ,
                 nullptr, wsz, &cb);
    return wsz;
}

bool WaitUntil(const std::function<bool()> &pred)
{
    ULONGLONG ullDeadline = GetTickCount64() + c_dwWaitMs;
    while (!pred())
    {
        if (GetTickCount64() >= ullDeadline)
        {
            return false;
        }
        Sleep(5);
    }
    return true;
}

size_t CountLines(const udptest::TraceSession &trace, const std::string &strLine)
{
    std::vector<std::string> rgLines = trace.Lines();
    return static_cast<size_t>(std::count(rgLines.begin(), rgLines.end(), strLine));
}

bool WaitForLine(const udptest::TraceSession &trace, const std::string &strLine, size_t c)
{
    return WaitUntil([&] { return CountLines(trace, strLine) >= c; });
}
} // namespace launchertest
