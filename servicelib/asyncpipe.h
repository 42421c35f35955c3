// The server end of one connection on a local message-mode pipe. It knows nothing of the
// protocol spoken over it: it hands each received message to its owner and writes whatever
// buffers it is given, in order.
#pragma once

#include "servicelib/synchronizedobject.h"

#include <windows.h>
#include <unknwn.h>
#include <deque>
#include <memory>
#include <vector>

// {0396A428-1EAE-4AD7-8965-DF041C68CAA8}
constexpr IID IID_IPipeDataSink = {
    0x0396A428, 0x1EAE, 0x4AD7, {0x89, 0x65, 0xDF, 0x04, 0x1C, 0x68, 0xCA, 0xA8}};
// {82DFB01D-DD90-4D62-B55C-7AF64DE03FAD}
constexpr IID IID_IPipeConnectSink = {
    0x82DFB01D, 0xDD90, 0x4D62, {0xB5, 0x5C, 0x7A, 0xF6, 0x4D, 0xE0, 0x3F, 0xAD}};

// The owner's receiver of messages and of the end of the connection. Called inside the
// pipe's handlers: implementations copy what they need and post to their own queue, never
// block. The pipe holds a reference from Listen until it reports the break.
struct IPipeDataSink : public IUnknown
{
    // pb points into the pipe's receive buffer and is valid only during the call.
    virtual HRESULT STDMETHODCALLTYPE IncomingMessage(const BYTE *pb, ULONG cb) = 0;
    // The connection is over for good: called once, whether the client left, sent a message
    // too long for the receive buffer, or the owner closed the pipe.
    virtual HRESULT STDMETHODCALLTYPE PipeBroken() = 0;
};

// The owner's receiver of the connected notice; held from Listen until the client connected
// or the pipe was closed.
struct IPipeConnectSink : public IUnknown
{
    virtual HRESULT STDMETHODCALLTYPE Connected() = 0;
};

// Every state change happens in a handler on the pipe's own Synchronizer; the thread-pool wait
// callbacks only collect a completion under their side's lock and post it as an event. Owned
// by one endpoint, which must call Close before it drops its reference; each pending connect,
// read or write holds a reference of its own until its completion has been handled.
class AsyncPipe : public SynchronizedObject
{
public:
    AsyncPipe();

    // Creates the pipe instance and waits for one client (caller's thread).
    void Listen(const wchar_t *wszPipeName, IPipeDataSink *pDataSink,
                IPipeConnectSink *pConnectSink);
    // The same in two steps (caller's thread). Create makes the instance; with fFirstInstance
    // it must be the name's first one, and its refusal is returned (ERROR_ACCESS_DENIED on
    // Windows when anyone holds the name) where every other failure is fatal. Listen then
    // waits for one client on it. An instance never listened on is closed by the destructor.
    DWORD Create(const wchar_t *wszPipeName, bool fFirstInstance);
    void Listen(IPipeDataSink *pDataSink, IPipeConnectSink *pConnectSink);
    // Queues a copy of the bytes; they leave after everything written before them. Owners
    // write only once Connected arrived. Any thread.
    void Write(const BYTE *pb, ULONG cb);
    // Ends the connection; pending operations finish with errors and the data sink still
    // receives PipeBroken if it has not yet. Any thread.
    void Close();

    ULONG AddRef() override;
    ULONG Release() override;
    void Dispatch(ULONG ulEventType, ULONG_PTR ulArg1, ULONG_PTR ulArg2, ULONG_PTR ulArg3) override;

    // Size of the receive buffer: the longest message a client may send.
    static constexpr ULONG c_cbMaxMessage = 1200;

protected:
    // Runs at the last Release, when no operation is pending any more.
    ~AsyncPipe() override;

private:
    enum : ULONG
    {
        EventListen = 1,
        EventWriteQueued = 2,
        EventClose = 3,
        EventConnectCompleted = 4,
        EventReadCompleted = 5,
        EventWriteCompleted = 6,
    };

    typedef std::vector<BYTE> ByteVector;

    void ListenCallback(HANDLE hPipe, IPipeDataSink *pDataSink, IPipeConnectSink *pConnectSink);
    void WriteQueuedCallback(ByteVector *pvb);
    void CloseCallback();
    void ConnectCompletedCallback();
    void ReadCompletedCallback();
    void WriteCompletedCallback();

    void StartConnect();
    void StartRead();
    void StartWrite();
    void WriteNext();
    void CloseInstance();
    void ReleaseConnectSink();
    void BreakDataSink();

    static VOID CALLBACK ReadCompletedStatic(PVOID pvContext, BOOLEAN fTimedOut);
    static VOID CALLBACK WriteCompletedStatic(PVOID pvContext, BOOLEAN fTimedOut);

    volatile LONG m_cRef;
    HANDLE m_hPipe;
    HANDLE m_hPipeCreated; // made by Create, handed to the handlers by Listen
    IPipeDataSink *m_pDataSink;
    IPipeConnectSink *m_pConnectSink;
    std::deque<std::unique_ptr<ByteVector>> m_queueWrite;
    HANDLE m_hregReadComplete;
    HANDLE m_hregWriteComplete;
    OVERLAPPED m_overlappedRead;
    OVERLAPPED m_overlappedWrite;
    CRITICAL_SECTION m_csRead;
    CRITICAL_SECTION m_csWrite;
    DWORD m_dwReadError;
    DWORD m_dwWriteError;
    DWORD m_cbRead;
    BYTE m_abRead[c_cbMaxMessage];
    std::unique_ptr<ByteVector> m_pvbWriteCurrent;
    // Whether the read side's pending operation is the connect; set by the starting code and
    // read by the completion callback, both under m_csRead.
    bool m_fConnectPending;
};
