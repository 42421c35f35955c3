// Installation through the prefix's real control manager, with test-only service and group
// names so that these tests run beside everything else. The failure actions are checked at
// the call: Wine accepts them and stores nothing. Test thread only.
#include "servicelib/reghelper.h"
#include "tests/common/testsupport.h"
#include "tests/common/scmtest.h"
#include "tests/service/testservice.h"

#include <gtest/gtest.h>

#include <functional>
#include <mutex>

using testsupport::FailureCapture;

namespace
{
// The failure actions as the shell hands them to the control manager.
struct FAILURE_ACTIONS_CALL
{
    DWORD dwResetPeriod = 0;
    bool fRebootMessage = false;
    bool fCommand = false;
    std::vector<SC_ACTION> rgActions;
};

std::mutex s_callLock;
std::vector<FAILURE_ACTIONS_CALL> s_rgCalls;

BOOL WINAPI RecordConfig2(SC_HANDLE hService, DWORD dwInfoLevel, LPVOID pvInfo)
{
    if (dwInfoLevel == SERVICE_CONFIG_FAILURE_ACTIONS)
    {
        const SERVICE_FAILURE_ACTIONSW *pActions = static_cast<SERVICE_FAILURE_ACTIONSW *>(pvInfo);
        std::lock_guard<std::mutex> guard(s_callLock);
        s_rgCalls.push_back({pActions->dwResetPeriod, pActions->lpRebootMsg != nullptr,
                             pActions->lpCommand != nullptr,
                             std::vector<SC_ACTION>(pActions->lpsaActions,
                                                    pActions->lpsaActions + pActions->cActions)});
    }
    return ChangeServiceConfig2W(hService, dwInfoLevel, pvInfo);
}

std::vector<std::wstring> GroupList(const std::wstring &wstrGroup)
{
    return RegHelperGetMultiString(c_wszSvchostGroupKey, wstrGroup.c_str());
}

// A demand-start test service with resource ids, removed again whatever the test did; owned by
// the test thread.
class CInstallService : public CTestService
{
public:
    // The control manager refuses a display name that another service has, and these
    // services (in every test process) share the program's path: their ids must differ.
    explicit CInstallService(const std::wstring &wstrName)
        : CTestService(wstrName.c_str())
    {
        m_idsLocalizedName = static_cast<ULONG>(std::hash<std::wstring>()(wstrName) & 0x3FFFFFFE);
        m_idsDescription = m_idsLocalizedName + 1;
        m_ulStartType = SERVICE_DEMAND_START;
    }
    ~CInstallService() override { testsupport::ServiceStopAndDelete(ServiceName()); }
};

// Records the failure-action calls through the seam while a test runs; test thread only.
class ServiceInstall : public ::testing::Test
{
protected:
    void SetUp() override
    {
        ASSERT_EQ(nullptr, CTestService::FirstService());
        std::lock_guard<std::mutex> guard(s_callLock);
        s_rgCalls.clear();
        ServiceSetChangeConfig2Hook(RecordConfig2);
    }
    void TearDown() override
    {
        ServiceSetChangeConfig2Hook(nullptr);
        CTestService::SetHostMode(false, nullptr, nullptr);
        RegHelperDeleteValue(c_wszSvchostGroupKey, m_wstrGroup.c_str());
    }

    // A host group of the test's own, removed when the test ends.
    const std::wstring m_wstrGroup = testsupport::UniqueName(L"TelvaneTestGroup");
};
} // namespace

