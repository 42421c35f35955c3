#include "platform/statenotify/statestore.h"

#include "inc/handleholder.h"

#include <string.h>

namespace
{
const wchar_t c_wszStoreKey[] = L"SOFTWARE\\Telvane\\Platform\\StateNotification";
const wchar_t c_wszDataValue[] = L"Data";
const wchar_t c_wszMutexPrefix[] = L"Global\\TelvaneStateNotification-";
// A publisher that holds the mutex does one read and one write; anything longer is a hung
// process, and the caller hears so instead of hanging with it.
const DWORD c_dwMutexWaitMs = 10000;

const size_t c_cchHexName = 16;

// Sixteen lower-case hex digits, most significant first: the key and mutex names of a state.
void StateStoreFormatName(WNF_STATE_NAME stateName, wchar_t *wszHex)
{
    const wchar_t c_wszDigits[] = L"0123456789abcdef";
    for (size_t i = 0; i < c_cchHexName; i++)
    {
        wszHex[c_cchHexName - 1 - i] = c_wszDigits[(stateName >> (4 * i)) & 0xF];
    }
    wszHex[c_cchHexName] = L'\0';
}
} // namespace

LONG StateStoreOpenKey(WNF_STATE_NAME stateName, REGSAM samDesired, bool fCreate, HKEY *phKey)
{
    *phKey = nullptr;
    wchar_t wszHex[c_cchHexName + 1];
    StateStoreFormatName(stateName, wszHex);
    if (!fCreate)
    {
        wchar_t wszPath[ARRAYSIZE(c_wszStoreKey) + 1 + c_cchHexName];
        wcscpy(wszPath, c_wszStoreKey);
        wcscat(wszPath, L"\\");
        wcscat(wszPath, wszHex);
        return RegOpenKeyExW(HKEY_LOCAL_MACHINE, wszPath, 0, samDesired, phKey);
    }
    // The parents are ordinary keys: a volatile parent would refuse every non-volatile key
    // anybody else later creates beside or beneath it.
    CRegKeyHandle hStore;
    LONG lError =
        RegCreateKeyExW(HKEY_LOCAL_MACHINE, c_wszStoreKey, 0, nullptr, REG_OPTION_NON_VOLATILE,
                        KEY_CREATE_SUB_KEY, nullptr, hStore.Receive(), nullptr);
    if (lError != ERROR_SUCCESS)
    {
        return lError;
    }
    return RegCreateKeyExW(hStore.Get(), wszHex, 0, nullptr, REG_OPTION_VOLATILE, samDesired,
                           nullptr, phKey, nullptr);
}

LONG StateStoreRead(HKEY hKey, WNF_CHANGE_STAMP *pStamp, BYTE *pbData, ULONG *pcbData)
{
    *pStamp = 0;
    *pcbData = 0;
    BYTE rgbValue[sizeof(WNF_CHANGE_STAMP) + WNF_STATE_MAX_DATA_SIZE];
    DWORD dwType = REG_NONE;
    DWORD cbValue = sizeof(rgbValue);
    LONG lError = RegQueryValueExW(hKey, c_wszDataValue, nullptr, &dwType, rgbValue, &cbValue);
    if (lError == ERROR_FILE_NOT_FOUND)
    {
        return ERROR_SUCCESS;
    }
    if (lError == ERROR_MORE_DATA)
    {
        return ERROR_INVALID_DATA;
    }
    if (lError != ERROR_SUCCESS)
    {
        return lError;
    }
    if (dwType != REG_BINARY || cbValue < sizeof(WNF_CHANGE_STAMP))
    {
        return ERROR_INVALID_DATA;
    }
    WNF_CHANGE_STAMP stamp = 0;
    memcpy(&stamp, rgbValue, sizeof(stamp));
    if (stamp == 0)
    {
        return ERROR_INVALID_DATA;
    }
    *pStamp = stamp;
    *pcbData = cbValue - sizeof(WNF_CHANGE_STAMP);
    memcpy(pbData, rgbValue + sizeof(WNF_CHANGE_STAMP), *pcbData);
    return ERROR_SUCCESS;
}

LONG StateStoreWrite(WNF_STATE_NAME stateName, const void *pvData, ULONG cbData,
                     WNF_CHANGE_STAMP *pStamp)
{
    if (cbData > WNF_STATE_MAX_DATA_SIZE || (cbData > 0 && pvData == nullptr))
    {
        return ERROR_INVALID_PARAMETER;
    }
    wchar_t wszMutex[ARRAYSIZE(c_wszMutexPrefix) + c_cchHexName];
    wcscpy(wszMutex, c_wszMutexPrefix);
    StateStoreFormatName(stateName, wszMutex + ARRAYSIZE(c_wszMutexPrefix) - 1);
    CKernelHandle hMutex(CreateMutexW(nullptr, FALSE, wszMutex));
    if (!hMutex)
    {
        return static_cast<LONG>(GetLastError());
    }
    // An abandoned mutex still guards a consistent value: the one write is atomic.
    DWORD dwWait = WaitForSingleObject(hMutex.Get(), c_dwMutexWaitMs);
    if (dwWait != WAIT_OBJECT_0 && dwWait != WAIT_ABANDONED)
    {
        return dwWait == WAIT_TIMEOUT ? ERROR_TIMEOUT : static_cast<LONG>(GetLastError());
    }

    CRegKeyHandle hKey;
    LONG lError =
        StateStoreOpenKey(stateName, KEY_QUERY_VALUE | KEY_SET_VALUE, true, hKey.Receive());
    WNF_CHANGE_STAMP stamp = 0;
    if (lError == ERROR_SUCCESS)
    {
        BYTE rgbOld[WNF_STATE_MAX_DATA_SIZE];
        ULONG cbOld = 0;
        // A damaged value is overwritten: publishing is how it gets repaired.
        if (StateStoreRead(hKey.Get(), &stamp, rgbOld, &cbOld) != ERROR_SUCCESS)
        {
            stamp = 0;
        }
        stamp++;
        if (stamp == 0)
        {
            stamp = 1; // 0 means never published
        }
        BYTE rgbValue[sizeof(WNF_CHANGE_STAMP) + WNF_STATE_MAX_DATA_SIZE];
        memcpy(rgbValue, &stamp, sizeof(stamp));
        if (cbData > 0)
        {
            memcpy(rgbValue + sizeof(stamp), pvData, cbData);
        }
        lError = RegSetValueExW(hKey.Get(), c_wszDataValue, 0, REG_BINARY, rgbValue,
                                static_cast<DWORD>(sizeof(stamp) + cbData));
    }
    ReleaseMutex(hMutex.Get());
    if (lError == ERROR_SUCCESS && pStamp != nullptr)
    {
        *pStamp = stamp;
    }
    return lError;
}

NTSTATUS StateStoreStatusFromError(LONG lError)
{
    if (lError == ERROR_SUCCESS)
    {
        return STATUS_SUCCESS;
    }
    return static_cast<NTSTATUS>(0xC0070000u | (static_cast<ULONG>(lError) & 0xFFFFu));
}
