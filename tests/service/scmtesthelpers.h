// Helpers for the tests that go through the control manager of the test prefix: unique
// names, bounded waits for a service state, and reading a service's record back.
#pragma once

#include <windows.h>
#include <string>
#include <vector>

namespace scmtest
{
// "prefix_<pid>_<start>_<counter>": unique across processes running side by side.
std::wstring UniqueName(const wchar_t *wszPrefix);

// Polls the service until it reports the state; false (with the last status) on time-out.
bool WaitForState(const wchar_t *wszService, DWORD dwState, DWORD dwTimeoutMs,
                  SERVICE_STATUS_PROCESS *pStatus = nullptr);
bool QueryStatus(const wchar_t *wszService, SERVICE_STATUS_PROCESS *pStatus);
bool ServiceExists(const wchar_t *wszService);

// Starts with the given start parameters; returns the error of StartService or 0.
DWORD StartWithArgs(const wchar_t *wszService, const std::vector<std::wstring> &rgArgs);
// Sends a control; returns its error or 0 and fills *pStatus with what ControlService gave.
DWORD Control(const wchar_t *wszService, DWORD dwControl, SERVICE_STATUS *pStatus);
// Sends STOP. A service whose handler stops it at once lets its process exit right away, and
// Wine's control manager, reading the handler's answer after that, reports 109 although the
// control was delivered: that counts as sent. Callers check the STOPPED state themselves.
DWORD Stop(const wchar_t *wszService);

struct SERVICE_RECORD
{
    DWORD dwServiceType = 0;
    DWORD dwStartType = 0;
    DWORD dwErrorControl = 0;
    std::wstring wstrBinaryPath;
    std::wstring wstrDisplayName;
    std::wstring wstrStartName;
    std::wstring wstrDescription;
};
bool ReadRecord(const wchar_t *wszService, SERVICE_RECORD *pRecord);

// Creates an own-process service running wstrImagePath; false when CreateService failed.
bool CreateOwnProcess(const wchar_t *wszService, const std::wstring &wstrImagePath);
bool SetImagePath(const wchar_t *wszService, const std::wstring &wstrImagePath);
// Marks the service for deletion, leaving it as it runs; false when that failed.
bool Delete(const wchar_t *wszService);
// Stops (bounded) and deletes the service if it exists.
void StopAndDelete(const wchar_t *wszService);

// Stops and deletes a test service when the test ends, however it ends.
class CServiceCleanup
{
public:
    explicit CServiceCleanup(const std::wstring &wstrService)
        : m_wstrService(wstrService)
    {
    }
    ~CServiceCleanup() { StopAndDelete(m_wstrService.c_str()); }
    CServiceCleanup(const CServiceCleanup &) = delete;
    CServiceCleanup &operator=(const CServiceCleanup &) = delete;

private:
    std::wstring m_wstrService;
};

// The process that runs a service, held open so that the test can see it leave.
class CServiceProcess
{
public:
    explicit CServiceProcess(DWORD dwProcessId);
    ~CServiceProcess();
    CServiceProcess(const CServiceProcess &) = delete;
    CServiceProcess &operator=(const CServiceProcess &) = delete;

    bool Opened() const { return m_hProcess != nullptr; }
    std::wstring ImageName() const;
    // Waits (bounded) for the process to end: its exit code, or STILL_ACTIVE when it did not.
    DWORD WaitForExitCode(DWORD dwTimeoutMs) const;

private:
    HANDLE m_hProcess;
};

// A REG_DWORD or string value under HKEY_LOCAL_MACHINE, read without the helpers under test.
bool ReadDword(const std::wstring &wstrKey, const wchar_t *wszValue, DWORD *pdw);
bool ReadRaw(const std::wstring &wstrKey, const wchar_t *wszValue, DWORD *pdwType,
             std::wstring *pwstrData);
} // namespace scmtest
