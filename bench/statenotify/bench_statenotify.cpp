// What the state-notification stand-in costs under Wine: publications and queries per
// second, and the time from a publication to its delivery for 1 and 8 subscribers (each a
// registry write, a registry notification and a thread-pool wait through the wineserver).
#include "platform/statenotify/statenotify.h"
#include "platform/statenotify/statenotifypublish.h"

#include <rpc.h>
#include <stdio.h>
#include <string.h>
#include <algorithm>
#include <vector>

namespace
{
double NowSeconds()
{
    LARGE_INTEGER li, freq;
    QueryPerformanceCounter(&li);
    QueryPerformanceFrequency(&freq);
    return static_cast<double>(li.QuadPart) / static_cast<double>(freq.QuadPart);
}

WNF_STATE_NAME BenchStateName()
{
    UUID uuid;
    UuidCreate(&uuid);
    WNF_STATE_NAME stateName = 0;
    memcpy(&stateName, &uuid, sizeof(stateName));
    return stateName;
}

// Each subscriber signals its own event when it has seen the stamp the bench waits for.
struct Subscriber
{
    HANDLE hSeen = nullptr;
    volatile LONG stampWanted = 0;
    PWNF_USER_SUBSCRIPTION pSubscription = nullptr;
};

NTSTATUS NTAPI OnChange(WNF_STATE_NAME, WNF_CHANGE_STAMP stamp, PWNF_TYPE_ID, PVOID pvContext,
                        const VOID *, ULONG)
{
    Subscriber *p = static_cast<Subscriber *>(pvContext);
    if (static_cast<LONG>(stamp) >= p->stampWanted)
    {
        SetEvent(p->hSeen);
    }
    return STATUS_SUCCESS;
}

void BenchPublishAndQuery()
{
    WNF_STATE_NAME stateName = BenchStateName();
    const int c_cPublish = 1000;
    DWORD dwValue = 0;
    double dStart = NowSeconds();
    for (int i = 0; i < c_cPublish; i++)
    {
        dwValue = static_cast<DWORD>(i);
        StateNotifyPublish(stateName, &dwValue, sizeof(dwValue), nullptr);
    }
    double dPublish = NowSeconds() - dStart;

    const int c_cQuery = 5000;
    dStart = NowSeconds();
    for (int i = 0; i < c_cQuery; i++)
    {
        ULONG cb = sizeof(dwValue);
        WNF_CHANGE_STAMP stamp = 0;
        NtQueryWnfStateData(&stateName, nullptr, nullptr, &stamp, &dwValue, &cb);
    }
    double dQuery = NowSeconds() - dStart;
    printf("publish (no subscriber)   %8.0f per s  %8.1f us each\n", c_cPublish / dPublish,
           dPublish * 1e6 / c_cPublish);
    printf("query                     %8.0f per s  %8.1f us each\n", c_cQuery / dQuery,
           dQuery * 1e6 / c_cQuery);
}

void BenchDelivery(size_t cSubscribers)
{
    WNF_STATE_NAME stateName = BenchStateName();
    std::vector<Subscriber> subscribers(cSubscribers);
    std::vector<HANDLE> rgh;
    for (Subscriber &s : subscribers)
    {
        s.hSeen = CreateEventW(nullptr, FALSE, FALSE, nullptr);
        rgh.push_back(s.hSeen);
        RtlSubscribeWnfStateChangeNotification(&s.pSubscription, stateName, 0, OnChange, &s,
                                               nullptr, 0, 0);
    }
    const int c_cRounds = 300;
    std::vector<double> rgdLatency;
    for (int i = 1; i <= c_cRounds; i++)
    {
        for (Subscriber &s : subscribers)
        {
            InterlockedExchange(&s.stampWanted, i);
        }
        DWORD dwValue = static_cast<DWORD>(i);
        double dStart = NowSeconds();
        StateNotifyPublish(stateName, &dwValue, sizeof(dwValue), nullptr);
        if (WaitForMultipleObjects(static_cast<DWORD>(rgh.size()), rgh.data(), TRUE, 10000) ==
            WAIT_TIMEOUT)
        {
            printf("delivery to %zu subscriber(s): a publication was not delivered\n",
                   cSubscribers);
            break;
        }
        rgdLatency.push_back(NowSeconds() - dStart);
    }
    for (Subscriber &s : subscribers)
    {
        RtlUnsubscribeWnfNotificationWaitForCompletion(s.pSubscription);
        CloseHandle(s.hSeen);
    }
    if (rgdLatency.empty())
    {
        return;
    }
    std::sort(rgdLatency.begin(), rgdLatency.end());
    printf("publish to delivered, %zu subscriber(s): median %7.1f us  p90 %7.1f us  (%zu rounds)\n",
           cSubscribers, rgdLatency[rgdLatency.size() / 2] * 1e6,
           rgdLatency[rgdLatency.size() * 9 / 10] * 1e6, rgdLatency.size());
}
} // namespace

int main()
{
    setvbuf(stdout, nullptr, _IONBF, 0);
    BenchPublishAndQuery();
    BenchDelivery(1);
    BenchDelivery(8);
    return 0;
}
