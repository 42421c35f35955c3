// The client library and telvanectl against the service's coordinator, run in the test process
// on pipes of its own: what the service took is read back from its trace and from the traces
// it delivers. Bare pipe instances stand in for the service only where a test needs what the
// service never does (stay silent, send nonsense, leave no instance free).
#include "client/cactivityclient.h"
#include "client/ccollectorclient.h"
#include "inc/handleholder.h"
#include "servicelib/pipecodec.h"
#include "tests/common/coordinator.h"
#include "tests/common/tracefiles.h"
#include "tests/common/tracesession.h"

#include <gtest/gtest.h>
#include <memory>
#include <thread>

using namespace testsupport;

namespace
{
const DWORD c_dwClientWaitMs = 10000;
const HRESULT c_hrState = HRESULT_FROM_WIN32(ERROR_INVALID_STATE);

// Payload sizes around the part boundaries of both pipes, and one of many parts.
const size_t c_rgcbSizes[] = {0, 1, 1168, 1169, 1188, 1189, 100000};

size_t PartCount(size_t cb, size_t cbMaxPart)
{
    return cb == 0 ? 1 : (cb + cbMaxPart - 1) / cbMaxPart;
}

// JSON text of exactly cb bytes whose characters depend on their place, so that a part out of
// order or a byte lost shows in the delivered trace.
std::string JsonOfSize(size_t cb, char chSeed)
{
    if (cb < 2)
    {
        return std::string(cb, '7');
    }
    std::string str(cb, '"');
    for (size_t i = 1; i + 1 < cb; i++)
    {
        str[i] = static_cast<char>('a' + (chSeed + i * 7 + i / 1000) % 26);
    }
    return str;
}

std::vector<std::string> Values(const std::string &str)
{
    return str.empty() ? std::vector<std::string>() : std::vector<std::string>{str};
}

// A bare instance of a message-mode pipe: clients can open it at once, and it says nothing
// unless the test writes.
HANDLE RawInstance(const std::wstring &wstrName)
{
    return CreateNamedPipeW(wstrName.c_str(), PIPE_ACCESS_DUPLEX,
                            PIPE_TYPE_MESSAGE | PIPE_READMODE_MESSAGE, PIPE_UNLIMITED_INSTANCES,
                            4096, 4096, 0, nullptr);
}

// The coordinator is started for each test and stopped, drained, at its end; clients and
// coordinator are driven from the test thread.
class TelvaneClient : public ::testing::Test
{
protected:
    void SetUp() override
    {
        AllowDelivery();
        m_coordinator.StartAndWait();
    }
    void TearDown() override
    {
        if (m_coordinator.State() != SERVICE_STOPPED)
        {
            m_coordinator.StopAndCheckDrained();
        }
        for (const GUID &logId : m_rgLogIds)
        {
            DeleteLogsOf(logId);
        }
        m_failures.ExpectNone();
    }

    // A LogID whose logs are deleted when the test ends.
    GUID NewLogId()
    {
        m_rgLogIds.push_back(NewGuid());
        return m_rgLogIds.back();
    }
    const wchar_t *ActivityPipe() const { return m_coordinator.ActivityPipe().c_str(); }
    const wchar_t *CollectorPipe() const { return m_coordinator.CollectorPipe().c_str(); }

    FailureCapture m_failures;
    CTraceSession m_trace;
    CTestCoordinator m_coordinator;
    std::vector<GUID> m_rgLogIds;
};
} // namespace

