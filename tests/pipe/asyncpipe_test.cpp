// AsyncPipe through real pipe instances and real clients under Wine.
#include "servicelib/asyncpipe.h"
#include "client/cpipeclient.h"
#include "platform/securityruntime/securityruntime.h"
#include "tests/common/testsupport.h"

#include <gtest/gtest.h>
#include <aclapi.h>
#include <sddl.h>
#include <atomic>
#include <mutex>
#include <thread>

using testsupport::c_dwWaitMs;
using testsupport::UniquePipeName;
using testsupport::WaitUntil;

namespace
{
std::vector<BYTE> Pattern(size_t cb, BYTE bSeed)
{
    std::vector<BYTE> vb(cb);
    for (size_t i = 0; i < cb; i++)
    {
        vb[i] = static_cast<BYTE>(bSeed + i * 31 + (i >> 8));
    }
    return vb;
}

// The pipe's reference count, read by adding and dropping one: the pipe has no event of its
// own for "idle", so tests poll until only the owner's reference is left.
bool WaitForPipeRefs(AsyncPipe *pPipe, ULONG cRef)
{
    return WaitUntil([&] {
        pPipe->AddRef();
        return pPipe->Release() == cRef;
    });
}

// Records what one pipe hands its owner, and echoes each message back through the pipe when
// given one (not counted as a reference). Called on the pipe's handlers (thread-pool
// threads); the test thread polls the counts and reads the messages under the lock.
class CRecordingSink final : public IPipeDataSink, public IPipeConnectSink
{
public:
    explicit CRecordingSink(AsyncPipe *pEcho)
        : m_pEcho(pEcho)
    {
    }
    HRESULT STDMETHODCALLTYPE QueryInterface(REFIID riid, void **ppv) override
    {
        *ppv = nullptr;
        return E_NOINTERFACE;
    }
    ULONG STDMETHODCALLTYPE AddRef() override { return ++m_cRef; }
    ULONG STDMETHODCALLTYPE Release() override
    {
        ULONG cRef = --m_cRef;
        if (cRef == 0)
        {
            delete this;
        }
        return cRef;
    }
    HRESULT STDMETHODCALLTYPE IncomingMessage(const BYTE *pb, ULONG cb) override
    {
        {
            std::lock_guard<std::mutex> guard(m_lock);
            m_rgMessages.emplace_back(pb, pb + cb);
        }
        if (m_pEcho != nullptr)
        {
            m_pEcho->Write(pb, cb);
        }
        return S_OK;
    }
    HRESULT STDMETHODCALLTYPE PipeBroken() override
    {
        m_cBroken++;
        return S_OK;
    }
    HRESULT STDMETHODCALLTYPE Connected() override
    {
        m_cConnected++;
        return S_OK;
    }

    std::vector<std::vector<BYTE>> Messages() const
    {
        std::lock_guard<std::mutex> guard(m_lock);
        return m_rgMessages;
    }
    bool WaitForRefs(ULONG cRef) const
    {
        return WaitUntil([&] { return m_cRef == cRef; });
    }
    bool WaitForBroken() const
    {
        return WaitUntil([&] { return m_cBroken > 0; });
    }

    std::atomic<ULONG> m_cRef{1};
    std::atomic<int> m_cConnected{0};
    std::atomic<int> m_cBroken{0};

private:
    AsyncPipe *m_pEcho;
    mutable std::mutex m_lock;
    std::vector<std::vector<BYTE>> m_rgMessages;
};

// Every test runs with failure reports captured: a fatal error or assertion fails the test
// instead of ending the run. The test thread owns the pipes and sinks it makes.
class AsyncPipeTest : public ::testing::Test
{
protected:
    void TearDown() override { m_failures.ExpectNone(); }

    // A pipe listening on the name with one sink for both roles.
    struct Listener
    {
        AsyncPipe *pPipe = nullptr;
        CRecordingSink *pSink = nullptr;
    };

    static Listener Listen(const std::wstring &name, bool fEcho = false, AsyncPipe *pPipe = nullptr)
    {
        Listener listener;
        listener.pPipe = pPipe != nullptr ? pPipe : new AsyncPipe();
        listener.pSink = new CRecordingSink(fEcho ? listener.pPipe : nullptr);
        listener.pPipe->Listen(name.c_str(), listener.pSink, listener.pSink);
        return listener;
    }

    // A client on the name, once the listener has seen it arrive.
    static bool ConnectTo(const std::wstring &name, const Listener &listener, CPipeClient *pClient)
    {
        return pClient->Connect(name.c_str(), c_dwWaitMs) == S_OK &&
               WaitUntil([&] { return listener.pSink->m_cConnected > 0; });
    }