TEST_F(ServiceInstall, OwnProgramRecordAndFailureActions)
{
    FailureCapture failures;
    CInstallService service(testsupport::UniqueName(L"TelvaneTestSvc"));
    CService::RegisterService(&service);
    service.RegisterOneService();
    ASSERT_EQ(0u, failures.Count());

    wchar_t wszExe[MAX_PATH];
    GetModuleFileNameW(nullptr, wszExe, MAX_PATH);
    const std::wstring wstrExe = wszExe;
    testsupport::SERVICE_RECORD record;
    ASSERT_TRUE(testsupport::ServiceReadRecord(service.ServiceName(), &record));
    EXPECT_EQ(static_cast<DWORD>(SERVICE_WIN32_OWN_PROCESS), record.dwServiceType);
    EXPECT_EQ(static_cast<DWORD>(SERVICE_DEMAND_START), record.dwStartType);
    EXPECT_EQ(wstrExe, record.wstrBinaryPath);
    std::wstring wstrIds = L"@" + wstrExe + L",-";
    EXPECT_EQ(wstrIds + std::to_wstring(service.m_idsLocalizedName), record.wstrDisplayName);
    EXPECT_EQ(wstrIds + std::to_wstring(service.m_idsDescription), record.wstrDescription);

    std::vector<FAILURE_ACTIONS_CALL> rgCalls;
    {
        std::lock_guard<std::mutex> guard(s_callLock);
        rgCalls = s_rgCalls;
    }
    ASSERT_EQ(1u, rgCalls.size());
    EXPECT_EQ(3600u, rgCalls[0].dwResetPeriod);
    EXPECT_FALSE(rgCalls[0].fRebootMessage);
    EXPECT_FALSE(rgCalls[0].fCommand);
    ASSERT_EQ(10u, rgCalls[0].rgActions.size());
    for (const SC_ACTION &action : rgCalls[0].rgActions)
    {
        EXPECT_EQ(SC_ACTION_RESTART, action.Type);
        EXPECT_EQ(10000u, action.Delay);
    }

    // Registration removes an older installation first, then calls OnRegister.
    EXPECT_EQ(1, service.m_cUnregisters);
    EXPECT_EQ(1, service.m_cRegisters);

    service.UnregisterOneService();
    EXPECT_FALSE(testsupport::ServiceExists(service.ServiceName()));
    EXPECT_EQ(2, service.m_cUnregisters);
    // A second removal finds nothing and is not an error.
    service.UnregisterOneService();

    // A program that lists several services shares its process among them.
    CInstallService other(testsupport::UniqueName(L"TelvaneTestSvc"));
    CService::RegisterService(&other);
    service.RegisterOneService();
    ASSERT_TRUE(testsupport::ServiceReadRecord(service.ServiceName(), &record));
    EXPECT_EQ(static_cast<DWORD>(SERVICE_WIN32_SHARE_PROCESS), record.dwServiceType);
    EXPECT_EQ(0u, failures.Count());
}

TEST_F(ServiceInstall, HostDllValuesAndGroupList)
{
    FailureCapture failures;
    const std::wstring &wstrGroup = m_wstrGroup;
    CTestService::SetHostMode(true, wstrGroup.c_str(), nullptr);
    // Someone else's service in the group stays where it is.
    RegHelperSetMultiString(c_wszSvchostGroupKey, wstrGroup.c_str(), {L"Other"});

    CInstallService alpha(testsupport::UniqueName(L"TelvaneTestSvc"));
    CInstallService beta(testsupport::UniqueName(L"TelvaneTestSvc"));
    CService::RegisterService(&alpha);
    CService::RegisterService(&beta);
    const std::wstring a = alpha.ServiceName();
    const std::wstring b = beta.ServiceName();

    alpha.RegisterOneService();
    testsupport::SERVICE_RECORD record;
    ASSERT_TRUE(testsupport::ServiceReadRecord(a.c_str(), &record));
    EXPECT_EQ(static_cast<DWORD>(SERVICE_WIN32_SHARE_PROCESS), record.dwServiceType);
    EXPECT_EQ(L"svchost.exe -k " + wstrGroup, record.wstrBinaryPath);
    // The DLL values are those of telvane.dll in the TelvaneScm suite.
    EXPECT_EQ((std::vector<std::wstring>{L"Other", a}), GroupList(wstrGroup));

    beta.RegisterOneService();
    EXPECT_EQ((std::vector<std::wstring>{L"Other", a, b}), GroupList(wstrGroup));
    // Registering again replaces the entry instead of adding one.
    alpha.RegisterOneService();
    EXPECT_EQ((std::vector<std::wstring>{L"Other", b, a}), GroupList(wstrGroup));

    alpha.UnregisterOneService();
    EXPECT_FALSE(testsupport::ServiceExists(a.c_str()));
    EXPECT_EQ((std::vector<std::wstring>{L"Other", b}), GroupList(wstrGroup));
    beta.UnregisterOneService();
    EXPECT_EQ((std::vector<std::wstring>{L"Other"}), GroupList(wstrGroup));

    EXPECT_EQ(0u, failures.Count());
}
