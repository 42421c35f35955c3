#include "tests/common/tracesession.h"

#include <algorithm>
#include <mutex>

namespace testsupport
{
namespace
{
std::mutex s_lock;
std::vector<TracedEvent> s_rgEvents;

void CaptureWrite(REGHANDLE, const EVENT_DESCRIPTOR *pDescriptor, ULONG cData,
                  const EVENT_DATA_DESCRIPTOR *pData)
{
    TracedEvent event;
    event.usId = pDescriptor->Id;
    for (ULONG i = 0; i < cData; i++)
    {
        event.rgFields.emplace_back(
            reinterpret_cast<const char *>(static_cast<ULONG_PTR>(pData[i].Ptr)), pData[i].Size);
    }
    std::lock_guard<std::mutex> guard(s_lock);
    s_rgEvents.push_back(std::move(event));
}

// UTF-16 text of ASCII characters has a zero in every odd byte; narrow text longer than one
// character never does.
std::string FieldText(std::string strField)
{
    bool fWide = strField.size() >= 2 && strField.size() % 2 == 0;
    for (size_t i = 1; fWide && i < strField.size(); i += 2)
    {
        fWide = strField[i] == '\0';
    }
    if (fWide)
    {
        std::string strNarrow;
        for (size_t i = 0; i < strField.size(); i += 2)
        {
            strNarrow.push_back(strField[i]);
        }
        strField.swap(strNarrow);
    }
    if (!strField.empty() && strField.back() == '\0')
    {
        strField.pop_back();
    }
    return strField;
}
} // namespace

std::string HexCode(ULONG ulCode)
{
    char sz[16];
    snprintf(sz, sizeof(sz), "%lx", ulCode);
    return sz;
}

std::string TracedEvent::Line() const
{
    std::string strLine = std::to_string(usId);
    for (size_t i = 0; i < rgFields.size(); i++)
    {
        strLine += '|';
        if (i > 0 && rgFields[i].size() == sizeof(ULONG))
        {
            ULONG ulCode;
            memcpy(&ulCode, rgFields[i].data(), sizeof(ulCode));
            strLine += HexCode(ulCode);
        }
        else
        {
            strLine += FieldText(rgFields[i]);
        }
    }
    return strLine;
}

CTraceSession::CTraceSession(TRACE_PROVIDER_CONTEXT *pProvider, const GUID &providerId)
    : m_pProvider(pProvider)
    , m_providerId(providerId)
{
    Clear();
    TraceSetWriteHook(CaptureWrite);
    Enable(true);
}

CTraceSession::~CTraceSession()
{
    Enable(false);
    TraceSetWriteHook(nullptr);
}

void CTraceSession::Enable(bool fEnable)
{
    TraceProviderEnableCallback(&m_providerId,
                                fEnable ? EVENT_CONTROL_CODE_ENABLE_PROVIDER
                                        : EVENT_CONTROL_CODE_DISABLE_PROVIDER,
                                0, fEnable ? ~0ull : 0, 0, nullptr, m_pProvider);
}

void CTraceSession::Clear()
{
    std::lock_guard<std::mutex> guard(s_lock);
    s_rgEvents.clear();
}

std::vector<TracedEvent> CTraceSession::Events() const
{
    std::lock_guard<std::mutex> guard(s_lock);
    return s_rgEvents;
}

std::vector<std::string> CTraceSession::Lines() const
{
    std::vector<std::string> rgLines;
    for (const TracedEvent &event : Events())
    {
        rgLines.push_back(event.Line());
    }
    return rgLines;
}

size_t CTraceSession::CountLines(const std::string &strLine) const
{
    std::vector<std::string> rgLines = Lines();
    return static_cast<size_t>(std::count(rgLines.begin(), rgLines.end(), strLine));
}

size_t CTraceSession::Count(const std::string &strText) const
{
    std::lock_guard<std::mutex> guard(s_lock);
    return static_cast<size_t>(
        std::count_if(s_rgEvents.begin(), s_rgEvents.end(), [&](const TracedEvent &event) {
            return !event.rgFields.empty() && FieldText(event.rgFields[0]) == strText;
        }));
}

bool CTraceSession::WaitForLine(const std::string &strLine, size_t c, DWORD dwTimeoutMs) const
{
    return WaitUntil([&] { return CountLines(strLine) >= c; }, dwTimeoutMs);
}

bool CTraceSession::WaitFor(const std::string &strText, size_t c, DWORD dwTimeoutMs) const
{
    return WaitUntil([&] { return Count(strText) >= c; }, dwTimeoutMs);
}
} // namespace testsupport