    // The owner's side of the end: close, then every reference the pipe took on the sink and
    // every operation's reference on the pipe must be gone, with exactly one break delivered
    // whoever ended the connection, and a connected notice only for a client that came.
    static void CloseAndRelease(const Listener &listener, int cConnected = 1)
    {
        listener.pSink->AddRef();
        listener.pPipe->Close();
        EXPECT_TRUE(listener.pSink->WaitForRefs(2)) << "the pipe still holds its sinks";
        EXPECT_TRUE(WaitForPipeRefs(listener.pPipe, 1)) << "an operation is still pending";
        EXPECT_EQ(1, listener.pSink->m_cBroken);
        EXPECT_EQ(cConnected, listener.pSink->m_cConnected);
        listener.pPipe->Release();
        listener.pSink->Release();
        listener.pSink->Release();
    }

    testsupport::FailureCapture m_failures;
};

// Holds the pipe's Synchronizer busy in one marked event, so that what is posted meanwhile
// waits in the queue while the pipe's instance and its clients move on. The hold runs on the
// Synchronizer's thread; the test owns the pipe like any other.
class CHeldPipe : public AsyncPipe
{
public:
    CHeldPipe()
        : m_hEntered(CreateEventW(nullptr, TRUE, FALSE, nullptr))
        , m_hProceed(CreateEventW(nullptr, TRUE, FALSE, nullptr))
    {
    }
    ~CHeldPipe() override
    {
        CloseHandle(m_hEntered);
        CloseHandle(m_hProceed);
    }

    void HoldInNextEvent() { m_fHold = true; }

    void Dispatch(ULONG ulEventType, ULONG_PTR ulArg1, ULONG_PTR ulArg2, ULONG_PTR ulArg3) override
    {
        if (m_fHold.exchange(false))
        {
            SetEvent(m_hEntered);
            WaitForSingleObject(m_hProceed, c_dwWaitMs);
        }
        AsyncPipe::Dispatch(ulEventType, ulArg1, ulArg2, ulArg3);
    }

    HANDLE m_hEntered;
    HANDLE m_hProceed;
    std::atomic<bool> m_fHold{false};
};
} // namespace

// The life of a connection whose client opened the instance before the pipe's connect call was
// issued (which then answers ERROR_PIPE_CONNECTED): connected notice, a full-size message
// delivered whole and echoed, then the client leaves while a read is pending.
TEST_F(AsyncPipeTest, DeliversWholeMessagesAndOneBreakWhenClientLeaves)
{
    std::wstring name = UniquePipeName(L"life");
    CHeldPipe *pPipe = new CHeldPipe();
    pPipe->HoldInNextEvent();
    std::thread holder([&] {
        BYTE b = 0;
        pPipe->Write(&b, 1); // not listening yet: freed unwritten, after the hold
    });
    ASSERT_EQ(WAIT_OBJECT_0, WaitForSingleObject(pPipe->m_hEntered, c_dwWaitMs));
    Listener listener = Listen(name, true, pPipe); // the instance exists; the connect waits
    EXPECT_EQ(3u, listener.pSink->m_cRef) << "Listen hands the pipe a reference per sink";
    CPipeClient client;
    HRESULT hrConnect = client.Connect(name.c_str(), c_dwWaitMs);
    EXPECT_EQ(0, listener.pSink->m_cConnected);
    SetEvent(pPipe->m_hProceed);
    holder.join();
    ASSERT_EQ(S_OK, hrConnect);
    ASSERT_TRUE(WaitUntil([&] { return listener.pSink->m_cConnected == 1; }));
    EXPECT_TRUE(listener.pSink->WaitForRefs(2)) << "the connect sink is released once connected";

    std::vector<BYTE> full = Pattern(AsyncPipe::c_cbMaxMessage, 1);
    std::vector<BYTE> small = Pattern(5, 2);
    for (const std::vector<BYTE> &message : {full, small})
    {
        ASSERT_EQ(S_OK, client.WriteMessage(message.data(), static_cast<DWORD>(message.size()),
                                            c_dwWaitMs));
    }
    for (const std::vector<BYTE> &message : {full, small})
    {
        std::vector<BYTE> echo(4096);
        DWORD cbEcho = 0;
        ASSERT_EQ(S_OK, client.ReadMessage(echo.data(), static_cast<DWORD>(echo.size()), &cbEcho,
                                           c_dwWaitMs));
        EXPECT_EQ(message, std::vector<BYTE>(echo.begin(), echo.begin() + cbEcho));
    }
    EXPECT_EQ((std::vector<std::vector<BYTE>>{full, small}), listener.pSink->Messages())
        << "a 1200-byte message arrives in one piece";

    client.Close();
    ASSERT_TRUE(listener.pSink->WaitForBroken());
    EXPECT_TRUE(listener.pSink->WaitForRefs(1)) << "the data sink is released with the break";
    // No read is pending after the break: only the owner's reference is left.
    EXPECT_TRUE(WaitForPipeRefs(listener.pPipe, 1));
    // Closing after the break changes nothing for the sink.
    CloseAndRelease(listener);
}

