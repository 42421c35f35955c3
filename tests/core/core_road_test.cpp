// One activity and its collectors from start to delivered trace, through real pipes into the
// files the service writes, read back member by member.
#include "tests/core/coretest.h"

#include <algorithm>

using namespace coretest;

using CoreRoad = CCoreTest;

// Every collector registered when the run starts is asked, each for this run once.
TEST_F(CoreRoad, OneActivityWithTwoCollectorsIsDeliveredWhole)
{
    GUID collectorId = NewGuid();
    GUID otherId = NewGuid();
    std::string strResult = "{\"collected\":\"" + std::string(3000, 'c') + "\"}";
    std::unique_ptr<CCollectorThread> collector = StartCollector(collectorId, strResult);
    std::unique_ptr<CCollectorThread> other = StartCollector(otherId, "2");

    GUID activityId = NewGuid();
    GUID logId = NewGuid();
    GUID eventA = NewGuid();
    GUID eventB = NewGuid();
    std::string strLong = "\"" + std::string(2500, 'e') + "\""; // three parts
    RunActivity(activityId, logId,
                {{eventA, "{\"n\":1}"}, {eventB, strLong}, {eventA, "[2,3]"}, {eventA, "4"}});

    std::vector<DeliveredLog> rgLogs = WaitForLogs(logId, 1);
    ASSERT_EQ(1u, rgLogs.size());
    const rapidjson::Value &log = *rgLogs[0].doc;

    // The members in their order: the header, the end time, the two event groups and the
    // collectors' groups in any order, then the end mark.
    std::vector<std::string> rgNames = MemberNames(log);
    ASSERT_EQ(15u, rgNames.size());
    EXPECT_EQ(
        (std::vector<std::string>{"ActivityID", "SessionID", "JsonVersion", "LogID", "WiFiConnID",
                                  "LogCount", "TimeStamp", "Orvex", "Phone", "ExecutionTime"}),
        std::vector<std::string>(rgNames.begin(), rgNames.begin() + 10));
    std::vector<std::string> rgGroups(rgNames.begin() + 10, rgNames.begin() + 14);
    std::sort(rgGroups.begin(), rgGroups.end());
    std::vector<std::string> rgExpectedGroups = {"ID" + GuidText(eventA), "ID" + GuidText(eventB),
                                                 "ID" + GuidText(collectorId),
                                                 "ID" + GuidText(otherId)};
    std::sort(rgExpectedGroups.begin(), rgExpectedGroups.end());
    EXPECT_EQ(rgExpectedGroups, rgGroups);
    EXPECT_EQ("LogEnd", rgNames.back());
    // The header's values are TraceDocumentTest's; a run's single log is also its last.
    EXPECT_GE(log["ExecutionTime"].GetUint64(), log["TimeStamp"].GetUint64());
    EXPECT_EQ(GuidText(activityId), log["ActivityID"].GetString());
    EXPECT_EQ(GuidText(logId), log["LogID"].GetString());
    EXPECT_EQ(1u, log["LogCount"].GetUint());
    EXPECT_TRUE(EndsRun(log));
    EXPECT_EQ((std::vector<std::string>{"{\"n\":1}", "[2,3]", "4"}), GroupValues(log, eventA));
    EXPECT_EQ((std::vector<std::string>{strLong}), GroupValues(log, eventB));
    EXPECT_EQ((std::vector<std::string>{strResult}), GroupValues(log, collectorId));
    EXPECT_EQ((std::vector<std::string>{"2"}), GroupValues(log, otherId));
    for (CCollectorThread *pCollector : {collector.get(), other.get()})
    {
        std::vector<GUID> rgAsked = pCollector->RequestLogIds();
        ASSERT_EQ(1u, rgAsked.size());
        EXPECT_EQ(GuidText(logId), GuidText(rgAsked[0]));
    }
}

TEST_F(CoreRoad, ActivityThatRecordedNothingDeliversNothing)
{
    GUID logId = NewGuid();
    RunActivity(NewGuid(), logId, {});
    ASSERT_TRUE(m_trace.WaitFor("CServiceOperation::FlushLog() - nothing to flush"));
    Stop();
    EXPECT_TRUE(LogsOf(logId).empty());
}
