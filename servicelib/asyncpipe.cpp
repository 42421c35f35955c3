#include "servicelib/asyncpipe.h"
#include "servicelib/diagnostics.h"
#include "platform/securityruntime/securityruntime.h"

#if defined(__MINGW32__)
// Exported by kernel32 but missing from the mingw-w64 headers.
extern "C" HANDLE WINAPI RegisterWaitForSingleObjectEx(HANDLE hObject, WAITORTIMERCALLBACK Callback,
                                                       PVOID Context, ULONG dwMilliseconds,
                                                       ULONG dwFlags);
#endif

namespace
{
const DWORD c_dwPipeOpenMode = FILE_FLAG_OVERLAPPED | PIPE_ACCESS_DUPLEX;
const DWORD c_dwPipeMode = PIPE_TYPE_MESSAGE | PIPE_READMODE_MESSAGE | PIPE_REJECT_REMOTE_CLIENTS;
const DWORD c_cbPipeOutBuffer = 1024;
const DWORD c_cbPipeInBuffer = 128;

// Closing a listening instance under Wine completes its pending connect with this code; on
// Windows the same departure comes back as 109.
#ifndef ERROR_HANDLES_CLOSED
#define ERROR_HANDLES_CLOSED 676L
#endif

// The codes with which the other side's departure, or our own close, ends an operation.
bool AsyncPipeIsDeparture(DWORD dwError)
{
    switch (dwError)
    {
    case ERROR_BROKEN_PIPE:
    case ERROR_NO_DATA:
    case ERROR_PIPE_NOT_CONNECTED:
    case ERROR_CANCELLED:
    case ERROR_HANDLES_CLOSED:
        return true;
    default:
        return false;
    }
}

// Owns the descriptor the security runtime hands out for the pipe.
class CTransientSecurityDescriptor
{
public:
    CTransientSecurityDescriptor() = default;
    ~CTransientSecurityDescriptor()
    {
        if (m_pSecurityDescriptor != nullptr)
        {
            FreeTransientObjectSecurityDescriptor(m_pSecurityDescriptor);
        }
    }
    CTransientSecurityDescriptor(const CTransientSecurityDescriptor &) = delete;
    CTransientSecurityDescriptor &operator=(const CTransientSecurityDescriptor &) = delete;

