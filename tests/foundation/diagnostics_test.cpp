#include "servicelib/diagnostics.h"
#include "tests/common/testsupport.h"

#include <gtest/gtest.h>
#include <string>

using testsupport::FailureCapture;
using testsupport::LogCapture;

TEST(StringCchPrintf, BoundsAndResults)
{
    wchar_t wsz[8];
    // Microsoft formats: %s is wide in the wide variant, %S narrow.
    EXPECT_EQ(S_OK, StringCchPrintf(wsz, 8, L"%s-%S", L"ab", "cd"));
    EXPECT_STREQ(L"ab-cd", wsz);

    // Exactly fits: 7 characters and the terminator.
    EXPECT_EQ(S_OK, StringCchPrintf(wsz, 8, L"%s", L"1234567"));
    EXPECT_STREQ(L"1234567", wsz);

    // One too many: cut and terminated.
    EXPECT_EQ(static_cast<HRESULT>(0x8007007A), StringCchPrintf(wsz, 8, L"%s", L"12345678"));
    EXPECT_STREQ(L"1234567", wsz);

    wsz[0] = L'x';
    EXPECT_EQ(E_INVALIDARG, StringCchPrintf(wsz, 0, L"abc"));
    EXPECT_EQ(L'x', wsz[0]);
    EXPECT_EQ(E_INVALIDARG, StringCchPrintf(wsz, static_cast<size_t>(0x80000000), L"abc"));
    EXPECT_EQ(L'\0', wsz[0]);

    char sz[4];
    EXPECT_EQ(S_OK, StringCchPrintf(sz, 4, "%d", 123));
    EXPECT_STREQ("123", sz);
    EXPECT_EQ(static_cast<HRESULT>(0x8007007A), StringCchPrintf(sz, 4, "%s", "abcdef"));
    EXPECT_STREQ("abc", sz);
    sz[0] = 'x';
    EXPECT_EQ(E_INVALIDARG, StringCchPrintf(sz, 0, "abc"));
    EXPECT_EQ('x', sz[0]);
    EXPECT_EQ(E_INVALIDARG, StringCchPrintf(sz, static_cast<size_t>(0x80000000), "abc"));
    EXPECT_EQ('\0', sz[0]);
}

TEST(DebugLog, PrefixFormatCutAndQuiet)
{
    LogCapture log;
    DebugLog(L"CService::SetStatus", L"%s is %s\r\n", L"Telvane", L"RUNNING");
    std::wstring longMessage(3000, L'z');
    DebugLog(L"Long", L"%s\r\n", longMessage.c_str());
    // A quiet process still hands its lines to the log hook.
    DiagnosticsSetLogQuiet(true);
    DebugLog(L"Tests::Quiet", L"%s\r\n", L"seen by the hook");
    DiagnosticsSetLogQuiet(false);

    std::vector<std::wstring> lines = log.Lines();
    ASSERT_EQ(3u, lines.size());
    EXPECT_TRUE(log.Contains(L"Tests::Quiet: seen by the hook\r\n"));
    const std::wstring &line = lines[0];
    // [hh:mm:ss] CService::SetStatus: Telvane is RUNNING\r\n
    ASSERT_GE(line.size(), 11u);
    EXPECT_EQ(L'[', line[0]);
    EXPECT_EQ(L':', line[3]);
    EXPECT_EQ(L':', line[6]);
    EXPECT_EQ(L"] CService::SetStatus: Telvane is RUNNING\r\n", line.substr(9));

    // An over-long line is cut to 1023 characters, not dropped.
    EXPECT_EQ(1023u, lines[1].size());
    EXPECT_EQ(L'z', lines[1].back());
}

TEST(FatalError, ReportTextWithAndWithoutSystemMessageAndFailedChecks)
{
    FailureCapture failures;
    LogCapture log;
    FatalError(L"CThing::Run", L"service/cthing.cpp", 42, L"CreateEvent", 0x80070490);
    FatalError(L"CThing::Run", L"service/cthing.cpp", 43, L"WinHttpSendRequest", 12157);

    // Under the failure hook (as under a debugger) both return to the caller.
    ASSERT_EQ(2u, failures.Count());
    EXPECT_TRUE(failures.Contains(L"CThing::Run: Fatal error 0x80070490 from CreateEvent"));
    EXPECT_TRUE(log.Contains(
        L"CThing::Run: service/cthing.cpp(42): Fatal error 0x80070490 from CreateEvent: "
        L"Element not found."));
    EXPECT_TRUE(log.Contains(L"service/cthing.cpp(43): Fatal error 0x2f7d from WinHttpSendRequest: "
                             L"(unknown error code)\r\n"));

    // A check reports only a false condition.
    int cValue = 1;
    ASSERT_CHECK(L"Tests::Check", cValue == 1);
    EXPECT_EQ(2u, failures.Count());
    ASSERT_CHECK(L"Tests::Check", cValue == 2);
    ASSERT_EQ(3u, failures.Count());
    EXPECT_TRUE(log.Contains(L"Tests::Check: "));
    EXPECT_TRUE(log.Contains(L"diagnostics_test.cpp("));
    EXPECT_TRUE(log.Contains(L"): Assertion failure: cValue == 2\r\n"));
}

// A fatal error or a failed assertion ends the process with its report; a quiet process (a
// benchmark's) prints the reports and its own output, but no debug lines.
TEST(FailFast, FatalErrorAndAssertEndTheProcessQuietOrNot)
{
    struct Case
    {
        const wchar_t *wszArgs;
        DWORD dwExitCode;
        const char *szOutputPart;
    };
    const Case rgCases[] = {
        {L"fatal", 0xC0000602u, "tests/foundation/foundation_child.cpp("},
        {L"assert", 0xC0000602u, "Assertion failure: cItems == 3\r\n"},
        {L"quiet fatal", 0xC0000602u, "): Fatal error 0x5 from CreateThing: "},
        {L"quiet assert", 0xC0000602u, "Assertion failure: cItems == 3\r\n"},
        {L"quiet figures", 0, "figure 42\n"}, // and nothing else
    };
    for (const Case &c : rgCases)
    {
        SCOPED_TRACE(testsupport::Narrow(c.wszArgs));
        testsupport::ChildResult result = testsupport::RunChild(
            testsupport::BinCommand(L"foundation_child.exe") + L" " + c.wszArgs);
        EXPECT_FALSE(result.fTimedOut);
        EXPECT_EQ(c.dwExitCode, result.dwExitCode);
        EXPECT_NE(std::string::npos, result.strOutput.find(c.szOutputPart)) << result.strOutput;
        EXPECT_EQ(std::string::npos, result.strOutput.find("nobody sees")) << result.strOutput;
        // Reports name the source relative to the tree, never by the build machine's path.
        EXPECT_EQ(std::string::npos, result.strOutput.find(": /")) << result.strOutput;
        if (c.dwExitCode == 0)
        {
            EXPECT_EQ(c.szOutputPart, result.strOutput);
        }
    }
}
