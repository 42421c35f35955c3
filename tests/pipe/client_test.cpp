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
