// Many clients at once: every event and every result lands in exactly one delivered log,
// nothing lost (events sent right after the start included) and nothing duplicated.
#include "tests/core/coretest.h"
#include "service/cserviceoperation.h"

#include <atomic>
#include <set>
#include <thread>

using namespace coretest;

namespace
{
// On a busy two-core machine under Wine a step may wait long for its turn; the test is about
// what arrives, not how fast.
const DWORD c_dwLoadStepMs = 240000;

using CoreLoad = CCoreTest;
} // namespace

TEST_F(CoreLoad, TwoHundredActivitiesAndFiftyCollectors)
{
    const size_t cCollectors = 50;
    const size_t cActivities = 200;
    const size_t cEvents = 50;

    std::vector<GUID> rgCollectorIds(cCollectors);
    std::vector<std::unique_ptr<CCollectorThread>> rgCollectors;
    for (size_t i = 0; i < cCollectors; i++)
    {
        rgCollectorIds[i] = NewGuid();
        rgCollectors.push_back(StartCollector(rgCollectorIds[i], "\"r" + std::to_string(i) + "\""));
    }
    // From here on the service traces into nothing, as it does on a phone without a session.
    m_trace.Enable(false);

    std::vector<GUID> rgLogIds(cActivities);
    for (GUID &logId : rgLogIds)
    {
        logId = NewGuid();
        m_rgLogIds.push_back(logId);
    }
    GUID eventId = NewGuid();
    std::atomic<size_t> cFailed(0);
    std::atomic<HRESULT> hrFailure(S_OK);
    std::vector<std::thread> rgThreads;
    for (size_t i = 0; i < cActivities; i++)
    {
        rgThreads.emplace_back([&, i] {
            CActivityClient client(c_dwLoadStepMs);
            HRESULT hr = client.Connect(ActivityPipe().c_str());
            hr = SUCCEEDED(hr) ? client.Start(NewGuid(), rgLogIds[i]) : hr;
            for (size_t e = 0; SUCCEEDED(hr) && e < cEvents; e++)
            {
                std::string text = std::to_string(e);
                hr = client.SendEvent(eventId, text.data(), text.size());
            }
            hr = SUCCEEDED(hr) ? client.Stop() : hr;
            if (FAILED(hr))
            {
                cFailed++;
                hrFailure = hr;
            }
        });
    }
    for (std::thread &t : rgThreads)
    {
        t.join();
    }
    ASSERT_EQ(0u, cFailed.load()) << "clients failed, one with 0x" << std::hex << hrFailure.load();
    // Every operation has completed and gone once its last log is out.
    ASSERT_TRUE(WaitUntil([] { return CServiceOperation::LiveCount() == 0; }, c_dwLoadStepMs));

    std::vector<std::string> rgExpectedEvents;
    for (size_t e = 0; e < cEvents; e++)
    {
        rgExpectedEvents.push_back(std::to_string(e));
    }
    std::set<std::wstring> files;
    RunLogs mapLogs = LogsByRun();
    for (size_t i = 0; i < cActivities; i++)
    {
        std::vector<DeliveredLog> &rgLogs = mapLogs[GuidText(rgLogIds[i])];
        ASSERT_EQ(1u, rgLogs.size()) << i;
        const rapidjson::Value &log = *rgLogs[0].doc;
        EXPECT_TRUE(EndsRun(log));
        EXPECT_EQ(rgExpectedEvents, GroupValues(log, eventId)) << i;
        for (size_t c = 0; c < cCollectors; c++)
        {
            EXPECT_EQ((std::vector<std::string>{"\"r" + std::to_string(c) + "\""}),
                      GroupValues(log, rgCollectorIds[c]))
                << i << " " << c;
        }
        files.insert(rgLogs[0].wstrPath);
    }
    EXPECT_EQ(cActivities, files.size());
    for (auto &collector : rgCollectors)
    {
        EXPECT_EQ(cActivities, collector->RequestLogIds().size());
    }
}
