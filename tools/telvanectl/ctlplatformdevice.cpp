// telvanectl platform device: shows and changes what the device information stand-in answers
// (its values live in the prefix's registry, so the service sees a change at its next log).
#include "platform/deviceinfo/deviceinfocontrol.h"
#include "tools/telvanectl/ctlcommand.h"

#include <stdio.h>

#include <algorithm>
#include <string>

namespace
{
int CtlDeviceShow()
{
    std::vector<std::wstring> rgFailing = DeviceInfoGetFailures();
    auto fails = [&](const std::wstring &wstrName) {
        return std::find(rgFailing.begin(), rgFailing.end(), wstrName) != rgFailing.end() ||
               std::find(rgFailing.begin(), rgFailing.end(), L"*") != rgFailing.end();
    };
    bool fBuildFails = fails(c_wszDeviceInfoBuild);
    for (const DEVICE_INFO_SETTING &setting : DeviceInfoGetSettings())
    {
        bool fItem = false;
        for (DWORD dwItem = 0; dwItem < 16; dwItem++)
        {
            fItem = fItem || setting.wstrName == DeviceInfoItemName(dwItem);
        }
        const wchar_t *wszState = (fItem ? fails(setting.wstrName) : fBuildFails) ? L"fails"
                                  : setting.fOverridden                           ? L"set"
                                                                                  : L"default";
        wprintf(L"%-32ls %-8ls %ls\n", setting.wstrName.c_str(), wszState,
                setting.wstrValue.c_str());
    }
    return c_iCtlExitOk;
}

int CtlPlatformDevice(int argc, wchar_t **argv)
{
    std::wstring wstrVerb = argc > 0 ? argv[0] : L"show";
    if (wstrVerb == L"show" && argc <= 1)
    {
        return CtlDeviceShow();
    }
    if (wstrVerb == L"set" && argc == 3)
    {
        if (!DeviceInfoSet(argv[1], argv[2]))
        {
            fprintf(stderr,
                    "telvanectl: %ls is not an item or build field, or %ls is not its "
                    "kind of value\n",
                    argv[1], argv[2]);
            return c_iCtlExitFailed;
        }
        return c_iCtlExitOk;
    }
    if ((wstrVerb == L"fail" || wstrVerb == L"ok") && argc == 2)
    {
        if (!DeviceInfoSetFailing(argv[1], wstrVerb == L"fail"))
        {
            fprintf(stderr, "telvanectl: %ls is not an item, \"Build\" or \"*\"\n", argv[1]);
            return c_iCtlExitFailed;
        }
        return c_iCtlExitOk;
    }
    if (wstrVerb == L"reset" && argc == 1)
    {
        DeviceInfoReset();
        return c_iCtlExitOk;
    }
    return CtlCommandUsage("platform device: unknown verb or wrong arguments");
}

const CtlCommand s_command(
    L"platform device", CtlPlatformDevice,
    "       telvanectl platform device [show]     what the device information stand-in answers\n"
    "       telvanectl platform device set ITEM VALUE   e.g. PhoneFriendlyName, Branch,\n"
    "                                                   BuildNumber (a number)\n"
    "       telvanectl platform device fail ITEM | ok ITEM   ITEM: an item, Build or *\n"
    "       telvanectl platform device reset      back to the defaults\n");
} // namespace
