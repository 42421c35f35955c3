#include "tests/common/tracefiles.h"
#include "tests/common/testsupport.h"

#include <gtest/gtest.h>
#include <rapidjson/error/en.h>
#include <rapidjson/stringbuffer.h>
#include <rapidjson/writer.h>

#include <algorithm>

namespace testsupport
{
const wchar_t c_wszTraceFolder[] = L"C:\\Data\\Test\\WiFiLog";
const wchar_t c_wszPreferenceKey[] =
    L"System\\CurrentControlSet\\Services\\Ambrel\\Parameters\\CrowdsrcPlugin";
const wchar_t c_wszPreferenceValue[] = L"EnableWifiCrowdsourcing";
const wchar_t c_wszTestLoggingKey[] = L"System\\CurrentControlSet\\Services\\Telvane\\Parameters";
const wchar_t c_wszTestLoggingValue[] = L"EnableTestLogging";

void AllowDelivery(DWORD dwTestLogging)
{
    CreateFolders(L"C:\\Data\\Test");
    HklmSetDword(c_wszPreferenceKey, c_wszPreferenceValue, 3);
    HklmSetDword(c_wszTestLoggingKey, c_wszTestLoggingValue, dwTestLogging);
}

void ResetDelivery()
{
    HklmDeleteValue(c_wszPreferenceKey, c_wszPreferenceValue);
    HklmDeleteValue(c_wszTestLoggingKey, c_wszTestLoggingValue);
    RemoveTree(c_wszTraceFolder);
}

void ParseStrict(const std::string &strText, rapidjson::Document &document)
{
    document.Parse<rapidjson::kParseValidateEncodingFlag>(strText.c_str(), strText.size());
    ASSERT_FALSE(document.HasParseError())
        << rapidjson::GetParseError_En(document.GetParseError()) << " at "
        << document.GetErrorOffset() << " in " << strText.substr(0, 2000);
}

std::vector<std::string> MemberNames(const rapidjson::Value &object)
{
    std::vector<std::string> rgNames;
    for (auto it = object.IsObject() ? object.MemberBegin() : object.MemberEnd();
         object.IsObject() && it != object.MemberEnd(); ++it)
    {
        rgNames.emplace_back(it->name.GetString(), it->name.GetStringLength());
    }
    return rgNames;
}

std::string JsonText(const rapidjson::Value &value)
{
    rapidjson::StringBuffer buffer;
    rapidjson::Writer<rapidjson::StringBuffer> writer(buffer);
    value.Accept(writer);
    return buffer.GetString();
}

namespace
{
// Files whose text holds strNeedle (all when empty); polling waits read only the runs they
// look for.
std::vector<DeliveredLog> ReadLogs(const std::string &strNeedle)
{
    std::vector<DeliveredLog> rgLogs;
    for (const std::wstring &wstrName : FileNames(c_wszTraceFolder))
    {
        if (wstrName.size() > 4 && wstrName.compare(wstrName.size() - 4, 4, L".tmp") == 0)
        {
            continue;
        }
        DeliveredLog log;
        log.wstrPath = std::wstring(c_wszTraceFolder) + L"\\" + wstrName;
        log.strText = ReadFileText(log.wstrPath);
        if (log.strText.find(strNeedle) == std::string::npos)
        {
            continue;
        }
        log.doc = std::make_shared<rapidjson::Document>();
        ParseStrict(log.strText, *log.doc);
        if (log.doc->IsObject() && log.doc->HasMember("LogCount") &&
            (*log.doc)["LogCount"].IsUint())
        {
            rgLogs.push_back(log);
        }
    }
    std::stable_sort(rgLogs.begin(), rgLogs.end(),
                     [](const DeliveredLog &a, const DeliveredLog &b) {
                         return (*a.doc)["LogCount"].GetUint() < (*b.doc)["LogCount"].GetUint();
                     });
    return rgLogs;
}
} // namespace

std::vector<DeliveredLog> DeliveredLogs()
{
    return ReadLogs(std::string());
}

std::vector<DeliveredLog> LogsOf(const GUID &logId)
{
    std::string strLogId = GuidText(logId);
    std::vector<DeliveredLog> rgLogs;
    for (DeliveredLog &log : ReadLogs(strLogId))
    {
        const rapidjson::Document &doc = *log.doc;
        if (doc.HasMember("LogID") && doc["LogID"].IsString() &&
            strLogId == doc["LogID"].GetString())
        {
            rgLogs.push_back(std::move(log));
        }
    }
    return rgLogs;
}

std::vector<DeliveredLog> WaitForLogs(const GUID &logId, size_t c)
{
    std::vector<DeliveredLog> rgLogs;
    WaitUntil([&] {
        rgLogs = LogsOf(logId);
        return rgLogs.size() >= c;
    });
    return rgLogs;
}

void DeleteLogsOf(const GUID &logId)
{
    for (const DeliveredLog &log : LogsOf(logId))
    {
        DeleteFileW(log.wstrPath.c_str());
    }
}

std::vector<std::string> GroupValues(const rapidjson::Value &log, const GUID &id)
{
    std::vector<std::string> rg;
    std::string strKey = "ID" + GuidText(id);
    auto it = log.FindMember(strKey.c_str());
    if (it == log.MemberEnd() || !it->value.IsArray())
    {
        return rg;
    }
    for (const rapidjson::Value &record : it->value.GetArray())
    {
        EXPECT_TRUE(record.IsObject() && record.HasMember("TimeStamp") && record.HasMember("Value"))
            << JsonText(record);
        if (record.IsObject() && record.HasMember("Value"))
        {
            rg.push_back(JsonText(record["Value"]));
        }
    }
    return rg;
}
} // namespace testsupport
