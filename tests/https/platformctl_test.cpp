// telvanectl's "platform cm" and "platform cert provision" commands: what each leaves in the
// stand-ins' registry keys, seen through the stand-ins themselves. Runs on the test's main
// thread.
#include "platform/certprovisioning/certprovisioning.h"
#include "platform/connectionmanager/connectionmanager.h"
#include "tests/common/testsupport.h"

#include <gtest/gtest.h>
#include <string>

namespace
{
DWORD Ctl(const wchar_t *wszArgs)
{
    return testsupport::RunTelvanectl(std::wstring(L"platform ") + wszArgs).dwExitCode;
}
} // namespace

// The steering values end where they started: "cm ok", "cm clear" and "cert provision ok"
// remove them.
TEST(PlatformCtlTest, ConnectionManagerAndProvisioningAreSteered)
{
    ASSERT_EQ(0u, Ctl(L"cm clear"));
    ASSERT_EQ(0u, Ctl(L"cm fail init"));
    EXPECT_FALSE(CmApiInit());
    ASSERT_EQ(0u, Ctl(L"cm fail requirements 0x3e5"));
    const DWORD rgdw[2] = {7, 8};
    EXPECT_EQ(0x3e5u, CmSetRequirements(0x42, rgdw, sizeof(rgdw)));
    CmCloseSession(0x42);
    CmApiDeinit();

    testsupport::ChildResult calls = testsupport::RunTelvanectl(L"platform cm calls");
    EXPECT_EQ(0u, calls.dwExitCode);
    EXPECT_NE(std::string::npos, calls.strOutput.find("CmApiInit\r\nCmSetRequirements 0x00000042 "
                                                      "7 8\r\nCmCloseSession 0x00000042\r\n"
                                                      "CmApiDeinit"))
        << calls.strOutput;

    ASSERT_EQ(0u, Ctl(L"cm ok"));
    EXPECT_TRUE(CmApiInit());
    EXPECT_EQ(0u, CmSetRequirements(0x42, rgdw, sizeof(rgdw)));
    ASSERT_EQ(0u, Ctl(L"cm clear"));
    EXPECT_EQ(std::string(), testsupport::RunTelvanectl(L"platform cm calls").strOutput);

    ASSERT_EQ(0u, Ctl(L"cert provision fail 0x81120005"));
    EXPECT_EQ(static_cast<HRESULT>(0x81120005), GOVCPC_ProvisionGOVCertificate());
    ASSERT_EQ(0u, Ctl(L"cert provision ok"));
    EXPECT_EQ(S_OK, GOVCPC_ProvisionGOVCertificate());
}

TEST(PlatformCtlTest, BadArgumentsExitWithUsage)
{
    for (const wchar_t *wszArgs :
         {L"cm bogus", L"cm fail requirements 0", L"cm fail requirements x", L"cm fail",
          L"cert provision fail 12z", L"cert provision fail", L"cert bogus", L"cert root add",
          L"endpoint a b c"})
    {
        testsupport::ChildResult result =
            testsupport::RunTelvanectl(L"platform " + std::wstring(wszArgs));
        EXPECT_EQ(2u, result.dwExitCode) << testsupport::Narrow(wszArgs) << result.strOutput;
        EXPECT_NE(std::string::npos, result.strOutput.find("telvanectl platform"))
            << testsupport::Narrow(wszArgs);
    }
}
