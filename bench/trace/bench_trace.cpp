// Building and delivering one trace of 100 groups x 100 records with 200-byte values: through
// the service's real steps (records validated and added, the log closed, the preference and
// test values read, the text written to a trace file), beside RapidJSON building the same
// document and handing it to the same file sink, in the same run. Prints MB/s (10^6 bytes of
// trace text per second, best of five rounds of at least 0.5 s), the ratios, and where our
// time goes. Sets the two delivery values of the prefix for the run and puts them back.
#include "bench/benchsupport.h"
#include "lib/cjsonobject.h"
#include "lib/jsonvalidator.h"
#include "service/ctracedocument.h"
#include "service/tracesinks.h"

#include <rapidjson/document.h>
#include <rapidjson/stringbuffer.h>
#include <rapidjson/writer.h>

#include <chrono>
#include <functional>
#include <stdio.h>
#include <string>
#include <vector>

namespace
{
typedef std::chrono::steady_clock Clock;

const ULONG c_cGroups = 100;
const ULONG c_cRecords = 100;

const wchar_t c_wszPreferenceKey[] =
    L"System\\CurrentControlSet\\Services\\Ambrel\\Parameters\\CrowdsrcPlugin";
const wchar_t c_wszTestKey[] = L"System\\CurrentControlSet\\Services\\Telvane\\Parameters";

GUID GroupId(ULONG g)
{
    GUID guid = c_guidBenchLog;
    guid.Data1 = g;
    return guid;
}

// A registry DWORD set for the run and put back as it was.
class CSavedDword
{
public:
    CSavedDword(const wchar_t *wszKey, const wchar_t *wszValue, DWORD dwValue)
        : m_wszKey(wszKey)
        , m_wszValue(wszValue)
    {
        DWORD cb = sizeof(m_dwOld);
        m_fHad = RegGetValueW(HKEY_LOCAL_MACHINE, wszKey, wszValue, RRF_RT_REG_DWORD, nullptr,
                              &m_dwOld, &cb) == ERROR_SUCCESS;
        Set(dwValue);
    }
    ~CSavedDword()
    {
        if (m_fHad)
        {
            Set(m_dwOld);
        }
        else
        {
            RegDeleteKeyValueW(HKEY_LOCAL_MACHINE, m_wszKey, m_wszValue);
        }
    }

private:
    void Set(DWORD dw)
    {
        RegSetKeyValueW(HKEY_LOCAL_MACHINE, m_wszKey, m_wszValue, REG_DWORD, &dw, sizeof(dw));
    }
    const wchar_t *m_wszKey;
    const wchar_t *m_wszValue;
    DWORD m_dwOld = 0;
    bool m_fHad = false;
};

void RemoveTraceFiles()
{
    std::wstring wstrDirectory = TraceSinks::c_wszTraceDirectory;
    WIN32_FIND_DATAW data;
    HANDLE hFind = FindFirstFileW((wstrDirectory + L"\\*").c_str(), &data);
    if (hFind == INVALID_HANDLE_VALUE)
    {
        return;
    }
    do
    {
        if (!(data.dwFileAttributes & FILE_ATTRIBUTE_DIRECTORY))
        {
            DeleteFileW((wstrDirectory + L"\\" + data.cFileName).c_str());
        }
    } while (FindNextFileW(hFind, &data));
    FindClose(hFind);
}

// Best rate of five rounds; each round repeats the work for at least 0.5 s of its own time.
// The trace files are removed between runs, outside the measured time.
double MegabytesPerSecond(size_t cbPerRun, const std::function<void()> &work)
{
    double dblBest = 0;
    for (int iRound = 0; iRound < 5; iRound++)
    {
        double dblSeconds = 0;
        unsigned long cRuns = 0;
        while (dblSeconds < 0.5)
        {
            Clock::time_point start = Clock::now();
            work();
            dblSeconds += std::chrono::duration<double>(Clock::now() - start).count();
            cRuns++;
            RemoveTraceFiles();
        }
        double dblRate = static_cast<double>(cbPerRun) * cRuns / dblSeconds / 1e6;
        dblBest = dblRate > dblBest ? dblRate : dblBest;
    }
    return dblBest;
}

// The real steps: the log begun (header, device description), the records added, the log
// closed and delivered to a file.
void DeliverThroughTheSteps(const std::vector<std::string> &rgValues)
{
    CTraceDocument document;
    document.Begin(c_guidBenchActivity, c_guidBenchSession, c_guidBenchLog);
    for (ULONG g = 0; g < c_cGroups; g++)
    {
        GUID id = GroupId(g);
        for (ULONG r = 0; r < c_cRecords; r++)
        {
            const std::string &strValue = rgValues[r];
            document.RecordEvent(id, reinterpret_cast<const BYTE *>(strValue.c_str()),
                                 strValue.size() + 1);
        }
    }
    document.FlushAndRestart(true);
}

// The header values as the steps find them, so both sides write the same document.
struct Header
{
    std::string strConnId;
    ULONGLONG ullNow;
    std::vector<std::pair<std::string, std::string>> rgPhoneTexts;
    std::vector<std::pair<std::string, unsigned>> rgPhoneNumbers;
    OSVERSIONINFOW version;
};

ULONGLONG Now()
{
    SYSTEMTIME st;
    GetSystemTime(&st);
    FILETIME ft;
    SystemTimeToFileTime(&st, &ft);
    return (static_cast<ULONGLONG>(ft.dwHighDateTime) << 32) | ft.dwLowDateTime;
}

template <class Writer>
void WriteHeader(Writer &writer, const Header &header)
{
    writer.Key("ActivityID");
    writer.String(GuidToString(c_guidBenchActivity).c_str());
    writer.Key("SessionID");
    writer.String(GuidToString(c_guidBenchSession).c_str());
    writer.Key("JsonVersion");
    writer.Uint(24);
    writer.Key("LogID");
    writer.String(GuidToString(c_guidBenchLog).c_str());
    writer.Key("WiFiConnID");
    writer.String(header.strConnId.c_str());
    writer.Key("LogCount");
    writer.Uint(1);
    writer.Key("TimeStamp");
    writer.Uint64(Now());
    writer.Key("Orvex");
    writer.StartObject();
    writer.Key("Major");
    writer.Uint(header.version.dwMajorVersion);
    writer.Key("Minor");
    writer.Uint(header.version.dwMinorVersion);
    writer.Key("Build");
    writer.Uint(header.version.dwBuildNumber);
    writer.Key("PlatformId");
    writer.Uint(header.version.dwPlatformId);
    writer.EndObject();
    writer.Key("Phone");
    writer.StartObject();
    for (const auto &number : header.rgPhoneNumbers)
    {
        writer.Key(number.first.c_str());
        writer.Uint(number.second);
    }
    for (const auto &text : header.rgPhoneTexts)
    {
        writer.Key(text.first.c_str());
        writer.String(text.second.c_str());
    }
    writer.EndObject();
}

// RapidJSON's streaming writer: no tree, each value inserted raw as it comes.
void DeliverThroughRapidWriter(const Header &header, const std::vector<std::string> &rgValues,
                               const std::vector<std::string> &rgGroupKeys)
{
    rapidjson::StringBuffer buffer;
    rapidjson::Writer<rapidjson::StringBuffer> writer(buffer);
    writer.StartObject();
    WriteHeader(writer, header);
    for (ULONG g = 0; g < c_cGroups; g++)
    {
        writer.Key(rgGroupKeys[g].c_str());
        writer.StartArray();
        for (ULONG r = 0; r < c_cRecords; r++)
        {
            writer.StartObject();
            writer.Key("TimeStamp");
            writer.Uint64(Now());
            writer.Key("Value");
            writer.RawValue(rgValues[r].c_str(), rgValues[r].size(), rapidjson::kObjectType);
            writer.EndObject();
        }
        writer.EndArray();
    }
    writer.Key("LogEnd");
    writer.Bool(true);
    writer.EndObject();
    TraceSinks::WriteTraceToFile(buffer.GetString(), buffer.GetSize());
}

// RapidJSON's tree: records kept until the log closes, as the service keeps them, so each
// value is parsed into the tree (a DOM holds no raw text), then the tree is written.
void DeliverThroughRapidDocument(const Header &header, const std::vector<std::string> &rgValues,
                                 const std::vector<std::string> &rgGroupKeys)
{
    rapidjson::Document document;
    rapidjson::Document::AllocatorType &allocator = document.GetAllocator();
    document.SetObject();
    std::vector<rapidjson::Value> rgGroups;
    for (ULONG g = 0; g < c_cGroups; g++)
    {
        rgGroups.emplace_back(rapidjson::kArrayType);
        for (ULONG r = 0; r < c_cRecords; r++)
        {
            rapidjson::Document value(&allocator);
            value.Parse(rgValues[r].c_str());
            rapidjson::Value record(rapidjson::kObjectType);
            record.AddMember("TimeStamp", rapidjson::Value(static_cast<uint64_t>(Now())),
                             allocator);
            record.AddMember("Value", rapidjson::Value(value, allocator), allocator);
            rgGroups.back().PushBack(record, allocator);
        }
    }
    rapidjson::StringBuffer buffer;
    rapidjson::Writer<rapidjson::StringBuffer> writer(buffer);
    writer.StartObject();
    WriteHeader(writer, header);
    for (ULONG g = 0; g < c_cGroups; g++)
    {
        writer.Key(rgGroupKeys[g].c_str());
        rgGroups[g].Accept(writer);
    }
    writer.Key("LogEnd");
    writer.Bool(true);
    writer.EndObject();
    TraceSinks::WriteTraceToFile(buffer.GetString(), buffer.GetSize());
}

size_t TraceFileSize()
{
    std::wstring wstrDirectory = TraceSinks::c_wszTraceDirectory;
    WIN32_FIND_DATAW data;
    HANDLE hFind = FindFirstFileW((wstrDirectory + L"\\*").c_str(), &data);
    size_t cb = 0;
    if (hFind != INVALID_HANDLE_VALUE)
    {
        do
        {
            if (!(data.dwFileAttributes & FILE_ATTRIBUTE_DIRECTORY))
            {
                cb += data.nFileSizeLow;
            }
        } while (FindNextFileW(hFind, &data));
        FindClose(hFind);
    }
    return cb;
}

double SecondsOf(const std::function<void()> &work, int cRuns)
{
    double dblBest = 1e9;
    for (int i = 0; i < cRuns; i++)
    {
        Clock::time_point start = Clock::now();
        work();
        double dbl = std::chrono::duration<double>(Clock::now() - start).count();
        dblBest = dbl < dblBest ? dbl : dblBest;
        RemoveTraceFiles();
    }
    return dblBest;
}
} // namespace

