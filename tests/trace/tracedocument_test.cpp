// The trace document through its real steps: header member order and forms of the first and
// later logs, records and their groups, the device description from the device information
// stand-in, "ConnID", the clock failing, and values that are not JSON. Every written trace
// is read back by RapidJSON, strictly.
#include "service/ctracedocument.h"

#include "lib/jsonreader.h"
#include "tests/common/tracesession.h"
#include "tests/trace/deliverystate.h"

#include <algorithm>
#include <memory>
#include <string>
#include <vector>

using namespace testsupport;
using namespace tracetest;

namespace
{
const GUID c_guidEventA = {
    0xaaaaaaaa, 0x0000, 0x4000, {0x80, 0x00, 0x00, 0x00, 0x00, 0x00, 0x00, 0x0a}};
// Differs from A in its last byte only: groups are told apart by the whole GUID.
const GUID c_guidEventB = {
    0xaaaaaaaa, 0x0000, 0x4000, {0x80, 0x00, 0x00, 0x00, 0x00, 0x00, 0x00, 0x0b}};
const GUID c_guidZero = {};

const std::string c_strNotTerminated =
    "1001|**Event sent that is not null terminated,  this is safe but a perf hit";
const std::string c_strReplaced =
    "1001|CServiceOperation::RecordEvent() - ***value is not one JSON text, recorded as a string";

using TraceDocumentTest = CDeliveryTest;

// Now, cut to the millisecond as the trace's clock (GetSystemTime) has it.
ULONGLONG NowFileTime()
{
    FILETIME ft;
    GetSystemTimeAsFileTime(&ft);
    ULONGLONG ull = (static_cast<ULONGLONG>(ft.dwHighDateTime) << 32) | ft.dwLowDateTime;
    return ull - ull % 10000;
}

std::string Group(const GUID &id)
{
    return "ID" + GuidText(id);
}

void ExpectHeader(const rapidjson::Document &trace, unsigned uLogCount, ULONGLONG ullBefore,
                  ULONGLONG ullAfter)
{
    EXPECT_EQ(GuidText(c_guidActivity), trace["ActivityID"].GetString());
    EXPECT_EQ(GuidText(c_guidSession), trace["SessionID"].GetString());
    EXPECT_EQ(GuidText(c_guidLog), trace["LogID"].GetString());
    EXPECT_STREQ("00000000-0000-0000-0000-000000000000", trace["WiFiConnID"].GetString());
    EXPECT_EQ(24u, trace["JsonVersion"].GetUint());
    EXPECT_EQ(uLogCount, trace["LogCount"].GetUint());
    ASSERT_TRUE(trace["TimeStamp"].IsUint64());
    EXPECT_LE(ullBefore, trace["TimeStamp"].GetUint64());
    EXPECT_GE(ullAfter, trace["TimeStamp"].GetUint64());
    EXPECT_TRUE(trace["Phone"].IsObject());
    // "Orvex" is the version as the platform reports it.
    OSVERSIONINFOW version = {};
    version.dwOSVersionInfoSize = sizeof(version);
    ASSERT_TRUE(GetVersionExW(&version));
    const rapidjson::Value &orvex = trace["Orvex"];
    ASSERT_EQ((std::vector<std::string>{"Major", "Minor", "Build", "PlatformId"}),
              MemberNames(orvex));
    const DWORD rgdwVersion[] = {version.dwMajorVersion, version.dwMinorVersion,
                                 version.dwBuildNumber, version.dwPlatformId};
    for (int i = 0; i < 4; i++)
    {
        EXPECT_EQ(rgdwVersion[i], orvex.MemberBegin()[i].value.GetDouble()) << i;
    }
}
} // namespace

