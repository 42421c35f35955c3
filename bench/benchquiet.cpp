// Linked into every benchmark (telvane_add_bench): a benchmark prints figures and nothing
// else, so the debug lines of the code it measures (a pipe logs each connection and each
// break) are silenced before main runs. Failure reports still print.
#include "servicelib/diagnostics.h"

namespace
{
// Built during static initialization on the main thread; lives until the process ends.
class CBenchQuietLog
{
public:
    CBenchQuietLog() { DiagnosticsSetLogQuiet(true); }
};

CBenchQuietLog s_quietLog;
} // namespace
