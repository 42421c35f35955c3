// The state-notification stand-in: machine-wide values published by one process (telvanectl's
// platform commands) and seen by another, the subscription lifecycle (including its end from
// inside its own callback), and the query's corner cases.
#include "platform/statenotify/statenotify.h"
#include "platform/statenotify/statenotifypublish.h"
#include "tests/common/testsupport.h"
#include "tests/platform/platformtestsupport.h"

#include <gtest/gtest.h>

#include <mutex>
#include <string>
#include <thread>
#include <vector>

using platformtest::NewStateName;

namespace
{
const WNF_TYPE_ID c_typeId = {
    {0x6d1f2a10, 0x3c4b, 0x4e5f, {0x80, 0x91, 0xa2, 0xb3, 0xc4, 0xd5, 0xe6, 0xf7}}};

struct Delivery
{
    WNF_STATE_NAME stateName;
    WNF_CHANGE_STAMP stamp;
    DWORD dwValue; // 0xFFFFFFFF unless the data was one 32-bit value
    bool fTypeId;  // the subscription's type id came along
    DWORD dwThreadId;
};

// What one subscription's callback saw. The callback runs on a thread of the pool; the test
// thread owns the log and reads it under its lock.
class CDeliveryLog
{
public:
    static NTSTATUS NTAPI Callback(WNF_STATE_NAME stateName, WNF_CHANGE_STAMP stamp,
                                   PWNF_TYPE_ID pTypeId, PVOID pvContext, const VOID *pvData,
                                   ULONG cbData)
    {
        CDeliveryLog *pLog = static_cast<CDeliveryLog *>(pvContext);
        DWORD dwValue = 0xFFFFFFFF;
        if (cbData == sizeof(dwValue))
        {
            memcpy(&dwValue, pvData, sizeof(dwValue));
        }
        if (pLog->m_pfnDuring != nullptr)
        {
            pLog->m_pfnDuring(pLog);
        }
        // Recorded last: once a test sees the delivery, the callback's work is done.
        std::lock_guard<std::mutex> guard(pLog->m_lock);
        pLog->m_rgDeliveries.push_back(
            {stateName, stamp, dwValue,
             pTypeId != nullptr && IsEqualGUID(pTypeId->TypeId, c_typeId.TypeId),
             GetCurrentThreadId()});
        return STATUS_SUCCESS;
    }

    std::vector<Delivery> Deliveries() const
    {
        std::lock_guard<std::mutex> guard(m_lock);
        return m_rgDeliveries;
    }
    size_t Count() const { return Deliveries().size(); }
    bool WaitForCount(size_t c) const
    {
        return testsupport::WaitUntil([&] { return Count() >= c; });
    }
    bool WaitForStamp(WNF_CHANGE_STAMP stamp) const
    {
        return testsupport::WaitUntil([&] {
            std::vector<Delivery> rg = Deliveries();
            return !rg.empty() && rg.back().stamp >= stamp;
        });
    }

