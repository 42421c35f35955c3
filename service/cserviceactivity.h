// The service side of one connection on the activity pipe: version exchange, the client's
// start message, its events (joined from their parts) for the activity's operation, and the
// report of its end. Runs on its own queue; the pipe's callbacks and other objects only post.
// Created by the coordinator as its listener; afterwards held by the coordinator until the
// client identifies itself, then by its operation.
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

class CServiceActivity : public SynchronizedObject,
                         public IPipeDataSink,
                         public IPipeConnectSink,
                         public IDestroyable
{
public:
    // Creates this connection's pipe instance and listens on it at once.
    explicit CServiceActivity(TelvaneService *pService);
    // The first instance of the pipe, made but not yet listening: the coordinator lets it
    // listen only once every pipe of the service could be made. *pdwError says why the
    // instance could not be made (the object is then to be dropped).
    CServiceActivity(TelvaneService *pService, DWORD *pdwError);
    void Listen();

    // Posted by the coordinator with its tag 24 on the operation.
    void SetServiceOperation(CServiceOperation *pOperation);

    // Set by the start message and never changed afterwards; the coordinator reads them.
    const GUID &ActivityId() const { return m_activityId; }
    const GUID &LogId() const { return m_logId; }

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
    ~CServiceActivity() override;

private:
    enum : ULONG
    {
        EventIncomingMessage = 1,
        EventConnected = 3,
        EventDestroy = 4,
        EventSetServiceOperation = 5,
        EventPipeBroken = 0x0BAAD002,
    };

    enum : ULONG
    {
        StateListening = 1,
        StateAwaitingVersion = 3,
        StateVersioned = 4,
        StateStarted = 5,
        StateReportingDisconnect = 6,
        StateClosed = 7,
    };

    typedef std::vector<BYTE> ByteVector;

    // An event completed before the operation was attached.
    struct HeldEvent
    {
        GUID eventId;
        std::vector<uint8_t> vb;
    };

    void Construct(TelvaneService *pService);
    void Dispatch_IncomingMessage(ByteVector *pvb);
    void Dispatch_Connected();
    void Dispatch_Destroy();
    void Dispatch_SetServiceOperation(CServiceOperation *pOperation);
    void Dispatch_PipeBroken();
    void Dispatch_AdvanceCompletion();
    void OnEventPart(const PIPE_MESSAGE &message);
    void Deliver(const GUID &eventId, const std::vector<uint8_t> &vb);
    void ClosePipe(const char *szFault, bool fFaultCode = false, ULONG ulCode = 0);
    void ReportDisconnect();

    ULONG m_ulProtocolState;
    AsyncPipe *m_pPipe;
    bool m_fReported;
    bool m_fDestroyRequested;
    // The pipe ended after the start but before the operation was attached: the disconnect is
    // reported once the held events are with the operation, so none arrives after its end.
    bool m_fDisconnectHeld;
    CKernelHandle m_hDestroyed;
    GUID m_activityId;
    GUID m_logId;
    TelvaneService *m_pService;
    CTaggedPtr<CServiceOperation, 25> m_pOperation;
    CPipeReassembly m_reassembly;
    // Allocates nothing until an event has to wait: most connections never need it.
    std::vector<HeldEvent> m_rgHeld;
    size_t m_cbHeld;
    TaggedRefCount<c_cServiceTags> m_refs;
};

TAGGED_PTR_CLASS_NAME(CServiceActivity);
