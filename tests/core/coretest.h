// The service-core suites' fixture: a coordinator of the test's own on unique pipe names,
// started as the shell starts it, with its traces and failure reports captured and every log
// delivered to a file; at the end a stop that must drain everything. The test thread owns the
// coordinator and drives it; clients run wherever the test puts them.
#pragma once

#include "client/cactivityclient.h"
#include "tests/common/coordinator.h"
#include "tests/common/tracefiles.h"
#include "tests/common/tracesession.h"

#include <gtest/gtest.h>
#include <map>
#include <memory>
#include <string>
#include <utility>
#include <vector>

namespace coretest
{
using namespace testsupport;

const char c_szActivityEvent[] = "CServiceOperation::ActivityEvent()";
const char c_szCollectorConnected[] = "TelvaneService::ReportConnectedCollector()";
const char c_szCollectorBroken[] = "CServiceCollector::PipeBroken  - ERROR, the pipe was broken "
                                   "during a collection - sending an error response";

inline bool EndsRun(const rapidjson::Value &log)
{
    auto it = log.FindMember("LogEnd");
    return it != log.MemberEnd() && it->value.IsTrue();
}

// The values under id in the run's one delivered log, which must end the run; waits for it.
inline std::vector<std::string> OnlyLogValues(const GUID &logId, const GUID &id)
{
    std::vector<DeliveredLog> rgLogs = WaitForLogs(logId, 1);
    if (rgLogs.size() != 1)
    {
        return {std::to_string(rgLogs.size()) + " logs"};
    }
    EXPECT_TRUE(EndsRun(*rgLogs[0].doc)) << rgLogs[0].strText.substr(0, 300);
    return GroupValues(*rgLogs[0].doc, id);
}

// Every delivered log, by its run's LogID, read in one pass over the trace folder.
typedef std::map<std::string, std::vector<DeliveredLog>> RunLogs;
inline RunLogs LogsByRun()
{
    RunLogs mapLogs;
    for (DeliveredLog &log : DeliveredLogs())
    {
        auto it = log.doc->FindMember("LogID");
        if (it != log.doc->MemberEnd() && it->value.IsString())
        {
            mapLogs[it->value.GetString()].push_back(std::move(log));
        }
    }
    return mapLogs;
}

inline void DeleteLogsOfRuns(const std::vector<GUID> &rgLogIds)
{
    RunLogs mapLogs = LogsByRun();
    for (const GUID &logId : rgLogIds)
    {
        for (const DeliveredLog &log : mapLogs[GuidText(logId)])
        {
            DeleteFileW(log.wstrPath.c_str());
        }
    }
}

// The service ended the connection: reads find the pipe broken (skipping what it sent first).
inline bool ClosedByService(CPipeClient &pipe)
{
    HRESULT hr = S_OK;
    for (int i = 0; i < 4 && SUCCEEDED(hr); i++)
    {
        BYTE rgb[64];
        DWORD cb = 0;
        hr = pipe.ReadMessage(rgb, sizeof(rgb), &cb, c_dwWaitMs);
    }
    return hr == HRESULT_FROM_WIN32(ERROR_BROKEN_PIPE) ||
           hr == HRESULT_FROM_WIN32(ERROR_PIPE_NOT_CONNECTED) ||
           hr == HRESULT_FROM_WIN32(ERROR_NO_DATA);
}

class CCoreTest : public ::testing::Test
{
protected:
    void SetUp() override
    {
        AllowDelivery(1);
        m_pService.reset(new CTestCoordinator());
        m_pService->StartAndWait();
    }
    void TearDown() override
    {
        Stop();
        m_pService.reset();
        DeleteLogsOfRuns(m_rgLogIds);
        m_failures.ExpectNone();
    }

    // The shell's stop, once; nothing may be left after it.
    void Stop()
    {
        if (!m_fStopped)
        {
            m_fStopped = true;
            m_pService->StopAndCheckDrained();
        }
    }

    const std::wstring &ActivityPipe() const { return m_pService->ActivityPipe(); }
    const std::wstring &CollectorPipe() const { return m_pService->CollectorPipe(); }

    // A connected and started activity client; the run's files go when the test ends.
    std::unique_ptr<CActivityClient> StartActivity(const GUID &activityId, const GUID &logId)
    {
        m_rgLogIds.push_back(logId);
        std::unique_ptr<CActivityClient> client(new CActivityClient(c_dwWaitMs));
        EXPECT_EQ(S_OK, client->Connect(ActivityPipe().c_str()));
        EXPECT_EQ(S_OK, client->Start(activityId, logId));
        return client;
    }
    static void SendEvent(CActivityClient &client, const GUID &eventId, const std::string &strText)
    {
        EXPECT_EQ(S_OK, client.SendEvent(eventId, strText.data(), strText.size()));
    }
    // Starts, sends the events (JSON text each under its event ID) and stops.
    void RunActivity(const GUID &activityId, const GUID &logId,
                     const std::vector<std::pair<GUID, std::string>> &rgEvents)
    {
        std::unique_ptr<CActivityClient> client = StartActivity(activityId, logId);
        for (const auto &event : rgEvents)
        {
            SendEvent(*client, event.first, event.second);
        }
        EXPECT_EQ(S_OK, client->Stop());
    }
    // Waits until the coordinator has handled c activity starts in all.
    void WaitForStarts(size_t c)
    {
        EXPECT_TRUE(m_trace.WaitFor("TelvaneService::ReportConnectedActivity()", c));
    }
    // A collector the coordinator has taken in; a held one leaves its first request unanswered.
    std::unique_ptr<CCollectorThread> StartCollector(const GUID &collectorId,
                                                     const std::string &strResult,
                                                     bool fHold = false, size_t cRequests = 0)
    {
        size_t cBefore = m_trace.Count(c_szCollectorConnected);
        std::unique_ptr<CCollectorThread> collector(
            new CCollectorThread(CollectorPipe(), collectorId, strResult, cRequests));
        EXPECT_TRUE(collector->WaitRegistered());
        EXPECT_TRUE(m_trace.WaitFor(c_szCollectorConnected, cBefore + 1));
        if (fHold)
        {
            collector->Hold();
        }
        return collector;
    }

    FailureCapture m_failures;
    CTraceSession m_trace;
    std::unique_ptr<CTestCoordinator> m_pService;
    bool m_fStopped = false;
    std::vector<GUID> m_rgLogIds; // runs whose files the test removes at the end
};
} // namespace coretest