    // Runs inside the callback, before the delivery is recorded.
    void (*m_pfnDuring)(CDeliveryLog *pLog) = nullptr;

private:
    mutable std::mutex m_lock;
    std::vector<Delivery> m_rgDeliveries;
};

HRESULT PublishValue(WNF_STATE_NAME stateName, DWORD dwValue, WNF_CHANGE_STAMP *pStamp = nullptr)
{
    return StateNotifyPublish(stateName, &dwValue, sizeof(dwValue), pStamp);
}

PWNF_USER_SUBSCRIPTION Subscribe(WNF_STATE_NAME stateName, WNF_CHANGE_STAMP stamp,
                                 CDeliveryLog *pLog, PCWNF_TYPE_ID pTypeId = nullptr)
{
    PWNF_USER_SUBSCRIPTION pSubscription = nullptr;
    EXPECT_EQ(STATUS_SUCCESS,
              RtlSubscribeWnfStateChangeNotification(&pSubscription, stateName, stamp,
                                                     CDeliveryLog::Callback, pLog, pTypeId, 0, 0));
    EXPECT_NE(nullptr, pSubscription);
    return pSubscription;
}

// The 32-bit value the query reads (0xFFFFFFFF when unpublished), and its stamp.
DWORD QueryValue(WNF_STATE_NAME stateName, WNF_CHANGE_STAMP *pStamp)
{
    DWORD dwValue = 0xFFFFFFFF;
    ULONG cb = sizeof(dwValue);
    EXPECT_EQ(STATUS_SUCCESS,
              NtQueryWnfStateData(&stateName, nullptr, nullptr, pStamp, &dwValue, &cb));
    EXPECT_EQ(*pStamp == 0 ? 0u : sizeof(DWORD), cb);
    return dwValue;
}

WNF_CHANGE_STAMP StampOf(WNF_STATE_NAME stateName)
{
    WNF_CHANGE_STAMP stamp = 0;
    QueryValue(stateName, &stamp);
    return stamp;
}

// A subscription that has ended gets nothing more: a later subscription to the same state
// sees the next two publications, and by then the ended one has seen nothing new.
void ExpectNoMoreDeliveries(WNF_STATE_NAME stateName, const CDeliveryLog &ended)
{
    size_t cBefore = ended.Count();
    CDeliveryLog later;
    WNF_CHANGE_STAMP stamp = StampOf(stateName);
    PWNF_USER_SUBSCRIPTION pLater = Subscribe(stateName, stamp, &later);
    ASSERT_HRESULT_SUCCEEDED(PublishValue(stateName, 40));
    ASSERT_HRESULT_SUCCEEDED(PublishValue(stateName, 41));
    ASSERT_TRUE(later.WaitForStamp(stamp + 2));
    EXPECT_EQ(STATUS_SUCCESS, RtlUnsubscribeWnfNotificationWaitForCompletion(pLater));
    EXPECT_EQ(cBefore, ended.Count());
}
} // namespace

TEST(StateNotify, RefusesMissingArguments)
{
    WNF_STATE_NAME stateName = NewStateName();
    DWORD dwValue = 0;
    ULONG cb = sizeof(dwValue);
    WNF_CHANGE_STAMP stamp = 0;
    const NTSTATUS c_status = static_cast<NTSTATUS>(STATUS_INVALID_PARAMETER);
    EXPECT_EQ(c_status, NtQueryWnfStateData(nullptr, nullptr, nullptr, &stamp, &dwValue, &cb));
    EXPECT_EQ(c_status,
              NtQueryWnfStateData(&stateName, nullptr, nullptr, &stamp, &dwValue, nullptr));
    // A size without a buffer.
    EXPECT_EQ(c_status, NtQueryWnfStateData(&stateName, nullptr, nullptr, &stamp, nullptr, &cb));

    CDeliveryLog log;
    PWNF_USER_SUBSCRIPTION pSubscription = nullptr;
    PWNF_USER_CALLBACK pfn = CDeliveryLog::Callback;
    EXPECT_EQ(c_status, RtlSubscribeWnfStateChangeNotification(nullptr, stateName, 0, pfn, &log,
                                                               nullptr, 0, 0));
    EXPECT_EQ(c_status, RtlSubscribeWnfStateChangeNotification(&pSubscription, stateName, 0,
                                                               nullptr, &log, nullptr, 0, 0));
    EXPECT_EQ(nullptr, pSubscription);
    pSubscription = reinterpret_cast<PWNF_USER_SUBSCRIPTION>(1);
    EXPECT_EQ(c_status, RtlSubscribeWnfStateChangeNotification(&pSubscription, stateName, 0, pfn,
                                                               &log, nullptr, 0, 1)); // flags
    EXPECT_EQ(nullptr, pSubscription);
    EXPECT_EQ(c_status, RtlUnsubscribeWnfNotificationWaitForCompletion(nullptr));
}

