// The service core end to end, in this process on pipe names of its own:
//  - events per second and MB/s from 1, 8 and 32 activity clients into delivered traces,
//    beside AsyncPipe with a counting sink fed the same messages by the same clients in the
//    same run (the transport is the limit here);
//  - committed private memory of the process: idle, per idle connected client, per open operation
//  that
//    holds 1,000 recorded events;
//  - the time from STOP to STOPPED with 200 clients connected.
// Logs go to files in C:\Data\Test\WiFiLog while it runs; the delivery values and the files
// are put back as they were.
#include "bench/benchsupport.h"
#include "service/cserviceoperation.h"
#include "service/telvaneservice.h"
#include "servicelib/asyncpipe.h"
#include "servicelib/reghelper.h"
#include "client/cactivityclient.h"

#include <rpc.h>

#include <atomic>
#include <memory>
#include <stdio.h>
#include <string>
#include <thread>
#include <vector>

namespace
{
const wchar_t c_wszCrowdKey[] =
    L"System\\CurrentControlSet\\Services\\Ambrel\\Parameters\\CrowdsrcPlugin";
const wchar_t c_wszTestKey[] = L"System\\CurrentControlSet\\Services\\Telvane\\Parameters";
const DWORD c_cbEvent = 1024; // one message per event

double NowSeconds()
{
    LARGE_INTEGER li, freq;
    QueryPerformanceCounter(&li);
    QueryPerformanceFrequency(&freq);
    return static_cast<double>(li.QuadPart) / static_cast<double>(freq.QuadPart);
}

std::wstring BenchName(const wchar_t *wszTag)
{
    static int s_iNext = 0;
    wchar_t wsz[128];
    swprintf(wsz, 128, L"\\\\.\\pipe\\TelvaneBenchCore-%ls-%lu-%d", wszTag, GetCurrentProcessId(),
             s_iNext++);
    return wsz;
}

GUID NewGuid()
{
    GUID guid;
    UuidCreate(&guid);
    return guid;
}

// Committed private memory of the process, counted region by region: Wine reports no
// private usage through the process memory counters.
double PrivateKiB()
{
    SIZE_T cb = 0;
    BYTE *pb = nullptr;
    MEMORY_BASIC_INFORMATION info;
    while (VirtualQuery(pb, &info, sizeof(info)) == sizeof(info))
    {
        if (info.State == MEM_COMMIT && info.Type == MEM_PRIVATE)
        {
            cb += info.RegionSize;
        }
        BYTE *pbNext = static_cast<BYTE *>(info.BaseAddress) + info.RegionSize;
        if (pbNext <= pb)
        {
            break;
        }
        pb = pbNext;
    }
    return static_cast<double>(cb) / 1024.0;
}

void WaitUntil(bool (*pfn)(), double dLimitSeconds = 600)
{
    double dEnd = NowSeconds() + dLimitSeconds;
    while (!pfn() && NowSeconds() < dEnd)
    {
        Sleep(1);
    }
}

class CBenchService
{
public:
    CBenchService()
        : m_wstrActivity(BenchName(L"act"))
        , m_wstrCollector(BenchName(L"col"))
        , m_service(m_wstrActivity.c_str(), m_wstrCollector.c_str())
    {
        m_service.OnStart();
        // Start runs on this thread's post: the listeners exist once OnStart returns.
    }
    ~CBenchService() { Stop(); }
    double Stop()
    {
        if (m_fStopped)
        {
            return 0;
        }
        m_fStopped = true;
        double dStart = NowSeconds();
        m_service.OnStop();
        return NowSeconds() - dStart;
    }
    const wchar_t *ActivityPipe() const { return m_wstrActivity.c_str(); }

private:
    std::wstring m_wstrActivity;
    std::wstring m_wstrCollector;
    TelvaneService m_service;
    bool m_fStopped = false;
};

// Events per second through the whole service: each client connects and starts, all wait for
// the common start, send their events and stop; the clock stops when every operation has
// delivered its log and gone.
double BenchService(int cClients, int cEventsPerClient, std::vector<GUID> *prgLogIds)
{
    CBenchService service;
    std::atomic<int> cReady{0};
    std::atomic<bool> fGo{false};
    std::vector<std::thread> clients;
    std::vector<BYTE> vbEvent(c_cbEvent, 'x');
    vbEvent.front() = '"';
    vbEvent.back() = '"';
    for (int c = 0; c < cClients; c++)
    {
        GUID logId = NewGuid();
        prgLogIds->push_back(logId);
        clients.emplace_back([&, logId] {
            CActivityClient client(120000);
            bool fOk = SUCCEEDED(client.Connect(service.ActivityPipe())) &&
                       SUCCEEDED(client.Start(NewGuid(), logId));
            cReady++;
            while (!fGo)
            {
                Sleep(0);
            }
            GUID eventId = NewGuid();
            for (int e = 0; fOk && e < cEventsPerClient; e++)
            {
                fOk = SUCCEEDED(client.SendEvent(eventId, vbEvent.data(), vbEvent.size()));
            }
            client.Stop();
        });
    }
    while (cReady < cClients)
    {
        Sleep(1);
    }
    double dStart = NowSeconds();
    fGo = true;
    for (std::thread &t : clients)
    {
        t.join();
    }
    WaitUntil([] { return CServiceOperation::LiveCount() == 0; });
    return NowSeconds() - dStart;
}

// The transport alone: AsyncPipe instances whose sink only counts, fed the same event
// messages by the same kind of clients.
double BenchTransport(int cClients, int cEventsPerClient)
{
    std::wstring name = BenchName(L"transport");
    std::atomic<LONGLONG> cMessages{0};
    std::vector<AsyncPipe *> pipes;
    for (int c = 0; c < cClients; c++)
    {
        CBenchCountingSink *pSink = new CBenchCountingSink(&cMessages);
        AsyncPipe *pPipe = new AsyncPipe();
        pPipe->Listen(name.c_str(), pSink, pSink);
        pSink->Release();
        pipes.push_back(pPipe);
    }
    std::atomic<int> cReady{0};
    std::atomic<bool> fGo{false};
    std::vector<std::thread> clients;
    TELVANE_ACTIVITY_EVENT header = {TELVANE_ACTIVITY_EVENT_OPCODE, {}, 1, c_cbEvent};
    std::vector<BYTE> vbMessage(TELVANE_ACTIVITY_EVENT_OVERHEAD + c_cbEvent, 'x');
    CopyMemory(vbMessage.data(), &header, sizeof(header));
    for (int c = 0; c < cClients; c++)
    {
        clients.emplace_back([&] {
            CPipeClient pipe;
            bool fOk = SUCCEEDED(pipe.Connect(name.c_str(), 120000));
            cReady++;
            while (!fGo)
            {
                Sleep(0);
            }
            for (int e = 0; fOk && e < cEventsPerClient; e++)
            {
                fOk = SUCCEEDED(pipe.WriteMessage(vbMessage.data(),
                                                  static_cast<DWORD>(vbMessage.size()), 120000));
            }
        });
    }
    while (cReady < cClients)
    {
        Sleep(1);
    }
    double dStart = NowSeconds();
    fGo = true;
    LONGLONG cTarget = static_cast<LONGLONG>(cClients) * cEventsPerClient;
    while (cMessages.load() < cTarget && NowSeconds() - dStart < 600)
    {
        Sleep(1);
    }
    double dSeconds = NowSeconds() - dStart;
    for (std::thread &t : clients)
    {
        t.join();
    }
    for (AsyncPipe *pPipe : pipes)
    {
        pPipe->Close();
        pPipe->Release();
    }
    return dSeconds;
}

void DeleteLogs(const std::vector<GUID> &rgLogIds)
{
    WIN32_FIND_DATAW data;
    HANDLE hFind = FindFirstFileW(L"C:\\Data\\Test\\WiFiLog\\*", &data);
    if (hFind == INVALID_HANDLE_VALUE)
    {
        return;
    }
    std::vector<std::string> rgTexts;
    for (const GUID &logId : rgLogIds)
    {
        char sz[40];
        snprintf(sz, sizeof(sz), "%08lx-%04x-%04x-%02x%02x-%02x%02x%02x%02x%02x%02x",
                 static_cast<unsigned long>(logId.Data1), logId.Data2, logId.Data3, logId.Data4[0],
                 logId.Data4[1], logId.Data4[2], logId.Data4[3], logId.Data4[4], logId.Data4[5],
                 logId.Data4[6], logId.Data4[7]);
        rgTexts.push_back(sz);
    }
    do
    {
        std::wstring wstrPath = std::wstring(L"C:\\Data\\Test\\WiFiLog\\") + data.cFileName;
        HANDLE hFile = CreateFileW(wstrPath.c_str(), GENERIC_READ, FILE_SHARE_READ, nullptr,
                                   OPEN_EXISTING, 0, nullptr);
        if (hFile == INVALID_HANDLE_VALUE)
        {
            continue;
        }
        char rgch[400] = {};
        DWORD cbRead = 0;
        ReadFile(hFile, rgch, sizeof(rgch) - 1, &cbRead, nullptr);
        CloseHandle(hFile);
        std::string strHead(rgch, cbRead);
        for (const std::string &text : rgTexts)
        {
            if (strHead.find(text) != std::string::npos)
            {
                DeleteFileW(wstrPath.c_str());
                break;
            }
        }
    } while (FindNextFileW(hFind, &data));
    FindClose(hFind);
}

// A registry value to put back at the end (missing stays missing).
struct SavedDword
{
    const wchar_t *wszKey;
    const wchar_t *wszValue;
    bool fPresent;
    DWORD dw;
};

SavedDword SaveAndSet(const wchar_t *wszKey, const wchar_t *wszValue, DWORD dwNew)
{
    SavedDword saved = {wszKey, wszValue, false, 0};
    DWORD cb = sizeof(saved.dw);
    saved.fPresent = RegGetValueW(HKEY_LOCAL_MACHINE, wszKey, wszValue, RRF_RT_REG_DWORD, nullptr,
                                  &saved.dw, &cb) == ERROR_SUCCESS;
    RegHelperSetDword(wszKey, wszValue, dwNew);
    return saved;
}

void Restore(const SavedDword &saved)
{
    if (saved.fPresent)
    {
        RegHelperSetDword(saved.wszKey, saved.wszValue, saved.dw);
    }
    else
    {
        RegHelperDeleteValue(saved.wszKey, saved.wszValue);
    }
}
} // namespace

