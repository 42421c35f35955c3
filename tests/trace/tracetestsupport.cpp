#include "tests/trace/tracetestsupport.h"

#include "platform/deviceinfo/deviceinfocontrol.h"
#include "platform/submission/submissioncontrol.h"
#include "service/tracesinks.h"
#include "servicelib/eventtrace.h"

#include <gtest/gtest.h>
#include <rapidjson/error/en.h>
#include <rpc.h>

#include <algorithm>
#include <mutex>

namespace tracetest
{
const wchar_t c_wszPreferenceKey[] =
    L"System\\CurrentControlSet\\Services\\Ambrel\\Parameters\\CrowdsrcPlugin";
const wchar_t c_wszPreferenceValue[] = L"EnableWifiCrowdsourcing";
const wchar_t c_wszTestKey[] = L"System\\CurrentControlSet\\Services\\Telvane\\Parameters";
const wchar_t c_wszTestValue[] = L"EnableTestLogging";
const wchar_t c_wszConnIdKey[] = L"System\\CurrentControlSet\\Services\\Ambrel\\Parameters\\Config";
const wchar_t c_wszConnIdValue[] = L"ConnID";

namespace
{
void SetValue(const wchar_t *wszKey, const wchar_t *wszValue, DWORD dwType, const void *pv,
              DWORD cb)
{
    HKEY hKey = nullptr;
    ASSERT_EQ(ERROR_SUCCESS, RegCreateKeyExW(HKEY_LOCAL_MACHINE, wszKey, 0, nullptr, 0, KEY_WRITE,
                                             nullptr, &hKey, nullptr));
    EXPECT_EQ(ERROR_SUCCESS,
              RegSetValueExW(hKey, wszValue, 0, dwType, static_cast<const BYTE *>(pv), cb));
    RegCloseKey(hKey);
}

std::mutex s_lock;
std::vector<std::string> s_rgLines;

void CaptureWrite(REGHANDLE, const EVENT_DESCRIPTOR *pDescriptor, ULONG cData,
                  const EVENT_DATA_DESCRIPTOR *pData)
{
    std::lock_guard<std::mutex> guard(s_lock);
    std::string strLine = std::to_string(pDescriptor->Id);
    for (ULONG i = 0; i < cData; i++)
    {
        strLine += '|';
        std::string strField(reinterpret_cast<const char *>(pData[i].Ptr), pData[i].Size);
        // Strings go out with their terminator; numbers as their bytes.
        if (pData[i].Size == sizeof(ULONG) && i > 0)
        {
            ULONG ul;
            memcpy(&ul, reinterpret_cast<const void *>(pData[i].Ptr), sizeof(ul));
            strField = std::to_string(ul);
        }
        else if (!strField.empty() && strField.back() == '\0')
        {
            strField.pop_back();
        }
        strLine += strField;
    }
    s_rgLines.push_back(strLine);
}
} // namespace

void SetDword(const wchar_t *wszKey, const wchar_t *wszValue, DWORD dwValue)
{
    SetValue(wszKey, wszValue, REG_DWORD, &dwValue, sizeof(dwValue));
}

void SetString(const wchar_t *wszKey, const wchar_t *wszValue, const std::wstring &wstrValue)
{
    SetValue(wszKey, wszValue, REG_SZ, wstrValue.c_str(),
             static_cast<DWORD>((wstrValue.size() + 1) * sizeof(wchar_t)));
}

void DeleteValue(const wchar_t *wszKey, const wchar_t *wszValue)
{
    HKEY hKey = nullptr;
    if (RegOpenKeyExW(HKEY_LOCAL_MACHINE, wszKey, 0, KEY_WRITE, &hKey) == ERROR_SUCCESS)
    {
        RegDeleteValueW(hKey, wszValue);
        RegCloseKey(hKey);
    }
}

void DeleteKey(const wchar_t *wszKey)
{
    RegDeleteKeyExW(HKEY_LOCAL_MACHINE, wszKey, 0, 0);
}

void RemoveDirectoryTree(const std::wstring &wstrPath)
{
    WIN32_FIND_DATAW data;
    HANDLE hFind = FindFirstFileW((wstrPath + L"\\*").c_str(), &data);
    if (hFind != INVALID_HANDLE_VALUE)
    {
        do
        {
            std::wstring wstrName = data.cFileName;
            if (wstrName == L"." || wstrName == L"..")
            {
                continue;
            }
            std::wstring wstrChild = wstrPath + L"\\" + wstrName;
            if (data.dwFileAttributes & FILE_ATTRIBUTE_DIRECTORY)
            {
                RemoveDirectoryTree(wstrChild);
            }
            else
            {
                SetFileAttributesW(wstrChild.c_str(), FILE_ATTRIBUTE_NORMAL);
                DeleteFileW(wstrChild.c_str());
            }
        } while (FindNextFileW(hFind, &data));
        FindClose(hFind);
    }
    RemoveDirectoryW(wstrPath.c_str());
}

void ResetDeliveryState()
{
    DeleteValue(c_wszPreferenceKey, c_wszPreferenceValue);
    DeleteValue(c_wszTestKey, c_wszTestValue);
    DeleteValue(c_wszConnIdKey, c_wszConnIdValue);
    RemoveDirectoryTree(TraceSinks::c_wszTraceDirectory);
    CreateDirectoryW(L"C:\\Data", nullptr);
    CreateDirectoryW(L"C:\\Data\\Test", nullptr);
    SubmissionClear();
    SubmissionSetResult(c_wszSubmissionInitResult, 0);
    SubmissionSetResult(c_wszSubmissionSubmitResult, 0);
    DeviceInfoReset();
}

void AllowDelivery(DWORD dwTestLogging)
{
    SetDword(c_wszPreferenceKey, c_wszPreferenceValue, 3);
    SetDword(c_wszTestKey, c_wszTestValue, dwTestLogging);
}

std::vector<std::wstring> TraceFileNames()
{
    std::vector<std::wstring> rgNames;
    WIN32_FIND_DATAW data;
    HANDLE hFind =
        FindFirstFileW((std::wstring(TraceSinks::c_wszTraceDirectory) + L"\\*").c_str(), &data);
    if (hFind == INVALID_HANDLE_VALUE)
    {
        return rgNames;
    }
    do
    {
        if (!(data.dwFileAttributes & FILE_ATTRIBUTE_DIRECTORY))
        {
            rgNames.push_back(data.cFileName);
        }
    } while (FindNextFileW(hFind, &data));
    FindClose(hFind);
    std::sort(rgNames.begin(), rgNames.end());
    return rgNames;
}

std::string ReadFileText(const std::wstring &wstrPath)
{
    std::string str;
    HANDLE hFile = CreateFileW(wstrPath.c_str(), GENERIC_READ, FILE_SHARE_READ, nullptr,
                               OPEN_EXISTING, FILE_ATTRIBUTE_NORMAL, nullptr);
    EXPECT_NE(INVALID_HANDLE_VALUE, hFile) << testing::PrintToString(wstrPath);
    if (hFile == INVALID_HANDLE_VALUE)
    {
        return str;
    }
    char rgch[65536];
    DWORD cbRead = 0;
    while (ReadFile(hFile, rgch, sizeof(rgch), &cbRead, nullptr) && cbRead > 0)
    {
        str.append(rgch, cbRead);
    }
    CloseHandle(hFile);
    return str;
}

std::vector<std::string> TraceFileTexts()
{
    std::vector<std::pair<unsigned, std::string>> rgTexts;
    for (const std::wstring &wstrName : TraceFileNames())
    {
        std::string str =
            ReadFileText(std::wstring(TraceSinks::c_wszTraceDirectory) + L"\\" + wstrName);
        rapidjson::Document document;
        ParseStrict(str, document);
        unsigned uLogCount = 0;
        if (document.IsObject() && document.HasMember("LogCount") && document["LogCount"].IsUint())
        {
            uLogCount = document["LogCount"].GetUint();
        }
        rgTexts.emplace_back(uLogCount, str);
    }
    std::sort(rgTexts.begin(), rgTexts.end(),
              [](const auto &a, const auto &b) { return a.first < b.first; });
    std::vector<std::string> rgResult;
    for (auto &text : rgTexts)
    {
        rgResult.push_back(text.second);
    }
    return rgResult;
}

TraceSession::TraceSession()
{
    {
        std::lock_guard<std::mutex> guard(s_lock);
        s_rgLines.clear();
    }
    TraceSetWriteHook(CaptureWrite);
    TraceProviderEnableCallback(&TELVANE_PROVIDER_GUID, EVENT_CONTROL_CODE_ENABLE_PROVIDER, 0,
                                0x100, 0, nullptr, &g_TelvaneTraceProvider);
}

TraceSession::~TraceSession()
{
    TraceProviderEnableCallback(&TELVANE_PROVIDER_GUID, EVENT_CONTROL_CODE_DISABLE_PROVIDER, 0, 0,
                                0, nullptr, &g_TelvaneTraceProvider);
    TraceSetWriteHook(nullptr);
}

std::vector<std::string> TraceSession::Lines() const
{
    std::lock_guard<std::mutex> guard(s_lock);
    return s_rgLines;
}

size_t TraceSession::CountMessages(const char *szText) const
{
    std::string strLine = std::string("1001|") + szText;
    std::vector<std::string> rgLines = Lines();
    return static_cast<size_t>(std::count(rgLines.begin(), rgLines.end(), strLine));
}

size_t TraceSession::CountFailures(const char *szText) const
{
    std::string strPrefix = std::string("1002|") + szText + "|";
    size_t c = 0;
    for (const std::string &strLine : Lines())
    {
        c += strLine.compare(0, strPrefix.size(), strPrefix) == 0 ? 1 : 0;
    }
    return c;
}

void ParseStrict(const std::string &strText, rapidjson::Document &document)
{
    document.Parse<rapidjson::kParseValidateEncodingFlag>(strText.c_str(), strText.size());
    ASSERT_FALSE(document.HasParseError())
        << rapidjson::GetParseError_En(document.GetParseError()) << " at "
        << document.GetErrorOffset() << " in " << strText.substr(0, 2000);
}

std::vector<std::string> MemberNames(const rapidjson::Value &object)
{
    std::vector<std::string> rgNames;
    if (!object.IsObject())
    {
        return rgNames;
    }
    for (auto it = object.MemberBegin(); it != object.MemberEnd(); ++it)
    {
        rgNames.emplace_back(it->name.GetString(), it->name.GetStringLength());
    }
    return rgNames;
}

GUID ParseGuid(const char *szText)
{
    GUID guid = {};
    EXPECT_EQ(RPC_S_OK,
              UuidFromStringA(reinterpret_cast<RPC_CSTR>(const_cast<char *>(szText)), &guid));
    return guid;
}

std::string GuidText(const GUID &guid)
{
    RPC_CSTR sz = nullptr;
    UuidToStringA(const_cast<GUID *>(&guid), &sz);
    std::string str(reinterpret_cast<const char *>(sz));
    RpcStringFreeA(&sz);
    return str;
}
} // namespace tracetest
