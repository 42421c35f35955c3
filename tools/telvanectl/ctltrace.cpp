// telvanectl trace: the traces the service delivered on this machine, as files in the trace
// folder or as submissions the submission stand-in accepted. "list" gives one line each,
// newest first; "show" prints a trace with its header summarised on top.
#include "lib/jsonreader.h"
#include "platform/submission/submissioncontrol.h"
#include "service/tracesinks.h"
#include "tools/telvanectl/ctlcommand.h"
#include "tools/telvanectl/ctltraceformat.h"

#include <stdio.h>

#include <algorithm>
#include <cwctype>
#include <memory>
#include <string>
#include <vector>

namespace
{
struct CtlTrace
{
    std::wstring wstrPath;
    const char *szSink; // "file" or "submission"
    ULONGLONG ullWhen;  // file written or submission accepted
    std::string strText;
    std::unique_ptr<JsonValue> root;

    const JsonObjectNode *Object() const
    {
        return root && root->Type() == JsonNodeType::Object
                   ? static_cast<const JsonObjectNode *>(root.get())
                   : nullptr;
    }
    std::string Member(const char *szName) const
    {
        std::string str;
        if (Object() == nullptr || !Object()->GetMemberText(szName, str))
        {
            return "-";
        }
        return str;
    }
};

bool ReadFileText(const std::wstring &wstrPath, std::string *pstr, ULONGLONG *pullWritten)
{
    HANDLE hFile = CreateFileW(wstrPath.c_str(), GENERIC_READ,
                               FILE_SHARE_READ | FILE_SHARE_WRITE | FILE_SHARE_DELETE, nullptr,
                               OPEN_EXISTING, FILE_ATTRIBUTE_NORMAL, nullptr);
    if (hFile == INVALID_HANDLE_VALUE)
    {
        return false;
    }
    FILETIME ftWritten = {};
    GetFileTime(hFile, nullptr, nullptr, &ftWritten);
    *pullWritten =
        (static_cast<ULONGLONG>(ftWritten.dwHighDateTime) << 32) | ftWritten.dwLowDateTime;
    pstr->clear();
    char rgch[65536];
    DWORD cbRead = 0;
    bool fOk = true;
    while ((fOk = ReadFile(hFile, rgch, sizeof(rgch), &cbRead, nullptr) != FALSE) && cbRead > 0)
    {
        pstr->append(rgch, cbRead);
    }
    CloseHandle(hFile);
    return fOk;
}

void Parse(CtlTrace &trace)
{
    trace.root.reset(JsonReader::FromJsonString(trace.strText.c_str()));
}

bool EndsWith(const std::wstring &wstr, const std::wstring &wstrSuffix)
{
    return wstr.size() >= wstrSuffix.size() &&
           wstr.compare(wstr.size() - wstrSuffix.size(), wstrSuffix.size(), wstrSuffix) == 0;
}

// One trace file or spooled submission; false when it cannot be read.
bool LoadPath(const std::wstring &wstrPath, CtlTrace &trace)
{
    if (EndsWith(wstrPath, c_wszSubmissionSuffix))
    {
        SUBMISSION_RECORD record;
        if (!SubmissionReadFile(wstrPath, &record))
        {
            return false;
        }
        trace.wstrPath = wstrPath;
        trace.szSink = "submission";
        trace.ullWhen = record.ullSubmitted;
        trace.strText = std::move(record.strData);
    }
    else
    {
        trace.wstrPath = wstrPath;
        trace.szSink = "file";
        if (!ReadFileText(wstrPath, &trace.strText, &trace.ullWhen))
        {
            return false;
        }
    }
    Parse(trace);
    return true;
}

// Every trace file (files still being written are skipped) and every submission.
std::vector<CtlTrace> LoadAll()
{
    std::vector<CtlTrace> rgTraces;
    std::wstring wstrDirectory = TraceSinks::c_wszTraceDirectory;
    WIN32_FIND_DATAW data;
    HANDLE hFind = FindFirstFileW((wstrDirectory + L"\\*").c_str(), &data);
    if (hFind != INVALID_HANDLE_VALUE)
    {
        do
        {
            std::wstring wstrName = data.cFileName;
            if ((data.dwFileAttributes & FILE_ATTRIBUTE_DIRECTORY) ||
                EndsWith(wstrName, TraceSinks::c_wszTemporarySuffix))
            {
                continue;
            }
            CtlTrace trace;
            if (LoadPath(wstrDirectory + L"\\" + wstrName, trace))
            {
                rgTraces.push_back(std::move(trace));
            }
        } while (FindNextFileW(hFind, &data));
        FindClose(hFind);
    }
    for (SUBMISSION_RECORD &record : SubmissionList())
    {
        CtlTrace trace;
        trace.wstrPath = record.wstrPath;
        trace.szSink = "submission";
        trace.ullWhen = record.ullSubmitted;
        trace.strText = std::move(record.strData);
        Parse(trace);
        rgTraces.push_back(std::move(trace));
    }
    std::stable_sort(rgTraces.begin(), rgTraces.end(),
                     [](const CtlTrace &a, const CtlTrace &b) { return a.ullWhen > b.ullWhen; });
    return rgTraces;
}

int CtlTraceList()
{
    std::vector<CtlTrace> rgTraces = LoadAll();
    printf("%-27s %-10s %-36s %5s %-6s %9s  %s\n", "WHEN", "SINK", "LOGID", "LOG", "END", "BYTES",
           "WHERE");
    for (const CtlTrace &trace : rgTraces)
    {
        printf("%-27s %-10s %-36s %5s %-6s %9u  %ls\n", CtlFormatFileTime(trace.ullWhen).c_str(),
               trace.szSink, trace.Member("LogID").c_str(), trace.Member("LogCount").c_str(),
               trace.Member("LogEnd").c_str(), static_cast<unsigned>(trace.strText.size()),
               trace.wstrPath.c_str());
    }
    printf("%u trace(s)\n", static_cast<unsigned>(rgTraces.size()));
    return c_iCtlExitOk;
}

std::string TimeMember(const CtlTrace &trace, const char *szName)
{
    std::string str = trace.Member(szName);
    if (str == "-")
    {
        return "-";
    }
    return CtlFormatFileTime(strtoull(str.c_str(), nullptr, 10)) + " (" + str + ")";
}

void ShowTrace(const CtlTrace &trace)
{
    printf("Trace %ls\n", trace.wstrPath.c_str());
    printf("  Sink           %s, %u bytes, %s\n", trace.szSink,
           static_cast<unsigned>(trace.strText.size()), CtlFormatFileTime(trace.ullWhen).c_str());
    printf("  LogID          %s\n", trace.Member("LogID").c_str());
    printf("  ActivityID     %s\n", trace.Member("ActivityID").c_str());
    printf("  SessionID      %s\n", trace.Member("SessionID").c_str());
    printf("  LogCount       %s   LogEnd %s   JsonVersion %s\n", trace.Member("LogCount").c_str(),
           trace.Member("LogEnd").c_str(), trace.Member("JsonVersion").c_str());
    printf("  TimeStamp      %s\n", TimeMember(trace, "TimeStamp").c_str());
    printf("  ExecutionTime  %s\n", TimeMember(trace, "ExecutionTime").c_str());
    printf("  WiFiConnID     %s\n", trace.Member("WiFiConnID").c_str());
    const JsonObjectNode *pObject = trace.Object();
    if (pObject == nullptr)
    {
        printf("  (not a JSON object)\n%s\n", trace.strText.c_str());
        return;
    }
    std::unique_ptr<JsonValue> orvex(JsonReader::FromJsonString(trace.Member("Orvex").c_str()));
    std::unique_ptr<JsonValue> phone(JsonReader::FromJsonString(trace.Member("Phone").c_str()));
    auto member = [](const std::unique_ptr<JsonValue> &value, const char *szName) {
        std::string str;
        if (value->Type() != JsonNodeType::Object ||
            !static_cast<const JsonObjectNode *>(value.get())->GetMemberText(szName, str))
        {
            return std::string("?");
        }
        return str;
    };
    printf("  Orvex          %s.%s.%s, platform %s\n", member(orvex, "Major").c_str(),
           member(orvex, "Minor").c_str(), member(orvex, "Build").c_str(),
           member(orvex, "PlatformId").c_str());
    printf("  Phone          %s %s, build %s.%s.%s.%s (%s)\n",
           member(phone, "Manufacturer").c_str(), member(phone, "PhoneModelName").c_str(),
           member(phone, "OV_MajorVersion").c_str(), member(phone, "OV_MinorVersion").c_str(),
           member(phone, "BuildNumber").c_str(), member(phone, "QFELevel").c_str(),
           member(phone, "Branch").c_str());
    size_t cGroups = 0;
    size_t cRecords = 0;
    for (const JsonMember &m : pObject->Members())
    {
        if (m.strName.compare(0, 2, "ID") == 0 && m.pValue->Type() == JsonNodeType::Array)
        {
            size_t c = static_cast<const JsonArrayNode *>(m.pValue)->Elements().size();
            printf("  Group          %s: %u record(s)\n", m.strName.c_str() + 2,
                   static_cast<unsigned>(c));
            cGroups++;
            cRecords += c;
        }
    }
    printf("  Groups         %u, %u record(s)\n\n", static_cast<unsigned>(cGroups),
           static_cast<unsigned>(cRecords));
    fputs(CtlPrettyJson(trace.strText).c_str(), stdout);
}

// A LogID as the trace writes it: lower case, no braces.
std::string NormalizeGuid(const std::wstring &wstr)
{
    std::wstring wstrBare = wstr;
    if (wstrBare.size() == 38 && wstrBare.front() == L'{' && wstrBare.back() == L'}')
    {
        wstrBare = wstrBare.substr(1, 36);
    }
    std::string str;
    for (wchar_t wch : wstrBare)
    {
        str += static_cast<char>(std::towlower(wch));
    }
    return str;
}

int CtlTraceShow(const std::wstring &wstrWhich)
{
    // A path, a name in the trace folder, or a LogID (every log of that run, in order).
    std::vector<std::wstring> rgCandidates = {
        wstrWhich, std::wstring(TraceSinks::c_wszTraceDirectory) + L"\\" + wstrWhich};
    for (const std::wstring &wstrPath : rgCandidates)
    {
        DWORD dwAttributes = GetFileAttributesW(wstrPath.c_str());
        if (dwAttributes != INVALID_FILE_ATTRIBUTES && !(dwAttributes & FILE_ATTRIBUTE_DIRECTORY))
        {
            CtlTrace trace;
            if (!LoadPath(wstrPath, trace))
            {
                fprintf(stderr, "telvanectl: cannot read %ls\n", wstrPath.c_str());
                return c_iCtlExitFailed;
            }
            ShowTrace(trace);
            return c_iCtlExitOk;
        }
    }
    std::string strLogId = NormalizeGuid(wstrWhich);
    std::vector<CtlTrace> rgTraces = LoadAll();
    std::vector<const CtlTrace *> rgMatches;
    for (const CtlTrace &trace : rgTraces)
    {
        if (trace.Member("LogID") == strLogId)
        {
            rgMatches.push_back(&trace);
        }
    }
    if (rgMatches.empty())
    {
        fprintf(stderr, "telvanectl: no trace file or LogID %ls\n", wstrWhich.c_str());
        return c_iCtlExitFailed;
    }
    std::stable_sort(rgMatches.begin(), rgMatches.end(), [](const CtlTrace *a, const CtlTrace *b) {
        return strtoul(a->Member("LogCount").c_str(), nullptr, 10) <
               strtoul(b->Member("LogCount").c_str(), nullptr, 10);
    });
    for (size_t i = 0; i < rgMatches.size(); i++)
    {
        if (i > 0)
        {
            printf("\n");
        }
        ShowTrace(*rgMatches[i]);
    }
    return c_iCtlExitOk;
}

int CtlTrace(int argc, wchar_t **argv)
{
    std::wstring wstrVerb = argc > 0 ? argv[0] : L"list";
    if (wstrVerb == L"list" && argc <= 1)
    {
        return CtlTraceList();
    }
    if (wstrVerb == L"show" && argc == 2)
    {
        return CtlTraceShow(argv[1]);
    }
    return CtlCommandUsage("trace: list, or show FILE|LOGID");
}

const CtlCommand s_command(
    L"trace", CtlTrace,
    "       telvanectl trace [list]               delivered traces (files and submissions),\n"
    "                                             newest first\n"
    "       telvanectl trace show FILE|LOGID      a trace, its header summarised on top\n");
} // namespace
