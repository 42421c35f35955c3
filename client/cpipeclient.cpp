#include "client/cpipeclient.h"
#include "inc/telvanepipe.h"

namespace
{
// The service's ends of a departed connection report it in three ways; callers see one.
HRESULT PipeClientResult(DWORD dwError)
{
    switch (dwError)
    {
    case ERROR_SUCCESS:
        return S_OK;
    case ERROR_BROKEN_PIPE:
    case ERROR_NO_DATA:
    case ERROR_PIPE_NOT_CONNECTED:
        return HRESULT_FROM_WIN32(ERROR_BROKEN_PIPE);
    default:
        return HRESULT_FROM_WIN32(dwError);
    }
}

// How long to sleep before looking for a listening instance again.
const DWORD c_dwConnectRetryMs = 5;
// Longest single wait for a busy pipe's next free instance.
const DWORD c_dwBusyWaitSliceMs = 1000;
} // namespace

void CClientHandle::Reset(HANDLE h)
{
    if (IsValid())
    {
        CloseHandle(m_h);
    }
    m_h = h;
}

HRESULT CPipeClient::Connect(const wchar_t *wszPipeName, DWORD dwTimeoutMs)
{
    if (wszPipeName == nullptr)
    {
        return E_INVALIDARG;
    }
    if (IsOpen())
    {
        return HRESULT_FROM_WIN32(ERROR_INVALID_STATE);
    }
    if (!m_hEvent.IsValid())
    {
        m_hEvent.Reset(CreateEventW(nullptr, TRUE, FALSE, nullptr));
        if (!m_hEvent.IsValid())
        {
            m_hEvent.Reset();
            return HRESULT_FROM_WIN32(GetLastError());
        }
    }

    ULONGLONG ullDeadline = GetTickCount64() + dwTimeoutMs;
    for (;;)
    {
        // Identification only: the service has no business acting as this client.
        HANDLE hPipe = CreateFileW(
            wszPipeName, c_dwTelvaneClientPipeAccess, 0, nullptr, OPEN_EXISTING,
            FILE_FLAG_OVERLAPPED | SECURITY_SQOS_PRESENT | SECURITY_IDENTIFICATION, nullptr);
        if (hPipe != INVALID_HANDLE_VALUE)
        {
            m_hPipe.Reset(hPipe);
            break;
        }
        DWORD dwError = GetLastError();
        ULONGLONG ullNow = GetTickCount64();
        if ((dwError != ERROR_FILE_NOT_FOUND && dwError != ERROR_PIPE_BUSY) ||
            ullNow >= ullDeadline)
        {
            return HRESULT_FROM_WIN32(dwError);
        }
        ULONGLONG ullLeft = ullDeadline - ullNow;
        if (dwError == ERROR_PIPE_BUSY)
        {
            // Every instance is taken: wait inside the pipe system until one listens. Asking
            // again every few milliseconds instead floods it when many clients arrive at once,
            // and slows the service that is trying to make the next instance. Never 0: that
            // would mean the server's default wait, which is for ever. The next open tells
            // whether this client got the instance.
            WaitNamedPipeW(wszPipeName, ullLeft < c_dwBusyWaitSliceMs
                                            ? static_cast<DWORD>(ullLeft) + 1
                                            : c_dwBusyWaitSliceMs);
            continue;
        }
        Sleep(ullLeft < c_dwConnectRetryMs ? static_cast<DWORD>(ullLeft) : c_dwConnectRetryMs);
    }

    DWORD dwMode = PIPE_READMODE_MESSAGE;
    if (!SetNamedPipeHandleState(m_hPipe.Get(), &dwMode, nullptr, nullptr))
    {
        DWORD dwError = GetLastError();
        Close();
        return PipeClientResult(dwError);
    }
    return S_OK;
}

