// The prefix's control manager: services created, started, controlled, read back and
// removed with bounded waits, and the product installed as the README says (telvanerun -r,
// the platform component registered) under either host. Used on the test thread.
#pragma once

#include "inc/handleholder.h"
#include "tests/common/testsupport.h"

#include <windows.h>
#include <string>
#include <vector>

namespace testsupport
{
// Polls the service until it reports the state; false (with the last status) on time-out.
bool ServiceWaitForState(const wchar_t *wszService, DWORD dwState, DWORD dwTimeoutMs,
                         SERVICE_STATUS_PROCESS *pStatus = nullptr);
bool ServiceQueryStatus(const wchar_t *wszService, SERVICE_STATUS_PROCESS *pStatus);
bool ServiceExists(const wchar_t *wszService);

// Starts with the given start parameters; returns the error of StartService or 0.
DWORD ServiceStart(const wchar_t *wszService, const std::vector<std::wstring> &rgArgs = {});
// Sends a control; returns its error or 0 and fills *pStatus with what ControlService gave.
DWORD ServiceControl(const wchar_t *wszService, DWORD dwControl, SERVICE_STATUS *pStatus);
// Sends STOP. A service whose handler stops it at once lets its process exit right away, and
// Wine's control manager, reading the handler's answer after that, reports 109 although the
// control was delivered: that counts as sent. Callers check the STOPPED state themselves.
DWORD ServiceStop(const wchar_t *wszService);

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
bool ServiceReadRecord(const wchar_t *wszService, SERVICE_RECORD *pRecord);

// Creates an own-process service running wstrImagePath; false when CreateService failed.
bool ServiceCreateOwnProcess(const wchar_t *wszService, const std::wstring &wstrImagePath);
bool ServiceSetImagePath(const wchar_t *wszService, const std::wstring &wstrImagePath);
// Marks the service for deletion, leaving it as it runs; false when that failed.
bool ServiceDelete(const wchar_t *wszService);
// Stops (bounded) and deletes the service if it exists.
void ServiceStopAndDelete(const wchar_t *wszService);

// Stops and deletes a test service when the test ends, however it ends.
class CServiceCleanup
{
public:
    explicit CServiceCleanup(const std::wstring &wstrService)
        : m_wstrService(wstrService)
    {
    }
    ~CServiceCleanup() { ServiceStopAndDelete(m_wstrService.c_str()); }
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

    bool Opened() const { return m_process.IsValid(); }
    std::wstring ImageName() const;
    // Waits (bounded) for the process to end: its exit code, or STILL_ACTIVE when it did not.
    DWORD WaitForExitCode(DWORD dwTimeoutMs) const;

private:
    CKernelHandle m_process;
};

// The product under its real name, installed and removed with the README's own steps.
extern const wchar_t c_wszTelvane[];
enum class TelvaneHost
{
    Svchost,    // Wine's svchost.exe, as installed
    TelvaneHost // telvanehost.exe -k OVTCBNetwork
};
// telvanerun.exe with these arguments.
ChildResult RunTelvane(const std::wstring &wstrArguments);
// telvanerun -r and regsvr32 of the platform component; the test fails when either fails.
void TelvaneInstall(TelvaneHost host = TelvaneHost::Svchost);
// telvanerun -u, the component unregistered, the service gone whatever state it was in.
void TelvaneUninstall();
// Starts the installed service and waits for RUNNING; its process id, or 0 (test failed).
DWORD TelvaneStart();
// Sends STOP and waits for STOPPED; false when it did not come.
bool TelvaneStop();
} // namespace testsupport
