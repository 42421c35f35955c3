#include "servicelib/synchronizedobject.h"
#include "servicelib/diagnostics.h"
#include "inc/taggedrefcount.h"
#include "tests/common/testsupport.h"

#include <gtest/gtest.h>
#include <atomic>
#include <cstdlib>
#include <new>
#include <thread>
#include <vector>

using testsupport::FailureCapture;

namespace
{
// Allocation goes straight to the C heap here, and one address at a time is watched for its
// delete, so a test can see that an object it cannot otherwise reach (an object's
// Synchronizer) was really freed.
std::atomic<void *> s_pvWatched{nullptr};
std::atomic<bool> s_fWatchedFreed{false};

void WatchDelete(void *pv)
{
    s_fWatchedFreed = false;
    s_pvWatched = pv;
}

void FreeWatched(void *pv)
{
    if (pv != nullptr && pv == s_pvWatched.load())
    {
        s_fWatchedFreed = true;
    }
    std::free(pv);
}
} // namespace

void *operator new(std::size_t cb)
{
    void *pv = std::malloc(cb != 0 ? cb : 1);
    if (pv == nullptr)
    {
        throw std::bad_alloc();
    }
    return pv;
}

void operator delete(void *pv) noexcept
{
    FreeWatched(pv);
}

void operator delete(void *pv, std::size_t) noexcept
{
    FreeWatched(pv);
}

namespace
{
enum : ULONG
{
    EventRecord = 1,
    EventPostThreeToSelf = 2,
    EventPostToOther = 3,
    EventDropCreator = 4,
};

// Records what its handlers saw; reference counted like the service's objects. Its handlers
// run on whichever test thread posts; the test that creates it owns the creator's reference.
class CRecorder : public SynchronizedObject
{
public:
    explicit CRecorder(bool *pfDeleted = nullptr)
        : m_pfDeleted(pfDeleted)
    {
    }
    ~CRecorder() override
    {
        if (m_pfDeleted != nullptr)
        {
            *m_pfDeleted = true;
        }
    }

    using SynchronizedObject::Post;

    void *SynchronizerAddress() const { return m_pSynchronizer; }

    void Dispatch(ULONG ulEventType, ULONG_PTR ulArg1, ULONG_PTR ulArg2, ULONG_PTR ulArg3) override
    {
        if (m_fInside.exchange(true))
        {
            m_cOverlaps++;
        }
        m_cDepth++;
        switch (ulEventType)
        {
        case EventRecord:
            m_rgRecords.push_back({ulArg1, ulArg2, GetCurrentThreadId(), m_cDepth});
            if (ulArg3 != 0)
            {
                Sleep(0); // widen the window in which other posters find the object busy
            }
            break;
        case EventPostThreeToSelf:
            m_rgRecords.push_back({0, 0, GetCurrentThreadId(), m_cDepth});
            for (ULONG_PTR i = 1; i <= 3; i++)
            {
                Post(EventRecord, 0, i);
            }
            break;
        case EventPostToOther: {
            m_rgRecords.push_back({0, 0, GetCurrentThreadId(), m_cDepth});
            CRecorder *pOther = reinterpret_cast<CRecorder *>(ulArg1);
            pOther->Post(EventRecord, 9, 9);
            m_cOtherRecordsAfterPost = pOther->m_rgRecords.size();
            break;
        }
        case EventDropCreator:
            Release();
            break;
        default:
            m_cDepth--;
            m_fInside = false;
            DISPATCH_UNKNOWN_EVENT(L"CRecorder::Dispatch", L"CRecorder::EventType %u", ulEventType);
            return;
        }
        m_cDepth--;
        m_fInside = false;
    }

    ULONG AddRef() override { return m_refs.AddRef(0); }
    ULONG Release() override
    {
        ULONG cRef = m_refs.Release(0, L"CRecorder::Release", TELVANE_WFILE, __LINE__);
        if (cRef == 0)
        {
            delete this;
        }
        return cRef;
    }

    struct Record
    {
        ULONG_PTR ulPoster;
        ULONG_PTR ulSequence;
        DWORD dwThread;
        int cDepth;
    };
    std::vector<Record> m_rgRecords;
    std::atomic<bool> m_fInside{false};
    std::atomic<int> m_cOverlaps{0};
    int m_cDepth = 0;
    size_t m_cOtherRecordsAfterPost = 0;

private:
    TaggedRefCount<1> m_refs;
    bool *m_pfDeleted;
};
} // namespace