TEST(StateNotify, QueryReturnsTheLatestPublicationWithItsStamp)
{
    WNF_STATE_NAME stateName = NewStateName();
    std::vector<BYTE> vbFull(WNF_STATE_MAX_DATA_SIZE);
    for (size_t i = 0; i < vbFull.size(); i++)
    {
        vbFull[i] = static_cast<BYTE>(i * 7);
    }
    // Never published: stamp 0 and no data, the buffer untouched.
    WNF_CHANGE_STAMP stamp = 99;
    ULONG cb = static_cast<ULONG>(vbFull.size());
    EXPECT_EQ(STATUS_SUCCESS,
              NtQueryWnfStateData(&stateName, nullptr, nullptr, &stamp, vbFull.data(), &cb));
    EXPECT_EQ(0u, stamp);
    EXPECT_EQ(0u, cb);
    EXPECT_EQ(7, vbFull[1]);
    ASSERT_HRESULT_SUCCEEDED(StateNotifyPublish(stateName, nullptr, 0, &stamp));
    EXPECT_EQ(1u, stamp);
    ASSERT_HRESULT_SUCCEEDED(
        StateNotifyPublish(stateName, vbFull.data(), static_cast<ULONG>(vbFull.size()), &stamp));
    EXPECT_EQ(2u, stamp);
    EXPECT_EQ(HRESULT_FROM_WIN32(ERROR_INVALID_PARAMETER),
              StateNotifyPublish(stateName, vbFull.data(), WNF_STATE_MAX_DATA_SIZE + 1, nullptr));

    std::vector<BYTE> vbRead(WNF_STATE_MAX_DATA_SIZE + 16, 0xEE);
    cb = static_cast<ULONG>(vbRead.size());
    stamp = 0;
    ASSERT_EQ(STATUS_SUCCESS,
              NtQueryWnfStateData(&stateName, nullptr, nullptr, &stamp, vbRead.data(), &cb));
    EXPECT_EQ(2u, stamp);
    ASSERT_EQ(WNF_STATE_MAX_DATA_SIZE, cb);
    EXPECT_EQ(0, memcmp(vbFull.data(), vbRead.data(), cb));

    // Too small a buffer gets nothing, and the size it would need.
    std::vector<BYTE> vbSmall(16, 0xEE);
    cb = static_cast<ULONG>(vbSmall.size());
    EXPECT_EQ(STATUS_BUFFER_TOO_SMALL,
              NtQueryWnfStateData(&stateName, nullptr, nullptr, &stamp, vbSmall.data(), &cb));
    EXPECT_EQ(WNF_STATE_MAX_DATA_SIZE, cb);
    EXPECT_EQ(std::vector<BYTE>(16, 0xEE), vbSmall);
}

TEST(StateNotify, ConcurrentPublishersRaiseTheStampOncePerPublication)
{
    WNF_STATE_NAME stateName = NewStateName();
    const int c_cThreads = 6;
    const int c_cEach = 25;
    std::vector<std::thread> threads;
    std::vector<HRESULT> rghr(c_cThreads, S_OK);
    for (int iThread = 0; iThread < c_cThreads; iThread++)
    {
        threads.emplace_back([&, iThread] {
            for (int i = 0; i < c_cEach && SUCCEEDED(rghr[iThread]); i++)
            {
                rghr[iThread] = PublishValue(stateName, static_cast<DWORD>(iThread));
            }
        });
    }
    // And one more process at the same time, through its own handles of the same mutex.
    EXPECT_EQ(0u, testsupport::RunTelvanectl(L"platform state " +
                                             platformtest::StateNameText(stateName) + L" 77")
                      .dwExitCode);
    for (std::thread &t : threads)
    {
        t.join();
    }
    for (HRESULT hr : rghr)
    {
        EXPECT_HRESULT_SUCCEEDED(hr);
    }
    EXPECT_EQ(static_cast<WNF_CHANGE_STAMP>(c_cThreads * c_cEach + 1), StampOf(stateName));
}

TEST(TelvanectlPlatform, RefusesBadArgumentsAndPublishesNothing)
{
    WNF_STATE_NAME stateName = NewStateName();
    const std::wstring wstrState = L"platform state " + platformtest::StateNameText(stateName);
    struct Case
    {
        std::wstring wstrArgs;
        const char *szProblem;
    };
    const Case rgCases[] = {
        {L"platform state", "needs a state NAME"},
        {L"platform state zz 1", "needs a state NAME"},
        {L"platform state 0x10000000000000000 1", "needs a state NAME"},
        {wstrState + L" -1", "VALUE must be"},
        {wstrState + L" 4294967296", "VALUE must be"},
        {wstrState + L" 0x", "VALUE must be"},
        {wstrState + L" 12abc", "VALUE must be"},
        {wstrState + L" 1 2", "too many arguments"},
        {L"platform backlight 1 2", "too many arguments"},
        {L"platform power on", "VALUE must be"},
    };
    for (const Case &c : rgCases)
    {
        SCOPED_TRACE(testsupport::Narrow(c.wstrArgs));
        testsupport::ChildResult result = testsupport::RunTelvanectl(c.wstrArgs);
        EXPECT_EQ(2u, result.dwExitCode);
        EXPECT_NE(std::string::npos, result.strOutput.find(c.szProblem)) << result.strOutput;
    }
    WNF_CHANGE_STAMP stamp = 0;
    QueryValue(stateName, &stamp);
    EXPECT_EQ(0u, stamp);
}

