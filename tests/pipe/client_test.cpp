// The client library against a service side made of the real AsyncPipe and codec.
#include "client/cactivityclient.h"
#include "client/ccollectorclient.h"
#include "tests/common/testsupport.h"
#include "tests/pipe/testpipeserver.h"

#include <gtest/gtest.h>
#include <thread>

using namespace pipetest;

namespace
{
// Payload sizes around the part boundaries of both pipes, and one of many parts.
const size_t c_rgcbSizes[] = {0, 1, 1168, 1169, 1188, 1189, 100000};

// Parts one item of cb bytes travels in, at most cbMaxPart payload bytes each.
size_t PartCount(size_t cb, size_t cbMaxPart)
{
    return cb == 0 ? 1 : (cb + cbMaxPart - 1) / cbMaxPart;
}

class TelvaneClientTest : public CPipeTest
{
protected:
    // A bare pipe whose sink only records: it says nothing on its own.
    struct Listener
    {
        AsyncPipe *pPipe;
        CRecordingSink *pSink;
    };

    static Listener ListenRaw(const std::wstring &name)
    {
        Listener listener = {new AsyncPipe(), new CRecordingSink()};
        listener.pPipe->Listen(name.c_str(), listener.pSink, listener.pSink);
        return listener;
    }

    static void CloseRaw(const Listener &listener)
    {
        listener.pPipe->Close();
        EXPECT_TRUE(listener.pSink->WaitForRefs(1));
        EXPECT_TRUE(WaitForPipeRefs(listener.pPipe, 1));
        listener.pPipe->Release();
        listener.pSink->Release();
    }
};
} // namespace

TEST_F(TelvaneClientTest, EventsOfEverySizeArriveWholeInParts)
{
    std::wstring name = UniquePipeName(L"events");
    CTestPipeServer *pServer = CTestPipeServer::Start(false, name);

    CActivityClient client;
    ASSERT_EQ(S_OK, client.Connect(name.c_str()));
    EXPECT_EQ(1u, client.ServiceVersion());
    ASSERT_EQ(S_OK, client.Start(TestGuid(0xA0), TestGuid(0xB0)));
    size_t cExpectedMessages = 2; // version reply and start
    for (size_t i = 0; i < ARRAYSIZE(c_rgcbSizes); i++)
    {
        std::vector<BYTE> value = Pattern(c_rgcbSizes[i], static_cast<BYTE>(i));
        ASSERT_EQ(S_OK, client.SendEvent(TestGuid(static_cast<BYTE>(i)),
                                         value.empty() ? nullptr : value.data(), value.size()));
        cExpectedMessages += PartCount(value.size(), TELVANE_MAX_EVENT_PART);
    }
    ASSERT_EQ(S_OK, client.Stop());
    cExpectedMessages++;

    ASSERT_TRUE(pServer->WaitForEnd());
    EXPECT_EQ(1, pServer->VersionReplies());
    EXPECT_TRUE(SameGuid(pServer->ActivityID(), TestGuid(0xA0)));
    EXPECT_TRUE(SameGuid(pServer->LogID(), TestGuid(0xB0)));
    std::vector<ReceivedItem> items = pServer->Items();
    ASSERT_EQ(ARRAYSIZE(c_rgcbSizes), items.size());
    for (size_t i = 0; i < items.size(); i++)
    {
        EXPECT_TRUE(SameGuid(items[i].id, TestGuid(static_cast<BYTE>(i))));
        EXPECT_EQ(Pattern(c_rgcbSizes[i], static_cast<BYTE>(i)), items[i].vb)
            << c_rgcbSizes[i] << " bytes";
    }
    // 1168 bytes fit one part, 1169 need two: the parts are as full as they can be.
    EXPECT_EQ(cExpectedMessages, pServer->Messages().size());
    EXPECT_TRUE(pServer->Faults().empty());
    pServer->Finish();
}

