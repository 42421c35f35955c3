// The launcher inside a running coordinator: the backlight published through the state
// facility, the policy file in the prefix, the Wi-Fi and chamber stand-ins, the installed test
// application against a loopback relay, and the coordinator's stop.
#include "tests/launcher/launchertestsupport.h"
#include "tests/common/coordinator.h"
#include "service/udptestlaunch.h"
#include "tests/common/policyserver.h"

#include <algorithm>
#include <functional>
#include <iterator>
#include <memory>

using namespace launchertest;

namespace
{
const ULONGLONG c_ullDay = 864000000000ull; // in the policy's 100 ns units

// The coordinator is the test thread's, started and stopped by the test.
class LauncherServiceTest : public CLauncherTest
{
protected:
    void TearDown() override
    {
        StopService();
        CLauncherTest::TearDown();
    }

    // A coordinator as the shell runs it, on pipe names of its own, with the backlight
    // subscription's first delivery (the value 1 the prefix was left with) handled.
    void StartService()
    {
        m_pService.reset(new CTestCoordinator());
        size_t cToggled = m_trace.CountLines(c_szHandlerToggled);
        m_pService->StartAndWait();
        ASSERT_TRUE(m_trace.WaitForLine(c_szHandlerToggled, cToggled + 1))
            << "no backlight subscription: is the platform component registered?";
    }

    // The shell's stop: returns once everything, the launcher first, is destroyed.
    void StopService()
    {
        if (m_pService != nullptr)
        {
            m_pService->StopAndCheckDrained();
            m_pService.reset();
        }
    }

    // Publishes a backlight change and waits until the launcher's handler saw it.
    void ToggleBacklight(const std::vector<BYTE> &vbData)
    {
        size_t cToggled = m_trace.CountLines(c_szHandlerToggled);
        Publish(c_ullBacklightStateName, vbData);
        ASSERT_TRUE(m_trace.WaitForLine(c_szHandlerToggled, cToggled + 1));
    }

    // The relay's report once the application sent all it was to send.
    static std::string Echoed(unsigned cPackets)
    {
        return "received " + std::to_string(cPackets) + " echoed " + std::to_string(cPackets) +
               " end packets\n";
    }

    static std::wstring CommandLine(const std::string &strArguments)
    {
        return std::wstring(c_wszTestAppPath) + L" " + Widen(strArguments);
    }

    std::unique_ptr<CTestCoordinator> m_pService;
    std::unique_ptr<CRelayProcess> m_pRelay;
};
} // namespace

