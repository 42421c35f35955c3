// The endpoint directory stand-in as another process drives it: roles set and removed by
// telvanectl, resolved here through the prefix's registry. Runs on the test's main thread.
#include "platform/endpointdirectory/endpointdirectory.h"
#include "tests/common/testsupport.h"

#include <gtest/gtest.h>
#include <string>

namespace
{
const wchar_t c_wszRole[] = L"TelvaneTestRole";

testsupport::ChildResult Ctl(const std::wstring &wstrArgs)
{
    return testsupport::RunTelvanectl(L"platform endpoint " + std::wstring(c_wszRole) + wstrArgs);
}

// What a lookup of the role answers now; a failure leaves no endpoint.
std::wstring Lookup(HRESULT hrExpected, const wchar_t *wszRole = c_wszRole, DWORD dwFlags = 0)
{
    PWSTR pwszEndpoint = reinterpret_cast<PWSTR>(1);
    EXPECT_EQ(hrExpected, GetServiceEndpoint(wszRole, &pwszEndpoint, dwFlags));
    std::wstring wstr = pwszEndpoint != nullptr ? pwszEndpoint : L"(none)";
    ReleaseEndpoint(pwszEndpoint);
    return wstr;
}
} // namespace

// A role set by another process resolves, shows and is released; a removed role, or one
// whose value is empty, is not found; a lookup without a role or with flags is refused.
TEST(EndpointDirectoryTest, RoleSetByAnotherProcessResolvesAndIsRemoved)
{
    testsupport::ChildResult set = Ctl(L" https://localhost:47131/");
    ASSERT_EQ(0u, set.dwExitCode) << set.strOutput;
    EXPECT_EQ(L"https://localhost:47131/", Lookup(S_OK));
    testsupport::ChildResult shown = Ctl(L"");
    EXPECT_EQ(0u, shown.dwExitCode);
    EXPECT_NE(std::string::npos, shown.strOutput.find("https://localhost:47131/"));

    EXPECT_EQ(L"(none)", Lookup(E_INVALIDARG, c_wszRole, 1));
    EXPECT_EQ(L"(none)", Lookup(E_INVALIDARG, L""));
    EXPECT_EQ(L"(none)", Lookup(E_INVALIDARG, nullptr));

    testsupport::ChildResult removed = Ctl(L" --remove");
    ASSERT_EQ(0u, removed.dwExitCode) << removed.strOutput;
    EXPECT_EQ(L"(none)", Lookup(HRESULT_FROM_WIN32(ERROR_FILE_NOT_FOUND)));
    testsupport::HklmSetString(ENDPOINT_DIRECTORY_KEY, c_wszRole, L"");
    EXPECT_EQ(L"(none)", Lookup(HRESULT_FROM_WIN32(ERROR_FILE_NOT_FOUND)));
    testsupport::HklmDeleteValue(ENDPOINT_DIRECTORY_KEY, c_wszRole);
}