int main()
{
    setvbuf(stdout, nullptr, _IONBF, 0);
    SavedDword crowd = SaveAndSet(c_wszCrowdKey, L"EnableWifiCrowdsourcing", 3);
    SavedDword test = SaveAndSet(c_wszTestKey, L"EnableTestLogging", 1);
    // The service makes only the last folder of the log directory.
    CreateDirectoryW(L"C:\\Data", nullptr);
    CreateDirectoryW(L"C:\\Data\\Test", nullptr);
    std::vector<GUID> rgLogIds;

    printf("Events of %lu bytes, one message each, into delivered traces:\n",
           static_cast<unsigned long>(c_cbEvent));
    const int c_cEventsTotal = 8000;
    for (int cClients : {1, 8, 32})
    {
        int cPer = c_cEventsTotal / cClients;
        BenchService(cClients, 50, &rgLogIds); // warm-up, not measured
        BenchTransport(cClients, 50);
        double dService = BenchService(cClients, cPer, &rgLogIds);
        double dTransport = BenchTransport(cClients, cPer);
        double cEvents = static_cast<double>(cClients) * cPer;
        printf("%2d client(s): service %8.0f events/s %6.2f MB/s | AsyncPipe counting sink "
               "%8.0f msgs/s %6.2f MB/s | ratio %.2f\n",
               cClients, cEvents / dService, cEvents * c_cbEvent / dService / 1e6,
               cEvents / dTransport, cEvents * c_cbEvent / dTransport / 1e6, dTransport / dService);
    }

    printf("Private bytes:\n");
    {
        CBenchService service;
        Sleep(200);
        double dIdle = PrivateKiB();
        printf("  idle service (listeners only)         %9.0f KiB for the whole process\n", dIdle);
        const int cIdle = 200;
        std::vector<std::unique_ptr<CActivityClient>> rgIdle;
        for (int i = 0; i < cIdle; i++)
        {
            rgIdle.emplace_back(new CActivityClient(120000));
            rgIdle.back()->Connect(service.ActivityPipe());
        }
        Sleep(500);
        double dConnected = PrivateKiB();
        printf("  per idle connected client             %9.1f KiB (%d clients, client side "
               "included)\n",
               (dConnected - dIdle) / cIdle, cIdle);
        const int cOperations = 20;
        std::vector<std::unique_ptr<CActivityClient>> rgOpen;
        std::string strEvent = "{\"n\":12345,\"text\":\"an event of about a hundred bytes, as "
                               "activities send them\"}";
        double dBefore = PrivateKiB();
        for (int i = 0; i < cOperations; i++)
        {
            GUID logId = NewGuid();
            rgLogIds.push_back(logId);
            rgOpen.emplace_back(new CActivityClient(120000));
            rgOpen.back()->Connect(service.ActivityPipe());
            rgOpen.back()->Start(NewGuid(), logId);
            GUID eventId = NewGuid();
            for (int e = 0; e < 1000; e++)
            {
                rgOpen.back()->SendEvent(eventId, strEvent.data(), strEvent.size());
            }
        }
        Sleep(1000);
        double dOpen = PrivateKiB();
        printf("  per open operation, 1000 events       %9.1f KiB (%zu-byte events)\n",
               (dOpen - dBefore) / cOperations, strEvent.size());
    }

    {
        CBenchService service;
        const int cClients = 200;
        std::vector<std::unique_ptr<CActivityClient>> rgClients;
        for (int i = 0; i < cClients; i++)
        {
            GUID logId = NewGuid();
            rgLogIds.push_back(logId);
            rgClients.emplace_back(new CActivityClient(120000));
            rgClients.back()->Connect(service.ActivityPipe());
            rgClients.back()->Start(NewGuid(), logId);
            rgClients.back()->SendEvent(NewGuid(), "1", 1);
        }
        Sleep(1000);
        printf("STOP to STOPPED with %d clients connected: %.2f s\n", cClients, service.Stop());
    }

    DeleteLogs(rgLogIds);
    Restore(crowd);
    Restore(test);
    return 0;
}
