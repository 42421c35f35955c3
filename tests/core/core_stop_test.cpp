// A stop drains whatever is going on (with no clients: every test's end): a collection
// outstanding beside a half-sent event, a retiring operation, clients still arriving (a hundred
// clients connected at once: CoreScm, under the control manager). The fixture's stop checks
// that nothing is left and every tagged count is back to zero.
#include "tests/core/coretest.h"
#include "client/ccollectorclient.h"
#include "inc/telvanepipe.h"

#include <atomic>
#include <thread>

using namespace coretest;

using CoreStop = CCoreTest;

// The collection ends with no content when the stop closes the collector's pipe, whether its
// operation still runs (its client in the middle of an event, whose parts so far are dropped)
// or was retired by a second start of its activity.
TEST_F(CoreStop, WithACollectionOutstanding)
{
    for (bool fRetired : {false, true})
    {
        SCOPED_TRACE(fRetired ? "retired operation" : "running operation");
        if (fRetired)
        {
            m_pService.reset(new CTestCoordinator());
            m_pService->StartAndWait();
            m_fStopped = false;
            m_trace.Clear();
        }
        GUID collectorId = NewGuid();
        std::unique_ptr<CCollectorThread> collector = StartCollector(collectorId, "\"late\"", true);
        GUID activityId = NewGuid();
        GUID logId = NewGuid();
        GUID eventId = NewGuid();
        std::unique_ptr<CActivityClient> client = StartActivity(activityId, logId);
        SendEvent(*client, eventId, "1");
        ASSERT_TRUE(collector->WaitRequests(1));
        ASSERT_TRUE(m_trace.WaitFor(c_szActivityEvent, 1));
        std::unique_ptr<CActivityClient> second;
        if (fRetired)
        {
            second = StartActivity(activityId, NewGuid());
            WaitForStarts(2);
        }
        else
        {
            // Half an event: a first part whose last part never comes.
            TELVANE_ACTIVITY_EVENT header = {TELVANE_ACTIVITY_EVENT_OPCODE, {}, 0, 3};
            BYTE rgb[sizeof(header) + 3 + TELVANE_ACTIVITY_EVENT_TRAILER] = {};
            CopyMemory(rgb, &header, sizeof(header));
            CopyMemory(rgb + sizeof(header), "\"ha", 3);
            EXPECT_EQ(S_OK, client->Pipe().WriteMessage(rgb, sizeof(rgb), c_dwWaitMs));
            ASSERT_TRUE(m_trace.WaitFor("CServiceActivity::IncomingMessage() - MULTIPART"));
        }
        Stop();
        EXPECT_EQ(1u, m_trace.Count(c_szCollectorBroken));
        EXPECT_EQ((std::vector<std::string>{"1"}), OnlyLogValues(logId, eventId));
        EXPECT_EQ(std::vector<std::string>(), OnlyLogValues(logId, collectorId));
    }
}

// Clients that start while the stop runs: a start handled after the destroy request leaves
// no listener and no operation behind, so the drain completes.
TEST_F(CoreStop, WhileClientsKeepArriving)
{
    std::atomic<bool> fStop(false);
    std::mutex lockLogIds;
    std::vector<std::thread> rgThreads;
    for (int i = 0; i < 6; i++)
    {
        rgThreads.emplace_back([&] {
            while (!fStop)
            {
                GUID logId = NewGuid();
                {
                    std::lock_guard<std::mutex> guard(lockLogIds);
                    m_rgLogIds.push_back(logId);
                }
                CActivityClient client(2000);
                if (SUCCEEDED(client.Connect(ActivityPipe().c_str())) &&
                    SUCCEEDED(client.Start(NewGuid(), logId)))
                {
                    client.SendEvent(NewGuid(), "1", 1);
                }
                client.Close();
                CCollectorClient collector(2000);
                if (SUCCEEDED(collector.Connect(CollectorPipe().c_str())))
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
