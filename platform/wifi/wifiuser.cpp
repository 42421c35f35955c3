#include "platform/wifi/wifiuser.h"

#include "inc/handleholder.h"

#include <new>
#include <string.h>
#include <wchar.h>

namespace
{
volatile LONG s_cLiveHandles = 0;
volatile LONG s_cLiveNetworks = 0;

const WCHAR c_wszStandInSsid[] = L"TelvaneTestNet";
const WCHAR c_wszStandInAdapter[] = L"Telvane stand-in wireless adapter";

struct WIFI_STANDIN_STATE
{
    DWORD dwState = WiFiConnectionStateDisconnected;
    WCHAR wszAddress[17] = L"";
    WCHAR wszFailCall[64] = L"";
    DWORD dwFailCode = static_cast<DWORD>(c_hrWiFiStandInFailure);
};

void WiFiStandInRead(WIFI_STANDIN_STATE *pState)
{
    CRegKeyHandle hKey;
    if (RegOpenKeyExW(HKEY_LOCAL_MACHINE, WIFI_STANDIN_KEY, 0, KEY_QUERY_VALUE, hKey.Receive()) !=
        ERROR_SUCCESS)
    {
        return;
    }
    DWORD cb = sizeof(pState->dwState);
    RegGetValueW(hKey.Get(), nullptr, L"State", RRF_RT_REG_DWORD, nullptr, &pState->dwState, &cb);
    cb = sizeof(pState->wszAddress);
    if (RegGetValueW(hKey.Get(), nullptr, L"Address", RRF_RT_REG_SZ, nullptr, pState->wszAddress,
                     &cb) != ERROR_SUCCESS)
    {
        pState->wszAddress[0] = L'\0';
    }
    cb = sizeof(pState->wszFailCall);
    if (RegGetValueW(hKey.Get(), nullptr, L"FailCall", RRF_RT_REG_SZ, nullptr, pState->wszFailCall,
                     &cb) != ERROR_SUCCESS)
    {
        pState->wszFailCall[0] = L'\0';
    }
    cb = sizeof(pState->dwFailCode);
    RegGetValueW(hKey.Get(), nullptr, L"FailCode", RRF_RT_REG_DWORD, nullptr, &pState->dwFailCode,
                 &cb);
}

// The failure set for this call, or S_OK.
HRESULT WiFiStandInFailureOf(const WIFI_STANDIN_STATE &state, PCWSTR wszCall)
{
    if (wcscmp(state.wszFailCall, wszCall) != 0)
    {
        return S_OK;
    }
    HRESULT hr = static_cast<HRESULT>(state.dwFailCode);
    return hr != S_OK ? hr : c_hrWiFiStandInFailure;
}

HRESULT WiFiStandInWrite(DWORD dwState, PCWSTR wszAddress, PCWSTR wszFailCall, HRESULT hrFail)
{
    CRegKeyHandle hKey;
    LSTATUS ls = RegCreateKeyExW(HKEY_LOCAL_MACHINE, WIFI_STANDIN_KEY, 0, nullptr, 0, KEY_SET_VALUE,
                                 nullptr, hKey.Receive(), nullptr);
    if (ls != ERROR_SUCCESS)
    {
        return HRESULT_FROM_WIN32(ls);
    }
    DWORD dwFail = static_cast<DWORD>(hrFail);
    ls = RegSetValueExW(hKey.Get(), L"State", 0, REG_DWORD,
                        reinterpret_cast<const BYTE *>(&dwState), sizeof(dwState));
    if (ls == ERROR_SUCCESS)
    {
        ls = RegSetValueExW(hKey.Get(), L"Address", 0, REG_SZ,
                            reinterpret_cast<const BYTE *>(wszAddress),
                            static_cast<DWORD>((wcslen(wszAddress) + 1) * sizeof(WCHAR)));
    }
    if (ls == ERROR_SUCCESS)
    {
        ls = RegSetValueExW(hKey.Get(), L"FailCall", 0, REG_SZ,
                            reinterpret_cast<const BYTE *>(wszFailCall),
                            static_cast<DWORD>((wcslen(wszFailCall) + 1) * sizeof(WCHAR)));
    }
    if (ls == ERROR_SUCCESS)
    {
        ls = RegSetValueExW(hKey.Get(), L"FailCode", 0, REG_DWORD,
                            reinterpret_cast<const BYTE *>(&dwFail), sizeof(dwFail));
    }
    return HRESULT_FROM_WIN32(ls);
}
} // namespace

WiFiNetwork::WiFiNetwork(PCWSTR wszSsid)
{
    wcsncpy_s(m_wszSsid, wszSsid, _TRUNCATE);
    InterlockedIncrement(&s_cLiveNetworks);
}

