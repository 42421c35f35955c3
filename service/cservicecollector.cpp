#include "service/cservicecollector.h"
#include "service/cserviceoperation.h"
#include "service/telvaneservice.h"
#include "servicelib/diagnostics.h"
#include "servicelib/eventtrace.h"

#include <rpc.h>

#include <memory>

namespace
{
std::atomic<long> s_cLiveCollectors(0);

const DWORD c_dwEndpointSettleMs = 1000;
} // namespace

CServiceCollector::CServiceCollector(TelvaneService *pService)
{
    Construct(pService);
    m_pPipe->Listen(pService->CollectorPipeName(), this, this);
}

CServiceCollector::CServiceCollector(TelvaneService *pService, DWORD *pdwError)
{
    Construct(pService);
    *pdwError = m_pPipe->Create(pService->CollectorPipeName(), true);
}

void CServiceCollector::Construct(TelvaneService *pService)
{
    s_cLiveCollectors.fetch_add(1);
    m_pService = pService;
    m_pService->AddRef();
    m_dwRequestTime.store(0);
    TelvaneTrace("CServiceCollector::CServiceCollector()");
    RPC_STATUS status = UuidCreate(&m_instanceId);
    if (status != RPC_S_OK)
    {
        FATAL_ERROR(L"CServiceCollector::CServiceCollector", L"UuidCreate", status);
    }
    m_fReported = true;
    m_fDestroyRequested = false;
    m_fRegistered = false;
    m_hDestroyed.Reset(CreateEventW(nullptr, TRUE, FALSE, nullptr));
    if (!m_hDestroyed.IsValid())
    {
        FATAL_ERROR(L"CServiceCollector::CServiceCollector", L"CreateEvent", GetLastError());
    }
    m_ulProtocolState = StateListening;
    m_collectorId = GUID();
    m_pPipe = new AsyncPipe();
}

void CServiceCollector::Listen()
{
    m_pPipe->Listen(this, this);
}

CServiceCollector::~CServiceCollector()
{
    TelvaneTrace("CServiceCollector::~CServiceCollector()");
    m_pPipe->Release();
    m_pPipe = nullptr;
    if (!m_hDestroyed.Close())
    {
        FATAL_ERROR(L"CServiceCollector::~CServiceCollector", L"CloseHandle", GetLastError());
    }
    m_pOperation.Release();
    m_reassembly.Clear();
    if (m_pService != nullptr)
    {
        m_pService->Release();
        m_pService = nullptr;
    }
    s_cLiveCollectors.fetch_sub(1);
}

long CServiceCollector::LiveCount()
{
    return s_cLiveCollectors.load();
}

HRESULT STDMETHODCALLTYPE CServiceCollector::QueryInterface(REFIID riid, void **ppv)
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

ULONG STDMETHODCALLTYPE CServiceCollector::AddRef()
{
    return AddRef(0);
}

ULONG STDMETHODCALLTYPE CServiceCollector::Release()
{
    return Release(0);
}

ULONG CServiceCollector::AddRef(ULONG ulTag)
{
    return m_refs.AddRef(ulTag);
}

ULONG CServiceCollector::Release(ULONG ulTag)
{
    ULONG cRef = m_refs.Release(ulTag, L"CServiceCollector::Release", TELVANE_WFILE, __LINE__);
    if (cRef == 0)
    {
        delete this;
    }
    return cRef;
}

HRESULT STDMETHODCALLTYPE CServiceCollector::IncomingMessage(const BYTE *pb, ULONG cb)
{
    Post(EventIncomingMessage, reinterpret_cast<ULONG_PTR>(new ByteVector(pb, pb + cb)));
    return S_OK;
}

HRESULT STDMETHODCALLTYPE CServiceCollector::PipeBroken()
{
    Post(EventPipeBroken);
    return S_OK;
}

HRESULT STDMETHODCALLTYPE CServiceCollector::Connected()
{
    Post(EventConnected);
    return S_OK;
}

void CServiceCollector::StartCollection(CServiceOperation *pOperation)
{
    Post(EventStartCollection, reinterpret_cast<ULONG_PTR>(pOperation));
}

void CServiceCollector::Destroy()
{
    TelvaneTrace("CServiceCollector::Destroy()");
    Post(EventDestroy);
}

