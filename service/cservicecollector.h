// The service side of one connection on the collector pipe: version exchange, the client's
// registration, start-collection requests on behalf of one operation at a time, the results
// joined from their parts, and the report of its end. Runs on its own queue; the pipe's
// callbacks and the operations only post. Created by the coordinator as its listener, then
// held by the coordinator's registry and by the operation it serves.
#pragma once

#include "service/guidkey.h"
#include "servicelib/asyncpipe.h"
#include "servicelib/cpipereassembly.h"
#include "servicelib/idestroyable.h"
#include "servicelib/pipecodec.h"
#include "servicelib/synchronizedobject.h"
#include "inc/handleholder.h"
#include "inc/taggedrefcount.h"

#include <atomic>
#include <vector>

class TelvaneService;
class CServiceOperation;

class CServiceCollector : public SynchronizedObject,
                          public IPipeDataSink,
                          public IPipeConnectSink,
                          public IDestroyable
{
public:
    // Creates this connection's pipe instance and listens on it at once.
    explicit CServiceCollector(TelvaneService *pService);
    // The first instance of the pipe, not yet listening (see CServiceActivity).
    CServiceCollector(TelvaneService *pService, DWORD *pdwError);
    void Listen();

    // Posted by an operation with its tag 16 on itself.
    void StartCollection(CServiceOperation *pOperation);

    // The collector ID is set by the register message before the coordinator hears of it;
    // the instance ID is fixed at construction. The request time is read racily by the
    // operation for its waiting trace only.
    const GUID &CollectorId() const { return m_collectorId; }
    const GUID &InstanceId() const { return m_instanceId; }
    DWORD RequestTime() const { return m_dwRequestTime.load(); }

    // IUnknown, IPipeDataSink, IPipeConnectSink
    HRESULT STDMETHODCALLTYPE QueryInterface(REFIID riid, void **ppv) override;
    ULONG STDMETHODCALLTYPE AddRef() override;
    ULONG STDMETHODCALLTYPE Release() override;
    HRESULT STDMETHODCALLTYPE IncomingMessage(const BYTE *pb, ULONG cb) override;
    HRESULT STDMETHODCALLTYPE PipeBroken() override;
    HRESULT STDMETHODCALLTYPE Connected() override;

    // IDestroyable
    void Destroy() override;
    void WaitForDestroyComplete() override;
    bool WaitForDestroyEvent() override;
    void FinishDestroy() override;
    ULONG AddRef(ULONG ulTag) override;
    ULONG Release(ULONG ulTag) override;

    void Dispatch(ULONG ulEventType, ULONG_PTR ulArg1, ULONG_PTR ulArg2, ULONG_PTR ulArg3) override;

    static long LiveCount();

protected:
    ~CServiceCollector() override;

private:
    enum : ULONG
    {
        EventIncomingMessage = 1,
        EventPipeBroken = 2,
        EventConnected = 3,
        EventStartCollection = 4,
        EventDestroy = 5,
    };

    enum : ULONG
    {
        StateListening = 1,
        StateAwaitingVersion = 3,
        StateVersioned = 4,
        StateReportingDisconnect = 5,
        StateClosed = 6,
    };

    typedef std::vector<BYTE> ByteVector;

    void Construct(TelvaneService *pService);
    void Dispatch_IncomingMessage(ByteVector *pvb);
    void Dispatch_PipeConnected();
    void Dispatch_StartCollection(CServiceOperation *pOperation);
    void Dispatch_Destroy();
    void Dispatch_PipeBroken();
    void Dispatch_AdvanceCompletion();
    void OnResultPart(const PIPE_MESSAGE &message);
    void ClosePipe(const char *szFault, bool fFaultCode = false, ULONG ulCode = 0);

    ULONG m_ulProtocolState;
    AsyncPipe *m_pPipe;
    bool m_fReported;
    bool m_fDestroyRequested;
    bool m_fRegistered;
    CKernelHandle m_hDestroyed;
    TelvaneService *m_pService;
    GUID m_collectorId;
    GUID m_instanceId;
    std::atomic<DWORD> m_dwRequestTime;
    CPipeReassembly m_reassembly;
    CTaggedPtr<CServiceOperation, 3> m_pOperation;
    TaggedRefCount<c_cServiceTags> m_refs;
};

TAGGED_PTR_CLASS_NAME(CServiceCollector);