WiFiNetwork::~WiFiNetwork()
{
    InterlockedDecrement(&s_cLiveNetworks);
}

HRESULT WiFiUserHandle::OpenHandle(DWORD dwVersion, WiFiUserHandle **ppHandle)
{
    if (ppHandle == nullptr)
    {
        return E_POINTER;
    }
    *ppHandle = nullptr;
    if (dwVersion != c_dwWiFiUserVersion)
    {
        return E_INVALIDARG;
    }
    WIFI_STANDIN_STATE state;
    WiFiStandInRead(&state);
    HRESULT hr = WiFiStandInFailureOf(state, L"OpenHandle");
    if (FAILED(hr))
    {
        return hr;
    }
    *ppHandle = new (std::nothrow) WiFiUserHandle();
    if (*ppHandle == nullptr)
    {
        return E_OUTOFMEMORY;
    }
    InterlockedIncrement(&s_cLiveHandles);
    return S_OK;
}

void WiFiUserHandle::CloseHandle(WiFiUserHandle *pHandle)
{
    if (pHandle != nullptr)
    {
        delete pHandle;
        InterlockedDecrement(&s_cLiveHandles);
    }
}

HRESULT WiFiUserHandle::QueryConnectionState(WiFiConnectionState *pState, WiFiNetwork **ppNetwork)
{
    if (pState == nullptr || ppNetwork == nullptr)
    {
        return E_POINTER;
    }
    *ppNetwork = nullptr;
    WIFI_STANDIN_STATE state;
    WiFiStandInRead(&state);
    HRESULT hr = WiFiStandInFailureOf(state, L"QueryConnectionState");
    if (FAILED(hr))
    {
        return hr;
    }
    *pState = static_cast<WiFiConnectionState>(state.dwState);
    if (state.dwState == WiFiConnectionStateConnected)
    {
        *ppNetwork = new (std::nothrow) WiFiNetwork(c_wszStandInSsid);
        if (*ppNetwork == nullptr)
        {
            return E_OUTOFMEMORY;
        }
    }
    return S_OK;
}

HRESULT WiFiUserHandle::QueryAdapterInfo(WiFiAdapterInfo *pInfo)
{
    if (pInfo == nullptr)
    {
        return E_POINTER;
    }
    WIFI_STANDIN_STATE state;
    WiFiStandInRead(&state);
    HRESULT hr = WiFiStandInFailureOf(state, L"QueryAdapterInfo");
    if (FAILED(hr))
    {
        return hr;
    }
    memset(pInfo, 0, sizeof(*pInfo));
    // Sixteen characters fill the field without a terminator, as on the phone.
    memcpy(pInfo->wszAddress, state.wszAddress,
           wcsnlen(state.wszAddress, ARRAYSIZE(pInfo->wszAddress)) * sizeof(WCHAR));
    wcsncpy_s(pInfo->wszAdapterName, c_wszStandInAdapter, _TRUNCATE);
    const BYTE rgbMac[6] = {0x02, 0x54, 0x45, 0x4C, 0x56, 0x4E}; // locally administered
    memcpy(pInfo->rgbMacAddress, rgbMac, sizeof(rgbMac));
    return S_OK;
}

HRESULT WiFiStandInSetConnected(PCWSTR wszAddress)
{
    if (wszAddress == nullptr || wszAddress[0] == L'\0' || wcslen(wszAddress) > 16)
    {
        return E_INVALIDARG;
    }
    return WiFiStandInWrite(WiFiConnectionStateConnected, wszAddress, L"", S_OK);
}

HRESULT WiFiStandInSetDisconnected()
{
    return WiFiStandInWrite(WiFiConnectionStateDisconnected, L"", L"", S_OK);
}

HRESULT WiFiStandInSetFailure(PCWSTR wszCall, HRESULT hr)
{
    if (wszCall == nullptr ||
        (wcscmp(wszCall, L"OpenHandle") != 0 && wcscmp(wszCall, L"QueryConnectionState") != 0 &&
         wcscmp(wszCall, L"QueryAdapterInfo") != 0))
    {
        return E_INVALIDARG;
    }
    WIFI_STANDIN_STATE state;
    WiFiStandInRead(&state);
    return WiFiStandInWrite(state.dwState, state.wszAddress, wszCall,
                            hr != S_OK ? hr : c_hrWiFiStandInFailure);
}

LONG WiFiStandInLiveHandles()
{
    return InterlockedCompareExchange(&s_cLiveHandles, 0, 0);
}

LONG WiFiStandInLiveNetworks()
{
    return InterlockedCompareExchange(&s_cLiveNetworks, 0, 0);
}
