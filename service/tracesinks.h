// Where a closed log goes: the user preference decides whether it may leave the device at
// all, the test value whether it is submitted, written to a file, both or neither. Free
// functions without state, run on the flushing operation's queue; several operations may
// deliver at once, each with its own profile, submitter and file name.
#pragma once

#include <windows.h>

#include <string>

namespace TraceSinks
{
// The folder trace files are written to, and the suffix of a file still being written there.
extern const wchar_t c_wszTraceDirectory[];
extern const wchar_t c_wszTemporarySuffix[];

// True only when "EnableWifiCrowdsourcing" reads as a number with bits 0 and 1 set.
bool IsCrowdsourcingEnabled();

// Hands the text to the sinks "EnableTestLogging" selects: a failed read submits, 1 writes a
// file, 2 writes a file and then submits, anything else sends nothing.
void DeliverTrace(const char *pchText, size_t cchText);

// Writes one new trace file. It appears under its final name only once complete: the text
// goes to the name with c_wszTemporarySuffix first, which a failed write removes again.
HRESULT WriteTraceToFile(const char *pchText, size_t cchText);

// A new file name in c_wszTraceDirectory, creating that last folder when it is missing.
// S_OK or E_FAIL.
HRESULT MakeTraceFileName(std::wstring &wstrPath);

// Test seam: the call that writes trace files in place of WriteFile (null: WriteFile
// again), so that short and failing writes, which the real file system does not make on
// demand, can be driven. Process-wide; set it only while no log is being delivered.
typedef BOOL(WINAPI *PFN_TRACE_WRITE_FILE)(HANDLE hFile, LPCVOID pvData, DWORD cbData,
                                           LPDWORD pcbWritten, LPOVERLAPPED pOverlapped);
void SetWriteFileForTest(PFN_TRACE_WRITE_FILE pfnWriteFile);

// Submits the text through the crowdsourcing library under the trace's profile; failures
// are traced, never retried.
void WriteTraceToVantor(const char *pchText, size_t cchText);
} // namespace TraceSinks