// A client that arrives while the close is already under way: its connect completes after
// the handle is gone. The owner must still get its one break and both sinks back, or owner and
// pipe keep each other alive for good.
TEST_F(AsyncPipeTest, ConnectCompletingAfterCloseStillEndsInOneBreak)
{
    std::wstring name = UniquePipeName(L"closing");
    CHeldPipe *pPipe = new CHeldPipe();
    Listener listener = Listen(name, false, pPipe);
    pPipe->HoldInNextEvent();
    std::thread holder([&] { pPipe->Close(); });
    ASSERT_EQ(WAIT_OBJECT_0, WaitForSingleObject(pPipe->m_hEntered, c_dwWaitMs));

    CPipeClient client;
    ASSERT_EQ(S_OK, client.Connect(name.c_str(), c_dwWaitMs));
    // Owner, pending connect, the held close and the queued connect completion.
    EXPECT_TRUE(WaitForPipeRefs(pPipe, 4));
    SetEvent(pPipe->m_hProceed);
    holder.join();

    EXPECT_TRUE(listener.pSink->WaitForRefs(1)) << "the pipe still holds its sinks";
    // The owner closed before the connection: no connected notice.
    CloseAndRelease(listener, 0);
}

// A write the client does not take stays pending; the buffers queued behind it are dropped by
// the close, the pending one by its completion, and buffers posted after the close are freed
// unwritten.
TEST_F(AsyncPipeTest, CloseDropsQueuedAndLaterWrites)
{
    std::wstring name = UniquePipeName(L"pending");
    Listener listener = Listen(name);
    CPipeClient client;
    ASSERT_TRUE(ConnectTo(name, listener, &client));

    std::vector<BYTE> big(256 * 1024, 0xA1); // far more than the pipe's output buffer
    listener.pPipe->Write(big.data(), static_cast<DWORD>(big.size()));
    for (BYTE b = 0xB2; b <= 0xB4; b++)
    {
        std::vector<BYTE> queued(1000, b);
        listener.pPipe->Write(queued.data(), static_cast<DWORD>(queued.size()));
    }
    listener.pPipe->Close();
    std::vector<BYTE> late(100, 0xC5);
    for (int i = 0; i < 3; i++)
    {
        listener.pPipe->Write(late.data(), static_cast<DWORD>(late.size()));
    }
    // The close alone ends the pending write (the client reads nothing until then).
    EXPECT_TRUE(listener.pSink->WaitForBroken());
    EXPECT_TRUE(WaitForPipeRefs(listener.pPipe, 1)) << "the pending write did not complete";

    // Whatever of the pending buffer got through, nothing queued behind it may follow.
    std::vector<BYTE> rgb(big.size());
    for (;;)
    {
        DWORD cbRead = 0;
        HRESULT hr =
            client.ReadMessage(rgb.data(), static_cast<DWORD>(rgb.size()), &cbRead, c_dwWaitMs);
        if (hr != S_OK && hr != HRESULT_FROM_WIN32(ERROR_MORE_DATA))
        {
            EXPECT_EQ(HRESULT_FROM_WIN32(ERROR_BROKEN_PIPE), hr);
            break;
        }
        for (DWORD i = 0; i < cbRead; i++)
        {
            ASSERT_EQ(0xA1, rgb[i]) << "a later buffer was written after the close";
        }
    }
    CloseAndRelease(listener);
}

// A client message longer than the receive buffer ends that connection alone.
TEST_F(AsyncPipeTest, OverlongMessageEndsOnlyItsConnection)
{
    std::wstring name = UniquePipeName(L"overlong");
    Listener first = Listen(name, true);
    CPipeClient clientFirst;
    ASSERT_TRUE(ConnectTo(name, first, &clientFirst));
    Listener second = Listen(name, true);
    CPipeClient clientSecond;
    ASSERT_TRUE(ConnectTo(name, second, &clientSecond));

    std::vector<BYTE> overlong = Pattern(AsyncPipe::c_cbMaxMessage + 1, 4);
    clientFirst.WriteMessage(overlong.data(), static_cast<DWORD>(overlong.size()), c_dwWaitMs);
    ASSERT_TRUE(first.pSink->WaitForBroken());
    EXPECT_TRUE(first.pSink->Messages().empty()) << "no part of the message is delivered";
    EXPECT_TRUE(first.pSink->WaitForRefs(1));
    BYTE rgb[16];
    DWORD cbRead = 0;
    EXPECT_EQ(HRESULT_FROM_WIN32(ERROR_BROKEN_PIPE),
              clientFirst.ReadMessage(rgb, sizeof(rgb), &cbRead, c_dwWaitMs))
        << "the service end of that connection is closed";

    BYTE rgbHello[5] = {'h', 'e', 'l', 'l', 'o'};
    ASSERT_EQ(S_OK, clientSecond.WriteMessage(rgbHello, sizeof(rgbHello), c_dwWaitMs));
    ASSERT_EQ(S_OK, clientSecond.ReadMessage(rgb, sizeof(rgb), &cbRead, c_dwWaitMs));
    EXPECT_EQ(5u, cbRead);
    EXPECT_EQ(0, second.pSink->m_cBroken);
    CloseAndRelease(first);
    CloseAndRelease(second);
}

