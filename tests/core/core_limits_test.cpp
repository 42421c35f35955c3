// What clients can make the service hold: one log is flushed early once it holds more than its
// bound, and unfinished items of all connections together stay within the service's budget.
#include "tests/core/coretest.h"
#include "servicelib/cpipereassembly.h"

using namespace coretest;

using CoreLimits = CCoreTest;

TEST_F(CoreLimits, ChattyActivityIsFlushedEarlyAndLosesNothing)
{
    GUID logId = NewGuid();
    GUID eventId = NewGuid();
    const size_t cEvents = 6;
    const size_t cbEvent = 1024 * 1024;
    std::unique_ptr<CActivityClient> client = StartActivity(NewGuid(), logId);
    for (size_t i = 0; i < cEvents; i++)
    {
        std::string text = "\"" + std::to_string(i) + std::string(cbEvent, 'v') + "\"";
        ASSERT_EQ(S_OK, client->SendEvent(eventId, text.data(), text.size()));
    }
    EXPECT_EQ(S_OK, client->Stop());
    ASSERT_TRUE(m_trace.WaitFor("TelvaneService::ReportoperationComplete()", 1));

    std::vector<DeliveredLog> rgLogs = LogsOf(logId);
    ASSERT_EQ(2u, rgLogs.size());
    size_t cValues = 0;
    for (size_t i = 0; i < rgLogs.size(); i++)
    {
        const rapidjson::Value &log = *rgLogs[i].doc;
        EXPECT_EQ(i + 1, log["LogCount"].GetUint());
        // Only the run's last log ends it.
        EXPECT_EQ(i + 1 == rgLogs.size(), log["LogEnd"].GetBool());
        for (const std::string &value : GroupValues(log, eventId))
        {
            EXPECT_EQ("\"" + std::to_string(cValues), value.substr(0, 2)) << i;
            cValues++;
        }
    }
    EXPECT_EQ(cEvents, cValues);
}

// The budget shared by all connections, with small numbers: each row adds parts to several
// buffers and says what the last addition gives; then the service's own budget.
TEST(CoreReassemblyBudget, BoundsUnfinishedItemsOfAllConnections)
{
    struct Step
    {
        size_t iBuffer;
        size_t cb;
        bool fComplete;
        PIPE_PART_RESULT expected;
        uint64_t cbUsedAfter;
    };
    const Step rgSteps[] = {
        {0, 40, false, PipePartMore, 40},       {1, 40, false, PipePartMore, 80},
        {2, 30, false, PipePartOverBudget, 80}, // would pass 100: closed, nothing held
        {2, 20, false, PipePartMore, 100},      // exactly the budget
        {0, 1, false, PipePartOverBudget, 60},  // the offender's own bytes go back
        {1, 50, false, PipePartOverBudget, 20}, {2, 50, true, PipePartComplete, 70},
        {3, 50, false, PipePartTooLarge, 70}, // the per-item cap comes first
    };
    CPipeReassemblyBudget budget(100);
    std::vector<std::unique_ptr<CPipeReassembly>> rgBuffers;
    for (int i = 0; i < 4; i++)
    {
        rgBuffers.emplace_back(new CPipeReassembly(i == 3 ? 49 : 1000, &budget));
    }
    std::vector<uint8_t> vb(100, 0x41);
    for (size_t i = 0; i < sizeof(rgSteps) / sizeof(rgSteps[0]); i++)
    {
        const Step &step = rgSteps[i];
        EXPECT_EQ(step.expected,
                  rgBuffers[step.iBuffer]->AddPart(vb.data(), step.cb, step.fComplete))
            << "step " << i;
        EXPECT_EQ(step.cbUsedAfter, budget.Used()) << "step " << i;
    }
    // A completed item leaves the budget once it is handed on.
    EXPECT_EQ(70u, rgBuffers[2]->Take().size());
    EXPECT_EQ(0u, budget.Used());
    rgBuffers[0]->AddPart(vb.data(), 5, false);
    rgBuffers.clear();
    EXPECT_EQ(0u, budget.Used());

    // The service's own budget is the one all its connections share.
    CPipeReassembly item(TELVANE_MAX_ITEM, &PipeReassemblyServiceBudget());
    uint64_t cbBefore = PipeReassemblyServiceBudget().Used();
    EXPECT_EQ(PipePartMore, item.AddPart(vb.data(), vb.size(), false));
    EXPECT_EQ(cbBefore + vb.size(), PipeReassemblyServiceBudget().Used());
    item.Clear();
    EXPECT_EQ(cbBefore, PipeReassemblyServiceBudget().Used());
}