TEST_F(TelvaneClientTest, ResultsOfEverySizeAnswerTheirRequests)
{
    std::wstring name = UniquePipeName(L"results");
    CTestPipeServer *pServer = CTestPipeServer::Start(true, name);

    CCollectorClient client;
    ASSERT_EQ(S_OK, client.Connect(name.c_str()));
    ASSERT_EQ(S_OK, client.Register(TestGuid(0xC0)));
    ASSERT_TRUE(pServer->WaitForRegistration());
    EXPECT_TRUE(SameGuid(pServer->CollectorID(), TestGuid(0xC0)));

    size_t cExpectedMessages = 2; // version reply and registration
    for (size_t i = 0; i < ARRAYSIZE(c_rgcbSizes); i++)
    {
        pServer->SendStartCollection(TestGuid(static_cast<BYTE>(0x10 + i)),
                                     TestGuid(static_cast<BYTE>(0x40 + i)));
        GUID activityId = {};
        GUID logId = {};
        ASSERT_EQ(S_OK, client.WaitForRequest(&activityId, &logId, c_dwWaitMs));
        EXPECT_TRUE(IsEqualGUID(TestGuid(static_cast<BYTE>(0x10 + i)), activityId));
        EXPECT_TRUE(IsEqualGUID(TestGuid(static_cast<BYTE>(0x40 + i)), logId));
        std::vector<BYTE> result = Pattern(c_rgcbSizes[i], static_cast<BYTE>(0x70 + i));
        ASSERT_EQ(S_OK, client.SendResult(result.empty() ? nullptr : result.data(), result.size()));
        ASSERT_TRUE(pServer->WaitForItems(i + 1));
        EXPECT_EQ(result, pServer->Items()[i].vb) << c_rgcbSizes[i] << " bytes";
        cExpectedMessages += PartCount(result.size(), TELVANE_MAX_RESULT_PART);
    }
    EXPECT_EQ(cExpectedMessages, pServer->Messages().size());
    ASSERT_EQ(S_OK, client.BreakPipe());
    ASSERT_TRUE(pServer->WaitForEnd());
    EXPECT_TRUE(pServer->Faults().empty());
    pServer->Finish();
}

// Between two clients the service has no listener for a moment; a client waits for the
// next one within its limit instead of failing at once.
TEST_F(TelvaneClientTest, ConnectWaitsForTheNextListener)
{
    std::wstring name = UniquePipeName(L"gap");
    CTestPipeServer *pServer = new CTestPipeServer(false);
    std::thread late([&] {
        Sleep(200);
        pServer->Listen(name);
    });
    CActivityClient client(c_dwWaitMs);
    HRESULT hr = client.Connect(name.c_str());
    late.join();
    EXPECT_EQ(S_OK, hr);
    client.Close();
    pServer->Finish();
}

// Calls out of order and arguments the protocol cannot carry are refused before anything is
// sent; nothing waits past its limit.
TEST_F(TelvaneClientTest, RefusesCallsOutOfOrderOrTooLarge)
{
    CActivityClient activity;
    EXPECT_EQ(HRESULT_FROM_WIN32(ERROR_INVALID_STATE), activity.Start(TestGuid(1), TestGuid(2)));
    EXPECT_EQ(HRESULT_FROM_WIN32(ERROR_INVALID_STATE), activity.SendEvent(TestGuid(1), "x", 1));
    EXPECT_EQ(HRESULT_FROM_WIN32(ERROR_INVALID_STATE), activity.Stop());

    std::wstring name = UniquePipeName(L"order");
    CTestPipeServer *pServer = CTestPipeServer::Start(false, name);
    ASSERT_EQ(S_OK, activity.Connect(name.c_str()));
    EXPECT_EQ(HRESULT_FROM_WIN32(ERROR_INVALID_STATE), activity.SendEvent(TestGuid(1), "x", 1))
        << "the service would drop an event before the start";
    ASSERT_EQ(S_OK, activity.Start(TestGuid(1), TestGuid(2)));
    EXPECT_EQ(HRESULT_FROM_WIN32(ERROR_INVALID_STATE), activity.Start(TestGuid(1), TestGuid(2)));
    EXPECT_EQ(E_INVALIDARG, activity.SendEvent(TestGuid(1), nullptr, 5));
    std::vector<BYTE> overCap(TELVANE_MAX_ITEM + 1);
    EXPECT_EQ(HRESULT_FROM_WIN32(ERROR_MESSAGE_EXCEEDS_MAX_SIZE),
              activity.SendEvent(TestGuid(1), overCap.data(), overCap.size()));
    activity.Close();
    pServer->Shutdown();
    EXPECT_TRUE(pServer->Items().empty());
    EXPECT_TRUE(pServer->Faults().empty());
    pServer->Release();

    CCollectorClient collector;
    GUID activityId;
    GUID logId;
    EXPECT_EQ(HRESULT_FROM_WIN32(ERROR_INVALID_STATE), collector.Register(TestGuid(3)));
    EXPECT_EQ(HRESULT_FROM_WIN32(ERROR_INVALID_STATE),
              collector.WaitForRequest(&activityId, &logId, 0));
    EXPECT_EQ(HRESULT_FROM_WIN32(ERROR_INVALID_STATE), collector.SendResult("x", 1));
    EXPECT_EQ(HRESULT_FROM_WIN32(ERROR_INVALID_STATE), collector.BreakPipe());
}

