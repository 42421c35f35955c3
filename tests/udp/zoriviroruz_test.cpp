// The test application, installed in the prefix and started through the chamber stand-in
// the way the service starts it, against the loopback relay.
#include "lib/jsonreader.h"
#include "platform/securityruntime/securityruntime.h"
#include "service/udptestcommandline.h"
#include "tests/common/testsupport.h"
#include "tests/common/udpsupport.h"

#include <gtest/gtest.h>
#include <algorithm>
#include <memory>
#include <sddl.h>

using namespace testsupport;

namespace
{
const wchar_t c_wszChamberId[] = L"ZoRiVirOruz";
const wchar_t c_wszChamberInstance[] = L"{5B04B775-356B-4AA0-AAF8-6491FFEA562E}";

std::wstring ReadChamberString(const wchar_t *wszName)
{
    wchar_t wsz[1024] = L"";
    DWORD cb = sizeof(wsz);
    RegGetValueW(HKEY_LOCAL_MACHINE, CHAMBER_STANDIN_KEY, wszName, RRF_RT_REG_SZ, nullptr, wsz,
                 &cb);
    return wsz;
}

DWORD ReadChamberDword(const wchar_t *wszName)
{
    DWORD dw = 0;
    DWORD cb = sizeof(dw);
    RegGetValueW(HKEY_LOCAL_MACHINE, CHAMBER_STANDIN_KEY, wszName, RRF_RT_REG_DWORD, nullptr, &dw,
                 &cb);
    return dw;
}

std::wstring SidText(PSID pSid)
{
    PWSTR pwsz = nullptr;
    if (!ConvertSidToStringSidW(pSid, &pwsz))
    {
        return L"";
    }
    std::wstring wstr = pwsz;
    LocalFree(pwsz);
    return wstr;
}

// Starts the installed application in its chamber as the launcher does: the phone's 68-byte
// startup block, "path arguments" in 256 characters, no console window.
HRESULT StartInChamber(const std::string &strArguments, PROCESS_INFORMATION *ppi,
                       std::wstring *pwstrSid, std::wstring *pwstrCommandLine)
{
    wchar_t wszCommandLine[256];
    swprintf_s(wszCommandLine, L"%s %hs", c_wszTestAppPath, strArguments.c_str());
    *pwstrCommandLine = wszCommandLine;
    PSID pSid = nullptr;
    HRESULT hr = GetChamberSidFromId(c_wszChamberId, &pSid);
    if (FAILED(hr))
    {
        return hr;
    }
    *pwstrSid = SidText(pSid);
    BYTE rgbStartup[sizeof(STARTUPINFOW)] = {};
    reinterpret_cast<STARTUPINFOW *>(rgbStartup)->cb = 68;
    hr = CreateProcessInChamber(pSid, c_wszChamberInstance, nullptr, wszCommandLine, FALSE,
                                0x08000000, nullptr, reinterpret_cast<STARTUPINFOW *>(rgbStartup),
                                ppi);
    LocalFree(pSid);
    return hr;
}

struct RunSummary
{
    DWORD dwExitCode = 0;
    std::string strResult; // the one result file's text
    uint32_t ulSent = 0;
    uint32_t ulReceived = 0;
    uint32_t ulLost = 0;
    std::string strError;
};

void RunAndCollect(const std::string &strArguments, RunSummary *pSummary)
{
    PROCESS_INFORMATION pi = {};
    std::wstring wstrSid;
    std::wstring wstrCommandLine;
    ASSERT_EQ(S_OK, StartInChamber(strArguments, &pi, &wstrSid, &wstrCommandLine));
    CloseHandle(pi.hThread);
    DWORD dwWait = WaitForSingleObject(pi.hProcess, 90000);
    GetExitCodeProcess(pi.hProcess, &pSummary->dwExitCode);
    CloseHandle(pi.hProcess);
    ASSERT_EQ(WAIT_OBJECT_0, dwWait);

    // The chamber stand-in records what it started, and in which chamber.
    EXPECT_EQ(wstrSid, ReadChamberString(L"LastChamberSid"));
    EXPECT_EQ(0u, wstrSid.rfind(L"S-1-15-2-", 0));
    EXPECT_EQ(c_wszChamberInstance, ReadChamberString(L"LastChamberInstance"));
    EXPECT_EQ(wstrCommandLine, ReadChamberString(L"LastCommandLine"));
    EXPECT_EQ(pi.dwProcessId, ReadChamberDword(L"LastProcessId"));

    std::vector<std::wstring> rgFiles = ResultFiles();
    ASSERT_EQ(1u, rgFiles.size());
    ASSERT_TRUE(ReadFileText(rgFiles[0], &pSummary->strResult));
    std::unique_ptr<JsonValue> pRoot(JsonReader::FromJsonString(pSummary->strResult.c_str()));
    ASSERT_EQ(JsonNodeType::Object, pRoot->Type());
    const JsonObjectNode *pObject = static_cast<const JsonObjectNode *>(pRoot.get());
    EXPECT_TRUE(pObject->GetMemberNumber("Sent", pSummary->ulSent));
    EXPECT_TRUE(pObject->GetMemberNumber("Received", pSummary->ulReceived));
    EXPECT_TRUE(pObject->GetMemberNumber("Lost", pSummary->ulLost));
    pObject->GetMemberText("Error", pSummary->strError);
}

// Runs on the test thread and owns the installed test application, its results and the
// chamber stand-in's key while it runs (the suite runs one test at a time).
class ZoRiVirOruz : public ::testing::Test
{
protected:
    void SetUp() override
    {
        InstallTestApplication();
        RegDeleteKeyW(HKEY_LOCAL_MACHINE, CHAMBER_STANDIN_KEY);
    }
    void TearDown() override { RegDeleteKeyW(HKEY_LOCAL_MACHINE, CHAMBER_STANDIN_KEY); }
};
} // namespace