HRESULT CPipeClient::Negotiate(DWORD dwTimeoutMs, DWORD *pdwVersion)
{
    TELVANE_VERSION_NEGOTIATE version = {};
    HRESULT hr =
        ReadExpected(&version, sizeof(version), TELVANE_VERSION_NEGOTIATE_OPCODE, dwTimeoutMs);
    if (FAILED(hr))
    {
        return hr;
    }
    if (pdwVersion != nullptr)
    {
        *pdwVersion = version.Version;
    }
    TELVANE_VERSION_NEGOTIATE reply = {TELVANE_VERSION_NEGOTIATE_OPCODE, TELVANE_PROTOCOL_VERSION};
    return WriteMessage(&reply, sizeof(reply), dwTimeoutMs);
}

HRESULT CPipeClient::Open(const wchar_t *wszPipeName, DWORD dwTimeoutMs, DWORD *pdwVersion)
{
    HRESULT hr = Connect(wszPipeName, dwTimeoutMs);
    if (SUCCEEDED(hr))
    {
        hr = Negotiate(dwTimeoutMs, pdwVersion);
        if (FAILED(hr))
        {
            Close();
        }
    }
    return hr;
}

HRESULT CPipeClient::ReadExpected(void *pv, DWORD cb, DWORD ulOpcode, DWORD dwTimeoutMs)
{
    BYTE rgb[TELVANE_MAX_MESSAGE];
    DWORD cbRead = 0;
    HRESULT hr = ReadMessage(rgb, sizeof(rgb), &cbRead, dwTimeoutMs);
    if (hr == HRESULT_FROM_WIN32(ERROR_MORE_DATA))
    {
        return HRESULT_FROM_WIN32(ERROR_INVALID_DATA);
    }
    if (FAILED(hr))
    {
        return hr;
    }
    TELVANE_PACKET header = {};
    if (cbRead != cb || cb < sizeof(header))
    {
        return HRESULT_FROM_WIN32(ERROR_INVALID_DATA);
    }
    CopyMemory(&header, rgb, sizeof(header));
    if (header.Opcode != ulOpcode)
    {
        return HRESULT_FROM_WIN32(ERROR_INVALID_DATA);
    }
    CopyMemory(pv, rgb, cb);
    return S_OK;
}

HRESULT CPipeClient::WriteMessage(const void *pv, DWORD cb, DWORD dwTimeoutMs)
{
    if (pv == nullptr && cb != 0)
    {
        return E_INVALIDARG;
    }
    if (!IsOpen())
    {
        return HRESULT_FROM_WIN32(ERROR_INVALID_STATE);
    }
    OVERLAPPED overlapped = {};
    overlapped.hEvent = m_hEvent.Get();
    BOOL fResult = WriteFile(m_hPipe.Get(), pv, cb, nullptr, &overlapped);
    DWORD cbWritten = 0;
    HRESULT hr = WaitIo(fResult, &overlapped, &cbWritten, dwTimeoutMs);
    if (hr == HRESULT_FROM_WIN32(ERROR_TIMEOUT))
    {
        Close();
    }
    return hr;
}

