// The policy file in the prefix's real policy folder, and the refresh's failure paths.
#include "platform/endpointdirectory/endpointdirectory.h"
#include "service/udptestpolicy.h"
#include "tests/udp/udptestsupport.h"

#include <gtest/gtest.h>

using udptest::ReadWholeFile;
using udptest::TraceSession;
using udptest::WriteWholeFile;

namespace
{
const char c_szResetText[] = R"({"Enabled":false,"RelayFQDN":"","RelayPort":0,"Expiration":0,)"
                             R"("LastTest":0,"NumPackets":500,"MaxTestDay":0,"Policy":"BattAC"})";

class UdpTestPolicy : public ::testing::Test
{
protected:
    void SetUp() override { testsupport::PreparePolicyFolder(); }
    void TearDown() override
    {
        RemoveDirectoryW(c_wszUdpConfigTempFile);
        DeleteFileW(c_wszUdpConfigFile);
        RegDeleteKeyValueW(HKEY_LOCAL_MACHINE, ENDPOINT_DIRECTORY_KEY, c_wszUdpConfigRole);
    }

    static std::string PolicyText()
    {
        std::string strText;
        EXPECT_TRUE(ReadWholeFile(c_wszUdpConfigFile, &strText));
        return strText;
    }

    static void SetRole(const wchar_t *wszUrl)
    {
        ASSERT_EQ(ERROR_SUCCESS,
                  RegSetKeyValueW(HKEY_LOCAL_MACHINE, ENDPOINT_DIRECTORY_KEY, c_wszUdpConfigRole,
                                  REG_SZ, wszUrl,
                                  static_cast<DWORD>((wcslen(wszUrl) + 1) * sizeof(wchar_t))));
    }

    // A failed refresh of a reset record: saved, due again in seven days.
    static void ExpectRetryInAWeek(uint64_t ullBefore, const UdpTestConfig &config)
    {
        uint64_t ullAfter = UdpConfigNow();
        EXPECT_LE(ullBefore + c_ullUdpConfigRetryTicks, config.expiration);
        EXPECT_GE(ullAfter + c_ullUdpConfigRetryTicks, config.expiration);
        std::string strExpected = c_szResetText;
        strExpected.replace(strExpected.find("\"Expiration\":0"), 14,
                            "\"Expiration\":" + std::to_string(config.expiration));
        EXPECT_EQ(strExpected, PolicyText());
    }
};
} // namespace

TEST_F(UdpTestPolicy, SavedTextAfterReset)
{
    TraceSession session;
    UdpTestConfig config;
    config.enabled = true;
    ResetUdpConfig(&config);
    ASSERT_EQ(S_OK, SaveUdpConfig(&config));
    EXPECT_EQ(c_szResetText, PolicyText());
    EXPECT_EQ(std::vector<std::string>({"2007"}), session.Lines());
    // Written under the temporary name, which is gone once it replaced the policy.
    EXPECT_EQ(INVALID_FILE_ATTRIBUTES, GetFileAttributesW(c_wszUdpConfigTempFile));
}

TEST_F(UdpTestPolicy, RoundTripThroughTheFile)
{
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
    EXPECT_EQ(R"({"Enabled":true,"RelayFQDN":"relay.example.net","RelayPort":47211,)"
              R"("Expiration":134000000000000000,"LastTest":133999999999999999,)"
              R"("NumPackets":100,"MaxTestDay":2.5,"Policy":"ACOnly"})",
              PolicyText());

    TraceSession session;
    UdpTestConfig loaded;
    ResetUdpConfig(&loaded);
    ASSERT_EQ(S_OK, LoadUdpConfig(&loaded));
    EXPECT_EQ(std::vector<std::string>({"2006"}), session.Lines());
    EXPECT_TRUE(loaded.enabled);
    EXPECT_TRUE(loaded.acOnly);
    EXPECT_EQ(2.5f, loaded.maxTestDay);
    EXPECT_EQ(saved.expiration, loaded.expiration);
    EXPECT_EQ(saved.lastTest, loaded.lastTest);
    EXPECT_EQ(saved.relayFqdn, loaded.relayFqdn);
    EXPECT_EQ(47211u, loaded.relayPort);
    EXPECT_EQ(100u, loaded.numPackets);
    EXPECT_TRUE(loaded.localIp.empty());

    ResetUdpConfig(&saved);
    ASSERT_EQ(S_OK, SaveUdpConfig(&saved));
    ASSERT_EQ(S_OK, LoadUdpConfig(&loaded));
    EXPECT_FALSE(loaded.acOnly); // "BattAC" reads back
}

TEST_F(UdpTestPolicy, SavedEmptyRelayReadsBackAsNoRelay)
{
    UdpTestConfig config;
    ResetUdpConfig(&config);
    config.enabled = true;
    ASSERT_EQ(S_OK, SaveUdpConfig(&config));
    UdpTestConfig loaded;
    ASSERT_EQ(S_OK, LoadUdpConfig(&loaded));
    EXPECT_EQ("null", loaded.relayFqdn); // the reader's reading of ""
    EXPECT_FALSE(UdpConfigHasRelay(loaded));
    // Saved again, it stays the text null and still names no relay.
    ASSERT_EQ(S_OK, SaveUdpConfig(&loaded));
    ASSERT_EQ(S_OK, LoadUdpConfig(&loaded));
    EXPECT_FALSE(UdpConfigHasRelay(loaded));
}

