// The client end of a connection to one of the service's message-mode pipes, with a time
// limit on every call. Failures are HRESULTs:
//   HRESULT_FROM_WIN32(ERROR_TIMEOUT)          the service did not answer or take a message in time
//   HRESULT_FROM_WIN32(ERROR_FILE_NOT_FOUND)   nobody listened on the pipe until the time limit
//   HRESULT_FROM_WIN32(ERROR_PIPE_BUSY)        every instance of the pipe stayed busy until then
//   HRESULT_FROM_WIN32(ERROR_BROKEN_PIPE)      the service closed the connection
//   HRESULT_FROM_WIN32(ERROR_INVALID_DATA)     the service sent something the protocol does not
//   HRESULT_FROM_WIN32(ERROR_INVALID_STATE)    the call does not fit the connection's state
//   HRESULT_FROM_WIN32(ERROR_MESSAGE_EXCEEDS_MAX_SIZE)  an event or result over TELVANE_MAX_ITEM
//   E_INVALIDARG                               a null pointer with a non-zero size, or a part
//                                              layout that does not fit one message
#pragma once

#include <windows.h>

// Default time limit of each client call.
const DWORD c_dwTelvaneClientTimeoutMs = 5000;

// What a client opens a pipe with: reading and writing messages, and setting the read mode.
// Not GENERIC_WRITE: on a pipe that includes the right to create instances of it, which the
// service's pipes grant nobody but the system and administrators.
const DWORD c_dwTelvaneClientPipeAccess = GENERIC_READ | FILE_WRITE_DATA | FILE_WRITE_ATTRIBUTES;

// Owns one handle; closes it when it goes.
class CClientHandle
{
public:
    CClientHandle() = default;
    ~CClientHandle() { Reset(); }
    CClientHandle(const CClientHandle &) = delete;
    CClientHandle &operator=(const CClientHandle &) = delete;

    HANDLE Get() const { return m_h; }
    bool IsValid() const { return m_h != nullptr && m_h != INVALID_HANDLE_VALUE; }
    void Reset(HANDLE h = nullptr);

private:
    HANDLE m_h = nullptr;
};

// One connection, used by one thread at a time; owned by its caller (an activity or collector
// client, or a test that speaks raw messages).
class CPipeClient
{
public:
    CPipeClient() = default;
    CPipeClient(const CPipeClient &) = delete;
    CPipeClient &operator=(const CPipeClient &) = delete;

    // Opens the pipe, waiting up to the limit for a listening instance (the service replaces
    // its listener after each client, so there are short gaps).
    HRESULT Connect(const wchar_t *wszPipeName, DWORD dwTimeoutMs);
    // Takes the service's version message and answers it. On success *pdwVersion (optional)
    // holds the version the service announced.
    HRESULT Negotiate(DWORD dwTimeoutMs, DWORD *pdwVersion = nullptr);
    // Connect and Negotiate; a failed negotiation closes the connection again.
    HRESULT Open(const wchar_t *wszPipeName, DWORD dwTimeoutMs, DWORD *pdwVersion = nullptr);

    // Sends one message. A write that runs out of time closes the connection, since part of
    // the message may already be with the service.
    HRESULT WriteMessage(const void *pv, DWORD cb, DWORD dwTimeoutMs);
    // Sends an item of any size as consecutive part messages: each is the header with its
    // complete field (at ibComplete: 0, or 1 on the last part) and length field (at ibLength)
    // filled in, up to cbMaxPart bytes of the item, then cbTrailer zero bytes. An empty item
    // is one last part. Header, cbMaxPart and trailer must fit one message, and cbMaxPart may
    // be 0 only for an empty item.
    HRESULT WriteParts(const void *pvHeader, DWORD cbHeader, DWORD ibComplete, DWORD ibLength,
                       DWORD cbTrailer, DWORD cbMaxPart, const void *pv, size_t cb,
                       DWORD dwTimeoutMs);
    // Receives one message of at most cbBuffer bytes; a longer one fails with
    // HRESULT_FROM_WIN32(ERROR_MORE_DATA) and its rest stays in the pipe. A read that runs out
    // of time leaves the connection usable.
    HRESULT ReadMessage(void *pv, DWORD cbBuffer, DWORD *pcbRead, DWORD dwTimeoutMs);

    // Receives one message that must be exactly cb bytes starting with the opcode; anything
    // else is HRESULT_FROM_WIN32(ERROR_INVALID_DATA).
    HRESULT ReadExpected(void *pv, DWORD cb, DWORD ulOpcode, DWORD dwTimeoutMs);

    // Sends a message of just the opcode (a goodbye: stop, break pipe), then closes.
    HRESULT WriteFinal(DWORD ulOpcode, DWORD dwTimeoutMs);

    void Close();
    bool IsOpen() const { return m_hPipe.IsValid(); }

private:
    HRESULT WaitIo(BOOL fResult, OVERLAPPED *pOverlapped, DWORD *pcbTransferred, DWORD dwTimeoutMs);

    CClientHandle m_hPipe;
    CClientHandle m_hEvent;
};
