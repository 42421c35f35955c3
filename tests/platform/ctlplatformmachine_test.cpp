// telvanectl's backlight and power commands publish the two states the service's launcher
// uses. Serial: the service's own tests subscribe to the backlight state. The values written
// are the harmless ones (1: the launcher ignores it; 0: mains power). Runs on the test's
// main thread.
#include "platform/statenotify/statenotify.h"
#include "tests/common/testsupport.h"

#include <gtest/gtest.h>

#include <string>

TEST(TelvanectlPlatform, BacklightAndPowerPublishTheLauncherStates)
{
    struct Case
    {
        const char *szCommand;
        WNF_STATE_NAME stateName;
        DWORD dwValue;
    };
    const Case rgCases[] = {
        {"backlight", 0x41C61D22A3BC3875ull, 1},
        {"power", 0x41C61D22A3BC2875ull, 0},
    };
    for (const Case &c : rgCases)
    {
        SCOPED_TRACE(c.szCommand);
        WNF_CHANGE_STAMP stamp = 0;
        DWORD dwValue = 0xFFFFFFFF;
        ULONG cb = sizeof(dwValue);
        ASSERT_EQ(STATUS_SUCCESS,
                  NtQueryWnfStateData(&c.stateName, nullptr, nullptr, &stamp, &dwValue, &cb));
        const std::string strLine = std::string(c.szCommand) + " = " + std::to_string(c.dwValue) +
                                    " (change stamp " + std::to_string(stamp + 1) + ")\r\n";

        const std::wstring wstrCommand = L"platform " + testsupport::Widen(c.szCommand);
        testsupport::ChildResult result =
            testsupport::RunTelvanectl(wstrCommand + L" " + std::to_wstring(c.dwValue));
        EXPECT_EQ(0u, result.dwExitCode) << result.strOutput;
        EXPECT_EQ(strLine, result.strOutput);

        WNF_CHANGE_STAMP stampBefore = stamp;
        cb = sizeof(dwValue);
        ASSERT_EQ(STATUS_SUCCESS,
                  NtQueryWnfStateData(&c.stateName, nullptr, nullptr, &stamp, &dwValue, &cb));
        EXPECT_EQ(stampBefore + 1, stamp);
        EXPECT_EQ(sizeof(DWORD), cb);
        EXPECT_EQ(c.dwValue, dwValue);

        result = testsupport::RunTelvanectl(wstrCommand);
        EXPECT_EQ(0u, result.dwExitCode) << result.strOutput;
        EXPECT_EQ(strLine, result.strOutput);
    }
}
