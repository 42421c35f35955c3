// How tests, telvanectl and the demo see and drive the submission stand-in. Its registry key
// under HKEY_LOCAL_MACHINE holds "InitResult" and "SubmitResult" (REG_DWORD, the code the
// call returns; missing or 0: success). Accepted submissions land in the spool folder, one
// file each, written under a temporary name and renamed, so a reader never sees half a
// file; every call of the library is also appended to a journal there. Free functions
// without state: any thread, any process.
#pragma once

#include "platform/submission/submissionspool.h"

#include <string>
#include <vector>

extern const wchar_t c_wszSubmissionInitResult[];
extern const wchar_t c_wszSubmissionSubmitResult[];

struct SUBMISSION_RECORD
{
    std::wstring wstrPath;
    std::string strProfileName;
    DWORD rgdwSettings[8] = {};
    std::vector<BYTE> rgbProfile; // the 120 bytes as the submitter received them
    std::string strTarget;        // "null 0 null" for the default target
    std::string strGuid;          // "null" or the GUID text
    ULONGLONG ullSubmitted = 0;   // FILETIME of the submission
    std::string strData;
};

// Parses one spool file; false when it is not a complete submission file.
bool SubmissionReadFile(const std::wstring &wstrPath, SUBMISSION_RECORD *pRecord);
// Every spooled submission, newest first; temporary files are skipped.
std::vector<SUBMISSION_RECORD> SubmissionList();
// The journal's lines in call order ("<thread id> <call>").
std::vector<std::string> SubmissionReadJournal();
// Removes every spool file and the journal.
void SubmissionClear();

// The code Init or SubmitData returns from now on (0: success).
bool SubmissionSetResult(const wchar_t *wszValue, DWORD dwCode);
