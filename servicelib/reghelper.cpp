#include "servicelib/reghelper.h"
#include "servicelib/diagnostics.h"

namespace
{
const REGSAM c_samRead = 0x20019;      // KEY_READ
const REGSAM c_samReadWrite = 0x2001F; // KEY_READ | KEY_WRITE
const size_t c_cchInitialValue = 260;

bool RegHelperIsRoot(const wchar_t *wszPath)
{
    return wszPath == nullptr || wszPath[0] == L'\0';
}

// Closes through RegHelperCloseKey so that a failing close is reported like any other.
class CRegKeyHolder
{
public:
    explicit CRegKeyHolder(HKEY hKey)
        : m_hKey(hKey)
    {
    }
    ~CRegKeyHolder() { RegHelperCloseKey(m_hKey); }
    CRegKeyHolder(const CRegKeyHolder &) = delete;
    CRegKeyHolder &operator=(const CRegKeyHolder &) = delete;
    HKEY Get() const { return m_hKey; }

private:
    HKEY m_hKey;
};

std::wstring RegHelperExpand(const std::wstring &wstrText)
{
    std::wstring wstrExpanded(wstrText.size() + 64, L'\0');
    for (;;)
    {
        DWORD cchNeeded = ExpandEnvironmentStringsW(wstrText.c_str(), &wstrExpanded[0],
                                                    static_cast<DWORD>(wstrExpanded.size()));
        if (cchNeeded == 0)
        {
            return std::wstring();
        }
        if (cchNeeded <= wstrExpanded.size())
        {
            wstrExpanded.resize(cchNeeded);
            return wstrExpanded;
        }
        wstrExpanded.resize(cchNeeded);
    }
}
} // namespace

HKEY RegHelperOpenKey(const wchar_t *wszPath, bool fWrite)
{
    if (RegHelperIsRoot(wszPath))
    {
        return HKEY_LOCAL_MACHINE;
    }
    HKEY hKey = nullptr;
    LONG lStatus =
        RegOpenKeyExW(HKEY_LOCAL_MACHINE, wszPath, 0, fWrite ? c_samReadWrite : c_samRead, &hKey);
    if (lStatus == ERROR_SUCCESS)
    {
        return hKey;
    }
    if (lStatus != ERROR_FILE_NOT_FOUND)
    {
        FATAL_ERROR(L"RegHelperOpenKey", L"RegOpenKeyEx", lStatus);
    }
    return nullptr;
}

HKEY RegHelperCreateKey(const wchar_t *wszPath)
{
    if (RegHelperIsRoot(wszPath))
    {
        return HKEY_LOCAL_MACHINE;
    }
    HKEY hKey = nullptr;
    LONG lStatus = RegCreateKeyExW(HKEY_LOCAL_MACHINE, wszPath, 0, nullptr, 0, c_samReadWrite,
                                   nullptr, &hKey, nullptr);
    if (lStatus != ERROR_SUCCESS)
    {
        FATAL_ERROR(L"RegHelperCreateKey", L"RegCreateKeyEx", lStatus);
        return nullptr;
    }
    return hKey;
}

void RegHelperCloseKey(HKEY hKey)
{
    if (hKey == nullptr || hKey == HKEY_LOCAL_MACHINE)
    {
        return;
    }
    LONG lStatus = RegCloseKey(hKey);
    if (lStatus != ERROR_SUCCESS)
    {
        FATAL_ERROR(L"RegHelperCloseKey", L"RegCloseKey", lStatus);
    }
}

void RegHelperDeleteKey(const wchar_t *wszFirst, const wchar_t *wszSecond)
{
    std::wstring wstrPath;
    if (wszFirst != nullptr)
    {
        wstrPath += wszFirst;
    }
    if (wszSecond != nullptr)
    {
        wstrPath += wszSecond;
    }
    LONG lStatus = RegDeleteKeyExW(HKEY_LOCAL_MACHINE, wstrPath.c_str(), 0, 0);
    if (lStatus != ERROR_SUCCESS && lStatus != ERROR_FILE_NOT_FOUND)
    {
        FATAL_ERROR(L"RegHelperDeleteKey", L"RegDeleteKeyEx", lStatus);
    }
}

void RegHelperDeleteValue(const wchar_t *wszPath, const wchar_t *wszValue)
{
    CRegKeyHolder key(RegHelperOpenKey(wszPath, true));
    if (key.Get() == nullptr)
    {
        return;
    }
    LONG lStatus = RegDeleteValueW(key.Get(), wszValue);
    if (lStatus != ERROR_SUCCESS && lStatus != ERROR_FILE_NOT_FOUND)
    {
        FATAL_ERROR(L"RegHelperDeleteValue", L"RegDeleteValue", lStatus);
    }
}

