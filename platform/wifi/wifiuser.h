// Stand-in for the phone's wireless user library: what the service asks of it (open a user
// handle, the connection state with its network, the adapter's information) and the controls
// that tests and "telvanectl platform wifi" use to set what it answers. The answers live in
// the registry, read at every call, so another process can change them while the service
// runs. Every function may be called from any thread; a handle is used by one at a time.
#pragma once

#include <windows.h>

// HKEY_LOCAL_MACHINE key of the stand-in's state: "State" (REG_DWORD, a WiFiConnectionState),
// "Address" (REG_SZ, the adapter's address text), "FailCall" (REG_SZ, the name of the call
// that fails) and "FailCode" (REG_DWORD, the HRESULT it fails with). No key: disconnected.
#define WIFI_STANDIN_KEY L"Software\\Telvane\\StandIns\\WiFi"

// The version OpenHandle understands.
const DWORD c_dwWiFiUserVersion = 1;
// What a failing call returns unless told otherwise: the adapter is not ready.
const HRESULT c_hrWiFiStandInFailure = static_cast<HRESULT>(0x80070015);

enum WiFiConnectionState : DWORD
{
    WiFiConnectionStateUnknown = 0,
    WiFiConnectionStateDisconnected = 1,
    WiFiConnectionStateAssociating = 2,
    WiFiConnectionStateAuthenticating = 3,
    WiFiConnectionStateObtainingAddress = 4,
    WiFiConnectionStateConnected = 5,
};

// The adapter block: 682 bytes, the address text first.
struct WiFiAdapterInfo
{
    WCHAR wszAddress[16];     // the adapter's address, terminated when shorter than 16
    WCHAR wszAdapterName[64]; // terminated
    BYTE rgbMacAddress[6];
    BYTE rgbReserved[516];
};
static_assert(sizeof(WiFiAdapterInfo) == 682, "the adapter block is 682 bytes");

// The network the adapter is connected to. The library creates it with new; its receiver
// destroys it with delete.
class WiFiNetwork
{
public:
    explicit WiFiNetwork(PCWSTR wszSsid);
    ~WiFiNetwork();
    WiFiNetwork(const WiFiNetwork &) = delete;
    WiFiNetwork &operator=(const WiFiNetwork &) = delete;

    PCWSTR Ssid() const { return m_wszSsid; }

private:
    WCHAR m_wszSsid[33];
};

// A user handle on the wireless service. Created by OpenHandle, destroyed by CloseHandle.
class WiFiUserHandle
{
public:
    static HRESULT OpenHandle(DWORD dwVersion, WiFiUserHandle **ppHandle);
    static void CloseHandle(WiFiUserHandle *pHandle);

    // On success *ppNetwork is the connected network, or null when there is none.
    HRESULT QueryConnectionState(WiFiConnectionState *pState, WiFiNetwork **ppNetwork);
    HRESULT QueryAdapterInfo(WiFiAdapterInfo *pInfo);

private:
    WiFiUserHandle() = default;
    ~WiFiUserHandle() = default;
};

// Controls. Connected and disconnected clear a failure set before; a failure keeps the
// state and makes one call ("OpenHandle", "QueryConnectionState", "QueryAdapterInfo") fail
// with hr until the state is set again. The address is at most 16 characters.
HRESULT WiFiStandInSetConnected(PCWSTR wszAddress);
HRESULT WiFiStandInSetDisconnected();
HRESULT WiFiStandInSetFailure(PCWSTR wszCall, HRESULT hr);
// Handles and networks of this process not yet closed or deleted.
LONG WiFiStandInLiveHandles();
LONG WiFiStandInLiveNetworks();