// Every event and result arrives whole, in parts as full as they can be: 1168 bytes fit one
// event part and 1169 need two (1188 and 1189 for results).
TEST_F(TelvaneClient, ItemsOfEverySizeArriveWholeInFullParts)
{
    const size_t c = ARRAYSIZE(c_rgcbSizes);
    std::vector<std::unique_ptr<CCollectorClient>> rgCollectors;
    std::vector<GUID> rgCollectorIds;
    for (size_t i = 0; i < c; i++)
    {
        rgCollectors.emplace_back(new CCollectorClient(c_dwClientWaitMs));
        rgCollectorIds.push_back(NewGuid());
        ASSERT_EQ(S_OK, rgCollectors[i]->Connect(CollectorPipe()));
        ASSERT_EQ(S_OK, rgCollectors[i]->Register(rgCollectorIds[i]));
    }
    ASSERT_TRUE(m_trace.WaitFor("TelvaneService::ReportConnectedCollector()", c));

    CActivityClient activity(c_dwClientWaitMs);
    ASSERT_EQ(S_OK, activity.Connect(ActivityPipe()));
    EXPECT_EQ(TELVANE_PROTOCOL_VERSION, activity.ServiceVersion());
    GUID activityId = NewGuid();
    GUID logId = NewLogId();
    ASSERT_EQ(S_OK, activity.Start(activityId, logId));
    std::vector<GUID> rgEventIds;
    size_t cEventParts = 0;
    size_t cResultParts = 0;
    for (size_t i = 0; i < c; i++)
    {
        SCOPED_TRACE(c_rgcbSizes[i]);
        rgEventIds.push_back(NewGuid());
        std::string strEvent = JsonOfSize(c_rgcbSizes[i], static_cast<char>(i));
        ASSERT_EQ(S_OK, activity.SendEvent(rgEventIds[i], strEvent.data(), strEvent.size()));
        cEventParts += PartCount(strEvent.size(), TELVANE_MAX_EVENT_PART);

        GUID askedActivityId;
        GUID askedLogId;
        ASSERT_EQ(S_OK,
                  rgCollectors[i]->WaitForRequest(&askedActivityId, &askedLogId, c_dwClientWaitMs));
        EXPECT_EQ(GuidText(activityId), GuidText(askedActivityId));
        EXPECT_EQ(GuidText(logId), GuidText(askedLogId));
        std::string strResult = JsonOfSize(c_rgcbSizes[i], static_cast<char>(i + 13));
        ASSERT_EQ(S_OK, rgCollectors[i]->SendResult(strResult.data(), strResult.size()));
        cResultParts += PartCount(strResult.size(), TELVANE_MAX_RESULT_PART);
    }
    ASSERT_EQ(S_OK, activity.Stop());

    std::vector<DeliveredLog> rgLogs = WaitForLogs(logId, 1);
    ASSERT_EQ(1u, rgLogs.size());
    for (size_t i = 0; i < c; i++)
    {
        SCOPED_TRACE(c_rgcbSizes[i]);
        // An empty item has nothing to record.
        EXPECT_EQ(Values(JsonOfSize(c_rgcbSizes[i], static_cast<char>(i))),
                  GroupValues(*rgLogs[0].doc, rgEventIds[i]));
        EXPECT_EQ(Values(JsonOfSize(c_rgcbSizes[i], static_cast<char>(i + 13))),
                  GroupValues(*rgLogs[0].doc, rgCollectorIds[i]));
    }
    EXPECT_EQ(cEventParts, m_trace.Count(c_szPipeTraceActivityEvent));
    EXPECT_EQ(cResultParts, m_trace.Count(c_szPipeTraceCollectorResult));
}

