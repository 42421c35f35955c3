// The policy refresh against the local TLS policy service, with the device certificate and
// the test CA that the HTTPS fixture puts into the prefix's stores.
#include "platform/endpointdirectory/endpointdirectory.h"
#include "service/udptestpolicy.h"
#include "tests/common/policyserver.h"
#include "tests/common/tracesession.h"
#include "tests/common/udpsupport.h"

#include <gtest/gtest.h>

using namespace testsupport;

namespace
{
struct RefreshCase
{
    const char *szName;
    int iStatus;
    unsigned cChunks; // 0: one body with its length
    const char *szBody;
    uint64_t ullLifetime;                   // expires now plus this; 0: a failed refresh
    std::vector<std::string> rgstrFailures; // the 2001 lines between 2005 and 2007
    const char *szSaved;                    // the saved text, "Expiration" left out
};

const uint64_t c_ullDay = 864000000000ull;

// clang-format off
const RefreshCase c_rgRefreshCases[] = {
    {"a policy with a lifetime", 200, 0,
     R"({"Enabled":"true","RelayFQDN":"127.0.0.1","RelayPort":47250,"NumPackets":100,)"
     R"("MaxTestDay":2,"DurationValid":"P1D","Policy":"BattAC"})",
     c_ullDay, {},
     R"({"Enabled":true,"RelayFQDN":"127.0.0.1","RelayPort":47250,"LastTest":0,)"
     R"("NumPackets":100,"MaxTestDay":2,"Policy":"BattAC"})"},
    {"chunked, mains power only", 200, 3,
     R"({"Enabled":true,"RelayFQDN":"relay.example.net","RelayPort":7,"DurationValid":"PT30M"})",
     18000000000ull, {},
     R"({"Enabled":true,"RelayFQDN":"relay.example.net","RelayPort":7,"LastTest":0,)"
     R"("NumPackets":500,"MaxTestDay":0,"Policy":"ACOnly"})"},
    {"an answer without expiration", 200, 0,
     R"({"Enabled":true,"RelayFQDN":"r","RelayPort":9,"Policy":"ACOnly"})",
     0, {"2001|ParseJson|80070057"},
     R"({"Enabled":true,"RelayFQDN":"r","RelayPort":9,"LastTest":0,)"
     R"("NumPackets":500,"MaxTestDay":0,"Policy":"BattAC"})"},
    {"a relay name for a shell", 200, 0,
     R"({"Enabled":true,"RelayFQDN":"r & calc.exe","RelayPort":9,"DurationValid":"P1D"})",
     0, {"2001|RelayFQDN|80070057", "2001|ParseJson|80070057"},
     R"({"Enabled":true,"RelayFQDN":"","RelayPort":0,"LastTest":0,)"
     R"("NumPackets":500,"MaxTestDay":0,"Policy":"BattAC"})"},
    {"not found", 404, 0, "",
     0, {"2001|OrvexJsonSendRequest|80070490"},
     R"({"Enabled":false,"RelayFQDN":"","RelayPort":0,"LastTest":0,)"
     R"("NumPackets":500,"MaxTestDay":0,"Policy":"BattAC"})"},
};
// clang-format on

// The saved text without its "Expiration" member, which depends on the clock.
std::string WithoutExpiration(const std::string &strText, uint64_t *pullExpiration)
{
    size_t pos = strText.find(",\"Expiration\":");
    if (pos == std::string::npos)
    {
        return strText;
    }
    size_t end = strText.find(',', pos + 1);
    *pullExpiration = std::stoull(strText.substr(pos + 14, end - pos - 14));
    return strText.substr(0, pos) + strText.substr(end);
}

// Runs on the test thread and owns the prefix's policy file and endpoint role while it runs.
class UdpTestRefresh : public ::testing::Test
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

// The service sees one GET of the policy path, on a port of each case's own (a later request
// may reuse an earlier connection).
TEST_F(UdpTestRefresh, AppliesAndSavesTheAnswer)
{
    USHORT usPort = 47220;
    for (const RefreshCase &c : c_rgRefreshCases)
    {
        SCOPED_TRACE(c.szName);
        DeleteFileW(c_wszUdpConfigFile);
        PolicyServerOptions options;
        options.usPort = usPort++;
        options.iStatus = c.iStatus;
        options.strBody = c.szBody;
        options.fUseBody = true;
        options.cChunks = c.cChunks;
        CTestPolicyServer server;
        ASSERT_TRUE(server.Start(options));
        HklmSetString(ENDPOINT_DIRECTORY_KEY, c_wszUdpConfigRole,
                      L"https://localhost:" + std::to_wstring(options.usPort) + L"/");

        CTraceSession session;
        UdpTestConfig config;
        ResetUdpConfig(&config);
        uint64_t ullBefore = UdpConfigNow();
        RefreshUdpConfig(&config);
        uint64_t ullAfter = UdpConfigNow();

        uint64_t ullLifetime = c.ullLifetime != 0 ? c.ullLifetime : c_ullUdpConfigRetryTicks;
        EXPECT_LE(ullBefore + ullLifetime, config.expiration);
        EXPECT_GE(ullAfter + ullLifetime, config.expiration);
        uint64_t ullSavedExpiration = 0;
        EXPECT_EQ(c.szSaved,
                  WithoutExpiration(ReadFileText(c_wszUdpConfigFile), &ullSavedExpiration));
        EXPECT_EQ(config.expiration, ullSavedExpiration);

        std::vector<std::string> rgExpected = {"2005"};
        rgExpected.insert(rgExpected.end(), c.rgstrFailures.begin(), c.rgstrFailures.end());
        rgExpected.push_back("2007");
        EXPECT_EQ(rgExpected, session.Lines());

        std::vector<std::string> rgRequests = server.Requests();
        ASSERT_EQ(1u, rgRequests.size());
        EXPECT_NE(std::string::npos, rgRequests[0].find("/v1/api/config/udpecho")) << rgRequests[0];
    }
}
