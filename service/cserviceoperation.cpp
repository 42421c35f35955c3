#include "service/cserviceoperation.h"
#include "service/cservicecollector.h"
#include "service/cserviceactivity.h"
#include "service/telvaneservice.h"
#include "servicelib/diagnostics.h"
#include "servicelib/eventtrace.h"

#include <memory>

namespace
{
std::atomic<long> s_cLiveOperations(0);

void OperationFatal(const wchar_t *wszFunction, ULONG ulLine, const wchar_t *wszLabel)
{
    FatalError(wszFunction, TELVANE_WFILE, ulLine, wszLabel, GetLastError());
}
} // namespace

CServiceOperation::CServiceOperation(TelvaneService *pService, const GUID &sessionId,
                                     CServiceActivity *pActivity)
    : m_activityId(pActivity->ActivityId())
    , m_sessionId(sessionId)
    , m_logId(pActivity->LogId())
    , m_fActivityAttached(true)
    , m_fHasContent(false)
    , m_fDestroying(false)
    , m_fCompleted(false)
    , m_hDestroyComplete(CreateEventW(nullptr, TRUE, FALSE, nullptr))
{
    s_cLiveOperations.fetch_add(1);
    m_pService = pService;
    m_pActivity = pActivity;
    if (!m_hDestroyComplete.IsValid())
    {
        FATAL_ERROR(L"CServiceOperation::CServiceOperation", L"CreateEvent", GetLastError());
    }
    m_trace.Begin(m_activityId, m_sessionId, m_logId);
    TelvaneTrace("CServiceOperation::CServiceOperation()");
}

CServiceOperation::~CServiceOperation()
{
    if (!m_hDestroyComplete.Close())
    {
        OperationFatal(L"CServiceOperation::~CServiceOperation", __LINE__, L"CloseHandle");
    }
    m_pActivity.Release();
    m_pService.Release();
    m_mapActiveCollectors.clear();
    s_cLiveOperations.fetch_sub(1);
}

long CServiceOperation::LiveCount()
{
    return s_cLiveOperations.load();
}

HRESULT STDMETHODCALLTYPE CServiceOperation::QueryInterface(REFIID riid, void **ppv)
{
    if (ppv == nullptr)
    {
        return E_POINTER;
    }
    if (IsEqualIID(riid, IID_IUnknown))
    {
        *ppv = static_cast<IUnknown *>(this);
        AddRef();
        return S_OK;
    }
    *ppv = nullptr;
    return E_NOINTERFACE;
}

ULONG STDMETHODCALLTYPE CServiceOperation::AddRef()
{
    return AddRef(0);
}

ULONG STDMETHODCALLTYPE CServiceOperation::Release()
{
    return Release(0);
}

ULONG CServiceOperation::AddRef(ULONG ulTag)
{
    return m_refs.AddRef(ulTag);
}

ULONG CServiceOperation::Release(ULONG ulTag)
{
    ULONG cRef = m_refs.Release(ulTag, L"CServiceOperation::Release", TELVANE_WFILE, __LINE__);
    if (cRef == 0)
    {
        delete this;
    }
    return cRef;
}

void CServiceOperation::AddCollectors(const std::vector<GUID> &rgCollectorIds)
{
    Post(EventAddCollectors, reinterpret_cast<ULONG_PTR>(new std::vector<GUID>(rgCollectorIds)));
}

void CServiceOperation::RemoveCollectors(const std::vector<GUID> &rgCollectorIds)
{
    Post(EventRemoveCollectors, reinterpret_cast<ULONG_PTR>(new std::vector<GUID>(rgCollectorIds)));
}

void CServiceOperation::ProvideCollector(CServiceCollector *pCollector)
{
    Post(EventProvideCollector, reinterpret_cast<ULONG_PTR>(pCollector));
}

void CServiceOperation::ActivityEvent(const GUID &eventId, const BYTE *pb, size_t cb)
{
    static const GUID s_zero = {};
    GUID *pEventId = GuidKeyEqual(eventId, s_zero) ? nullptr : new GUID(eventId);
    ByteVector *pvb = pb != nullptr ? new ByteVector(pb, pb + cb) : nullptr;
    Post(EventActivityEvent, reinterpret_cast<ULONG_PTR>(pEventId),
         reinterpret_cast<ULONG_PTR>(pvb));
}

void CServiceOperation::CompleteCollectorCollection(CServiceCollector *pCollector, const BYTE *pb,
                                                    size_t cb)
{
    pCollector->AddRef(9);
    ByteVector *pvb = pb != nullptr ? new ByteVector(pb, pb + cb) : nullptr;
    Post(EventCompleteCollectorCollection, reinterpret_cast<ULONG_PTR>(pCollector),
         reinterpret_cast<ULONG_PTR>(pvb));
}

void CServiceOperation::ActivitiyCompleted()
{
    Post(EventActivitiyCompleted);
}

void CServiceOperation::FlushLog()
{
    Post(EventFlushLog);
}

void CServiceOperation::Destroy()
{
    Post(EventDestroy);
}