TEST(Synchronizer, ConcurrentPostersNeverOverlapAndKeepTheirOrder)
{
    const int cThreads = 8;
    const ULONG_PTR cPerThread = 5000;
    CRecorder *pObject = new CRecorder();
    std::atomic<bool> fGo{false};
    std::vector<std::thread> threads;
    for (int t = 0; t < cThreads; t++)
    {
        threads.emplace_back([&, t] {
            while (!fGo)
            {
            }
            for (ULONG_PTR i = 0; i < cPerThread; i++)
            {
                pObject->Post(EventRecord, t, i, i % 64 == 0);
            }
        });
    }
    fGo = true;
    for (std::thread &thread : threads)
    {
        thread.join();
    }

    // Every post has returned, so every event has run: nothing lost, nothing overlapped.
    ASSERT_EQ(cThreads * cPerThread, pObject->m_rgRecords.size());
    EXPECT_EQ(0, pObject->m_cOverlaps.load());
    std::vector<ULONG_PTR> rgNext(cThreads, 0);
    for (const CRecorder::Record &record : pObject->m_rgRecords)
    {
        ASSERT_EQ(rgNext[record.ulPoster], record.ulSequence) << "poster " << record.ulPoster;
        rgNext[record.ulPoster]++;
        EXPECT_EQ(1, record.cDepth);
    }
    pObject->Release();
}

TEST(Synchronizer, PostsToSelfRunAfterTheHandlerToOthersNestedUnknownOnesAreFatal)
{
    CRecorder *pObject = new CRecorder();
    pObject->Post(EventPostThreeToSelf);
    // All three ran before the outermost Post returned, after the posting handler, unnested.
    ASSERT_EQ(4u, pObject->m_rgRecords.size());
    for (ULONG_PTR i = 0; i < 4; i++)
    {
        EXPECT_EQ(i, pObject->m_rgRecords[i].ulSequence);
        EXPECT_EQ(GetCurrentThreadId(), pObject->m_rgRecords[i].dwThread);
        EXPECT_EQ(1, pObject->m_rgRecords[i].cDepth);
    }

    // A post to another idle object runs nested: its handler had run by the time its Post
    // returned inside ours.
    CRecorder *pFirst = pObject;
    CRecorder *pSecond = new CRecorder();
    pFirst->Post(EventPostToOther, reinterpret_cast<ULONG_PTR>(pSecond));
    EXPECT_EQ(1u, pFirst->m_cOtherRecordsAfterPost);
    ASSERT_EQ(1u, pSecond->m_rgRecords.size());
    EXPECT_EQ(GetCurrentThreadId(), pSecond->m_rgRecords[0].dwThread);
    EXPECT_EQ(9u, pSecond->m_rgRecords[0].ulSequence);

    // An event no handler knows is a fatal error naming the handler.
    FailureCapture failures;
    pFirst->Post(77);
    ASSERT_EQ(1u, failures.Count());
    EXPECT_TRUE(
        failures.Contains(L"CRecorder::Dispatch: Fatal error 0x4d from CRecorder::EventType %u"))
        << testsupport::Narrow(failures.Lines()[0]);
    pFirst->Release();
    pSecond->Release();
}

TEST(Synchronizer, ObjectDeletedByTheReleaseAfterItsLastEvent)
{
    FailureCapture failures;
    bool fDeleted = false;
    CRecorder *pObject = new CRecorder(&fDeleted);
    WatchDelete(pObject->SynchronizerAddress());
    // The handler drops the creator's reference; the Post's own release then deletes the
    // object inside the dispatch loop, which must delete the Synchronizer after draining.
    pObject->Post(EventDropCreator);
    EXPECT_TRUE(fDeleted);
    EXPECT_TRUE(s_fWatchedFreed.load()) << "Synchronizer left behind";
    EXPECT_EQ(0u, failures.Count());

    // An idle object's Synchronizer goes with the object at once.
    pObject = new CRecorder();
    pObject->Post(EventRecord);
    WatchDelete(pObject->SynchronizerAddress());
    pObject->Release();
    EXPECT_TRUE(s_fWatchedFreed.load());
    WatchDelete(nullptr);
    EXPECT_EQ(0u, failures.Count());
}
