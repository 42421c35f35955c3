#include "service/telvaneservice.h"
#include "service/cserviceactivity.h"
#include "service/cservicecollector.h"
#include "service/cserviceoperation.h"
#include "service/resource.h"
#include "service/statesubscription.h"
#include "servicelib/diagnostics.h"
#include "servicelib/eventtrace.h"

#include <rpc.h>

#include <vector>

namespace
{
// The flush comes once an hour; the platform may put it off by up to five minutes to batch it
// with other timers.
const LONGLONG c_llTimerDueRelative = -36000000000LL;
const DWORD c_dwTimerWindowMs = 300000;

// The pause after the endpoints' destroy events, given once for all of them.
const DWORD c_dwEndpointSettleMs = 1000;

void ServiceFatal(const wchar_t *wszFunction, ULONG ulLine, const wchar_t *wszLabel)
{
    FatalError(wszFunction, TELVANE_WFILE, ulLine, wszLabel, GetLastError());
}

// Whether anybody holds an instance of the pipe name. WaitNamedPipeW answers "not found" only
// when no instance exists; a listening instance answers TRUE, busy ones ERROR_SEM_TIMEOUT.
bool PipeNameTaken(const wchar_t *wszPipe)
{
    if (WaitNamedPipeW(wszPipe, 1))
    {
        return true;
    }
    return GetLastError() != ERROR_FILE_NOT_FOUND;
}
} // namespace

TelvaneService::TelvaneService(const wchar_t *wszActivityPipe, const wchar_t *wszCollectorPipe)
    : m_wszActivityPipe(wszActivityPipe)
    , m_wszCollectorPipe(wszCollectorPipe)
    , m_pComponent(nullptr)
    , m_pTimer(nullptr)
    , m_sessionId()
    , m_fStarted(false)
    , m_fDestroying(false)
    , m_fDrained(false)
    , m_mtaCookie(nullptr)
    , m_hDestruction(CreateEventW(nullptr, TRUE, FALSE, nullptr))
{
    m_wszServiceName = L"Telvane";
    m_idsLocalizedName = IDS_TELVANE_DISPLAY_NAME;
    m_idsDescription = IDS_TELVANE_DESCRIPTION;
    m_ulStartType = SERVICE_AUTO_START;

    if (!m_hDestruction.IsValid())
    {
        FATAL_ERROR(L"TelvaneService::TelvaneService", L"CreateEvent", GetLastError());
    }
    InitializeCriticalSection(&m_lock);
    RPC_STATUS status = UuidCreate(&m_sessionId);
    if (status != RPC_S_OK)
    {
        FATAL_ERROR(L"TelvaneService::TelvaneService", L"UuidCreate", status);
    }
    TelvaneTrace("TelvaneService::TelvaneService()");
    m_pTimer = CreateThreadpoolTimer(TimerCallback, this, nullptr);
    if (m_pTimer == nullptr)
    {
        FATAL_ERROR(L"TelvaneService::TelvaneService", L"CreateThreadpoolTimer", GetLastError());
    }
    ArmTimer();
}

TelvaneService::~TelvaneService()
{
    // Unloaded after a stop, nothing of the service may be left; the counts name the leak.
    if (m_fDrained)
    {
        DebugLog(L"TelvaneService::~TelvaneService",
                 L"left: %ld activities, %ld collectors, %ld operations\r\n",
                 CServiceActivity::LiveCount(), CServiceCollector::LiveCount(),
                 CServiceOperation::LiveCount());
        ASSERT_CHECK(L"TelvaneService::~TelvaneService", CServiceActivity::LiveCount() == 0);
        ASSERT_CHECK(L"TelvaneService::~TelvaneService", CServiceCollector::LiveCount() == 0);
        ASSERT_CHECK(L"TelvaneService::~TelvaneService", CServiceOperation::LiveCount() == 0);
        for (ULONG ulTag = 1; ulTag < c_cServiceTags; ulTag++)
        {
            ASSERT_CHECK(L"TelvaneService::~TelvaneService", m_refs.TagCount(ulTag) == 0);
        }
    }
    CancelTimer();
    CloseThreadpoolTimer(m_pTimer);
    m_pTimer = nullptr;
    if (!m_hDestruction.Close())
    {
        ServiceFatal(L"TelvaneService::~TelvaneService", __LINE__, L"CloseHandle");
    }
    DeleteCriticalSection(&m_lock);
    if (m_pComponent != nullptr)
    {
        m_pComponent->Release();
        m_pComponent = nullptr;
    }
    m_listDestroyables.clear();
    m_mapWaitingOperations.clear();
    m_mapBusyCollectors.clear();
    m_mapRegisteredCollectors.clear();
    m_mapActiveOperations.clear();
    m_mapRetiringOperations.clear();
    m_mapConnectedActivities.clear();
    m_mapConnectedCollectors.clear();
    m_pCollectorListener.Release();
    m_pActivityListener.Release();
}

