// The launcher suite's old names for the common harness, kept only until that suite includes
// tests/common itself; nothing here is its own. Test thread only, like what it names.
#pragma once

#include "tests/common/tracesession.h"
#include "tests/common/udpsupport.h"

namespace udptest
{
using TraceSession = testsupport::CTraceSession;

inline bool ReadWholeFile(const std::wstring &wstrPath, std::string *pstrText)
{
    return testsupport::ReadFileText(wstrPath, pstrText);
}

inline bool WriteWholeFile(const std::wstring &wstrPath, const std::string &strText)
{
    return testsupport::WriteFileText(wstrPath, strText);
}
} // namespace udptest