TEST_F(ZoRiVirOruz, CountsWhatTheRelayEchoes)
{
    struct
    {
        const char *szArguments;
        USHORT usRelay;       // a relay listens on this port (0: none)
        const char *szReport; // the relay's
        DWORD dwExitCode;
        uint32_t ulSent, ulReceived;
        const char *szError;  // how "Error" starts ("null": none, "" read back as text null)
        const char *szOption; // an option as the result records it
    } rgCases[] = {
        // The relay leaves every fourth packet unanswered, so the count shows what came back.
        {"-localIP 127.0.0.1 -delay 1 -count 20 127.0.0.1 47211", 47211,
         "received 20 echoed 15 end idle\n", 0, 20, 15, "null", "\"LocalIP\":\"127.0.0.1\""},
        {"-remoteIP -delay 1 -count 3 -size 64 127.0.0.1 47212", 0, nullptr, 0, 3, 0, "null",
         "\"PacketSize\":64"},
        {"-remoteIP -count 3 relay.invalid 47213", 0, nullptr, 1, 0, 0, "cannot resolve the relay",
         "\"Relay\":\"relay.invalid\""},
    };
    for (const auto &c : rgCases)
    {
        SCOPED_TRACE(c.szArguments);
        std::unique_ptr<CRelayProcess> pRelay;
        if (c.usRelay != 0)
        {
            pRelay.reset(new CRelayProcess(c.usRelay, L"-drop 4"));
            ASSERT_TRUE(pRelay->Listening());
        }
        for (const std::wstring &wstrFile : ResultFiles())
        {
            DeleteFileW(wstrFile.c_str());
        }
        RunSummary summary;
        RunAndCollect(c.szArguments, &summary);
        EXPECT_EQ(c.dwExitCode, summary.dwExitCode) << summary.strResult;
        EXPECT_EQ(c.ulSent, summary.ulSent) << summary.strResult;
        EXPECT_EQ(c.ulReceived, summary.ulReceived) << summary.strResult;
        EXPECT_EQ(c.ulSent - c.ulReceived, summary.ulLost) << summary.strResult;
        EXPECT_EQ(0u, summary.strError.rfind(c.szError, 0)) << summary.strError;
        EXPECT_NE(std::string::npos, summary.strResult.find(c.szOption)) << summary.strResult;
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
        ChildResult result =
            RunChild(std::wstring(c_wszTestAppPath) + L" " + wszArguments, {}, 30000);
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
    ChildResult result =
        RunChild(std::wstring(c_wszTestAppPath) + L" -count 0 127.0.0.1 47214", {}, 60000);
    EXPECT_EQ(0u, result.dwExitCode) << result.strOutput;
    std::vector<std::wstring> rgFiles = ResultFiles();
    EXPECT_EQ(64u, rgFiles.size());
    std::sort(rgFiles.begin(), rgFiles.end());
    EXPECT_EQ(std::wstring(c_wszResultFolder) + L"\\result-20200101T000007.000Z-1.json",
              rgFiles.front());
    EXPECT_EQ(std::wstring::npos, rgFiles.back().find(L"result-2020")); // the new run
}