ULONG TelvaneService::AddRef(ULONG ulTag)
{
    return m_refs.AddRef(ulTag);
}

// The coordinator is a static object: its creator's reference is never released, so the
// total never reaches zero.
ULONG TelvaneService::Release(ULONG ulTag)
{
    return m_refs.Release(ulTag, L"TelvaneService::Release", TELVANE_WFILE, __LINE__);
}

void TelvaneService::OnStart()
{
    TelvaneTrace("TelvaneService::OnStart()");
    // Under the control manager's own host no thread keeps the process's multithreaded
    // apartment alive, and the thread-pool thread that runs Start could not create the
    // platform component. The service keeps it alive itself while it runs.
    if (m_mtaCookie == nullptr)
    {
        HRESULT hr = CoIncrementMTAUsage(&m_mtaCookie);
        if (FAILED(hr))
        {
            DebugLog(L"TelvaneService::OnStart", L"CoIncrementMTAUsage failed: 0x%08x\r\n", hr);
            m_mtaCookie = nullptr;
        }
    }
    Post(EventStart);
}

void TelvaneService::OnStop()
{
    TelvaneTrace("TelvaneService::OnStop()");
    Destroy();
    WaitForDestroyComplete();
    if (m_mtaCookie != nullptr)
    {
        CoDecrementMTAUsage(m_mtaCookie);
        m_mtaCookie = nullptr;
    }
    SetStatus(SERVICE_STOPPED);
}

void TelvaneService::ReportClientConnected(CServiceActivity *pActivity)
{
    Post(EventReportActivityClientConnected, reinterpret_cast<ULONG_PTR>(pActivity));
}

void TelvaneService::ReportClientConnected(CServiceCollector *pCollector)
{
    Post(EventReportCollectorClientConnected, reinterpret_cast<ULONG_PTR>(pCollector));
}

void TelvaneService::ReportConnectedActivity(CServiceActivity *pActivity)
{
    Post(EventReportConnectedActivity, reinterpret_cast<ULONG_PTR>(pActivity));
}

void TelvaneService::ReportDisconnectedActivity(CServiceActivity *pActivity)
{
    Post(EventReportDisconnectedActivity, reinterpret_cast<ULONG_PTR>(pActivity));
}

void TelvaneService::ReportConnectedCollector(CServiceCollector *pCollector)
{
    Post(EventReportConnectedCollector, reinterpret_cast<ULONG_PTR>(pCollector));
}

void TelvaneService::ReportDisconnectedCollector(CServiceCollector *pCollector)
{
    Post(EventReportDisconnectedCollector, reinterpret_cast<ULONG_PTR>(pCollector));
}

void TelvaneService::ReturnCollector(CServiceCollector *pCollector)
{
    Post(EventReturnCollector, reinterpret_cast<ULONG_PTR>(pCollector));
}

void TelvaneService::ReportOperationCompletion(CServiceOperation *pOperation)
{
    Post(EventReportOperationCompletion, reinterpret_cast<ULONG_PTR>(pOperation));
}

void TelvaneService::TimerTick()
{
    Post(EventTimerTick);
}

void TelvaneService::Destroy()
{
    Post(EventDestroy);
}

VOID CALLBACK TelvaneService::TimerCallback(PTP_CALLBACK_INSTANCE pInstance, PVOID pvContext,
                                            PTP_TIMER pTimer)
{
    static_cast<TelvaneService *>(pvContext)->TimerTick();
}

void TelvaneService::ArmTimer()
{
    ULARGE_INTEGER uliDue;
    uliDue.QuadPart = static_cast<ULONGLONG>(c_llTimerDueRelative);
    FILETIME ftDue = {uliDue.LowPart, uliDue.HighPart};
    SetThreadpoolTimer(m_pTimer, &ftDue, 0, c_dwTimerWindowMs);
}

