// telvane.dll installed, started and stopped under its real name through the prefix's
// control manager: with telvanerun, under Wine's own svchost.exe (no host globals) and under
// telvanehost.exe (the host's stop callback). These tests own the name "Telvane" and the
// group "OVTCBNetwork" while they run, and remove the service whatever happens.
#include "servicelib/reghelper.h"
#include "servicelib/service.h"
#include "service/resource.h"
#include "tests/common/testsupport.h"
#include "tests/common/scmtest.h"

#include <gtest/gtest.h>

#include <algorithm>

namespace
{
const wchar_t c_wszTelvane[] = L"Telvane";
const wchar_t c_wszGroup[] = L"OVTCBNetwork";
const wchar_t c_wszParameters[] = L"SYSTEM\\CurrentControlSet\\Services\\Telvane\\Parameters";
const DWORD c_dwStateWaitMs = 30000;

testsupport::ChildResult RunTelvane(const wchar_t *wszArgs)
{
    return testsupport::RunChild(L"\"" + testsupport::BinDir() + L"telvanerun.exe\" " + wszArgs);
}

size_t GroupEntries()
{
    std::vector<std::wstring> rgGroup = RegHelperGetMultiString(c_wszSvchostGroupKey, c_wszGroup);
    return static_cast<size_t>(std::count(rgGroup.begin(), rgGroup.end(), c_wszTelvane));
}

bool GroupValueExists()
{
    DWORD dwType = 0;
    std::wstring wstrData;
    return testsupport::HklmReadRaw(c_wszSvchostGroupKey, c_wszGroup, &dwType, &wstrData);
}

std::wstring LoadDllString(UINT uId)
{
    std::wstring wstrDll = testsupport::BinDir() + L"telvane.dll";
    HMODULE hDll = LoadLibraryExW(wstrDll.c_str(), nullptr, LOAD_LIBRARY_AS_DATAFILE);
    if (hDll == nullptr)
    {
        return L"";
    }
    wchar_t wszText[512] = L"";
    LoadStringW(hDll, uId, wszText, 512);
    FreeLibrary(hDll);
    return wszText;
}

class TelvaneInstall : public ::testing::Test
{
protected:
    void SetUp() override { ASSERT_EQ(0u, RunTelvane(L"-u").dwExitCode); }
    void TearDown() override
    {
        RunTelvane(L"-u");
        testsupport::ServiceStopAndDelete(c_wszTelvane);
    }

    // Starts the service, checks which program hosts it, stops it and sees the host leave.
    void StartAndStop(const wchar_t *wszHostImage)
    {
        SCOPED_TRACE(testsupport::Narrow(wszHostImage));
        ASSERT_EQ(0u, testsupport::ServiceStart(c_wszTelvane, {}));
        SERVICE_STATUS_PROCESS status = {};
        ASSERT_TRUE(testsupport::ServiceWaitForState(c_wszTelvane, SERVICE_RUNNING, c_dwStateWaitMs, &status))
            << status.dwCurrentState;
        EXPECT_EQ(static_cast<DWORD>(SERVICE_WIN32_SHARE_PROCESS), status.dwServiceType);
        EXPECT_EQ(static_cast<DWORD>(SERVICE_ACCEPT_STOP), status.dwControlsAccepted);

        testsupport::CServiceProcess host(status.dwProcessId);
        ASSERT_TRUE(host.Opened());
        std::wstring wstrImage = host.ImageName();
        EXPECT_NE(std::wstring::npos, wstrImage.find(wszHostImage))
            << testsupport::Narrow(wstrImage);

        EXPECT_EQ(0u, testsupport::ServiceStop(c_wszTelvane));
        EXPECT_TRUE(testsupport::ServiceWaitForState(c_wszTelvane, SERVICE_STOPPED, c_dwStateWaitMs, &status));
        EXPECT_EQ(0u, status.dwWin32ExitCode);

        // The host leaves once its only service has stopped.
        EXPECT_EQ(0u, host.WaitForExitCode(c_dwStateWaitMs));
    }
};
} // namespace