TEST_F(TraceDocumentTest, FirstAndLaterLogsKeepTheirMemberOrder)
{
    AllowDelivery(1);
    CTraceSession session;
    ULONGLONG ullBefore = NowFileTime();
    CTraceDocument document;
    document.Begin(c_guidActivity, c_guidSession, c_guidLog);
    EXPECT_EQ(1u, document.LogCount());
    Record(document, c_guidEventA, std::string("{\"n\":1}", 8)); // with its NUL
    Record(document, c_guidEventB, "\"b\"");                     // without
    Record(document, c_guidEventA, std::string("[2]\0ignored", 11));
    EXPECT_EQ(7u + 3u + 3u, document.RecordedBytes());
    document.FlushAndRestart(false);
    ULONGLONG ullMiddle = NowFileTime();
    EXPECT_EQ(2u, document.LogCount());
    EXPECT_EQ(0u, document.RecordedBytes());
    Record(document, c_guidZero, "3");
    document.AddExecutionTime();
    document.FlushAndRestart(true);
    ULONGLONG ullAfter = NowFileTime();
    EXPECT_EQ(3u, document.LogCount());
    // Every payload whose last byte is not its NUL, also one cut at an inner NUL.
    EXPECT_EQ(3u, session.CountLines(c_strNotTerminated));
    EXPECT_EQ(0u, session.CountLines(c_strReplaced));

    std::vector<DeliveredLog> rgLogs = DeliveredLogs();
    ASSERT_EQ(2u, rgLogs.size());
    EXPECT_EQ(2u, FileNames(c_wszTraceFolder).size());

    const rapidjson::Document &first = *rgLogs[0].doc;
    std::vector<std::string> rgNames = MemberNames(first);
    ASSERT_EQ(12u, rgNames.size());
    std::sort(rgNames.begin() + 9, rgNames.begin() + 11); // the groups come in any order
    EXPECT_EQ((std::vector<std::string>{"ActivityID", "SessionID", "JsonVersion", "LogID",
                                        "WiFiConnID", "LogCount", "TimeStamp", "Orvex", "Phone",
                                        Group(c_guidEventA), Group(c_guidEventB), "LogEnd"}),
              rgNames);
    ExpectHeader(first, 1, ullBefore, ullMiddle);
    EXPECT_EQ((std::vector<std::string>{"{\"n\":1}", "[2]"}), GroupValues(first, c_guidEventA));
    EXPECT_EQ((std::vector<std::string>{"\"b\""}), GroupValues(first, c_guidEventB));
    EXPECT_FALSE(first["LogEnd"].GetBool());
    // A record is {TimeStamp, Value}, stamped within the log's life.
    const rapidjson::Value &record = first[Group(c_guidEventA).c_str()][0];
    EXPECT_EQ((std::vector<std::string>{"TimeStamp", "Value"}), MemberNames(record));
    EXPECT_LE(first["TimeStamp"].GetUint64(), record["TimeStamp"].GetUint64());

    const rapidjson::Document &later = *rgLogs[1].doc;
    EXPECT_EQ((std::vector<std::string>{"ActivityID", "SessionID", "LogID", "WiFiConnID",
                                        "LogCount", "JsonVersion", "TimeStamp", "Orvex", "Phone",
                                        "ExecutionTime", Group(c_guidZero), "LogEnd"}),
              MemberNames(later));
    ExpectHeader(later, 2, ullBefore, ullAfter);
    EXPECT_LE(later["TimeStamp"].GetUint64(), later["ExecutionTime"].GetUint64());
    EXPECT_GE(ullAfter, later["ExecutionTime"].GetUint64());
    EXPECT_EQ((std::vector<std::string>{"3"}), GroupValues(later, c_guidZero));
    EXPECT_TRUE(later["LogEnd"].GetBool());
}

TEST_F(TraceDocumentTest, LogCountRisesAlsoForLogsThePreferenceStops)
{
    HklmSetDword(c_wszTestLoggingKey, c_wszTestLoggingValue, 1);
    CTraceDocument document;
    document.Begin(c_guidActivity, c_guidSession, c_guidLog);
    Record(document, c_guidEventA, "1");
    document.FlushAndRestart(false); // no preference: dropped
    Record(document, c_guidEventA, "2");
    HklmSetDword(c_wszPreferenceKey, c_wszPreferenceValue, 1);
    document.FlushAndRestart(false); // bit 1 missing: dropped
    EXPECT_TRUE(FileNames(c_wszTraceFolder).empty());
    EXPECT_EQ(3u, document.LogCount());

    // The open log was begun as a later log, numbered past the two dropped ones; the dropped
    // records went with their logs (nine header members, nothing else).
    rapidjson::Document open;
    ParseStrict(document.CurrentText(), open);
    EXPECT_EQ(3u, open["LogCount"].GetUint());
    EXPECT_EQ(9u, MemberNames(open).size());

    HklmSetDword(c_wszPreferenceKey, c_wszPreferenceValue, 3);
    Record(document, c_guidEventA, "3");
    document.FlushAndRestart(true);
    std::vector<DeliveredLog> rgLogs = DeliveredLogs();
    ASSERT_EQ(1u, rgLogs.size());
    const rapidjson::Document &delivered = *rgLogs[0].doc;
    EXPECT_EQ(3u, delivered["LogCount"].GetUint());
    EXPECT_EQ((std::vector<std::string>{"3"}), GroupValues(delivered, c_guidEventA));
}

