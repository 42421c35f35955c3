#include "platform/deviceinfo/deviceinfocontrol.h"
#include "platform/deviceinfo/deviceinfodefaults.h"

#include <algorithm>
#include <cwchar>

const wchar_t c_wszDeviceInfoKey[] = DEVICE_INFO_KEY;
const wchar_t c_wszDeviceInfoBuild[] = DEVICE_INFO_FAIL_BUILD;

namespace
{
class CControlKey
{
public:
    explicit CControlKey(bool fWrite)
    {
        LONG lStatus =
            fWrite ? RegCreateKeyExW(HKEY_LOCAL_MACHINE, DEVICE_INFO_KEY, 0, nullptr, 0,
                                     KEY_READ | KEY_WRITE, nullptr, &m_hKey, nullptr)
                   : RegOpenKeyExW(HKEY_LOCAL_MACHINE, DEVICE_INFO_KEY, 0, KEY_READ, &m_hKey);
        if (lStatus != ERROR_SUCCESS)
        {
            m_hKey = nullptr;
        }
    }
    ~CControlKey()
    {
        if (m_hKey != nullptr)
        {
            RegCloseKey(m_hKey);
        }
    }
    CControlKey(const CControlKey &) = delete;
    CControlKey &operator=(const CControlKey &) = delete;
    HKEY Get() const { return m_hKey; }

private:
    HKEY m_hKey = nullptr;
};

bool QueryValue(HKEY hKey, const wchar_t *wszName, DWORD *pdwType, std::wstring *pwstrText,
                DWORD *pdwNumber)
{
    DWORD cb = 0;
    if (hKey == nullptr ||
        RegQueryValueExW(hKey, wszName, nullptr, pdwType, nullptr, &cb) != ERROR_SUCCESS)
    {
        return false;
    }
    std::wstring wstr(cb / sizeof(wchar_t) + 2, L'\0');
    if (RegQueryValueExW(hKey, wszName, nullptr, pdwType, reinterpret_cast<BYTE *>(&wstr[0]),
                         &cb) != ERROR_SUCCESS)
    {
        return false;
    }
    if (*pdwType == REG_DWORD && cb == sizeof(DWORD))
    {
        *pdwNumber = *reinterpret_cast<const DWORD *>(wstr.data());
    }
    else if (*pdwType == REG_SZ)
    {
        wstr.resize(wcslen(wstr.c_str()));
        *pwstrText = wstr;
    }
    else if (*pdwType == REG_MULTI_SZ)
    {
        wstr.resize(cb / sizeof(wchar_t));
        *pwstrText = wstr;
    }
    return true;
}

bool IsNumberName(const std::wstring &wstrName)
{
    for (const DEVICE_INFO_NUMBER_DEFAULT &number : c_rgDeviceInfoBuildNumbers)
    {
        if (wstrName == number.wszName)
        {
            return true;
        }
    }
    return false;
}

bool IsTextName(const std::wstring &wstrName)
{
    for (const DEVICE_INFO_TEXT_DEFAULT &text : c_rgDeviceInfoItems)
    {
        if (wstrName == text.wszName)
        {
            return true;
        }
    }
    for (const DEVICE_INFO_TEXT_DEFAULT &text : c_rgDeviceInfoBuildTexts)
    {
        if (wstrName == text.wszName)
        {
            return true;
        }
    }
    return false;
}

bool ParseNumber(const std::wstring &wstr, DWORD *pdw)
{
    if (wstr.empty() || wstr.size() > 10)
    {
        return false;
    }
    unsigned long long ull = 0;
    for (wchar_t wch : wstr)
    {
        if (wch < L'0' || wch > L'9')
        {
            return false;
        }
        ull = ull * 10 + static_cast<unsigned>(wch - L'0');
    }
    if (ull > 0xFFFFFFFFull)
    {
        return false;
    }
    *pdw = static_cast<DWORD>(ull);
    return true;
}
} // namespace

const wchar_t *DeviceInfoItemName(DWORD dwItem)
{
    return dwItem < 16 ? c_rgDeviceInfoItems[dwItem].wszName : nullptr;
}

