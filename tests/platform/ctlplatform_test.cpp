// telvanectl's platform commands on states of their own: what they publish is what the
// facility's query reads, and what they refuse changes nothing. Runs on the test's main
// thread.
#include "platform/statenotify/statenotify.h"
#include "platform/statenotify/statenotifypublish.h"
#include "tests/common/testsupport.h"
#include "tests/platform/platformtestsupport.h"

#include <gtest/gtest.h>

#include <string>

namespace
{
// The 32-bit value and stamp the facility's query reads.
DWORD QueryValue(WNF_STATE_NAME stateName, WNF_CHANGE_STAMP *pStamp)
{
    DWORD dwValue = 0xFFFFFFFF;
    ULONG cb = sizeof(dwValue);
    EXPECT_EQ(STATUS_SUCCESS,
              NtQueryWnfStateData(&stateName, nullptr, nullptr, pStamp, &dwValue, &cb));
    EXPECT_EQ(*pStamp == 0 ? 0u : sizeof(DWORD), cb);
    return dwValue;
}
} // namespace

TEST(TelvanectlPlatform, RefusesBadArgumentsAndPublishesNothing)
{
    WNF_STATE_NAME stateName = platformtest::NewStateName();
    const std::wstring wstrState = L"platform state " + platformtest::StateNameText(stateName);
    struct Case
    {
        std::wstring wstrArgs;
        const char *szProblem;
    };
    const Case rgCases[] = {
        {L"platform state", "needs a state NAME"},
        {L"platform state zz 1", "needs a state NAME"},
        {L"platform state 0x10000000000000000 1", "needs a state NAME"},
        {wstrState + L" -1", "VALUE must be"},
        {wstrState + L" 4294967296", "VALUE must be"},
        {wstrState + L" 0x", "VALUE must be"},
        {wstrState + L" 12abc", "VALUE must be"},
        {wstrState + L" 1 2", "too many arguments"},
        {L"platform backlight 1 2", "too many arguments"},
        {L"platform power on", "VALUE must be"},
    };
    for (const Case &c : rgCases)
    {
        SCOPED_TRACE(testsupport::Narrow(c.wstrArgs));
        testsupport::ChildResult result = testsupport::RunTelvanectl(c.wstrArgs);
        EXPECT_EQ(2u, result.dwExitCode);
        EXPECT_NE(std::string::npos, result.strOutput.find(c.szProblem)) << result.strOutput;
    }
    WNF_CHANGE_STAMP stamp = 0;
    QueryValue(stateName, &stamp);
    EXPECT_EQ(0u, stamp);
}

TEST(TelvanectlPlatform, StatePublishesAndShowsThirtyTwoBitValues)
{
    WNF_STATE_NAME stateName = platformtest::NewStateName();
    const std::wstring wstrState = L"platform state " + platformtest::StateNameText(stateName);
    const std::string strLabel =
        "state " + testsupport::Narrow(platformtest::StateNameText(stateName));

    testsupport::ChildResult result = testsupport::RunTelvanectl(wstrState);
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
        SCOPED_TRACE(testsupport::Narrow(c.wszValue));
        stamp++;
        const std::string strLine = strLabel + " = " + std::to_string(c.dwExpected) +
                                    " (change stamp " + std::to_string(stamp) + ")\r\n";
        result = testsupport::RunTelvanectl(wstrState + L" " + c.wszValue);
        EXPECT_EQ(0u, result.dwExitCode);
        EXPECT_EQ(strLine, result.strOutput);
        WNF_CHANGE_STAMP stampRead = 0;
        EXPECT_EQ(c.dwExpected, QueryValue(stateName, &stampRead));
        EXPECT_EQ(stamp, stampRead);
        EXPECT_EQ(strLine, testsupport::RunTelvanectl(wstrState).strOutput);
    }

    // Data of another size, as another component might publish, shows as bytes.
    const BYTE rgb[] = {0x01, 0xA2};
    ASSERT_HRESULT_SUCCEEDED(StateNotifyPublish(stateName, rgb, sizeof(rgb), nullptr));
    EXPECT_EQ(strLabel + " = 2 bytes: 01 a2 (change stamp " + std::to_string(stamp + 1) + ")\r\n",
              testsupport::RunTelvanectl(wstrState).strOutput);
}
