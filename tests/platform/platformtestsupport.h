// Helpers of the platform stand-ins' tests: fresh state names, telvanectl as a child
// process, and a record of the deliveries a subscription received.
#pragma once

#include "platform/statenotify/statenotify.h"

#include <windows.h>
#include <string>
#include <vector>

namespace platformtest
{
// A state name nobody has used in this prefix (random, so that runs never meet).
WNF_STATE_NAME NewStateName();

// "0x" and sixteen hex digits, as telvanectl takes a state name.
std::wstring StateNameText(WNF_STATE_NAME stateName);

// Path of telvanectl.exe beside the test executable, quoted for a command line.
std::wstring TelvanectlCommand();

struct Delivery
{
    WNF_STATE_NAME stateName = 0;
    WNF_CHANGE_STAMP stamp = 0;
    std::vector<BYTE> vbData;
    bool fHadTypeId = false;
    GUID typeId = {};
    DWORD dwThreadId = 0;
};

// What one subscription's callback saw. The callback may run on any thread; the test thread
// reads the record through the accessors.
class CDeliveryLog
{
public:
    CDeliveryLog();
    ~CDeliveryLog();
    CDeliveryLog(const CDeliveryLog &) = delete;
    CDeliveryLog &operator=(const CDeliveryLog &) = delete;

    // The callback to subscribe with; the log is its context.
    static NTSTATUS NTAPI Callback(WNF_STATE_NAME stateName, WNF_CHANGE_STAMP stamp,
                                   PWNF_TYPE_ID pTypeId, PVOID pvContext, const VOID *pvData,
                                   ULONG cbData);

    // Waits until at least cDeliveries arrived; false when they did not within a generous
    // limit (a hang, not a measurement).
    bool WaitForCount(size_t cDeliveries);
    // Waits until a delivery with at least this stamp arrived.
    bool WaitForStamp(WNF_CHANGE_STAMP stamp);
    std::vector<Delivery> Deliveries() const;
    size_t Count() const;

    // Runs inside the callback, after the delivery is recorded and before waiters are told.
    void (*m_pfnDuring)(CDeliveryLog *pLog) = nullptr;
    PWNF_USER_SUBSCRIPTION m_pSubscription = nullptr;
    NTSTATUS m_statusInCallback = 0;

private:
    mutable CRITICAL_SECTION m_cs;
    std::vector<Delivery> m_rgDeliveries;
    HANDLE m_hDelivered;
};

// The 32-bit value of a delivery or query, as telvanectl publishes it.
DWORD ValueOf(const std::vector<BYTE> &vbData);
} // namespace platformtest
