// The launcher inside a running coordinator: the backlight published through the state
// facility, the policy file in the prefix, the Wi-Fi and chamber stand-ins, the installed test
// application against a loopback relay, and the coordinator's stop.
#include "tests/core/coretestsupport.h"
#include "tests/launcher/launchertestsupport.h"
#include "platform/securityruntime/securityruntime.h"
#include "platform/wifi/wifiuser.h"
#include "service/udptestpolicy.h"
#include "platform/endpointdirectory/endpointdirectory.h"
#include "tests/common/policyserver.h"

#include <gtest/gtest.h>
#include <memory>

using namespace launchertest;

namespace
{
const wchar_t c_wszTestApplication[] = L"C:\\programs\\zoriviroruz\\ZoRiVirOruz.exe";

class LauncherServiceTest : public ::testing::Test
{
protected:
    void SetUp() override
    {
        PreparePrefix();
        RestartTrace();
    }

    // Forgets what was traced so far.
    void RestartTrace()
    {
        m_pTrace.reset();
        m_pTrace.reset(new udptest::TraceSession());
    }

    void TearDown() override
    {
        StopService();
        CleanupPrefix();
        for (const std::wstring &wstrLine : m_failures.Lines())
        {
            ADD_FAILURE() << testsupport::Narrow(wstrLine);
        }
    }

    // A coordinator as the shell runs it, on pipe names of its own, with the backlight
    // subscription's first delivery (the value 1 the prefix was left with) handled.
    void StartService()
    {
        m_wstrActivityPipe = pipetest::UniquePipeName(L"launchact");
        m_wstrCollectorPipe = pipetest::UniquePipeName(L"launchcol");
        m_pService.reset(new coretest::CTestCoordinator(m_wstrActivityPipe.c_str(),
                                                        m_wstrCollectorPipe.c_str()));
        size_t cToggled = CountLines(*m_pTrace, c_szHandlerToggled);
        m_pService->OnStart();
        ASSERT_TRUE(WaitUntil([&] { return m_pService->State() == SERVICE_RUNNING; }));
        ASSERT_TRUE(WaitForLine(*m_pTrace, c_szHandlerToggled, cToggled + 1))
            << "no backlight subscription: is the platform component registered?";
    }

    // The shell's stop: returns once everything, the launcher first, is destroyed.
    void StopService()
    {
        if (m_pService != nullptr)
        {
            m_pService->OnStop();
            EXPECT_EQ(static_cast<DWORD>(SERVICE_STOPPED), m_pService->State());
            m_pService.reset();
        }
    }

    // Publishes a backlight change and waits until the launcher's handler saw it.
    void ToggleBacklight(DWORD dwValue)
    {
        size_t cToggled = CountLines(*m_pTrace, c_szHandlerToggled);
        PublishBacklight(dwValue);
        ASSERT_TRUE(WaitForLine(*m_pTrace, c_szHandlerToggled, cToggled + 1));
    }

    std::wstring ExpectedCommandLine(const std::string &strArguments)
    {
        return std::wstring(c_wszTestApplication) + L" " +
               std::wstring(strArguments.begin(), strArguments.end());
    }

