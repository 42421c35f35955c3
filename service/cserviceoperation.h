// The record of one run of one activity: its events, the results of the collectors it waits
// for, and the trace it flushes when nothing is left to wait for (and early, from the hourly
// timer or when a log grows large). Runs on its own queue; created by the coordinator, held by
// the coordinator's maps, the activity endpoint and the collector endpoint serving it.
#pragma once

#include "service/ctracedocument.h"
#include "servicelib/idestroyable.h"
#include "servicelib/synchronizedobject.h"
#include "inc/taggedrefcount.h"
#include "inc/handleholder.h"
#include "service/guidkey.h"

#include <windows.h>
#include <unknwn.h>

#include <atomic>
#include <list>
#include <map>
#include <vector>

class TelvaneService;
class CServiceActivity;
class CServiceCollector;

class CServiceOperation : public SynchronizedObject, public IUnknown, public IDestroyable
{
public:
    CServiceOperation(TelvaneService *pService, const GUID &sessionId, CServiceActivity *pActivity);

    // Entry points: any thread; each copies its arguments and posts.
    void AddCollectors(const std::vector<GUID> &rgCollectorIds);
    void RemoveCollectors(const std::vector<GUID> &rgCollectorIds);
    void ProvideCollector(CServiceCollector *pCollector); // the caller took tag 10 on it
    void ActivityEvent(const GUID &eventId, const BYTE *pb, size_t cb);
    void CompleteCollectorCollection(CServiceCollector *pCollector, const BYTE *pb, size_t cb);
    void ActivitiyCompleted();
    void FlushLog();

    // Fixed at construction; read by the coordinator and the collector endpoints.
    const GUID &ActivityId() const { return m_activityId; }
    const GUID &LogId() const { return m_logId; }
    // Whether the activity still runs: only a hint outside the operation's queue.
    bool HasActivity() const { return m_fActivityAttached.load(); }

    // IUnknown
    HRESULT STDMETHODCALLTYPE QueryInterface(REFIID riid, void **ppv) override;
    ULONG STDMETHODCALLTYPE AddRef() override;
    ULONG STDMETHODCALLTYPE Release() override;

    // IDestroyable
    void Destroy() override;
    void WaitForDestroyComplete() override;
    ULONG AddRef(ULONG ulTag) override;
    ULONG Release(ULONG ulTag) override;

    void Dispatch(ULONG ulEventType, ULONG_PTR ulArg1, ULONG_PTR ulArg2, ULONG_PTR ulArg3) override;

    // Objects alive in this process: the unload check and the tests read it.
    static long LiveCount();

protected:
    ~CServiceOperation() override;

private:
    enum : ULONG
    {
        EventProvideCollector = 1,
        EventCompleteCollectorCollection = 2,
        EventActivitiyCompleted = 3,
        EventActivityEvent = 4,
        EventDestroy = 5,
        EventAddCollectors = 6,
        EventRemoveCollectors = 7,
        EventFlushLog = 8,
    };

    typedef std::vector<BYTE> ByteVector;

    void Dispatch_ProvideCollector(CServiceCollector *pCollector);
    void Dispatch_CompleteCollectorCollection(CServiceCollector *pCollector, ByteVector *pvb);
    void Dispatch_ActivitiyCompleted();
    void Dispatch_ActivityEvent(GUID *pEventId, ByteVector *pvb);
    void Dispatch_Destroy();
    void Dispatch_AddCollectors(std::vector<GUID> *prgIds);
    void Dispatch_RemoveCollectors(std::vector<GUID> *prgIds);
    void Dispatch_FlushLog();
    void Dispatch_AdvanceCompletion();
    void Record(const GUID &id, const ByteVector &vb);

    GUID m_activityId;
    GUID m_sessionId;
    GUID m_logId;
    std::map<GUID, CTaggedPtr<CServiceCollector, 1>, GuidKeyLess> m_mapActiveCollectors;
    std::list<GUID> m_listWaitingForCollectors;
    CTaggedPtr<TelvaneService, 2> m_pService;
    CTaggedPtr<CServiceActivity, 22> m_pActivity;
    std::atomic<bool> m_fActivityAttached;
    CTraceDocument m_trace;
    bool m_fHasContent;
    bool m_fDestroying;
    bool m_fCompleted;
    CKernelHandle m_hDestroyComplete;
    TaggedRefCount<c_cServiceTags> m_refs;
};

TAGGED_PTR_CLASS_NAME(CServiceOperation);