namespace
{
// Fails the conversion on one chosen call, counted from 1 (0: never).
int s_iFailingCall = 0;
int s_cConversions = 0;

BOOL WINAPI FailOneConversion(const SYSTEMTIME *pst, FILETIME *pft)
{
    if (++s_cConversions == s_iFailingCall)
    {
        SetLastError(ERROR_INVALID_PARAMETER);
        return FALSE;
    }
    return SystemTimeToFileTime(pst, pft);
}
} // namespace

TEST_F(TraceDocumentTest, AFailedTimeConversionLeavesOutExactlyOneMember)
{
    // Calls in order: 1 the header's TimeStamp, 2 the record's, 3 ExecutionTime; 0 none.
    for (int iCall = 0; iCall <= 3; iCall++)
    {
        SCOPED_TRACE(iCall);
        ResetDeliveryState();
        AllowDelivery(1);
        s_iFailingCall = iCall;
        s_cConversions = 0;
        CTraceDocument document;
        document.SetTimeConversion(FailOneConversion);
        document.Begin(c_guidActivity, c_guidSession, c_guidLog);
        Record(document, c_guidEventA, "{}");
        document.AddExecutionTime();
        document.FlushAndRestart(true);
        EXPECT_EQ(4, s_cConversions); // the next log's header asked too

        std::vector<DeliveredLog> rgLogs = DeliveredLogs();
        ASSERT_EQ(1u, rgLogs.size());
        const rapidjson::Document &trace = *rgLogs[0].doc;
        const rapidjson::Value &record = trace[Group(c_guidEventA).c_str()][0];
        EXPECT_EQ(iCall != 1, trace.HasMember("TimeStamp"));
        EXPECT_EQ(iCall != 2, record.HasMember("TimeStamp"));
        EXPECT_EQ(iCall != 3, trace.HasMember("ExecutionTime"));
        EXPECT_EQ(iCall == 1 || iCall == 3 ? 11u : 12u, MemberNames(trace).size());
        EXPECT_TRUE(record.HasMember("Value"));
    }
}

// Values that are one JSON text go in byte for byte; anything else becomes a JSON string of
// its bytes, each byte of 0x80 and above as \u00XX, so the document stays JSON (which texts
// are JSON is the validator's to say: its own test holds the verdicts). A value nested
// so deep that the trace around it passes the depth our reader (and many others) will read
// would make every other record of the log unreadable with it: it is kept as a string too.
TEST_F(TraceDocumentTest, ValuesThatAreNotJsonBecomeStrings)
{
    struct Row
    {
        std::string strPayload; // as the client sent it
        bool fKept;             // written unchanged
        std::string strWritten; // the value's text in the file
    };
    // The trace's own levels around a value: the log, the group's array, the record.
    const size_t cMaxValueDepth = JsonReader::c_cMaxDepth - 3;
    auto nested = [](size_t cDepth) {
        return std::string(cDepth, '[') + "1" + std::string(cDepth, ']');
    };
    const Row rgRows[] = {
        {std::string("{\"a\":[1,2.5e-3,true,null,\"x\"]}\0", 31), true,
         "{\"a\":[1,2.5e-3,true,null,\"x\"]}"},
        {" \t{\"a\" : 1}\r\n ", true, " \t{\"a\" : 1}\r\n "},
        {"\"caf\xC3\xA9 \\u00e9 \\ud83d\\ude00\"", true, "\"caf\xC3\xA9 \\u00e9 \\ud83d\\ude00\""},
        {std::string("{\"a\":1}\0{\"b\":2}", 15), true, "{\"a\":1}"},
        {nested(cMaxValueDepth), true, nested(cMaxValueDepth)},
        {nested(cMaxValueDepth + 1), false, "\"" + nested(cMaxValueDepth + 1) + "\""},
        {"{\"a\":1}x", false, "\"{\\\"a\\\":1}x\""},
        {std::string("\0", 1), false, "\"\""},
        {"Connected", false, "\"Connected\""},
        {"\"caf\xE9\"", false, "\"\\\"caf\\u00e9\\\"\""},
        {"[\"\\ud800\"]", false, "\"[\\\"\\\\ud800\\\"]\""},
        {"[\"\\udc00\"]", false, "\"[\\\"\\\\udc00\\\"]\""}, // RapidJSON takes it, we do not
    };
    AllowDelivery(1);
    CTraceSession session;
    CTraceDocument document;
    document.Begin(c_guidActivity, c_guidSession, c_guidLog);
    size_t cReplaced = 0;
    for (const Row &row : rgRows)
    {
        Record(document, c_guidEventA, row.strPayload);
        cReplaced += row.fKept ? 0 : 1;
    }
    EXPECT_EQ(cReplaced, session.CountLines(c_strReplaced));
    document.FlushAndRestart(true);

    std::vector<DeliveredLog> rgLogs = DeliveredLogs();
    ASSERT_EQ(1u, rgLogs.size());
    const rapidjson::Document &trace = *rgLogs[0].doc;
    const std::string &strText = rgLogs[0].strText;
    // Our own reader takes the whole trace, the deepest value kept included.
    std::unique_ptr<JsonValue> root(JsonReader::FromJsonString(strText.c_str()));
    EXPECT_EQ(JsonNodeType::Object, root->Type());
    const rapidjson::Value &group = trace[Group(c_guidEventA).c_str()];
    ASSERT_EQ(sizeof(rgRows) / sizeof(rgRows[0]), group.Size());
    // Each value's exact text sits between its "Value": and the record's closing brace (the
    // strict parse above read every replacement string back).
    size_t pos = 0;
    for (size_t i = 0; i < group.Size(); i++)
    {
        const Row &row = rgRows[i];
        SCOPED_TRACE(row.strWritten.substr(0, 40));
        pos = strText.find("\"Value\":", pos);
        ASSERT_NE(std::string::npos, pos);
        pos += 8;
        EXPECT_EQ(row.strWritten + "}", strText.substr(pos, row.strWritten.size() + 1));
    }
}

