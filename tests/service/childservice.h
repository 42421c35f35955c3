// The test service of servicetest_child.exe and servicetest.dll. Its behaviour comes from
// the start parameters:
//   hold-start  OnStart never reports RUNNING (to read the START_PENDING report)
//   hold-stop   OnStop waits for the event "Global\<name>_release" (at most 60 s)
//   linger      OnStop keeps its thread (and so the host process) for a second after STOPPED
// At STOPPED it reports the number of breakpoints its program saw as its service-specific
// exit code.
#pragma once

#include "servicelib/service.h"

#include <string>

const DWORD c_dwChildReleaseTimeoutMs = 60000;
const DWORD c_dwChildLingerMs = 1000;
inline volatile LONG g_cChildBreakpoints = 0;

inline bool HasArg(DWORD argc, LPWSTR *argv, const wchar_t *wszArg)
{
    for (DWORD i = 1; i < argc; i++)
    {
        if (wcscmp(argv[i], wszArg) == 0)
        {
            return true;
        }
    }
    return false;
}

// Runs on the dispatcher's service thread (ServiceMain), a thread-pool thread (OnStart) and
// the stop thread (OnStop). One static instance per program.
class CChildService : public CService
{
public:
    // The control manager's name for the service is known only when ServiceMain runs.
    void Configure(DWORD argc, LPWSTR *argv)
    {
        m_wstrName = argv[0];
        m_wszServiceName = m_wstrName.c_str();
        m_fHoldStart = HasArg(argc, argv, L"hold-start");
        m_fHoldStop = HasArg(argc, argv, L"hold-stop");
        m_fLinger = HasArg(argc, argv, L"linger");
    }
    void OnStart() override
    {
        if (!m_fHoldStart)
        {
            SetStatus(SERVICE_RUNNING);
        }
    }
    void OnStop() override
    {
        if (m_fHoldStop)
        {
            std::wstring wstrEvent = L"Global\\" + m_wstrName + L"_release";
            HANDLE hRelease = CreateEventW(nullptr, TRUE, FALSE, wstrEvent.c_str());
            if (hRelease != nullptr)
            {
                WaitForSingleObject(hRelease, c_dwChildReleaseTimeoutMs);
                CloseHandle(hRelease);
            }
        }
        m_status.dwWin32ExitCode = ERROR_SERVICE_SPECIFIC_ERROR;
        m_status.dwServiceSpecificExitCode = static_cast<DWORD>(g_cChildBreakpoints);
        SetStatus(SERVICE_STOPPED);
        if (m_fLinger)
        {
            Sleep(c_dwChildLingerMs);
        }
    }

private:
    std::wstring m_wstrName;
    bool m_fHoldStart = false;
    bool m_fHoldStop = false;
    bool m_fLinger = false;
};
