// A stop drains whatever is going on: no clients, clients in the middle of an event, a
// collection outstanding, a retiring operation, a hundred clients, clients still arriving. The
// fixture's stop checks that nothing is left and every tagged count is back to zero.
#include "tests/core/coretestsupport.h"

#include <thread>

using namespace coretest;

namespace
{
class CoreStop : public CCoreTest
{
protected:
    void WaitForStarts(size_t c)
    {
        ASSERT_TRUE(m_trace.WaitFor("TelvaneService::ReportConnectedActivity()", c));
    }
};

const char c_szDone[] =
    "TelvaneService::WaitForDestroyComplete() - all IDestroyables complete, we're done";
} // namespace

TEST_F(CoreStop, WithNoClients)
{
    Stop();
    EXPECT_EQ(1u, m_trace.Count(c_szDone));
    // Both listeners were torn down as never-identified endpoints.
    EXPECT_LE(2u, m_trace.Count("CServiceActivity::Dispatch_AdvanceCompletion() - destruction "
                                "complete, setting event"));
}

TEST_F(CoreStop, WithClientsInTheMiddleOfAnEvent)
{
    GUID logId = NewGuid();
    GUID eventId = NewGuid();
    std::unique_ptr<CActivityClient> client = StartActivity(NewGuid(), logId);
    EXPECT_EQ(S_OK, client->SendEvent(eventId, "\"whole\"", 7));
    // Half an event: a first part whose last part never comes.
    TELVANE_ACTIVITY_EVENT header = {TELVANE_ACTIVITY_EVENT_OPCODE, {}, 0, 3};
    BYTE rgb[sizeof(header) + 3 + TELVANE_ACTIVITY_EVENT_TRAILER] = {};
    CopyMemory(rgb, &header, sizeof(header));
    CopyMemory(rgb + sizeof(header), "\"ha", 3);
    EXPECT_EQ(S_OK, client->Pipe().WriteMessage(rgb, sizeof(rgb), c_dwWaitMs));
    ASSERT_TRUE(m_trace.WaitFor("CServiceActivity::IncomingMessage() - MULTIPART"));
    Stop();
    std::vector<DeliveredLog> rgLogs = LogsOf(logId);
    ASSERT_EQ(1u, rgLogs.size());
    EXPECT_TRUE((*rgLogs[0].doc)["LogEnd"].GetBool());
    EXPECT_EQ((std::vector<std::string>{"\"whole\""}), GroupValues(*rgLogs[0].doc, eventId));
}

TEST_F(CoreStop, WithACollectionOutstanding)
{
    GUID collectorId = NewGuid();
    CCollectorThread collector(m_wstrCollectorPipe, collectorId, "\"late\"");
    ASSERT_TRUE(collector.WaitRegistered());
    ASSERT_TRUE(m_trace.WaitFor("TelvaneService::ReportConnectedCollector()", 1));
    collector.Hold();
    GUID logId = NewGuid();
    GUID eventId = NewGuid();
    std::unique_ptr<CActivityClient> client = StartActivity(NewGuid(), logId);
    EXPECT_EQ(S_OK, client->SendEvent(eventId, "1", 1));
    ASSERT_TRUE(collector.WaitRequests(1));
    ASSERT_TRUE(m_trace.WaitFor("CServiceOperation::ActivityEvent()", 1));
    Stop();
    // The collection ended with no content when the collector's pipe was closed.
    EXPECT_EQ(1u, m_trace.Count("CServiceCollector::PipeBroken  - ERROR, the pipe was broken "
                                "during a collection - sending an error response"));
    std::vector<DeliveredLog> rgLogs = LogsOf(logId);
    ASSERT_EQ(1u, rgLogs.size());
    EXPECT_EQ((std::vector<std::string>{"1"}), GroupValues(*rgLogs[0].doc, eventId));
    EXPECT_TRUE(GroupValues(*rgLogs[0].doc, collectorId).empty());
}

TEST_F(CoreStop, WithARetiringOperationDraining)
{
    GUID collectorId = NewGuid();
    CCollectorThread collector(m_wstrCollectorPipe, collectorId, "\"late\"");
    ASSERT_TRUE(collector.WaitRegistered());
    ASSERT_TRUE(m_trace.WaitFor("TelvaneService::ReportConnectedCollector()", 1));
    collector.Hold();
    GUID activityId = NewGuid();
    GUID logFirst = NewGuid();
    std::unique_ptr<CActivityClient> first = StartActivity(activityId, logFirst);
    EXPECT_EQ(S_OK, first->SendEvent(NewGuid(), "1", 1));
    ASSERT_TRUE(collector.WaitRequests(1));
    ASSERT_TRUE(m_trace.WaitFor("CServiceOperation::ActivityEvent()", 1));
    // The second start retires the first operation, which still waits for its collection.
    std::unique_ptr<CActivityClient> second = StartActivity(activityId, NewGuid());
    WaitForStarts(2);
    Stop();
    EXPECT_EQ(1u, LogsOf(logFirst).size());
}

TEST_F(CoreStop, WithAHundredClientsConnected)
{
    const size_t cActivities = 100;
    std::vector<std::unique_ptr<CCollectorThread>> rgCollectors;
    for (int i = 0; i < 5; i++)
    {
        rgCollectors.emplace_back(new CCollectorThread(m_wstrCollectorPipe, NewGuid(), "0"));
        ASSERT_TRUE(rgCollectors.back()->WaitRegistered());
    }
    std::vector<GUID> rgLogIds;
    std::vector<std::unique_ptr<CActivityClient>> rgClients;
    GUID eventId = NewGuid();
    for (size_t i = 0; i < cActivities; i++)
    {
        rgLogIds.push_back(NewGuid());
        rgClients.push_back(StartActivity(NewGuid(), rgLogIds.back()));
        EXPECT_EQ(S_OK, rgClients.back()->SendEvent(eventId, "1", 1));
    }
    ASSERT_TRUE(m_trace.WaitFor("CServiceOperation::ActivityEvent()", cActivities));
    Stop();
    for (const GUID &logId : rgLogIds)
    {
        EXPECT_EQ(1u, LogsOf(logId).size());
    }
}

// Clients that start while the stop runs: a start handled after the destroy request leaves
// no listener and no operation behind, so the drain completes.
TEST_F(CoreStop, WhileClientsKeepArriving)
{
    std::atomic<bool> fStop(false);
    std::vector<std::thread> rgThreads;
    for (int i = 0; i < 6; i++)
    {
        rgThreads.emplace_back([&] {
            while (!fStop)
            {
                CActivityClient client(2000);
                if (SUCCEEDED(client.Connect(m_wstrActivityPipe.c_str())) &&
                    SUCCEEDED(client.Start(NewGuid(), NewGuid())))
                {
                    client.SendEvent(NewGuid(), "1", 1);
                }
                client.Close();
                CCollectorClient collector(2000);
                if (SUCCEEDED(collector.Connect(m_wstrCollectorPipe.c_str())))
                {
                    collector.Register(NewGuid());
                }
                collector.Close();
            }
        });
    }
    ASSERT_TRUE(m_trace.WaitFor("TelvaneService::ReportConnectedActivity()", 20));
    Stop();
    fStop = true;
    for (std::thread &t : rgThreads)
    {
        t.join();
    }
}
