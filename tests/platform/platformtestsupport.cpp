#include "tests/platform/platformtestsupport.h"

#include "tests/common/testsupport.h"

#include <rpc.h>
#include <string.h>

namespace platformtest
{
namespace
{
// Long enough for a loaded two-core machine under Wine; only a hang reaches it.
const DWORD c_dwDeliveryLimitMs = 30000;
} // namespace

WNF_STATE_NAME NewStateName()
{
    UUID uuid;
    UuidCreate(&uuid);
    WNF_STATE_NAME stateName = 0;
    memcpy(&stateName, &uuid, sizeof(stateName));
    return stateName;
}

std::wstring StateNameText(WNF_STATE_NAME stateName)
{
    wchar_t wsz[24];
    swprintf(wsz, ARRAYSIZE(wsz), L"0x%016llx", static_cast<unsigned long long>(stateName));
    return wsz;
}

std::wstring TelvanectlCommand()
{
    return L"\"" + testsupport::BinDir() + L"telvanectl.exe\"";
}

CDeliveryLog::CDeliveryLog()
    : m_hDelivered(CreateEventW(nullptr, FALSE, FALSE, nullptr))
{
    InitializeCriticalSection(&m_cs);
}

CDeliveryLog::~CDeliveryLog()
{
    CloseHandle(m_hDelivered);
    DeleteCriticalSection(&m_cs);
}

NTSTATUS NTAPI CDeliveryLog::Callback(WNF_STATE_NAME stateName, WNF_CHANGE_STAMP stamp,
                                      PWNF_TYPE_ID pTypeId, PVOID pvContext, const VOID *pvData,
                                      ULONG cbData)
{
    CDeliveryLog *pLog = static_cast<CDeliveryLog *>(pvContext);
    Delivery delivery;
    delivery.stateName = stateName;
    delivery.stamp = stamp;
    const BYTE *pb = static_cast<const BYTE *>(pvData);
    delivery.vbData.assign(pb, pb + cbData);
    delivery.fHadTypeId = pTypeId != nullptr;
    if (pTypeId != nullptr)
    {
        delivery.typeId = pTypeId->TypeId;
    }
    delivery.dwThreadId = GetCurrentThreadId();
    EnterCriticalSection(&pLog->m_cs);
    pLog->m_rgDeliveries.push_back(delivery);
    LeaveCriticalSection(&pLog->m_cs);
    if (pLog->m_pfnDuring != nullptr)
    {
        pLog->m_pfnDuring(pLog);
    }
    SetEvent(pLog->m_hDelivered);
    return STATUS_SUCCESS;
}

bool CDeliveryLog::WaitForCount(size_t cDeliveries)
{
    ULONGLONG ullEnd = GetTickCount64() + c_dwDeliveryLimitMs;
    while (Count() < cDeliveries)
    {
        ULONGLONG ullNow = GetTickCount64();
        if (ullNow >= ullEnd ||
            WaitForSingleObject(m_hDelivered, static_cast<DWORD>(ullEnd - ullNow)) != WAIT_OBJECT_0)
        {
            return Count() >= cDeliveries;
        }
    }
    return true;
}

bool CDeliveryLog::WaitForStamp(WNF_CHANGE_STAMP stamp)
{
    ULONGLONG ullEnd = GetTickCount64() + c_dwDeliveryLimitMs;
    for (;;)
    {
        std::vector<Delivery> rg = Deliveries();
        if (!rg.empty() && rg.back().stamp >= stamp)
        {
            return true;
        }
        ULONGLONG ullNow = GetTickCount64();
        if (ullNow >= ullEnd ||
            WaitForSingleObject(m_hDelivered, static_cast<DWORD>(ullEnd - ullNow)) != WAIT_OBJECT_0)
        {
            rg = Deliveries();
            return !rg.empty() && rg.back().stamp >= stamp;
        }
    }
}

std::vector<Delivery> CDeliveryLog::Deliveries() const
{
    EnterCriticalSection(&m_cs);
    std::vector<Delivery> rg = m_rgDeliveries;
    LeaveCriticalSection(&m_cs);
    return rg;
}

size_t CDeliveryLog::Count() const
{
    EnterCriticalSection(&m_cs);
    size_t c = m_rgDeliveries.size();
    LeaveCriticalSection(&m_cs);
    return c;
}

DWORD ValueOf(const std::vector<BYTE> &vbData)
{
    DWORD dw = 0xFFFFFFFF;
    if (vbData.size() == sizeof(dw))
    {
        memcpy(&dw, vbData.data(), sizeof(dw));
    }
    return dw;
}
} // namespace platformtest