int main()
{
    CreateDirectoryW(L"C:\\Data", nullptr);
    CreateDirectoryW(L"C:\\Data\\Test", nullptr);
    CSavedDword preference(c_wszPreferenceKey, L"EnableWifiCrowdsourcing", 3);
    CSavedDword testLogging(c_wszTestKey, L"EnableTestLogging", 1);
    RemoveTraceFiles();

    std::vector<std::string> rgValues;
    for (ULONG r = 0; r < c_cRecords; r++)
    {
        rgValues.push_back(BenchRecordValue(r));
    }
    std::vector<std::string> rgGroupKeys;
    for (ULONG g = 0; g < c_cGroups; g++)
    {
        rgGroupKeys.push_back("ID" + GuidToString(GroupId(g)));
    }

    // The header as the steps write it, taken from one log of ours.
    Header header = {};
    header.version.dwOSVersionInfoSize = sizeof(header.version);
    GetVersionExW(&header.version);
    {
        CTraceDocument probe;
        probe.Begin(c_guidBenchActivity, c_guidBenchSession, c_guidBenchLog);
        std::string strProbe = probe.CurrentText();
        rapidjson::Document parsed;
        parsed.Parse(strProbe.c_str());
        header.strConnId = parsed["WiFiConnID"].GetString();
        for (auto it = parsed["Phone"].MemberBegin(); it != parsed["Phone"].MemberEnd(); ++it)
        {
            if (it->value.IsString())
            {
                header.rgPhoneTexts.emplace_back(it->name.GetString(), it->value.GetString());
            }
            else
            {
                header.rgPhoneNumbers.emplace_back(it->name.GetString(), it->value.GetUint());
            }
        }
    }

    DeliverThroughTheSteps(rgValues);
    size_t cbOurs = TraceFileSize();
    RemoveTraceFiles();
    DeliverThroughRapidWriter(header, rgValues, rgGroupKeys);
    size_t cbRapid = TraceFileSize();
    RemoveTraceFiles();
    printf("trace: %lu groups x %lu records, 200-byte values; %zu bytes through the steps, "
           "%zu bytes through RapidJSON\n",
           c_cGroups, c_cRecords, cbOurs, cbRapid);
    if (cbOurs == 0)
    {
        printf("no trace file was written: is C:\\Data\\Test in the prefix?\n");
        return 1;
    }

    double dblOurs = MegabytesPerSecond(cbOurs, [&] { DeliverThroughTheSteps(rgValues); });
    double dblRapidWriter = MegabytesPerSecond(
        cbRapid, [&] { DeliverThroughRapidWriter(header, rgValues, rgGroupKeys); });
    double dblRapidDocument = MegabytesPerSecond(
        cbRapid, [&] { DeliverThroughRapidDocument(header, rgValues, rgGroupKeys); });
    printf("build and deliver to a file: telvane steps %.1f MB/s, RapidJSON Writer (raw values, "
           "no tree) %.1f MB/s, RapidJSON Document (values parsed into the tree) %.1f MB/s\n",
           dblOurs, dblRapidWriter, dblRapidDocument);
    printf("ratio telvane/RapidJSON: %.2f against the Writer, %.2f against the Document\n",
           dblOurs / dblRapidWriter, dblOurs / dblRapidDocument);

    // Where our time goes, best of seven single runs each.
    std::string strTrace;
    double dblValidate = SecondsOf(
        [&] {
            size_t cValid = 0;
            for (ULONG g = 0; g < c_cGroups; g++)
            {
                for (ULONG r = 0; r < c_cRecords; r++)
                {
                    cValid += JsonValidateText(rgValues[r]) ? 1 : 0;
                }
            }
            if (cValid != c_cGroups * c_cRecords)
            {
                printf("validation refused a value\n");
            }
        },
        7);
    double dblBegin = SecondsOf(
        [&] {
            CTraceDocument document;
            document.Begin(c_guidBenchActivity, c_guidBenchSession, c_guidBenchLog);
        },
        7);
    // Records alone: the document of each run is deleted outside the measured time.
    double dblRecord = 1e9;
    double dblFlush = 1e9;
    for (int i = 0; i < 7; i++)
    {
        CTraceDocument *pDocument = new CTraceDocument();
        pDocument->Begin(c_guidBenchActivity, c_guidBenchSession, c_guidBenchLog);
        Clock::time_point start = Clock::now();
        for (ULONG g = 0; g < c_cGroups; g++)
        {
            GUID id = GroupId(g);
            for (ULONG r = 0; r < c_cRecords; r++)
            {
                pDocument->RecordEvent(id, reinterpret_cast<const BYTE *>(rgValues[r].c_str()),
                                       rgValues[r].size() + 1);
            }
        }
        double dbl = std::chrono::duration<double>(Clock::now() - start).count();
        dblRecord = dbl < dblRecord ? dbl : dblRecord;
        start = Clock::now();
        pDocument->FlushAndRestart(true);
        dbl = std::chrono::duration<double>(Clock::now() - start).count();
        dblFlush = dbl < dblFlush ? dbl : dblFlush;
        delete pDocument;
        RemoveTraceFiles();
    }
    double dblFileOnly = SecondsOf(
        [&] {
            strTrace.assign(cbOurs, ' ');
            TraceSinks::WriteTraceToFile(strTrace.data(), strTrace.size());
        },
        7);
    printf("telvane per trace: begin %.2f ms, 10000 records %.2f ms (of which validating the "
           "values %.2f ms), close + to text + deliver + begin the next %.2f ms (of which the "
           "file alone %.2f ms)\n",
           dblBegin * 1e3, dblRecord * 1e3, dblValidate * 1e3, dblFlush * 1e3, dblFileOnly * 1e3);
    RemoveTraceFiles();
    return 0;
}
