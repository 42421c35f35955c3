// Pieces several benchmarks share: the run identifiers and record values of a trace-shaped
// workload, and a pipe sink that only counts. The sink's methods run on the pipe's
// thread-pool callbacks; the benchmark owns it through its reference count.
#pragma once

#include "servicelib/asyncpipe.h"

#include <atomic>
#include <stdio.h>
#include <string>

const GUID c_guidBenchActivity = {
    0x6f1d2a40, 0x3c1e, 0x4b7a, {0x9d, 0x55, 0x1a, 0x2b, 0x3c, 0x4d, 0x5e, 0x6f}};
const GUID c_guidBenchSession = {
    0x0a1b2c3d, 0x4e5f, 0x6071, {0x82, 0x93, 0xa4, 0xb5, 0xc6, 0xd7, 0xe8, 0xf9}};
const GUID c_guidBenchLog = {
    0x12345678, 0x9abc, 0xdef0, {0x12, 0x34, 0x56, 0x78, 0x9a, 0xbc, 0xde, 0xf0}};

// An activity event as a client sends it: a JSON object of exactly 200 bytes.
inline std::string BenchRecordValue(ULONG i)
{
    char szValue[256];
    int cch = snprintf(szValue, sizeof(szValue),
                       "{\"Event\":\"Connect\",\"Bssid\":\"00:11:22:33:%02x:%02x\",\"Rssi\":-%lu,"
                       "\"Channel\":%lu,\"Band\":\"5GHz\",\"Reason\":0,\"Detail\":\"",
                       static_cast<unsigned>(i & 0xFF), static_cast<unsigned>((i >> 8) & 0xFF),
                       40 + i % 50, 1 + i % 13);
    std::string str(szValue, static_cast<size_t>(cch));
    str.append(200 - str.size() - 2, 'x');
    str += "\"}";
    return str;
}

// Counts the messages (and, when asked, their bytes) of the pipes it serves; sets hDone when
// the cTarget-th message is in.
class CBenchCountingSink : public IPipeDataSink, public IPipeConnectSink
{
public:
    explicit CBenchCountingSink(std::atomic<LONGLONG> *pcMessages,
                                std::atomic<LONGLONG> *pcbBytes = nullptr, LONGLONG cTarget = 0,
                                HANDLE hDone = nullptr)
        : m_pcMessages(pcMessages)
        , m_pcbBytes(pcbBytes)
        , m_cTarget(cTarget)
        , m_hDone(hDone)
    {
    }
    virtual ~CBenchCountingSink() = default;
    HRESULT STDMETHODCALLTYPE QueryInterface(REFIID, void **ppv) override
    {
        *ppv = nullptr;
        return E_NOINTERFACE;
    }
    ULONG STDMETHODCALLTYPE AddRef() override { return InterlockedIncrement(&m_cRef); }
    ULONG STDMETHODCALLTYPE Release() override
    {
        ULONG cRef = InterlockedDecrement(&m_cRef);
        if (cRef == 0)
        {
            delete this;
        }
        return cRef;
    }
    HRESULT STDMETHODCALLTYPE IncomingMessage(const BYTE *, ULONG cb) override
    {
        if (m_pcbBytes != nullptr)
        {
            *m_pcbBytes += cb;
        }
        if (++*m_pcMessages == m_cTarget && m_hDone != nullptr)
        {
            SetEvent(m_hDone);
        }
        return S_OK;
    }
    HRESULT STDMETHODCALLTYPE PipeBroken() override { return S_OK; }
    HRESULT STDMETHODCALLTYPE Connected() override { return S_OK; }

private:
    volatile LONG m_cRef = 1;
    std::atomic<LONGLONG> *m_pcMessages;
    std::atomic<LONGLONG> *m_pcbBytes;
    LONGLONG m_cTarget;
    HANDLE m_hDone;
};