    PSECURITY_DESCRIPTOR *Receive() { return &m_pSecurityDescriptor; }
    PSECURITY_DESCRIPTOR Get() const { return m_pSecurityDescriptor; }

private:
    PSECURITY_DESCRIPTOR m_pSecurityDescriptor = nullptr;
};

// Steps 3 and 4 of every start: a fresh event in the side's OVERLAPPED and a one-shot wait on
// it. The caller holds the side's lock.
void AsyncPipePrepareWait(const wchar_t *wszFunction, OVERLAPPED *pOverlapped, HANDLE *phreg,
                          WAITORTIMERCALLBACK pfnCallback, PVOID pvContext)
{
    ZeroMemory(pOverlapped, sizeof(*pOverlapped));
    pOverlapped->hEvent = CreateEventW(nullptr, TRUE, FALSE, nullptr);
    if (pOverlapped->hEvent == nullptr)
    {
        FATAL_ERROR(wszFunction, L"CreateEvent", GetLastError());
    }
    *phreg = RegisterWaitForSingleObjectEx(pOverlapped->hEvent, pfnCallback, pvContext, INFINITE,
                                           WT_EXECUTEONLYONCE);
    if (*phreg == nullptr)
    {
        FATAL_ERROR(wszFunction, L"RegisterWaitForSingleObjectEx", GetLastError());
    }
}

// Step 6: an outcome the system will not signal (immediate success or failure) is signalled
// here, so every outcome reaches the handlers through the same completion path.
void AsyncPipeRecordOutcome(const wchar_t *wszFunction, BOOL fResult, OVERLAPPED *pOverlapped,
                            DWORD *pdwError)
{
    *pdwError = fResult ? ERROR_SUCCESS : GetLastError();
    if (*pdwError != ERROR_IO_PENDING && !SetEvent(pOverlapped->hEvent))
    {
        FATAL_ERROR(wszFunction, L"SetEvent", GetLastError());
    }
}

// The callbacks' common part, under the side's lock: collect the result of an operation that
// was still pending when it was issued, then drop the wait and the event.
void AsyncPipeFinishWait(const wchar_t *wszFunction, HANDLE hPipe, OVERLAPPED *pOverlapped,
                         HANDLE *phreg, DWORD *pdwError, DWORD *pcbTransferred)
{
    if (*pdwError == ERROR_IO_PENDING)
    {
        *pdwError = GetOverlappedResult(hPipe, pOverlapped, pcbTransferred, FALSE) ? ERROR_SUCCESS
                                                                                   : GetLastError();
    }
    // Inside its own callback the wait cannot be removed synchronously; 997 says it will be.
    if (!UnregisterWaitEx(*phreg, nullptr) && GetLastError() != ERROR_IO_PENDING)
    {
        FATAL_ERROR(wszFunction, L"UnregisterWaitEx", GetLastError());
    }
    *phreg = nullptr;
    if (!CloseHandle(pOverlapped->hEvent))
    {
        FATAL_ERROR(wszFunction, L"CloseHandle", GetLastError());
    }
    pOverlapped->hEvent = nullptr;
}

void AsyncPipeFatalCode(const wchar_t *wszFunction, const wchar_t *wszFile, ULONG ulLine,
                        const wchar_t *wszCall, DWORD dwError)
{
    wchar_t wszName[64];
    StringCchPrintf(wszName, ARRAYSIZE(wszName), L"%s %u", wszCall, dwError);
    FatalError(wszFunction, wszFile, ulLine, wszName, dwError);
}
} // namespace

AsyncPipe::AsyncPipe()
    : m_cRef(1)
    , m_hPipe(INVALID_HANDLE_VALUE)
    , m_hPipeCreated(INVALID_HANDLE_VALUE)
    , m_pDataSink(nullptr)
    , m_pConnectSink(nullptr)
    , m_hregReadComplete(nullptr)
    , m_hregWriteComplete(nullptr)
    , m_overlappedRead()
    , m_overlappedWrite()
    , m_dwReadError(0xFFFFFFFF)
    , m_dwWriteError(0xFFFFFFFF)
    , m_cbRead(0)
    , m_abRead()
    , m_fConnectPending(false)
{
    InitializeCriticalSection(&m_csRead);
    InitializeCriticalSection(&m_csWrite);
    DebugLog(L"AsyncPipe::AsyncPipe", L"Constructed %p\r\n", this);
}

AsyncPipe::~AsyncPipe()
{
    ASSERT_CHECK(L"AsyncPipe::~AsyncPipe", m_pvbWriteCurrent == NULL);
    ASSERT_CHECK(L"AsyncPipe::~AsyncPipe", m_queueWrite.empty());
    ASSERT_CHECK(L"AsyncPipe::~AsyncPipe", m_hregWriteComplete == NULL);
    ASSERT_CHECK(L"AsyncPipe::~AsyncPipe", m_hregReadComplete == NULL);
    ASSERT_CHECK(L"AsyncPipe::~AsyncPipe", m_overlappedWrite.hEvent == NULL);
    ASSERT_CHECK(L"AsyncPipe::~AsyncPipe", m_overlappedRead.hEvent == NULL);
    DeleteCriticalSection(&m_csRead);
    DeleteCriticalSection(&m_csWrite);
    ReleaseConnectSink();
    if (m_pDataSink != nullptr)
    {
        m_pDataSink->Release();
        m_pDataSink = nullptr;
    }
    if (m_hPipe != INVALID_HANDLE_VALUE && !CloseHandle(m_hPipe))
    {
        FATAL_ERROR(L"AsyncPipe::~AsyncPipe", L"CloseHandle", GetLastError());
    }
    m_hPipe = INVALID_HANDLE_VALUE;
    if (m_hPipeCreated != INVALID_HANDLE_VALUE && !CloseHandle(m_hPipeCreated))
    {
        FATAL_ERROR(L"AsyncPipe::~AsyncPipe", L"CloseHandle", GetLastError());
    }
    DebugLog(L"AsyncPipe::~AsyncPipe", L"Destructed %p\r\n", this);
}