// No callback runs after this returns, and none is queued.
void TelvaneService::CancelTimer()
{
    SetThreadpoolTimer(m_pTimer, nullptr, 0, 0);
    WaitForThreadpoolTimerCallbacks(m_pTimer, TRUE);
}

void TelvaneService::Dispatch(ULONG ulEventType, ULONG_PTR ulArg1, ULONG_PTR ulArg2,
                              ULONG_PTR ulArg3)
{
    switch (ulEventType)
    {
    case EventReportConnectedActivity:
        Dispatch_ReportConnectedActivity(reinterpret_cast<CServiceActivity *>(ulArg1));
        break;
    case EventReportDisconnectedActivity:
        Dispatch_ReportDisconnectedActivity(reinterpret_cast<CServiceActivity *>(ulArg1));
        break;
    case EventReportConnectedCollector:
        Dispatch_ReportConnectedCollector(reinterpret_cast<CServiceCollector *>(ulArg1));
        break;
    case EventReportDisconnectedCollector:
        Dispatch_ReportDisconnectedCollector(reinterpret_cast<CServiceCollector *>(ulArg1));
        break;
    case EventReturnCollector:
        Dispatch_ReturnCollector(reinterpret_cast<CServiceCollector *>(ulArg1));
        break;
    case EventAdvanceCollections:
        Dispatch_AdvanceCollections();
        break;
    case EventStart:
        Dispatch_Start();
        break;
    case EventReportOperationCompletion:
        Dispatch_ReportOperationCompletion(reinterpret_cast<CServiceOperation *>(ulArg1));
        break;
    case EventTimerTick:
        Dispatch_TimerTick();
        break;
    case EventDestroy:
        Dispatch_Destroy();
        break;
    case EventReportActivityClientConnected:
        Dispatch_ReportActivityClientConnected(reinterpret_cast<CServiceActivity *>(ulArg1));
        break;
    case EventReportCollectorClientConnected:
        Dispatch_ReportCollectorClientConnected(reinterpret_cast<CServiceCollector *>(ulArg1));
        break;
    default:
        DISPATCH_UNKNOWN_EVENT(L"TelvaneService::Dispatch", L"TelvaneService::EventType %u",
                               ulEventType);
        break;
    }
}

void TelvaneService::Dispatch_Start()
{
    TelvaneTrace("TelvaneService::Start()");
    if (m_fStarted || m_fDestroying)
    {
        // The coordinator runs once per load of the DLL.
        RefuseStart(ERROR_SERVICE_ALREADY_RUNNING);
        return;
    }
    m_fStarted = true;

    // Nobody may stand in for the service: a process that made either pipe before us would get
    // a share of the clients. The check comes before anything starts, so a refusal leaves
    // nothing behind.
    for (const wchar_t *wszPipe : {m_wszActivityPipe, m_wszCollectorPipe})
    {
        if (PipeNameTaken(wszPipe))
        {
            DebugLog(L"TelvaneService::Start",
                     L"%s exists already: another process holds it; not starting\r\n", wszPipe);
            TelvaneTrace("***TelvaneService::Start() - a pipe name is taken, not starting");
            RefuseStart(ERROR_ALREADY_EXISTS);
            return;
        }
    }
    // Each pipe's first instance must be its first anywhere (Windows refuses it otherwise).
    DWORD dwError = ERROR_SUCCESS;
    CServiceActivity *pActivity = new CServiceActivity(this, &dwError);
    if (dwError != ERROR_SUCCESS)
    {
        pActivity->Release(0);
        RefuseStart(dwError);
        return;
    }
    CServiceCollector *pCollector = new CServiceCollector(this, &dwError);
    if (dwError != ERROR_SUCCESS)
    {
        pCollector->Release(0);
        pActivity->Release(0);
        RefuseStart(dwError);
        return;
    }

    HRESULT hr =
        CoCreateInstance(CLSID_TelvanePlatformComponent, nullptr, CLSCTX_ALL,
                         IID_TelvanePlatformComponent, reinterpret_cast<void **>(&m_pComponent));
    if (SUCCEEDED(hr))
    {
        StateSubscriptionBegin(m_launcher.SubscriptionSlot(), c_ullBacklightStateName,
                               CUDPTestLauncher::WnfNotificationCallback, &m_launcher);
    }
    else
    {
        m_pComponent = nullptr;
        DebugLog(L"TelvaneService::Start",
                 L"no platform component (0x%08x): no backlight subscription\r\n", hr);
    }

    m_pActivityListener = pActivity;
    m_pCollectorListener = pCollector;
    pActivity->Listen();
    pCollector->Listen();
    pActivity->Release(0);
    pCollector->Release(0);
    SetStatus(SERVICE_RUNNING);
}

