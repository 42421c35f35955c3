// The Wi-Fi and chamber stand-ins, set through telvanectl in a child process (as tests of
// the running service and the demo set them) and read back through the library calls. (What
// the Wi-Fi stand-in answers is UdpTestLaunch.WiFiGate's.)
#include "platform/securityruntime/securityruntime.h"
#include "platform/wifi/wifiuser.h"
#include "tests/common/testsupport.h"

#include <gtest/gtest.h>
#include <sddl.h>

using namespace testsupport;

namespace
{
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

// The adapter block comes back whole, whatever the caller's buffer held: the address
// terminated, the rest zeroed.
TEST_F(StandIns, WiFiFillsTheWholeAdapterBlock)
{
    ASSERT_EQ(S_OK, WiFiStandInSetConnected(L"10.1.2.3"));
    WiFiUserHandle *pHandle = nullptr;
    ASSERT_EQ(S_OK, WiFiUserHandle::OpenHandle(c_dwWiFiUserVersion, &pHandle));
    WiFiAdapterInfo info;
    memset(&info, 0xCC, sizeof(info));
    EXPECT_EQ(S_OK, pHandle->QueryAdapterInfo(&info));
    WiFiUserHandle::CloseHandle(pHandle);
    EXPECT_STREQ(L"10.1.2.3", info.wszAddress);
    EXPECT_EQ(0, info.rgbReserved[0]);
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

// A chamber's SID is stable per name, whatever its case; a process starts only in a chamber,
// and either call fails when telvanectl says so.
TEST_F(StandIns, ChamberSidsAndStarts)
{
    PSID rgpSid[3] = {};
    ASSERT_EQ(S_OK, GetChamberSidFromId(L"ZoRiVirOruz", &rgpSid[0]));
    ASSERT_EQ(S_OK, GetChamberSidFromId(L"zorivirORUZ", &rgpSid[1]));
    ASSERT_EQ(S_OK, GetChamberSidFromId(L"OtherChamber", &rgpSid[2]));
    EXPECT_TRUE(EqualSid(rgpSid[0], rgpSid[1]));
    EXPECT_FALSE(EqualSid(rgpSid[0], rgpSid[2]));
    EXPECT_EQ(8, *GetSidSubAuthorityCount(rgpSid[0])); // 2 and seven from the name
    PSID pSid = reinterpret_cast<PSID>(1);
    EXPECT_EQ(E_INVALIDARG, GetChamberSidFromId(L"", &pSid));
    EXPECT_EQ(nullptr, pSid);
    EXPECT_EQ(E_INVALIDARG, GetChamberSidFromId(nullptr, &pSid));

    STARTUPINFOW si = {sizeof(si)};
    PROCESS_INFORMATION pi = {};
    wchar_t wszCommandLine[] = L"cmd.exe /c exit 0";
    ASSERT_TRUE(ConvertStringSidToSidW(L"S-1-1-0", &pSid)); // Everyone is no chamber
    EXPECT_EQ(E_INVALIDARG, CreateProcessInChamber(pSid, L"{x}", nullptr, wszCommandLine, FALSE, 0,
                                                   nullptr, &si, &pi));
    for (PSID p : {pSid, rgpSid[0], rgpSid[1], rgpSid[2]})
    {
        LocalFree(p);
    }

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
