// "telvanectl platform cm": shows the calls the connection manager stand-in recorded,
// clears them, and makes its calls fail or succeed.
#include "platform/connectionmanager/connectionmanager.h"
#include "tools/telvanectl/ctlcommand.h"

#include <stdio.h>
#include <wchar.h>
#include <string>
#include <vector>

namespace
{
int CmFailed(const char *szStep, LSTATUS status)
{
    fprintf(stderr, "telvanectl: %s failed: %ld\n", szStep, static_cast<long>(status));
    return c_iCtlExitFailed;
}

LSTATUS CmDeleteValue(const wchar_t *wszName)
{
    LSTATUS status = RegDeleteKeyValueW(HKEY_LOCAL_MACHINE, CM_STANDIN_KEY, wszName);
    return status == ERROR_FILE_NOT_FOUND ? ERROR_SUCCESS : status;
}

LSTATUS CmSetDword(const wchar_t *wszName, DWORD dw)
{
    return RegSetKeyValueW(HKEY_LOCAL_MACHINE, CM_STANDIN_KEY, wszName, REG_DWORD, &dw, sizeof(dw));
}

int CmCalls()
{
    DWORD cb = 0;
    LSTATUS status = RegGetValueW(HKEY_LOCAL_MACHINE, CM_STANDIN_KEY, L"Calls", RRF_RT_REG_MULTI_SZ,
                                  nullptr, nullptr, &cb);
    if (status == ERROR_FILE_NOT_FOUND)
    {
        return c_iCtlExitOk;
    }
    std::vector<wchar_t> rgwch(cb / sizeof(wchar_t) + 2, L'\0');
    if (status == ERROR_SUCCESS)
    {
        status = RegGetValueW(HKEY_LOCAL_MACHINE, CM_STANDIN_KEY, L"Calls", RRF_RT_REG_MULTI_SZ,
                              nullptr, rgwch.data(), &cb);
    }
    if (status != ERROR_SUCCESS)
    {
        return CmFailed("reading the recorded calls", status);
    }
    for (const wchar_t *pwsz = rgwch.data(); *pwsz != L'\0'; pwsz += wcslen(pwsz) + 1)
    {
        printf("%ls\n", pwsz);
    }
    return c_iCtlExitOk;
}

int CtlCm(int argc, wchar_t **argv)
{
    std::wstring wstrVerb = argc > 0 ? argv[0] : L"calls";
    LSTATUS status = ERROR_SUCCESS;
    if (wstrVerb == L"calls" && argc <= 1)
    {
        return CmCalls();
    }
    if (wstrVerb == L"clear" && argc == 1)
    {
        status = CmDeleteValue(L"Calls");
    }
    else if (wstrVerb == L"ok" && argc == 1)
    {
        status = CmDeleteValue(L"FailInit");
        if (status == ERROR_SUCCESS)
        {
            status = CmDeleteValue(L"RequirementsResult");
        }
    }
    else if (wstrVerb == L"fail" && argc == 2 && wcscmp(argv[1], L"init") == 0)
    {
        status = CmSetDword(L"FailInit", 1);
    }
    else if (wstrVerb == L"fail" && argc == 3 && wcscmp(argv[1], L"requirements") == 0)
    {
        wchar_t *pwchEnd = nullptr;
        unsigned long ulResult = wcstoul(argv[2], &pwchEnd, 0);
        if (pwchEnd == argv[2] || *pwchEnd != L'\0' || ulResult == 0 || ulResult > 0xFFFFFFFFul)
        {
            return CtlCommandUsage("platform cm fail requirements takes a non-zero result");
        }
        status = CmSetDword(L"RequirementsResult", static_cast<DWORD>(ulResult));
    }
    else
    {
        return CtlCommandUsage("platform cm takes calls, clear, ok, fail init or "
                               "fail requirements RESULT");
    }
    if (status != ERROR_SUCCESS)
    {
        return CmFailed("setting the connection manager stand-in", status);
    }
    return c_iCtlExitOk;
}

const CtlCommand s_cmCommand(
    L"platform cm", CtlCm,
    "       telvanectl platform cm [calls | clear | ok | fail init | fail requirements RESULT]\n"
    "           shows or clears the connection manager stand-in's recorded calls, or makes\n"
    "           CmApiInit or CmSetRequirements fail\n");
} // namespace
