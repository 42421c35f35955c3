#include "platform/submission/submissioncontrol.h"

#include <algorithm>
#include <cstring>
#include <stdlib.h>

const wchar_t c_wszSubmissionInitResult[] = L"InitResult";
const wchar_t c_wszSubmissionSubmitResult[] = L"SubmitResult";

namespace
{
bool ReadWholeFile(const std::wstring &wstrPath, std::string *pstr)
{
    HANDLE hFile = CreateFileW(wstrPath.c_str(), GENERIC_READ,
                               FILE_SHARE_READ | FILE_SHARE_WRITE | FILE_SHARE_DELETE, nullptr,
                               OPEN_EXISTING, FILE_ATTRIBUTE_NORMAL, nullptr);
    if (hFile == INVALID_HANDLE_VALUE)
    {
        return false;
    }
    LARGE_INTEGER liSize;
    bool fOk = GetFileSizeEx(hFile, &liSize) && liSize.QuadPart < 0x7FFFFFFF;
    if (fOk)
    {
        pstr->resize(static_cast<size_t>(liSize.QuadPart));
        size_t cbDone = 0;
        while (fOk && cbDone < pstr->size())
        {
            DWORD cbRead = 0;
            fOk = ReadFile(hFile, &(*pstr)[cbDone], static_cast<DWORD>(pstr->size() - cbDone),
                           &cbRead, nullptr) &&
                  cbRead != 0;
            cbDone += cbRead;
        }
    }
    CloseHandle(hFile);
    return fOk;
}

// The text after "<strName>: " on the line starting at pos; advances pos past the line.
bool HeaderLine(const std::string &str, size_t &pos, const char *szName, std::string *pstrValue)
{
    size_t end = str.find("\r\n", pos);
    std::string strPrefix = std::string(szName) + ": ";
    if (end == std::string::npos || str.compare(pos, strPrefix.size(), strPrefix) != 0)
    {
        return false;
    }
    *pstrValue = str.substr(pos + strPrefix.size(), end - pos - strPrefix.size());
    pos = end + 2;
    return true;
}

int HexDigit(char ch)
{
    if (ch >= '0' && ch <= '9')
    {
        return ch - '0';
    }
    if (ch >= 'a' && ch <= 'f')
    {
        return ch - 'a' + 10;
    }
    return -1;
}
} // namespace

bool SubmissionReadFile(const std::wstring &wstrPath, SUBMISSION_RECORD *pRecord)
{
    std::string str;
    if (!ReadWholeFile(wstrPath, &str))
    {
        return false;
    }
    SUBMISSION_RECORD record;
    record.wstrPath = wstrPath;
    size_t pos = 0;
    std::string strSettings, strBytes, strSubmitted, strLength;
    if (!HeaderLine(str, pos, "Profile", &record.strProfileName) ||
        !HeaderLine(str, pos, "Settings", &strSettings) ||
        !HeaderLine(str, pos, "ProfileBytes", &strBytes) ||
        !HeaderLine(str, pos, "Target", &record.strTarget) ||
        !HeaderLine(str, pos, "Guid", &record.strGuid) ||
        !HeaderLine(str, pos, "Submitted", &strSubmitted) ||
        !HeaderLine(str, pos, "Length", &strLength) || str.compare(pos, 2, "\r\n") != 0)
    {
        return false;
    }
    pos += 2;
    const char *psz = strSettings.c_str();
    for (int i = 0; i < 8; i++)
    {
        char *pszEnd = nullptr;
        record.rgdwSettings[i] = static_cast<DWORD>(strtoul(psz, &pszEnd, 0));
        if (pszEnd == psz)
        {
            return false;
        }
        psz = pszEnd;
    }
    if (strBytes.size() != 240)
    {
        return false;
    }
    for (size_t i = 0; i < 120; i++)
    {
        int iHigh = HexDigit(strBytes[2 * i]);
        int iLow = HexDigit(strBytes[2 * i + 1]);
        if (iHigh < 0 || iLow < 0)
        {
            return false;
        }
        record.rgbProfile.push_back(static_cast<BYTE>(iHigh * 16 + iLow));
    }
    record.ullSubmitted = strtoull(strSubmitted.c_str(), nullptr, 10);
    if (strtoull(strLength.c_str(), nullptr, 10) != str.size() - pos)
    {
        return false;
    }
    record.strData = str.substr(pos);
    *pRecord = std::move(record);
    return true;
}

std::vector<SUBMISSION_RECORD> SubmissionList()
{
    std::vector<SUBMISSION_RECORD> rgRecords;
    std::wstring wstrDirectory = SubmissionSpoolDirectory();
    WIN32_FIND_DATAW data;
    HANDLE hFind = FindFirstFileW((wstrDirectory + L"\\*" + c_wszSubmissionSuffix).c_str(), &data);
    if (hFind == INVALID_HANDLE_VALUE)
    {
        return rgRecords;
    }
    do
    {
        SUBMISSION_RECORD record;
        if (!(data.dwFileAttributes & FILE_ATTRIBUTE_DIRECTORY) &&
            SubmissionReadFile(wstrDirectory + L"\\" + data.cFileName, &record))
        {
            rgRecords.push_back(std::move(record));
        }
    } while (FindNextFileW(hFind, &data));
    FindClose(hFind);
    // File names start with the submission time: the newest sorts last by name.
    std::sort(rgRecords.begin(), rgRecords.end(),
              [](const SUBMISSION_RECORD &a, const SUBMISSION_RECORD &b) {
                  return a.wstrPath > b.wstrPath;
              });
    return rgRecords;
}

std::vector<std::string> SubmissionReadJournal()
{
    std::vector<std::string> rgLines;
    std::string str;
    if (!ReadWholeFile(SubmissionSpoolDirectory() + L"\\calls.log", &str))
    {
        return rgLines;
    }
    size_t pos = 0;
    while (pos < str.size())
    {
        size_t end = str.find("\r\n", pos);
        if (end == std::string::npos)
        {
            end = str.size();
        }
        rgLines.push_back(str.substr(pos, end - pos));
        pos = end + 2;
    }
    return rgLines;
}

void SubmissionClear()
{
    std::wstring wstrDirectory = SubmissionSpoolDirectory();
    WIN32_FIND_DATAW data;
    HANDLE hFind = FindFirstFileW((wstrDirectory + L"\\*").c_str(), &data);
    if (hFind == INVALID_HANDLE_VALUE)
    {
        return;
    }
    do
    {
        if (!(data.dwFileAttributes & FILE_ATTRIBUTE_DIRECTORY))
        {
            DeleteFileW((wstrDirectory + L"\\" + data.cFileName).c_str());
        }
    } while (FindNextFileW(hFind, &data));
    FindClose(hFind);
}

bool SubmissionSetResult(const wchar_t *wszValue, DWORD dwCode)
{
    HKEY hKey = nullptr;
    if (RegCreateKeyExW(HKEY_LOCAL_MACHINE, c_wszSubmissionKey, 0, nullptr, 0, KEY_WRITE, nullptr,
                        &hKey, nullptr) != ERROR_SUCCESS)
    {
        return false;
    }
    LONG lStatus = dwCode == 0
                       ? RegDeleteValueW(hKey, wszValue)
                       : RegSetValueExW(hKey, wszValue, 0, REG_DWORD,
                                        reinterpret_cast<const BYTE *>(&dwCode), sizeof(dwCode));
    RegCloseKey(hKey);
    return lStatus == ERROR_SUCCESS || (dwCode == 0 && lStatus == ERROR_FILE_NOT_FOUND);
}