TEST_F(TraceDocumentTest, PhoneDescribesTheDeviceAsTheLibraryAnswers)
{
    // Members of "Phone" as name and JSON text; "-" for a member left out.
    typedef std::vector<std::pair<std::string, std::string>> Members;
    // The defaults in document order: the build record, then the items in item order.
    Members rgDefaults = {{"Branch", "\"WPB_CXE_R1\""},
                          {"TimeStamp", "\"151214-1700\""},
                          {"ParentBranchBuild", "10586"},
                          {"BuildNumber", "10586"},
                          {"QFELevel", "107"},
                          {"OV_MajorVersion", "10"},
                          {"OV_MinorVersion", "0"}};
    for (DWORD dwItem = 0; dwItem < 16; dwItem++)
    {
        for (const DEVICE_INFO_SETTING &setting : DeviceInfoGetSettings())
        {
            if (setting.wstrName == DeviceInfoItemName(dwItem))
            {
                rgDefaults.emplace_back(Narrow(setting.wstrName),
                                        "\"" + Narrow(setting.wstrValue) + "\"");
            }
        }
    }
    struct Row
    {
        const char *szCase;
        std::vector<std::wstring> rgFail;
        std::vector<std::pair<std::wstring, std::wstring>> rgSet;
        Members rgChanged; // "*" stands for every member, "Build" for the build record's
    };
    const Row rgRows[] = {
        // clang-format off
        {"defaults", {}, {}, {}},
        {"every call fails", {L"*"}, {}, {{"*", "-"}}},
        {"build record fails", {L"Build"}, {}, {{"Build", "-"}}},
        {"two items fail", {L"Manufacturer", L"PhoneSOCVersion"}, {},
         {{"Manufacturer", "-"}, {"PhoneSOCVersion", "-"}}},
        {"300-character friendly name", {}, {{L"PhoneFriendlyName", std::wstring(300, L'x')}},
         {{"PhoneFriendlyName", "\"error\""}}},
        {"friendly name outside ASCII", {}, {{L"PhoneFriendlyName", L"Lumen \x00e9\x00e8"}},
         {{"PhoneFriendlyName", "\"Lumen \xC3\xA9\xC3\xA8\""}}},
        {"item longer than the buffer", {}, {{L"PhoneModelName", std::wstring(1024, L'y')}},
         {{"PhoneModelName", "-"}}},
        {"build values set", {}, {{L"Branch", L"rs_prerelease"}, {L"BuildNumber", L"4294967295"}},
         {{"Branch", "\"rs_prerelease\""}, {"BuildNumber", "4294967295"}}},
        // clang-format on
    };
    for (const Row &row : rgRows)
    {
        SCOPED_TRACE(row.szCase);
        DeviceInfoReset();
        for (const std::wstring &wstrFail : row.rgFail)
        {
            ASSERT_TRUE(DeviceInfoSetFailing(wstrFail, true));
        }
        for (const auto &set : row.rgSet)
        {
            ASSERT_TRUE(DeviceInfoSet(set.first, set.second));
        }
        Members rgExpected;
        for (size_t i = 0; i < rgDefaults.size(); i++)
        {
            std::string strValue = rgDefaults[i].second;
            for (const auto &changed : row.rgChanged)
            {
                bool fMatch = changed.first == "*" || changed.first == rgDefaults[i].first ||
                              (changed.first == "Build" && i < 7);
                strValue = fMatch ? changed.second : strValue;
            }
            if (strValue != "-")
            {
                rgExpected.emplace_back(rgDefaults[i].first, strValue);
            }
        }
        CTraceDocument document;
        document.Begin(c_guidActivity, c_guidSession, c_guidLog);
        rapidjson::Document trace;
        ParseStrict(document.CurrentText(), trace);
        ASSERT_TRUE(trace.HasMember("Phone"));
        Members rgActual;
        for (auto it = trace["Phone"].MemberBegin(); it != trace["Phone"].MemberEnd(); ++it)
        {
            rgActual.emplace_back(it->name.GetString(), JsonText(it->value));
        }
        EXPECT_EQ(rgExpected, rgActual);
    }
}