std::wstring RegHelperGetString(const wchar_t *wszPath, const wchar_t *wszValue)
{
    CRegKeyHolder key(RegHelperOpenKey(wszPath, false));
    if (key.Get() == nullptr)
    {
        return std::wstring();
    }
    std::wstring wstrText(c_cchInitialValue, L'\0');
    DWORD dwType = REG_NONE;
    for (;;)
    {
        DWORD cb = static_cast<DWORD>(wstrText.size() * sizeof(wchar_t));
        LONG lStatus = RegQueryValueExW(key.Get(), wszValue, nullptr, &dwType,
                                        reinterpret_cast<BYTE *>(&wstrText[0]), &cb);
        if (lStatus == ERROR_SUCCESS)
        {
            wstrText.resize(cb / sizeof(wchar_t));
            break;
        }
        if (lStatus == ERROR_FILE_NOT_FOUND)
        {
            return std::wstring();
        }
        if (lStatus == ERROR_MORE_DATA)
        {
            // Round up: a value of an odd byte count would otherwise never fit.
            wstrText.resize((cb + sizeof(wchar_t) - 1) / sizeof(wchar_t));
            continue;
        }
        FATAL_ERROR(L"RegHelperGetString", L"RegQueryValueEx", lStatus);
    }
    if (dwType == REG_EXPAND_SZ)
    {
        wstrText = RegHelperExpand(wstrText);
    }
    size_t cch = wstrText.size();
    while (cch > 0 && wstrText[cch - 1] == L'\0')
    {
        cch--;
    }
    wstrText.resize(cch);
    return wstrText;
}

std::vector<std::wstring> RegHelperGetMultiString(const wchar_t *wszPath, const wchar_t *wszValue)
{
    std::wstring wstrJoined = RegHelperGetString(wszPath, wszValue);
    std::vector<std::wstring> rgStrings;
    size_t ichStart = 0;
    while (ichStart < wstrJoined.size())
    {
        size_t ichEnd = wstrJoined.find(L'\0', ichStart);
        if (ichEnd == std::wstring::npos)
        {
            ichEnd = wstrJoined.size();
        }
        // An empty string ends a multi-string for every other reader; never list one.
        if (ichEnd > ichStart)
        {
            rgStrings.push_back(wstrJoined.substr(ichStart, ichEnd - ichStart));
        }
        ichStart = ichEnd + 1;
    }
    return rgStrings;
}

void RegHelperSetString(const wchar_t *wszPath, const wchar_t *wszValue,
                        const std::wstring &wstrText, DWORD dwType)
{
    CRegKeyHolder key(RegHelperCreateKey(wszPath));
    if (key.Get() == nullptr)
    {
        return;
    }
    DWORD cb = static_cast<DWORD>((wstrText.size() + 1) * sizeof(wchar_t));
    LONG lStatus = RegSetValueExW(key.Get(), wszValue, 0, dwType,
                                  reinterpret_cast<const BYTE *>(wstrText.c_str()), cb);
    if (lStatus != ERROR_SUCCESS)
    {
        FATAL_ERROR(L"RegHelperSetString", L"RegSetValueEx", lStatus);
    }
}

void RegHelperSetMultiString(const wchar_t *wszPath, const wchar_t *wszValue,
                             const std::vector<std::wstring> &rgStrings)
{
    std::wstring wstrJoined;
    for (const std::wstring &wstr : rgStrings)
    {
        // An empty entry would end the list early for every reader.
        if (!wstr.empty())
        {
            wstrJoined += wstr;
            wstrJoined.push_back(L'\0');
        }
    }
    RegHelperSetString(wszPath, wszValue, wstrJoined, REG_MULTI_SZ);
}

void RegHelperSetDword(const wchar_t *wszPath, const wchar_t *wszValue, DWORD dwValue)
{
    CRegKeyHolder key(RegHelperCreateKey(wszPath));
    if (key.Get() == nullptr)
    {
        return;
    }
    LONG lStatus = RegSetValueExW(key.Get(), wszValue, 0, REG_DWORD,
                                  reinterpret_cast<const BYTE *>(&dwValue), sizeof(dwValue));
    if (lStatus != ERROR_SUCCESS)
    {
        FATAL_ERROR(L"RegHelperSetDword", L"RegSetValueEx", lStatus);
    }
}