HRESULT CPipeClient::WriteParts(const void *pvHeader, DWORD cbHeader, DWORD ibComplete,
                                DWORD ibLength, DWORD cbTrailer, DWORD cbMaxPart, const void *pv,
                                size_t cb, DWORD dwTimeoutMs)
{
    if (pv == nullptr && cb != 0)
    {
        return E_INVALIDARG;
    }
    if (cb > TELVANE_MAX_ITEM)
    {
        return HRESULT_FROM_WIN32(ERROR_MESSAGE_EXCEEDS_MAX_SIZE);
    }
    BYTE rgbPart[TELVANE_MAX_MESSAGE] = {};
    // Summed in 64 bits: a size near 2^32 must not wrap round and pass for a small one. Parts
    // that may carry nothing would never finish an item that has bytes.
    const ULONGLONG cbLayout = static_cast<ULONGLONG>(cbHeader) + cbMaxPart + cbTrailer;
    if (pvHeader == nullptr || cbLayout > sizeof(rgbPart) ||
        static_cast<ULONGLONG>(ibComplete) + sizeof(DWORD) > cbHeader ||
        static_cast<ULONGLONG>(ibLength) + sizeof(DWORD) > cbHeader || (cbMaxPart == 0 && cb != 0))
    {
        return E_INVALIDARG;
    }
    CopyMemory(rgbPart, pvHeader, cbHeader);
    const BYTE *pb = static_cast<const BYTE *>(pv);
    size_t cbLeft = cb;
    do
    {
        DWORD cbPart = static_cast<DWORD>(cbLeft < cbMaxPart ? cbLeft : cbMaxPart);
        DWORD ulComplete = cbPart == cbLeft ? 1 : 0;
        CopyMemory(rgbPart + ibComplete, &ulComplete, sizeof(ulComplete));
        CopyMemory(rgbPart + ibLength, &cbPart, sizeof(cbPart));
        if (cbPart != 0)
        {
            CopyMemory(rgbPart + cbHeader, pb, cbPart);
        }
        ZeroMemory(rgbPart + cbHeader + cbPart, cbTrailer);
        HRESULT hr = WriteMessage(rgbPart, cbHeader + cbPart + cbTrailer, dwTimeoutMs);
        if (FAILED(hr))
        {
            return hr;
        }
        pb += cbPart;
        cbLeft -= cbPart;
    } while (cbLeft != 0);
    return S_OK;
}

HRESULT CPipeClient::ReadMessage(void *pv, DWORD cbBuffer, DWORD *pcbRead, DWORD dwTimeoutMs)
{
    if (pcbRead == nullptr || (pv == nullptr && cbBuffer != 0))
    {
        return E_INVALIDARG;
    }
    *pcbRead = 0;
    if (!IsOpen())
    {
        return HRESULT_FROM_WIN32(ERROR_INVALID_STATE);
    }
    OVERLAPPED overlapped = {};
    overlapped.hEvent = m_hEvent.Get();
    BOOL fResult = ReadFile(m_hPipe.Get(), pv, cbBuffer, nullptr, &overlapped);
    return WaitIo(fResult, &overlapped, pcbRead, dwTimeoutMs);
}

HRESULT CPipeClient::WaitIo(BOOL fResult, OVERLAPPED *pOverlapped, DWORD *pcbTransferred,
                            DWORD dwTimeoutMs)
{
    if (!fResult)
    {
        DWORD dwError = GetLastError();
        // A read of a message longer than the buffer filled it at once; how much it delivered
        // is in the operation's result, collected below like any completion's.
        if (dwError != ERROR_IO_PENDING && dwError != ERROR_MORE_DATA)
        {
            return PipeClientResult(dwError);
        }
        if (dwError == ERROR_IO_PENDING &&
            WaitForSingleObject(pOverlapped->hEvent, dwTimeoutMs) != WAIT_OBJECT_0)
        {
            // The operation may still finish as it is cancelled; then its result stands.
            CancelIoEx(m_hPipe.Get(), pOverlapped);
            if (GetOverlappedResult(m_hPipe.Get(), pOverlapped, pcbTransferred, TRUE))
            {
                return S_OK;
            }
            dwError = GetLastError();
            return dwError == ERROR_OPERATION_ABORTED ? HRESULT_FROM_WIN32(ERROR_TIMEOUT)
                                                      : PipeClientResult(dwError);
        }
    }
    if (!GetOverlappedResult(m_hPipe.Get(), pOverlapped, pcbTransferred, FALSE))
    {
        return PipeClientResult(GetLastError());
    }
    return S_OK;
}

HRESULT CPipeClient::WriteFinal(DWORD ulOpcode, DWORD dwTimeoutMs)
{
    TELVANE_PACKET message = {ulOpcode};
    HRESULT hr = WriteMessage(&message, sizeof(message), dwTimeoutMs);
    Close();
    return hr;
}

void CPipeClient::Close()
{
    m_hPipe.Reset();
}