// A backlight change runs the test against the policy's relay and remembers the start in the
// saved policy; an expired policy is first fetched from the web service, with the device
// certificate, and the answer is what the gates judge (what the refresh saves is
// UdpTestRefresh's). While the test application runs, changes are ignored and a stop waits for
// it to end by itself; so too after the policy could not be saved, since the process is
// tracked anyway.
TEST_F(LauncherServiceTest, BacklightChangeRunsTestThatHoldsTheStop)
{
    const USHORT usServerPort = 47330;
    const struct
    {
        const char *szName;
        bool fRefresh;
        bool fSaveFails;
        USHORT usPort;
    } rgCases[] = {{"expired and refreshed", true, false, 47303},
                   {"save failed", false, true, 47304}};
    for (const auto &c : rgCases)
    {
        SCOPED_TRACE(c.szName);
        PreparePrefix();
        m_trace.Clear();
        const std::string strPort = std::to_string(c.usPort);
        CTestPolicyServer server;
        if (c.fRefresh)
        {
            WritePolicyFile({{"Enabled", "false"},
                             {"RelayPort", "47399"},
                             {"Expiration", std::to_string(UdpConfigNow() - 10000000)}});
            PolicyServerOptions options;
            options.usPort = usServerPort;
            options.fUseBody = true;
            options.strBody =
                "{\"Enabled\":\"true\",\"RelayFQDN\":\"127.0.0.1\",\"RelayPort\":" + strPort +
                ",\"NumPackets\":250,\"MaxTestDay\":24,\"Policy\":\"BattAC\","
                "\"DurationValid\":\"P1D\"}";
            ASSERT_TRUE(server.Start(options));
            HklmSetString(ENDPOINT_DIRECTORY_KEY, c_wszUdpConfigRole,
                          L"https://localhost:" + std::to_wstring(usServerPort) + L"/");
            Publish(c_ullPowerSourceStateName, 1); // the answer allows battery power
        }
        else
        {
            WritePolicyFile({{"RelayPort", strPort}, {"NumPackets", "250"}});
        }
        if (c.fSaveFails)
        {
            // A folder where the new policy would be written makes every save fail.
            ASSERT_TRUE(CreateDirectoryW(c_wszUdpConfigTempFile, nullptr));
        }
        m_pRelay.reset(new CRelayProcess(c.usPort, L"-packets 250")); // five seconds of sending
        ASSERT_TRUE(m_pRelay->Listening());
        DWORD cLaunches = ChamberLaunchCount();
        ULONGLONG ullBefore = UdpConfigNow();
        StartService();
        ToggleBacklight({0, 0, 0, 0});
        ASSERT_TRUE(m_trace.WaitForLine(c_szLaunched));
        EXPECT_EQ(c.fRefresh ? 1u : 0u, m_trace.CountLines("2005")) << "refreshed";
        EXPECT_FALSE(m_trace.Contains(c_szConfigExpired)) << "refreshed once, at the first load";
        const std::string strArguments = "-localIP 127.0.0.1 -count 250 127.0.0.1 " + strPort;
        EXPECT_EQ(CommandLine(strArguments), ChamberLastCommandLine());
        EXPECT_TRUE(m_trace.Contains("2008|" + Narrow(CommandLine(strArguments))));
        // Started in the test application's own chamber.
        std::wstring wstrSid, wstrInstance;
        DWORD dwType = 0;
        ASSERT_TRUE(HklmReadRaw(CHAMBER_STANDIN_KEY, L"LastChamberSid", &dwType, &wstrSid));
        ASSERT_TRUE(
            HklmReadRaw(CHAMBER_STANDIN_KEY, L"LastChamberInstance", &dwType, &wstrInstance));
        EXPECT_EQ(0u, wstrSid.rfind(L"S-1-15-2-", 0));
        EXPECT_STREQ(c_wszUdpTestChamberInstance, wstrInstance.c_str());
        EXPECT_EQ(c.fSaveFails, m_trace.Contains("2001|CreateFile (write)|80070005"))
            << "the failed save is traced";
        // The start is remembered in the saved policy, with the rest of it unchanged.
        std::string strSaved = ReadFileText(c_wszUdpConfigFile);
        size_t ichLastTest = strSaved.find("\"LastTest\":");
        ASSERT_NE(std::string::npos, ichLastTest) << strSaved;
        EXPECT_EQ(!c.fSaveFails, ullBefore <= std::stoull(strSaved.substr(ichLastTest + 11)));
        EXPECT_NE(std::string::npos, strSaved.find("\"RelayPort\":" + strPort)) << strSaved;
        ASSERT_TRUE(ResultFiles().empty()) << "the test ended before the next change";
        ToggleBacklight({0, 0, 0, 0});
        ToggleBacklight({2, 0, 0, 0});
        EXPECT_EQ(2u, m_trace.CountLines(c_szStillRunning));

        StopService();
        // The application writes its result as it ends: the stop came back only after that.
        EXPECT_EQ(1u, ResultFiles().size());
        EXPECT_TRUE(m_trace.Contains(c_szStillWaiting));
        EXPECT_TRUE(m_trace.Contains(c_szFinishedDestruction));
        EXPECT_EQ(Echoed(250), m_pRelay->WaitForReport());
        EXPECT_EQ(cLaunches + 1, ChamberLaunchCount());
    }
}

