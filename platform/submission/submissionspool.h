// The spool folder of the submission stand-in, shared by the library and its control: where
// it is, the submission file's form and the call journal. A submission file is text lines
// ending in CRLF, then an empty line, then the submitted bytes:
//   Profile: <name>
//   Settings: <eight numbers, the first in hexadecimal>
//   ProfileBytes: <the 120 profile bytes in hexadecimal>
//   Target: <the submitter's three target arguments, "null 0 null" for the default>
//   Guid: <"null" or the GUID text>
//   Submitted: <FILETIME in decimal>
//   Length: <byte count>
// Free functions without state: any thread, any process.
#pragma once

#include <windows.h>

#include <string>

// %ProgramData%\Telvane\Submissions, without a trailing backslash.
std::wstring SubmissionSpoolDirectory();
// Creates the spool folder and its parents; false when that fails.
bool SubmissionCreateSpoolDirectory();

// Where the control keeps the codes the library's calls are told to return.
extern const wchar_t c_wszSubmissionKey[];
// The code a call named wszValue ("InitResult", "SubmitResult") is told to return; 0 when none.
DWORD SubmissionGetResult(const wchar_t *wszValue);

// Final names end in this; a file being written ends in ".tmp" instead.
extern const wchar_t c_wszSubmissionSuffix[];

std::string SubmissionFormatHeader(const BYTE *pbProfile, const std::string &strTarget,
                                   const std::string &strGuid, ULONGLONG ullSubmitted,
                                   DWORD cbData);
// Appends "<thread id> <strCall>" to the journal; failures are ignored (the journal is only
// an observer's aid).
void SubmissionAppendJournal(const std::string &strCall);
