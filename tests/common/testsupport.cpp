#include "tests/common/testsupport.h"
#include "servicelib/diagnostics.h"

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

ChildResult RunChild(const std::wstring &wstrCommandLine,
                     const std::vector<std::wstring> &rgEnvironment, DWORD dwTimeoutMs)
{
    ChildResult result;
    SECURITY_ATTRIBUTES sa = {sizeof(sa), nullptr, TRUE};
    HANDLE hRead = nullptr;
    HANDLE hWrite = nullptr;
    if (!CreatePipe(&hRead, &hWrite, &sa, 0))
    {
        result.dwExitCode = GetLastError();
        return result;
    }
    SetHandleInformation(hRead, HANDLE_FLAG_INHERIT, 0);

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
    si.hStdOutput = hWrite;
    si.hStdError = hWrite;
    PROCESS_INFORMATION pi = {};
    std::wstring cmd = wstrCommandLine;
    BOOL fCreated = CreateProcessW(nullptr, &cmd[0], nullptr, nullptr, TRUE,
                                   CREATE_UNICODE_ENVIRONMENT, &block[0], nullptr, &si, &pi);
    CloseHandle(hWrite);
    if (!fCreated)
    {
        result.dwExitCode = GetLastError();
        result.strOutput = "CreateProcess failed: " + std::to_string(result.dwExitCode);
        CloseHandle(hRead);
        return result;
    }
    CloseHandle(pi.hThread);

    // Read until the child (and anything it handed the pipe to) is done.
    ULONGLONG ullDeadline = GetTickCount64() + dwTimeoutMs;
    for (;;)
    {
        DWORD cbAvail = 0;
        if (!PeekNamedPipe(hRead, nullptr, 0, nullptr, &cbAvail, nullptr))
        {
            // The output is closed, but the process may still be running: its exit code is
            // only known once it has ended.
            ULONGLONG ullNow = GetTickCount64();
            DWORD dwLeft = ullNow < ullDeadline ? static_cast<DWORD>(ullDeadline - ullNow) : 0;
            if (WaitForSingleObject(pi.hProcess, dwLeft) != WAIT_OBJECT_0)
            {
                result.fTimedOut = true;
                TerminateProcess(pi.hProcess, 1);
                WaitForSingleObject(pi.hProcess, 5000);
            }
            break;
        }
        if (cbAvail > 0)
        {
            char rgch[4096];
            DWORD cbRead = 0;
            if (!ReadFile(hRead, rgch, sizeof(rgch), &cbRead, nullptr))
            {
                break;
            }
            result.strOutput.append(rgch, cbRead);
            continue;
        }
        if (WaitForSingleObject(pi.hProcess, 20) == WAIT_OBJECT_0)
        {
            // Drain what is left, then stop.
            while (PeekNamedPipe(hRead, nullptr, 0, nullptr, &cbAvail, nullptr) && cbAvail > 0)
            {
                char rgch[4096];
                DWORD cbRead = 0;
                if (!ReadFile(hRead, rgch, sizeof(rgch), &cbRead, nullptr))
                {
                    break;
                }
                result.strOutput.append(rgch, cbRead);
            }
            break;
        }
        if (GetTickCount64() > ullDeadline)
        {
            result.fTimedOut = true;
            TerminateProcess(pi.hProcess, 1);
            WaitForSingleObject(pi.hProcess, 5000);
            break;
        }
    }
    GetExitCodeProcess(pi.hProcess, &result.dwExitCode);
    CloseHandle(pi.hProcess);
    CloseHandle(hRead);
    return result;
}

std::wstring BinDir()
{
    wchar_t wszPath[MAX_PATH];
    DWORD cch = GetModuleFileNameW(nullptr, wszPath, MAX_PATH);
    std::wstring path(wszPath, cch);
    return path.substr(0, path.find_last_of(L"\\/") + 1);
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
} // namespace testsupport