TEST_F(TelvaneInstall, RegisterRunUnderSvchostAndUnregister)
{
    testsupport::ChildResult result = RunTelvane(L"-r");
    ASSERT_EQ(0u, result.dwExitCode) << result.strOutput;

    std::wstring wstrDll = testsupport::BinDir() + L"telvane.dll";
    testsupport::SERVICE_RECORD record;
    ASSERT_TRUE(testsupport::ServiceReadRecord(c_wszTelvane, &record));
    EXPECT_EQ(static_cast<DWORD>(SERVICE_WIN32_SHARE_PROCESS), record.dwServiceType);
    EXPECT_EQ(static_cast<DWORD>(SERVICE_AUTO_START), record.dwStartType);
    EXPECT_EQ(static_cast<DWORD>(SERVICE_ERROR_NORMAL), record.dwErrorControl);
    EXPECT_EQ(L"svchost.exe -k OVTCBNetwork", record.wstrBinaryPath);
    EXPECT_EQ(L"LocalSystem", record.wstrStartName);
    // Wine keeps the indirect strings as written; the ids must name strings of the DLL.
    EXPECT_EQ(L"@" + wstrDll + L",-" + std::to_wstring(IDS_TELVANE_DISPLAY_NAME),
              record.wstrDisplayName);
    EXPECT_EQ(L"@" + wstrDll + L",-" + std::to_wstring(IDS_TELVANE_DESCRIPTION),
              record.wstrDescription);
    EXPECT_FALSE(LoadDllString(IDS_TELVANE_DISPLAY_NAME).empty());
    EXPECT_FALSE(LoadDllString(IDS_TELVANE_DESCRIPTION).empty());

    DWORD dwType = 0;
    std::wstring wstrServiceDll;
    ASSERT_TRUE(testsupport::HklmReadRaw(c_wszParameters, L"ServiceDll", &dwType, &wstrServiceDll));
    EXPECT_EQ(static_cast<DWORD>(REG_EXPAND_SZ), dwType);
    EXPECT_EQ(wstrDll, RegHelperGetString(c_wszParameters, L"ServiceDll"));
    DWORD dwUnload = 0;
    ASSERT_TRUE(testsupport::HklmReadDword(c_wszParameters, L"ServiceDllUnloadOnStop", &dwUnload));
    EXPECT_EQ(1u, dwUnload);
    EXPECT_EQ(1u, GroupEntries());

    // Wine's svchost never pushes host globals: the DLL lists its service in ServiceMain and
    // stops it on the dispatcher thread.
    StartAndStop(L"svchost.exe");

    // Registering again, even while the service runs, leaves one installation and one entry.
    ASSERT_EQ(0u, RunTelvane(L"-r").dwExitCode);
    EXPECT_EQ(1u, GroupEntries());
    ASSERT_EQ(0u, testsupport::ServiceStart(c_wszTelvane, {}));
    ASSERT_TRUE(testsupport::ServiceWaitForState(c_wszTelvane, SERVICE_RUNNING, c_dwStateWaitMs));
    result = RunTelvane(L"-r");
    ASSERT_EQ(0u, result.dwExitCode) << result.strOutput;
    EXPECT_EQ(1u, GroupEntries());
    SERVICE_STATUS_PROCESS status = {};
    ASSERT_TRUE(testsupport::ServiceQueryStatus(c_wszTelvane, &status));
    EXPECT_EQ(static_cast<DWORD>(SERVICE_STOPPED), status.dwCurrentState);

    result = RunTelvane(L"-u");
    ASSERT_EQ(0u, result.dwExitCode) << result.strOutput;
    EXPECT_FALSE(testsupport::ServiceExists(c_wszTelvane));
    EXPECT_FALSE(GroupValueExists());
    // Removing what is not installed is not an error.
    EXPECT_EQ(0u, RunTelvane(L"-u").dwExitCode);
    EXPECT_EQ(0u, RunTelvane(L"Telvane /u").dwExitCode);
}

TEST_F(TelvaneInstall, UnregisterTakesPrecedenceOverRegister)
{
    ASSERT_EQ(0u, RunTelvane(L"-r").dwExitCode);
    ASSERT_TRUE(testsupport::ServiceExists(c_wszTelvane));
    ASSERT_EQ(0u, RunTelvane(L"-r -u").dwExitCode);
    EXPECT_FALSE(testsupport::ServiceExists(c_wszTelvane));
    EXPECT_FALSE(GroupValueExists());
}

TEST_F(TelvaneInstall, RunsUnderTelvaneHostWithItsStopCallback)
{
    ASSERT_EQ(0u, RunTelvane(L"-r").dwExitCode);
    ASSERT_TRUE(testsupport::ServiceSetImagePath(c_wszTelvane, L"\"" + testsupport::BinDir() +
                                                        L"telvanehost.exe\" -k OVTCBNetwork"));
    // Only the stop callback runs OnStop under this host: without it STOPPED never comes.
    StartAndStop(L"telvanehost.exe");
    // And the next start gets a fresh host.
    StartAndStop(L"telvanehost.exe");

    // Here a STOP returns while the service still runs: registering again must see the old
    // installation down before it creates the new one.
    ASSERT_EQ(0u, testsupport::ServiceStart(c_wszTelvane, {}));
    ASSERT_TRUE(testsupport::ServiceWaitForState(c_wszTelvane, SERVICE_RUNNING, c_dwStateWaitMs));
    testsupport::ChildResult result = RunTelvane(L"-r");
    ASSERT_EQ(0u, result.dwExitCode) << result.strOutput;
    testsupport::SERVICE_RECORD record;
    ASSERT_TRUE(testsupport::ServiceReadRecord(c_wszTelvane, &record));
    EXPECT_EQ(L"svchost.exe -k OVTCBNetwork", record.wstrBinaryPath);
    EXPECT_EQ(1u, GroupEntries());
}
