// The trace of one operation: the document of the open log, the records made since the last
// flush (one array per event or collector ID) and the number of the open log. Embedded in
// CServiceOperation and run only on that operation's queue; it shares nothing with other
// operations' traces, so several operations may flush at the same time.
#pragma once

#include <windows.h>

#include <cstddef>

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
    // client's payload, kept up to its first NUL.
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

private:
    struct Impl;
    Impl *m_pImpl;
};
