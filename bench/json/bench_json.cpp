// Throughput of the JSON work the service does, each beside RapidJSON doing the same in the
// same run: building and writing a trace-shaped document (a header, 100 groups of 100
// records with 200-byte raw values), and reading a 1 MiB document. Prints MB/s (10^6 bytes
// of JSON text per second, best of five rounds) and the ratios; never run as a test.
#include "bench/benchsupport.h"
#include "lib/cjsonobject.h"
#include "lib/jsonreader.h"

#include <rapidjson/document.h>
#include <rapidjson/stringbuffer.h>
#include <rapidjson/writer.h>

#include <chrono>
#include <memory>
#include <stdio.h>
#include <string>
#include <vector>

namespace
{
const ULONG c_cGroups = 100;
const ULONG c_cRecords = 100;
const size_t c_cbReadDocument = 1024 * 1024;

struct PhoneItem
{
    const char *szKey;
    const wchar_t *wszValue;
};
const PhoneItem c_rgPhone[] = {
    {"Manufacturer", L"Telvane Devices"},           {"PhoneModelName", L"TV-100"},
    {"PhoneMobileOperatorName", L"Example Mobile"}, {"PhoneFirmwareRevision", L"2.11.4.7"},
    {"PhoneFriendlyName", L"Test phone"},
};

struct Workload
{
    std::vector<std::string> rgstrGroupKeys; // "ID" and the group's GUID text
    std::vector<std::string> rgstrValues;    // one 200-byte JSON object per record
};

Workload MakeWorkload()
{
    Workload work;
    for (ULONG g = 0; g < c_cGroups; g++)
    {
        GUID guid = c_guidBenchLog;
        guid.Data1 = g;
        work.rgstrGroupKeys.push_back("ID" + GuidToString(guid));
    }
    for (ULONG r = 0; r < c_cRecords; r++)
    {
        work.rgstrValues.push_back(BenchRecordValue(r));
    }
    return work;
}

// The trace as the operation builds it: header members, "Orvex" and "Phone" added as
// objects, records moved into group arrays, the arrays moved into the trace.
CJsonObject *BuildTrace(const Workload &work, ULONG cGroups)
{
    CJsonObject *pTrace = new CJsonObject();
    pTrace->AddGuid("ActivityID", c_guidBenchActivity);
    pTrace->AddGuid("SessionID", c_guidBenchSession);
    pTrace->AddDword("JsonVersion", 24);
    pTrace->AddGuid("LogID", c_guidBenchLog);
    pTrace->AddString("WiFiConnID", L"00000000-0000-0000-0000-000000000000");
    pTrace->AddDword("LogCount", 1);
    pTrace->AddUlonglong("TimeStamp", 133000000000000000ull);
    CJsonObject *pOrvex = new CJsonObject();
    pOrvex->AddDouble("Major", 10);
    pOrvex->AddDouble("Minor", 0);
    pOrvex->AddDouble("Build", 14393);
    pOrvex->AddDouble("PlatformId", 2);
    pTrace->AddObject("Orvex", pOrvex);
    pOrvex->Release();
    CJsonObject *pPhone = new CJsonObject();
    for (const PhoneItem &item : c_rgPhone)
    {
        pPhone->AddString(item.szKey, item.wszValue);
    }
    pTrace->AddObject("Phone", pPhone);
    pPhone->Release();

    for (ULONG g = 0; g < cGroups; g++)
    {
        CJsonArray *pGroup = new CJsonArray();
        for (ULONG r = 0; r < c_cRecords; r++)
        {
            const std::string &strValue = work.rgstrValues[r];
            CJsonObject *pRecord = new CJsonObject();
            pRecord->AddUlonglong("TimeStamp", 133000000000000000ull + g * c_cRecords + r);
            pRecord->AddRawJson("Value", strValue.c_str(), static_cast<DWORD>(strValue.size() + 1));
            pGroup->AddObject(pRecord);
        }
        pTrace->AddArray(work.rgstrGroupKeys[g % work.rgstrGroupKeys.size()], pGroup);
        pGroup->Release(0);
    }
    pTrace->AddBool("LogEnd", true);
    return pTrace;
}

// The same text through RapidJSON's streaming writer, which builds no tree at all.
std::string WriteTraceRapid(const Workload &work)
{
    rapidjson::StringBuffer buffer;
    rapidjson::Writer<rapidjson::StringBuffer> writer(buffer);
    writer.StartObject();
    writer.Key("ActivityID");
    writer.String(GuidToString(c_guidBenchActivity).c_str());
    writer.Key("SessionID");
    writer.String(GuidToString(c_guidBenchSession).c_str());
    writer.Key("JsonVersion");
    writer.Uint(24);
    writer.Key("LogID");
    writer.String(GuidToString(c_guidBenchLog).c_str());
    writer.Key("WiFiConnID");
    writer.String(WideToNarrow(L"00000000-0000-0000-0000-000000000000").c_str());
    writer.Key("LogCount");
    writer.Uint(1);
    writer.Key("TimeStamp");
    writer.Uint64(133000000000000000ull);
    writer.Key("Orvex");
    writer.StartObject();
    writer.Key("Major");
    writer.Uint(10);
    writer.Key("Minor");
    writer.Uint(0);
    writer.Key("Build");
    writer.Uint(14393);
    writer.Key("PlatformId");
    writer.Uint(2);
    writer.EndObject();
    writer.Key("Phone");
    writer.StartObject();
    for (const PhoneItem &item : c_rgPhone)
    {
        writer.Key(item.szKey);
        writer.String(WideToNarrow(item.wszValue).c_str());
    }
    writer.EndObject();
    for (ULONG g = 0; g < c_cGroups; g++)
    {
        writer.Key(work.rgstrGroupKeys[g].c_str());
        writer.StartArray();
        for (ULONG r = 0; r < c_cRecords; r++)
        {
            const std::string &strValue = work.rgstrValues[r];
            writer.StartObject();
            writer.Key("TimeStamp");
            writer.Uint64(133000000000000000ull + g * c_cRecords + r);
            writer.Key("Value");
            writer.RawValue(strValue.c_str(), strValue.size(), rapidjson::kObjectType);
            writer.EndObject();
        }
        writer.EndArray();
    }
    writer.Key("LogEnd");
    writer.Bool(true);
    writer.EndObject();
    return std::string(buffer.GetString(), buffer.GetSize());
}

// Best throughput of five rounds, each repeating the work for at least 0.2 s.
template <class F>
double MegabytesPerSecond(size_t cbPerRun, F work)
{
    typedef std::chrono::steady_clock Clock;
    double dblBest = 0;
    for (int iRound = 0; iRound < 5; iRound++)
    {
        Clock::time_point start = Clock::now();
        unsigned long cRuns = 0;
        double dblSeconds = 0;
        do
        {
            work();
            cRuns++;
            dblSeconds = std::chrono::duration<double>(Clock::now() - start).count();
        } while (dblSeconds < 0.2);
        double dblRate = static_cast<double>(cbPerRun) * cRuns / dblSeconds / 1e6;
        dblBest = dblRate > dblBest ? dblRate : dblBest;
    }
    return dblBest;
}

bool RapidAccepts(const std::string &strText)
{
    rapidjson::Document document;
    document.Parse(strText.c_str());
    return !document.HasParseError();
}
} // namespace