ULONG AsyncPipe::AddRef()
{
    return static_cast<ULONG>(InterlockedIncrement(&m_cRef));
}

ULONG AsyncPipe::Release()
{
    ULONG cRef = static_cast<ULONG>(InterlockedDecrement(&m_cRef));
    if (cRef == 0)
    {
        delete this;
    }
    return cRef;
}

void AsyncPipe::Listen(const wchar_t *wszPipeName, IPipeDataSink *pDataSink,
                       IPipeConnectSink *pConnectSink)
{
    Create(wszPipeName, false);
    Listen(pDataSink, pConnectSink);
}

DWORD AsyncPipe::Create(const wchar_t *wszPipeName, bool fFirstInstance)
{
    ASSERT_CHECK(L"AsyncPipe::Create", m_hPipeCreated == INVALID_HANDLE_VALUE);
    HANDLE hPipe;
    {
        CTransientSecurityDescriptor securityDescriptor;
        HRESULT hr = QueryTransientObjectSecurityDescriptor(
            TRANSIENT_OBJECT_TYPE_NAMED_PIPE, wszPipeName, securityDescriptor.Receive());
        if (hr != S_OK)
        {
            FATAL_ERROR(L"AsyncPipe::Listen", L"QueryTransientObjectSecurityDescriptor", hr);
        }
        // Not inheritable: a process the service starts must never hold a client's connection
        // open after the service has closed it.
        SECURITY_ATTRIBUTES securityAttributes = {sizeof(securityAttributes),
                                                  securityDescriptor.Get(), FALSE};
        hPipe = CreateNamedPipeW(
            wszPipeName, c_dwPipeOpenMode | (fFirstInstance ? FILE_FLAG_FIRST_PIPE_INSTANCE : 0),
            c_dwPipeMode, PIPE_UNLIMITED_INSTANCES, c_cbPipeOutBuffer, c_cbPipeInBuffer,
            NMPWAIT_WAIT_FOREVER, &securityAttributes);
    }
    DWORD dwError = GetLastError();
    DebugLog(L"AsyncPipe::Listen", L"hPipe=%x\r\n", static_cast<ULONG>(HandleToULong(hPipe)));
    if (hPipe == INVALID_HANDLE_VALUE)
    {
        if (fFirstInstance)
        {
            return dwError;
        }
        FATAL_ERROR(L"AsyncPipe::Listen", L"CreateNamedPipe", dwError);
        return dwError;
    }
    m_hPipeCreated = hPipe;
    return ERROR_SUCCESS;
}

void AsyncPipe::Listen(IPipeDataSink *pDataSink, IPipeConnectSink *pConnectSink)
{
    HANDLE hPipe = m_hPipeCreated;
    if (hPipe == INVALID_HANDLE_VALUE)
    {
        return;
    }
    m_hPipeCreated = INVALID_HANDLE_VALUE;
    pDataSink->AddRef();
    if (pConnectSink != nullptr)
    {
        pConnectSink->AddRef();
    }
    Post(EventListen, reinterpret_cast<ULONG_PTR>(hPipe), reinterpret_cast<ULONG_PTR>(pDataSink),
         reinterpret_cast<ULONG_PTR>(pConnectSink));
}

