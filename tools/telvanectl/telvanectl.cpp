// telvanectl: a command-line activity or collector client of the service, for people and
// scripts. Runs on its main thread only.
#include "client/cactivityclient.h"
#include "client/ccollectorclient.h"
#include "tools/telvanectl/ctlcommand.h"

#include <windows.h>
#include <rpc.h>
#include <stdio.h>
#include <string>
#include <vector>

namespace
{
const int c_iExitOk = 0;
const int c_iExitFailed = 1;
const int c_iExitUsage = 2;

const char c_szUsage[] =
    "usage: telvanectl activity [--pipe NAME] [--timeout MS] [--no-stop]\n"
    "                           ACTIVITYID LOGID [EVENTID=TEXT | EVENTID=@FILE]...\n"
    "       telvanectl collector [--pipe NAME] [--timeout MS] [--requests N] COLLECTORID FILE\n"
    "\n"
    "activity   starts activity ACTIVITYID as run LOGID on the activity pipe, sends each\n"
    "           event (TEXT in UTF-8, or the content of FILE), then stops the activity\n"
    "           (--no-stop: closes the pipe instead).\n"
    "collector  registers COLLECTORID on the collector pipe and answers each start-collection\n"
    "           request with the content of FILE until the service ends the connection, or\n"
    "           until N requests were answered (--requests); then it breaks the pipe.\n"
    "\n"
    "GUIDs are written 8-4-4-4-12, with or without braces. --timeout limits each step of the\n"
    "conversation in milliseconds (default 5000). --pipe names another pipe than the service's.\n";

// How long one wait for a collection request lasts before the collector looks again.
const DWORD c_dwRequestSliceMs = 1000;

struct CtlOptions
{
    const wchar_t *wszPipe = nullptr;
    DWORD dwTimeoutMs = c_dwTelvaneClientTimeoutMs;
    bool fNoStop = false;
    DWORD cRequests = 0; // 0: until the service ends the connection
    std::vector<const wchar_t *> rgwszArgs;
};

int CtlUsage(const char *szProblem)
{
    fprintf(stderr, "telvanectl: %s\n%s", szProblem, c_szUsage);
    CtlCommand::PrintUsages();
    return c_iExitUsage;
}

int CtlFailed(const char *szStep, HRESULT hr)
{
    wchar_t wszText[512] = L"";
    if (FormatMessageW(FORMAT_MESSAGE_FROM_SYSTEM | FORMAT_MESSAGE_IGNORE_INSERTS, nullptr,
                       static_cast<DWORD>(hr), 0, wszText, ARRAYSIZE(wszText), nullptr) == 0)
    {
        wszText[0] = L'\0';
    }
    fprintf(stderr, "telvanectl: %s failed: 0x%08lx %ls\n", szStep, static_cast<unsigned long>(hr),
            wszText);
    return c_iExitFailed;
}

// Decimal digits only. wcstoul alone would take "-1" as its negation, INFINITE for a time
// limit, and quietly saturate a value past 32 bits.
bool CtlParseNumber(const wchar_t *wsz, DWORD *pdw)
{
    ULONGLONG ull = 0;
    const wchar_t *pwch = wsz;
    for (; *pwch >= L'0' && *pwch <= L'9'; pwch++)
    {
        ull = ull * 10 + static_cast<ULONGLONG>(*pwch - L'0');
        if (ull > 0xFFFFFFFFull)
        {
            return false;
        }
    }
    if (pwch == wsz || *pwch != L'\0')
    {
        return false;
    }
    *pdw = static_cast<DWORD>(ull);
    return true;
}

bool CtlParseGuid(const std::wstring &text, GUID *pGuid)
{
    std::wstring bare = text;
    if (bare.size() == 38 && bare.front() == L'{' && bare.back() == L'}')
    {
        bare = bare.substr(1, 36);
    }
    if (bare.size() != 36)
    {
        return false;
    }
    return UuidFromStringW(reinterpret_cast<RPC_WSTR>(&bare[0]), pGuid) == RPC_S_OK;
}

std::string CtlGuidText(const GUID &guid)
{
    char sz[40];
    snprintf(sz, sizeof(sz), "%08lx-%04x-%04x-%02x%02x-%02x%02x%02x%02x%02x%02x",
             static_cast<unsigned long>(guid.Data1), guid.Data2, guid.Data3, guid.Data4[0],
             guid.Data4[1], guid.Data4[2], guid.Data4[3], guid.Data4[4], guid.Data4[5],
             guid.Data4[6], guid.Data4[7]);
    return sz;
}

HRESULT CtlReadFile(const wchar_t *wszPath, std::vector<BYTE> *pvb)
{
    HANDLE hFile = CreateFileW(wszPath, GENERIC_READ, FILE_SHARE_READ, nullptr, OPEN_EXISTING,
                               FILE_ATTRIBUTE_NORMAL, nullptr);
    if (hFile == INVALID_HANDLE_VALUE)
    {
        return HRESULT_FROM_WIN32(GetLastError());
    }
    HRESULT hr = S_OK;
    LARGE_INTEGER liSize = {};
    if (!GetFileSizeEx(hFile, &liSize))
    {
        hr = HRESULT_FROM_WIN32(GetLastError());
    }
    else if (liSize.QuadPart > TELVANE_MAX_ITEM)
    {
        hr = HRESULT_FROM_WIN32(ERROR_MESSAGE_EXCEEDS_MAX_SIZE);
    }
    else
    {
        pvb->resize(static_cast<size_t>(liSize.QuadPart));
        DWORD cbRead = 0;
        if (!pvb->empty() &&
            !ReadFile(hFile, pvb->data(), static_cast<DWORD>(pvb->size()), &cbRead, nullptr))
        {
            hr = HRESULT_FROM_WIN32(GetLastError());
        }
        pvb->resize(cbRead);
    }
    CloseHandle(hFile);
    return hr;
}

std::vector<BYTE> CtlUtf8(const wchar_t *wsz)
{
    int cb = WideCharToMultiByte(CP_UTF8, 0, wsz, -1, nullptr, 0, nullptr, nullptr);
    std::vector<BYTE> vb(cb > 0 ? cb : 1);
    WideCharToMultiByte(CP_UTF8, 0, wsz, -1, reinterpret_cast<char *>(vb.data()), cb, nullptr,
                        nullptr);
    vb.pop_back(); // the terminator is not part of the value
    return vb;
}

// Options may come anywhere among the positional arguments.
bool CtlParseOptions(int argc, wchar_t **argv, CtlOptions *pOptions, const char **pszProblem)
{
    for (int i = 2; i < argc; i++)
    {
        std::wstring arg = argv[i];
        bool fHasValue = i + 1 < argc;
        if (arg == L"--pipe" && fHasValue)
        {
            pOptions->wszPipe = argv[++i];
        }
        else if (arg == L"--timeout" && fHasValue)
        {
            if (!CtlParseNumber(argv[++i], &pOptions->dwTimeoutMs))
            {
                *pszProblem = "--timeout needs a number of milliseconds";
                return false;
            }
        }
        else if (arg == L"--requests" && fHasValue)
        {
            if (!CtlParseNumber(argv[++i], &pOptions->cRequests) || pOptions->cRequests == 0)
            {
                *pszProblem = "--requests needs a positive number";
                return false;
            }
        }
        else if (arg == L"--no-stop")
        {
            pOptions->fNoStop = true;
        }
        else if (arg.compare(0, 2, L"--") == 0)
        {
            *pszProblem = "unknown option or missing value";
            return false;
        }
        else
        {
            pOptions->rgwszArgs.push_back(argv[i]);
        }
    }
    return true;
}

struct CtlEvent
{
    GUID eventId;
    std::vector<BYTE> vbValue;
};

int CtlActivity(const CtlOptions &options)
{
    if (options.rgwszArgs.size() < 2)
    {
        return CtlUsage("activity needs ACTIVITYID and LOGID");
    }
    GUID activityId;
    GUID logId;
    if (!CtlParseGuid(options.rgwszArgs[0], &activityId) ||
        !CtlParseGuid(options.rgwszArgs[1], &logId))
    {
        return CtlUsage("ACTIVITYID and LOGID must be GUIDs");
    }
    // Every event is read before the activity starts, so a bad file sends nothing.
    std::vector<CtlEvent> rgEvents;
    for (size_t i = 2; i < options.rgwszArgs.size(); i++)
    {
        std::wstring arg = options.rgwszArgs[i];
        size_t ichEquals = arg.find(L'=');
        CtlEvent event;
        if (ichEquals == std::wstring::npos ||
            !CtlParseGuid(arg.substr(0, ichEquals), &event.eventId))
        {
            return CtlUsage("an event is EVENTID=TEXT or EVENTID=@FILE");
        }
        const wchar_t *wszValue = options.rgwszArgs[i] + ichEquals + 1;
        if (*wszValue == L'@')
        {
            HRESULT hr = CtlReadFile(wszValue + 1, &event.vbValue);
            if (FAILED(hr))
            {
                fprintf(stderr, "telvanectl: cannot read %ls\n", wszValue + 1);
                return CtlFailed("reading an event file", hr);
            }
        }
        else
        {
            event.vbValue = CtlUtf8(wszValue);
        }
        rgEvents.push_back(std::move(event));
    }

    CActivityClient client(options.dwTimeoutMs);
    const wchar_t *wszPipe =
        options.wszPipe != nullptr ? options.wszPipe : c_wszTelvaneActivityPipe;
    HRESULT hr = client.Connect(wszPipe);
    if (FAILED(hr))
    {
        return CtlFailed("connecting to the activity pipe", hr);
    }
    printf("connected to %ls (service version %lu)\n", wszPipe,
           static_cast<unsigned long>(client.ServiceVersion()));
    hr = client.Start(activityId, logId);
    if (FAILED(hr))
    {
        return CtlFailed("starting the activity", hr);
    }
    printf("started activity %s log %s\n", CtlGuidText(activityId).c_str(),
           CtlGuidText(logId).c_str());
    for (const CtlEvent &event : rgEvents)
    {
        hr = client.SendEvent(event.eventId, event.vbValue.data(), event.vbValue.size());
        if (FAILED(hr))
        {
            return CtlFailed("sending an event", hr);
        }
        printf("sent event %s: %lu bytes\n", CtlGuidText(event.eventId).c_str(),
               static_cast<unsigned long>(event.vbValue.size()));
    }
    if (options.fNoStop)
    {
        client.Close();
        printf("closed without a stop\n");
        return c_iExitOk;
    }
    hr = client.Stop();
    if (FAILED(hr))
    {
        return CtlFailed("stopping the activity", hr);
    }
    printf("stopped\n");
    return c_iExitOk;
}

int CtlCollector(const CtlOptions &options)
{
    if (options.rgwszArgs.size() != 2)
    {
        return CtlUsage("collector needs COLLECTORID and FILE");
    }
    GUID collectorId;
    if (!CtlParseGuid(options.rgwszArgs[0], &collectorId))
    {
        return CtlUsage("COLLECTORID must be a GUID");
    }
    std::vector<BYTE> vbResult;
    HRESULT hr = CtlReadFile(options.rgwszArgs[1], &vbResult);
    if (FAILED(hr))
    {
        fprintf(stderr, "telvanectl: cannot read %ls\n", options.rgwszArgs[1]);
        return CtlFailed("reading the result file", hr);
    }

    CCollectorClient client(options.dwTimeoutMs);
    const wchar_t *wszPipe =
        options.wszPipe != nullptr ? options.wszPipe : c_wszTelvaneCollectorPipe;
    hr = client.Connect(wszPipe);
    if (FAILED(hr))
    {
        return CtlFailed("connecting to the collector pipe", hr);
    }
    printf("connected to %ls (service version %lu)\n", wszPipe,
           static_cast<unsigned long>(client.ServiceVersion()));
    hr = client.Register(collectorId);
    if (FAILED(hr))
    {
        return CtlFailed("registering the collector", hr);
    }
    printf("registered collector %s\n", CtlGuidText(collectorId).c_str());
    // Scripts wait for this line before they start the activity it should serve.
    fflush(stdout);
    fflush(stdout);

    DWORD cAnswered = 0;
    while (options.cRequests == 0 || cAnswered < options.cRequests)
    {
        GUID activityId;
        GUID logId;
        hr = client.WaitForRequest(&activityId, &logId, c_dwRequestSliceMs);
        if (hr == HRESULT_FROM_WIN32(ERROR_TIMEOUT))
        {
            continue;
        }
        if (hr == HRESULT_FROM_WIN32(ERROR_BROKEN_PIPE))
        {
            printf("the service ended the connection\n");
            return c_iExitOk;
        }
        if (FAILED(hr))
        {
            return CtlFailed("waiting for a collection request", hr);
        }
        hr = client.SendResult(vbResult.data(), vbResult.size());
        if (FAILED(hr))
        {
            return CtlFailed("sending the result", hr);
        }
        cAnswered++;
        printf("request for activity %s log %s: answered with %lu bytes\n",
               CtlGuidText(activityId).c_str(), CtlGuidText(logId).c_str(),
               static_cast<unsigned long>(vbResult.size()));
        fflush(stdout);
    }
    hr = client.BreakPipe();
    if (FAILED(hr))
    {
        return CtlFailed("breaking the pipe", hr);
    }
    printf("broke the pipe after %lu requests\n", static_cast<unsigned long>(cAnswered));
    return c_iExitOk;
}
} // namespace

int wmain(int argc, wchar_t **argv)
{
    if (argc < 2)
    {
        return CtlUsage("no command");
    }
    std::wstring command = argv[1];
    if (command != L"activity" && command != L"collector")
    {
        int cWords = 0;
        const CtlCommand *pCommand = CtlCommand::Find(argc - 1, argv + 1, &cWords);
        if (pCommand == nullptr)
        {
            return CtlUsage("unknown command");
        }
        return pCommand->Run(argc - 1 - cWords, argv + 1 + cWords);
    }
    CtlOptions options;
    const char *szProblem = nullptr;
    if (!CtlParseOptions(argc, argv, &options, &szProblem))
    {
        return CtlUsage(szProblem);
    }
    if (command == L"activity")
    {
        return CtlActivity(options);
    }
    if (command == L"collector")
    {
        return CtlCollector(options);
    }
    return CtlUsage("unknown command");
}