// Calls out of order and arguments the protocol cannot carry are refused before anything is
// sent (the service would close the pipe on a second start or registration, and drop an event
// before the start), and leave a live connection as it was.
TEST_F(TelvaneClient, RefusedCallsSendNothingAndKeepTheConnection)
{
    CActivityClient activity(c_dwClientWaitMs);
    CCollectorClient collector(c_dwClientWaitMs);
    GUID eventId = NewGuid();
    GUID collectorId = NewGuid();
    GUID activityId;
    GUID logId;
    EXPECT_EQ(c_hrState, activity.Start(eventId, eventId));
    EXPECT_EQ(c_hrState, activity.SendEvent(eventId, "1", 1));
    EXPECT_EQ(c_hrState, activity.Stop());
    EXPECT_EQ(c_hrState, collector.Register(collectorId));
    EXPECT_EQ(c_hrState, collector.WaitForRequest(&activityId, &logId, 0));
    EXPECT_EQ(c_hrState, collector.SendResult("2", 1));
    EXPECT_EQ(c_hrState, collector.BreakPipe());

    ASSERT_EQ(S_OK, collector.Connect(CollectorPipe()));
    ASSERT_EQ(S_OK, collector.Register(collectorId));
    EXPECT_EQ(c_hrState, collector.Connect(CollectorPipe()));
    EXPECT_EQ(c_hrState, collector.Register(collectorId));
    // Waiting for a request that does not come keeps the connection.
    EXPECT_EQ(HRESULT_FROM_WIN32(ERROR_TIMEOUT),
              collector.WaitForRequest(&activityId, &logId, 100));
    EXPECT_EQ(c_hrState, collector.SendResult("2", 1)) << "no request was taken";
    ASSERT_TRUE(m_trace.WaitFor("TelvaneService::ReportConnectedCollector()"));

    ASSERT_EQ(S_OK, activity.Connect(ActivityPipe()));
    EXPECT_EQ(c_hrState, activity.SendEvent(eventId, "1", 1));
    GUID startedLogId = NewLogId();
    ASSERT_EQ(S_OK, activity.Start(NewGuid(), startedLogId));
    EXPECT_EQ(c_hrState, activity.Connect(ActivityPipe()));
    EXPECT_EQ(c_hrState, activity.Start(NewGuid(), startedLogId));
    EXPECT_EQ(E_INVALIDARG, activity.SendEvent(eventId, nullptr, 5));
    std::vector<BYTE> overCap(TELVANE_MAX_ITEM + 1, '1');
    EXPECT_EQ(HRESULT_FROM_WIN32(ERROR_MESSAGE_EXCEEDS_MAX_SIZE),
              activity.SendEvent(eventId, overCap.data(), overCap.size()));
    EXPECT_EQ(S_OK, activity.SendEvent(eventId, "1", 1)) << "still started";

    ASSERT_EQ(S_OK, collector.WaitForRequest(&activityId, &logId, c_dwClientWaitMs));
    EXPECT_EQ(c_hrState, collector.WaitForRequest(&activityId, &logId, 0))
        << "the service never asks twice before the answer";
    EXPECT_EQ(c_hrState, collector.Connect(CollectorPipe()));
    EXPECT_EQ(E_INVALIDARG, collector.SendResult(nullptr, 5));
    EXPECT_EQ(S_OK, collector.SendResult("2", 1)) << "the request taken is still open";
    ASSERT_EQ(S_OK, activity.Stop());

    std::vector<DeliveredLog> rgLogs = WaitForLogs(startedLogId, 1);
    ASSERT_EQ(1u, rgLogs.size());
    EXPECT_EQ(Values("1"), GroupValues(*rgLogs[0].doc, eventId));
    EXPECT_EQ(Values("2"), GroupValues(*rgLogs[0].doc, collectorId));
    EXPECT_EQ(1u, m_trace.Count(c_szPipeTraceActivityStart));
    EXPECT_EQ(1u, m_trace.Count(c_szPipeTraceActivityEvent));
    EXPECT_EQ(1u, m_trace.Count(c_szPipeTraceCollectorRegister));
    EXPECT_EQ(1u, m_trace.Count(c_szPipeTraceCollectorResult));

    // A part layout that does not fit one message is refused before anything is copied or
    // sent: a size that wraps round in 32 bits must not pass for a small one, and parts that
    // may carry nothing would never finish the item. (One that slipped through would write
    // past the part buffer or send parts for ever.)
    CPipeClient raw;
    ASSERT_EQ(S_OK, raw.Connect(CollectorPipe(), c_dwClientWaitMs));
    // The version message read in pieces: each read says what it delivered, also when the rest
    // is already waiting and the read completes at once.
    std::vector<BYTE> version;
    for (HRESULT hrExpected :
         {HRESULT_FROM_WIN32(ERROR_MORE_DATA), HRESULT_FROM_WIN32(ERROR_MORE_DATA), S_OK})
    {
        BYTE rgb[3] = {};
        DWORD cbRead = 0xFFFF;
        EXPECT_EQ(hrExpected, raw.ReadMessage(rgb, sizeof(rgb), &cbRead, c_dwClientWaitMs));
        ASSERT_LE(cbRead, sizeof(rgb));
        version.insert(version.end(), rgb, rgb + cbRead);
    }
    EXPECT_EQ(std::vector<BYTE>({1, 0, 0, 0, 1, 0, 0, 0}), version);
    ASSERT_EQ(S_OK, raw.WriteMessage(version.data(), static_cast<DWORD>(version.size()),
                                     c_dwClientWaitMs));
    const TELVANE_COLLECTION_COMPLETE header = {TELVANE_COLLECTION_COMPLETE_OPCODE, 0, 0};
    const DWORD ibComplete = offsetof(TELVANE_COLLECTION_COMPLETE, Complete);
    const DWORD ibLength = offsetof(TELVANE_COLLECTION_COMPLETE, Length);
    std::string strItem = JsonOfSize(5000, 3);
    struct
    {
        const void *pvHeader;
        DWORD ibComplete;
        DWORD ibLength;
        DWORD cbTrailer;
        DWORD cbMaxPart;
    } rgBad[] = {
        {&header, ibComplete, ibLength, 0, 0xFFFFFFF8},                  // 12 + this is 4
        {&header, ibComplete, ibLength, 0xFFFFFFF8, 100},                // likewise the trailer
        {&header, 0xFFFFFFFE, ibLength, 0, 100},                         // + 4 is 2
        {&header, ibComplete, 0xFFFFFFFD, 0, 100},                       // + 4 is 1
        {&header, ibComplete, ibLength, 0, 0},                           // empty parts, no end
        {&header, ibComplete, ibLength, 0, TELVANE_MAX_RESULT_PART + 1}, // a byte too many
        {nullptr, ibComplete, ibLength, 0, TELVANE_MAX_RESULT_PART},     // no header to copy
    };
    for (const auto &bad : rgBad)
    {
        EXPECT_EQ(E_INVALIDARG, raw.WriteParts(bad.pvHeader, sizeof(header), bad.ibComplete,
                                               bad.ibLength, bad.cbTrailer, bad.cbMaxPart,
                                               strItem.data(), strItem.size(), c_dwClientWaitMs))
            << bad.ibComplete << " " << bad.ibLength << " " << bad.cbTrailer << " "
            << bad.cbMaxPart;
    }
    // An empty item needs no payload room at all, and the connection was never disturbed.
    EXPECT_EQ(S_OK, raw.WriteParts(&header, sizeof(header), ibComplete, ibLength, 0, 0, nullptr, 0,
                                   c_dwClientWaitMs));
    EXPECT_EQ(S_OK, raw.WriteParts(&header, sizeof(header), ibComplete, ibLength, 0,
                                   TELVANE_MAX_RESULT_PART, strItem.data(), strItem.size(),
                                   c_dwClientWaitMs));
    ASSERT_TRUE(m_trace.WaitFor(c_szPipeTraceCollectorWithContent, 2));
    EXPECT_EQ(1u, m_trace.Count(c_szPipeTraceCollectorNoContent));
    // The answer above, the empty item and the long one's parts.
    EXPECT_EQ(1 + 1 + PartCount(strItem.size(), TELVANE_MAX_RESULT_PART),
              m_trace.Count(c_szPipeTraceCollectorResult));

    // Nothing refused ever reached the service.
    EXPECT_EQ(0u, m_trace.Count(c_szPipeFaultActivityState) +
                      m_trace.Count(c_szPipeFaultCollectorState) +
                      m_trace.Count(c_szPipeFaultCollectorSize));
    // A collector the service leaves learns it at once.
    m_coordinator.StopAndCheckDrained();
    EXPECT_EQ(HRESULT_FROM_WIN32(ERROR_BROKEN_PIPE),
              collector.WaitForRequest(&activityId, &logId, c_dwClientWaitMs));
}

