// Helpers for the test suites. Captures are process-wide: one capture object at a time.
#pragma once

#include <windows.h>
#include <string>
#include <vector>

namespace testsupport
{
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

// Directory of the running test executable, with a trailing backslash (build\bin\).
std::wstring BinDir();

std::string Narrow(const std::wstring &wstr);
} // namespace testsupport