// What telvanectl publishes from a process of its own, as the phone's components do, reaches
// a subscriber (on a thread of the pool, with its type id) and the query, and shows again;
// an unsubscribe while idle ends the deliveries. Data of another size shows as bytes.
TEST(TelvanectlPlatform, StatePublishesToSubscribersAndShows)
{
    WNF_STATE_NAME stateName = NewStateName();
    const std::wstring wstrState = L"platform state " + platformtest::StateNameText(stateName);
    const std::string strLabel =
        "state " + testsupport::Narrow(platformtest::StateNameText(stateName));
    // A subscriber creates the state's key to watch it; the state still reads unpublished.
    CDeliveryLog log;
    PWNF_USER_SUBSCRIPTION pSubscription = Subscribe(stateName, 0, &log, &c_typeId);
    EXPECT_EQ(strLabel + ": not published\r\n", testsupport::RunTelvanectl(wstrState).strOutput);

    struct Case
    {
        const wchar_t *wszValue;
        DWORD dwExpected;
    };
    const Case rgCases[] = {
        {L"5", 5}, {L"0", 0}, {L"4294967295", 0xFFFFFFFF}, {L"0x1F", 31}, {L"0XaB", 171}};
    WNF_CHANGE_STAMP stamp = 0;
    for (const Case &c : rgCases)
    {
        SCOPED_TRACE(testsupport::Narrow(c.wszValue));
        stamp++;
        const std::string strLine = strLabel + " = " + std::to_string(c.dwExpected) +
                                    " (change stamp " + std::to_string(stamp) + ")\r\n";
        testsupport::ChildResult result = testsupport::RunTelvanectl(wstrState + L" " + c.wszValue);
        EXPECT_EQ(0u, result.dwExitCode);
        EXPECT_EQ(strLine, result.strOutput);
        // Each publication is awaited before the next, so none is folded into another.
        ASSERT_TRUE(log.WaitForCount(stamp));
        WNF_CHANGE_STAMP stampRead = 0;
        EXPECT_EQ(c.dwExpected, QueryValue(stateName, &stampRead));
        EXPECT_EQ(stamp, stampRead);
        EXPECT_EQ(strLine, testsupport::RunTelvanectl(wstrState).strOutput);
    }
    EXPECT_EQ(STATUS_SUCCESS, RtlUnsubscribeWnfNotificationWaitForCompletion(pSubscription));
    std::vector<Delivery> rg = log.Deliveries();
    ASSERT_EQ(ARRAYSIZE(rgCases), rg.size());
    for (size_t i = 0; i < rg.size(); i++)
    {
        EXPECT_EQ(stateName, rg[i].stateName);
        EXPECT_EQ(i + 1, rg[i].stamp);
        EXPECT_EQ(rgCases[i].dwExpected, rg[i].dwValue);
        EXPECT_TRUE(rg[i].fTypeId);
        EXPECT_NE(GetCurrentThreadId(), rg[i].dwThreadId);
    }
    ExpectNoMoreDeliveries(stateName, log);

    const BYTE rgb[] = {0x01, 0xA2};
    ASSERT_HRESULT_SUCCEEDED(StateNotifyPublish(stateName, rgb, sizeof(rgb), nullptr));
    EXPECT_EQ(strLabel + " = 2 bytes: 01 a2 (change stamp " + std::to_string(stamp + 3) + ")\r\n",
              testsupport::RunTelvanectl(wstrState).strOutput);
}