// What a service never does on purpose comes back as its HRESULT within the client's limit.
TEST(TelvaneClientRaw, FailuresComeBackAsHResultsWithinTheirLimits)
{
    CActivityClient quick(200);
    EXPECT_EQ(HRESULT_FROM_WIN32(ERROR_FILE_NOT_FOUND),
              quick.Connect(UniquePipeName(L"none").c_str()));

    // Between two clients the service has no listener for a moment: a client waits for the
    // next one within its limit instead of failing at once.
    std::wstring wstrName = UniquePipeName(L"raw");
    CFileHandle taken;
    std::thread late([&] {
        Sleep(200);
        taken.Reset(RawInstance(wstrName));
    });
    CPipeClient holder;
    HRESULT hrLate = holder.Connect(wstrName.c_str(), c_dwClientWaitMs);
    late.join();
    ASSERT_EQ(S_OK, hrLate);

    // Every instance is taken by a client that has not left: busy until the limit.
    EXPECT_EQ(HRESULT_FROM_WIN32(ERROR_PIPE_BUSY), quick.Connect(wstrName.c_str()));
    // An instance that never sends the version message.
    CFileHandle silent(RawInstance(wstrName));
    EXPECT_EQ(HRESULT_FROM_WIN32(ERROR_TIMEOUT), quick.Connect(wstrName.c_str()));

    // One whose first message is not the version message.
    std::wstring wstrOdd = UniquePipeName(L"odd");
    CFileHandle odd(RawInstance(wstrOdd));
    std::thread answer([&] {
        BYTE rgb[8] = {6, 0, 0, 0, 1, 0, 0, 0};
        DWORD cbWritten = 0;
        if (ConnectNamedPipe(odd.Get(), nullptr) || GetLastError() == ERROR_PIPE_CONNECTED)
        {
            WriteFile(odd.Get(), rgb, sizeof(rgb), &cbWritten, nullptr);
        }
    });
    CActivityClient oddClient(c_dwClientWaitMs);
    EXPECT_EQ(HRESULT_FROM_WIN32(ERROR_INVALID_DATA), oddClient.Connect(wstrOdd.c_str()));
    answer.join();
}

