// Helpers of the pipe suites: unique pipe names, test GUIDs, and a sink that records what an
// AsyncPipe hands its owner. Sink calls arrive on the pipe's handlers (thread-pool threads);
// the test thread reads the record under the sink's lock and waits with a time limit.
#pragma once

#include "servicelib/asyncpipe.h"
#include "inc/telvanepipe.h"
#include "tests/common/testsupport.h"

#include <gtest/gtest.h>
#include <condition_variable>
#include <functional>
#include <mutex>
#include <string>
#include <vector>

namespace pipetest
{
// Longest any test waits for something the pipe or a client should do.
const DWORD c_dwWaitMs = 10000;

// A pipe name no other test or run uses, and never the product's.
std::wstring UniquePipeName(const wchar_t *wszTag);

GUID TestGuid(BYTE bSeed);
TELVANE_GUID WireGuid(const GUID &guid);
bool SameGuid(const TELVANE_GUID &wire, const GUID &guid);
std::vector<BYTE> Pattern(size_t cb, BYTE bSeed);

// Reference count of a pipe, read by adding and dropping one reference; 1 means only the
// owner's is left (no connect, read or write pending).
ULONG PipeRefs(AsyncPipe *pPipe);
// Polls until the pipe's count is cRef: the pipe has no event of its own for "idle".
bool WaitForPipeRefs(AsyncPipe *pPipe, ULONG cRef, DWORD dwTimeoutMs = c_dwWaitMs);

// Base of the suites' fixtures: failure reports are captured, so a fatal error or an
// assertion fails the test instead of ending the run.
class CPipeTest : public ::testing::Test
{
protected:
    void TearDown() override;

    testsupport::FailureCapture m_failures;
};

// Records the data and connect sink calls of one pipe. Optionally echoes every message back
// through a pipe, or runs a hook instead of recording.
class CRecordingSink : public IPipeDataSink, public IPipeConnectSink
{
public:
    CRecordingSink();
    virtual ~CRecordingSink();

    HRESULT STDMETHODCALLTYPE QueryInterface(REFIID riid, void **ppv) override;
    ULONG STDMETHODCALLTYPE AddRef() override;
    ULONG STDMETHODCALLTYPE Release() override;
    HRESULT STDMETHODCALLTYPE IncomingMessage(const BYTE *pb, ULONG cb) override;
    HRESULT STDMETHODCALLTYPE PipeBroken() override;
    HRESULT STDMETHODCALLTYPE Connected() override;

    // Every message is written back through this pipe (not counted as a reference).
    void EchoThrough(AsyncPipe *pPipe) { m_pEchoPipe = pPipe; }

    // Each waits until the count reaches the value; false when time ran out.
    bool WaitForConnected(int c, DWORD dwTimeoutMs = c_dwWaitMs);
    bool WaitForBroken(int c, DWORD dwTimeoutMs = c_dwWaitMs);
    bool WaitForMessages(size_t c, DWORD dwTimeoutMs = c_dwWaitMs);
    bool WaitForRefs(ULONG cRef, DWORD dwTimeoutMs = c_dwWaitMs);

    ULONG Refs() const;
    int ConnectedCount() const;
    int BrokenCount() const;
    std::vector<std::vector<BYTE>> Messages() const;

protected:
    // Called for each message under no lock; the default records it and echoes it.
    virtual void OnMessage(const BYTE *pb, ULONG cb);
    virtual void OnConnected() {}
    void Record(const std::function<void()> &change);
    // Waits until the predicate, evaluated under the lock, holds.
    bool WaitUntil(const std::function<bool()> &pred, DWORD dwTimeoutMs);

    mutable std::mutex m_lock;
    std::condition_variable m_changed;
    volatile LONG m_cRef;
    AsyncPipe *m_pEchoPipe;
    int m_cConnected;
    int m_cBroken;
    std::vector<std::vector<BYTE>> m_rgMessages;
};
} // namespace pipetest
