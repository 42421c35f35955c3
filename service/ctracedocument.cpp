#include "service/ctracedocument.h"

#include "inc/handleholder.h"
#include "lib/jsonvalidator.h"
#include "platform/deviceinfo/deviceinfo.h"
#include "service/tracesinks.h"
#include "servicelib/eventtrace.h"

#include <cwchar>

namespace
{
const DWORD c_dwJsonVersion = 24;
const wchar_t c_wszConnIdKey[] = L"System\\CurrentControlSet\\Services\\Ambrel\\Parameters\\Config";
const wchar_t c_wszConnIdValue[] = L"ConnID";
const wchar_t c_wszZeroGuid[] = L"00000000-0000-0000-0000-000000000000";
const DWORD c_cchPhoneBuffer = 1024;

// What a log's text holds beside the record values: the header with the device description,
// each record's {"TimeStamp":...,"Value":} and each group's "ID<guid>":[].
const size_t c_cbHeaderEstimate = 4096;
const size_t c_cbRecordOverheadEstimate = 48;
const size_t c_cbGroupOverheadEstimate = 48;

const char *const c_rgszPhoneItemKeys[c_cPhoneInformationItems] = {
    "Manufacturer",
    "RomVersion",
    "PhoneMobileOperatorName",
    "PhoneMobileOperatorDisplayName",
    "PhoneModelName",
    "PhoneManufacturerModelName",
    "PhoneHardwareRevision",
    "PhoneSOCVersion",
    "PhoneFirmwareRevision",
    "PhoneRadioHardwareRevision",
    "PhoneRadioSoftwareRevision",
    "PhoneBootLoaderVersion",
    "PhoneSupportPhoneNumber",
    "PhoneSupportLink",
    "PhoneOEMSupportLink",
    "PhoneFriendlyName",
};

static_assert(sizeof(OSVERSIONINFOW) == 276, "the version record is 276 bytes");

// A fixed text field of the build record, terminated here even if the library filled it
// to the last character.
template <size_t N>
std::wstring FieldText(const WCHAR (&wszField)[N])
{
    size_t cch = 0;
    while (cch < N && wszField[cch] != L'\0')
    {
        cch++;
    }
    return std::wstring(wszField, cch);
}
} // namespace

CTraceDocument::CTraceDocument()
    : m_guidActivity()
    , m_guidSession()
    , m_guidLog()
    , m_EventGroups(8)
    , m_ulLogCount(1)
    , m_cbRecorded(0)
    , m_cRecords(0)
    , m_pfnTimeConversion(nullptr)
{
    m_EventGroups.max_load_factor(1.0f);
}

CTraceDocument::~CTraceDocument()
{
    m_EventGroups.clear();
    m_pTrace.Release();
}

void CTraceDocument::Begin(const GUID &activityId, const GUID &sessionId, const GUID &logId)
{
    m_guidActivity = activityId;
    m_guidSession = sessionId;
    m_guidLog = logId;
    m_ulLogCount = 1;
    NewTrace();
    BeginLog(true);
}

void CTraceDocument::NewTrace()
{
    m_pTrace.Release();
    CJsonObject *pTrace = new CJsonObject();
    m_pTrace = pTrace;
    pTrace->Release(0);
}

bool CTraceDocument::Now(ULONGLONG &ullNow) const
{
    SYSTEMTIME st;
    GetSystemTime(&st);
    FILETIME ft;
    BOOL fOk = m_pfnTimeConversion != nullptr ? m_pfnTimeConversion(&st, &ft)
                                              : SystemTimeToFileTime(&st, &ft);
    if (!fOk)
    {
        return false;
    }
    ullNow = (static_cast<ULONGLONG>(ft.dwHighDateTime) << 32) | ft.dwLowDateTime;
    return true;
}

