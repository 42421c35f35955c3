// The Wi-Fi and chamber stand-ins, set through telvanectl in a child process (as tests of
// the running service and the demo set them) and read back through the library calls.
#include "platform/securityruntime/securityruntime.h"
#include "platform/wifi/wifiuser.h"
#include "tests/common/testsupport.h"

#include <gtest/gtest.h>
#include <sddl.h>

using namespace testsupport;

namespace
{
struct WiFiAnswers
{
    HRESULT hrOpen = S_OK;
    HRESULT hrState = S_OK;
    WiFiConnectionState state = WiFiConnectionStateUnknown;
    bool fNetwork = false;
    HRESULT hrAdapter = S_OK;
    std::wstring wstrAddress; // the first 16 characters of the block, up to a zero
};

WiFiAnswers AskWiFi()
{
    WiFiAnswers answers;
    WiFiUserHandle *pHandle = nullptr;
    answers.hrOpen = WiFiUserHandle::OpenHandle(c_dwWiFiUserVersion, &pHandle);
    if (FAILED(answers.hrOpen))
    {
        EXPECT_EQ(nullptr, pHandle);
        return answers;
    }
    WiFiNetwork *pNetwork = nullptr;
    answers.hrState = pHandle->QueryConnectionState(&answers.state, &pNetwork);
    answers.fNetwork = pNetwork != nullptr;
    if (pNetwork != nullptr)
    {
        EXPECT_STREQ(L"TelvaneTestNet", pNetwork->Ssid());
        delete pNetwork;
    }
    WiFiAdapterInfo info;
    memset(&info, 0xCC, sizeof(info));
    answers.hrAdapter = pHandle->QueryAdapterInfo(&info);
    if (SUCCEEDED(answers.hrAdapter))
    {
        answers.wstrAddress.assign(info.wszAddress, wcsnlen(info.wszAddress, 16));
        EXPECT_EQ(0, info.rgbReserved[0]); // the rest of the block is zeroed
    }
    WiFiUserHandle::CloseHandle(pHandle);
    return answers;
}

// Runs on the test thread and owns the stand-ins' keys while it runs (the suite runs one test
// at a time).
class StandIns : public ::testing::Test
{
protected:
    void TearDown() override
    {
        RegDeleteKeyW(HKEY_LOCAL_MACHINE, WIFI_STANDIN_KEY);
        RegDeleteKeyW(HKEY_LOCAL_MACHINE, CHAMBER_STANDIN_KEY);
    }
};
} // namespace

TEST_F(StandIns, WiFiAnswersWhatTelvanectlSet)
{
    const HRESULT hrDefault = c_hrWiFiStandInFailure;
    struct
    {
        const wchar_t *wszCommand; // null: no state at all
        HRESULT hrOpen, hrState;
        WiFiConnectionState state;
        bool fNetwork;
        HRESULT hrAdapter;
        const wchar_t *wszAddress;
    } rgCases[] = {
        {nullptr, S_OK, S_OK, WiFiConnectionStateDisconnected, false, S_OK, L""},
        {L"connected 10.1.2.3", S_OK, S_OK, WiFiConnectionStateConnected, true, S_OK, L"10.1.2.3"},
        {L"connected fe80::1234:5678a", S_OK, S_OK, WiFiConnectionStateConnected, true, S_OK,
         L"fe80::1234:5678a"}, // 16 characters fill the field, unterminated
        {L"fail QueryAdapterInfo", S_OK, S_OK, WiFiConnectionStateConnected, true, hrDefault, L""},
        {L"fail QueryConnectionState 80004005", S_OK, E_FAIL, WiFiConnectionStateUnknown, false,
         S_OK, L"fe80::1234:5678a"},
        {L"fail OpenHandle", hrDefault, S_OK, WiFiConnectionStateUnknown, false, S_OK, L""},
        {L"disconnected", S_OK, S_OK, WiFiConnectionStateDisconnected, false, S_OK, L""},
    };
    for (const auto &c : rgCases)
    {
        SCOPED_TRACE(Narrow(c.wszCommand != nullptr ? c.wszCommand : L"no state"));
        if (c.wszCommand == nullptr)
        {
            HklmDeleteKey(WIFI_STANDIN_KEY);
        }
        else
        {
            ChildResult result = RunTelvanectl(std::wstring(L"platform wifi ") + c.wszCommand);
            ASSERT_EQ(0u, result.dwExitCode) << result.strOutput;
        }
        WiFiAnswers answers = AskWiFi();
        EXPECT_EQ(c.hrOpen, answers.hrOpen);
        if (FAILED(c.hrOpen))
        {
            continue;
        }
        EXPECT_EQ(c.hrState, answers.hrState);
        EXPECT_EQ(c.state, answers.state);
        EXPECT_EQ(c.fNetwork, answers.fNetwork);
        EXPECT_EQ(c.hrAdapter, answers.hrAdapter);
        EXPECT_EQ(c.wszAddress, answers.wstrAddress);
    }
    EXPECT_EQ(0, WiFiStandInLiveHandles());
    EXPECT_EQ(0, WiFiStandInLiveNetworks());
    WiFiUserHandle *pHandle = nullptr;
    EXPECT_EQ(E_INVALIDARG, WiFiUserHandle::OpenHandle(2, &pHandle)); // another version
    EXPECT_EQ(nullptr, pHandle);
}