std::vector<DEVICE_INFO_SETTING> DeviceInfoGetSettings()
{
    CControlKey key(false);
    std::vector<DEVICE_INFO_SETTING> rgSettings;
    auto addText = [&](const DEVICE_INFO_TEXT_DEFAULT &text) {
        DEVICE_INFO_SETTING setting{text.wszName, text.wszDefault, false, false};
        DWORD dwType = 0;
        std::wstring wstr;
        DWORD dw = 0;
        if (QueryValue(key.Get(), text.wszName, &dwType, &wstr, &dw) && dwType == REG_SZ)
        {
            setting.wstrValue = wstr;
            setting.fOverridden = true;
        }
        rgSettings.push_back(setting);
    };
    for (const DEVICE_INFO_TEXT_DEFAULT &text : c_rgDeviceInfoItems)
    {
        addText(text);
    }
    for (const DEVICE_INFO_TEXT_DEFAULT &text : c_rgDeviceInfoBuildTexts)
    {
        addText(text);
    }
    for (const DEVICE_INFO_NUMBER_DEFAULT &number : c_rgDeviceInfoBuildNumbers)
    {
        DEVICE_INFO_SETTING setting{number.wszName, std::to_wstring(number.dwDefault), true, false};
        DWORD dwType = 0;
        std::wstring wstr;
        DWORD dw = 0;
        if (QueryValue(key.Get(), number.wszName, &dwType, &wstr, &dw) && dwType == REG_DWORD)
        {
            setting.wstrValue = std::to_wstring(dw);
            setting.fOverridden = true;
        }
        rgSettings.push_back(setting);
    }
    return rgSettings;
}

std::vector<std::wstring> DeviceInfoGetFailures()
{
    CControlKey key(false);
    std::vector<std::wstring> rgNames;
    DWORD dwType = 0;
    std::wstring wstrList;
    DWORD dw = 0;
    if (!QueryValue(key.Get(), DEVICE_INFO_FAIL_VALUE, &dwType, &wstrList, &dw) ||
        dwType != REG_MULTI_SZ)
    {
        return rgNames;
    }
    size_t pos = 0;
    while (pos < wstrList.size())
    {
        size_t end = wstrList.find(L'\0', pos);
        if (end == std::wstring::npos)
        {
            end = wstrList.size();
        }
        if (end > pos)
        {
            rgNames.push_back(wstrList.substr(pos, end - pos));
        }
        pos = end + 1;
    }
    return rgNames;
}

bool DeviceInfoSet(const std::wstring &wstrName, const std::wstring &wstrValue)
{
    if (IsNumberName(wstrName))
    {
        DWORD dw = 0;
        if (!ParseNumber(wstrValue, &dw))
        {
            return false;
        }
        CControlKey key(true);
        return key.Get() != nullptr &&
               RegSetValueExW(key.Get(), wstrName.c_str(), 0, REG_DWORD,
                              reinterpret_cast<const BYTE *>(&dw), sizeof(dw)) == ERROR_SUCCESS;
    }
    if (!IsTextName(wstrName))
    {
        return false;
    }
    CControlKey key(true);
    return key.Get() != nullptr &&
           RegSetValueExW(key.Get(), wstrName.c_str(), 0, REG_SZ,
                          reinterpret_cast<const BYTE *>(wstrValue.c_str()),
                          static_cast<DWORD>((wstrValue.size() + 1) * sizeof(wchar_t))) ==
               ERROR_SUCCESS;
}

bool DeviceInfoSetFailing(const std::wstring &wstrName, bool fFail)
{
    bool fItem = false;
    for (const DEVICE_INFO_TEXT_DEFAULT &text : c_rgDeviceInfoItems)
    {
        fItem = fItem || wstrName == text.wszName;
    }
    if (!fItem && wstrName != DEVICE_INFO_FAIL_BUILD && wstrName != DEVICE_INFO_FAIL_ALL)
    {
        return false;
    }
    std::vector<std::wstring> rgNames = DeviceInfoGetFailures();
    auto it = std::find(rgNames.begin(), rgNames.end(), wstrName);
    if (fFail && it == rgNames.end())
    {
        rgNames.push_back(wstrName);
    }
    else if (!fFail && it != rgNames.end())
    {
        rgNames.erase(it);
    }
    std::wstring wstrList;
    for (const std::wstring &wstr : rgNames)
    {
        wstrList += wstr;
        wstrList += L'\0';
    }
    wstrList += L'\0';
    CControlKey key(true);
    return key.Get() != nullptr &&
           RegSetValueExW(key.Get(), DEVICE_INFO_FAIL_VALUE, 0, REG_MULTI_SZ,
                          reinterpret_cast<const BYTE *>(wstrList.data()),
                          static_cast<DWORD>(wstrList.size() * sizeof(wchar_t))) == ERROR_SUCCESS;
}

void DeviceInfoReset()
{
    RegDeleteKeyExW(HKEY_LOCAL_MACHINE, DEVICE_INFO_KEY, 0, 0);
}