    testsupport::FailureCapture m_failures;
    std::unique_ptr<udptest::TraceSession> m_pTrace;
    std::wstring m_wstrActivityPipe;
    std::wstring m_wstrCollectorPipe;
    std::unique_ptr<coretest::CTestCoordinator> m_pService;
};

TEST_F(LauncherServiceTest, BacklightChangeRunsTestAgainstRelay)
{
    const USHORT usPort = 47301;
    PolicyFile policy;
    policy.strRelayPort = std::to_string(usPort);
    WritePolicyFile(policy);
    testsupport::CRelayProcess relay(usPort, L"-packets 20");
    ASSERT_TRUE(relay.Listening());
    DWORD cLaunches = ChamberLaunchCount();
    StartService();

    ULONGLONG ullBefore = UdpConfigNow();
    ToggleBacklight(0);
    ASSERT_TRUE(WaitForLine(*m_pTrace, c_szLaunched));
    EXPECT_EQ(cLaunches + 1, ChamberLaunchCount());
    const std::string strArguments = "-localIP 127.0.0.1 -count 20 127.0.0.1 47301";
    EXPECT_EQ(ExpectedCommandLine(strArguments), ChamberLastCommandLine());
    EXPECT_TRUE(
        m_pTrace->Contains("2008|C:\\programs\\zoriviroruz\\ZoRiVirOruz.exe " + strArguments));
    EXPECT_TRUE(m_pTrace->Contains(c_szLoadingConfig));

    EXPECT_EQ("received 20 echoed 20 end packets\n", relay.WaitForReport());
    ASSERT_TRUE(WaitUntil([] { return !testsupport::ResultFiles().empty(); }));
    std::string strResult;
    ASSERT_TRUE(udptest::ReadWholeFile(testsupport::ResultFiles()[0], &strResult));
    EXPECT_NE(std::string::npos, strResult.find("\"Received\":20")) << strResult;

    // The start is remembered in the saved policy, with the rest of it unchanged.
    std::string strSaved = ReadPolicyFile();
    size_t ichLastTest = strSaved.find("\"LastTest\":");
    ASSERT_NE(std::string::npos, ichLastTest) << strSaved;
    unsigned long long ullLastTest = std::stoull(strSaved.substr(ichLastTest + 11));
    EXPECT_LE(ullBefore, ullLastTest);
    EXPECT_NE(std::string::npos, strSaved.find("\"RelayPort\":47301,")) << strSaved;

    StopService();
    EXPECT_TRUE(m_pTrace->Contains(c_szFinishedDestruction));
}

// A value of 1 does nothing beyond the two trace lines; any other value, and data too short to
// hold a value, runs the checks (here the policy's "Not enabled").
TEST_F(LauncherServiceTest, BacklightValuesAndShortData)
{
    PolicyFile policy;
    policy.strEnabled = "false";
    policy.strRelayPort = "47302";
    WritePolicyFile(policy);
    StartService();

    struct
    {
        std::vector<BYTE> vbData;
        bool fChecks;
    } rgCases[] = {
        {{1, 0, 0, 0}, false}, {{0, 0, 0, 0}, true},
        {{2, 0, 0, 0}, true},  {{1, 0, 0, 0, 7, 7}, false}, // only the first value counts
        {{1, 0}, true},        {{}, true},
    };
    size_t cChecks = 0;
    for (const auto &c : rgCases)
    {
        size_t cToggled = CountLines(*m_pTrace, c_szHandlerToggled);
        PublishBacklight(c.vbData);
        ASSERT_TRUE(WaitForLine(*m_pTrace, c_szHandlerToggled, cToggled + 1));
        if (c.fChecks)
        {
            cChecks++;
            ASSERT_TRUE(WaitForLine(*m_pTrace, c_szNotAsked, cChecks)) << c.vbData.size();
        }
    }
    StopService(); // drains the launcher's queue: nothing more is on its way
    EXPECT_EQ(cChecks, CountLines(*m_pTrace, c_szNotAsked));
    EXPECT_EQ(cChecks, CountLines(*m_pTrace, "2001|Not enabled|0"));
    EXPECT_EQ(1u, CountLines(*m_pTrace, c_szLoadingConfig)); // the file is read once
}

// A change while the test application runs is ignored; so is a change that comes after the
// policy could not be saved, since the process is tracked anyway.
TEST_F(LauncherServiceTest, ChangeWhileTestRunsIsIgnored)
{
    struct
    {
        const char *szName;
        bool fSaveFails;
    } rgCases[] = {{"saved", false}, {"save failed", true}};
    USHORT usPort = 47303;
    for (const auto &c : rgCases)
    {
        SCOPED_TRACE(c.szName);
        PreparePrefix();
        RestartTrace();
        PolicyFile policy;
        policy.strRelayPort = std::to_string(usPort);
        policy.strNumPackets = "150"; // three seconds of sending
        WritePolicyFile(policy);
        if (c.fSaveFails)
        {
            // A folder where the new policy would be written makes every save fail.
            ASSERT_TRUE(CreateDirectoryW(c_wszUdpConfigTempFile, nullptr));
        }
        testsupport::CRelayProcess relay(usPort, L"-packets 150");
        ASSERT_TRUE(relay.Listening());
        DWORD cLaunches = ChamberLaunchCount();
        StartService();

        ToggleBacklight(0);
        ASSERT_TRUE(WaitForLine(*m_pTrace, c_szLaunched));
        EXPECT_EQ(c.fSaveFails, m_pTrace->Contains("2001|CreateFile (write)|80070005"))
            << "the failed save is traced";
        ASSERT_TRUE(testsupport::ResultFiles().empty()) << "the test ended before the next change";
        ToggleBacklight(0);
        ToggleBacklight(2);
        EXPECT_EQ(2u, CountLines(*m_pTrace, c_szStillRunning));
        EXPECT_EQ(cLaunches + 1, ChamberLaunchCount());

        EXPECT_EQ("received 150 echoed 150 end packets\n", relay.WaitForReport());
        StopService();
        EXPECT_EQ(cLaunches + 1, ChamberLaunchCount());
        EXPECT_EQ(1u, testsupport::ResultFiles().size());
        usPort++;
    }
}

// Stopping the service while the test application runs waits for it to end by itself.
TEST_F(LauncherServiceTest, StopWhileTestRunsCompletesAfterTestExits)
{
    const USHORT usPort = 47306;
    PolicyFile policy;
    policy.strRelayPort = std::to_string(usPort);
    policy.strNumPackets = "250"; // five seconds of sending
    WritePolicyFile(policy);
    testsupport::CRelayProcess relay(usPort, L"-packets 250");
    ASSERT_TRUE(relay.Listening());
    StartService();

    ToggleBacklight(0);
    ASSERT_TRUE(WaitForLine(*m_pTrace, c_szLaunched));
    ASSERT_TRUE(testsupport::ResultFiles().empty()) << "the test ended before the stop";
    StopService();
    // The application writes its result as it ends: the stop came back only after that.
    EXPECT_EQ(1u, testsupport::ResultFiles().size());
    EXPECT_TRUE(m_pTrace->Contains(c_szStillWaiting));
    EXPECT_TRUE(m_pTrace->Contains(c_szFinishedDestruction));
    EXPECT_EQ("received 250 echoed 250 end packets\n", relay.WaitForReport());
}

// An expired policy is fetched from the web service, with the device certificate, before the
// gates are judged; the answer's relay is the one tested and the saved file carries it.
TEST_F(LauncherServiceTest, ExpiredPolicyIsRefreshedFromWebService)
{
    const USHORT usServerPort = 47330;
    const USHORT usRelayPort = 47331;
    PolicyFile policy;
    policy.strEnabled = "false";
    policy.strRelayPort = "47399";
    policy.strExpiration = std::to_string(UdpConfigNow() - 10000000); // a second ago
    WritePolicyFile(policy);
    PolicyServerOptions options;
    options.usPort = usServerPort;
    options.fUseBody = true;
    options.strBody = "{\"Enabled\":\"true\",\"RelayFQDN\":\"127.0.0.1\",\"RelayPort\":" +
                      std::to_string(usRelayPort) +
                      ",\"NumPackets\":10,\"MaxTestDay\":24,\"Policy\":\"BattAC\","
                      "\"DurationValid\":\"P1D\"}";
    CTestPolicyServer server;
    ASSERT_TRUE(server.Start(options));
    std::wstring wstrEndpoint = L"https://localhost:" + std::to_wstring(usServerPort) + L"/";
    ASSERT_EQ(ERROR_SUCCESS,
              RegSetKeyValueW(HKEY_LOCAL_MACHINE, ENDPOINT_DIRECTORY_KEY, c_wszUdpConfigRole,
                              REG_SZ, wstrEndpoint.c_str(),
                              static_cast<DWORD>((wstrEndpoint.size() + 1) * sizeof(wchar_t))));
    PublishPowerSource(1); // the answer allows battery power
    testsupport::CRelayProcess relay(usRelayPort, L"-packets 10");
    ASSERT_TRUE(relay.Listening());
    StartService();

    ULONGLONG ullBefore = UdpConfigNow();
    ToggleBacklight(0);
    ASSERT_TRUE(WaitForLine(*m_pTrace, c_szLaunched));
    ULONGLONG ullAfter = UdpConfigNow();
    EXPECT_EQ("received 10 echoed 10 end packets\n", relay.WaitForReport());
    EXPECT_EQ(ExpectedCommandLine("-localIP 127.0.0.1 -count 10 127.0.0.1 47331"),
              ChamberLastCommandLine());
    std::vector<std::string> rgRequests = server.Requests();
    ASSERT_EQ(1u, rgRequests.size());
    EXPECT_NE(std::string::npos, rgRequests[0].find("/v1/api/config/udpecho")) << rgRequests[0];
    EXPECT_TRUE(m_pTrace->Contains("2005")) << "refreshed";
    EXPECT_FALSE(m_pTrace->Contains(c_szConfigExpired)) << "refreshed once, at the first load";

    // The saved policy holds the answer with its absolute expiration, a day after the fetch.
    std::string strSaved = ReadPolicyFile();
    EXPECT_EQ(0u, strSaved.find("{\"Enabled\":true,\"RelayFQDN\":\"127.0.0.1\",\"RelayPort\":47331,"
                                "\"Expiration\":"))
        << strSaved;
    unsigned long long ullExpiration =
        std::stoull(strSaved.substr(strSaved.find("\"Expiration\":") + 13));
    EXPECT_LE(ullBefore + 864000000000ull, ullExpiration);
    EXPECT_GE(ullAfter + 864000000000ull, ullExpiration);
    EXPECT_NE(std::string::npos, strSaved.find(",\"Policy\":\"BattAC\"}")) << strSaved;
}

// Every gate that refuses, and every launch step that fails, traces why and starts nothing.
struct RefusalCase
{
    const char *szName;
    bool fPolicyFile;                            // false: no policy file at all
    std::function<void(PolicyFile *)> pfnPolicy; // changes the open policy
    std::function<void()> pfnPrefix;             // changes the open prefix
    std::vector<std::string> rgExpected;         // trace lines, in this order
};

const std::vector<RefusalCase> &RefusalCases()
{
    static const std::vector<RefusalCase> s_rgCases = {
        {"disabled",
         true,
         [](PolicyFile *p) { p->strEnabled = "false"; },
         nullptr,
         {"2001|Not enabled|0"}},
        {"enabled as text",
         true,
         [](PolicyFile *p) { p->strEnabled = "\"yes\""; },
         nullptr,
         {"2001|Not enabled|0"}},
        // The reader gives a saved empty name back as null.
        {"empty relay",
         true,
         [](PolicyFile *p) { p->strRelay = "\"\""; },
         nullptr,
         {"2001|No relay to test against|0"}},
        {"relay null",
         true,
         [](PolicyFile *p) { p->strRelay = "\"null\""; },
         nullptr,
         {"2001|No relay to test against|0"}},
        {"relay port 0",
         true,
         [](PolicyFile *p) { p->strRelayPort = "0"; },
         nullptr,
         {"2001|No relay to test against|0"}},
        {"relay port not a number",
         true,
         [](PolicyFile *p) { p->strRelayPort = "\"x47310\""; },
         nullptr,
         {"2001|No relay to test against|0"}},
        {"on battery",
         true,
         nullptr,
         [] { PublishPowerSource(1); },
         {"2001|Not on AC, it's required|0"}},
        {"power state too short",
         true,
         nullptr,
         [] {
             PublishPowerSource(std::vector<BYTE>{0, 0});
         },
         {"2001|Not on AC, it's required|0"}},
        {"battery allowed, no Wi-Fi",
         true,
         [](PolicyFile *p) { p->strPolicy = "\"BattAC\""; },
         [] {
             PublishPowerSource(1);
             WiFiStandInSetDisconnected();
         },
         {"2001|We dont have active WiFi|0"}},
        {"Wi-Fi disconnected",
         true,
         nullptr,
         [] { WiFiStandInSetDisconnected(); },
         {"2001|We dont have active WiFi|0"}},
        {"Wi-Fi handle fails",
         true,
         nullptr,
         [] { WiFiStandInSetFailure(L"OpenHandle", c_hrWiFiStandInFailure); },
         {"2001|WiFiUserHandle::OpenHandle|80070015", "2001|We dont have active WiFi|0"}},
        {"Wi-Fi state fails",
         true,
         nullptr,
         [] { WiFiStandInSetFailure(L"QueryConnectionState", c_hrWiFiStandInFailure); },
         {"2001|QueryConnectionState|80070015", "2001|We dont have active WiFi|0"}},
        {"Wi-Fi adapter fails",
         true,
         nullptr,
         [] { WiFiStandInSetFailure(L"QueryAdapterInfo", c_hrWiFiStandInFailure); },
         {"2001|QueryAdapterInfo|80070015", "2001|We dont have active WiFi|0"}},
        {"tested an hour ago",
         true,
         [](PolicyFile *p) { p->strLastTest = std::to_string(UdpConfigNow() - 36000000000ull); },
         nullptr,
         {"2001|Not time to run|0"}},
        {"no tests a day",
         true,
         [](PolicyFile *p) {
             p->strLastTest = "1";
             p->strMaxTestDay = "0";
         },
         nullptr,
         {"2001|Not time to run|0"}},
        {"negative tests a day",
         true,
         [](PolicyFile *p) {
             p->strLastTest = "1";
             p->strMaxTestDay = "-2";
         },
         nullptr,
         {"2001|Not time to run|0"}},
        {"tests a day not a number",
         true,
         [](PolicyFile *p) {
             p->strLastTest = "1";
             p->strMaxTestDay = "\"often\"";
         },
         nullptr,
         {"2001|Not time to run|0"}},
        // The record is reset before the file is read, and the refresh brings nothing.
        {"no policy file",
         false,
         nullptr,
         nullptr,
         {"2001|CreateFile (read)|80070002", "2001|GetServiceEndpoint|80070002",
          "2001|Not enabled|0"}},
        {"no chamber",
         true,
         nullptr,
         [] { ChamberStandInSetFailure(L"GetChamberSidFromId", CHAMBER_STANDIN_FAILURE); },
         {"2001|GetChamberSidFromId|80070005"}},
        {"chamber refuses the process",
         true,
         nullptr,
         [] { ChamberStandInSetFailure(L"CreateProcessInChamber", CHAMBER_STANDIN_FAILURE); },
         {"2001|CreateProcessInChamber|80070005"}},
        // The line would be cut, and a cut line tests against another relay or port.
        {"command line too long",
         true,
         [](PolicyFile *p) { p->strRelay = "\"" + std::string(220, 'r') + "\""; },
         nullptr,
         {"2001|StringCchPrintf|8007007a"}},
    };
    return s_rgCases;
}

TEST_F(LauncherServiceTest, RefusalsAreTracedAndStartNothing)
{
    for (const RefusalCase &c : RefusalCases())
    {
        SCOPED_TRACE(c.szName);
        PreparePrefix();
        PolicyFile policy;
        policy.strRelayPort = "47310";
        if (c.pfnPolicy)
        {
            c.pfnPolicy(&policy);
        }
        if (c.fPolicyFile)
        {
            WritePolicyFile(policy);
        }
        if (c.pfnPrefix)
        {
            c.pfnPrefix();
        }
        DWORD cLaunches = ChamberLaunchCount();
        RestartTrace();
        StartService();

        ToggleBacklight(0);
        StopService(); // every handler has run when the launcher is destroyed
        std::vector<std::string> rgFailures;
        for (const std::string &strLine : m_pTrace->Lines())
        {
            if (strLine.compare(0, 5, "2001|") == 0)
            {
                rgFailures.push_back(strLine);
            }
        }
        EXPECT_EQ(c.rgExpected, rgFailures);
        EXPECT_FALSE(m_pTrace->Contains(c_szLaunched));
        EXPECT_EQ(cLaunches, ChamberLaunchCount());
    }
}
} // namespace
