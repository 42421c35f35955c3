// "telvanectl platform endpoint": points a web service role of the endpoint directory
// stand-in at a URL prefix, shows it, or removes it.
#include "platform/endpointdirectory/endpointdirectory.h"
#include "tools/telvanectl/ctlcommand.h"

#include <stdio.h>
#include <wchar.h>

namespace
{
int CtlEndpoint(int argc, wchar_t **argv)
{
    if (argc < 1 || argc > 2)
    {
        return CtlCommandUsage("platform endpoint takes ROLE and an optional URL or --remove");
    }
    const wchar_t *wszRole = argv[0];
    if (argc == 1)
    {
        PWSTR pwszEndpoint = nullptr;
        HRESULT hr = GetServiceEndpoint(wszRole, &pwszEndpoint, 0);
        if (FAILED(hr))
        {
            fprintf(stderr, "telvanectl: role %ls has no endpoint (0x%08lx)\n", wszRole,
                    static_cast<unsigned long>(hr));
            return c_iCtlExitFailed;
        }
        printf("%ls\n", pwszEndpoint);
        ReleaseEndpoint(pwszEndpoint);
        return c_iCtlExitOk;
    }
    LSTATUS status;
    if (wcscmp(argv[1], L"--remove") == 0)
    {
        status = RegDeleteKeyValueW(HKEY_LOCAL_MACHINE, ENDPOINT_DIRECTORY_KEY, wszRole);
        if (status == ERROR_FILE_NOT_FOUND)
        {
            status = ERROR_SUCCESS;
        }
    }
    else
    {
        size_t cch = wcslen(argv[1]);
        if (cch == 0)
        {
            return CtlCommandUsage("platform endpoint: the URL is empty");
        }
        if (argv[1][cch - 1] != L'/')
        {
            // Callers append their path unchanged.
            fprintf(stderr, "telvanectl: warning: %ls does not end in '/'\n", argv[1]);
        }
        status = RegSetKeyValueW(HKEY_LOCAL_MACHINE, ENDPOINT_DIRECTORY_KEY, wszRole, REG_SZ,
                                 argv[1], static_cast<DWORD>((cch + 1) * sizeof(wchar_t)));
    }
    if (status != ERROR_SUCCESS)
    {
        fprintf(stderr, "telvanectl: platform endpoint failed: %ld\n", static_cast<long>(status));
        return c_iCtlExitFailed;
    }
    return c_iCtlExitOk;
}

const CtlCommand s_endpointCommand(
    L"platform endpoint", CtlEndpoint,
    "       telvanectl platform endpoint ROLE [URL | --remove]\n"
    "           shows, sets or removes the URL prefix the endpoint directory gives ROLE\n");
} // namespace
