// Presentation helpers of telvanectl's trace and submission commands. Run on telvanectl's
// main thread only.
#pragma once

#include <windows.h>

#include <string>
#include <string_view>

// "2026-12-06 19:50:01.123 UTC" for a FILETIME count; "-" for 0.
std::string CtlFormatFileTime(ULONGLONG ullFileTime);

// The JSON text indented by two spaces per level, one member or element per line, strings
// and numbers unchanged. Text that is not JSON comes out re-indented as far as it goes.
std::string CtlPrettyJson(std::string_view text);