void CServiceCollector::Dispatch(ULONG ulEventType, ULONG_PTR ulArg1, ULONG_PTR ulArg2,
                                 ULONG_PTR ulArg3)
{
    switch (ulEventType)
    {
    case EventIncomingMessage:
        Dispatch_IncomingMessage(reinterpret_cast<ByteVector *>(ulArg1));
        break;
    case EventPipeBroken:
        Dispatch_PipeBroken();
        break;
    case EventConnected:
        Dispatch_PipeConnected();
        break;
    case EventStartCollection:
        Dispatch_StartCollection(reinterpret_cast<CServiceOperation *>(ulArg1));
        break;
    case EventDestroy:
        Dispatch_Destroy();
        break;
    default:
        DISPATCH_UNKNOWN_EVENT(L"CServiceCollector::Dispatch", L"CServiceCollector::EventType %u",
                               ulEventType);
        break;
    }
}

void CServiceCollector::Dispatch_PipeConnected()
{
    TelvaneTrace("CServiceCollector::PipeConnected");
    if (m_ulProtocolState >= StateReportingDisconnect)
    {
        // The client arrived just as the endpoint was being destroyed.
        return;
    }
    if (m_ulProtocolState != StateListening)
    {
        FATAL_ERROR(L"CServiceCollector::Dispatch_PipeConnected", L"ProtocolState",
                    m_ulProtocolState);
        return;
    }
    m_ulProtocolState = StateAwaitingVersion;
    uint8_t rgbVersion[sizeof(TELVANE_VERSION_NEGOTIATE)];
    PipeCodecEncodeVersion(rgbVersion);
    m_pPipe->Write(rgbVersion, sizeof(rgbVersion));
    AddRef(11);
    m_pService->ReportClientConnected(this);
}

void CServiceCollector::Dispatch_IncomingMessage(ByteVector *pvb)
{
    std::unique_ptr<ByteVector> vb(pvb);
    if (m_ulProtocolState >= StateReportingDisconnect)
    {
        return;
    }
    PIPE_MESSAGE message;
    PipeCodecDecodeCollector(vb->data(), vb->size(), &message);
    if (message.szTrace != nullptr)
    {
        TelvaneTrace(message.szTrace);
    }
    switch (message.kind)
    {
    case PipeMessageVersion:
        if (m_ulProtocolState != StateAwaitingVersion)
        {
            ClosePipe(c_szPipeFaultCollectorState);
            break;
        }
        m_ulProtocolState = StateVersioned;
        break;

    case PipeMessageRegisterCollector:
        // The state decides first: before the version reply the message is dropped whatever
        // its size.
        if (m_ulProtocolState != StateVersioned)
        {
            break;
        }
        if (message.szFault != nullptr)
        {
            ClosePipe(message.szFault);
            break;
        }
        if (m_fRegistered)
        {
            // The coordinator keeps one registration per connection.
            ClosePipe(c_szPipeFaultCollectorState);
            break;
        }
        m_fRegistered = true;
        static_assert(sizeof(GUID) == sizeof(TELVANE_GUID), "a GUID travels as its 16 bytes");
        CopyMemory(&m_collectorId, &message.CollectorID, sizeof(m_collectorId));
        AddRef(17);
        m_pService->ReportConnectedCollector(this);
        break;

    case PipeMessageCollectionComplete:
        if (m_ulProtocolState != StateVersioned)
        {
            break;
        }
        if (message.szFault != nullptr)
        {
            ClosePipe(message.szFault);
            break;
        }
        OnResultPart(message);
        break;

    case PipeMessageBreakPipe:
        ClosePipe(nullptr);
        break;

    default:
        ClosePipe(message.szFault, message.fFaultCode, message.ulOpcode);
        break;
    }
}

