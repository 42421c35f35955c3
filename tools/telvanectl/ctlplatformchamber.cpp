// "telvanectl platform chamber": the chamber calls of the security runtime stand-in.
#include "platform/securityruntime/securityruntime.h"
#include "tools/telvanectl/ctlcommand.h"

#include <stdio.h>
#include <wchar.h>

namespace
{
void CtlChamberPrintValue(const wchar_t *wszName)
{
    wchar_t wszValue[1024] = L"";
    DWORD cb = sizeof(wszValue);
    DWORD dwValue = 0;
    if (RegGetValueW(HKEY_LOCAL_MACHINE, CHAMBER_STANDIN_KEY, wszName, RRF_RT_REG_SZ, nullptr,
                     wszValue, &cb) == ERROR_SUCCESS)
    {
        printf("%ls: %ls\n", wszName, wszValue);
        return;
    }
    cb = sizeof(dwValue);
    if (RegGetValueW(HKEY_LOCAL_MACHINE, CHAMBER_STANDIN_KEY, wszName, RRF_RT_REG_DWORD, nullptr,
                     &dwValue, &cb) == ERROR_SUCCESS)
    {
        printf("%ls: %lu\n", wszName, static_cast<unsigned long>(dwValue));
    }
}

int CtlPlatformChamber(int argc, wchar_t **argv)
{
    HRESULT hr = S_OK;
    if (argc == 1 && wcscmp(argv[0], L"last") == 0)
    {
        const wchar_t *rgwszNames[] = {L"LaunchCount", L"LastChamberSid", L"LastChamberInstance",
                                       L"LastCommandLine", L"LastProcessId"};
        for (const wchar_t *wszName : rgwszNames)
        {
            CtlChamberPrintValue(wszName);
        }
        return c_iCtlExitOk;
    }
    if (argc == 1 && wcscmp(argv[0], L"ok") == 0)
    {
        hr = ChamberStandInSetFailure(nullptr, S_OK);
    }
    else if (argc == 2 && wcscmp(argv[0], L"fail") == 0)
    {
        hr = ChamberStandInSetFailure(argv[1], CHAMBER_STANDIN_FAILURE);
        if (hr == E_INVALIDARG)
        {
            return CtlCommandUsage("CALL is GetChamberSidFromId or CreateProcessInChamber");
        }
    }
    else
    {
        return CtlCommandUsage("platform chamber needs last, ok or fail CALL");
    }
    if (FAILED(hr))
    {
        fprintf(stderr, "telvanectl: setting the chamber state failed: 0x%08lx\n",
                static_cast<unsigned long>(hr));
        return c_iCtlExitFailed;
    }
    printf("chamber calls: %ls\n", argc == 2 ? argv[1] : L"all succeed");
    return c_iCtlExitOk;
}

const CtlCommand s_platformChamber(
    L"platform chamber", CtlPlatformChamber,
    "       telvanectl platform chamber last | ok | fail CALL\n"
    "           the process last started in a chamber; make the chamber calls succeed, or\n"
    "           CALL (GetChamberSidFromId, CreateProcessInChamber) fail with access denied\n");
} // namespace