void CServiceOperation::Dispatch(ULONG ulEventType, ULONG_PTR ulArg1, ULONG_PTR ulArg2,
                                 ULONG_PTR ulArg3)
{
    switch (ulEventType)
    {
    case EventProvideCollector:
        Dispatch_ProvideCollector(reinterpret_cast<CServiceCollector *>(ulArg1));
        break;
    case EventCompleteCollectorCollection:
        Dispatch_CompleteCollectorCollection(reinterpret_cast<CServiceCollector *>(ulArg1),
                                             reinterpret_cast<ByteVector *>(ulArg2));
        break;
    case EventActivitiyCompleted:
        Dispatch_ActivitiyCompleted();
        break;
    case EventActivityEvent:
        Dispatch_ActivityEvent(reinterpret_cast<GUID *>(ulArg1),
                               reinterpret_cast<ByteVector *>(ulArg2));
        break;
    case EventDestroy:
        Dispatch_Destroy();
        break;
    case EventAddCollectors:
        Dispatch_AddCollectors(reinterpret_cast<std::vector<GUID> *>(ulArg1));
        break;
    case EventRemoveCollectors:
        Dispatch_RemoveCollectors(reinterpret_cast<std::vector<GUID> *>(ulArg1));
        break;
    case EventFlushLog:
        Dispatch_FlushLog();
        break;
    default:
        DISPATCH_UNKNOWN_EVENT(L"CServiceOperation::Dispatch", L"CServiceOperation::EventType %u",
                               ulEventType);
        break;
    }
}

void CServiceOperation::Dispatch_ProvideCollector(CServiceCollector *pCollector)
{
    TelvaneTrace("CServiceOperation::ProvideCollector()");
    const GUID &collectorId = pCollector->CollectorId();
    if (m_fDestroying)
    {
        OperationFatal(L"CServiceOperation::Dispatch_ProvideCollector", __LINE__, L"Destroying");
    }
    auto it = m_listWaitingForCollectors.begin();
    while (it != m_listWaitingForCollectors.end() && !GuidKeyEqual(*it, collectorId))
    {
        ++it;
    }
    if (it == m_listWaitingForCollectors.end())
    {
        OperationFatal(L"CServiceOperation::Dispatch_ProvideCollector", __LINE__,
                       L"NotWaitingForCollector");
    }
    else
    {
        m_listWaitingForCollectors.erase(it);
    }
    AddRef(16);
    pCollector->StartCollection(this);
    // The coordinator hands a collector to one operation at a time, and this operation gets it
    // back only after returning it, so an entry never holds another collector object here.
    m_mapActiveCollectors[collectorId] = pCollector;
    Dispatch_AdvanceCompletion();
    pCollector->Release(10);
}

void CServiceOperation::Dispatch_CompleteCollectorCollection(CServiceCollector *pCollector,
                                                             ByteVector *pvb)
{
    std::unique_ptr<ByteVector> vb(pvb);
    TelvaneTrace("CServiceOperation::CompleteCollectorCollection()");
    auto it = m_mapActiveCollectors.find(pCollector->CollectorId());
    if (it == m_mapActiveCollectors.end())
    {
        OperationFatal(L"CServiceOperation::Dispatch_CompleteCollectorCollection", __LINE__,
                       L"NoSuchCollector");
    }
    else
    {
        m_mapActiveCollectors.erase(it);
    }
    if (vb != nullptr)
    {
        if (!vb->empty())
        {
            Record(pCollector->CollectorId(), *vb);
        }
    }
    else
    {
        TelvaneTrace("CServiceOperation::CompleteCollectorCollection() - collection failed, no "
                     "content");
    }
    vb.reset();
    pCollector->AddRef(15);
    m_pService->ReturnCollector(pCollector);
    Dispatch_AdvanceCompletion();
    pCollector->Release(9);
}

void CServiceOperation::Dispatch_ActivitiyCompleted()
{
    TelvaneTrace("CServiceOperation::ActivitiyCompleted()");
    m_trace.AddExecutionTime();
    if (m_pActivity != nullptr)
    {
        m_fActivityAttached.store(false);
        m_pActivity.Release();
    }
    Dispatch_AdvanceCompletion();
}

void CServiceOperation::Dispatch_ActivityEvent(GUID *pEventId, ByteVector *pvb)
{
    std::unique_ptr<GUID> eventId(pEventId);
    std::unique_ptr<ByteVector> vb(pvb);
    TelvaneTrace("CServiceOperation::ActivityEvent()");
    if (vb != nullptr && !vb->empty())
    {
        static const GUID s_zero = {};
        Record(eventId != nullptr ? *eventId : s_zero, *vb);
    }
}

