// The child-process helper the suites lean on: the exit code and the environment
// must be the ones the test asked for, whatever the child does with its output.
#include "tests/common/testsupport.h"

#include <gtest/gtest.h>

using testsupport::ChildResult;
using testsupport::RunChild;

TEST(RunChild, ExitCodeAndEnvironment)
{
    const std::wstring child = L"\"" + testsupport::BinDir() + L"foundation_child.exe\"";

    // Output that ends early does not end the wait for the process.
    ChildResult closed = RunChild(child + L" closeout", {}, 30000);
    EXPECT_FALSE(closed.fTimedOut);
    EXPECT_EQ(7u, closed.dwExitCode);

    // An extra entry replaces an inherited variable of the same name.
    SetEnvironmentVariableW(L"TELVANE_RUNCHILD_PROBE", L"parent");
    ChildResult env =
        RunChild(child + L" env TELVANE_RUNCHILD_PROBE", {L"telvane_runchild_probe=child"});
    SetEnvironmentVariableW(L"TELVANE_RUNCHILD_PROBE", nullptr);
    EXPECT_EQ(0u, env.dwExitCode);
    EXPECT_EQ("value=child", env.strOutput);
}
