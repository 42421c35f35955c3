#include "platform/deviceinfo/deviceinfo.h"
#include "platform/deviceinfo/deviceinfodefaults.h"

#include <cwchar>
#include <string>

namespace
{
// Open for each call: another process (telvanectl, a test) may change the values at any
// time, and the next call must see it.
class CDeviceInfoKey
{
public:
    CDeviceInfoKey()
    {
        if (RegOpenKeyExW(HKEY_LOCAL_MACHINE, DEVICE_INFO_KEY, 0, KEY_READ, &m_hKey) !=
            ERROR_SUCCESS)
        {
            m_hKey = nullptr;
        }
    }
    ~CDeviceInfoKey()
    {
        if (m_hKey != nullptr)
        {
            RegCloseKey(m_hKey);
        }
    }
    CDeviceInfoKey(const CDeviceInfoKey &) = delete;
    CDeviceInfoKey &operator=(const CDeviceInfoKey &) = delete;

    // True when the failure list names wszName or "*".
    bool Fails(const wchar_t *wszName) const
    {
        if (m_hKey == nullptr)
        {
            return false;
        }
        DWORD cbList = 0;
        if (RegQueryValueExW(m_hKey, DEVICE_INFO_FAIL_VALUE, nullptr, nullptr, nullptr, &cbList) !=
                ERROR_SUCCESS ||
            cbList == 0)
        {
            return false;
        }
        std::wstring wstrList(cbList / sizeof(wchar_t) + 2, L'\0');
        if (RegQueryValueExW(m_hKey, DEVICE_INFO_FAIL_VALUE, nullptr, nullptr,
                             reinterpret_cast<BYTE *>(&wstrList[0]), &cbList) != ERROR_SUCCESS)
        {
            return false;
        }
        for (const wchar_t *pwsz = wstrList.c_str(); *pwsz != L'\0'; pwsz += wcslen(pwsz) + 1)
        {
            if (wcscmp(pwsz, wszName) == 0 || wcscmp(pwsz, DEVICE_INFO_FAIL_ALL) == 0)
            {
                return true;
            }
        }
        return false;
    }

    // The override text, or the default when there is none.
    std::wstring Text(const wchar_t *wszName, const wchar_t *wszDefault) const
    {
        DWORD dwType = 0;
        DWORD cb = 0;
        if (m_hKey == nullptr ||
            RegQueryValueExW(m_hKey, wszName, nullptr, &dwType, nullptr, &cb) != ERROR_SUCCESS ||
            dwType != REG_SZ)
        {
            return wszDefault;
        }
        std::wstring wstr(cb / sizeof(wchar_t) + 1, L'\0');
        if (RegQueryValueExW(m_hKey, wszName, nullptr, nullptr, reinterpret_cast<BYTE *>(&wstr[0]),
                             &cb) != ERROR_SUCCESS)
        {
            return wszDefault;
        }
        wstr.resize(wcslen(wstr.c_str()));
        return wstr;
    }

    DWORD Number(const wchar_t *wszName, DWORD dwDefault) const
    {
        DWORD dwType = 0;
        DWORD dwValue = 0;
        DWORD cb = sizeof(dwValue);
        if (m_hKey == nullptr ||
            RegQueryValueExW(m_hKey, wszName, nullptr, &dwType, reinterpret_cast<BYTE *>(&dwValue),
                             &cb) != ERROR_SUCCESS ||
            dwType != REG_DWORD || cb != sizeof(dwValue))
        {
            return dwDefault;
        }
        return dwValue;
    }

private:
    HKEY m_hKey = nullptr;
};

// Copies wstr into a fixed field with its terminator, cut to fit as the platform's own
// record would be.
template <size_t N>
void CopyField(WCHAR (&wszField)[N], const std::wstring &wstr)
{
    size_t cch = wstr.size() < N - 1 ? wstr.size() : N - 1;
    wmemcpy(wszField, wstr.c_str(), cch);
    wszField[cch] = L'\0';
}
} // namespace

extern "C" HRESULT WINAPI GetPhoneBuildInfo(PHONE_BUILD_INFO *pBuildInfo)
{
    if (pBuildInfo == nullptr)
    {
        return E_POINTER;
    }
    CDeviceInfoKey key;
    if (key.Fails(DEVICE_INFO_FAIL_BUILD))
    {
        return HRESULT_FROM_WIN32(ERROR_NOT_FOUND);
    }
    CopyField(pBuildInfo->wszBranch, key.Text(c_rgDeviceInfoBuildTexts[0].wszName,
                                              c_rgDeviceInfoBuildTexts[0].wszDefault));
    CopyField(pBuildInfo->wszTimeStamp, key.Text(c_rgDeviceInfoBuildTexts[1].wszName,
                                                 c_rgDeviceInfoBuildTexts[1].wszDefault));
    DWORD rgdw[5];
    for (size_t i = 0; i < 5; i++)
    {
        rgdw[i] = key.Number(c_rgDeviceInfoBuildNumbers[i].wszName,
                             c_rgDeviceInfoBuildNumbers[i].dwDefault);
    }
    pBuildInfo->dwParentBranchBuild = rgdw[0];
    pBuildInfo->dwMajorVersion = rgdw[1];
    pBuildInfo->dwMinorVersion = rgdw[2];
    pBuildInfo->dwQfeLevel = rgdw[3];
    pBuildInfo->dwBuildNumber = rgdw[4];
    return S_OK;
}

extern "C" BOOL WINAPI QueryPhoneInformation(DWORD dwItem, PWSTR wszBuffer, DWORD cchBuffer,
                                             DWORD dwFlags)
{
    if (wszBuffer == nullptr || cchBuffer == 0 || dwFlags != 0 ||
        dwItem >= c_cPhoneInformationItems)
    {
        SetLastError(ERROR_INVALID_PARAMETER);
        return FALSE;
    }
    CDeviceInfoKey key;
    const DEVICE_INFO_TEXT_DEFAULT &item = c_rgDeviceInfoItems[dwItem];
    if (key.Fails(item.wszName))
    {
        SetLastError(ERROR_NOT_FOUND);
        return FALSE;
    }
    std::wstring wstr = key.Text(item.wszName, item.wszDefault);
    if (wstr.size() >= cchBuffer)
    {
        SetLastError(ERROR_INSUFFICIENT_BUFFER);
        return FALSE;
    }
    wmemcpy(wszBuffer, wstr.c_str(), wstr.size() + 1);
    return TRUE;
}
