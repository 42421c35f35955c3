// Helpers of the launcher suites: the prefix made ready for a test (platform component
// registered, test application installed, Wi-Fi connected, mains power, chambers working,
// no web service role), the policy file written as the web service would have it, the states
// published as the phone does, and what the chamber stand-in recorded. Every helper changes
// machine-wide state of the prefix, so the suites run one test at a time, on the test thread.
#pragma once

#include "platform/endpointdirectory/endpointdirectory.h"
#include "platform/securityruntime/securityruntime.h"
#include "platform/statenotify/statenotify.h"
#include "platform/statenotify/statenotifypublish.h"
#include "platform/wifi/wifiuser.h"
#include "service/statesubscription.h"
#include "service/udptestpolicy.h"
#include "tests/common/tracesession.h"
#include "tests/common/udpsupport.h"

#include <gtest/gtest.h>
#include <map>
#include <string>
#include <vector>

namespace launchertest
{
using namespace testsupport;

const WNF_STATE_NAME c_ullPowerSourceStateName = 0x41C61D22A3BC2875ull;

// Trace lines of the launcher, as the session records them.
#define LAUNCHER_LINE(text) "1001|CUDPTestLauncher::" text
const char c_szCallbackToggled[] = LAUNCHER_LINE("WnfNotificationCallback() - backlight toggled");
const char c_szHandlerToggled[] =
    LAUNCHER_LINE("Dispatch_BacklightChangedup  () - backlight toggled");
const char c_szLoadingConfig[] =
    LAUNCHER_LINE("Dispatch_BacklightChangedup  () - loading UDP config");
const char c_szConfigExpired[] =
    LAUNCHER_LINE("Dispatch_BacklightChangedup  () - config expired, refreshing");
const char c_szLaunched[] = LAUNCHER_LINE("Dispatch_BacklightChangedup  () - UDP app launched");
const char c_szStillRunning[] =
    LAUNCHER_LINE("Dispatch_BacklightChanged() - process is still running, ignoring this call");
const char c_szDestroyingIgnored[] =
    LAUNCHER_LINE("Dispatch_BacklightChanged() - destroying, ignoring this call");
const char c_szStillWaiting[] =
    LAUNCHER_LINE("Dispatch_AdvanceDestruction() - still waiting on outstanding operation");
const char c_szFinishedDestruction[] =
    LAUNCHER_LINE("Dispatch_AdvanceDestruction() - finished destruction, signaling event");
#undef LAUNCHER_LINE

// Members of the policy file by name, each as JSON text. The defaults open every gate
// (enabled, a loopback relay on port 47310, expiring in a day, never tested), and each member
// given replaces its default.
typedef std::map<std::string, std::string> PolicyMembers;
inline void WritePolicyFile(const PolicyMembers &members)
{
    PolicyMembers all = {
        {"Enabled", "true"},    {"RelayFQDN", "\"127.0.0.1\""},
        {"RelayPort", "47310"}, {"Expiration", std::to_string(UdpConfigNow() + 864000000000ull)},
        {"LastTest", "0"},      {"NumPackets", "20"},
        {"MaxTestDay", "1"},    {"Policy", "\"ACOnly\""}};
    for (const auto &member : members)
    {
        all[member.first] = member.second;
    }
    std::string strText;
    for (const char *szName : {"Enabled", "RelayFQDN", "RelayPort", "Expiration", "LastTest",
                               "NumPackets", "MaxTestDay", "Policy"})
    {
        strText += (strText.empty() ? "{\"" : ",\"") + std::string(szName) + "\":" + all[szName];
    }
    ASSERT_TRUE(WriteFileText(c_wszUdpConfigFile, strText + "}"));
}

// Publishes the state with these bytes, or with the four bytes of a value.
inline void Publish(WNF_STATE_NAME stateName, const std::vector<BYTE> &vbData)
{
    ASSERT_HRESULT_SUCCEEDED(StateNotifyPublish(stateName, vbData.empty() ? nullptr : vbData.data(),
                                                static_cast<ULONG>(vbData.size()), nullptr));
}
inline void Publish(WNF_STATE_NAME stateName, DWORD dwValue)
{
    const BYTE *pb = reinterpret_cast<const BYTE *>(&dwValue);
    Publish(stateName, std::vector<BYTE>(pb, pb + sizeof(dwValue)));
}

// What the chamber stand-in recorded of the processes it started.
inline DWORD ChamberLaunchCount()
{
    DWORD dw = 0;
    HklmReadDword(CHAMBER_STANDIN_KEY, L"LaunchCount", &dw);
    return dw;
}
inline std::wstring ChamberLastCommandLine()
{
    DWORD dwType = 0;
    std::wstring wstr;
    HklmReadRaw(CHAMBER_STANDIN_KEY, L"LastCommandLine", &dwType, &wstr);
    return wstr.c_str(); // without the terminator
}

// Base of the suites' fixtures: the prefix prepared as described at the top and put back
// afterwards, the main provider's events and the failure reports captured.
class CLauncherTest : public ::testing::Test
{
protected:
    void SetUp() override { PreparePrefix(); }
    void TearDown() override
    {
        RunChild(L"regsvr32.exe /s /u " + BinCommand(L"platformcomponent.dll"));
        WiFiStandInSetDisconnected();
        // Whatever subscribes next (a service the prefix starts) finds nothing to do.
        ResetPrefix();
        m_failures.ExpectNone();
    }
    // Puts the prefix as SetUp leaves it, for cases that need it fresh.
    void PreparePrefix()
    {
        ChildResult result = RunChild(L"regsvr32.exe /s " + BinCommand(L"platformcomponent.dll"));
        ASSERT_EQ(0u, result.dwExitCode) << result.strOutput;
        InstallTestApplication();
        // No web service: a refresh fails at once at the endpoint directory.
        ResetPrefix();
        ASSERT_HRESULT_SUCCEEDED(WiFiStandInSetConnected(L"127.0.0.1"));
        Publish(c_ullPowerSourceStateName, 0);
    }
    // What the prefix keeps between tests and the phone would not have set.
    static void ResetPrefix()
    {
        HklmDeleteValue(ENDPOINT_DIRECTORY_KEY, c_wszUdpConfigRole);
        ChamberStandInSetFailure(nullptr, S_OK);
        PreparePolicyFolder();
        // A backlight that was ever published is delivered to a new subscription at once; 1
        // makes that first delivery do nothing.
        Publish(c_ullBacklightStateName, 1);
    }

    FailureCapture m_failures;
    CTraceSession m_trace;
};
} // namespace launchertest