void AsyncPipe::Write(const BYTE *pb, ULONG cb)
{
    Post(EventWriteQueued, reinterpret_cast<ULONG_PTR>(new ByteVector(pb, pb + cb)));
}

void AsyncPipe::Close()
{
    Post(EventClose);
}

void AsyncPipe::Dispatch(ULONG ulEventType, ULONG_PTR ulArg1, ULONG_PTR ulArg2, ULONG_PTR ulArg3)
{
    switch (ulEventType)
    {
    case EventListen:
        ListenCallback(reinterpret_cast<HANDLE>(ulArg1), reinterpret_cast<IPipeDataSink *>(ulArg2),
                       reinterpret_cast<IPipeConnectSink *>(ulArg3));
        break;
    case EventWriteQueued:
        WriteQueuedCallback(reinterpret_cast<ByteVector *>(ulArg1));
        break;
    case EventClose:
        CloseCallback();
        break;
    case EventConnectCompleted:
        ConnectCompletedCallback();
        break;
    case EventReadCompleted:
        ReadCompletedCallback();
        break;
    case EventWriteCompleted:
        WriteCompletedCallback();
        break;
    default:
        DISPATCH_UNKNOWN_EVENT(L"AsyncPipe::Dispatch", L"AsyncPipe::EventType %u", ulEventType);
        break;
    }
}

void AsyncPipe::ListenCallback(HANDLE hPipe, IPipeDataSink *pDataSink,
                               IPipeConnectSink *pConnectSink)
{
    ASSERT_CHECK(L"AsyncPipe::ListenCallback", m_hPipe == INVALID_HANDLE_VALUE);
    m_hPipe = hPipe;
    m_pDataSink = pDataSink;
    m_pConnectSink = pConnectSink;
    StartConnect();
}

void AsyncPipe::StartConnect()
{
    AddRef();
    EnterCriticalSection(&m_csRead);
    ASSERT_CHECK(L"AsyncPipe::StartConnect", m_overlappedRead.hEvent == NULL);
    ASSERT_CHECK(L"AsyncPipe::StartConnect", m_hregReadComplete == NULL);
    m_fConnectPending = true;
    AsyncPipePrepareWait(L"AsyncPipe::StartConnect", &m_overlappedRead, &m_hregReadComplete,
                         ReadCompletedStatic, this);
    BOOL fResult = ConnectNamedPipe(m_hPipe, &m_overlappedRead);
    AsyncPipeRecordOutcome(L"AsyncPipe::StartConnect", fResult, &m_overlappedRead, &m_dwReadError);
    LeaveCriticalSection(&m_csRead);
}

void AsyncPipe::StartRead()
{
    AddRef();
    EnterCriticalSection(&m_csRead);
    ASSERT_CHECK(L"AsyncPipe::StartRead", m_overlappedRead.hEvent == NULL);
    ASSERT_CHECK(L"AsyncPipe::StartRead", m_hregReadComplete == NULL);
    m_fConnectPending = false;
    AsyncPipePrepareWait(L"AsyncPipe::StartRead", &m_overlappedRead, &m_hregReadComplete,
                         ReadCompletedStatic, this);
    BOOL fResult = ReadFile(m_hPipe, m_abRead, sizeof(m_abRead), &m_cbRead, &m_overlappedRead);
    AsyncPipeRecordOutcome(L"AsyncPipe::StartRead", fResult, &m_overlappedRead, &m_dwReadError);
    LeaveCriticalSection(&m_csRead);
}

