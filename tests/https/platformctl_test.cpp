// telvanectl's "platform cm" and "platform cert provision" commands: what each leaves in the
// stand-ins' registry keys, seen through the stand-ins themselves.
#include "platform/certprovisioning/certprovisioning.h"
#include "platform/connectionmanager/connectionmanager.h"
#include "tests/common/testsupport.h"

#include <gtest/gtest.h>
#include <string>

namespace
{
testsupport::ChildResult Ctl(const std::wstring &wstrArgs)
{
    return testsupport::RunChild(testsupport::BinDir() + L"telvanectl.exe platform " + wstrArgs);
}

class PlatformCtlTest : public ::testing::Test
{
protected:
    void TearDown() override
    {
        RegDeleteKeyValueW(HKEY_LOCAL_MACHINE, CM_STANDIN_KEY, L"FailInit");
        RegDeleteKeyValueW(HKEY_LOCAL_MACHINE, CM_STANDIN_KEY, L"RequirementsResult");
        RegDeleteKeyValueW(HKEY_LOCAL_MACHINE, CM_STANDIN_KEY, L"Calls");
        RegDeleteKeyValueW(HKEY_LOCAL_MACHINE, GOVCPC_STANDIN_KEY, L"Result");
    }
};

TEST_F(PlatformCtlTest, ConnectionManagerIsSteeredAndItsCallsShown)
{
    ASSERT_EQ(0u, Ctl(L"cm clear").dwExitCode);
    ASSERT_EQ(0u, Ctl(L"cm fail init").dwExitCode);
    EXPECT_FALSE(CmApiInit());
    ASSERT_EQ(0u, Ctl(L"cm fail requirements 0x3e5").dwExitCode);
    const DWORD rgdw[2] = {7, 8};
    EXPECT_EQ(0x3e5u, CmSetRequirements(0x42, rgdw, sizeof(rgdw)));
    CmCloseSession(0x42);
    CmApiDeinit();

    testsupport::ChildResult calls = Ctl(L"cm calls");
    EXPECT_EQ(0u, calls.dwExitCode);
    EXPECT_NE(std::string::npos, calls.strOutput.find("CmApiInit\r\nCmSetRequirements 0x00000042 "
                                                      "7 8\r\nCmCloseSession 0x00000042\r\n"
                                                      "CmApiDeinit"))
        << calls.strOutput;

    ASSERT_EQ(0u, Ctl(L"cm ok").dwExitCode);
    EXPECT_TRUE(CmApiInit());
    EXPECT_EQ(0u, CmSetRequirements(0x42, rgdw, sizeof(rgdw)));
    ASSERT_EQ(0u, Ctl(L"cm clear").dwExitCode);
    EXPECT_EQ(std::string(), Ctl(L"cm calls").strOutput);
}

TEST_F(PlatformCtlTest, ProvisioningAnswerIsSet)
{
    ASSERT_EQ(0u, Ctl(L"cert provision fail 0x81120005").dwExitCode);
    EXPECT_EQ(static_cast<HRESULT>(0x81120005), GOVCPC_ProvisionGOVCertificate());
    ASSERT_EQ(0u, Ctl(L"cert provision ok").dwExitCode);
    EXPECT_EQ(S_OK, GOVCPC_ProvisionGOVCertificate());
}

struct UsageCase
{
    const char *szName;
    const wchar_t *wszArgs;
};

void PrintTo(const UsageCase &c, std::ostream *pStream)
{
    *pStream << c.szName;
}

const UsageCase c_rgUsages[] = {
    {"CmUnknownVerb", L"cm bogus"},
    {"CmZeroResult", L"cm fail requirements 0"},
    {"CmNotANumber", L"cm fail requirements x"},
    {"CmFailNothing", L"cm fail"},
    {"ProvisionNotANumber", L"cert provision fail 12z"},
    {"ProvisionNoResult", L"cert provision fail"},
    {"CertUnknownVerb", L"cert bogus"},
    {"CertRootWithoutFile", L"cert root add"},
    {"EndpointTooMany", L"endpoint a b c"},
};

class PlatformCtlUsageTest : public ::testing::TestWithParam<UsageCase>
{
};

TEST_P(PlatformCtlUsageTest, ExitsWithUsage)
{
    testsupport::ChildResult result = Ctl(GetParam().wszArgs);
    EXPECT_EQ(2u, result.dwExitCode) << result.strOutput;
    EXPECT_NE(std::string::npos, result.strOutput.find("telvanectl platform"));
}

INSTANTIATE_TEST_SUITE_P(Usages, PlatformCtlUsageTest, ::testing::ValuesIn(c_rgUsages),
                         [](const ::testing::TestParamInfo<UsageCase> &info) {
                             return std::string(info.param.szName);
                         });
} // namespace
