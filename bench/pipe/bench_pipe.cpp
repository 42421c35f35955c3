// Messages per second and MB/s from clients into AsyncPipe instances with a counting sink,
// beside a plain blocking server loop (one thread per instance, ReadFile in a loop) measured
// in the same run on the same machine: the platform's own limit. 1 and 8 concurrent clients,
// small and full-size messages; the clients are the same plain blocking writers in both.
#include "bench/benchsupport.h"
#include "servicelib/asyncpipe.h"
#include "client/cpipeclient.h"

#include <atomic>
#include <stdio.h>
#include <string>
#include <thread>
#include <vector>

namespace
{
const DWORD c_dwPipeMode = PIPE_TYPE_MESSAGE | PIPE_READMODE_MESSAGE | PIPE_REJECT_REMOTE_CLIENTS;

double NowSeconds()
{
    LARGE_INTEGER li, freq;
    QueryPerformanceCounter(&li);
    QueryPerformanceFrequency(&freq);
    return static_cast<double>(li.QuadPart) / static_cast<double>(freq.QuadPart);
}

std::wstring BenchPipeName(const wchar_t *wszTag, int iRun)
{
    wchar_t wsz[128];
    swprintf(wsz, 128, L"\\\\.\\pipe\\TelvaneBench-%ls-%lu-%d", wszTag, GetCurrentProcessId(),
             iRun);
    return wsz;
}

// A plain client: opens the pipe (retrying while no instance listens) and writes its
// messages with blocking calls.
HANDLE BenchConnect(const std::wstring &name)
{
    for (int i = 0; i < 2000; i++)
    {
        HANDLE h = CreateFileW(name.c_str(), c_dwTelvaneClientPipeAccess, 0, nullptr, OPEN_EXISTING,
                               0, nullptr);
        if (h != INVALID_HANDLE_VALUE)
        {
            DWORD dwMode = PIPE_READMODE_MESSAGE;
            SetNamedPipeHandleState(h, &dwMode, nullptr, nullptr);
            return h;
        }
        Sleep(5);
    }
    return INVALID_HANDLE_VALUE;
}

struct Figures
{
    double dSeconds;
    LONGLONG cMessages;
    LONGLONG cbBytes;
};

// Starts the clients, each connecting and then waiting for the common start, and returns the
// time from the start until fnDone says every message is in.
template <class FDone>
double RunClients(const std::wstring &name, int cClients, int cMessagesPerClient, DWORD cbMessage,
                  FDone fnDone)
{
    std::atomic<int> cReady{0};
    std::atomic<bool> fGo{false};
    std::vector<std::thread> clients;
    for (int c = 0; c < cClients; c++)
    {
        clients.emplace_back([&] {
            HANDLE h = BenchConnect(name);
            std::vector<BYTE> vb(cbMessage, 0x5A);
            cReady++;
            while (!fGo)
            {
                Sleep(0);
            }
            for (int m = 0; m < cMessagesPerClient && h != INVALID_HANDLE_VALUE; m++)
            {
                DWORD cbWritten = 0;
                if (!WriteFile(h, vb.data(), cbMessage, &cbWritten, nullptr))
                {
                    break;
                }
            }
            if (h != INVALID_HANDLE_VALUE)
            {
                FlushFileBuffers(h);
                CloseHandle(h);
            }
        });
    }
    while (cReady < cClients)
    {
        Sleep(1);
    }
    double dStart = NowSeconds();
    fGo = true;
    fnDone();
    double dSeconds = NowSeconds() - dStart;
    for (std::thread &t : clients)
    {
        t.join();
    }
    return dSeconds;
}

Figures BenchAsyncPipe(int iRun, int cClients, int cMessagesPerClient, DWORD cbMessage)
{
    std::wstring name = BenchPipeName(L"async", iRun);
    std::atomic<LONGLONG> cMessages{0};
    std::atomic<LONGLONG> cbBytes{0};
    LONGLONG cTarget = static_cast<LONGLONG>(cClients) * cMessagesPerClient;
    HANDLE hDone = CreateEventW(nullptr, TRUE, FALSE, nullptr);
    std::vector<AsyncPipe *> pipes;
    for (int c = 0; c < cClients; c++)
    {
        CBenchCountingSink *pSink = new CBenchCountingSink(&cMessages, &cbBytes, cTarget, hDone);
        AsyncPipe *pPipe = new AsyncPipe();
        pPipe->Listen(name.c_str(), pSink, pSink);
        pSink->Release();
        pipes.push_back(pPipe);
    }
    double dSeconds = RunClients(name, cClients, cMessagesPerClient, cbMessage,
                                 [&] { WaitForSingleObject(hDone, 120000); });
    for (AsyncPipe *pPipe : pipes)
    {
        pPipe->Close();
        pPipe->Release();
    }
    CloseHandle(hDone);
    return {dSeconds, cMessages.load(), cbBytes.load()};
}

Figures BenchBlockingLoop(int iRun, int cClients, int cMessagesPerClient, DWORD cbMessage)
{
    std::wstring name = BenchPipeName(L"plain", iRun);
    std::atomic<LONGLONG> cMessages{0};
    std::atomic<LONGLONG> cbBytes{0};
    std::vector<HANDLE> handles;
    for (int c = 0; c < cClients; c++)
    {
        handles.push_back(CreateNamedPipeW(name.c_str(), PIPE_ACCESS_DUPLEX, c_dwPipeMode,
                                           PIPE_UNLIMITED_INSTANCES, 1024, 128, 0, nullptr));
    }
    std::vector<std::thread> servers;
    for (HANDLE h : handles)
    {
        servers.emplace_back([&, h] {
            ConnectNamedPipe(h, nullptr);
            BYTE rgb[AsyncPipe::c_cbMaxMessage];
            DWORD cbRead = 0;
            while (ReadFile(h, rgb, sizeof(rgb), &cbRead, nullptr))
            {
                cbBytes += cbRead;
                cMessages++;
            }
        });
    }
    double dSeconds = RunClients(name, cClients, cMessagesPerClient, cbMessage, [&] {
        for (std::thread &t : servers)
        {
            t.join();
        }
    });
    for (HANDLE h : handles)
    {
        CloseHandle(h);
    }
    return {dSeconds, cMessages.load(), cbBytes.load()};
}

void Print(const char *szWhat, const Figures &f)
{
    printf("  %-22s %8lld msgs %8.3f s %10.0f msgs/s %8.2f MB/s\n", szWhat, f.cMessages, f.dSeconds,
           f.cMessages / f.dSeconds, f.cbBytes / f.dSeconds / 1e6);
}
} // namespace

int main()
{
    setvbuf(stdout, nullptr, _IONBF, 0);
    const DWORD rgcbMessage[] = {64, 1200};
    const int rgcClients[] = {1, 8};
    const int c_cMessagesTotal = 40000;
    int iRun = 0;
    for (DWORD cbMessage : rgcbMessage)
    {
        for (int cClients : rgcClients)
        {
            int cPerClient = c_cMessagesTotal / cClients;
            // Warm-up of both paths (thread pool, pipe server), not measured.
            BenchAsyncPipe(iRun++, cClients, 200, cbMessage);
            BenchBlockingLoop(iRun++, cClients, 200, cbMessage);
            Figures async = BenchAsyncPipe(iRun++, cClients, cPerClient, cbMessage);
            Figures plain = BenchBlockingLoop(iRun++, cClients, cPerClient, cbMessage);
            printf("%d client(s), %lu-byte messages:\n", cClients,
                   static_cast<unsigned long>(cbMessage));
            Print("AsyncPipe", async);
            Print("blocking server loop", plain);
            printf("  ratio AsyncPipe/blocking: %.2f\n",
                   (async.cMessages / async.dSeconds) / (plain.cMessages / plain.dSeconds));
        }
    }
    return 0;
}