// telvanectl plays a collector answering with a file and activities with text and file events.
TEST_F(TelvaneClient, TelvanectlPlaysActivitiesAndACollector)
{
    std::wstring wstrFolder = BinDir() + UniqueName(L"ctl");
    CreateFolders(wstrFolder);
    std::string strResult = JsonOfSize(5000, 4);
    std::string strFileEvent = JsonOfSize(3000, 9);
    ASSERT_TRUE(WriteFileText(wstrFolder + L"\\result.json", strResult));
    ASSERT_TRUE(WriteFileText(wstrFolder + L"\\event.json", strFileEvent));

    GUID collectorId = NewGuid();
    ChildResult collector;
    std::thread tool([&] {
        collector =
            RunTelvanectl(L"collector --requests 2 --pipe " + m_coordinator.CollectorPipe() + L" " +
                          Widen(GuidText(collectorId)) + L" " + wstrFolder + L"\\result.json");
    });
    bool fRegistered = m_trace.WaitFor("TelvaneService::ReportConnectedCollector()");
    GUID textEvent = NewGuid();
    GUID jsonEvent = NewGuid();
    GUID fileEvent = NewGuid();
    GUID rgLogIds[2] = {NewLogId(), NewLogId()};
    GUID activityId = NewGuid();
    // With braces and without: both forms of a GUID are taken.
    std::wstring wstrRun = L"activity --pipe " + m_coordinator.ActivityPipe() + L" {" +
                           Widen(GuidText(activityId)) + L"} ";
    ChildResult first =
        RunTelvanectl(wstrRun + Widen(GuidText(rgLogIds[0])) + L" " + Widen(GuidText(textEvent)) +
                      L"=h\u00e9llo " + Widen(GuidText(jsonEvent)) + L"=[1,2] " +
                      Widen(GuidText(fileEvent)) + L"=@" + wstrFolder + L"\\event.json");
    ChildResult second = RunTelvanectl(wstrRun + Widen(GuidText(rgLogIds[1])));
    tool.join();
    RemoveTree(wstrFolder);
    ASSERT_TRUE(fRegistered) << collector.strOutput;
    EXPECT_EQ(0u, first.dwExitCode) << first.strOutput;
    // The text goes in UTF-8 without a terminator (the service would drop what follows a zero).
    EXPECT_NE(std::string::npos,
              first.strOutput.find("sent event " + GuidText(textEvent) + ": 6 bytes"))
        << first.strOutput;
    EXPECT_NE(std::string::npos,
              first.strOutput.find("sent event " + GuidText(fileEvent) + ": 3000 bytes"));
    EXPECT_EQ(0u, second.dwExitCode) << second.strOutput;
    EXPECT_EQ(0u, collector.dwExitCode) << collector.strOutput;
    EXPECT_NE(std::string::npos, collector.strOutput.find("log " + GuidText(rgLogIds[1]) +
                                                          ": answered with 5000 bytes"))
        << collector.strOutput;

    for (const GUID &logId : rgLogIds)
    {
        std::vector<DeliveredLog> rgLogs = WaitForLogs(logId, 1);
        ASSERT_EQ(1u, rgLogs.size());
        EXPECT_EQ(GuidText(activityId), (*rgLogs[0].doc)["ActivityID"].GetString());
        EXPECT_EQ(Values(strResult), GroupValues(*rgLogs[0].doc, collectorId));
    }
    std::vector<DeliveredLog> rgFirst = WaitForLogs(rgLogIds[0], 1);
    ASSERT_EQ(1u, rgFirst.size());
    // Text that is no JSON is recorded byte by byte: the two UTF-8 bytes of the accent come
    // back as two characters.
    EXPECT_EQ(Values("\"h\xC3\x83\xC2\xA9llo\""), GroupValues(*rgFirst[0].doc, textEvent));
    EXPECT_EQ(Values("[1,2]"), GroupValues(*rgFirst[0].doc, jsonEvent));
    EXPECT_EQ(Values(strFileEvent), GroupValues(*rgFirst[0].doc, fileEvent));
    EXPECT_TRUE(m_trace.WaitFor(c_szPipeTraceCollectorBreak)) << "the tool leaves after 2 requests";
}