// A start that cannot be served ends as it began: the timer that runs from construction is
// taken back, so nothing is left running when the host unloads the DLL.
void TelvaneService::RefuseStart(DWORD dwError)
{
    CancelTimer();
    if (m_mtaCookie != nullptr)
    {
        CoDecrementMTAUsage(m_mtaCookie);
        m_mtaCookie = nullptr;
    }
    m_status.dwWin32ExitCode = dwError;
    SetStatus(SERVICE_STOPPED);
}

void TelvaneService::Dispatch_ReportActivityClientConnected(CServiceActivity *pActivity)
{
    TelvaneTrace("TelvaneService::ReportClientConnected()");
    // While destroying, the endpoint was destroyed as the listener; it ends by itself.
    if (!m_fDestroying)
    {
        if (pActivity != m_pActivityListener)
        {
            ServiceFatal(L"TelvaneService::Dispatch_ReportClientConnected", __LINE__,
                         L"Invalid Connection");
        }
        else
        {
            m_mapConnectedActivities[pActivity] = pActivity;
            m_pActivityListener.Release();
            CServiceActivity *pListener = new CServiceActivity(this);
            m_pActivityListener = pListener;
            pListener->Release(0);
        }
    }
    pActivity->Release(11);
}

void TelvaneService::Dispatch_ReportCollectorClientConnected(CServiceCollector *pCollector)
{
    TelvaneTrace("TelvaneService::ReportClientConnected()");
    if (!m_fDestroying)
    {
        if (pCollector != m_pCollectorListener)
        {
            ServiceFatal(L"TelvaneService::Dispatch_ReportClientConnected", __LINE__,
                         L"Invalid Connection");
        }
        else
        {
            m_mapConnectedCollectors[pCollector] = pCollector;
            m_pCollectorListener.Release();
            CServiceCollector *pListener = new CServiceCollector(this);
            m_pCollectorListener = pListener;
            pListener->Release(0);
        }
    }
    pCollector->Release(11);
}

void TelvaneService::Dispatch_ReportConnectedActivity(CServiceActivity *pActivity)
{
    TelvaneTrace("TelvaneService::ReportConnectedActivity()");
    if (m_fDestroying)
    {
        // Destroy destroyed it already (as the listener or a connected client); no listener
        // and no operation follow, so the drain completes.
        static_cast<IDestroyable *>(pActivity)->Destroy();
        pActivity->Release(19);
        return;
    }
    auto itConnected = m_mapConnectedActivities.find(pActivity);
    if (itConnected == m_mapConnectedActivities.end())
    {
        ServiceFatal(L"TelvaneService::Dispatch_ReportConnectedActivity", __LINE__,
                     L"Invalid Connection");
        pActivity->Release(19);
        return;
    }
    m_mapConnectedActivities.erase(itConnected);

    auto itActive = m_mapActiveOperations.find(pActivity->ActivityId());
    if (itActive != m_mapActiveOperations.end())
    {
        CServiceOperation *pOld = itActive->second;
        RemoveFromWaitingLists(pOld);
        TelvaneTrace("**TelvaneService::ReportConnectectedActivity() - destroying our old active "
                     "Operations because of duplicate activty type ID's");
        static_cast<IDestroyable *>(pOld)->Destroy();
        m_mapRetiringOperations[pOld] = pOld;
        m_mapActiveOperations.erase(itActive);
    }

    std::vector<GUID> rgCollectorIds;
    for (const auto &entry : m_mapRegisteredCollectors)
    {
        rgCollectorIds.push_back(entry.first);
    }
    CServiceOperation *pOperation = new CServiceOperation(this, m_sessionId, pActivity);
    pOperation->AddCollectors(rgCollectorIds);
    m_mapActivityOperations[pActivity] = pOperation;
    pOperation->AddRef(24);
    pActivity->SetServiceOperation(pOperation);
    m_mapActiveOperations[pActivity->ActivityId()] = pOperation;
    for (const GUID &collectorId : rgCollectorIds)
    {
        m_mapWaitingOperations[collectorId].emplace_back();
        m_mapWaitingOperations[collectorId].back() = pOperation;
    }
    Post(EventAdvanceCollections);
    pOperation->Release(0);
    pActivity->Release(19);
}