int main()
{
    Workload work = MakeWorkload();

    // Writing.
    CJsonObject *pTrace = BuildTrace(work, c_cGroups);
    std::string strOurs;
    pTrace->ToString(strOurs);
    std::string strRapid = WriteTraceRapid(work);
    printf("trace: %lu groups x %lu records, 200-byte values; %zu bytes (RapidJSON's text %zu "
           "bytes); RapidJSON parses ours: %s\n",
           c_cGroups, c_cRecords, strOurs.size(), strRapid.size(),
           RapidAccepts(strOurs) ? "yes" : "NO");

    double dblBuildWrite = MegabytesPerSecond(strOurs.size(), [&] {
        CJsonObject *p = BuildTrace(work, c_cGroups);
        std::string str;
        p->ToString(str);
        p->Release();
    });
    double dblWriteOnly = MegabytesPerSecond(strOurs.size(), [&] {
        std::string str;
        pTrace->ToString(str);
    });
    double dblRapidWrite = MegabytesPerSecond(strRapid.size(), [&] { WriteTraceRapid(work); });
    pTrace->Release();
    printf("write trace: telvane build+write %.1f MB/s, telvane write of a built tree %.1f MB/s, "
           "RapidJSON Writer %.1f MB/s; ratios to RapidJSON %.2f and %.2f\n",
           dblBuildWrite, dblWriteOnly, dblRapidWrite, dblBuildWrite / dblRapidWrite,
           dblWriteOnly / dblRapidWrite);

    // Reading: a trace of just enough groups to pass 1 MiB.
    CJsonObject *pOneGroup = BuildTrace(work, 1);
    std::string strOneGroup;
    pOneGroup->ToString(strOneGroup);
    pOneGroup->Release();
    ULONG cReadGroups = static_cast<ULONG>(c_cbReadDocument / (strOneGroup.size() - 600) + 1);
    CJsonObject *pReadTrace = BuildTrace(work, cReadGroups);
    std::string strDocument;
    pReadTrace->ToString(strDocument);
    pReadTrace->Release();
    std::unique_ptr<JsonValue> check(JsonReader::FromJsonString(strDocument.c_str()));
    std::string strReread;
    check->ToString(strReread);
    printf("read document: %zu bytes, %lu groups; read and written again unchanged: %s; "
           "RapidJSON parses it: %s\n",
           strDocument.size(), cReadGroups, strReread == strDocument ? "yes" : "NO",
           RapidAccepts(strDocument) ? "yes" : "NO");

    double dblRead = MegabytesPerSecond(
        strDocument.size(), [&] { delete JsonReader::FromJsonString(strDocument.c_str()); });
    double dblRapidRead = MegabytesPerSecond(strDocument.size(), [&] {
        rapidjson::Document document;
        document.Parse(strDocument.c_str());
    });
    printf("read 1 MiB: telvane %.1f MB/s, RapidJSON Document::Parse %.1f MB/s; ratio %.2f\n",
           dblRead, dblRapidRead, dblRead / dblRapidRead);
    return 0;
}
