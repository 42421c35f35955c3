#include "tests/launcher/launchertestsupport.h"

#include "platform/endpointdirectory/endpointdirectory.h"
#include "platform/securityruntime/securityruntime.h"
#include "platform/statenotify/statenotifypublish.h"
#include "platform/wifi/wifiuser.h"
#include "service/udptestpolicy.h"
#include "tests/common/udpsupport.h"

namespace launchertest
{
namespace
{
// What the prefix keeps between tests and the phone would not have set.
void ResetPrefix()
{
    HklmDeleteValue(ENDPOINT_DIRECTORY_KEY, c_wszUdpConfigRole);
    ChamberStandInSetFailure(nullptr, S_OK);
    PreparePolicyFolder();
    // A backlight that was ever published is delivered to a new subscription at once; 1 makes
    // that first delivery do nothing.
    Publish(c_ullBacklightStateName, 1);
}
} // namespace

void WritePolicyFile(const PolicyMembers &members)
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

void Publish(WNF_STATE_NAME stateName, const std::vector<BYTE> &vbData)
{
    ASSERT_HRESULT_SUCCEEDED(StateNotifyPublish(stateName, vbData.empty() ? nullptr : vbData.data(),
                                                static_cast<ULONG>(vbData.size()), nullptr));
}

void Publish(WNF_STATE_NAME stateName, DWORD dwValue)
{
    const BYTE *pb = reinterpret_cast<const BYTE *>(&dwValue);
    Publish(stateName, std::vector<BYTE>(pb, pb + sizeof(dwValue)));
}

DWORD ChamberLaunchCount()
{
    DWORD dw = 0;
    HklmReadDword(CHAMBER_STANDIN_KEY, L"LaunchCount", &dw);
    return dw;
}

std::wstring ChamberLastCommandLine()
{
    DWORD dwType = 0;
    std::wstring wstr;
    HklmReadRaw(CHAMBER_STANDIN_KEY, L"LastCommandLine", &dwType, &wstr);
    return wstr.c_str(); // without the terminator
}

void CLauncherTest::PreparePrefix()
{
    ChildResult result = RunChild(L"regsvr32.exe /s " + BinCommand(L"platformcomponent.dll"));
    ASSERT_EQ(0u, result.dwExitCode) << result.strOutput;
    InstallTestApplication();
    // No web service: a refresh fails at once at the endpoint directory.
    ResetPrefix();
    ASSERT_HRESULT_SUCCEEDED(WiFiStandInSetConnected(L"127.0.0.1"));
    Publish(c_ullPowerSourceStateName, 0);
}

void CLauncherTest::TearDown()
{
    RunChild(L"regsvr32.exe /s /u " + BinCommand(L"platformcomponent.dll"));
    WiFiStandInSetDisconnected();
    // Whatever subscribes next (a service the prefix starts) finds nothing to do.
    ResetPrefix();
    m_failures.ExpectNone();
}
} // namespace launchertest
