// The service's coordinator run in the test process as the shell runs it, on pipe names of
// its own, and a collector client on a thread of its own (the client library's, as real
// collectors use it). The test thread drives both; the collector's record is read under its
// lock.
#pragma once

#include "service/telvaneservice.h"
#include "tests/common/testsupport.h"

#include <atomic>
#include <mutex>
#include <string>
#include <thread>
#include <vector>

namespace testsupport
{
// The pipe names live in a base of their own: the coordinator keeps pointers to them, so
// they must be made before it.
struct CTestPipeNames
{
    std::wstring m_wstrActivityPipe;
    std::wstring m_wstrCollectorPipe;
};

// The coordinator as the shell runs it, with its status readable.
class CTestCoordinator : private CTestPipeNames, public TelvaneService
{
public:
    // Unique pipe names unless both are given.
    CTestCoordinator(const std::wstring &wstrActivityPipe = std::wstring(),
                     const std::wstring &wstrCollectorPipe = std::wstring());
    DWORD State() const { return m_status.dwCurrentState; }
    DWORD ExitCode() const { return m_status.dwWin32ExitCode; }
    const std::wstring &ActivityPipe() const { return m_wstrActivityPipe; }
    const std::wstring &CollectorPipe() const { return m_wstrCollectorPipe; }

    // The shell's start, waiting for RUNNING; the test fails when it does not come.
    void StartAndWait();
    // The shell's stop; then every endpoint and operation must be gone and every tagged
    // count back to zero.
    void StopAndCheckDrained();
};

// A collector client on its own thread: it registers, then answers each request with the
// payload until Stop, the service ending the connection, or cRequests answers.
class CCollectorThread
{
public:
    CCollectorThread(const std::wstring &wstrPipe, const GUID &collectorId, std::string strResult,
                     size_t cRequests = 0);
    ~CCollectorThread();

    bool WaitRegistered(DWORD dwTimeoutMs = c_dwWaitMs);
    bool WaitRequests(size_t c, DWORD dwTimeoutMs = c_dwWaitMs);
    bool WaitEnded(DWORD dwTimeoutMs = c_dwWaitMs)
    {
        return WaitUntil([&] { return m_fEnded.load(); }, dwTimeoutMs);
    }
    // The LogIDs of the requests in the order they came.
    std::vector<GUID> RequestLogIds() const;
    // Holds the next answers until Release (the collector stays busy meanwhile).
    void Hold() { m_fHold = true; }
    void Release() { m_fHold = false; }
    // Drops the connection without a goodbye (a request it holds stays unanswered).
    void Vanish() { Stop(); }
    void Stop();

private:
    void Run();

    std::wstring m_wstrPipe;
    GUID m_collectorId;
    std::string m_strResult;
    size_t m_cRequests;
    mutable std::mutex m_lock;
    std::vector<GUID> m_rgLogIds;
    std::atomic<bool> m_fRegistered{false};
    std::atomic<bool> m_fEnded{false};
    std::atomic<bool> m_fStop{false};
    std::atomic<bool> m_fHold{false};
    std::thread m_thread;
};
} // namespace testsupport
