// How the coordinator matches activities, operations and collectors: duplicates, reused
// identifiers, collectors shared by several operations, collectors that vanish, and the hourly
// flush (fired through the timer's own entry point).
#include "tests/core/coretestsupport.h"

using namespace coretest;

namespace
{
class CoreCoordinator : public CCoreTest
{
protected:
    // Waits until the coordinator has handled n starts in all.
    void WaitForStarts(size_t c)
    {
        ASSERT_TRUE(m_trace.WaitFor("TelvaneService::ReportConnectedActivity()", c));
    }

    void SendEvent(CActivityClient &client, const GUID &eventId, const std::string &text)
    {
        EXPECT_EQ(S_OK, client.SendEvent(eventId, text.data(), text.size()));
    }

    // The service ended the client's connection: the next read finds the pipe broken.
    static bool ClosedByService(CActivityClient &client)
    {
        BYTE rgb[64];
        DWORD cb = 0;
        HRESULT hr = client.Pipe().ReadMessage(rgb, sizeof(rgb), &cb, c_dwWaitMs);
        return hr == HRESULT_FROM_WIN32(ERROR_BROKEN_PIPE) ||
               hr == HRESULT_FROM_WIN32(ERROR_PIPE_NOT_CONNECTED) ||
               hr == HRESULT_FROM_WIN32(ERROR_NO_DATA);
    }
};
} // namespace

TEST_F(CoreCoordinator, DuplicateActivityIdRetiresTheFirstAndDeliversBoth)
{
    GUID activityId = NewGuid();
    GUID logFirst = NewGuid();
    GUID logSecond = NewGuid();
    GUID eventId = NewGuid();
    std::unique_ptr<CActivityClient> first = StartActivity(activityId, logFirst);
    SendEvent(*first, eventId, "1");
    WaitForStarts(1);
    // Recorded before the second start; an event still on its way when the first run is
    // retired would be dropped with its connection.
    ASSERT_TRUE(m_trace.WaitFor("CServiceOperation::ActivityEvent()", 1));
    std::unique_ptr<CActivityClient> second = StartActivity(activityId, logSecond);
    SendEvent(*second, eventId, "2");

    // The first run is retired: its connection is ended and its log delivered.
    EXPECT_TRUE(ClosedByService(*first));
    std::vector<DeliveredLog> rgFirst = WaitForLogs(logFirst, 1);
    ASSERT_EQ(1u, rgFirst.size());
    EXPECT_EQ((std::vector<std::string>{"1"}), GroupValues(*rgFirst[0].doc, eventId));
    EXPECT_TRUE((*rgFirst[0].doc)["LogEnd"].GetBool());
    EXPECT_EQ(1u, m_trace.Count("**TelvaneService::ReportConnectectedActivity() - destroying our "
                                "old active Operations because of duplicate activty type ID's"));

    SendEvent(*second, eventId, "3");
    EXPECT_EQ(S_OK, second->Stop());
    std::vector<DeliveredLog> rgSecond = WaitForLogs(logSecond, 1);
    ASSERT_EQ(1u, rgSecond.size());
    EXPECT_EQ((std::vector<std::string>{"2", "3"}), GroupValues(*rgSecond[0].doc, eventId));
}

// Clients that reuse a LogID: each activity's end reaches its own operation, both complete,
// and a stop drains them.
TEST_F(CoreCoordinator, ReusedLogIdOfTheSameActivityKeepsBothRuns)
{
    GUID activityId = NewGuid();
    GUID logId = NewGuid();
    GUID eventId = NewGuid();
    std::unique_ptr<CActivityClient> first = StartActivity(activityId, logId);
    SendEvent(*first, eventId, "\"first\"");
    WaitForStarts(1);
    ASSERT_TRUE(m_trace.WaitFor("CServiceOperation::ActivityEvent()", 1));
    std::unique_ptr<CActivityClient> second = StartActivity(activityId, logId);
    EXPECT_TRUE(ClosedByService(*first));
    ASSERT_EQ(1u, WaitForLogs(logId, 1).size());

    // Sent after the first run ended: it belongs to the second run alone.
    SendEvent(*second, eventId, "\"second\"");
    EXPECT_EQ(S_OK, second->Stop());
    std::vector<DeliveredLog> rgLogs = WaitForLogs(logId, 2);
    ASSERT_EQ(2u, rgLogs.size());
    std::vector<std::string> rgValues;
    for (const DeliveredLog &log : rgLogs)
    {
        EXPECT_TRUE((*log.doc)["LogEnd"].GetBool());
        for (const std::string &value : GroupValues(*log.doc, eventId))
        {
            rgValues.push_back(value);
        }
    }
    std::sort(rgValues.begin(), rgValues.end());
    EXPECT_EQ((std::vector<std::string>{"\"first\"", "\"second\""}), rgValues);
}

