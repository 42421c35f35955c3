// telvanectl platform submission: lists what the submission stand-in accepted and tells it
// to fail (its settings live in the prefix's registry and apply from the next call on).
#include "platform/submission/submissioncontrol.h"
#include "tools/telvanectl/ctlcommand.h"
#include "tools/telvanectl/ctltraceformat.h"

#include <stdio.h>
#include <stdlib.h>

#include <string>

namespace
{
bool ParseCode(const wchar_t *wsz, DWORD *pdwCode)
{
    wchar_t *pwszEnd = nullptr;
    unsigned long ul = wcstoul(wsz, &pwszEnd, 0);
    if (pwszEnd == wsz || *pwszEnd != L'\0')
    {
        return false;
    }
    *pdwCode = static_cast<DWORD>(ul);
    return true;
}

int CtlSubmissionList()
{
    std::vector<SUBMISSION_RECORD> rgRecords = SubmissionList();
    printf("%u submission(s) in %ls\n", static_cast<unsigned>(rgRecords.size()),
           SubmissionSpoolDirectory().c_str());
    for (const SUBMISSION_RECORD &record : rgRecords)
    {
        printf("%s  %-20s %8u bytes  %ls\n", CtlFormatFileTime(record.ullSubmitted).c_str(),
               record.strProfileName.c_str(), static_cast<unsigned>(record.strData.size()),
               record.wstrPath.c_str());
    }
    DWORD dwInit = SubmissionGetResult(c_wszSubmissionInitResult);
    DWORD dwSubmit = SubmissionGetResult(c_wszSubmissionSubmitResult);
    printf("Init %s, SubmitData %s\n", dwInit == 0 ? "succeeds" : "fails",
           dwSubmit == 0 ? "succeeds" : "fails");
    if (dwInit != 0 || dwSubmit != 0)
    {
        printf("codes: Init 0x%lx, SubmitData 0x%lx\n", static_cast<unsigned long>(dwInit),
               static_cast<unsigned long>(dwSubmit));
    }
    return c_iCtlExitOk;
}

int CtlPlatformSubmission(int argc, wchar_t **argv)
{
    std::wstring wstrVerb = argc > 0 ? argv[0] : L"list";
    if (wstrVerb == L"list" && argc <= 1)
    {
        return CtlSubmissionList();
    }
    if (wstrVerb == L"fail" && (argc == 2 || argc == 3))
    {
        // "fail CODE" fails Init; "fail submit CODE" fails SubmitData.
        std::wstring wstrCall = argc == 3 ? argv[1] : L"init";
        DWORD dwCode = 0;
        if (!ParseCode(argv[argc - 1], &dwCode) || dwCode == 0 ||
            (wstrCall != L"init" && wstrCall != L"submit"))
        {
            return CtlCommandUsage("platform submission fail: [init|submit] CODE, CODE not 0");
        }
        return SubmissionSetResult(wstrCall == L"init" ? c_wszSubmissionInitResult
                                                       : c_wszSubmissionSubmitResult,
                                   dwCode)
                   ? c_iCtlExitOk
                   : c_iCtlExitFailed;
    }
    if (wstrVerb == L"ok" && argc == 1)
    {
        bool fOk = SubmissionSetResult(c_wszSubmissionInitResult, 0) &&
                   SubmissionSetResult(c_wszSubmissionSubmitResult, 0);
        return fOk ? c_iCtlExitOk : c_iCtlExitFailed;
    }
    if (wstrVerb == L"clear" && argc == 1)
    {
        SubmissionClear();
        return c_iCtlExitOk;
    }
    return CtlCommandUsage("platform submission: unknown verb or wrong arguments");
}

const CtlCommand s_command(
    L"platform submission", CtlPlatformSubmission,
    "       telvanectl platform submission [list]   accepted submissions, newest first\n"
    "       telvanectl platform submission fail [init|submit] CODE   that call returns CODE\n"
    "       telvanectl platform submission ok | clear   calls succeed | empty the spool\n");
} // namespace
