// "telvanectl platform wifi": what the wireless user library stand-in answers the service.
#include "platform/wifi/wifiuser.h"
#include "tools/telvanectl/ctlcommand.h"

#include <stdio.h>
#include <wchar.h>

namespace
{
int CtlWiFiFailed(const char *szStep, HRESULT hr)
{
    fprintf(stderr, "telvanectl: %s failed: 0x%08lx\n", szStep, static_cast<unsigned long>(hr));
    return c_iCtlExitFailed;
}

// An HRESULT in hex ("0x80070015" or "80070015").
bool CtlWiFiParseCode(const wchar_t *wsz, HRESULT *phr)
{
    wchar_t *pwchEnd = nullptr;
    unsigned long ul = wcstoul(wsz, &pwchEnd, 16);
    if (wsz[0] == L'\0' || wsz[0] == L'-' || *pwchEnd != L'\0' || ul == 0)
    {
        return false;
    }
    *phr = static_cast<HRESULT>(ul);
    return true;
}

int CtlPlatformWiFi(int argc, wchar_t **argv)
{
    if (argc == 2 && wcscmp(argv[0], L"connected") == 0)
    {
        HRESULT hr = WiFiStandInSetConnected(argv[1]);
        if (hr == E_INVALIDARG)
        {
            return CtlCommandUsage("the adapter address is 1 to 16 characters");
        }
        if (FAILED(hr))
        {
            return CtlWiFiFailed("setting the Wi-Fi state", hr);
        }
        printf("Wi-Fi connected, adapter address %ls\n", argv[1]);
        return c_iCtlExitOk;
    }
    if (argc == 1 && wcscmp(argv[0], L"disconnected") == 0)
    {
        HRESULT hr = WiFiStandInSetDisconnected();
        if (FAILED(hr))
        {
            return CtlWiFiFailed("setting the Wi-Fi state", hr);
        }
        printf("Wi-Fi disconnected\n");
        return c_iCtlExitOk;
    }
    if ((argc == 2 || argc == 3) && wcscmp(argv[0], L"fail") == 0)
    {
        HRESULT hrFail = c_hrWiFiStandInFailure;
        if (argc == 3 && !CtlWiFiParseCode(argv[2], &hrFail))
        {
            return CtlCommandUsage("CODE is a non-zero HRESULT in hexadecimal");
        }
        HRESULT hr = WiFiStandInSetFailure(argv[1], hrFail);
        if (hr == E_INVALIDARG)
        {
            return CtlCommandUsage("CALL is OpenHandle, QueryConnectionState or QueryAdapterInfo");
        }
        if (FAILED(hr))
        {
            return CtlWiFiFailed("setting the Wi-Fi failure", hr);
        }
        printf("Wi-Fi %ls fails with 0x%08lx\n", argv[1], static_cast<unsigned long>(hrFail));
        return c_iCtlExitOk;
    }
    return CtlCommandUsage("platform wifi needs connected ADDRESS, disconnected or fail CALL");
}

const CtlCommand s_platformWiFi(
    L"platform wifi", CtlPlatformWiFi,
    "       telvanectl platform wifi connected ADDRESS | disconnected | fail CALL [CODE]\n"
    "           what the Wi-Fi stand-in answers: connected with the adapter address\n"
    "           ADDRESS, disconnected, or CALL (OpenHandle, QueryConnectionState,\n"
    "           QueryAdapterInfo) failing with CODE (hex HRESULT, default 0x80070015)\n");
} // namespace