TEST_F(UdpTestPolicy, LoadFailures)
{
    struct
    {
        const char *szText; // null: no file
        HRESULT hr;
        const char *szTrace;
    } rgCases[] = {
        {nullptr, HRESULT_FROM_WIN32(ERROR_FILE_NOT_FOUND), "2001|CreateFile (read)|80070002"},
        {"", HRESULT_FROM_WIN32(ERROR_BAD_FORMAT), "2001|JsonReader::FromJsonString|b"},
        {"[1,2]", HRESULT_FROM_WIN32(ERROR_BAD_FORMAT), "2001|JsonReader::FromJsonString|b"},
        {"\"text\"", HRESULT_FROM_WIN32(ERROR_BAD_FORMAT), "2001|JsonReader::FromJsonString|b"},
        {"  \r\n{\"Enabled\":true}", E_INVALIDARG, nullptr}, // no expiration
        {"{\"RelayFQDN\":\"a b\",\"Expiration\":1}", E_INVALIDARG, "2001|RelayFQDN|80070057"},
    };
    for (const auto &c : rgCases)
    {
        SCOPED_TRACE(c.szText != nullptr ? c.szText : "(no file)");
        DeleteFileW(c_wszUdpConfigFile);
        if (c.szText != nullptr)
        {
            ASSERT_TRUE(WriteWholeFile(c_wszUdpConfigFile, c.szText));
        }
        TraceSession session;
        UdpTestConfig config;
        ResetUdpConfig(&config);
        EXPECT_EQ(c.hr, LoadUdpConfig(&config));
        std::vector<std::string> rgExpected = {"2006"};
        if (c.szTrace != nullptr)
        {
            rgExpected.push_back(c.szTrace);
        }
        EXPECT_EQ(rgExpected, session.Lines());
    }
}

TEST_F(UdpTestPolicy, LongFileIsReadWhole)
{
    // Past one 512-byte block: the members after the padding still count.
    std::string strText = "{\"Pad\":\"" + std::string(1500, 'x') +
                          "\",\"Enabled\":true,\"Expiration\":42,\"LastTest\":7}";
    ASSERT_TRUE(WriteWholeFile(c_wszUdpConfigFile, strText));
    UdpTestConfig config;
    ResetUdpConfig(&config);
    ASSERT_EQ(S_OK, LoadUdpConfig(&config));
    EXPECT_TRUE(config.enabled);
    EXPECT_EQ(42u, config.expiration);
    EXPECT_EQ(7u, config.lastTest);
}

TEST_F(UdpTestPolicy, FailedSaveKeepsTheOldPolicy)
{
    UdpTestConfig config;
    ResetUdpConfig(&config);
    config.lastTest = 123;
    ASSERT_EQ(S_OK, SaveUdpConfig(&config));
    std::string strOld = PolicyText();

    // Nothing can be created under the temporary name while a folder holds it.
    ASSERT_TRUE(CreateDirectoryW(c_wszUdpConfigTempFile, nullptr));
    TraceSession session;
    config.lastTest = 456;
    HRESULT hr = SaveUdpConfig(&config);
    EXPECT_TRUE(FAILED(hr));
    EXPECT_EQ(strOld, PolicyText());
    std::vector<std::string> rgLines = session.Lines();
    ASSERT_EQ(2u, rgLines.size());
    EXPECT_EQ("2007", rgLines[0]);
    EXPECT_EQ(0u, rgLines[1].rfind("2001|CreateFile (write)|", 0)) << rgLines[1];
    EXPECT_EQ(456u, config.lastTest); // the record in memory is the caller's
}

TEST_F(UdpTestPolicy, RefreshWithoutEndpointRetriesInAWeekAndSaves)
{
    TraceSession session;
    UdpTestConfig config;
    ResetUdpConfig(&config);
    uint64_t ullBefore = UdpConfigNow();
    RefreshUdpConfig(&config);
    ExpectRetryInAWeek(ullBefore, config);
    EXPECT_EQ(std::vector<std::string>({"2005", "2001|GetServiceEndpoint|80070002", "2007"}),
              session.Lines());
    EXPECT_FALSE(IsConfigExpired(&config));
}

TEST_F(UdpTestPolicy, RefreshAgainstNoServiceRetriesInAWeekAndSaves)
{
    SetRole(L"https://localhost:47219/"); // nothing listens there
    TraceSession session;
    UdpTestConfig config;
    ResetUdpConfig(&config);
    uint64_t ullBefore = UdpConfigNow();
    RefreshUdpConfig(&config);
    ExpectRetryInAWeek(ullBefore, config);
    std::vector<std::string> rgLines = session.Lines();
    ASSERT_EQ(3u, rgLines.size());
    EXPECT_EQ("2005", rgLines[0]);
    EXPECT_EQ(0u, rgLines[1].rfind("2001|OrvexJsonSendRequest|", 0)) << rgLines[1];
    EXPECT_EQ("2007", rgLines[2]);
}

TEST(UdpTestPolicyTime, IsConfigExpired)
{
    UdpTestConfig config;
    config.expiration = 0;
    EXPECT_TRUE(IsConfigExpired(&config));
    config.expiration = UdpConfigNow() + 600 * 10000000ull;
    EXPECT_FALSE(IsConfigExpired(&config));
    config.expiration = UdpConfigNow() - 10000000ull;
    EXPECT_TRUE(IsConfigExpired(&config));
}
