// The harness every suite shares: failure and log capture, bounded waits, GUIDs and unique
// names, child processes and the project's tools, and the prefix's registry and files read
// and written without the product's helpers. Captures are process-wide: one of each at a time.
#pragma once

#include <windows.h>
#include <functional>
#include <string>
#include <vector>

namespace testsupport
{
// Longest any test waits for something that should happen (a hang, not a measurement).
const DWORD c_dwWaitMs = 30000;

// Collects what Assert and FatalError report while it lives; they return to the caller
// instead of ending the process, as they do under a debugger.
class FailureCapture
{
public:
    FailureCapture();
    ~FailureCapture();
    std::vector<std::wstring> Lines() const;
    size_t Count() const;
    bool Contains(const std::wstring &text) const;
    // Fails the running test once per captured report (for fixtures' TearDown).
    void ExpectNone() const;
};

// Collects every debug line while it lives.
class LogCapture
{
public:
    LogCapture();
    ~LogCapture();
    std::vector<std::wstring> Lines() const;
    bool Contains(const std::wstring &text) const;
};

// Polls the condition (every few milliseconds) until it holds or time runs out.
bool WaitUntil(const std::function<bool()> &pred, DWORD dwTimeoutMs = c_dwWaitMs);

GUID NewGuid();
// Lower case without braces, as the traces write them.
std::string GuidText(const GUID &guid);
GUID ParseGuid(const char *szText);

// "prefix_<pid>_<start>_<counter>": unique across processes running side by side.
std::wstring UniqueName(const wchar_t *wszPrefix);
// A pipe name no other test or run uses, and never the product's.
std::wstring UniquePipeName(const wchar_t *wszTag);

struct ChildResult
{
    DWORD dwExitCode = 0;
    std::string strOutput; // standard output and standard error together
    bool fTimedOut = false;
};

// Runs a program with the given command line, extra environment entries ("NAME=value",
// each replacing an inherited variable of that name) and a time limit, and collects what
// it prints.
ChildResult RunChild(const std::wstring &wstrCommandLine,
                     const std::vector<std::wstring> &rgEnvironment = {},
                     DWORD dwTimeoutMs = 60000);

// CreateProcessW for the harness's own children. Wine now and then reports
// ERROR_INTERNAL_ERROR when a new process ends during its start-up, before it ran any of its
// own code; such a start is tried again (a few times), any other failure is returned at once.
BOOL CreateTestProcess(std::wstring wstrCommandLine, BOOL fInheritHandles, DWORD dwFlags,
                       void *pvEnvironment, STARTUPINFOW *pStartup, PROCESS_INFORMATION *pInfo);

// Directory of the running test executable, with a trailing backslash (build\bin\).
std::wstring BinDir();
// A program or DLL of the build, quoted for a command line.
std::wstring BinCommand(const wchar_t *wszFile);
// telvanectl.exe with these arguments.
ChildResult RunTelvanectl(const std::wstring &wstrArguments, DWORD dwTimeoutMs = 60000);

std::string Narrow(const std::wstring &wstr);
std::wstring Widen(const std::string &str);

// Values under HKEY_LOCAL_MACHINE. Writes fail the test when they fail; deletes tolerate
// what is already gone.
void HklmSetDword(const std::wstring &wstrKey, const wchar_t *wszValue, DWORD dwValue);
void HklmSetString(const std::wstring &wstrKey, const wchar_t *wszValue,
                   const std::wstring &wstrValue);
void HklmSetBytes(const std::wstring &wstrKey, const wchar_t *wszValue, DWORD dwType,
                  const void *pv, DWORD cb);
bool HklmReadDword(const std::wstring &wstrKey, const wchar_t *wszValue, DWORD *pdw);
// Any type, as its raw bytes read into a wide string.
bool HklmReadRaw(const std::wstring &wstrKey, const wchar_t *wszValue, DWORD *pdwType,
                 std::wstring *pwstrData);
void HklmDeleteValue(const std::wstring &wstrKey, const wchar_t *wszValue);
void HklmDeleteKey(const std::wstring &wstrKey);

// Files of the prefix.
bool ReadFileText(const std::wstring &wstrPath, std::string *pstrText);
std::string ReadFileText(const std::wstring &wstrPath); // empty when it cannot be read
bool WriteFileText(const std::wstring &wstrPath, const std::string &strText);
// Names of the plain files in the folder matching the pattern, sorted; empty when missing.
std::vector<std::wstring> FileNames(const std::wstring &wstrFolder,
                                    const wchar_t *wszPattern = L"*");
void RemoveTree(const std::wstring &wstrPath);
// Makes every folder of the path that is missing.
void CreateFolders(const std::wstring &wstrPath);
} // namespace testsupport
