// The test application, installed in the prefix as the service finds it, run against the
// loopback relay. (The launch through the chamber stand-in is UdpTestLaunch's.)
#include "lib/jsonreader.h"
#include "tests/common/testsupport.h"
#include "tests/common/udpsupport.h"

#include <gtest/gtest.h>
#include <algorithm>
#include <memory>

using namespace testsupport;

namespace
{
// Runs on the test thread and owns the installed test application and its results while it
// runs (the suite runs one test at a time).
class ZoRiVirOruz : public ::testing::Test
{
protected:
    void SetUp() override { InstallTestApplication(); }
};

ChildResult RunTestApplication(const std::wstring &wstrArguments)
{
    return RunChild(std::wstring(c_wszTestAppPath) + L" " + wstrArguments, {}, 90000);
}
} // namespace

TEST_F(ZoRiVirOruz, CountsWhatTheRelayEchoes)
{
    struct
    {
        const wchar_t *wszArguments;
        USHORT usRelay;       // a relay listens on this port (0: none)
        const char *szReport; // the relay's
        DWORD dwExitCode;
        uint32_t ulSent, ulReceived;
        const char *szError;  // how "Error" starts ("" reads back as the text null)
        const char *szOption; // an option as the result records it
    } rgCases[] = {
        // The relay leaves every fourth packet unanswered, so the count shows what came back.
        {L"-localIP 127.0.0.1 -delay 1 -count 20 127.0.0.1 47211", 47211,
         "received 20 echoed 15 end idle\n", 0, 20, 15, "null", "\"LocalIP\":\"127.0.0.1\""},
        {L"-remoteIP -delay 1 -count 3 -size 64 127.0.0.1 47212", 0, nullptr, 0, 3, 0, "null",
         "\"PacketSize\":64"},
        {L"-remoteIP -count 3 relay.invalid 47213", 0, nullptr, 1, 0, 0, "cannot resolve the relay",
         "\"Relay\":\"relay.invalid\""},
    };
    for (const auto &c : rgCases)
    {
        SCOPED_TRACE(Narrow(c.wszArguments));
        std::unique_ptr<CRelayProcess> pRelay;
        if (c.usRelay != 0)
        {
            pRelay.reset(new CRelayProcess(c.usRelay, L"-drop 4"));
            ASSERT_TRUE(pRelay->Listening());
        }
        InstallTestApplication(); // no results
        ChildResult result = RunTestApplication(c.wszArguments);
        EXPECT_EQ(c.dwExitCode, result.dwExitCode) << result.strOutput;
        std::vector<std::wstring> rgFiles = ResultFiles();
        ASSERT_EQ(1u, rgFiles.size());
        std::string strResult = ReadFileText(rgFiles[0]);
        std::unique_ptr<JsonValue> pRoot(JsonReader::FromJsonString(strResult.c_str()));
        ASSERT_EQ(JsonNodeType::Object, pRoot->Type()) << strResult;
        const JsonObjectNode *pObject = static_cast<const JsonObjectNode *>(pRoot.get());
        uint32_t ulSent = 0, ulReceived = 0, ulLost = 0;
        std::string strError;
        EXPECT_TRUE(pObject->GetMemberNumber("Sent", ulSent));
        EXPECT_TRUE(pObject->GetMemberNumber("Received", ulReceived));
        EXPECT_TRUE(pObject->GetMemberNumber("Lost", ulLost));
        EXPECT_TRUE(pObject->GetMemberText("Error", strError));
        EXPECT_EQ(c.ulSent, ulSent) << strResult;
        EXPECT_EQ(c.ulReceived, ulReceived) << strResult;
        EXPECT_EQ(c.ulSent - c.ulReceived, ulLost) << strResult;
        EXPECT_EQ(0u, strError.rfind(c.szError, 0)) << strError;
        EXPECT_NE(std::string::npos, strResult.find(c.szOption)) << strResult;
        if (pRelay != nullptr)
        {
            EXPECT_EQ(c.szReport, pRelay->WaitForReport());
        }
    }
}

TEST_F(ZoRiVirOruz, BadArguments)
{
    const wchar_t *rgwszArguments[] = {
        L"",
        L"127.0.0.1",
        L"127.0.0.1 0",
        L"127.0.0.1 65536",
        L"-count x 127.0.0.1 47214",
        L"-count 100001 127.0.0.1 47214",
        L"-size 11 127.0.0.1 47214",
        L"-delay 10001 127.0.0.1 47214",
        L"-bogus 127.0.0.1 47214",
        L"127.0.0.1 47214 extra",
        L"127.0.0.1 47214 -count",
    };
    for (const wchar_t *wszArguments : rgwszArguments)
    {
        SCOPED_TRACE(Narrow(wszArguments));
        ChildResult result = RunTestApplication(wszArguments);
        EXPECT_EQ(2u, result.dwExitCode) << result.strOutput;
    }
    EXPECT_TRUE(ResultFiles().empty()); // a refused command line measures nothing
}

TEST_F(ZoRiVirOruz, KeepsTheNewestResults)
{
    // Seventy older results: after one more run the newest 64 are left, the run's among them.
    for (int i = 0; i < 70; i++)
    {
        wchar_t wszName[MAX_PATH];
        swprintf_s(wszName, L"%s\\result-20200101T0000%02d.000Z-1.json", c_wszResultFolder, i);
        ASSERT_TRUE(WriteFileText(wszName, "{}"));
    }
    ChildResult result = RunTestApplication(L"-count 0 127.0.0.1 47214");
    EXPECT_EQ(0u, result.dwExitCode) << result.strOutput;
    std::vector<std::wstring> rgFiles = ResultFiles();
    EXPECT_EQ(64u, rgFiles.size());
    std::sort(rgFiles.begin(), rgFiles.end());
    EXPECT_EQ(std::wstring(c_wszResultFolder) + L"\\result-20200101T000007.000Z-1.json",
              rgFiles.front());
    EXPECT_EQ(std::wstring::npos, rgFiles.back().find(L"result-2020")); // the new run
}
