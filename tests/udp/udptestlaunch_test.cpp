// The Wi-Fi gate against the Wi-Fi stand-in, and the launch's failures before the test
// application starts (the started launch is LauncherServiceTest's, through the service).
#include "platform/securityruntime/securityruntime.h"
#include "platform/wifi/wifiuser.h"
#include "service/udptestlaunch.h"
#include "service/udptestpolicy.h"
#include "tests/common/tracesession.h"
#include "tests/common/udpsupport.h"

#include <gtest/gtest.h>

using namespace testsupport;

namespace
{
// Runs on the test thread and owns the prefix's policy file, test application and stand-in
// state while it runs (the suite runs one test at a time).
class UdpTestLaunch : public ::testing::Test
{
protected:
    void SetUp() override
    {
        PreparePolicyFolder();
        InstallTestApplication();
        RegDeleteKeyW(HKEY_LOCAL_MACHINE, CHAMBER_STANDIN_KEY);
    }
    void TearDown() override
    {
        RegDeleteKeyW(HKEY_LOCAL_MACHINE, WIFI_STANDIN_KEY);
        RegDeleteKeyW(HKEY_LOCAL_MACHINE, CHAMBER_STANDIN_KEY);
        DeleteFileW(c_wszUdpConfigFile);
    }

    static UdpTestConfig RelayConfig(USHORT usPort)
    {
        UdpTestConfig config;
        ResetUdpConfig(&config);
        config.localIp = "127.0.0.1";
        config.relayFqdn = "127.0.0.1";
        config.relayPort = usPort;
        config.numPackets = 10;
        config.delay = 1;
        return config;
    }
};
} // namespace

// The gate against the Wi-Fi stand-in as telvanectl sets it (as the demo does), one row after
// the other: a failure replaces the one before, "disconnected" clears it.
TEST_F(UdpTestLaunch, WiFiGate)
{
    const std::string strRefused = "2001|We dont have active WiFi|0";
    struct
    {
        const wchar_t *wszCommand; // "platform wifi ..."; null: no state at all
        const char *szAddress;     // what the gate fills in; empty: the gate refuses
        std::vector<std::string> rgstrTrace;
    } rgCases[] = {
        {nullptr, "", {strRefused}},
        {L"connected 10.1.2.3", "10.1.2.3", {}},
        {L"connected fe80::1234:5678a", "fe80::1234:5678a", {}}, // 16 characters, no zero
        {L"fail QueryAdapterInfo", "", {"2001|QueryAdapterInfo|80070015", strRefused}},
        {L"fail QueryConnectionState 80004005",
         "",
         {"2001|QueryConnectionState|80004005", strRefused}},
        {L"fail OpenHandle", "", {"2001|WiFiUserHandle::OpenHandle|80070015", strRefused}},
        {L"disconnected", "", {strRefused}},
    };
    HklmDeleteKey(WIFI_STANDIN_KEY);
    for (const auto &c : rgCases)
    {
        SCOPED_TRACE(Narrow(c.wszCommand != nullptr ? c.wszCommand : L"no state"));
        if (c.wszCommand != nullptr)
        {
            ChildResult result = RunTelvanectl(std::wstring(L"platform wifi ") + c.wszCommand);
            ASSERT_EQ(0u, result.dwExitCode) << result.strOutput;
        }
        CTraceSession session;
        UdpTestConfig config;
        ResetUdpConfig(&config);
        EXPECT_EQ(*c.szAddress != '\0', UdpTestWiFiActive(&config));
        EXPECT_EQ(c.szAddress, config.localIp);
        EXPECT_EQ(c.rgstrTrace, session.Lines());
        EXPECT_EQ(0, WiFiStandInLiveHandles());
        EXPECT_EQ(0, WiFiStandInLiveNetworks());
    }
    WiFiUserHandle *pHandle = nullptr;
    EXPECT_EQ(E_INVALIDARG, WiFiUserHandle::OpenHandle(2, &pHandle)); // another version
    EXPECT_EQ(nullptr, pHandle);
}

TEST_F(UdpTestLaunch, FailuresBeforeTheStartStartNothing)
{
    const std::string strLine = "2008|C:\\programs\\zoriviroruz\\ZoRiVirOruz.exe -localIP "
                                "127.0.0.1 -delay 1 -count 10 127.0.0.1 47216";
    struct
    {
        const wchar_t *wszFailingCall; // of the chamber stand-in
        bool fLongRelay;               // a valid name, but the line passes 255 characters
        HRESULT hr;
        size_t cchLine; // of the command line's trace ("2008|" and the line, cut at 255)
        const char *szFailure;
    } rgCases[] = {
        {L"GetChamberSidFromId", false, CHAMBER_STANDIN_FAILURE, strLine.size(),
         "2001|GetChamberSidFromId|80070005"},
        {L"CreateProcessInChamber", false, CHAMBER_STANDIN_FAILURE, strLine.size(),
         "2001|CreateProcessInChamber|80070005"},
        {nullptr, true, static_cast<HRESULT>(0x8007007A), 5 + 255, "2001|StringCchPrintf|8007007a"},
    };
    for (const auto &c : rgCases)
    {
        SCOPED_TRACE(c.szFailure);
        RegDeleteKeyW(HKEY_LOCAL_MACHINE, CHAMBER_STANDIN_KEY);
        if (c.wszFailingCall != nullptr)
        {
            ASSERT_EQ(S_OK, ChamberStandInSetFailure(c.wszFailingCall, CHAMBER_STANDIN_FAILURE));
        }
        UdpTestConfig config = RelayConfig(47216);
        config.relayFqdn = c.fLongRelay ? std::string(200, 'r') : config.relayFqdn;
        CTraceSession session;
        HANDLE hProcess = nullptr;
        EXPECT_EQ(c.hr, LaunchUdpTest(&config, &hProcess));
        EXPECT_EQ(INVALID_HANDLE_VALUE, hProcess);
        EXPECT_EQ(0u, config.lastTest);
        std::vector<std::string> rgLines = session.Lines();
        ASSERT_EQ(2u, rgLines.size()); // the command line, the failure; nothing saved
        EXPECT_EQ(0u, rgLines[0].rfind("2008|C:\\programs\\", 0));
        EXPECT_EQ(c.cchLine, rgLines[0].size());
        EXPECT_EQ(c.szFailure, rgLines[1]);
    }
    EXPECT_EQ(INVALID_FILE_ATTRIBUTES, GetFileAttributesW(c_wszUdpConfigFile));
}