TEST_F(StandIns, TelvanectlRefusesBadWiFiCommands)
{
    const wchar_t *rgwszCommands[] = {
        L"platform wifi",
        L"platform wifi connected",
        L"platform wifi connected 12345678901234567",
        L"platform wifi fail Bogus",
        L"platform wifi fail OpenHandle xyz",
        L"platform wifi fail OpenHandle 0",
        L"platform wifi disconnected now",
        L"platform chamber fail Bogus",
        L"platform chamber",
    };
    for (const wchar_t *wszCommand : rgwszCommands)
    {
        SCOPED_TRACE(Narrow(wszCommand));
        EXPECT_EQ(2u, RunTelvanectl(wszCommand).dwExitCode);
    }
}

TEST_F(StandIns, ChamberSidIsStablePerName)
{
    PSID pSid1 = nullptr;
    PSID pSid2 = nullptr;
    PSID pSid3 = nullptr;
    ASSERT_EQ(S_OK, GetChamberSidFromId(L"ZoRiVirOruz", &pSid1));
    ASSERT_EQ(S_OK, GetChamberSidFromId(L"zorivirORUZ", &pSid2));
    ASSERT_EQ(S_OK, GetChamberSidFromId(L"OtherChamber", &pSid3));
    EXPECT_TRUE(EqualSid(pSid1, pSid2));
    EXPECT_FALSE(EqualSid(pSid1, pSid3));
    EXPECT_EQ(8, *GetSidSubAuthorityCount(pSid1)); // 2 and seven from the name
    LocalFree(pSid1);
    LocalFree(pSid2);
    LocalFree(pSid3);

    PSID pSid = reinterpret_cast<PSID>(1);
    EXPECT_EQ(E_INVALIDARG, GetChamberSidFromId(L"", &pSid));
    EXPECT_EQ(nullptr, pSid);
    EXPECT_EQ(E_INVALIDARG, GetChamberSidFromId(nullptr, &pSid));
}

TEST_F(StandIns, ChamberStartsOnlyInChambersAndFailsWhenTelvanectlSaysSo)
{
    STARTUPINFOW si = {sizeof(si)};
    PROCESS_INFORMATION pi = {};
    wchar_t wszCommandLine[] = L"cmd.exe /c exit 0";
    PSID pSid = nullptr;
    ASSERT_TRUE(ConvertStringSidToSidW(L"S-1-1-0", &pSid)); // Everyone is no chamber
    EXPECT_EQ(E_INVALIDARG, CreateProcessInChamber(pSid, L"{x}", nullptr, wszCommandLine, FALSE, 0,
                                                   nullptr, &si, &pi));
    LocalFree(pSid);

    ASSERT_EQ(0u, RunTelvanectl(L"platform chamber fail GetChamberSidFromId").dwExitCode);
    pSid = nullptr;
    EXPECT_EQ(CHAMBER_STANDIN_FAILURE, GetChamberSidFromId(L"ZoRiVirOruz", &pSid));
    EXPECT_EQ(nullptr, pSid);

    ASSERT_EQ(0u, RunTelvanectl(L"platform chamber fail CreateProcessInChamber").dwExitCode);
    ASSERT_EQ(S_OK, GetChamberSidFromId(L"ZoRiVirOruz", &pSid));
    EXPECT_EQ(CHAMBER_STANDIN_FAILURE, CreateProcessInChamber(pSid, L"{x}", nullptr, wszCommandLine,
                                                              FALSE, 0, nullptr, &si, &pi));

    ASSERT_EQ(0u, RunTelvanectl(L"platform chamber ok").dwExitCode);
    ASSERT_EQ(S_OK, CreateProcessInChamber(pSid, L"{x}", nullptr, wszCommandLine, FALSE,
                                           CREATE_NO_WINDOW, nullptr, &si, &pi));
    EXPECT_EQ(WAIT_OBJECT_0, WaitForSingleObject(pi.hProcess, 30000));
    CloseHandle(pi.hThread);
    CloseHandle(pi.hProcess);
    LocalFree(pSid);

    ChildResult result = RunTelvanectl(L"platform chamber last");
    ASSERT_EQ(0u, result.dwExitCode);
    EXPECT_NE(std::string::npos, result.strOutput.find("LastCommandLine: cmd.exe /c exit 0"))
        << result.strOutput;
}
