// The events a provider of this process writes while a session lives, captured through the
// trace writer's hook (Wine never enables a provider itself). Events arrive on any thread;
// the test thread reads them under the session's lock. One session at a time.
#pragma once

#include "servicelib/eventtrace.h"
#include "tests/common/testsupport.h"

#include <string>
#include <vector>

namespace testsupport
{
struct TracedEvent
{
    USHORT usId = 0;
    std::vector<std::string> rgFields; // each payload field's bytes as written

    // "id|field|field...": the first field and any field that is not four bytes as text
    // (terminator dropped, UTF-16 narrowed), later four-byte fields as hex codes.
    std::string Line() const;
};

class CTraceSession
{
public:
    // Enables every level and keyword of the provider (the main provider by default).
    explicit CTraceSession(TRACE_PROVIDER_CONTEXT *pProvider = &g_TelvaneTraceProvider,
                           const GUID &providerId = TELVANE_PROVIDER_GUID);
    ~CTraceSession();
    CTraceSession(const CTraceSession &) = delete;
    CTraceSession &operator=(const CTraceSession &) = delete;

    // Turns the provider off and on again: heavy runs need not pay for what nobody reads.
    void Enable(bool fEnable);
    void Clear();

    std::vector<TracedEvent> Events() const;
    std::vector<std::string> Lines() const;
    // Lines equal to strLine ("1001|text"), and events whose first field is strText.
    size_t CountLines(const std::string &strLine) const;
    size_t Count(const std::string &strText) const;
    bool Contains(const std::string &strLine) const { return CountLines(strLine) > 0; }
    bool WaitForLine(const std::string &strLine, size_t c = 1,
                     DWORD dwTimeoutMs = c_dwWaitMs) const;
    bool WaitFor(const std::string &strText, size_t c = 1, DWORD dwTimeoutMs = c_dwWaitMs) const;

private:
    TRACE_PROVIDER_CONTEXT *m_pProvider;
    GUID m_providerId;
};

// A code as the session's lines show it.
std::string HexCode(ULONG ulCode);
} // namespace testsupport