TEST_F(TelvaneClientTest, FailuresComeBackAsHResultsWithinTheirLimits)
{
    // Nobody listens.
    CActivityClient quick(200);
    EXPECT_EQ(HRESULT_FROM_WIN32(ERROR_FILE_NOT_FOUND),
              quick.Connect(UniquePipeName(L"none").c_str()));

    // Every instance is taken by a client that has not left: busy until the limit.
    std::wstring silentName = UniquePipeName(L"silent");
    Listener taken = ListenRaw(silentName);
    CPipeClient holder;
    ASSERT_EQ(S_OK, holder.Connect(silentName.c_str(), c_dwWaitMs));
    ASSERT_TRUE(taken.pSink->WaitForConnected(1));
    EXPECT_EQ(HRESULT_FROM_WIN32(ERROR_PIPE_BUSY), quick.Connect(silentName.c_str()));

    // A server that never sends its version message.
    Listener silent = ListenRaw(silentName);
    EXPECT_EQ(HRESULT_FROM_WIN32(ERROR_TIMEOUT), quick.Connect(silentName.c_str()));
    holder.Close();
    CloseRaw(taken);
    CloseRaw(silent);

    // A server whose first message is not the version message.
    std::wstring oddName = UniquePipeName(L"odd");
    Listener odd = ListenRaw(oddName);
    std::thread answer([&] {
        if (odd.pSink->WaitForConnected(1))
        {
            BYTE rgb[8] = {6, 0, 0, 0, 1, 0, 0, 0};
            odd.pPipe->Write(rgb, sizeof(rgb));
        }
    });
    CActivityClient oddClient;
    EXPECT_EQ(HRESULT_FROM_WIN32(ERROR_INVALID_DATA), oddClient.Connect(oddName.c_str()));
    answer.join();
    CloseRaw(odd);

    // A collector waiting for a request that does not come keeps its connection; one that the
    // service leaves learns it at once.
    std::wstring name = UniquePipeName(L"wait");
    CTestPipeServer *pServer = CTestPipeServer::Start(true, name);
    CCollectorClient collector;
    ASSERT_EQ(S_OK, collector.Connect(name.c_str()));
    ASSERT_EQ(S_OK, collector.Register(TestGuid(9)));
    GUID activityId;
    GUID logId;
    EXPECT_EQ(HRESULT_FROM_WIN32(ERROR_TIMEOUT),
              collector.WaitForRequest(&activityId, &logId, 100));
    EXPECT_EQ(HRESULT_FROM_WIN32(ERROR_INVALID_STATE), collector.SendResult("x", 1))
        << "no request was taken";
    pServer->SendStartCollection(TestGuid(1), TestGuid(2));
    ASSERT_EQ(S_OK, collector.WaitForRequest(&activityId, &logId, c_dwWaitMs));
    EXPECT_TRUE(IsEqualGUID(TestGuid(2), logId));
    EXPECT_EQ(HRESULT_FROM_WIN32(ERROR_INVALID_STATE),
              collector.WaitForRequest(&activityId, &logId, 0))
        << "the service never asks twice before the answer";
    ASSERT_EQ(S_OK, collector.SendResult("done", 4));
    ASSERT_TRUE(pServer->WaitForItems(1));
    pServer->Shutdown();
    EXPECT_EQ(HRESULT_FROM_WIN32(ERROR_BROKEN_PIPE),
              collector.WaitForRequest(&activityId, &logId, c_dwWaitMs));
    pServer->Release();
}

