// The endpoint directory stand-in as another process drives it: roles set and removed by
// telvanectl, resolved here through the prefix's registry. Runs on the test's main thread.
#include "platform/endpointdirectory/endpointdirectory.h"
#include "tests/common/testsupport.h"

#include <gtest/gtest.h>
#include <string>

namespace
{
const wchar_t c_wszRole[] = L"TelvaneTestRole";

// Removes the test's role after each test; runs on the test's main thread.
class EndpointDirectoryTest : public ::testing::Test
{
protected:
    void TearDown() override { testsupport::HklmDeleteValue(ENDPOINT_DIRECTORY_KEY, c_wszRole); }

    static testsupport::ChildResult Ctl(const std::wstring &wstrArgs)
    {
        return testsupport::RunTelvanectl(L"platform endpoint " + std::wstring(c_wszRole) +
                                          wstrArgs);
    }
};

TEST_F(EndpointDirectoryTest, RoleSetByAnotherProcessResolvesAndIsReleased)
{
    testsupport::ChildResult set = Ctl(L" https://localhost:47131/");
    ASSERT_EQ(0u, set.dwExitCode) << set.strOutput;

    PWSTR pwszEndpoint = nullptr;
    ASSERT_EQ(S_OK, GetServiceEndpoint(c_wszRole, &pwszEndpoint, 0));
    EXPECT_STREQ(L"https://localhost:47131/", pwszEndpoint);
    ReleaseEndpoint(pwszEndpoint);

    testsupport::ChildResult shown = Ctl(L"");
    EXPECT_EQ(0u, shown.dwExitCode);
    EXPECT_NE(std::string::npos, shown.strOutput.find("https://localhost:47131/"));

    testsupport::ChildResult removed = Ctl(L" --remove");
    ASSERT_EQ(0u, removed.dwExitCode) << removed.strOutput;
    pwszEndpoint = reinterpret_cast<PWSTR>(1);
    EXPECT_EQ(HRESULT_FROM_WIN32(ERROR_FILE_NOT_FOUND),
              GetServiceEndpoint(c_wszRole, &pwszEndpoint, 0));
    EXPECT_EQ(nullptr, pwszEndpoint);
    ReleaseEndpoint(nullptr);
}

TEST_F(EndpointDirectoryTest, LookupsResolveOrRefuse)
{
    struct Case
    {
        const char *szName;
        const wchar_t *wszStored; // null: no value
        const wchar_t *wszRole;
        DWORD dwFlags;
        HRESULT hrExpected;
    };
    const Case rgCases[] = {
        {"Stored", L"https://h/", c_wszRole, 0, S_OK},
        {"Missing", nullptr, c_wszRole, 0, HRESULT_FROM_WIN32(ERROR_FILE_NOT_FOUND)},
        {"EmptyValue", L"", c_wszRole, 0, HRESULT_FROM_WIN32(ERROR_FILE_NOT_FOUND)},
        {"NullRole", L"https://h/", nullptr, 0, E_INVALIDARG},
        {"EmptyRole", L"https://h/", L"", 0, E_INVALIDARG},
        {"Flags", L"https://h/", c_wszRole, 1, E_INVALIDARG},
    };
    for (const Case &c : rgCases)
    {
        SCOPED_TRACE(c.szName);
        testsupport::HklmDeleteValue(ENDPOINT_DIRECTORY_KEY, c_wszRole);
        if (c.wszStored != nullptr)
        {
            testsupport::HklmSetString(ENDPOINT_DIRECTORY_KEY, c_wszRole, c.wszStored);
        }
        PWSTR pwszEndpoint = reinterpret_cast<PWSTR>(1);
        EXPECT_EQ(c.hrExpected, GetServiceEndpoint(c.wszRole, &pwszEndpoint, c.dwFlags));
        EXPECT_STREQ(SUCCEEDED(c.hrExpected) ? c.wszStored : nullptr, pwszEndpoint);
        ReleaseEndpoint(pwszEndpoint);
    }
}
} // namespace
