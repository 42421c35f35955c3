// The trace of one operation: the document of the open log, the records made since the last
// flush (one array per event or collector ID) and the number of the open log. Embedded in
// CServiceOperation and run only on that operation's queue (Begin on the coordinator's
// thread, before the operation is shared); it shares nothing with other operations' traces,
// so several operations may flush at the same time.
#pragma once

#include <windows.h>

#include "lib/cjsonobject.h"

#include <cstddef>
#include <cstring>
#include <string>
#include <unordered_map>

class CTraceDocument
{
public:
    CTraceDocument();
    ~CTraceDocument();

    CTraceDocument(const CTraceDocument &) = delete;
    CTraceDocument &operator=(const CTraceDocument &) = delete;

    // Creates the first log (LogCount 1) of the run logId of activity activityId; called once,
    // from the operation's constructor.
    void Begin(const GUID &activityId, const GUID &sessionId, const GUID &logId);

    // One record {TimeStamp, Value} appended to the group of id; pbValue/cbValue is the
    // client's payload, kept up to its first NUL. A payload that is not one JSON text is
    // kept as a JSON string of its bytes, so one faulty client cannot spoil the document.
    void RecordEvent(const GUID &id, const BYTE *pbValue, size_t cbValue);

    // "ExecutionTime" (now) on the open log; left out when the clock cannot be read.
    void AddExecutionTime();

    // Closes the open log, delivers it when the user preference allows (with "LogEnd" set to
    // fCompleted), and begins the next log with LogCount one higher, whether or not it was
    // delivered.
    void FlushAndRestart(bool fCompleted);

    ULONG LogCount() const;

    // Bytes of record values kept since the last flush: the operation flushes early past a
    // bound so that one chatty activity cannot pin unbounded memory.
    size_t RecordedBytes() const;

    // Test seam: the conversion "now" uses in place of SystemTimeToFileTime (null: the real
    // one), so that a failing clock can be driven.
    typedef BOOL(WINAPI *PFN_SYSTEM_TIME_TO_FILE_TIME)(const SYSTEMTIME *, FILETIME *);
    void SetTimeConversion(PFN_SYSTEM_TIME_TO_FILE_TIME pfnConvert);

    // The open log's compact text (for tests and tools); empty before Begin.
    std::string CurrentText() const;

    // The wireless connection's ID text from "ConnID": the all-zero GUID text when it is
    // missing or does not fit 36 characters and a terminator.
    static std::wstring ReadWiFiConnId();

private:
    struct GuidHash
    {
        size_t operator()(const GUID &guid) const
        {
            unsigned long long rgull[2];
            std::memcpy(rgull, &guid, sizeof(rgull));
            return std::hash<unsigned long long>()(rgull[0] * 0x9E3779B97F4A7C15ull ^ rgull[1]);
        }
    };
    struct GuidEqual
    {
        bool operator()(const GUID &a, const GUID &b) const
        {
            return std::memcmp(&a, &b, sizeof(GUID)) == 0;
        }
    };
    typedef std::unordered_map<GUID, CTaggedPtr<class CJsonArray, 1>, GuidHash, GuidEqual>
        EventGroupMap;

    void BeginLog(bool fFirst);
    void AddDeviceInformation();
    void CloseLog();
    void NewTrace();
    bool Now(ULONGLONG &ullNow) const;

    GUID m_guidActivity;
    GUID m_guidSession;
    GUID m_guidLog;
    CTaggedPtr<class CJsonObject, 1> m_pTrace;
    EventGroupMap m_EventGroups;
    ULONG m_ulLogCount;
    size_t m_cbRecorded;
    size_t m_cRecords; // since the last flush: with m_cbRecorded, sizes the log's text
    PFN_SYSTEM_TIME_TO_FILE_TIME m_pfnTimeConversion;
};