void AsyncPipe::StartWrite()
{
    AddRef();
    EnterCriticalSection(&m_csWrite);
    ASSERT_CHECK(L"AsyncPipe::StartWrite", m_overlappedWrite.hEvent == NULL);
    ASSERT_CHECK(L"AsyncPipe::StartWrite", m_hregWriteComplete == NULL);
    AsyncPipePrepareWait(L"AsyncPipe::StartWrite", &m_overlappedWrite, &m_hregWriteComplete,
                         WriteCompletedStatic, this);
    BOOL fResult =
        WriteFile(m_hPipe, m_pvbWriteCurrent->data(), static_cast<DWORD>(m_pvbWriteCurrent->size()),
                  nullptr, &m_overlappedWrite);
    AsyncPipeRecordOutcome(L"AsyncPipe::StartWrite", fResult, &m_overlappedWrite, &m_dwWriteError);
    LeaveCriticalSection(&m_csWrite);
}

VOID CALLBACK AsyncPipe::ReadCompletedStatic(PVOID pvContext, BOOLEAN fTimedOut)
{
    AsyncPipe *pPipe = static_cast<AsyncPipe *>(pvContext);
    EnterCriticalSection(&pPipe->m_csRead);
    AsyncPipeFinishWait(L"AsyncPipe::ReadCompletedStatic", pPipe->m_hPipe, &pPipe->m_overlappedRead,
                        &pPipe->m_hregReadComplete, &pPipe->m_dwReadError, &pPipe->m_cbRead);
    bool fConnect = pPipe->m_fConnectPending;
    LeaveCriticalSection(&pPipe->m_csRead);
    pPipe->Post(fConnect ? EventConnectCompleted : EventReadCompleted);
}

VOID CALLBACK AsyncPipe::WriteCompletedStatic(PVOID pvContext, BOOLEAN fTimedOut)
{
    AsyncPipe *pPipe = static_cast<AsyncPipe *>(pvContext);
    DWORD cbWritten = 0;
    EnterCriticalSection(&pPipe->m_csWrite);
    AsyncPipeFinishWait(L"AsyncPipe::WriteCompletedStatic", pPipe->m_hPipe,
                        &pPipe->m_overlappedWrite, &pPipe->m_hregWriteComplete,
                        &pPipe->m_dwWriteError, &cbWritten);
    LeaveCriticalSection(&pPipe->m_csWrite);
    pPipe->Post(EventWriteCompleted);
}

void AsyncPipe::ConnectCompletedCallback()
{
    switch (m_dwReadError)
    {
    case ERROR_SUCCESS:
    case ERROR_PIPE_CONNECTED: {
        IPipeConnectSink *pConnectSink = m_pConnectSink;
        m_pConnectSink = nullptr;
        if (pConnectSink != nullptr)
        {
            pConnectSink->Connected();
            pConnectSink->Release();
        }
        if (m_hPipe != INVALID_HANDLE_VALUE)
        {
            StartRead();
        }
        else
        {
            // Closed as the client arrived: nothing more will be read.
            BreakDataSink();
        }
        break;
    }
    case ERROR_OPERATION_ABORTED:
        if (m_hPipe != INVALID_HANDLE_VALUE)
        {
            StartConnect();
            break;
        }
        ReleaseConnectSink();
        BreakDataSink();
        break;
    default:
        if (!AsyncPipeIsDeparture(m_dwReadError))
        {
            AsyncPipeFatalCode(L"AsyncPipe::ConnectCompletedCallback", TELVANE_WFILE, __LINE__,
                               L"ConnectNamedPipe", m_dwReadError);
        }
        DebugLog(L"AsyncPipe::ConnectCompletedCallback", L"connect ended with %u\r\n",
                 m_dwReadError);
        ReleaseConnectSink();
        BreakDataSink();
        break;
    }
    Release();
}