void TelvaneService::Dispatch_ReportDisconnectedActivity(CServiceActivity *pActivity)
{
    TelvaneTrace("TelvaneService::ReportDisconnectedActivity()");
    auto itConnected = m_mapConnectedActivities.find(pActivity);
    auto itOperation = m_mapActivityOperations.find(pActivity);
    if (pActivity == m_pActivityListener)
    {
        m_pActivityListener.Release();
        if (!m_fDestroying)
        {
            // The listener's pipe ended before a client connected (under load a client can
            // come and go before the connect completes): the pipe keeps a listener.
            CServiceActivity *pListener = new CServiceActivity(this);
            m_pActivityListener = pListener;
            pListener->Release(0);
        }
    }
    else if (itConnected != m_mapConnectedActivities.end())
    {
        // A client that left before it identified itself.
        m_mapConnectedActivities.erase(itConnected);
    }
    else if (itOperation != m_mapActivityOperations.end())
    {
        CServiceOperation *pOperation = itOperation->second;
        m_mapActivityOperations.erase(itOperation);
        pOperation->ActivitiyCompleted();
    }
    else
    {
        ServiceFatal(L"TelvaneService::Dispatch_ReportDisconnectedActivity", __LINE__,
                     L"CantBothRunAndDestroy");
    }
    Post(EventAdvanceCollections);
    pActivity->Release(18);
}

void TelvaneService::Dispatch_ReportConnectedCollector(CServiceCollector *pCollector)
{
    TelvaneTrace("TelvaneService::ReportConnectedCollector()");
    if (m_fDestroying)
    {
        static_cast<IDestroyable *>(pCollector)->Destroy();
        pCollector->Release(17);
        return;
    }
    auto itConnected = m_mapConnectedCollectors.find(pCollector);
    if (itConnected == m_mapConnectedCollectors.end())
    {
        ServiceFatal(L"TelvaneService::Dispatch_ReportConnectedCollector", __LINE__,
                     L"Invalid Connection");
        pCollector->Release(17);
        return;
    }
    m_mapConnectedCollectors.erase(itConnected);

    const GUID &collectorId = pCollector->CollectorId();
    auto itRegistered = m_mapRegisteredCollectors.find(collectorId);
    if (itRegistered != m_mapRegisteredCollectors.end())
    {
        TelvaneTrace("**TelvaneService::ReportConnectedCollector() - destroying two active "
                     "Collectors because of duplicate activty ID's");
        static_cast<IDestroyable *>(itRegistered->second.Get())->Destroy();
        m_mapRegisteredCollectors.erase(itRegistered);
    }
    m_mapRegisteredCollectors[collectorId] = pCollector;
    for (const auto &entry : m_mapActiveOperations)
    {
        CServiceOperation *pOperation = entry.second;
        if (pOperation->HasActivity())
        {
            pOperation->AddCollectors(std::vector<GUID>(1, collectorId));
            m_mapWaitingOperations[collectorId].emplace_back();
            m_mapWaitingOperations[collectorId].back() = pOperation;
        }
    }
    Post(EventAdvanceCollections);
    pCollector->Release(17);
}

