// The coordinator of the Telvane service: the service the shell starts and stops, and the
// object that owns every pipe endpoint and operation, matches collectors to operations, runs
// the hourly flush and drains everything at stop.
#pragma once

#include "service/cudptestlauncher.h"
#include "service/guidkey.h"
#include "servicelib/idestroyable.h"
#include "servicelib/service.h"
#include "servicelib/synchronizedobject.h"
#include "inc/handleholder.h"
#include "inc/taggedrefcount.h"
#include "inc/telvanepipe.h"

#include <objbase.h>

#include <list>
#include <map>

// The service host group the service is installed in.
const wchar_t c_wszTelvaneGroup[] = L"OVTCBNetwork";

// The platform component created at start: {B5368813-926B-449C-9676-DB6ED6F8F428}, interface
// {BD38F9C6-BC6C-4381-A13D-5A0D772D121F}.
constexpr CLSID CLSID_TelvanePlatformComponent = {
    0xB5368813, 0x926B, 0x449C, {0x96, 0x76, 0xDB, 0x6E, 0xD6, 0xF8, 0xF4, 0x28}};
constexpr IID IID_TelvanePlatformComponent = {
    0xBD38F9C6, 0xBC6C, 0x4381, {0xA1, 0x3D, 0x5A, 0x0D, 0x77, 0x2D, 0x12, 0x1F}};

class CServiceActivity;
class CServiceCollector;
class CServiceOperation;

// One per DLL (a static object built at load); tests make their own on other pipe names. The
// shell runs OnStart on a thread-pool thread (or the console thread) and OnStop on the stop
// thread; every other method only posts to the coordinator's queue, whose handlers run one at
// a time on whichever thread posted to it while idle.
class TelvaneService : public CService, public SynchronizedObject, public IDestroyable
{
public:
    TelvaneService(const wchar_t *wszActivityPipe = c_wszTelvaneActivityPipe,
                   const wchar_t *wszCollectorPipe = c_wszTelvaneCollectorPipe);
    ~TelvaneService() override;

    void OnStart() override;
    void OnStop() override;

    const wchar_t *ActivityPipeName() const { return m_wszActivityPipe; }
    const wchar_t *CollectorPipeName() const { return m_wszCollectorPipe; }

    // Reports of the endpoints and operations; each caller took the tag named at the event.
    void ReportClientConnected(CServiceActivity *pActivity);         // 11
    void ReportClientConnected(CServiceCollector *pCollector);       // 11
    void ReportConnectedActivity(CServiceActivity *pActivity);       // 19
    void ReportDisconnectedActivity(CServiceActivity *pActivity);    // 18
    void ReportConnectedCollector(CServiceCollector *pCollector);    // 17
    void ReportDisconnectedCollector(CServiceCollector *pCollector); // 14
    void ReturnCollector(CServiceCollector *pCollector);             // 15
    void ReportOperationCompletion(CServiceOperation *pOperation);   // 23
    // What the hourly timer's callback posts; tests fire it directly.
    void TimerTick();

    // IDestroyable
    void Destroy() override;
    void WaitForDestroyComplete() override;
    ULONG AddRef(ULONG ulTag) override;
    ULONG Release(ULONG ulTag) override;
    // Plain references (tag 0), as the endpoints hold the coordinator.
    ULONG AddRef() override { return AddRef(0); }
    ULONG Release() override { return Release(0); }

    void Dispatch(ULONG ulEventType, ULONG_PTR ulArg1, ULONG_PTR ulArg2, ULONG_PTR ulArg3) override;

    // References held under one tag, for the tests and the unload check.
    long TagCount(ULONG ulTag) const { return m_refs.TagCount(ulTag); }

private:
    enum : ULONG
    {
        EventReportConnectedActivity = 1,
        EventReportDisconnectedActivity = 2,
        EventReportConnectedCollector = 3,
        EventReportDisconnectedCollector = 4,
        EventReturnCollector = 5,
        EventAdvanceCollections = 6,
        EventStart = 7,
        EventReportOperationCompletion = 8,
        EventTimerTick = 9,
        EventDestroy = 10,
        EventReportActivityClientConnected = 11,
        EventReportCollectorClientConnected = 12,
    };

    typedef std::list<CTaggedPtr<CServiceOperation, 8>> WaitingList;

    void Dispatch_Start();
    void Dispatch_ReportActivityClientConnected(CServiceActivity *pActivity);
    void Dispatch_ReportCollectorClientConnected(CServiceCollector *pCollector);
    void Dispatch_ReportConnectedActivity(CServiceActivity *pActivity);
    void Dispatch_ReportDisconnectedActivity(CServiceActivity *pActivity);
    void Dispatch_ReportConnectedCollector(CServiceCollector *pCollector);
    void Dispatch_ReportDisconnectedCollector(CServiceCollector *pCollector);
    void Dispatch_ReturnCollector(CServiceCollector *pCollector);
    void Dispatch_ReportOperationCompletion(CServiceOperation *pOperation);
    void Dispatch_AdvanceCollections();
    void Dispatch_TimerTick();
    void Dispatch_Destroy();

    void RefuseStart(DWORD dwError);
    void ArmTimer();
    void CancelTimer();
    void RemoveFromWaitingLists(CServiceOperation *pOperation);
    void AddDestroyable(IDestroyable *pDestroyable);
    bool IsDrained() const;
    static VOID CALLBACK TimerCallback(PTP_CALLBACK_INSTANCE pInstance, PVOID pvContext,
                                       PTP_TIMER pTimer);

    const wchar_t *m_wszActivityPipe;
    const wchar_t *m_wszCollectorPipe;
    CTaggedPtr<CServiceActivity, 21> m_pActivityListener;
    CTaggedPtr<CServiceCollector, 5> m_pCollectorListener;
    // Connected clients that have not identified themselves yet (the listener is already
    // replaced); told apart by identity, so an all-zero identifier is an ordinary one.
    std::map<CServiceActivity *, CTaggedPtr<CServiceActivity, 12>> m_mapConnectedActivities;
    std::map<CServiceCollector *, CTaggedPtr<CServiceCollector, 12>> m_mapConnectedCollectors;
    // Keyed by the operation: clients may reuse a LogID.
    std::map<CServiceOperation *, CTaggedPtr<CServiceOperation, 29>> m_mapRetiringOperations;
    std::map<GUID, CTaggedPtr<CServiceOperation, 6>, GuidKeyLess> m_mapActiveOperations;
    // Which operation each started activity endpoint feeds, so that its end reaches that
    // operation whatever other activities share its identifiers. References are held by the
    // two maps above.
    std::map<CServiceActivity *, CServiceOperation *> m_mapActivityOperations;
    std::map<GUID, CTaggedPtr<CServiceCollector, 4>, GuidKeyLess> m_mapRegisteredCollectors;
    std::map<GUID, CTaggedPtr<CServiceOperation, 7>, GuidKeyLess> m_mapBusyCollectors;
    std::map<GUID, WaitingList, GuidKeyLess> m_mapWaitingOperations;
    std::list<CTaggedPtr<IDestroyable, 26>> m_listDestroyables;
    IUnknown *m_pComponent;
    CUDPTestLauncher m_launcher;
    PTP_TIMER m_pTimer;
    GUID m_sessionId;
    bool m_fStarted;
    bool m_fDestroying;
    bool m_fDrained;
    CO_MTA_USAGE_COOKIE m_mtaCookie;
    CKernelHandle m_hDestruction;
    CRITICAL_SECTION m_lock;
    TaggedRefCount<c_cServiceTags> m_refs;
};

TAGGED_PTR_CLASS_NAME(TelvaneService);