// Records one value; a log that has grown past its bound while the activity runs is flushed at
// once, as the hourly flush would, so that a chatty activity cannot pin unbounded memory.
void CServiceOperation::Record(const GUID &id, const ByteVector &vb)
{
    m_fHasContent = true;
    m_trace.RecordEvent(id, vb.data(), vb.size());
    if (m_pActivity != nullptr && m_trace.RecordedBytes() >= TELVANE_MAX_LOG_BYTES)
    {
        TelvaneTrace("CServiceOperation::ActivityEvent() - log past its bound, flushing early");
        Dispatch_FlushLog();
    }
}

void CServiceOperation::Dispatch_Destroy()
{
    if (m_fDestroying)
    {
        return;
    }
    m_fDestroying = true;
    if (m_pActivity != nullptr)
    {
        // The reference stays until ActivitiyCompleted arrives.
        static_cast<IDestroyable *>(m_pActivity.Get())->Destroy();
    }
    m_listWaitingForCollectors.clear();
    Dispatch_AdvanceCompletion();
}

void CServiceOperation::Dispatch_AddCollectors(std::vector<GUID> *prgIds)
{
    std::unique_ptr<std::vector<GUID>> rgIds(prgIds);
    if (m_fDestroying)
    {
        OperationFatal(L"CServiceOperation::Dispatch_AddCollectors", __LINE__, L"Destroying");
    }
    else
    {
        m_listWaitingForCollectors.insert(m_listWaitingForCollectors.end(), rgIds->begin(),
                                          rgIds->end());
    }
    rgIds.reset();
    Dispatch_AdvanceCompletion();
}

void CServiceOperation::Dispatch_RemoveCollectors(std::vector<GUID> *prgIds)
{
    std::unique_ptr<std::vector<GUID>> rgIds(prgIds);
    for (const GUID &id : *rgIds)
    {
        for (auto it = m_listWaitingForCollectors.begin(); it != m_listWaitingForCollectors.end();
             ++it)
        {
            if (GuidKeyEqual(*it, id))
            {
                m_listWaitingForCollectors.erase(it);
                break;
            }
        }
    }
    rgIds.reset();
    Dispatch_AdvanceCompletion();
}

void CServiceOperation::Dispatch_FlushLog()
{
    TelvaneTrace("CServiceOperation::FlushLog()");
    if (!m_fHasContent)
    {
        TelvaneTrace("CServiceOperation::FlushLog() - nothing to flush");
        return;
    }
    m_trace.FlushAndRestart(m_fCompleted);
    m_fHasContent = false;
}

void CServiceOperation::Dispatch_AdvanceCompletion()
{
    TelvaneTrace("CServiceOperation::AdvanceCompletion()");
    if (m_pActivity != nullptr)
    {
        return;
    }
    if (!m_mapActiveCollectors.empty())
    {
        if (TelvaneTraceEnabled(TelvaneTraceBitMessage))
        {
            DWORD dwNow = GetTickCount();
            for (const auto &entry : m_mapActiveCollectors)
            {
                TelvaneTraceF("CServiceOperation::AdvanceCompletion() waiting for collector to "
                              "finish %s for %lu at %p",
                              GuidKeyText(entry.first).Get(),
                              static_cast<unsigned long>(dwNow - entry.second->RequestTime()),
                              static_cast<void *>(entry.second.Get()));
            }
        }
        return;
    }
    if (!m_listWaitingForCollectors.empty())
    {
        if (TelvaneTraceEnabled(TelvaneTraceBitMessage))
        {
            for (const GUID &id : m_listWaitingForCollectors)
            {
                TelvaneTraceF("CServiceOperation::AdvanceCompletion() waiting for collector to "
                              "start %s",
                              GuidKeyText(id).Get());
            }
        }
        return;
    }
    if (!m_fCompleted)
    {
        TelvaneTrace("CServiceOperation::AdvanceCompletion() - no more waiting collectors, "
                     "flushing log");
        m_fCompleted = true;
        Dispatch_FlushLog();
        AddRef(23);
        m_pService->ReportOperationCompletion(this);
    }
    if (m_fDestroying)
    {
        m_pService.Release();
        if (!SetEvent(m_hDestroyComplete.Get()))
        {
            OperationFatal(L"CServiceOperation::Dispatch_AdvanceCompletion", __LINE__, L"SetEvent");
        }
    }
}

void CServiceOperation::WaitForDestroyComplete()
{
    TelvaneTrace("CServiceOperation::WaitForDestroyComplete()");
    WaitForSingleObject(m_hDestroyComplete.Get(), INFINITE);
    TelvaneTrace("CServiceOperation::WaitForDestroyComplete() - wait event finished");
    const wchar_t *wszFunction = L"CServiceOperation::WaitForDestroyComplete";
    if (!m_mapActiveCollectors.empty())
    {
        OperationFatal(wszFunction, __LINE__, L"ActiveCollectors");
    }
    if (!m_listWaitingForCollectors.empty())
    {
        OperationFatal(wszFunction, __LINE__, L"WaitingForCollectors");
    }
    if (m_pService != nullptr)
    {
        OperationFatal(wszFunction, __LINE__, L"Service");
    }
    if (m_pActivity != nullptr)
    {
        OperationFatal(wszFunction, __LINE__, L"Activity");
    }
}
