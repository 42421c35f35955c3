// The endpoint directory stand-in as another process drives it: roles set and removed by
// telvanectl, resolved here through the prefix's registry.
#include "platform/endpointdirectory/endpointdirectory.h"
#include "tests/common/testsupport.h"

#include <gtest/gtest.h>
#include <string>

namespace
{
const wchar_t c_wszRole[] = L"TelvaneTestRole";

testsupport::ChildResult Ctl(const std::wstring &wstrArgs)
{
    return testsupport::RunChild(testsupport::BinDir() + L"telvanectl.exe platform endpoint " +
                                 wstrArgs);
}

class EndpointDirectoryTest : public ::testing::Test
{
protected:
    void TearDown() override
    {
        RegDeleteKeyValueW(HKEY_LOCAL_MACHINE, ENDPOINT_DIRECTORY_KEY, c_wszRole);
    }
};

TEST_F(EndpointDirectoryTest, RoleSetByAnotherProcessResolvesAndIsReleased)
{
    testsupport::ChildResult set = Ctl(std::wstring(c_wszRole) + L" https://localhost:47131/");
    ASSERT_EQ(0u, set.dwExitCode) << set.strOutput;

    PWSTR pwszEndpoint = nullptr;
    ASSERT_EQ(S_OK, GetServiceEndpoint(c_wszRole, &pwszEndpoint, 0));
    EXPECT_STREQ(L"https://localhost:47131/", pwszEndpoint);
    ReleaseEndpoint(pwszEndpoint);

    testsupport::ChildResult shown = Ctl(c_wszRole);
    EXPECT_EQ(0u, shown.dwExitCode);
    EXPECT_NE(std::string::npos, shown.strOutput.find("https://localhost:47131/"));

    testsupport::ChildResult removed = Ctl(std::wstring(c_wszRole) + L" --remove");
    ASSERT_EQ(0u, removed.dwExitCode) << removed.strOutput;
    pwszEndpoint = reinterpret_cast<PWSTR>(1);
    EXPECT_EQ(HRESULT_FROM_WIN32(ERROR_FILE_NOT_FOUND),
              GetServiceEndpoint(c_wszRole, &pwszEndpoint, 0));
    EXPECT_EQ(nullptr, pwszEndpoint);
    ReleaseEndpoint(nullptr);
}

struct LookupCase
{
    const char *szName;
    const wchar_t *wszStored; // null: no value
    const wchar_t *wszRole;
    DWORD dwFlags;
    HRESULT hrExpected;
};

void PrintTo(const LookupCase &c, std::ostream *pStream)
{
    *pStream << c.szName;
}

const LookupCase c_rgLookups[] = {
    {"Stored", L"https://h/", c_wszRole, 0, S_OK},
    {"Missing", nullptr, c_wszRole, 0, HRESULT_FROM_WIN32(ERROR_FILE_NOT_FOUND)},
    {"EmptyValue", L"", c_wszRole, 0, HRESULT_FROM_WIN32(ERROR_FILE_NOT_FOUND)},
    {"NullRole", L"https://h/", nullptr, 0, E_INVALIDARG},
    {"EmptyRole", L"https://h/", L"", 0, E_INVALIDARG},
    {"Flags", L"https://h/", c_wszRole, 1, E_INVALIDARG},
};

class EndpointLookupTest : public EndpointDirectoryTest,
                           public ::testing::WithParamInterface<LookupCase>
{
};

TEST_P(EndpointLookupTest, Resolves)
{
    const LookupCase &c = GetParam();
    if (c.wszStored != nullptr)
    {
        ASSERT_EQ(ERROR_SUCCESS,
                  RegSetKeyValueW(HKEY_LOCAL_MACHINE, ENDPOINT_DIRECTORY_KEY, c_wszRole, REG_SZ,
                                  c.wszStored,
                                  static_cast<DWORD>((wcslen(c.wszStored) + 1) * sizeof(wchar_t))));
    }
    PWSTR pwszEndpoint = nullptr;
    EXPECT_EQ(c.hrExpected, GetServiceEndpoint(c.wszRole, &pwszEndpoint, c.dwFlags));
    if (SUCCEEDED(c.hrExpected))
    {
        EXPECT_STREQ(c.wszStored, pwszEndpoint);
    }
    else
    {
        EXPECT_EQ(nullptr, pwszEndpoint);
    }
    ReleaseEndpoint(pwszEndpoint);
}

INSTANTIATE_TEST_SUITE_P(Lookups, EndpointLookupTest, ::testing::ValuesIn(c_rgLookups),
                         [](const ::testing::TestParamInfo<LookupCase> &info) {
                             return std::string(info.param.szName);
                         });
} // namespace
