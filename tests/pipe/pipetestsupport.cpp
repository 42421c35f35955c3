#include "tests/pipe/pipetestsupport.h"

#include <chrono>
#include <cstring>

namespace pipetest
{
std::wstring UniquePipeName(const wchar_t *wszTag)
{
    static volatile LONG s_lNext = 0;
    wchar_t wszName[128];
    swprintf(wszName, ARRAYSIZE(wszName), L"\\\\.\\pipe\\TelvanePipeTest-%ls-%lu-%llu-%ld", wszTag,
             GetCurrentProcessId(), static_cast<unsigned long long>(GetTickCount64()),
             InterlockedIncrement(&s_lNext));
    return wszName;
}

GUID TestGuid(BYTE bSeed)
{
    GUID guid;
    BYTE *pb = reinterpret_cast<BYTE *>(&guid);
    for (size_t i = 0; i < sizeof(guid); i++)
    {
        pb[i] = static_cast<BYTE>(bSeed + i * 7);
    }
    return guid;
}

TELVANE_GUID WireGuid(const GUID &guid)
{
    TELVANE_GUID wire;
    std::memcpy(&wire, &guid, sizeof(wire));
    return wire;
}

bool SameGuid(const TELVANE_GUID &wire, const GUID &guid)
{
    return std::memcmp(&wire, &guid, sizeof(wire)) == 0;
}

std::vector<BYTE> Pattern(size_t cb, BYTE bSeed)
{
    std::vector<BYTE> vb(cb);
    for (size_t i = 0; i < cb; i++)
    {
        vb[i] = static_cast<BYTE>(bSeed + i * 31 + (i >> 8));
    }
    return vb;
}

ULONG PipeRefs(AsyncPipe *pPipe)
{
    pPipe->AddRef();
    return pPipe->Release();
}

bool WaitForPipeRefs(AsyncPipe *pPipe, ULONG cRef, DWORD dwTimeoutMs)
{
    ULONGLONG ullDeadline = GetTickCount64() + dwTimeoutMs;
    while (PipeRefs(pPipe) != cRef)
    {
        if (GetTickCount64() >= ullDeadline)
        {
            return false;
        }
        Sleep(5);
    }
    return true;
}

void CPipeTest::TearDown()
{
    for (const std::wstring &line : m_failures.Lines())
    {
        ADD_FAILURE() << testsupport::Narrow(line);
    }
}

CRecordingSink::CRecordingSink()
    : m_cRef(1)
    , m_pEchoPipe(nullptr)
    , m_cConnected(0)
    , m_cBroken(0)
{
}

CRecordingSink::~CRecordingSink() = default;

HRESULT STDMETHODCALLTYPE CRecordingSink::QueryInterface(REFIID riid, void **ppv)
{
    if (ppv == nullptr)
    {
        return E_POINTER;
    }
    if (IsEqualIID(riid, IID_IUnknown) || IsEqualIID(riid, IID_IPipeDataSink))
    {
        *ppv = static_cast<IPipeDataSink *>(this);
    }
    else if (IsEqualIID(riid, IID_IPipeConnectSink))
    {
        *ppv = static_cast<IPipeConnectSink *>(this);
    }
    else
    {
        *ppv = nullptr;
        return E_NOINTERFACE;
    }
    AddRef();
    return S_OK;
}

ULONG STDMETHODCALLTYPE CRecordingSink::AddRef()
{
    ULONG cRef = static_cast<ULONG>(InterlockedIncrement(&m_cRef));
    std::lock_guard<std::mutex> guard(m_lock);
    m_changed.notify_all();
    return cRef;
}

ULONG STDMETHODCALLTYPE CRecordingSink::Release()
{
    ULONG cRef = static_cast<ULONG>(InterlockedDecrement(&m_cRef));
    if (cRef == 0)
    {
        delete this;
        return 0;
    }
    std::lock_guard<std::mutex> guard(m_lock);
    m_changed.notify_all();
    return cRef;
}

HRESULT STDMETHODCALLTYPE CRecordingSink::IncomingMessage(const BYTE *pb, ULONG cb)
{
    OnMessage(pb, cb);
    return S_OK;
}

void CRecordingSink::OnMessage(const BYTE *pb, ULONG cb)
{
    Record([&] { m_rgMessages.emplace_back(pb, pb + cb); });
    if (m_pEchoPipe != nullptr)
    {
        m_pEchoPipe->Write(pb, cb);
    }
}

HRESULT STDMETHODCALLTYPE CRecordingSink::PipeBroken()
{
    Record([&] { m_cBroken++; });
    return S_OK;
}

HRESULT STDMETHODCALLTYPE CRecordingSink::Connected()
{
    Record([&] { m_cConnected++; });
    OnConnected();
    return S_OK;
}

void CRecordingSink::Record(const std::function<void()> &change)
{
    std::lock_guard<std::mutex> guard(m_lock);
    change();
    m_changed.notify_all();
}

bool CRecordingSink::WaitUntil(const std::function<bool()> &pred, DWORD dwTimeoutMs)
{
    std::unique_lock<std::mutex> guard(m_lock);
    return m_changed.wait_for(guard, std::chrono::milliseconds(dwTimeoutMs), pred);
}

bool CRecordingSink::WaitForConnected(int c, DWORD dwTimeoutMs)
{
    return WaitUntil([&] { return m_cConnected >= c; }, dwTimeoutMs);
}

bool CRecordingSink::WaitForBroken(int c, DWORD dwTimeoutMs)
{
    return WaitUntil([&] { return m_cBroken >= c; }, dwTimeoutMs);
}

bool CRecordingSink::WaitForMessages(size_t c, DWORD dwTimeoutMs)
{
    return WaitUntil([&] { return m_rgMessages.size() >= c; }, dwTimeoutMs);
}

bool CRecordingSink::WaitForRefs(ULONG cRef, DWORD dwTimeoutMs)
{
    return WaitUntil([&] { return static_cast<ULONG>(m_cRef) == cRef; }, dwTimeoutMs);
}

ULONG CRecordingSink::Refs() const
{
    return static_cast<ULONG>(m_cRef);
}

int CRecordingSink::ConnectedCount() const
{
    std::lock_guard<std::mutex> guard(m_lock);
    return m_cConnected;
}

int CRecordingSink::BrokenCount() const
{
    std::lock_guard<std::mutex> guard(m_lock);
    return m_cBroken;
}

std::vector<std::vector<BYTE>> CRecordingSink::Messages() const
{
    std::lock_guard<std::mutex> guard(m_lock);
    return m_rgMessages;
}
} // namespace pipetest