void CTraceDocument::BeginLog(bool fFirst)
{
    CJsonObject *pTrace = m_pTrace;
    pTrace->AddGuid("ActivityID", m_guidActivity);
    pTrace->AddGuid("SessionID", m_guidSession);
    if (fFirst)
    {
        pTrace->AddDword("JsonVersion", c_dwJsonVersion);
    }
    pTrace->AddGuid("LogID", m_guidLog);
    pTrace->AddString("WiFiConnID", ReadWiFiConnId().c_str());
    pTrace->AddDword("LogCount", fFirst ? 1 : m_ulLogCount);
    if (!fFirst)
    {
        pTrace->AddDword("JsonVersion", c_dwJsonVersion);
    }
    ULONGLONG ullNow;
    if (Now(ullNow))
    {
        pTrace->AddUlonglong("TimeStamp", ullNow);
    }
    AddDeviceInformation();
}

void CTraceDocument::AddDeviceInformation()
{
    OSVERSIONINFOW version = {};
    version.dwOSVersionInfoSize = 276;
#ifdef _MSC_VER
#pragma warning(suppress : 4996) // the version the platform reports is what the trace wants
#endif
    if (!GetVersionExW(&version))
    {
        return;
    }
    CJsonObject *pOrvex = new CJsonObject();
    pOrvex->AddDouble("Major", version.dwMajorVersion);
    pOrvex->AddDouble("Minor", version.dwMinorVersion);
    pOrvex->AddDouble("Build", version.dwBuildNumber);
    pOrvex->AddDouble("PlatformId", version.dwPlatformId);
    m_pTrace->AddObject("Orvex", pOrvex);
    pOrvex->Release(0);

    CJsonObject *pPhone = new CJsonObject();
    PHONE_BUILD_INFO build = {};
    if (GetPhoneBuildInfo(&build) >= 0)
    {
        pPhone->AddString("Branch", FieldText(build.wszBranch).c_str());
        pPhone->AddString("TimeStamp", FieldText(build.wszTimeStamp).c_str());
        pPhone->AddDword("ParentBranchBuild", build.dwParentBranchBuild);
        pPhone->AddDword("BuildNumber", build.dwBuildNumber);
        pPhone->AddDword("QFELevel", build.dwQfeLevel);
        pPhone->AddDword("OV_MajorVersion", build.dwMajorVersion);
        pPhone->AddDword("OV_MinorVersion", build.dwMinorVersion);
    }
    // One buffer for all sixteen items, terminated by us as well in case an item fills it.
    std::wstring wstrBuffer(c_cchPhoneBuffer + 1, L'\0');
    for (DWORD dwItem = 0; dwItem < c_cPhoneInformationItems; dwItem++)
    {
        if (QueryPhoneInformation(dwItem, &wstrBuffer[0], c_cchPhoneBuffer, 0))
        {
            wstrBuffer[c_cchPhoneBuffer] = L'\0';
            pPhone->AddString(c_rgszPhoneItemKeys[dwItem], wstrBuffer.c_str());
        }
    }
    m_pTrace->AddObject("Phone", pPhone);
    pPhone->Release(0);
}

std::wstring CTraceDocument::ReadWiFiConnId()
{
    wchar_t wszConnId[37];
    wmemcpy(wszConnId, c_wszZeroGuid, 37);
    CRegKeyHandle key;
    if (RegOpenKeyExW(HKEY_LOCAL_MACHINE, c_wszConnIdKey, 0, KEY_READ, key.Receive()) ==
        ERROR_SUCCESS)
    {
        DWORD cbConnId = sizeof(wszConnId);
        // The type is not checked; a value that does not fit leaves the default. The
        // registry may have written part of the buffer before it gave up, so the default
        // is put back.
        if (RegQueryValueExW(key.Get(), c_wszConnIdValue, nullptr, nullptr,
                             reinterpret_cast<BYTE *>(wszConnId), &cbConnId) != ERROR_SUCCESS)
        {
            wmemcpy(wszConnId, c_wszZeroGuid, 37);
        }
    }
    else
    {
        key.Detach();
    }
    size_t cch = 0;
    while (cch < 36 && wszConnId[cch] != L'\0')
    {
        cch++;
    }
    return std::wstring(wszConnId, cch);
}