TEST(StateNotify, SubscriptionStartsAfterTheStampItIsGiven)
{
    struct Case
    {
        WNF_CHANGE_STAMP stampGiven;
        std::vector<WNF_CHANGE_STAMP> rgStampsExpected; // after publications 1, 2, subscribe, 3
    };
    const Case rgCases[] = {
        {0, {2, 3}}, // the current value at once, then the change
        {1, {2, 3}},
        {2, {3}}, // the subscriber has seen the current value
    };
    for (const Case &c : rgCases)
    {
        SCOPED_TRACE(c.stampGiven);
        WNF_STATE_NAME stateName = NewStateName();
        ASSERT_HRESULT_SUCCEEDED(PublishValue(stateName, 1));
        ASSERT_HRESULT_SUCCEEDED(PublishValue(stateName, 2));
        CDeliveryLog log;
        PWNF_USER_SUBSCRIPTION pSubscription = Subscribe(stateName, c.stampGiven, &log);
        if (c.rgStampsExpected.size() > 1)
        {
            // The first delivery is the current value, before anything else is published:
            // a publication racing it could fold both into one call.
            ASSERT_TRUE(log.WaitForCount(1));
        }
        ASSERT_HRESULT_SUCCEEDED(PublishValue(stateName, 3));
        ASSERT_TRUE(log.WaitForStamp(3));
        EXPECT_EQ(STATUS_SUCCESS, RtlUnsubscribeWnfNotificationWaitForCompletion(pSubscription));
        std::vector<WNF_CHANGE_STAMP> rgStamps;
        for (const Delivery &d : log.Deliveries())
        {
            rgStamps.push_back(d.stamp);
            EXPECT_EQ(d.stamp, d.dwValue);
        }
        EXPECT_EQ(c.rgStampsExpected, rgStamps);
    }
}

TEST(StateNotify, UnsubscribeFromAnotherThreadWaitsForTheRunningCallback)
{
    WNF_STATE_NAME stateName = NewStateName();
    static HANDLE s_hEntered = CreateEventW(nullptr, TRUE, FALSE, nullptr);
    static HANDLE s_hRelease = CreateEventW(nullptr, TRUE, FALSE, nullptr);
    static volatile LONG s_fCallbackDone = 0;
    CDeliveryLog log;
    log.m_pfnDuring = [](CDeliveryLog *) {
        SetEvent(s_hEntered);
        WaitForSingleObject(s_hRelease, INFINITE);
        InterlockedExchange(&s_fCallbackDone, 1);
    };
    PWNF_USER_SUBSCRIPTION pSubscription = Subscribe(stateName, 0, &log);
    ASSERT_HRESULT_SUCCEEDED(PublishValue(stateName, 1));
    ASSERT_EQ(WAIT_OBJECT_0, WaitForSingleObject(s_hEntered, testsupport::c_dwWaitMs));

    LONG fDoneWhenUnsubscribed = -1;
    std::thread unsubscriber([&] {
        EXPECT_EQ(STATUS_SUCCESS, RtlUnsubscribeWnfNotificationWaitForCompletion(pSubscription));
        fDoneWhenUnsubscribed = InterlockedCompareExchange(&s_fCallbackDone, 0, 0);
    });
    // Give the unsubscribe a chance to be waiting before the callback is let go; if it is
    // not yet, the check below holds trivially.
    Sleep(200);
    SetEvent(s_hRelease);
    unsubscriber.join();
    EXPECT_EQ(1, fDoneWhenUnsubscribed);
    ExpectNoMoreDeliveries(stateName, log);
    EXPECT_EQ(1u, log.Count());
}

