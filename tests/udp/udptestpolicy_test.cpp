// The policy file in the prefix's real policy folder, and a refresh with no policy service. (A
// save that fails keeps the old policy: LauncherServiceTest's running-test row.)
#include "platform/endpointdirectory/endpointdirectory.h"
#include "service/udptestpolicy.h"
#include "tests/common/tracesession.h"
#include "tests/common/udpsupport.h"

#include <gtest/gtest.h>

using namespace testsupport;

namespace
{
const char c_szResetText[] = R"({"Enabled":false,"RelayFQDN":"","RelayPort":0,"Expiration":0,)"
                             R"("LastTest":0,"NumPackets":500,"MaxTestDay":0,"Policy":"BattAC"})";

// Runs on the test thread and owns the prefix's policy file and endpoint role while it runs
// (the suite runs one test at a time).
class UdpTestPolicy : public ::testing::Test
{
protected:
    void SetUp() override { PreparePolicyFolder(); }
    void TearDown() override
    {
        DeleteFileW(c_wszUdpConfigFile);
        HklmDeleteValue(ENDPOINT_DIRECTORY_KEY, c_wszUdpConfigRole);
    }
};
} // namespace

TEST_F(UdpTestPolicy, SaveAndLoadRoundTripThroughTheFile)
{
    CTraceSession session;
    UdpTestConfig config;
    config.enabled = true;
    ResetUdpConfig(&config);
    ASSERT_EQ(S_OK, SaveUdpConfig(&config));
    EXPECT_EQ(c_szResetText, ReadFileText(c_wszUdpConfigFile));
    EXPECT_EQ(std::vector<std::string>({"2007"}), session.Lines());
    // Written under the temporary name, which is gone once it replaced the policy.
    EXPECT_EQ(INVALID_FILE_ATTRIBUTES, GetFileAttributesW(c_wszUdpConfigTempFile));

    // Every field the file keeps differs from the reset record loaded into, so one that is
    // not read back shows when the loaded record is saved again.
    UdpTestConfig saved;
    ResetUdpConfig(&saved);
    saved.enabled = true;
    saved.acOnly = true;
    saved.maxTestDay = 2.5f;
    saved.expiration = 134000000000000000ull;
    saved.lastTest = 133999999999999999ull;
    saved.relayFqdn = "relay.example.net";
    saved.relayPort = 47211;
    saved.numPackets = 100;
    saved.localIp = "10.0.0.7"; // not kept in the file
    ASSERT_EQ(S_OK, SaveUdpConfig(&saved));
    const std::string strSaved = ReadFileText(c_wszUdpConfigFile);
    EXPECT_EQ(R"({"Enabled":true,"RelayFQDN":"relay.example.net","RelayPort":47211,)"
              R"("Expiration":134000000000000000,"LastTest":133999999999999999,)"
              R"("NumPackets":100,"MaxTestDay":2.5,"Policy":"ACOnly"})",
              strSaved);
    UdpTestConfig loaded;
    ResetUdpConfig(&loaded);
    ASSERT_EQ(S_OK, LoadUdpConfig(&loaded));
    EXPECT_TRUE(loaded.localIp.empty());
    ASSERT_EQ(S_OK, SaveUdpConfig(&loaded));
    EXPECT_EQ(strSaved, ReadFileText(c_wszUdpConfigFile));
}

TEST_F(UdpTestPolicy, LoadReadsTheWholeFileOrFails)
{
    const std::string strBadFormat = "2001|JsonReader::FromJsonString|b";
    struct
    {
        const char *szCase;
        std::string strText; // "-": no file
        HRESULT hr;
        std::string strTrace; // the failure after the read mark, if any
    } rgCases[] = {
        {"no file", "-", HRESULT_FROM_WIN32(ERROR_FILE_NOT_FOUND),
         "2001|CreateFile (read)|80070002"},
        {"empty", "", HRESULT_FROM_WIN32(ERROR_BAD_FORMAT), strBadFormat},
        {"array", "[1,2]", HRESULT_FROM_WIN32(ERROR_BAD_FORMAT), strBadFormat},
        {"bad relay", "{\"RelayFQDN\":\"a b\",\"Expiration\":1}", E_INVALIDARG,
         "2001|RelayFQDN|80070057"},
        // Past one 512-byte block: the members after the padding still count.
        {"long file",
         "{\"Pad\":\"" + std::string(1500, 'x') + "\",\"Enabled\":true,\"Expiration\":42}", S_OK,
         ""},
    };
    for (const auto &c : rgCases)
    {
        SCOPED_TRACE(c.szCase);
        DeleteFileW(c_wszUdpConfigFile);
        if (c.strText != "-")
        {
            ASSERT_TRUE(WriteFileText(c_wszUdpConfigFile, c.strText));
        }
        CTraceSession session;
        UdpTestConfig config;
        ResetUdpConfig(&config);
        EXPECT_EQ(c.hr, LoadUdpConfig(&config));
        std::vector<std::string> rgExpected = {"2006"};
        if (!c.strTrace.empty())
        {
            rgExpected.push_back(c.strTrace);
        }
        EXPECT_EQ(rgExpected, session.Lines());
        EXPECT_EQ(c.hr == S_OK ? 42u : 0u, config.expiration);
    }
}

// Without a policy service the refresh fails at once and retries in a week, saving the reset
// record with that expiration (a service that fails is UdpTestRefresh's).
TEST_F(UdpTestPolicy, FailedRefreshRetriesInAWeekAndSaves)
{
    CTraceSession session;
    UdpTestConfig config;
    ResetUdpConfig(&config);
    uint64_t ullBefore = UdpConfigNow();
    RefreshUdpConfig(&config);
    uint64_t ullAfter = UdpConfigNow();
    EXPECT_LE(ullBefore + c_ullUdpConfigRetryTicks, config.expiration);
    EXPECT_GE(ullAfter + c_ullUdpConfigRetryTicks, config.expiration);
    EXPECT_FALSE(IsConfigExpired(&config));
    std::string strExpected = c_szResetText;
    strExpected.replace(strExpected.find("\"Expiration\":0"), 14,
                        "\"Expiration\":" + std::to_string(config.expiration));
    EXPECT_EQ(strExpected, ReadFileText(c_wszUdpConfigFile));
    EXPECT_EQ((std::vector<std::string>{"2005", "2001|GetServiceEndpoint|80070002", "2007"}),
              session.Lines());
}