TEST_F(CoreCoordinator, ReusedLogIdOfTwoActivitiesIsDrainedByStop)
{
    GUID logId = NewGuid();
    GUID eventId = NewGuid();
    std::unique_ptr<CActivityClient> first = StartActivity(NewGuid(), logId);
    std::unique_ptr<CActivityClient> second = StartActivity(NewGuid(), logId);
    SendEvent(*first, eventId, "1");
    SendEvent(*second, eventId, "2");
    WaitForStarts(2);
    ASSERT_TRUE(m_trace.WaitFor("CServiceOperation::ActivityEvent()", 2));
    // Both operations retire at once under the same LogID.
    Stop();
    std::vector<DeliveredLog> rgLogs = WaitForLogs(logId, 2);
    EXPECT_EQ(2u, rgLogs.size());
}

TEST_F(CoreCoordinator, DuplicateCollectorIdReplacesTheFirstCollector)
{
    GUID collectorId = NewGuid();
    CCollectorThread first(m_wstrCollectorPipe, collectorId, "\"first\"");
    ASSERT_TRUE(first.WaitRegistered());
    ASSERT_TRUE(m_trace.WaitFor("TelvaneService::ReportConnectedCollector()", 1));
    CCollectorThread second(m_wstrCollectorPipe, collectorId, "\"second\"");
    ASSERT_TRUE(second.WaitRegistered());
    EXPECT_TRUE(first.WaitEnded());
    EXPECT_TRUE(m_trace.WaitFor("**TelvaneService::ReportConnectedCollector() - destroying two "
                                "active Collectors because of duplicate activty ID's"));
    // The replaced collector's disconnect finds its replacement registered and leaves it.
    EXPECT_TRUE(m_trace.WaitFor(
        "TelvaneService::Dispatch_ReportDisconnectedCollector() - encountered a valid collector "
        "with the wrong instance ID, this is okay but may point to a bug in the collector"));

    GUID logId = NewGuid();
    RunActivity(NewGuid(), logId, {});
    std::vector<DeliveredLog> rgLogs = WaitForLogs(logId, 1);
    ASSERT_EQ(1u, rgLogs.size());
    EXPECT_EQ((std::vector<std::string>{"\"second\""}), GroupValues(*rgLogs[0].doc, collectorId));
    EXPECT_TRUE(first.RequestLogIds().empty());
}

TEST_F(CoreCoordinator, ThreeOperationsWaitingForOneCollectorAreServedInOrder)
{
    GUID collectorId = NewGuid();
    CCollectorThread collector(m_wstrCollectorPipe, collectorId, "{\"c\":1}");
    ASSERT_TRUE(collector.WaitRegistered());
    ASSERT_TRUE(m_trace.WaitFor("TelvaneService::ReportConnectedCollector()", 1));
    collector.Hold();

    std::vector<GUID> rgLogIds = {NewGuid(), NewGuid(), NewGuid()};
    std::vector<std::unique_ptr<CActivityClient>> rgClients;
    for (size_t i = 0; i < rgLogIds.size(); i++)
    {
        rgClients.push_back(StartActivity(NewGuid(), rgLogIds[i]));
        WaitForStarts(i + 1);
    }
    // The first is served; the others wait for the collector it holds.
    ASSERT_TRUE(collector.WaitRequests(1));
    EXPECT_EQ(1u, collector.RequestLogIds().size());
    for (auto &client : rgClients)
    {
        EXPECT_EQ(S_OK, client->Stop());
    }
    collector.Release();
    ASSERT_TRUE(collector.WaitRequests(3));
    std::vector<GUID> rgAsked = collector.RequestLogIds();
    ASSERT_EQ(3u, rgAsked.size());
    for (size_t i = 0; i < rgLogIds.size(); i++)
    {
        EXPECT_EQ(GuidText(rgLogIds[i]), GuidText(rgAsked[i])) << i;
        std::vector<DeliveredLog> rgLogs = WaitForLogs(rgLogIds[i], 1);
        ASSERT_EQ(1u, rgLogs.size());
        EXPECT_EQ((std::vector<std::string>{"{\"c\":1}"}),
                  GroupValues(*rgLogs[0].doc, collectorId));
    }
}

