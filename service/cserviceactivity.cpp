#include "service/cserviceactivity.h"
#include "service/cserviceoperation.h"
#include "service/telvaneservice.h"
#include "servicelib/diagnostics.h"
#include "servicelib/eventtrace.h"

#include <memory>

namespace
{
std::atomic<long> s_cLiveActivities(0);

// What the pipes' owners wait after an endpoint's destroy event, so that the thread-pool
// callbacks of its pipe have finished with it.
const DWORD c_dwEndpointSettleMs = 1000;
} // namespace

CServiceActivity::CServiceActivity(TelvaneService *pService)
{
    Construct(pService);
    m_pPipe->Listen(pService->ActivityPipeName(), this, this);
}

CServiceActivity::CServiceActivity(TelvaneService *pService, DWORD *pdwError)
{
    Construct(pService);
    *pdwError = m_pPipe->Create(pService->ActivityPipeName(), true);
}

void CServiceActivity::Construct(TelvaneService *pService)
{
    s_cLiveActivities.fetch_add(1);
    m_pService = pService;
    m_pService->AddRef();
    m_activityId = GUID();
    m_logId = GUID();
    m_fDestroyRequested = false;
    m_fDisconnectHeld = false;
    m_cbHeld = 0;
    m_hDestroyed.Reset(CreateEventW(nullptr, TRUE, FALSE, nullptr));
    if (!m_hDestroyed.IsValid())
    {
        FATAL_ERROR(L"CServiceActivity::CServiceActivity", L"CreateEvent", GetLastError());
    }
    m_pPipe = new AsyncPipe();
    m_fReported = true;
    m_ulProtocolState = StateListening;
    TelvaneTrace("CServiceActivity::CServiceActivity()");
}

void CServiceActivity::Listen()
{
    m_pPipe->Listen(this, this);
}

CServiceActivity::~CServiceActivity()
{
    TelvaneTrace("CServiceActivity::~CServiceActivity()");
    m_pPipe->Release();
    m_pPipe = nullptr;
    if (!m_hDestroyed.Close())
    {
        FATAL_ERROR(L"CServiceActivity::~CServiceActivity", L"CloseHandle", GetLastError());
    }
    m_reassembly.Clear();
    m_pOperation.Release();
    if (m_pService != nullptr)
    {
        m_pService->Release();
        m_pService = nullptr;
    }
    s_cLiveActivities.fetch_sub(1);
}

long CServiceActivity::LiveCount()
{
    return s_cLiveActivities.load();
}

HRESULT STDMETHODCALLTYPE CServiceActivity::QueryInterface(REFIID riid, void **ppv)
{
    if (ppv == nullptr)
    {
        return E_POINTER;
    }
    if (IsEqualIID(riid, IID_IUnknown) || IsEqualIID(riid, IID_IPipeDataSink))
    {
        *ppv = static_cast<IPipeDataSink *>(this);
        AddRef();
        return S_OK;
    }
    *ppv = nullptr;
    return E_NOINTERFACE;
}

ULONG STDMETHODCALLTYPE CServiceActivity::AddRef()
{
    return AddRef(0);
}

ULONG STDMETHODCALLTYPE CServiceActivity::Release()
{
    return Release(0);
}

ULONG CServiceActivity::AddRef(ULONG ulTag)
{
    return m_refs.AddRef(ulTag);
}

ULONG CServiceActivity::Release(ULONG ulTag)
{
    ULONG cRef = m_refs.Release(ulTag, L"CServiceActivity::Release", TELVANE_WFILE, __LINE__);
    if (cRef == 0)
    {
        delete this;
    }
    return cRef;
}

HRESULT STDMETHODCALLTYPE CServiceActivity::IncomingMessage(const BYTE *pb, ULONG cb)
{
    Post(EventIncomingMessage, reinterpret_cast<ULONG_PTR>(new ByteVector(pb, pb + cb)));
    return S_OK;
}

HRESULT STDMETHODCALLTYPE CServiceActivity::Connected()
{
    Post(EventConnected);
    return S_OK;
}

HRESULT STDMETHODCALLTYPE CServiceActivity::PipeBroken()
{
    TelvaneTrace("CServiceActivity::PipeBroken()");
    Post(EventPipeBroken);
    return S_OK;
}

void CServiceActivity::Destroy()
{
    TelvaneTrace("CServiceActivity::Destroy()");
    Post(EventDestroy);
}

void CServiceActivity::SetServiceOperation(CServiceOperation *pOperation)
{
    Post(EventSetServiceOperation, reinterpret_cast<ULONG_PTR>(pOperation));
}