void CTraceDocument::RecordEvent(const GUID &id, const BYTE *pbValue, size_t cbValue)
{
    auto itGroup = m_EventGroups.find(id);
    if (itGroup == m_EventGroups.end())
    {
        itGroup = m_EventGroups.try_emplace(id).first;
        CJsonArray *pArray = new CJsonArray();
        itGroup->second = pArray;
        pArray->Release(0);
    }

    CJsonObject *pRecord = new CJsonObject();
    ULONGLONG ullNow;
    if (Now(ullNow))
    {
        pRecord->AddUlonglong("TimeStamp", ullNow);
    }

    // The document keeps the text up to the first NUL; that text must be one JSON value or
    // the whole trace stops being JSON.
    const char *pchValue = reinterpret_cast<const char *>(pbValue);
    size_t cchKept = 0;
    if (pbValue != nullptr && cbValue > 0)
    {
        const void *pvZero = std::memchr(pbValue, 0, cbValue);
        cchKept = pvZero != nullptr
                      ? static_cast<size_t>(static_cast<const BYTE *>(pvZero) - pbValue)
                      : cbValue;
    }
    std::string_view strKept(pbValue != nullptr ? pchValue : "", cchKept);
    if (cbValue > 0 && cbValue <= 0xFFFFFFFFull && JsonValidateText(strKept))
    {
        pRecord->AddRawJson("Value", pchValue, static_cast<DWORD>(cbValue));
        m_cbRecorded += cchKept;
    }
    else
    {
        TelvaneTrace("CServiceOperation::RecordEvent() - ***value is not one JSON text, "
                     "recorded as a string");
        std::string strValue(strKept);
        std::string strEscaped;
        JsonAppendEscaped(strEscaped, strValue);
        pRecord->AddString("Value", strValue.c_str());
        m_cbRecorded += strEscaped.size() + 2;
    }
    itGroup->second->AddObject(pRecord);
    m_cRecords++;
}

void CTraceDocument::AddExecutionTime()
{
    ULONGLONG ullNow;
    if (m_pTrace != nullptr && Now(ullNow))
    {
        m_pTrace->AddUlonglong("ExecutionTime", ullNow);
    }
}

void CTraceDocument::CloseLog()
{
    for (auto &group : m_EventGroups)
    {
        m_pTrace->AddArray("ID" + GuidToString(group.first), group.second);
    }
    m_EventGroups.clear();
}

void CTraceDocument::FlushAndRestart(bool fCompleted)
{
    size_t cGroups = m_EventGroups.size();
    CloseLog();
    TelvaneTrace("CServiceOperation::Reading User Preference key");
    if (TraceSinks::IsCrowdsourcingEnabled())
    {
        m_pTrace->AddBool("LogEnd", fCompleted);
        // Sized up front: growing a text of megabytes step by step costs more than writing
        // it (each step copies, and fresh pages of a large block fault in one by one).
        std::string strText;
        strText.reserve(c_cbHeaderEstimate + m_cbRecorded +
                        m_cRecords * c_cbRecordOverheadEstimate +
                        cGroups * c_cbGroupOverheadEstimate);
        m_pTrace->ToString(strText);
        TraceSinks::DeliverTrace(strText.data(), strText.size());
    }
    NewTrace();
    m_ulLogCount++;
    BeginLog(false);
    m_cbRecorded = 0;
    m_cRecords = 0;
}

ULONG CTraceDocument::LogCount() const
{
    return m_ulLogCount;
}

size_t CTraceDocument::RecordedBytes() const
{
    return m_cbRecorded;
}

void CTraceDocument::SetTimeConversion(PFN_SYSTEM_TIME_TO_FILE_TIME pfnConvert)
{
    m_pfnTimeConversion = pfnConvert;
}

std::string CTraceDocument::CurrentText() const
{
    std::string strText;
    if (m_pTrace != nullptr)
    {
        m_pTrace->ToString(strText);
    }
    return strText;
}