void TelvaneService::Dispatch_ReportDisconnectedCollector(CServiceCollector *pCollector)
{
    TelvaneTrace("TelvaneService::Dispatch_ReportDisconnectedCollector()");
    auto itConnected = m_mapConnectedCollectors.find(pCollector);
    if (pCollector == m_pCollectorListener)
    {
        m_pCollectorListener.Release();
        if (!m_fDestroying)
        {
            CServiceCollector *pListener = new CServiceCollector(this);
            m_pCollectorListener = pListener;
            pListener->Release(0);
        }
    }
    else if (itConnected != m_mapConnectedCollectors.end())
    {
        m_mapConnectedCollectors.erase(itConnected);
    }
    else
    {
        auto itRegistered = m_mapRegisteredCollectors.find(pCollector->CollectorId());
        if (itRegistered == m_mapRegisteredCollectors.end())
        {
            // A replaced collector whose replacement left first: nothing of it is registered.
            TelvaneTrace("TelvaneService::Dispatch_ReportDisconnectedCollector() - late report "
                         "of a replaced collector, ignored");
        }
        else if (GuidKeyEqual(itRegistered->second->InstanceId(), pCollector->InstanceId()))
        {
            m_mapRegisteredCollectors.erase(itRegistered);
        }
        else
        {
            TelvaneTrace("TelvaneService::Dispatch_ReportDisconnectedCollector() - encountered a "
                         "valid collector with the wrong instance ID, this is okay but may point "
                         "to a bug in the collector");
        }
    }
    Post(EventAdvanceCollections);
    pCollector->Release(14);
}

void TelvaneService::Dispatch_ReturnCollector(CServiceCollector *pCollector)
{
    TelvaneTrace("TelvaneService::ReturnCollector()");
    auto itBusy = m_mapBusyCollectors.find(pCollector->CollectorId());
    if (itBusy == m_mapBusyCollectors.end())
    {
        ServiceFatal(L"TelvaneService::Dispatch_ReturnCollector", __LINE__, L"NoSuchCollection");
    }
    else
    {
        m_mapBusyCollectors.erase(itBusy);
    }
    Post(EventAdvanceCollections);
    pCollector->Release(15);
}

void TelvaneService::Dispatch_ReportOperationCompletion(CServiceOperation *pOperation)
{
    TelvaneTrace("TelvaneService::ReportoperationComplete()");
    auto itActive = m_mapActiveOperations.find(pOperation->ActivityId());
    auto itRetiring = m_mapRetiringOperations.find(pOperation);
    if (itActive != m_mapActiveOperations.end() && itActive->second == pOperation)
    {
        m_mapActiveOperations.erase(itActive);
    }
    else if (itRetiring != m_mapRetiringOperations.end())
    {
        m_mapRetiringOperations.erase(itRetiring);
    }
    else
    {
        ServiceFatal(L"TelvaneService::Dispatch_ReportOperationCompletion", __LINE__,
                     L"CantBothRunAndDestroy");
    }
    Post(EventAdvanceCollections);
    pOperation->Release(23);
}

void TelvaneService::Dispatch_AdvanceCollections()
{
    TelvaneTrace("TelvaneService::AdvanceCollections()");
    for (auto it = m_mapWaitingOperations.begin(); it != m_mapWaitingOperations.end();)
    {
        const GUID &collectorId = it->first;
        WaitingList &listWaiting = it->second;
        if (m_mapBusyCollectors.count(collectorId) != 0)
        {
            ++it;
            continue;
        }
        if (listWaiting.empty())
        {
            it = m_mapWaitingOperations.erase(it);
            continue;
        }
        CTaggedPtr<CServiceOperation, 13> pOperation;
        pOperation = listWaiting.front().Get();
        listWaiting.pop_front();
        auto itRegistered = m_mapRegisteredCollectors.find(collectorId);
        if (itRegistered == m_mapRegisteredCollectors.end())
        {
            TelvaneTrace("TelvaneService::AdvanceCollections() - a waiting operation needs a "
                         "collector that is missing, alerting that truth");
            pOperation->RemoveCollectors(std::vector<GUID>(1, collectorId));
        }
        else
        {
            m_mapBusyCollectors[collectorId] = pOperation.Get();
            CServiceCollector *pCollector = itRegistered->second;
            pCollector->AddRef(10);
            pOperation->ProvideCollector(pCollector);
        }
        pOperation.Release();
        if (listWaiting.empty())
        {
            it = m_mapWaitingOperations.erase(it);
        }
        else
        {
            ++it;
        }
    }
    if (m_fDestroying && IsDrained())
    {
        TelvaneTrace("TelvaneService::AdvanceCollections() - everything destroyed, signaling");
        if (!SetEvent(m_hDestruction.Get()))
        {
            ServiceFatal(L"TelvaneService::Dispatch_AdvanceCollections", __LINE__, L"SetEvent");
        }
    }
}