void CServiceActivity::Dispatch(ULONG ulEventType, ULONG_PTR ulArg1, ULONG_PTR ulArg2,
                                ULONG_PTR ulArg3)
{
    switch (ulEventType)
    {
    case EventIncomingMessage:
        Dispatch_IncomingMessage(reinterpret_cast<ByteVector *>(ulArg1));
        break;
    case EventConnected:
        Dispatch_Connected();
        break;
    case EventDestroy:
        Dispatch_Destroy();
        break;
    case EventSetServiceOperation:
        Dispatch_SetServiceOperation(reinterpret_cast<CServiceOperation *>(ulArg1));
        break;
    case EventPipeBroken:
        Dispatch_PipeBroken();
        break;
    default:
        DISPATCH_UNKNOWN_EVENT(L"CServiceActivity::Dispatch", L"CClientActivity::EventType %u",
                               ulEventType);
        break;
    }
}

void CServiceActivity::Dispatch_Connected()
{
    TelvaneTrace("CServiceActivity::Connected()");
    if (m_ulProtocolState >= StateReportingDisconnect)
    {
        // The client arrived just as the endpoint was being destroyed; the connection is over.
        return;
    }
    if (m_ulProtocolState != StateListening)
    {
        FATAL_ERROR(L"CServiceActivity::Dispatch_Connected", L"ProtocolState", m_ulProtocolState);
        return;
    }
    m_ulProtocolState = StateAwaitingVersion;
    uint8_t rgbVersion[sizeof(TELVANE_VERSION_NEGOTIATE)];
    PipeCodecEncodeVersion(rgbVersion);
    m_pPipe->Write(rgbVersion, sizeof(rgbVersion));
    // The coordinator puts the next listener in place now, not when this client identifies
    // itself: a client that never does must not keep everyone else out.
    AddRef(11);
    m_pService->ReportClientConnected(this);
}

void CServiceActivity::Dispatch_IncomingMessage(ByteVector *pvb)
{
    std::unique_ptr<ByteVector> vb(pvb);
    if (m_ulProtocolState >= StateReportingDisconnect)
    {
        return;
    }
    PIPE_MESSAGE message;
    PipeCodecDecodeActivity(vb->data(), vb->size(), &message);
    if (message.szTrace != nullptr)
    {
        TelvaneTrace(message.szTrace);
    }
    switch (message.kind)
    {
    case PipeMessageVersion:
        if (m_ulProtocolState != StateAwaitingVersion)
        {
            ClosePipe(c_szPipeFaultActivityState);
            break;
        }
        m_ulProtocolState = StateVersioned;
        break;

    case PipeMessageStartActivity:
        if (m_ulProtocolState != StateVersioned)
        {
            ClosePipe(c_szPipeFaultActivityState);
            break;
        }
        if (message.szFault != nullptr)
        {
            ClosePipe(message.szFault);
            break;
        }
        m_ulProtocolState = StateStarted;
        static_assert(sizeof(GUID) == sizeof(TELVANE_GUID), "a GUID travels as its 16 bytes");
        CopyMemory(&m_activityId, &message.ActivityID, sizeof(m_activityId));
        CopyMemory(&m_logId, &message.LogID, sizeof(m_logId));
        AddRef(19);
        m_pService->ReportConnectedActivity(this);
        break;

    case PipeMessageActivityEvent:
        // The state decides first: an event before the start is dropped whatever its size.
        if (m_ulProtocolState != StateStarted)
        {
            break;
        }
        if (message.szFault != nullptr)
        {
            ClosePipe(message.szFault);
            break;
        }
        OnEventPart(message);
        break;

    case PipeMessageStopActivity:
        ClosePipe(nullptr);
        break;

    default:
        ClosePipe(message.szFault, message.fFaultCode, message.ulOpcode);
        break;
    }
}

void CServiceActivity::OnEventPart(const PIPE_MESSAGE &message)
{
    switch (m_reassembly.AddPart(message.pbPayload, message.cbPayload, message.fComplete))
    {
    case PipePartMore:
        TelvaneTrace(c_szPipeTraceActivityMultipart);
        break;
    case PipePartTooLarge:
        ClosePipe(c_szPipeFaultActivityEventTooLarge);
        break;
    case PipePartOverBudget:
        ClosePipe(c_szPipeFaultActivityOverBudget);
        break;
    case PipePartComplete: {
        GUID eventId;
        CopyMemory(&eventId, &message.EventID, sizeof(eventId));
        std::vector<uint8_t> vbEvent = m_reassembly.Take();
        if (m_pOperation != nullptr)
        {
            Deliver(eventId, vbEvent);
            break;
        }
        // The coordinator is still making the operation: keep the event for it, within what
        // one log may hold.
        if (vbEvent.size() > TELVANE_MAX_LOG_BYTES - m_cbHeld)
        {
            ClosePipe(c_szPipeFaultActivityBacklog);
            break;
        }
        m_cbHeld += vbEvent.size();
        m_rgHeld.push_back(HeldEvent{eventId, std::move(vbEvent)});
        break;
    }
    }
}

