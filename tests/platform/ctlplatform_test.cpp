// telvanectl's platform commands on states of their own: what they publish is what the
// facility's query reads, and what they refuse changes nothing.
#include "platform/statenotify/statenotify.h"
#include "platform/statenotify/statenotifypublish.h"
#include "tests/common/testsupport.h"
#include "tests/platform/platformtestsupport.h"

#include <gtest/gtest.h>

#include <string>

using platformtest::NewStateName;
using platformtest::StateNameText;
using platformtest::TelvanectlCommand;

namespace
{
testsupport::ChildResult Ctl(const std::wstring &wstrArgs)
{
    return testsupport::RunChild(TelvanectlCommand() + L" " + wstrArgs);
}

WNF_CHANGE_STAMP StampOf(WNF_STATE_NAME stateName)
{
    WNF_CHANGE_STAMP stamp = 0;
    BYTE rgb[WNF_STATE_MAX_DATA_SIZE];
    ULONG cb = sizeof(rgb);
    EXPECT_EQ(STATUS_SUCCESS, NtQueryWnfStateData(&stateName, nullptr, nullptr, &stamp, rgb, &cb));
    return stamp;
}
} // namespace

TEST(TelvanectlPlatform, RefusesBadArgumentsAndPublishesNothing)
{
    WNF_STATE_NAME stateName = NewStateName();
    const std::wstring wstrName = StateNameText(stateName);
    struct Case
    {
        std::wstring wstrArgs;
        const char *szProblem;
    };
    const Case rgCases[] = {
        {L"platform state", "needs a state NAME"},
        {L"platform state zz 1", "needs a state NAME"},
        {L"platform state 0x10000000000000000 1", "needs a state NAME"},
        {L"platform state " + wstrName + L" -1", "VALUE must be"},
        {L"platform state " + wstrName + L" 4294967296", "VALUE must be"},
        {L"platform state " + wstrName + L" 0x", "VALUE must be"},
        {L"platform state " + wstrName + L" 12abc", "VALUE must be"},
        {L"platform state " + wstrName + L" 1 2", "too many arguments"},
        {L"platform backlight 1 2", "too many arguments"},
        {L"platform power on", "VALUE must be"},
    };
    for (const Case &c : rgCases)
    {
        testsupport::ChildResult result = Ctl(c.wstrArgs);
        EXPECT_EQ(2u, result.dwExitCode) << testsupport::Narrow(c.wstrArgs);
        EXPECT_NE(std::string::npos, result.strOutput.find(c.szProblem))
            << testsupport::Narrow(c.wstrArgs) << ": " << result.strOutput;
    }
    EXPECT_EQ(0u, StampOf(stateName));
}

TEST(TelvanectlPlatform, StatePublishesAndShowsThirtyTwoBitValues)
{
    WNF_STATE_NAME stateName = NewStateName();
    const std::wstring wstrName = StateNameText(stateName);
    const std::string strLabel = "state " + testsupport::Narrow(wstrName);

    testsupport::ChildResult result = Ctl(L"platform state " + wstrName);
    EXPECT_EQ(0u, result.dwExitCode);
    EXPECT_EQ(strLabel + ": not published\r\n", result.strOutput);

    struct Case
    {
        const wchar_t *wszValue;
        DWORD dwExpected;
    };
    const Case rgCases[] = {{L"0", 0}, {L"4294967295", 0xFFFFFFFF}, {L"0x1F", 31}, {L"0XaB", 171}};
    WNF_CHANGE_STAMP stamp = 0;
    for (const Case &c : rgCases)
    {
        stamp++;
        const std::string strLine = strLabel + " = " + std::to_string(c.dwExpected) +
                                    " (change stamp " + std::to_string(stamp) + ")\r\n";
        result = Ctl(L"platform state " + wstrName + L" " + c.wszValue);
        EXPECT_EQ(0u, result.dwExitCode) << result.strOutput;
        EXPECT_EQ(strLine, result.strOutput);
        DWORD dwValue = 0;
        ULONG cb = sizeof(dwValue);
        WNF_CHANGE_STAMP stampRead = 0;
        EXPECT_EQ(STATUS_SUCCESS,
                  NtQueryWnfStateData(&stateName, nullptr, nullptr, &stampRead, &dwValue, &cb));
        EXPECT_EQ(stamp, stampRead);
        EXPECT_EQ(sizeof(DWORD), cb);
        EXPECT_EQ(c.dwExpected, dwValue);
        result = Ctl(L"platform state " + wstrName);
        EXPECT_EQ(strLine, result.strOutput);
    }

    // Data of another size, as another component might publish, shows as bytes.
    const BYTE rgb[] = {0x01, 0xA2};
    ASSERT_HRESULT_SUCCEEDED(StateNotifyPublish(stateName, rgb, sizeof(rgb), nullptr));
    result = Ctl(L"platform state " + wstrName);
    EXPECT_EQ(strLabel + " = 2 bytes: 01 a2 (change stamp " + std::to_string(stamp + 1) + ")\r\n",
              result.strOutput);
}