// Every gate that refuses, and a launch step that fails, traces why and starts nothing. How
// each gate judges its values (the relay's name, the spacing of tests, the Wi-Fi stand-in's
// failures, the launch's other failures) is the UDP suites' to check; here one row per gate.
// A backlight value of 1 does nothing beyond the two trace lines; any other value, and data
// too short to hold a value, runs the checks, with the policy file read once. After the stop
// the launcher no longer hears the backlight.
TEST_F(LauncherServiceTest, RefusalsAreTracedAndStartNothing)
{
    const std::string strOneHourAgo = std::to_string(UdpConfigNow() - c_ullDay / 24);
    auto power = [](std::vector<BYTE> vbData) {
        return [=] { Publish(c_ullPowerSourceStateName, vbData); };
    };
    const char szNotEnabled[] = "2001|Not enabled|0";
    const char szNoRelay[] = "2001|No relay to test against|0";
    const char szNoWiFi[] = "2001|We dont have active WiFi|0";
    const char szNotTime[] = "2001|Not time to run|0";
    const char szNotOnAc[] = "2001|Not on AC, it's required|0";
    const struct
    {
        const char *szName;
        PolicyMembers policy;                // replaces members of the open policy
        std::function<void()> pfnPrefix;     // changes the open prefix
        std::vector<std::string> rgExpected; // the failure lines, in this order
        std::vector<std::vector<BYTE>> rgToggles = {{0, 0, 0, 0}}; // the backlight's values
    } rgCases[] = {
        {"disabled, backlight values",
         {{"Enabled", "false"}},
         nullptr,
         {szNotEnabled, szNotEnabled, szNotEnabled, szNotEnabled},
         {{1, 0, 0, 0}, {0, 0, 0, 0}, {2, 0, 0, 0}, {1, 0, 0, 0, 7, 7}, {1, 0}, {}}},
        // The reader gives a saved empty name back as null.
        {"empty relay", {{"RelayFQDN", "\"\""}}, nullptr, {szNoRelay}},
        {"relay port 0", {{"RelayPort", "0"}}, nullptr, {szNoRelay}},
        {"on battery", {}, power({1, 0, 0, 0}), {szNotOnAc}},
        {"power state too short", {}, power({0, 0}), {szNotOnAc}},
        {"battery allowed, no Wi-Fi",
         {{"Policy", "\"BattAC\""}},
         [=] {
             power({1, 0, 0, 0})();
             WiFiStandInSetDisconnected();
         },
         {szNoWiFi}},
        {"tested an hour ago", {{"LastTest", strOneHourAgo}}, nullptr, {szNotTime}},
        // The record is reset before the file is read, and the refresh brings nothing.
        {"no policy file",
         {},
         [] { DeleteFileW(c_wszUdpConfigFile); },
         {"2001|CreateFile (read)|80070002", "2001|GetServiceEndpoint|80070002", szNotEnabled}},
        {"chamber refuses the process",
         {},
         [] { ChamberStandInSetFailure(L"CreateProcessInChamber", CHAMBER_STANDIN_FAILURE); },
         {"2001|CreateProcessInChamber|80070005"}},
    };
    for (const auto &c : rgCases)
    {
        SCOPED_TRACE(c.szName);
        PreparePrefix();
        WritePolicyFile(c.policy);
        if (c.pfnPrefix)
        {
            c.pfnPrefix();
        }
        DWORD cLaunches = ChamberLaunchCount();
        m_trace.Clear();
        StartService();

        for (const std::vector<BYTE> &vbData : c.rgToggles)
        {
            ToggleBacklight(vbData);
        }
        StopService(); // every handler has run when the launcher is destroyed
        EXPECT_EQ(1u, m_trace.CountLines(c_szLoadingConfig));
        EXPECT_EQ(1u, m_trace.CountLines(c_szFinishedDestruction));
        std::vector<std::string> rgLines = m_trace.Lines(), rgFailures;
        std::copy_if(
            rgLines.begin(), rgLines.end(), std::back_inserter(rgFailures),
            [](const std::string &strLine) { return strLine.compare(0, 5, "2001|") == 0; });
        EXPECT_EQ(c.rgExpected, rgFailures);
        EXPECT_FALSE(m_trace.Contains(c_szLaunched));
        EXPECT_EQ(cLaunches, ChamberLaunchCount());
    }
    size_t cCallbacks = m_trace.CountLines(c_szCallbackToggled);
    Publish(c_ullBacklightStateName, 0);
    Sleep(200);
    EXPECT_EQ(cCallbacks, m_trace.CountLines(c_szCallbackToggled));
}
