#include "tests/common/testsupport.h"
#include "inc/handleholder.h"
#include "servicelib/diagnostics.h"

#include <gtest/gtest.h>
#include <rpc.h>

#include <algorithm>
#include <mutex>
#include <wchar.h>

namespace testsupport
{
namespace
{
std::mutex s_lock;
std::vector<std::wstring> s_rgFailures;
std::vector<std::wstring> s_rgLog;

void OnFailure(const wchar_t *wszLine)
{
    std::lock_guard<std::mutex> guard(s_lock);
    s_rgFailures.push_back(wszLine);
}

void OnLog(const wchar_t *wszLine)
{
    std::lock_guard<std::mutex> guard(s_lock);
    s_rgLog.push_back(wszLine);
}

// The name of an environment entry ends at the first '=' after its first character (names
// of the hidden per-drive entries start with one).
std::wstring EnvironmentName(const wchar_t *wszEntry)
{
    const wchar_t *pEquals = wszEntry[0] != L'\0' ? wcschr(wszEntry + 1, L'=') : nullptr;
    return pEquals != nullptr ? std::wstring(wszEntry, pEquals) : std::wstring(wszEntry);
}

bool EnvironmentNamesEntry(const std::vector<std::wstring> &rgEnvironment, const wchar_t *wszEntry)
{
    std::wstring name = EnvironmentName(wszEntry);
    for (const std::wstring &entry : rgEnvironment)
    {
        if (_wcsicmp(EnvironmentName(entry.c_str()).c_str(), name.c_str()) == 0)
        {
            return true;
        }
    }
    return false;
}

bool AnyContains(const std::vector<std::wstring> &rg, const std::wstring &text)
{
    for (const std::wstring &line : rg)
    {
        if (line.find(text) != std::wstring::npos)
        {
            return true;
        }
    }
    return false;
}
} // namespace

FailureCapture::FailureCapture()
{
    std::lock_guard<std::mutex> guard(s_lock);
    s_rgFailures.clear();
    DiagnosticsSetFailureHook(OnFailure);
}

FailureCapture::~FailureCapture()
{
    DiagnosticsSetFailureHook(nullptr);
}

std::vector<std::wstring> FailureCapture::Lines() const
{
    std::lock_guard<std::mutex> guard(s_lock);
    return s_rgFailures;
}

size_t FailureCapture::Count() const
{
    std::lock_guard<std::mutex> guard(s_lock);
    return s_rgFailures.size();
}

bool FailureCapture::Contains(const std::wstring &text) const
{
    std::lock_guard<std::mutex> guard(s_lock);
    return AnyContains(s_rgFailures, text);
}

void FailureCapture::ExpectNone() const
{
    for (const std::wstring &line : Lines())
    {
        ADD_FAILURE() << Narrow(line);
    }
}

LogCapture::LogCapture()
{
    std::lock_guard<std::mutex> guard(s_lock);
    s_rgLog.clear();
    DiagnosticsSetLogHook(OnLog);
}

LogCapture::~LogCapture()
{
    DiagnosticsSetLogHook(nullptr);
}

std::vector<std::wstring> LogCapture::Lines() const
{
    std::lock_guard<std::mutex> guard(s_lock);
    return s_rgLog;
}

bool LogCapture::Contains(const std::wstring &text) const
{
    std::lock_guard<std::mutex> guard(s_lock);
    return AnyContains(s_rgLog, text);
}

BOOL CreateTestProcess(std::wstring wstrCommandLine, BOOL fInheritHandles, DWORD dwFlags,
                       void *pvEnvironment, STARTUPINFOW *pStartup, PROCESS_INFORMATION *pInfo)
{
    const int c_cTries = 3;
    for (int iTry = 1;; iTry++)
    {
        // CreateProcessW may write into the command line.
        std::wstring wstrCommand = wstrCommandLine;
        if (CreateProcessW(nullptr, &wstrCommand[0], nullptr, nullptr, fInheritHandles, dwFlags,
                           pvEnvironment, nullptr, pStartup, pInfo))
        {
            return TRUE;
        }
        DWORD dwError = GetLastError();
        if (dwError != ERROR_INTERNAL_ERROR || iTry == c_cTries)
        {
            SetLastError(dwError);
            return FALSE;
        }
        Sleep(100);
    }
}

ChildResult RunChild(const std::wstring &wstrCommandLine,
                     const std::vector<std::wstring> &rgEnvironment, DWORD dwTimeoutMs)
{
    ChildResult result;
    SECURITY_ATTRIBUTES sa = {sizeof(sa), nullptr, TRUE};
    HANDLE hReadEnd = nullptr;
    HANDLE hWriteEnd = nullptr;
    if (!CreatePipe(&hReadEnd, &hWriteEnd, &sa, 0))
    {
        result.dwExitCode = GetLastError();
        return result;
    }
    CKernelHandle read(hReadEnd);
    CKernelHandle write(hWriteEnd);
    SetHandleInformation(read.Get(), HANDLE_FLAG_INHERIT, 0);

    // Environment block: ours plus the extra entries. A child reads the first entry of a
    // name, so an inherited entry that an extra one names again is left out.
    std::wstring block;
    LPWCH pEnv = GetEnvironmentStringsW();
    for (LPWCH p = pEnv; *p != L'\0'; p += wcslen(p) + 1)
    {
        if (!EnvironmentNamesEntry(rgEnvironment, p))
        {
            block.append(p);
            block.push_back(L'\0');
        }
    }
    FreeEnvironmentStringsW(pEnv);
    for (const std::wstring &entry : rgEnvironment)
    {
        block.append(entry);
        block.push_back(L'\0');
    }
    block.push_back(L'\0');

    STARTUPINFOW si = {};
    si.cb = sizeof(si);
    si.dwFlags = STARTF_USESTDHANDLES;
    si.hStdInput = GetStdHandle(STD_INPUT_HANDLE);
    si.hStdOutput = write.Get();
    si.hStdError = write.Get();
    PROCESS_INFORMATION pi = {};
    BOOL fCreated =
        CreateTestProcess(wstrCommandLine, TRUE, CREATE_UNICODE_ENVIRONMENT, &block[0], &si, &pi);
    write.Close();
    if (!fCreated)
    {
        result.dwExitCode = GetLastError();
        result.strOutput = "CreateProcess failed: " + std::to_string(result.dwExitCode);
        return result;
    }
    CKernelHandle process(pi.hProcess);
    CloseHandle(pi.hThread);

    // Reads what is there now; false once the output is closed.
    auto ReadAvailable = [&] {
        DWORD cbAvail = 0;
        while (PeekNamedPipe(read.Get(), nullptr, 0, nullptr, &cbAvail, nullptr))
        {
            char rgch[4096];
            DWORD cbRead = 0;
            if (cbAvail == 0)
            {
                return true;
            }
            if (!ReadFile(read.Get(), rgch, sizeof(rgch), &cbRead, nullptr))
            {
                break;
            }
            result.strOutput.append(rgch, cbRead);
        }
        return false;
    };
    // Until the child has ended and its output is read, or time runs out. The output may
    // close before the process ends (its exit code is known only then), and a process that
    // handed the pipe on may end before its output closes.
    ULONGLONG ullDeadline = GetTickCount64() + dwTimeoutMs;
    bool fOpen = true;
    for (;;)
    {
        fOpen = fOpen && ReadAvailable();
        DWORD dwWaitMs = fOpen ? 20 : 200;
        if (WaitForSingleObject(process.Get(), dwWaitMs) == WAIT_OBJECT_0)
        {
            ReadAvailable();
            break;
        }
        if (GetTickCount64() > ullDeadline)
        {
            result.fTimedOut = true;
            TerminateProcess(process.Get(), 1);
            WaitForSingleObject(process.Get(), 5000);
            break;
        }
    }
    GetExitCodeProcess(process.Get(), &result.dwExitCode);
    return result;
}

bool WaitUntil(const std::function<bool()> &pred, DWORD dwTimeoutMs)
{
    ULONGLONG ullDeadline = GetTickCount64() + dwTimeoutMs;
    while (!pred())
    {
        if (GetTickCount64() >= ullDeadline)
        {
            return false;
        }
        Sleep(5);
    }
    return true;
}

GUID NewGuid()
{
    GUID guid = {};
    UuidCreate(&guid);
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

GUID ParseGuid(const char *szText)
{
    GUID guid = {};
    EXPECT_EQ(RPC_S_OK,
              UuidFromStringA(reinterpret_cast<RPC_CSTR>(const_cast<char *>(szText)), &guid));
    return guid;
}

std::wstring UniqueName(const wchar_t *wszPrefix)
{
    // Wine hands out process ids again soon: the start time tells runs apart.
    static LONG s_lCounter = 0;
    static const ULONGLONG s_ullStart = GetTickCount64() % 1000000;
    wchar_t wsz[128];
    swprintf(wsz, 128, L"%ls_%lu_%llu_%ld", wszPrefix, GetCurrentProcessId(), s_ullStart,
             InterlockedIncrement(&s_lCounter));
    return wsz;
}

std::wstring UniquePipeName(const wchar_t *wszTag)
{
    return L"\\\\.\\pipe\\TelvaneTest-" + UniqueName(wszTag);
}

std::wstring BinDir()
{
    wchar_t wszPath[MAX_PATH];
    DWORD cch = GetModuleFileNameW(nullptr, wszPath, MAX_PATH);
    std::wstring path(wszPath, cch);
    return path.substr(0, path.find_last_of(L"\\/") + 1);
}

std::wstring BinCommand(const wchar_t *wszFile)
{
    return L"\"" + BinDir() + wszFile + L"\"";
}

ChildResult RunTelvanectl(const std::wstring &wstrArguments, DWORD dwTimeoutMs)
{
    ChildResult result =
        RunChild(BinCommand(L"telvanectl.exe") + L" " + wstrArguments, {}, dwTimeoutMs);
    EXPECT_FALSE(result.fTimedOut) << Narrow(wstrArguments);
    return result;
}

std::string Narrow(const std::wstring &wstr)
{
    std::string str;
    for (wchar_t wc : wstr)
    {
        str.push_back(static_cast<char>(wc));
    }
    return str;
}

std::wstring Widen(const std::string &str)
{
    return std::wstring(str.begin(), str.end());
}

void HklmSetBytes(const std::wstring &wstrKey, const wchar_t *wszValue, DWORD dwType,
                  const void *pv, DWORD cb)
{
    CRegKeyHandle key;
    ASSERT_EQ(ERROR_SUCCESS, RegCreateKeyExW(HKEY_LOCAL_MACHINE, wstrKey.c_str(), 0, nullptr, 0,
                                             KEY_WRITE, nullptr, key.Receive(), nullptr));
    EXPECT_EQ(ERROR_SUCCESS,
              RegSetValueExW(key.Get(), wszValue, 0, dwType, static_cast<const BYTE *>(pv), cb));
}

void HklmSetDword(const std::wstring &wstrKey, const wchar_t *wszValue, DWORD dwValue)
{
    HklmSetBytes(wstrKey, wszValue, REG_DWORD, &dwValue, sizeof(dwValue));
}

void HklmSetString(const std::wstring &wstrKey, const wchar_t *wszValue,
                   const std::wstring &wstrValue)
{
    HklmSetBytes(wstrKey, wszValue, REG_SZ, wstrValue.c_str(),
                 static_cast<DWORD>((wstrValue.size() + 1) * sizeof(wchar_t)));
}

bool HklmReadDword(const std::wstring &wstrKey, const wchar_t *wszValue, DWORD *pdw)
{
    DWORD cb = sizeof(*pdw);
    return RegGetValueW(HKEY_LOCAL_MACHINE, wstrKey.c_str(), wszValue, RRF_RT_REG_DWORD, nullptr,
                        pdw, &cb) == ERROR_SUCCESS;
}

bool HklmReadRaw(const std::wstring &wstrKey, const wchar_t *wszValue, DWORD *pdwType,
                 std::wstring *pwstrData)
{
    HKEY hKey = nullptr;
    if (RegOpenKeyExW(HKEY_LOCAL_MACHINE, wstrKey.c_str(), 0, KEY_READ, &hKey) != ERROR_SUCCESS)
    {
        return false;
    }
    CRegKeyHandle key(hKey);
    DWORD cb = 0;
    LONG lStatus = RegQueryValueExW(hKey, wszValue, nullptr, pdwType, nullptr, &cb);
    std::vector<BYTE> rgb(cb + sizeof(wchar_t));
    if (lStatus == ERROR_SUCCESS)
    {
        lStatus = RegQueryValueExW(hKey, wszValue, nullptr, pdwType, rgb.data(), &cb);
    }
    if (lStatus != ERROR_SUCCESS)
    {
        return false;
    }
    pwstrData->assign(reinterpret_cast<const wchar_t *>(rgb.data()), cb / sizeof(wchar_t));
    return true;
}

void HklmDeleteValue(const std::wstring &wstrKey, const wchar_t *wszValue)
{
    RegDeleteKeyValueW(HKEY_LOCAL_MACHINE, wstrKey.c_str(), wszValue);
}

void HklmDeleteKey(const std::wstring &wstrKey)
{
    RegDeleteTreeW(HKEY_LOCAL_MACHINE, wstrKey.c_str());
    RegDeleteKeyExW(HKEY_LOCAL_MACHINE, wstrKey.c_str(), 0, 0);
}

bool ReadFileText(const std::wstring &wstrPath, std::string *pstrText)
{
    CFileHandle file(CreateFileW(wstrPath.c_str(), GENERIC_READ,
                                 FILE_SHARE_READ | FILE_SHARE_WRITE | FILE_SHARE_DELETE, nullptr,
                                 OPEN_EXISTING, FILE_ATTRIBUTE_NORMAL, nullptr));
    if (!file.IsValid())
    {
        return false;
    }
    pstrText->clear();
    char rgch[65536];
    DWORD cbRead = 0;
    while (ReadFile(file.Get(), rgch, sizeof(rgch), &cbRead, nullptr) && cbRead != 0)
    {
        pstrText->append(rgch, cbRead);
    }
    return true;
}

std::string ReadFileText(const std::wstring &wstrPath)
{
    std::string str;
    ReadFileText(wstrPath, &str);
    return str;
}

bool WriteFileText(const std::wstring &wstrPath, const std::string &strText)
{
    CFileHandle file(
        CreateFileW(wstrPath.c_str(), GENERIC_WRITE, 0, nullptr, CREATE_ALWAYS, 0, nullptr));
    DWORD cb = 0;
    return file.IsValid() &&
           WriteFile(file.Get(), strText.data(), static_cast<DWORD>(strText.size()), &cb,
                     nullptr) &&
           cb == strText.size();
}

std::vector<std::wstring> FileNames(const std::wstring &wstrFolder, const wchar_t *wszPattern)
{
    std::vector<std::wstring> rgNames;
    WIN32_FIND_DATAW data;
    CFindHandle find(FindFirstFileW((wstrFolder + L"\\" + wszPattern).c_str(), &data));
    if (!find.IsValid())
    {
        return rgNames;
    }
    do
    {
        if ((data.dwFileAttributes & FILE_ATTRIBUTE_DIRECTORY) == 0)
        {
            rgNames.push_back(data.cFileName);
        }
    } while (FindNextFileW(find.Get(), &data));
    std::sort(rgNames.begin(), rgNames.end());
    return rgNames;
}

void RemoveTree(const std::wstring &wstrPath)
{
    WIN32_FIND_DATAW data;
    CFindHandle find(FindFirstFileW((wstrPath + L"\\*").c_str(), &data));
    if (find.IsValid())
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
                RemoveTree(wstrChild);
            }
            else
            {
                SetFileAttributesW(wstrChild.c_str(), FILE_ATTRIBUTE_NORMAL);
                DeleteFileW(wstrChild.c_str());
            }
        } while (FindNextFileW(find.Get(), &data));
    }
    RemoveDirectoryW(wstrPath.c_str());
}

void CreateFolders(const std::wstring &wstrPath)
{
    for (size_t ich = wstrPath.find(L'\\', 3); ich != std::wstring::npos;
         ich = wstrPath.find(L'\\', ich + 1))
    {
        CreateDirectoryW(wstrPath.substr(0, ich).c_str(), nullptr);
    }
    CreateDirectoryW(wstrPath.c_str(), nullptr);
}
} // namespace testsupport
