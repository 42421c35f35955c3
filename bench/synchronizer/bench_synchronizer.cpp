// Cost of a post to an idle object, and of posts from two threads to one busy object,
// each beside a bare critical-section enter/leave plus a virtual call in the same run.
#include "servicelib/synchronizedobject.h"

#include <atomic>
#include <stdio.h>
#include <thread>

namespace
{
class CSink : public SynchronizedObject
{
public:
    void Send(ULONG ul) { Post(1, ul); }
    void Dispatch(ULONG, ULONG_PTR ulArg1, ULONG_PTR, ULONG_PTR) override { m_ullSum += ulArg1; }
    ULONGLONG m_ullSum = 0;
};

// The baseline: what a hand-written lock around a virtual call costs.
class CBaseline
{
public:
    CBaseline() { InitializeCriticalSection(&m_lock); }
    ~CBaseline() { DeleteCriticalSection(&m_lock); }
    virtual void Handle(ULONG_PTR ul) { m_ullSum += ul; }
    void Call(ULONG_PTR ul)
    {
        EnterCriticalSection(&m_lock);
        Handle(ul);
        LeaveCriticalSection(&m_lock);
    }
    CRITICAL_SECTION m_lock;
    ULONGLONG m_ullSum = 0;
};

double NowNs()
{
    LARGE_INTEGER li, freq;
    QueryPerformanceCounter(&li);
    QueryPerformanceFrequency(&freq);
    return static_cast<double>(li.QuadPart) * 1e9 / static_cast<double>(freq.QuadPart);
}

template <class F>
double NsPerOp(int cThreads, ULONG cOps, F op)
{
    std::atomic<int> cReady{0};
    std::atomic<bool> fGo{false};
    std::thread rgThreads[8];
    for (int t = 0; t < cThreads; t++)
    {
        rgThreads[t] = std::thread([&] {
            cReady++;
            while (!fGo)
            {
            }
            for (ULONG i = 0; i < cOps; i++)
            {
                op(i);
            }
        });
    }
    while (cReady < cThreads)
    {
    }
    double start = NowNs();
    fGo = true;
    for (int t = 0; t < cThreads; t++)
    {
        rgThreads[t].join();
    }
    return (NowNs() - start) / (static_cast<double>(cOps) * cThreads);
}
} // namespace

int main()
{
    const ULONG cOps = 2000000;
    CSink sink;
    CBaseline baseline;
    // Warm up both paths.
    NsPerOp(1, cOps / 10, [&](ULONG i) { sink.Send(i); });
    NsPerOp(1, cOps / 10, [&](ULONG i) { baseline.Call(i); });

    double idlePost = NsPerOp(1, cOps, [&](ULONG i) { sink.Send(i); });
    double idleBase = NsPerOp(1, cOps, [&](ULONG i) { baseline.Call(i); });
    double busyPost = NsPerOp(2, cOps, [&](ULONG i) { sink.Send(i); });
    double busyBase = NsPerOp(2, cOps, [&](ULONG i) { baseline.Call(i); });

    printf("%-44s %10s %10s %8s\n", "case", "ns/op", "baseline", "ratio");
    printf("%-44s %10.1f %10.1f %8.2f\n", "post to idle object (1 thread)", idlePost, idleBase,
           idlePost / idleBase);
    printf("%-44s %10.1f %10.1f %8.2f\n", "posts to one busy object (2 threads)", busyPost,
           busyBase, busyPost / busyBase);
    printf("(baseline: critical section enter/leave around a virtual call; sums %llu %llu)\n",
           sink.m_ullSum, baseline.m_ullSum);
    return 0;
}
