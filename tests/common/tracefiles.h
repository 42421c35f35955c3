// The traces the service delivers to files, read back with RapidJSON (an implementation
// independent of ours), and the two registry values that send them there. Used on the test
// thread; every helper works on the prefix's one trace folder.
#pragma once

#include <windows.h>

#include <rapidjson/document.h>

#include <memory>
#include <string>
#include <vector>

namespace testsupport
{
extern const wchar_t c_wszTraceFolder[];   // C:\Data\Test\WiFiLog
extern const wchar_t c_wszPreferenceKey[]; // "EnableWifiCrowdsourcing" lives here
extern const wchar_t c_wszPreferenceValue[];
extern const wchar_t c_wszTestLoggingKey[]; // "EnableTestLogging" lives here
extern const wchar_t c_wszTestLoggingValue[];

// Delivery allowed (3) and "EnableTestLogging" set (1: file, 2: file and submission), with
// the folders above the trace folder made (the service makes only the last one).
void AllowDelivery(DWORD dwTestLogging = 1);
// Both values gone and the trace folder removed.
void ResetDelivery();

// Parses strictly (UTF-8 checked, one value, nothing after it); the test fails on any error.
void ParseStrict(const std::string &strText, rapidjson::Document &document);
std::vector<std::string> MemberNames(const rapidjson::Value &object);
std::string JsonText(const rapidjson::Value &value);

// One delivered trace file, parsed strictly.
struct DeliveredLog
{
    std::wstring wstrPath;
    std::string strText;
    std::shared_ptr<rapidjson::Document> doc;
};
// Every file of the trace folder ("*.tmp" left out), ordered by "LogCount".
std::vector<DeliveredLog> DeliveredLogs();
// The logs of one run (by "LogID"), ordered by "LogCount".
std::vector<DeliveredLog> LogsOf(const GUID &logId);
// Waits until at least c logs of the run are there.
std::vector<DeliveredLog> WaitForLogs(const GUID &logId, size_t c);
void DeleteLogsOf(const GUID &logId);
// The values recorded under the group of id ("ID" + text) in the log, as JSON text each;
// every record must hold "TimeStamp" and "Value".
std::vector<std::string> GroupValues(const rapidjson::Value &log, const GUID &id);
} // namespace testsupport
