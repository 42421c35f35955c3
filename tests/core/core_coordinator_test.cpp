// How the coordinator matches activities, operations and collectors: duplicates, reused
// identifiers, collectors shared by several operations, collectors that vanish, and the hourly
// flush (fired through the timer's own entry point).
#include "tests/core/coretest.h"

#include <algorithm>

using namespace coretest;

namespace
{
class CoreCoordinator : public CCoreTest
{
protected:
    // Three runs that all want the one collector, which holds its first request.
    std::vector<std::unique_ptr<CActivityClient>> ThreeRunsWaiting(CCollectorThread &collector,
                                                                   std::vector<GUID> *prgLogIds)
    {
        std::vector<std::unique_ptr<CActivityClient>> rgClients;
        for (size_t i = 0; i < 3; i++)
        {
            prgLogIds->push_back(NewGuid());
            rgClients.push_back(StartActivity(NewGuid(), prgLogIds->back()));
            WaitForStarts(i + 1);
        }
        EXPECT_TRUE(collector.WaitRequests(1));
        return rgClients;
    }
};
} // namespace

// A second start of a running activity retires the first run, which is delivered, and ends its
// connection; with the LogID reused too, each run's end reaches its own operation.
TEST_F(CoreCoordinator, DuplicateActivityIdRetiresTheFirstAndDeliversBoth)
{
    for (bool fSameLog : {false, true})
    {
        SCOPED_TRACE(fSameLog ? "same LogID" : "new LogID");
        GUID activityId = NewGuid();
        GUID logFirst = NewGuid();
        GUID logSecond = fSameLog ? logFirst : NewGuid();
        GUID eventId = NewGuid();
        size_t cEvents = m_trace.Count(c_szActivityEvent);
        std::unique_ptr<CActivityClient> first = StartActivity(activityId, logFirst);
        SendEvent(*first, eventId, "1");
        // Recorded before the second start; an event still on its way when the first run is
        // retired would be dropped with its connection.
        ASSERT_TRUE(m_trace.WaitFor(c_szActivityEvent, cEvents + 1));
        std::unique_ptr<CActivityClient> second = StartActivity(activityId, logSecond);
        EXPECT_TRUE(ClosedByService(first->Pipe()));
        EXPECT_EQ((std::vector<std::string>{"1"}), OnlyLogValues(logFirst, eventId));
        // Sent after the first run ended: it belongs to the second run alone.
        SendEvent(*second, eventId, "2");
        EXPECT_EQ(S_OK, second->Stop());
        std::vector<DeliveredLog> rgLogs = WaitForLogs(logSecond, fSameLog ? 2 : 1);
        std::vector<std::string> rgValues;
        for (const DeliveredLog &log : rgLogs)
        {
            EXPECT_TRUE(EndsRun(*log.doc));
            for (const std::string &value : GroupValues(*log.doc, eventId))
            {
                rgValues.push_back(value);
            }
        }
        std::sort(rgValues.begin(), rgValues.end());
        EXPECT_EQ((fSameLog ? std::vector<std::string>{"1", "2"} : std::vector<std::string>{"2"}),
                  rgValues);
    }
    EXPECT_EQ(2u, m_trace.Count("**TelvaneService::ReportConnectectedActivity() - destroying our "
                                "old active Operations because of duplicate activty type ID's"));
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
    ASSERT_TRUE(m_trace.WaitFor(c_szActivityEvent, 2));
    // Both operations retire at once under the same LogID.
    Stop();
    EXPECT_EQ(2u, WaitForLogs(logId, 2).size());
}