void AsyncPipe::ReadCompletedCallback()
{
    switch (m_dwReadError)
    {
    case ERROR_SUCCESS:
        if (m_pDataSink != nullptr)
        {
            m_pDataSink->IncomingMessage(m_abRead, m_cbRead);
        }
        [[fallthrough]]; // read on while the pipe is open
    case ERROR_OPERATION_ABORTED:
        if (m_hPipe != INVALID_HANDLE_VALUE)
        {
            StartRead();
        }
        else
        {
            BreakDataSink();
        }
        break;
    case ERROR_MORE_DATA:
        // A client message longer than the receive buffer: the protocol never sends one, so
        // this client is broken or hostile. End its connection, and only its connection.
        DebugLog(L"AsyncPipe::ReadCompletedCallback",
                 L"message longer than %u bytes, closing the connection\r\n", c_cbMaxMessage);
        BreakDataSink();
        CloseInstance();
        break;
    default:
        if (!AsyncPipeIsDeparture(m_dwReadError))
        {
            AsyncPipeFatalCode(L"AsyncPipe::ReadCompletedCallback", TELVANE_WFILE, __LINE__,
                               L"ReadFile", m_dwReadError);
        }
        BreakDataSink();
        break;
    }
    Release();
}

void AsyncPipe::WriteQueuedCallback(ByteVector *pvb)
{
    std::unique_ptr<ByteVector> vb(pvb);
    if (m_hPipe == INVALID_HANDLE_VALUE)
    {
        return;
    }
    if (m_pvbWriteCurrent != nullptr)
    {
        m_queueWrite.push_back(std::move(vb));
        return;
    }
    m_pvbWriteCurrent = std::move(vb);
    StartWrite();
}

void AsyncPipe::WriteCompletedCallback()
{
    if (m_dwWriteError == ERROR_SUCCESS || AsyncPipeIsDeparture(m_dwWriteError))
    {
        // After a departure the queued buffers are still tried in turn; each fails at once.
        WriteNext();
    }
    else if (m_dwWriteError == ERROR_OPERATION_ABORTED)
    {
        if (m_hPipe != INVALID_HANDLE_VALUE)
        {
            StartWrite();
        }
        else
        {
            // Aborted by the close: there is nothing left to write to.
            m_pvbWriteCurrent.reset();
        }
    }
    else
    {
        FATAL_ERROR(L"AsyncPipe::WriteCompletedCallback", L"WriteFile", m_dwWriteError);
        m_pvbWriteCurrent.reset();
        m_queueWrite.clear();
    }
    Release();
}

void AsyncPipe::WriteNext()
{
    m_pvbWriteCurrent.reset();
    if (m_queueWrite.empty())
    {
        return;
    }
    m_pvbWriteCurrent = std::move(m_queueWrite.front());
    m_queueWrite.pop_front();
    StartWrite();
}

void AsyncPipe::CloseCallback()
{
    CloseInstance();
}

// Closing the handle makes the pending connect, read or write complete; their handlers then
// release what they hold. The buffer being written stays with its pending write.
void AsyncPipe::CloseInstance()
{
    if (m_hPipe != INVALID_HANDLE_VALUE)
    {
        // The completion callbacks read the handle under their side's lock.
        EnterCriticalSection(&m_csRead);
        EnterCriticalSection(&m_csWrite);
        HANDLE hPipe = m_hPipe;
        m_hPipe = INVALID_HANDLE_VALUE;
        LeaveCriticalSection(&m_csWrite);
        LeaveCriticalSection(&m_csRead);
        if (!CloseHandle(hPipe))
        {
            FATAL_ERROR(L"AsyncPipe::CloseCallback", L"CloseHandle", GetLastError());
        }
    }
    ReleaseConnectSink();
    m_queueWrite.clear();
}

void AsyncPipe::ReleaseConnectSink()
{
    IPipeConnectSink *pConnectSink = m_pConnectSink;
    if (pConnectSink != nullptr)
    {
        m_pConnectSink = nullptr;
        pConnectSink->Release();
    }
}

// The one place PipeBroken is delivered; the sink is cleared first, so it cannot come twice.
void AsyncPipe::BreakDataSink()
{
    IPipeDataSink *pDataSink = m_pDataSink;
    if (pDataSink != nullptr)
    {
        m_pDataSink = nullptr;
        pDataSink->PipeBroken();
        pDataSink->Release();
    }
}
