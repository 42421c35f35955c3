// The test service of servicetest_child.exe and servicetest.dll. Its behaviour comes from
// the start parameters:
//   hold-start  OnStart never reports RUNNING (to read the START_PENDING report)
//   hold-stop   OnStop waits for the event "Global\<name>_release" (at most 60 s)
//   linger      OnStop keeps its thread (and so the host process) for a second after STOPPED
// At STOPPED it reports the number of breakpoints its program saw as its service-specific
// exit code.
#pragma once

#include "servicelib/service.h"

#include <algorithm>
#include <string>

const DWORD c_dwChildReleaseTimeoutMs = 60000;
const DWORD c_dwChildLingerMs = 1000;
inline volatile LONG g_cChildBreakpoints = 0;

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
        auto fnHas = [&](const wchar_t *wszArg) {
            return std::any_of(argv + 1, argv + argc,
                               [&](LPWSTR wsz) { return wcscmp(wsz, wszArg) == 0; });
        };
        m_fHoldStart = fnHas(L"hold-start");
        m_fHoldStop = fnHas(L"hold-stop");
        m_fLinger = fnHas(L"linger");
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
