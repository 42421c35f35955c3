// telvane.dll installed and removed under its real name through the prefix's control manager
// with the product's own steps (serving and stopping under both hosts is CoreScm's). These
// tests own the name "Telvane" and the group "OVTCBNetwork" while they run (the suite is
// serial), and remove the service however they end. Test thread only.
#include "servicelib/reghelper.h"
#include "servicelib/service.h"
#include "service/resource.h"
#include "tests/common/scmtest.h"

#include <gtest/gtest.h>

#include <algorithm>

using namespace testsupport;

namespace
{
const wchar_t c_wszGroup[] = L"OVTCBNetwork";
const wchar_t c_wszParameters[] = L"SYSTEM\\CurrentControlSet\\Services\\Telvane\\Parameters";

// How often the group lists the service; -1 when the group's value is gone.
int GroupEntries()
{
    DWORD dwType = 0;
    std::wstring wstrData;
    if (!HklmReadRaw(c_wszSvchostGroupKey, c_wszGroup, &dwType, &wstrData))
    {
        return -1;
    }
    std::vector<std::wstring> rgGroup = RegHelperGetMultiString(c_wszSvchostGroupKey, c_wszGroup);
    return static_cast<int>(std::count(rgGroup.begin(), rgGroup.end(), c_wszTelvane));
}

std::wstring LoadDllString(UINT uId)
{
    HMODULE hDll =
        LoadLibraryExW((BinDir() + L"telvane.dll").c_str(), nullptr, LOAD_LIBRARY_AS_DATAFILE);
    wchar_t wszText[512] = L"";
    if (hDll != nullptr)
    {
        LoadStringW(hDll, uId, wszText, 512);
        FreeLibrary(hDll);
    }
    return wszText;
}

// Installs with telvanerun alone: the platform component, which these tests do not look at,
// would make every start and stop slower.
class TelvaneScm : public ::testing::Test
{
protected:
    void SetUp() override { TearDown(); }
    void TearDown() override
    {
        RunTelvane(L"-u");
        ServiceStopAndDelete(c_wszTelvane);
    }
};
} // namespace

TEST_F(TelvaneScm, RegistersReplacesARunningOneAndUnregisters)
{
    ChildResult result = RunTelvane(L"-r");
    ASSERT_EQ(0u, result.dwExitCode) << result.strOutput;
    std::wstring wstrDll = BinDir() + L"telvane.dll";
    SERVICE_RECORD record;
    ASSERT_TRUE(ServiceReadRecord(c_wszTelvane, &record));
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
    ASSERT_TRUE(HklmReadRaw(c_wszParameters, L"ServiceDll", &dwType, &wstrServiceDll));
    EXPECT_EQ(static_cast<DWORD>(REG_EXPAND_SZ), dwType);
    EXPECT_EQ(wstrDll, RegHelperGetString(c_wszParameters, L"ServiceDll"));
    DWORD dwUnload = 0;
    ASSERT_TRUE(HklmReadDword(c_wszParameters, L"ServiceDllUnloadOnStop", &dwUnload));
    EXPECT_EQ(1u, dwUnload);
    EXPECT_EQ(1, GroupEntries());

    // Registering again while the service runs leaves one installation, stopped, and one entry.
    ASSERT_NE(0u, TelvaneStart());
    result = RunTelvane(L"-r");
    ASSERT_EQ(0u, result.dwExitCode) << result.strOutput;
    EXPECT_EQ(1, GroupEntries());
    SERVICE_STATUS_PROCESS status = {};
    ASSERT_TRUE(ServiceQueryStatus(c_wszTelvane, &status));
    EXPECT_EQ(static_cast<DWORD>(SERVICE_STOPPED), status.dwCurrentState);

    // Unregistering takes precedence over registering, and takes the group's value with it.
    result = RunTelvane(L"-r -u");
    ASSERT_EQ(0u, result.dwExitCode) << result.strOutput;
    EXPECT_FALSE(ServiceExists(c_wszTelvane));
    EXPECT_EQ(-1, GroupEntries());
    // Removing what is not installed is not an error.
    EXPECT_EQ(0u, RunTelvane(L"-u").dwExitCode);
    EXPECT_EQ(0u, RunTelvane(L"Telvane /u").dwExitCode);
}