// A second Connect on a live connection is refused and leaves that connection as it was: the
// client must not forget that it started or registered (the service closes the pipe on a
// second start or registration) nor that a request still waits for its answer.
TEST_F(TelvaneClientTest, ConnectOnALiveConnectionKeepsItsState)
{
    const HRESULT hrInvalidState = HRESULT_FROM_WIN32(ERROR_INVALID_STATE);

    std::wstring activityName = UniquePipeName(L"again-activity");
    CTestPipeServer *pActivityServer = CTestPipeServer::Start(false, activityName);
    CActivityClient activity;
    ASSERT_EQ(S_OK, activity.Connect(activityName.c_str()));
    ASSERT_EQ(S_OK, activity.Start(TestGuid(1), TestGuid(2)));
    EXPECT_EQ(hrInvalidState, activity.Connect(activityName.c_str()));
    EXPECT_EQ(hrInvalidState, activity.Start(TestGuid(1), TestGuid(2)));
    EXPECT_EQ(S_OK, activity.SendEvent(TestGuid(3), "e", 1)) << "still started";
    ASSERT_EQ(S_OK, activity.Stop());
    ASSERT_TRUE(pActivityServer->WaitForEnd());
    EXPECT_EQ(1u, pActivityServer->Items().size());
    EXPECT_EQ(4u, pActivityServer->Messages().size()) << "version reply, one start, event, stop";
    pActivityServer->Finish();

    std::wstring collectorName = UniquePipeName(L"again-collector");
    CTestPipeServer *pCollectorServer = CTestPipeServer::Start(true, collectorName);
    CCollectorClient collector;
    ASSERT_EQ(S_OK, collector.Connect(collectorName.c_str()));
    ASSERT_EQ(S_OK, collector.Register(TestGuid(4)));
    pCollectorServer->SendStartCollection(TestGuid(5), TestGuid(6));
    GUID activityId;
    GUID logId;
    ASSERT_EQ(S_OK, collector.WaitForRequest(&activityId, &logId, c_dwWaitMs));
    EXPECT_EQ(hrInvalidState, collector.Connect(collectorName.c_str()));
    EXPECT_EQ(hrInvalidState, collector.Register(TestGuid(4)));
    EXPECT_EQ(S_OK, collector.SendResult("r", 1)) << "the request taken is still open";
    EXPECT_TRUE(pCollectorServer->WaitForItems(1));
    ASSERT_EQ(S_OK, collector.BreakPipe());
    ASSERT_TRUE(pCollectorServer->WaitForEnd());
    EXPECT_EQ(4u, pCollectorServer->Messages().size())
        << "version reply, one registration, result, break";
    pCollectorServer->Finish();
}

// A message longer than the caller's buffer fills the buffer and says how many bytes it
// delivered, also when the message is already waiting and the read completes at once; the
// rest follows on the next reads.
TEST_F(TelvaneClientTest, ReadOfALongerMessageReportsWhatItDelivered)
{
    std::wstring name = UniquePipeName(L"moredata");
    Listener listener = ListenRaw(name);
    CPipeClient client;
    ASSERT_EQ(S_OK, client.Connect(name.c_str(), c_dwWaitMs));
    ASSERT_TRUE(listener.pSink->WaitForConnected(1));
    std::vector<BYTE> message = Pattern(10, 0x31);
    listener.pPipe->Write(message.data(), static_cast<DWORD>(message.size()));

    // The first read may wait for the message; once part of it is read, the rest is waiting.
    std::vector<BYTE> received;
    const HRESULT rghrExpected[] = {HRESULT_FROM_WIN32(ERROR_MORE_DATA),
                                    HRESULT_FROM_WIN32(ERROR_MORE_DATA), S_OK};
    for (HRESULT hrExpected : rghrExpected)
    {
        BYTE rgb[4] = {};
        DWORD cbRead = 0xFFFF;
        EXPECT_EQ(hrExpected, client.ReadMessage(rgb, sizeof(rgb), &cbRead, c_dwWaitMs));
        ASSERT_LE(cbRead, sizeof(rgb));
        received.insert(received.end(), rgb, rgb + cbRead);
    }
    EXPECT_EQ(message, received);
    client.Close();
    CloseRaw(listener);
}