TEST_F(CoreCoordinator, CollectorVanishingWhileTwoWaitTellsEachInTurn)
{
    GUID collectorId = NewGuid();
    CCollectorThread collector(m_wstrCollectorPipe, collectorId, "1");
    ASSERT_TRUE(collector.WaitRegistered());
    ASSERT_TRUE(m_trace.WaitFor("TelvaneService::ReportConnectedCollector()", 1));
    collector.Hold();

    std::vector<GUID> rgLogIds = {NewGuid(), NewGuid(), NewGuid()};
    std::vector<std::unique_ptr<CActivityClient>> rgClients;
    for (size_t i = 0; i < rgLogIds.size(); i++)
    {
        rgClients.push_back(StartActivity(NewGuid(), rgLogIds[i]));
        WaitForStarts(i + 1);
    }
    ASSERT_TRUE(collector.WaitRequests(1));
    collector.Vanish();

    // The one being served gets an empty result; the two waiting are told it is missing.
    EXPECT_TRUE(m_trace.WaitFor("CServiceCollector::PipeBroken  - ERROR, the pipe was broken "
                                "during a collection - sending an error response"));
    // One waiting operation is told per pass; the next report makes the next pass.
    const char szMissing[] = "TelvaneService::AdvanceCollections() - a waiting operation needs a "
                             "collector that is missing, alerting that truth";
    EXPECT_TRUE(m_trace.WaitFor(szMissing, 1));
    EXPECT_EQ(S_OK, rgClients[0]->Stop());
    EXPECT_TRUE(m_trace.WaitFor(szMissing, 2));
    EXPECT_EQ(S_OK, rgClients[1]->Stop());
    EXPECT_EQ(S_OK, rgClients[2]->Stop());
    // Nothing was recorded, so nothing is delivered, but every run completes.
    EXPECT_TRUE(m_trace.WaitFor("TelvaneService::ReportoperationComplete()", 3));
    EXPECT_EQ(2u, m_trace.Count(szMissing));
}

TEST_F(CoreCoordinator, HourlyFlushDeliversPartialLogsThenTheFinalOne)
{
    GUID collectorId = NewGuid();
    CCollectorThread collector(m_wstrCollectorPipe, collectorId, "\"result\"");
    ASSERT_TRUE(collector.WaitRegistered());
    ASSERT_TRUE(m_trace.WaitFor("TelvaneService::ReportConnectedCollector()", 1));

    GUID logId = NewGuid();
    GUID eventId = NewGuid();
    std::unique_ptr<CActivityClient> client = StartActivity(NewGuid(), logId);
    SendEvent(*client, eventId, "1");
    ASSERT_TRUE(collector.WaitRequests(1));
    ASSERT_TRUE(m_trace.WaitFor("CServiceOperation::ActivityEvent()", 1));
    ASSERT_TRUE(m_trace.WaitFor("CServiceOperation::CompleteCollectorCollection()", 1));

    m_pService->TimerTick();
    std::vector<DeliveredLog> rgLogs = WaitForLogs(logId, 1);
    ASSERT_EQ(1u, rgLogs.size());
    EXPECT_EQ(1u, (*rgLogs[0].doc)["LogCount"].GetUint());
    EXPECT_FALSE((*rgLogs[0].doc)["LogEnd"].GetBool());
    EXPECT_EQ((std::vector<std::string>{"1"}), GroupValues(*rgLogs[0].doc, eventId));
    // The tick also offered the idle collector to the running operation again.
    ASSERT_TRUE(collector.WaitRequests(2));

    SendEvent(*client, eventId, "2");
    EXPECT_EQ(S_OK, client->Stop());
    rgLogs = WaitForLogs(logId, 2);
    ASSERT_EQ(2u, rgLogs.size());
    EXPECT_EQ(2u, (*rgLogs[1].doc)["LogCount"].GetUint());
    EXPECT_TRUE((*rgLogs[1].doc)["LogEnd"].GetBool());
    EXPECT_EQ((std::vector<std::string>{"2"}), GroupValues(*rgLogs[1].doc, eventId));
    EXPECT_EQ((std::vector<std::string>{"\"result\""}), GroupValues(*rgLogs[1].doc, collectorId));
}