TEST_F(CoreCoordinator, DuplicateCollectorIdReplacesTheFirstCollector)
{
    GUID collectorId = NewGuid();
    std::unique_ptr<CCollectorThread> first = StartCollector(collectorId, "\"first\"");
    std::unique_ptr<CCollectorThread> second = StartCollector(collectorId, "\"second\"");
    EXPECT_TRUE(first->WaitEnded());
    EXPECT_TRUE(m_trace.WaitFor("**TelvaneService::ReportConnectedCollector() - destroying two "
                                "active Collectors because of duplicate activty ID's"));
    // The replaced collector's disconnect finds its replacement registered and leaves it.
    EXPECT_TRUE(m_trace.WaitFor(
        "TelvaneService::Dispatch_ReportDisconnectedCollector() - encountered a valid collector "
        "with the wrong instance ID, this is okay but may point to a bug in the collector"));

    GUID logId = NewGuid();
    RunActivity(NewGuid(), logId, {});
    EXPECT_EQ((std::vector<std::string>{"\"second\""}), OnlyLogValues(logId, collectorId));
    EXPECT_TRUE(first->RequestLogIds().empty());
}

TEST_F(CoreCoordinator, ThreeOperationsWaitingForOneCollectorAreServedInOrder)
{
    GUID collectorId = NewGuid();
    std::unique_ptr<CCollectorThread> collector = StartCollector(collectorId, "{\"c\":1}", true);
    std::vector<GUID> rgLogIds;
    auto rgClients = ThreeRunsWaiting(*collector, &rgLogIds);
    // The first is served; the others wait for the collector it holds.
    EXPECT_EQ(1u, collector->RequestLogIds().size());
    for (auto &client : rgClients)
    {
        EXPECT_EQ(S_OK, client->Stop());
    }
    collector->Release();
    ASSERT_TRUE(collector->WaitRequests(3));
    std::vector<GUID> rgAsked = collector->RequestLogIds();
    ASSERT_EQ(3u, rgAsked.size());
    for (size_t i = 0; i < rgLogIds.size(); i++)
    {
        EXPECT_EQ(GuidText(rgLogIds[i]), GuidText(rgAsked[i])) << i;
        EXPECT_EQ((std::vector<std::string>{"{\"c\":1}"}), OnlyLogValues(rgLogIds[i], collectorId));
    }
}

TEST_F(CoreCoordinator, CollectorVanishingWhileTwoWaitTellsEachInTurn)
{
    std::unique_ptr<CCollectorThread> collector = StartCollector(NewGuid(), "1", true);
    std::vector<GUID> rgLogIds;
    auto rgClients = ThreeRunsWaiting(*collector, &rgLogIds);
    collector->Vanish();

    // The one being served gets an empty result; the two waiting are told it is missing.
    EXPECT_TRUE(m_trace.WaitFor(c_szCollectorBroken));
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
    std::unique_ptr<CCollectorThread> collector = StartCollector(collectorId, "\"result\"");
    GUID logId = NewGuid();
    GUID eventId = NewGuid();
    std::unique_ptr<CActivityClient> client = StartActivity(NewGuid(), logId);
    SendEvent(*client, eventId, "1");
    ASSERT_TRUE(collector->WaitRequests(1));
    ASSERT_TRUE(m_trace.WaitFor(c_szActivityEvent, 1));
    ASSERT_TRUE(m_trace.WaitFor("CServiceOperation::CompleteCollectorCollection()", 1));

    m_pService->TimerTick();
    std::vector<DeliveredLog> rgLogs = WaitForLogs(logId, 1);
    ASSERT_EQ(1u, rgLogs.size());
    EXPECT_EQ(1u, (*rgLogs[0].doc)["LogCount"].GetUint());
    EXPECT_FALSE(EndsRun(*rgLogs[0].doc));
    EXPECT_EQ((std::vector<std::string>{"1"}), GroupValues(*rgLogs[0].doc, eventId));
    // The tick also offered the idle collector to the running operation again.
    ASSERT_TRUE(collector->WaitRequests(2));

    SendEvent(*client, eventId, "2");
    EXPECT_EQ(S_OK, client->Stop());
    rgLogs = WaitForLogs(logId, 2);
    ASSERT_EQ(2u, rgLogs.size());
    EXPECT_EQ(2u, (*rgLogs[1].doc)["LogCount"].GetUint());
    EXPECT_TRUE(EndsRun(*rgLogs[1].doc));
    EXPECT_EQ((std::vector<std::string>{"2"}), GroupValues(*rgLogs[1].doc, eventId));
    EXPECT_EQ((std::vector<std::string>{"\"result\""}), GroupValues(*rgLogs[1].doc, collectorId));
}