// The service DLL may be unloaded as soon as its stop is reported, and its launcher ends its
// subscription from inside the subscription's callback: the code the callback returns into
// must stay loaded until the callback has left it. A subscription its owner ended holds the
// module no longer either.
TEST(StateNotify, SubscriptionHoldsItsCallbacksModuleUntilItHasEnded)
{
    const wchar_t c_wszTestDll[] = L"statenotifytest.dll";
    HMODULE hDll = LoadLibraryW((testsupport::BinDir() + c_wszTestDll).c_str());
    ASSERT_NE(nullptr, hDll);
    auto pfnExport = [&](const char *szName) {
        return reinterpret_cast<void *>(GetProcAddress(hDll, szName));
    };
    auto pfnPlain = reinterpret_cast<NTSTATUS (*)(WNF_STATE_NAME)>(pfnExport("SubscribePlain"));
    auto pfnUnsubscribe = reinterpret_cast<NTSTATUS (*)()>(pfnExport("UnsubscribePlain"));
    auto pfnSelfEnding = reinterpret_cast<NTSTATUS (*)(WNF_STATE_NAME, HANDLE, HANDLE)>(
        pfnExport("SubscribeSelfEnding"));
    ASSERT_TRUE(pfnPlain != nullptr && pfnUnsubscribe != nullptr && pfnSelfEnding != nullptr);

    WNF_STATE_NAME stateName = NewStateName();
    ASSERT_EQ(STATUS_SUCCESS, pfnPlain(stateName));
    ASSERT_HRESULT_SUCCEEDED(PublishValue(stateName, 1));
    EXPECT_EQ(STATUS_SUCCESS, pfnUnsubscribe());

    HANDLE hUnsubscribed = CreateEventW(nullptr, TRUE, FALSE, nullptr);
    HANDLE hGo = CreateEventW(nullptr, TRUE, FALSE, nullptr);
    // The state is published already: the first delivery comes at once.
    ASSERT_EQ(STATUS_SUCCESS, pfnSelfEnding(stateName, hUnsubscribed, hGo));
    ASSERT_EQ(WAIT_OBJECT_0, WaitForSingleObject(hUnsubscribed, testsupport::c_dwWaitMs));

    // The subscription has ended, as far as its owner knows, and the owner lets go.
    FreeLibrary(hDll);
    EXPECT_NE(nullptr, GetModuleHandleW(c_wszTestDll));
    SetEvent(hGo);
    // A thread of the pool may still be on its way out of the module.
    EXPECT_TRUE(testsupport::WaitUntil([&] { return GetModuleHandleW(c_wszTestDll) == nullptr; }));
    CloseHandle(hUnsubscribed);
    CloseHandle(hGo);
}

// The store is an ordinary registry value that anybody with the rights can overwrite: what
// no publisher writes is refused by the query, skipped by subscribers, and repaired by the
// next publication.
TEST(StateNotify, ValueNoPublisherWroteIsRefusedThenRepaired)
{
    struct Case
    {
        const char *szWhat;
        DWORD dwType;
        std::vector<BYTE> vbValue;
    };
    const Case rgCases[] = {
        {"text", REG_SZ, {'x', 0, 0, 0}},
        {"shorter than a stamp", REG_BINARY, {1, 0, 0}},
        {"stamp 0", REG_BINARY, {0, 0, 0, 0, 9}},
        {"more data than a state holds", REG_BINARY,
         std::vector<BYTE>(sizeof(WNF_CHANGE_STAMP) + WNF_STATE_MAX_DATA_SIZE + 1, 1)},
    };
    for (const Case &c : rgCases)
    {
        SCOPED_TRACE(c.szWhat);
        WNF_STATE_NAME stateName = NewStateName();
        CDeliveryLog log;
        PWNF_USER_SUBSCRIPTION pSubscription = Subscribe(stateName, 0, &log);
        testsupport::HklmSetBytes(L"SOFTWARE\\Telvane\\Platform\\StateNotification\\" +
                                      platformtest::StateNameText(stateName).substr(2),
                                  L"Data", c.dwType, c.vbValue.data(),
                                  static_cast<DWORD>(c.vbValue.size()));

        BYTE rgb[WNF_STATE_MAX_DATA_SIZE];
        ULONG cb = sizeof(rgb);
        WNF_CHANGE_STAMP stamp = 0;
        EXPECT_EQ(static_cast<NTSTATUS>(0xC0070000 | ERROR_INVALID_DATA),
                  NtQueryWnfStateData(&stateName, nullptr, nullptr, &stamp, rgb, &cb));

        ASSERT_HRESULT_SUCCEEDED(PublishValue(stateName, 6, &stamp));
        EXPECT_EQ(1u, stamp);
        ASSERT_TRUE(log.WaitForStamp(1));
        EXPECT_EQ(STATUS_SUCCESS, RtlUnsubscribeWnfNotificationWaitForCompletion(pSubscription));
        std::vector<Delivery> rg = log.Deliveries();
        ASSERT_EQ(1u, rg.size());
        EXPECT_EQ(6u, rg[0].dwValue);
    }
}
