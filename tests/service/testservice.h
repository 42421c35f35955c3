// A service for in-process tests of the shell: it records what the shell calls on it and
// opens the shell's protected state to the tests. Tests run it on their own threads; the
// counters are interlocked.
#pragma once

#include "servicelib/service.h"

#include <string>

class CTestService : public CService
{
public:
    enum class StartMode
    {
        ReportRunning,
        StopItself
    };

    explicit CTestService(const wchar_t *wszName, StartMode mode = StartMode::ReportRunning)
        : m_wstrName(wszName)
        , m_mode(mode)
    {
        m_wszServiceName = m_wstrName.c_str();
    }

    void OnStart() override
    {
        InterlockedIncrement(&m_cStarts);
        SetStatus(SERVICE_RUNNING);
        if (m_mode == StartMode::StopItself)
        {
            SetStatus(SERVICE_STOPPED);
        }
        // A start on the thread pool must be over before the test's service goes away.
        if (m_hStartDone != nullptr)
        {
            SetEvent(m_hStartDone);
        }
    }

    void OnStop() override
    {
        m_dwStopThread = GetCurrentThreadId();
        if (m_hStopEntered != nullptr)
        {
            SetEvent(m_hStopEntered);
        }
        if (m_hStopRelease != nullptr)
        {
            WaitForSingleObject(m_hStopRelease, 10000);
        }
        InterlockedIncrement(&m_cStops);
        SetStatus(SERVICE_STOPPED);
        // The window between STOPPED and the end of OnStop, in which the host may already
        // start the service again.
        if (m_hStoppedReported != nullptr)
        {
            SetEvent(m_hStoppedReported);
        }
        if (m_hStopFinish != nullptr)
        {
            WaitForSingleObject(m_hStopFinish, 10000);
        }
    }

    void OnRegister() override { InterlockedIncrement(&m_cRegisters); }
    void OnUnregister() override { InterlockedIncrement(&m_cUnregisters); }

    // The shell's state, for the tests.
    using CService::m_fAcceptControl;
    using CService::m_fAcceptPauseContinue;
    using CService::m_fAcceptPowerEvents;
    using CService::m_hServiceStatus;
    using CService::m_hStopEvent;
    using CService::m_hStopWait;
    using CService::m_idsDescription;
    using CService::m_idsLocalizedName;
    using CService::m_status;
    using CService::m_ulServiceBit;
    using CService::m_ulStartType;

    static CService *FirstService() { return s_pFirstService; }
    static const wchar_t *Group() { return s_wszSvchostGroup; }
    static HANDLE ConsoleEvent() { return s_hConsoleEvent; }

    // Host mode as the DLL's exports leave it, and back to a plain program.
    static void SetHostMode(bool fSvchost, const wchar_t *wszGroup, SVCHOST_GLOBAL_DATA *pGlobals)
    {
        s_fSvchost = fSvchost;
        s_wszSvchostGroup = wszGroup;
        s_pSvchostGlobals = pGlobals;
    }

    volatile LONG m_cStarts = 0;
    volatile LONG m_cStops = 0;
    volatile LONG m_cRegisters = 0;
    volatile LONG m_cUnregisters = 0;
    volatile DWORD m_dwStopThread = 0;
    HANDLE m_hStopEntered = nullptr;
    HANDLE m_hStopRelease = nullptr;
    HANDLE m_hStartDone = nullptr;
    HANDLE m_hStoppedReported = nullptr;
    HANDLE m_hStopFinish = nullptr;

private:
    std::wstring m_wstrName;
    StartMode m_mode;
};

// A service that overrides every optional handler, recording the last call.
class CRecordingService : public CTestService
{
public:
    explicit CRecordingService(const wchar_t *wszName)
        : CTestService(wszName)
    {
    }

    void OnPause() override { m_wstrLast = L"Pause"; }
    void OnContinue() override { m_wstrLast = L"Continue"; }
    void OnControl(ULONG ulControl, void *pvEventData) override
    {
        m_wstrLast = L"Control " + std::to_wstring(ulControl);
        m_pvLastData = pvEventData;
    }
    void OnDeviceEvent(ULONG ulEventType, void *pvEventData) override
    {
        m_wstrLast = L"DeviceEvent " + std::to_wstring(ulEventType);
        m_pvLastData = pvEventData;
    }
    void OnPowerEvent(ULONG ulEventType, void *pvEventData) override
    {
        m_wstrLast = L"PowerEvent " + std::to_wstring(ulEventType);
        m_pvLastData = pvEventData;
    }
    void OnShutdown() override { m_wstrLast = L"Shutdown"; }

    std::wstring m_wstrLast;
    void *m_pvLastData = nullptr;
};