bool TelvaneService::IsDrained() const
{
    return m_pActivityListener == nullptr && m_pCollectorListener == nullptr &&
           m_mapConnectedActivities.empty() && m_mapConnectedCollectors.empty() &&
           m_mapRetiringOperations.empty() && m_mapActiveOperations.empty() &&
           m_mapRegisteredCollectors.empty() && m_mapBusyCollectors.empty() &&
           m_mapWaitingOperations.empty();
}

void TelvaneService::Dispatch_TimerTick()
{
    TelvaneTrace("TelvaneService::TimerTick()");
    for (const auto &entry : m_mapActiveOperations)
    {
        entry.second->FlushLog();
    }
    for (const auto &registered : m_mapRegisteredCollectors)
    {
        const GUID &collectorId = registered.first;
        for (const auto &active : m_mapActiveOperations)
        {
            CServiceOperation *pOperation = active.second;
            if (pOperation->HasActivity() && m_mapWaitingOperations.count(collectorId) == 0)
            {
                pOperation->AddCollectors(std::vector<GUID>(1, collectorId));
                m_mapWaitingOperations[collectorId].emplace_back();
                m_mapWaitingOperations[collectorId].back() = pOperation;
            }
        }
    }
    Post(EventAdvanceCollections);
    if (!m_fDestroying)
    {
        ArmTimer();
    }
}

void TelvaneService::RemoveFromWaitingLists(CServiceOperation *pOperation)
{
    for (auto &entry : m_mapWaitingOperations)
    {
        entry.second.remove_if([pOperation](const CTaggedPtr<CServiceOperation, 8> &p) {
            return p.Get() == pOperation;
        });
    }
}

// Under the lock.
void TelvaneService::AddDestroyable(IDestroyable *pDestroyable)
{
    m_listDestroyables.emplace_back();
    m_listDestroyables.back() = pDestroyable;
    pDestroyable->Destroy();
}

void TelvaneService::Dispatch_Destroy()
{
    TelvaneTrace("TelvaneService::Destroy()");
    if (m_fDestroying)
    {
        return;
    }
    m_fDestroying = true;
    EnterCriticalSection(&m_lock);
    m_launcher.RequestDestroy();
    if (m_pActivityListener != nullptr)
    {
        AddDestroyable(m_pActivityListener.Get());
    }
    if (m_pCollectorListener != nullptr)
    {
        AddDestroyable(m_pCollectorListener.Get());
    }
    for (const auto &entry : m_mapConnectedActivities)
    {
        AddDestroyable(entry.first);
    }
    for (const auto &entry : m_mapConnectedCollectors)
    {
        AddDestroyable(entry.first);
    }
    for (const auto &entry : m_mapActiveOperations)
    {
        CServiceOperation *pOperation = entry.second;
        AddDestroyable(pOperation);
        m_mapRetiringOperations[pOperation] = pOperation;
    }
    m_mapActiveOperations.clear();
    m_mapWaitingOperations.clear();
    for (const auto &entry : m_mapRegisteredCollectors)
    {
        AddDestroyable(entry.second.Get());
    }
    LeaveCriticalSection(&m_lock);
    // With nothing to drain (no start, or a refused one) this pass is the one that finishes.
    Post(EventAdvanceCollections);
}

void TelvaneService::WaitForDestroyComplete()
{
    TelvaneTrace("TelvaneService::WaitForDestroyComplete()");
    m_launcher.WaitForDestroyComplete();
    CancelTimer();
    TelvaneTrace("TelvaneService::WaitForDestroyComplete() - thread pool back");
    WaitForSingleObject(m_hDestruction.Get(), INFINITE);
    TelvaneTrace("TelvaneService::WaitForDestroyComplete() - destruction event signaled");
    EnterCriticalSection(&m_lock);
    // Every destroy event first, then one settling pause for all: a pause per endpoint would
    // make a stop with many clients outlast the control manager's patience.
    bool fPause = false;
    for (const auto &pDestroyable : m_listDestroyables)
    {
        fPause = pDestroyable->WaitForDestroyEvent() || fPause;
    }
    if (fPause)
    {
        Sleep(c_dwEndpointSettleMs);
    }
    for (const auto &pDestroyable : m_listDestroyables)
    {
        pDestroyable->FinishDestroy();
    }
    m_listDestroyables.clear();
    LeaveCriticalSection(&m_lock);
    m_fDrained = true;
    TelvaneTrace("TelvaneService::WaitForDestroyComplete() - all IDestroyables complete, we're "
                 "done");
}