TEST_F(TraceDocumentTest, ConnIdGivesTheConnectionOrTheZeroGuid)
{
    const std::string strZero = "00000000-0000-0000-0000-000000000000";
    struct Row
    {
        const char *szCase;
        int iKind; // 0: no key, 1: key without value, 2: REG_SZ, 3: REG_BINARY of the text
        std::wstring wstrValue;
        std::string strExpected;
    };
    const Row rgRows[] = {
        {"key missing", 0, L"", strZero},
        {"value missing", 1, L"", strZero},
        {"plain GUID", 2, L"5a3f0c1e-2b4d-4e6f-8a9b-0c1d2e3f4a5b",
         "5a3f0c1e-2b4d-4e6f-8a9b-0c1d2e3f4a5b"},
        {"GUID in braces does not fit", 2, L"{5a3f0c1e-2b4d-4e6f-8a9b-0c1d2e3f4a5b}", strZero},
        {"short text", 2, L"home", "home"},
        {"36 characters without a terminator", 3, L"5A3F0C1E-2B4D-4E6F-8A9B-0C1D2E3F4A5B",
         "5A3F0C1E-2B4D-4E6F-8A9B-0C1D2E3F4A5B"},
        // 74 bytes fit the buffer exactly; the text stops at 36 characters all the same.
        {"37 characters without a terminator", 3, L"5A3F0C1E-2B4D-4E6F-8A9B-0C1D2E3F4A5BC",
         "5A3F0C1E-2B4D-4E6F-8A9B-0C1D2E3F4A5B"},
    };
    for (const Row &row : rgRows)
    {
        SCOPED_TRACE(row.szCase);
        HklmDeleteKey(c_wszConnIdKey);
        if (row.iKind >= 1)
        {
            HklmSetString(c_wszConnIdKey, L"Other", L"x");
        }
        if (row.iKind == 2)
        {
            HklmSetString(c_wszConnIdKey, c_wszConnIdValue, row.wstrValue);
        }
        else if (row.iKind == 3)
        {
            HklmSetBytes(c_wszConnIdKey, c_wszConnIdValue, REG_BINARY, row.wstrValue.c_str(),
                         static_cast<DWORD>(row.wstrValue.size() * sizeof(wchar_t)));
        }
        EXPECT_EQ(row.strExpected, Narrow(CTraceDocument::ReadWiFiConnId()));
        CTraceDocument document;
        document.Begin(c_guidActivity, c_guidSession, c_guidLog);
        rapidjson::Document trace;
        ParseStrict(document.CurrentText(), trace);
        EXPECT_EQ(row.strExpected, trace["WiFiConnID"].GetString());
    }
    HklmDeleteKey(c_wszConnIdKey);
}