// Arguments it cannot use are a usage error, and a failed step is reported with its reason;
// neither waits for anything.
TEST(Telvanectl, RefusesBadArgumentsAndReportsFailures)
{
    const std::wstring wstrGuids = L"0a1b2c3d-0000-4000-8000-000000000001 "
                                   L"{0a1b2c3d-0000-4000-8000-000000000002}";
    const std::wstring wstrNone = L" --pipe " + UniquePipeName(L"none") + L" ";
    // A sign or a value past 32 bits is no number of milliseconds or requests: read leniently,
    // "-1" would become a wait without end on a pipe nobody serves.
    const std::wstring rgwstrArgs[] = {
        L"",
        L"frobnicate",
        L"activity",
        L"activity not-a-guid 0a1b2c3d-0000-4000-8000-000000000002",
        L"activity --timeout soon " + wstrGuids,
        L"activity " + wstrGuids + L" novalue",
        L"collector cccccccc-0000-4000-8000-00000000000c",
        L"collector --requests 0 cccccccc-0000-4000-8000-00000000000c x",
        L"collector --bogus cccccccc-0000-4000-8000-00000000000c x",
        L"activity --timeout -1" + wstrNone + wstrGuids,
        L"activity --timeout 4294967296" + wstrNone + wstrGuids,
        L"activity --timeout 99999999999999999999999" + wstrNone + wstrGuids,
        L"collector --timeout 100 --requests -2" + wstrNone +
            L"cccccccc-0000-4000-8000-00000000000c x",
    };
    for (const std::wstring &wstrArgs : rgwstrArgs)
    {
        SCOPED_TRACE(Narrow(wstrArgs));
        ChildResult result = RunTelvanectl(wstrArgs, c_dwClientWaitMs);
        EXPECT_FALSE(result.fTimedOut);
        EXPECT_EQ(2u, result.dwExitCode) << result.strOutput;
        EXPECT_NE(std::string::npos, result.strOutput.find("usage: telvanectl activity"))
            << result.strOutput;
    }

    ChildResult result = RunTelvanectl(L"activity --timeout 100" + wstrNone + wstrGuids);
    EXPECT_EQ(1u, result.dwExitCode);
    EXPECT_NE(std::string::npos,
              result.strOutput.find("connecting to the activity pipe failed: 0x80070002"))
        << result.strOutput;
}