void CServiceActivity::Deliver(const GUID &eventId, const std::vector<uint8_t> &vb)
{
    TelvaneTrace(c_szPipeTraceActivityEventComplete);
    m_pOperation->ActivityEvent(eventId, vb.empty() ? nullptr : vb.data(), vb.size());
}

// Every fault, and the stop message (no fault text), ends the connection the same way.
void CServiceActivity::ClosePipe(const char *szFault, bool fFaultCode, ULONG ulCode)
{
    if (szFault != nullptr)
    {
        if (fFaultCode)
        {
            TelvaneTraceFailure(szFault, ulCode);
        }
        else
        {
            TelvaneTrace(szFault);
        }
    }
    m_reassembly.Clear();
    m_pPipe->Close();
    PipeBroken();
}

void CServiceActivity::Dispatch_SetServiceOperation(CServiceOperation *pOperation)
{
    TelvaneTrace("CServiceActivity::SetServiceOperation()");
    if (pOperation != m_pOperation)
    {
        m_pOperation = pOperation;
    }
    for (const HeldEvent &held : m_rgHeld)
    {
        Deliver(held.eventId, held.vb);
    }
    std::vector<HeldEvent>().swap(m_rgHeld);
    m_cbHeld = 0;
    if (m_fDisconnectHeld)
    {
        ReportDisconnect();
        Dispatch_AdvanceCompletion();
    }
    pOperation->Release(24);
}

void CServiceActivity::Dispatch_PipeBroken()
{
    TelvaneTrace("CServiceActivity::PipeBroken()");
    if (m_fReported && !m_fDisconnectHeld)
    {
        if (m_ulProtocolState == StateStarted && m_pOperation == nullptr && !m_fDestroyRequested)
        {
            // The operation is on its way (the coordinator handles the start); its events
            // must reach it before the end does.
            m_ulProtocolState = StateReportingDisconnect;
            m_fDisconnectHeld = true;
            m_pPipe->Close();
        }
        else
        {
            ReportDisconnect();
        }
    }
    Dispatch_AdvanceCompletion();
}

void CServiceActivity::ReportDisconnect()
{
    m_ulProtocolState = StateReportingDisconnect;
    m_fDisconnectHeld = false;
    // Gives the pipe instance back at once, whoever ended the connection.
    m_pPipe->Close();
    AddRef(18);
    m_pService->ReportDisconnectedActivity(this);
    m_pService->Release();
    m_pService = nullptr;
    m_ulProtocolState = StateClosed;
    m_fReported = false;
}

void CServiceActivity::Dispatch_Destroy()
{
    TelvaneTrace("CServiceActivity::Destroy()");
    m_fDestroyRequested = true;
    if (m_fDisconnectHeld)
    {
        // No operation will come any more: the coordinator is shutting down.
        ReportDisconnect();
    }
    else if (m_ulProtocolState != StateClosed)
    {
        m_pPipe->Close();
        PipeBroken();
    }
    Dispatch_AdvanceCompletion();
}

void CServiceActivity::Dispatch_AdvanceCompletion()
{
    if (m_fDestroyRequested && !m_fReported)
    {
        TelvaneTrace("CServiceActivity::Dispatch_AdvanceCompletion() - destruction complete, "
                     "setting event");
        if (!SetEvent(m_hDestroyed.Get()))
        {
            FATAL_ERROR(L"CServiceActivity::Dispatch_AdvanceCompletion", L"SetEvent",
                        GetLastError());
        }
    }
}

bool CServiceActivity::WaitForDestroyEvent()
{
    TelvaneTrace("CServiceActivity::WaitForDestroyComplete()");
    WaitForSingleObject(m_hDestroyed.Get(), INFINITE);
    return true;
}

void CServiceActivity::FinishDestroy()
{
    m_pOperation.Release();
    TelvaneTrace("CServiceActivity::WaitForDestroyComplete() - complete");
}

void CServiceActivity::WaitForDestroyComplete()
{
    WaitForDestroyEvent();
    Sleep(c_dwEndpointSettleMs);
    FinishDestroy();
}