// The pipe's descriptor comes from the security runtime, lets local clients in and nobody but
// the system and administrators serve the pipe, and the handle does not leak into processes
// the service starts.
TEST_F(AsyncPipeTest, SecuredByRuntimeDescriptorAndNotInherited)
{
    // The handle value comes from the pipe's own debug line.
    std::wstring name = UniquePipeName(L"handle");
    HANDLE hPipe = nullptr;
    Listener listener;
    {
        testsupport::LogCapture log;
        listener = Listen(name);
        for (const std::wstring &line : log.Lines())
        {
            size_t at = line.find(L"hPipe=");
            if (at != std::wstring::npos)
            {
                hPipe = ULongToHandle(wcstoul(line.c_str() + at + 6, nullptr, 16));
            }
        }
    }
    ASSERT_NE(nullptr, hPipe) << "no debug line names the pipe's handle";
    DWORD dwFlags = 0;
    ASSERT_TRUE(GetHandleInformation(hPipe, &dwFlags));
    EXPECT_EQ(0u, dwFlags & HANDLE_FLAG_INHERIT);
    PACL pDacl = nullptr;
    PSECURITY_DESCRIPTOR pPipeDescriptor = nullptr;
    ASSERT_EQ(ERROR_SUCCESS, GetSecurityInfo(hPipe, SE_KERNEL_OBJECT, DACL_SECURITY_INFORMATION,
                                             nullptr, nullptr, &pDacl, nullptr, &pPipeDescriptor));
    ASSERT_NE(nullptr, pDacl) << "a null DACL would let anyone in";
    // Everyone on the machine gets what a client asks for, and not the right to create
    // instances of the pipe (for a pipe that is the append right within generic write): with
    // it any local process could serve the service's pipe name to the service's clients.
    // Network logons are denied. Wine enforces none of this, so the rights are read here.
    GENERIC_MAPPING mapping = {FILE_GENERIC_READ, FILE_GENERIC_WRITE, FILE_GENERIC_EXECUTE,
                               FILE_ALL_ACCESS};
    DWORD dwClientAccess = c_dwTelvaneClientPipeAccess;
    MapGenericMask(&dwClientAccess, &mapping);
    EXPECT_EQ(0u, dwClientAccess & FILE_CREATE_PIPE_INSTANCE);
    DWORD dwWorldAccess = 0;
    bool fNetworkDenied = false;
    PSID pWorld = nullptr;
    PSID pNetwork = nullptr;
    ASSERT_TRUE(ConvertStringSidToSidW(L"S-1-1-0", &pWorld));
    ASSERT_TRUE(ConvertStringSidToSidW(L"S-1-5-2", &pNetwork));
    for (DWORD i = 0; i < pDacl->AceCount; i++)
    {
        ACCESS_ALLOWED_ACE *pAce = nullptr; // a denying ACE has the same layout
        ASSERT_TRUE(GetAce(pDacl, i, reinterpret_cast<void **>(&pAce)));
        if (pAce->Header.AceType == ACCESS_ALLOWED_ACE_TYPE && EqualSid(&pAce->SidStart, pWorld))
        {
            DWORD dwMask = pAce->Mask;
            MapGenericMask(&dwMask, &mapping);
            dwWorldAccess |= dwMask;
        }
        fNetworkDenied = fNetworkDenied || (pAce->Header.AceType == ACCESS_DENIED_ACE_TYPE &&
                                            EqualSid(&pAce->SidStart, pNetwork));
    }
    EXPECT_EQ(dwClientAccess, dwWorldAccess & dwClientAccess) << "a client could not open the pipe";
    EXPECT_EQ(0u, dwWorldAccess & FILE_CREATE_PIPE_INSTANCE) << "anyone could serve the pipe";
    EXPECT_TRUE(fNetworkDenied);
    LocalFree(pWorld);
    LocalFree(pNetwork);
    LocalFree(pPipeDescriptor);
    // Closing a pipe nobody connected to (under Wine the pending connect ends with 676) is a
    // departure, never a fatal error: the owner gets its one break and both sinks back.
    CloseAndRelease(listener, 0);
}
