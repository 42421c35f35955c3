#include "platform/submission/submissionspool.h"

#include <stdio.h>

const wchar_t c_wszSubmissionSuffix[] = L".sub";
const wchar_t c_wszSubmissionKey[] = L"Software\\Telvane\\Standins\\Submission";

DWORD SubmissionGetResult(const wchar_t *wszValue)
{
    DWORD dwValue = 0;
    DWORD cb = sizeof(dwValue);
    if (RegGetValueW(HKEY_LOCAL_MACHINE, c_wszSubmissionKey, wszValue, RRF_RT_REG_DWORD, nullptr,
                     &dwValue, &cb) != ERROR_SUCCESS)
    {
        return 0;
    }
    return dwValue;
}

std::wstring SubmissionSpoolDirectory()
{
    wchar_t wszBase[MAX_PATH];
    DWORD cch = ExpandEnvironmentStringsW(L"%ProgramData%", wszBase, MAX_PATH);
    std::wstring wstrBase =
        (cch == 0 || cch > MAX_PATH || wszBase[0] == L'%') ? L"C:\\ProgramData" : wszBase;
    return wstrBase + L"\\Telvane\\Submissions";
}

bool SubmissionCreateSpoolDirectory()
{
    std::wstring wstrDirectory = SubmissionSpoolDirectory();
    // Every level from the drive down; levels that exist are fine.
    for (size_t pos = wstrDirectory.find(L'\\', 3);; pos = wstrDirectory.find(L'\\', pos + 1))
    {
        std::wstring wstrLevel = wstrDirectory.substr(0, pos);
        if (!CreateDirectoryW(wstrLevel.c_str(), nullptr) && GetLastError() != ERROR_ALREADY_EXISTS)
        {
            return false;
        }
        if (pos == std::wstring::npos)
        {
            return true;
        }
    }
}

std::string SubmissionFormatHeader(const BYTE *pbProfile, const std::string &strTarget,
                                   const std::string &strGuid, ULONGLONG ullSubmitted, DWORD cbData)
{
    // The name field is wide; the file keeps it narrow, with anything outside ASCII as '?'.
    std::string strName;
    for (size_t i = 0; i < 32; i++)
    {
        WCHAR wch = static_cast<WCHAR>(pbProfile[2 * i] | (pbProfile[2 * i + 1] << 8));
        if (wch == 0)
        {
            break;
        }
        strName += (wch >= 0x20 && wch < 0x7F) ? static_cast<char>(wch) : '?';
    }
    DWORD rgdw[8];
    memcpy(rgdw, pbProfile + 64, sizeof(rgdw));
    char szLine[160];
    std::string str = "Profile: " + strName + "\r\n";
    snprintf(szLine, sizeof(szLine), "Settings: 0x%08lx %lu %lu %lu %lu %lu %lu %lu\r\n",
             static_cast<unsigned long>(rgdw[0]), static_cast<unsigned long>(rgdw[1]),
             static_cast<unsigned long>(rgdw[2]), static_cast<unsigned long>(rgdw[3]),
             static_cast<unsigned long>(rgdw[4]), static_cast<unsigned long>(rgdw[5]),
             static_cast<unsigned long>(rgdw[6]), static_cast<unsigned long>(rgdw[7]));
    str += szLine;
    str += "ProfileBytes: ";
    static const char c_rgchHex[] = "0123456789abcdef";
    for (size_t i = 0; i < 120; i++)
    {
        str += c_rgchHex[pbProfile[i] >> 4];
        str += c_rgchHex[pbProfile[i] & 0xF];
    }
    str += "\r\nTarget: " + strTarget + "\r\nGuid: " + strGuid + "\r\n";
    snprintf(szLine, sizeof(szLine), "Submitted: %llu\r\nLength: %lu\r\n\r\n",
             static_cast<unsigned long long>(ullSubmitted), static_cast<unsigned long>(cbData));
    str += szLine;
    return str;
}

void SubmissionAppendJournal(const std::string &strCall)
{
    if (!SubmissionCreateSpoolDirectory())
    {
        return;
    }
    std::wstring wstrPath = SubmissionSpoolDirectory() + L"\\calls.log";
    // Appending writers in several processes: each line goes out in one write at the end.
    HANDLE hFile = CreateFileW(wstrPath.c_str(), FILE_APPEND_DATA,
                               FILE_SHARE_READ | FILE_SHARE_WRITE | FILE_SHARE_DELETE, nullptr,
                               OPEN_ALWAYS, FILE_ATTRIBUTE_NORMAL, nullptr);
    if (hFile == INVALID_HANDLE_VALUE)
    {
        return;
    }
    std::string strLine = std::to_string(GetCurrentThreadId()) + " " + strCall + "\r\n";
    DWORD cbWritten = 0;
    WriteFile(hFile, strLine.data(), static_cast<DWORD>(strLine.size()), &cbWritten, nullptr);
    CloseHandle(hFile);
}
