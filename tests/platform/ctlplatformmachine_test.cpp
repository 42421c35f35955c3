// telvanectl's backlight and power commands publish the two states the service's launcher
// uses. Serial: the service's own tests subscribe to the backlight state. The values written
// are the harmless ones (1: the launcher ignores it; 0: mains power).
#include "platform/statenotify/statenotify.h"
#include "tests/common/testsupport.h"
#include "tests/platform/platformtestsupport.h"

#include <gtest/gtest.h>

#include <string>

TEST(TelvanectlPlatform, BacklightAndPowerPublishTheLauncherStates)
{
    struct Case
    {
        const wchar_t *wszCommand;
        const char *szLabel;
        WNF_STATE_NAME stateName;
        DWORD dwValue;
    };
    const Case rgCases[] = {
        {L"backlight", "backlight", 0x41C61D22A3BC3875ull, 1},
        {L"power", "power", 0x41C61D22A3BC2875ull, 0},
    };
    for (const Case &c : rgCases)
    {
        WNF_CHANGE_STAMP stampBefore = 0;
        DWORD dwValue = 0xFFFFFFFF;
        ULONG cb = sizeof(dwValue);
        ASSERT_EQ(STATUS_SUCCESS,
                  NtQueryWnfStateData(&c.stateName, nullptr, nullptr, &stampBefore, &dwValue, &cb));

        const std::wstring wstrCommand =
            platformtest::TelvanectlCommand() + L" platform " + c.wszCommand;
        testsupport::ChildResult result =
            testsupport::RunChild(wstrCommand + L" " + std::to_wstring(c.dwValue));
        const std::string strLine = std::string(c.szLabel) + " = " + std::to_string(c.dwValue) +
                                    " (change stamp " + std::to_string(stampBefore + 1) + ")\r\n";
        EXPECT_EQ(0u, result.dwExitCode) << result.strOutput;
        EXPECT_EQ(strLine, result.strOutput);

        WNF_CHANGE_STAMP stamp = 0;
        cb = sizeof(dwValue);
        ASSERT_EQ(STATUS_SUCCESS,
                  NtQueryWnfStateData(&c.stateName, nullptr, nullptr, &stamp, &dwValue, &cb));
        EXPECT_EQ(stampBefore + 1, stamp) << c.szLabel;
        EXPECT_EQ(sizeof(DWORD), cb) << c.szLabel;
        EXPECT_EQ(c.dwValue, dwValue) << c.szLabel;

        result = testsupport::RunChild(wstrCommand);
        EXPECT_EQ(0u, result.dwExitCode) << result.strOutput;
        EXPECT_EQ(strLine, result.strOutput);
    }
}