// Part layouts that do not fit one message are refused before anything is copied or sent: a
// size that wraps round in 32 bits must not pass for a small one, and parts that may carry
// nothing would never finish the item.
TEST_F(TelvaneClientTest, WritePartsRefusesLayoutsThatDoNotFitAMessage)
{
    std::wstring name = UniquePipeName(L"layout");
    CTestPipeServer *pServer = CTestPipeServer::Start(true, name);
    CPipeClient client;
    ASSERT_EQ(S_OK, client.Open(name.c_str(), c_dwWaitMs));

    // Were a layout to slip through, the item would go out for real: end the connection after
    // the time limit so that a part loop without end still returns.
    HANDLE hReturned = CreateEventW(nullptr, TRUE, FALSE, nullptr);
    std::thread watchdog([&] {
        if (WaitForSingleObject(hReturned, c_dwWaitMs) != WAIT_OBJECT_0)
        {
            pServer->Shutdown();
        }
    });

    const TELVANE_COLLECTION_COMPLETE header = {TELVANE_COLLECTION_COMPLETE_OPCODE, 0, 0};
    const DWORD ibComplete = offsetof(TELVANE_COLLECTION_COMPLETE, Complete);
    const DWORD ibLength = offsetof(TELVANE_COLLECTION_COMPLETE, Length);
    std::vector<BYTE> item = Pattern(5000, 0x21);
    struct Layout
    {
        DWORD ibComplete;
        DWORD ibLength;
        DWORD cbTrailer;
        DWORD cbMaxPart;
    };
    const Layout rgBad[] = {
        {ibComplete, ibLength, 0, 0xFFFFFFF8},                  // 12 + this is 4 in 32 bits
        {ibComplete, ibLength, 0xFFFFFFF8, 100},                // likewise the trailer
        {0xFFFFFFFE, ibLength, 0, 100},                         // + 4 is 2 in 32 bits
        {ibComplete, 0xFFFFFFFD, 0, 100},                       // + 4 is 1 in 32 bits
        {ibComplete, ibLength, 0, 0},                           // empty parts without end
        {ibComplete, ibLength, 0, TELVANE_MAX_RESULT_PART + 1}, // one byte too many
    };
    for (const Layout &layout : rgBad)
    {
        EXPECT_EQ(E_INVALIDARG,
                  client.WriteParts(&header, sizeof(header), layout.ibComplete, layout.ibLength,
                                    layout.cbTrailer, layout.cbMaxPart, item.data(), item.size(),
                                    c_dwWaitMs))
            << layout.ibComplete << " " << layout.ibLength << " " << layout.cbTrailer << " "
            << layout.cbMaxPart;
    }
    EXPECT_EQ(E_INVALIDARG,
              client.WriteParts(nullptr, sizeof(header), ibComplete, ibLength, 0,
                                TELVANE_MAX_RESULT_PART, item.data(), item.size(), c_dwWaitMs))
        << "no header to copy";
    // An empty item needs no payload room at all, and the connection was never disturbed.
    EXPECT_EQ(S_OK, client.WriteParts(&header, sizeof(header), ibComplete, ibLength, 0, 0, nullptr,
                                      0, c_dwWaitMs));
    EXPECT_EQ(S_OK,
              client.WriteParts(&header, sizeof(header), ibComplete, ibLength, 0,
                                TELVANE_MAX_RESULT_PART, item.data(), item.size(), c_dwWaitMs));
    SetEvent(hReturned);
    watchdog.join();
    CloseHandle(hReturned);

    ASSERT_TRUE(pServer->WaitForItems(2));
    std::vector<ReceivedItem> items = pServer->Items();
    EXPECT_TRUE(items[0].vb.empty());
    EXPECT_EQ(item, items[1].vb);
    EXPECT_EQ(1u + 1 + PartCount(item.size(), TELVANE_MAX_RESULT_PART), pServer->Messages().size())
        << "version reply and the two items' parts only";
    client.Close();
    pServer->Finish();
}