void CServiceCollector::OnResultPart(const PIPE_MESSAGE &message)
{
    switch (m_reassembly.AddPart(message.pbPayload, message.cbPayload, message.fComplete))
    {
    case PipePartMore:
        TelvaneTrace(c_szPipeTraceCollectorMultipart);
        break;
    case PipePartTooLarge:
        ClosePipe(c_szPipeFaultCollectorResultTooLarge);
        break;
    case PipePartOverBudget:
        ClosePipe(c_szPipeFaultCollectorOverBudget);
        break;
    case PipePartComplete: {
        std::vector<uint8_t> vbResult = m_reassembly.Take();
        TelvaneTrace(vbResult.empty() ? c_szPipeTraceCollectorNoContent
                                      : c_szPipeTraceCollectorWithContent);
        if (m_pOperation != nullptr)
        {
            m_pOperation->CompleteCollectorCollection(
                this, vbResult.empty() ? nullptr : vbResult.data(), vbResult.size());
            m_pOperation.Release();
        }
        break;
    }
    }
}

void CServiceCollector::ClosePipe(const char *szFault, bool fFaultCode, ULONG ulCode)
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

void CServiceCollector::Dispatch_StartCollection(CServiceOperation *pOperation)
{
    TelvaneTrace("CServiceCollector::StartCollection");
    if (m_pOperation != nullptr)
    {
        FATAL_ERROR(L"CServiceCollector::Dispatch_StartCollection", L"Dispatch_StartCollection",
                    GetLastError());
    }
    if (m_ulProtocolState != StateVersioned)
    {
        TelvaneTrace("CServiceCollector::StartCollection - failing collection request, we're not "
                     "connected");
        pOperation->CompleteCollectorCollection(this, nullptr, 0);
    }
    else
    {
        m_pOperation = pOperation;
        m_dwRequestTime.store(GetTickCount());
        uint8_t rgbRequest[sizeof(TELVANE_START_COLLECTION)];
        TELVANE_GUID activityId;
        TELVANE_GUID logId;
        CopyMemory(&activityId, &pOperation->ActivityId(), sizeof(activityId));
        CopyMemory(&logId, &pOperation->LogId(), sizeof(logId));
        PipeCodecEncodeStartCollection(activityId, logId, rgbRequest);
        m_pPipe->Write(rgbRequest, sizeof(rgbRequest));
    }
    pOperation->Release(16);
}

void CServiceCollector::Dispatch_PipeBroken()
{
    TelvaneTrace("CServiceCollector::PipeBroken");
    if (m_fReported)
    {
        m_ulProtocolState = StateReportingDisconnect;
        m_pPipe->Close();
        AddRef(14);
        m_pService->ReportDisconnectedCollector(this);
        m_pService->Release();
        m_pService = nullptr;
        m_ulProtocolState = StateClosed;
        m_fReported = false;
    }
    if (m_pOperation != nullptr)
    {
        TelvaneTrace("CServiceCollector::PipeBroken  - ERROR, the pipe was broken during a "
                     "collection - sending an error response");
        m_pOperation->CompleteCollectorCollection(this, nullptr, 0);
        m_pOperation.Release();
    }
    Dispatch_AdvanceCompletion();
}

void CServiceCollector::Dispatch_Destroy()
{
    TelvaneTrace("CServiceCollector::Destroy()");
    m_fDestroyRequested = true;
    if (m_ulProtocolState != StateClosed)
    {
        m_pPipe->Close();
        PipeBroken();
    }
    Dispatch_AdvanceCompletion();
}

void CServiceCollector::Dispatch_AdvanceCompletion()
{
    if (m_fDestroyRequested && !m_fReported)
    {
        // The collector endpoint shares the activity endpoint's text here.
        TelvaneTrace("CServiceActivity::Dispatch_AdvanceCompletion() - destruction complete, "
                     "setting event");
        if (!SetEvent(m_hDestroyed.Get()))
        {
            FATAL_ERROR(L"CServiceCollector::Dispatch_AdvanceCompletion", L"SetEvent",
                        GetLastError());
        }
    }
}

bool CServiceCollector::WaitForDestroyEvent()
{
    TelvaneTrace("CServiceCollector::WaitForDestroyComplete()");
    WaitForSingleObject(m_hDestroyed.Get(), INFINITE);
    return true;
}

void CServiceCollector::FinishDestroy()
{
    if (m_pService != nullptr)
    {
        m_pService->Release();
        m_pService = nullptr;
    }
    m_pOperation.Release();
    TelvaneTrace("CServiceCollector::WaitForDestroyComplete() - complete");
}

void CServiceCollector::WaitForDestroyComplete()
{
    WaitForDestroyEvent();
    Sleep(c_dwEndpointSettleMs);
    FinishDestroy();
}
