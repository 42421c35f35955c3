// Helpers of the UDP test suites: a trace session that records the events of the main
// provider as text, and the prefix's policy folder and test application.
#pragma once

#include <windows.h>
#include <string>
#include <vector>

#include "tests/common/udpsupport.h"

namespace udptest
{
// Acts as a trace session with every keyword of the main provider while it lives. Events
// are recorded as "id", "id|text" or "id|text|code" (code in hex), payload terminators
// dropped; wide payloads are narrowed. One session at a time.
class TraceSession
{
public:
    TraceSession();
    ~TraceSession();
    std::vector<std::string> Lines() const;
    bool Contains(const std::string &strLine) const;
};

// Reads a whole file; false when it cannot be opened.
bool ReadWholeFile(const std::wstring &wstrPath, std::string *pstrText);
bool WriteWholeFile(const std::wstring &wstrPath, const std::string &strText);

} // namespace udptest
