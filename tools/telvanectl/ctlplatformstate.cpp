// telvanectl platform backlight|power|state: publishes or shows the machine-wide state
// values of the state-notification stand-in, as the phone's display and power components
// publish them. Runs on telvanectl's main thread.
#include "platform/statenotify/statenotify.h"
#include "platform/statenotify/statenotifypublish.h"
#include "tools/telvanectl/ctlcommand.h"

#include <stdio.h>
#include <string.h>

namespace
{
const WNF_STATE_NAME c_stateBacklight = 0x41C61D22A3BC3875ull;
const WNF_STATE_NAME c_statePowerSource = 0x41C61D22A3BC2875ull;

// Digits only, decimal or 0x-prefixed hex, and nothing past ullMax.
bool CtlStateParseNumber(const wchar_t *wsz, ULONGLONG ullMax, ULONGLONG *pull)
{
    ULONGLONG ullBase = 10;
    if (wsz[0] == L'0' && (wsz[1] == L'x' || wsz[1] == L'X'))
    {
        ullBase = 16;
        wsz += 2;
    }
    if (*wsz == L'\0')
    {
        return false;
    }
    ULONGLONG ull = 0;
    for (; *wsz != L'\0'; wsz++)
    {
        ULONGLONG ullDigit = 0;
        if (*wsz >= L'0' && *wsz <= L'9')
        {
            ullDigit = static_cast<ULONGLONG>(*wsz - L'0');
        }
        else if (ullBase == 16 && *wsz >= L'a' && *wsz <= L'f')
        {
            ullDigit = static_cast<ULONGLONG>(*wsz - L'a' + 10);
        }
        else if (ullBase == 16 && *wsz >= L'A' && *wsz <= L'F')
        {
            ullDigit = static_cast<ULONGLONG>(*wsz - L'A' + 10);
        }
        else
        {
            return false;
        }
        if (ull > (ullMax - ullDigit) / ullBase)
        {
            return false;
        }
        ull = ull * ullBase + ullDigit;
    }
    *pull = ull;
    return true;
}

int CtlStateFailed(const char *szStep, HRESULT hr)
{
    fprintf(stderr, "telvanectl: %s failed: 0x%08lx\n", szStep, static_cast<unsigned long>(hr));
    return c_iCtlExitFailed;
}

int CtlStateShow(const char *szLabel, WNF_STATE_NAME stateName)
{
    BYTE rgbData[WNF_STATE_MAX_DATA_SIZE];
    ULONG cbData = sizeof(rgbData);
    WNF_CHANGE_STAMP stamp = 0;
    NTSTATUS status = NtQueryWnfStateData(&stateName, nullptr, nullptr, &stamp, rgbData, &cbData);
    if (!NT_SUCCESS(status))
    {
        return CtlStateFailed("NtQueryWnfStateData", static_cast<HRESULT>(status));
    }
    if (stamp == 0)
    {
        printf("%s: not published\n", szLabel);
        return c_iCtlExitOk;
    }
    if (cbData == sizeof(DWORD))
    {
        DWORD dwValue = 0;
        memcpy(&dwValue, rgbData, sizeof(dwValue));
        printf("%s = %lu (change stamp %lu)\n", szLabel, static_cast<unsigned long>(dwValue),
               static_cast<unsigned long>(stamp));
        return c_iCtlExitOk;
    }
    printf("%s = %lu bytes:", szLabel, static_cast<unsigned long>(cbData));
    for (ULONG ib = 0; ib < cbData; ib++)
    {
        printf(" %02x", rgbData[ib]);
    }
    printf(" (change stamp %lu)\n", static_cast<unsigned long>(stamp));
    return c_iCtlExitOk;
}

// A value is published as the 32-bit number the phone's components write.
int CtlStatePublish(const char *szLabel, WNF_STATE_NAME stateName, const wchar_t *wszValue)
{
    ULONGLONG ullValue = 0;
    if (!CtlStateParseNumber(wszValue, 0xFFFFFFFFull, &ullValue))
    {
        return CtlCommandUsage("VALUE must be a 32-bit number (decimal or 0x hex)");
    }
    DWORD dwValue = static_cast<DWORD>(ullValue);
    WNF_CHANGE_STAMP stamp = 0;
    HRESULT hr = StateNotifyPublish(stateName, &dwValue, sizeof(dwValue), &stamp);
    if (FAILED(hr))
    {
        return CtlStateFailed("publishing the state", hr);
    }
    printf("%s = %lu (change stamp %lu)\n", szLabel, static_cast<unsigned long>(dwValue),
           static_cast<unsigned long>(stamp));
    return c_iCtlExitOk;
}

int CtlStateRun(const char *szLabel, WNF_STATE_NAME stateName, int argc, wchar_t **argv)
{
    if (argc > 1)
    {
        return CtlCommandUsage("too many arguments");
    }
    return argc == 0 ? CtlStateShow(szLabel, stateName)
                     : CtlStatePublish(szLabel, stateName, argv[0]);
}

int CtlBacklight(int argc, wchar_t **argv)
{
    return CtlStateRun("backlight", c_stateBacklight, argc, argv);
}

int CtlPowerSource(int argc, wchar_t **argv)
{
    return CtlStateRun("power", c_statePowerSource, argc, argv);
}

int CtlState(int argc, wchar_t **argv)
{
    ULONGLONG ullName = 0;
    if (argc < 1 || !CtlStateParseNumber(argv[0], ~0ull, &ullName))
    {
        return CtlCommandUsage("platform state needs a state NAME (a 64-bit number)");
    }
    char szLabel[40];
    snprintf(szLabel, sizeof(szLabel), "state 0x%016llx", ullName);
    return CtlStateRun(szLabel, ullName, argc - 1, argv + 1);
}

const CtlCommand s_commandBacklight(
    L"platform backlight", CtlBacklight,
    "telvanectl platform backlight [VALUE]\n"
    "           publishes VALUE (a 32-bit number) as the display backlight state, or shows\n"
    "           the state; 1 is the value the service ignores\n");
const CtlCommand s_commandPower(
    L"platform power", CtlPowerSource,
    "telvanectl platform power [VALUE]\n"
    "           the same for the power-source state; 0 means mains power\n");
const CtlCommand s_commandState(L"platform state", CtlState,
                                "telvanectl platform state NAME [VALUE]\n"
                                "           the same for any state NAME (a 64-bit number)\n");
} // namespace
