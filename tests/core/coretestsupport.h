// Helpers of the service-core suites: a coordinator of our own on unique pipe names (or the
// real ones), driven like the shell drives it; a trace session that captures what the service
// traces; collector clients on threads of their own; and the delivered trace files, read back
// by an independent strict JSON parser. The test thread reads every record under its lock and
// waits with a time limit.
#pragma once

#include "service/telvaneservice.h"
#include "tests/common/testsupport.h"
#include "tests/pipe/pipetestsupport.h"
#include "client/cactivityclient.h"
#include "client/ccollectorclient.h"

#include <rapidjson/document.h>

#include <gtest/gtest.h>
#include <atomic>
#include <functional>
#include <memory>
#include <mutex>
#include <string>
#include <thread>
#include <vector>

namespace coretest
{
const DWORD c_dwWaitMs = 20000;

GUID NewGuid();
std::string GuidText(const GUID &guid);

// Polls the condition (every few milliseconds) until it holds or time runs out.
bool WaitUntil(const std::function<bool()> &pred, DWORD dwTimeoutMs = c_dwWaitMs);

// Every event the service traces while it lives, as "id|text[|code]" lines.
class CTraceSession
{
public:
    CTraceSession();
    ~CTraceSession();
    std::vector<std::string> Lines() const;
    size_t Count(const std::string &text) const; // lines whose text part equals text
    bool WaitFor(const std::string &text, size_t c = 1, DWORD dwTimeoutMs = c_dwWaitMs) const;
    // Turns the session off and on again: heavy runs need not pay for what nobody reads.
    void Enable(bool fEnable);
};

// The coordinator as the shell runs it, with its status readable.
class CTestCoordinator : public TelvaneService
{
public:
    CTestCoordinator(const wchar_t *wszActivityPipe, const wchar_t *wszCollectorPipe)
        : TelvaneService(wszActivityPipe, wszCollectorPipe)
    {
    }
    DWORD State() const { return m_status.dwCurrentState; }
    DWORD ExitCode() const { return m_status.dwWin32ExitCode; }
};

// Sets the delivery values so that every log is written to a file and nothing is submitted,
// and makes the folders above the log directory.
void EnableFileDelivery();

// One delivered log, parsed strictly, with its file.
struct DeliveredLog
{
    std::wstring wstrPath;
    std::shared_ptr<rapidjson::Document> doc;
};
// The logs delivered for the run logId, in LogCount order; unparsable files that name it fail
// the test.
std::vector<DeliveredLog> LogsOf(const GUID &logId);
// Waits until at least c logs of the run are there.
std::vector<DeliveredLog> WaitForLogs(const GUID &logId, size_t c, DWORD dwTimeoutMs = c_dwWaitMs);
void DeleteLogsOf(const GUID &logId);
// The values recorded under the group of id ("ID" + text) in the log, as JSON text each.
std::vector<std::string> GroupValues(const rapidjson::Value &log, const GUID &id);
std::string JsonText(const rapidjson::Value &value);

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
    bool WaitEnded(DWORD dwTimeoutMs = c_dwWaitMs);
    // The LogIDs of the requests in the order they came.
    std::vector<GUID> RequestLogIds() const;
    // Holds the next answers until Release (the collector stays busy meanwhile).
    void Hold();
    void Release();
    // Drops the connection without a goodbye.
    void Vanish();
    void Stop();

private:
    void Run();

    std::wstring m_wstrPipe;
    GUID m_collectorId;
    std::string m_strResult;
    size_t m_cRequests;
    mutable std::mutex m_lock;
    std::vector<GUID> m_rgLogIds;
    std::atomic<bool> m_fRegistered;
    std::atomic<bool> m_fEnded;
    std::atomic<bool> m_fStop;
    std::atomic<bool> m_fHold;
    std::atomic<bool> m_fVanish;
    std::thread m_thread;
};

// Base fixture: a started coordinator on unique pipe names, traces captured, failure reports
// captured (any fails the test), and at the end a stop that must drain everything.
class CCoreTest : public ::testing::Test
{
protected:
    void SetUp() override;
    void TearDown() override;

    // The shell's start and stop; Stop checks that nothing is left.
    void Start();
    void Stop();

    // A started activity client; its events and its end are the test's.
    std::unique_ptr<CActivityClient> StartActivity(const GUID &activityId, const GUID &logId);
    // Connects, starts, sends the events (JSON text each under its event ID) and stops.
    void RunActivity(const GUID &activityId, const GUID &logId,
                     const std::vector<std::pair<GUID, std::string>> &rgEvents);

    testsupport::FailureCapture m_failures;
    CTraceSession m_trace;
    std::wstring m_wstrActivityPipe;
    std::wstring m_wstrCollectorPipe;
    std::unique_ptr<CTestCoordinator> m_pService;
    bool m_fStopped = false;
    std::vector<GUID> m_rgLogIds; // runs whose files the test removes at the end
};
} // namespace coretest
