// The trace document through its real steps: header member order and forms of the first and
// later logs, records and their groups, the device description from the device information
// stand-in, "ConnID", the clock failing, and values that are not JSON. Every written trace
// is read back by RapidJSON, strictly.
#include "service/ctracedocument.h"

#include "platform/deviceinfo/deviceinfocontrol.h"
#include "tests/trace/tracetestsupport.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <string>
#include <vector>

using namespace tracetest;

namespace
{
const GUID c_guidActivity = {
    0x6f1d2a40, 0x3c1e, 0x4b7a, {0x9d, 0x55, 0x1a, 0x2b, 0x3c, 0x4d, 0x5e, 0x6f}};
const GUID c_guidSession = {
    0x0a1b2c3d, 0x4e5f, 0x6071, {0x82, 0x93, 0xa4, 0xb5, 0xc6, 0xd7, 0xe8, 0xf9}};
const GUID c_guidLog = {
    0x12345678, 0x9abc, 0xdef0, {0x12, 0x34, 0x56, 0x78, 0x9a, 0xbc, 0xde, 0xf0}};
const GUID c_guidEventA = {
    0xaaaaaaaa, 0x0000, 0x4000, {0x80, 0x00, 0x00, 0x00, 0x00, 0x00, 0x00, 0x0a}};
const GUID c_guidEventB = {
    0xbbbbbbbb, 0x0000, 0x4000, {0x80, 0x00, 0x00, 0x00, 0x00, 0x00, 0x00, 0x0b}};
const GUID c_guidZero = {};

const char c_szNotTerminated[] =
    "**Event sent that is not null terminated,  this is safe but a perf hit";
const char c_szReplaced[] =
    "CServiceOperation::RecordEvent() - ***value is not one JSON text, recorded as a string";

class TraceDocumentTest : public testing::Test
{
protected:
    void SetUp() override { ResetDeliveryState(); }
    void TearDown() override { ResetDeliveryState(); }
};

// Now, cut to the millisecond as the trace's clock (GetSystemTime) has it.
ULONGLONG NowFileTime()
{
    FILETIME ft;
    GetSystemTimeAsFileTime(&ft);
    ULONGLONG ull = (static_cast<ULONGLONG>(ft.dwHighDateTime) << 32) | ft.dwLowDateTime;
    return ull - ull % 10000;
}

void Record(CTraceDocument &document, const GUID &id, const std::string &strBytes)
{
    document.RecordEvent(id, reinterpret_cast<const BYTE *>(strBytes.data()), strBytes.size());
}

// The text a rapidjson value has in the document, for comparing member values compactly.
std::string Compact(const rapidjson::Value &value);

std::string Compact(const rapidjson::Value &value)
{
    if (value.IsString())
    {
        return "\"" + std::string(value.GetString(), value.GetStringLength()) + "\"";
    }
    if (value.IsBool())
    {
        return value.GetBool() ? "true" : "false";
    }
    if (value.IsNull())
    {
        return "null";
    }
    if (value.IsUint64())
    {
        return std::to_string(value.GetUint64());
    }
    if (value.IsNumber())
    {
        char sz[64];
        snprintf(sz, sizeof(sz), "%.12g", value.GetDouble());
        return sz;
    }
    std::string str;
    if (value.IsArray())
    {
        str = "[";
        for (rapidjson::SizeType i = 0; i < value.Size(); i++)
        {
            str += (i > 0 ? "," : "") + Compact(value[i]);
        }
        return str + "]";
    }
    str = "{";
    for (auto it = value.MemberBegin(); it != value.MemberEnd(); ++it)
    {
        str += (it == value.MemberBegin() ? "\"" : ",\"") + std::string(it->name.GetString()) +
               "\":" + Compact(it->value);
    }
    return str + "}";
}

// The "Orvex" members as the platform reports the version.
void ExpectOrvex(const rapidjson::Value &orvex)
{
    OSVERSIONINFOW version = {};
    version.dwOSVersionInfoSize = sizeof(version);
    ASSERT_TRUE(GetVersionExW(&version));
    ASSERT_EQ((std::vector<std::string>{"Major", "Minor", "Build", "PlatformId"}),
              MemberNames(orvex));
    EXPECT_EQ(version.dwMajorVersion, orvex["Major"].GetDouble());
    EXPECT_EQ(version.dwMinorVersion, orvex["Minor"].GetDouble());
    EXPECT_EQ(version.dwBuildNumber, orvex["Build"].GetDouble());
    EXPECT_EQ(version.dwPlatformId, orvex["PlatformId"].GetDouble());
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
    ExpectOrvex(trace["Orvex"]);
    EXPECT_TRUE(trace["Phone"].IsObject());
}

// The records of a group: their "Value" texts in order; each record is {TimeStamp, Value}.
std::vector<std::string> GroupValues(const rapidjson::Value &group)
{
    std::vector<std::string> rgValues;
    EXPECT_TRUE(group.IsArray());
    for (rapidjson::SizeType i = 0; group.IsArray() && i < group.Size(); i++)
    {
        EXPECT_EQ((std::vector<std::string>{"TimeStamp", "Value"}), MemberNames(group[i]));
        EXPECT_TRUE(group[i]["TimeStamp"].IsUint64());
        rgValues.push_back(Compact(group[i]["Value"]));
    }
    return rgValues;
}
} // namespace

TEST_F(TraceDocumentTest, FirstAndLaterLogsKeepTheirMemberOrder)
{
    AllowDelivery(1);
    TraceSession session;
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
    EXPECT_EQ(3u, session.CountMessages(c_szNotTerminated));
    EXPECT_EQ(0u, session.CountMessages(c_szReplaced));

    std::vector<std::string> rgTexts = TraceFileTexts();
    ASSERT_EQ(2u, rgTexts.size());
    EXPECT_EQ(2u, TraceFileNames().size());

    rapidjson::Document first;
    ParseStrict(rgTexts[0], first);
    std::vector<std::string> rgNames = MemberNames(first);
    ASSERT_EQ(12u, rgNames.size());
    // The iteration order of the groups is free.
    std::vector<std::string> rgGroups(rgNames.begin() + 9, rgNames.begin() + 11);
    std::sort(rgGroups.begin(), rgGroups.end());
    rgNames.erase(rgNames.begin() + 9, rgNames.begin() + 11);
    EXPECT_EQ(
        (std::vector<std::string>{"ActivityID", "SessionID", "JsonVersion", "LogID", "WiFiConnID",
                                  "LogCount", "TimeStamp", "Orvex", "Phone", "LogEnd"}),
        rgNames);
    std::string strGroupA = "ID" + GuidText(c_guidEventA);
    std::string strGroupB = "ID" + GuidText(c_guidEventB);
    EXPECT_EQ((std::vector<std::string>{strGroupA, strGroupB}), rgGroups);
    ExpectHeader(first, 1, ullBefore, ullMiddle);
    EXPECT_EQ((std::vector<std::string>{"{\"n\":1}", "[2]"}),
              GroupValues(first[strGroupA.c_str()]));
    EXPECT_EQ((std::vector<std::string>{"\"b\""}), GroupValues(first[strGroupB.c_str()]));
    EXPECT_FALSE(first["LogEnd"].GetBool());
    // The records' own stamps lie within the log's life.
    EXPECT_LE(first["TimeStamp"].GetUint64(), first[strGroupA.c_str()][0]["TimeStamp"].GetUint64());

    rapidjson::Document later;
    ParseStrict(rgTexts[1], later);
    std::string strGroupZero = "ID00000000-0000-0000-0000-000000000000";
    EXPECT_EQ((std::vector<std::string>{"ActivityID", "SessionID", "LogID", "WiFiConnID",
                                        "LogCount", "JsonVersion", "TimeStamp", "Orvex", "Phone",
                                        "ExecutionTime", strGroupZero, "LogEnd"}),
              MemberNames(later));
    ExpectHeader(later, 2, ullBefore, ullAfter);
    EXPECT_LE(later["TimeStamp"].GetUint64(), later["ExecutionTime"].GetUint64());
    EXPECT_GE(ullAfter, later["ExecutionTime"].GetUint64());
    EXPECT_EQ((std::vector<std::string>{"3"}), GroupValues(later[strGroupZero.c_str()]));
    EXPECT_TRUE(later["LogEnd"].GetBool());
}

TEST_F(TraceDocumentTest, LogCountRisesAlsoForLogsThePreferenceStops)
{
    SetDword(c_wszTestKey, c_wszTestValue, 1);
    CTraceDocument document;
    document.Begin(c_guidActivity, c_guidSession, c_guidLog);
    Record(document, c_guidEventA, "1");
    document.FlushAndRestart(false); // no preference: dropped
    Record(document, c_guidEventA, "2");
    SetDword(c_wszPreferenceKey, c_wszPreferenceValue, 1);
    document.FlushAndRestart(false); // bit 1 missing: dropped
    EXPECT_TRUE(TraceFileNames().empty());
    EXPECT_EQ(3u, document.LogCount());

    // The open log was begun as a later log, numbered past the two dropped ones; the dropped
    // records went with their logs.
    rapidjson::Document open;
    ParseStrict(document.CurrentText(), open);
    EXPECT_EQ(3u, open["LogCount"].GetUint());
    EXPECT_FALSE(open.HasMember("LogEnd"));
    EXPECT_EQ(9u, MemberNames(open).size());

    SetDword(c_wszPreferenceKey, c_wszPreferenceValue, 3);
    Record(document, c_guidEventA, "3");
    document.FlushAndRestart(true);
    std::vector<std::string> rgTexts = TraceFileTexts();
    ASSERT_EQ(1u, rgTexts.size());
    rapidjson::Document delivered;
    ParseStrict(rgTexts[0], delivered);
    EXPECT_EQ(3u, delivered["LogCount"].GetUint());
    EXPECT_TRUE(delivered["LogEnd"].GetBool());
    std::string strGroup = "ID" + GuidText(c_guidEventA);
    EXPECT_EQ((std::vector<std::string>{"3"}), GroupValues(delivered[strGroup.c_str()]));
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
    struct Row
    {
        int iFailingCall;
        const char *szMissing; // member path that is left out, or null
    };
    // Calls in order: the header's TimeStamp, the record's, ExecutionTime.
    const Row rgRows[] = {
        {0, nullptr},
        {1, "TimeStamp"},
        {2, "record TimeStamp"},
        {3, "ExecutionTime"},
    };
    std::string strGroup = "ID" + GuidText(c_guidEventA);
    for (const Row &row : rgRows)
    {
        SCOPED_TRACE(row.iFailingCall);
        ResetDeliveryState();
        AllowDelivery(1);
        s_iFailingCall = row.iFailingCall;
        s_cConversions = 0;
        CTraceDocument document;
        document.SetTimeConversion(FailOneConversion);
        document.Begin(c_guidActivity, c_guidSession, c_guidLog);
        Record(document, c_guidEventA, "{}");
        document.AddExecutionTime();
        document.FlushAndRestart(true);
        EXPECT_EQ(4, s_cConversions); // the next log's header asked too

        std::vector<std::string> rgTexts = TraceFileTexts();
        ASSERT_EQ(1u, rgTexts.size());
        rapidjson::Document trace;
        ParseStrict(rgTexts[0], trace);
        std::vector<std::string> rgNames = MemberNames(trace);
        const rapidjson::Value &record = trace[strGroup.c_str()][0];
        bool fHeaderStamp = trace.HasMember("TimeStamp");
        bool fRecordStamp = record.HasMember("TimeStamp");
        bool fExecution = trace.HasMember("ExecutionTime");
        std::string strMissing = !fHeaderStamp   ? "TimeStamp"
                                 : !fRecordStamp ? "record TimeStamp"
                                 : !fExecution   ? "ExecutionTime"
                                                 : "";
        EXPECT_EQ(row.szMissing != nullptr ? row.szMissing : "", strMissing);
        EXPECT_EQ(3, fHeaderStamp + fRecordStamp + fExecution + (row.szMissing != nullptr));
        EXPECT_EQ(row.iFailingCall == 1 || row.iFailingCall == 3 ? 11u : 12u, rgNames.size());
        EXPECT_TRUE(record.HasMember("Value"));
    }
}

TEST_F(TraceDocumentTest, RecordsOfOneIdShareOneArrayInOrder)
{
    AllowDelivery(1);
    CTraceDocument document;
    document.Begin(c_guidActivity, c_guidSession, c_guidLog);
    for (int i = 0; i < 20; i++)
    {
        // Enough groups to make the map grow past its first buckets.
        GUID id = c_guidEventA;
        id.Data1 += static_cast<unsigned long>(i % 10);
        Record(document, id, std::to_string(i));
    }
    document.FlushAndRestart(true);
    std::vector<std::string> rgTexts = TraceFileTexts();
    ASSERT_EQ(1u, rgTexts.size());
    rapidjson::Document trace;
    ParseStrict(rgTexts[0], trace);
    EXPECT_EQ(9u + 10u + 1u, MemberNames(trace).size());
    for (int i = 0; i < 10; i++)
    {
        GUID id = c_guidEventA;
        id.Data1 += static_cast<unsigned long>(i);
        std::string strGroup = "ID" + GuidText(id);
        ASSERT_TRUE(trace.HasMember(strGroup.c_str()));
        EXPECT_EQ((std::vector<std::string>{std::to_string(i), std::to_string(i + 10)}),
                  GroupValues(trace[strGroup.c_str()]));
    }
}

// Values that are one JSON text go in byte for byte; anything else becomes a JSON string of
// its bytes, each byte of 0x80 and above as \u00XX, so the document stays JSON.
TEST_F(TraceDocumentTest, ValuesThatAreNotJsonBecomeStrings)
{
    struct Row
    {
        std::string strPayload; // as the client sent it
        bool fKept;             // written unchanged
        std::string strWritten; // the value's text in the file
    };
    const Row rgRows[] = {
        {std::string("{\"a\":[1,2.5e-3,true,null,\"x\"]}\0", 31), true,
         "{\"a\":[1,2.5e-3,true,null,\"x\"]}"},
        {" \t{\"a\" : 1}\r\n ", true, " \t{\"a\" : 1}\r\n "},
        {"\"caf\xC3\xA9 \\u00e9 \\ud83d\\ude00\"", true, "\"caf\xC3\xA9 \\u00e9 \\ud83d\\ude00\""},
        {"-0.5E+2", true, "-0.5E+2"},
        {std::string("{\"a\":1}\0{\"b\":2}", 15), true, "{\"a\":1}"},
        {"{\"a\":1}x", false, "\"{\\\"a\\\":1}x\""},
        {"1 2", false, "\"1 2\""},
        {"{\"a\":1", false, "\"{\\\"a\\\":1\""},
        {std::string("\0", 1), false, "\"\""},
        {"Connected", false, "\"Connected\""},
        {"\"caf\xE9\"", false, "\"\\\"caf\\u00e9\\\"\""},
        {"\"\xED\xA0\x80\"", false, "\"\\\"\\u00ed\\u00a0\\u0080\\\"\""},
        {"[\"\\ud800\"]", false, "\"[\\\"\\\\ud800\\\"]\""},
        {"\"a\tb\"", false, "\"\\\"a\\tb\\\"\""},
        {"01", false, "\"01\""},
        {"{\"a\":1,}", false, "\"{\\\"a\\\":1,}\""},
        {"</script>", false, "\"<\\/script>\""},
    };
    AllowDelivery(1);
    TraceSession session;
    CTraceDocument document;
    document.Begin(c_guidActivity, c_guidSession, c_guidLog);
    size_t cReplaced = 0;
    for (const Row &row : rgRows)
    {
        Record(document, c_guidEventA, row.strPayload);
        cReplaced += row.fKept ? 0 : 1;
    }
    EXPECT_EQ(cReplaced, session.CountMessages(c_szReplaced));
    document.FlushAndRestart(true);

    std::vector<std::string> rgTexts = TraceFileTexts();
    ASSERT_EQ(1u, rgTexts.size());
    rapidjson::Document trace;
    ParseStrict(rgTexts[0], trace);
    std::string strGroup = "ID" + GuidText(c_guidEventA);
    const rapidjson::Value &group = trace[strGroup.c_str()];
    ASSERT_EQ(sizeof(rgRows) / sizeof(rgRows[0]), group.Size());
    // Each value's exact text sits between its "Value": and the record's closing brace.
    size_t pos = 0;
    for (size_t i = 0; i < group.Size(); i++)
    {
        const Row &row = rgRows[i];
        SCOPED_TRACE(row.strWritten);
        pos = rgTexts[0].find("\"Value\":", pos);
        ASSERT_NE(std::string::npos, pos);
        pos += 8;
        EXPECT_EQ(row.strWritten + "}", rgTexts[0].substr(pos, row.strWritten.size() + 1));
        const rapidjson::Value &value = group[static_cast<rapidjson::SizeType>(i)]["Value"];
        if (!row.fKept)
        {
            // The string decodes to the kept bytes, each byte one character.
            ASSERT_TRUE(value.IsString());
            std::string strKept(row.strPayload.c_str());
            std::string strExpected;
            for (unsigned char b : strKept)
            {
                if (b < 0x80)
                {
                    strExpected += static_cast<char>(b);
                }
                else
                {
                    strExpected += static_cast<char>(0xC0 | (b >> 6));
                    strExpected += static_cast<char>(0x80 | (b & 0x3F));
                }
            }
            EXPECT_EQ(strExpected, std::string(value.GetString(), value.GetStringLength()));
            for (char ch : row.strWritten)
            {
                EXPECT_LT(static_cast<unsigned char>(ch), 0x80);
            }
        }
    }
}

TEST_F(TraceDocumentTest, PhoneDescribesTheDeviceAsTheLibraryAnswers)
{
    struct Row
    {
        const char *szCase;
        std::vector<std::wstring> rgFail;
        std::vector<std::pair<std::wstring, std::wstring>> rgSet;
        // Members of "Phone" whose value differs from the defaults ("-" means absent).
        std::vector<std::pair<std::string, std::string>> rgExpected;
    };
    const std::wstring wstrLong(300, L'x');
    const std::wstring wstrTooLongForTheBuffer(1024, L'y');
    const Row rgRows[] = {
        {"defaults", {}, {}, {}},
        {"every call fails", {L"*"}, {}, {{"*", "-"}}},
        {"build record fails",
         {L"Build"},
         {},
         {{"Branch", "-"},
          {"TimeStamp", "-"},
          {"ParentBranchBuild", "-"},
          {"BuildNumber", "-"},
          {"QFELevel", "-"},
          {"OV_MajorVersion", "-"},
          {"OV_MinorVersion", "-"}}},
        {"two items fail",
         {L"Manufacturer", L"PhoneSOCVersion"},
         {},
         {{"Manufacturer", "-"}, {"PhoneSOCVersion", "-"}}},
        {"300-character friendly name",
         {},
         {{L"PhoneFriendlyName", wstrLong}},
         {{"PhoneFriendlyName", "\"error\""}}},
        {"friendly name outside ASCII",
         {},
         {{L"PhoneFriendlyName", L"Lumen \x00e9\x00e8"}},
         {{"PhoneFriendlyName", "\"Lumen \xC3\xA9\xC3\xA8\""}}},
        {"item longer than the buffer",
         {},
         {{L"PhoneModelName", wstrTooLongForTheBuffer}},
         {{"PhoneModelName", "-"}}},
        {"build values set",
         {},
         {{L"Branch", L"rs_prerelease"}, {L"BuildNumber", L"4294967295"}},
         {{"Branch", "\"rs_prerelease\""}, {"BuildNumber", "4294967295"}}},
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
        CTraceDocument document;
        document.Begin(c_guidActivity, c_guidSession, c_guidLog);
        rapidjson::Document trace;
        ParseStrict(document.CurrentText(), trace);
        ASSERT_TRUE(trace.HasMember("Phone"));
        const rapidjson::Value &phone = trace["Phone"];

        // The defaults, in document order: the build record, then the items.
        std::vector<std::pair<std::string, std::string>> rgExpected = {
            {"Branch", "\"WPB_CXE_R1\""},
            {"TimeStamp", "\"151214-1700\""},
            {"ParentBranchBuild", "10586"},
            {"BuildNumber", "10586"},
            {"QFELevel", "107"},
            {"OV_MajorVersion", "10"},
            {"OV_MinorVersion", "0"},
        };
        for (DWORD dwItem = 0; dwItem < 16; dwItem++)
        {
            for (const DEVICE_INFO_SETTING &setting : DeviceInfoGetSettings())
            {
                if (setting.wstrName == DeviceInfoItemName(dwItem) && !setting.fOverridden)
                {
                    std::string strName(setting.wstrName.begin(), setting.wstrName.end());
                    std::string strValue(setting.wstrValue.begin(), setting.wstrValue.end());
                    rgExpected.emplace_back(strName, "\"" + strValue + "\"");
                }
                else if (setting.wstrName == DeviceInfoItemName(dwItem))
                {
                    std::string strName(setting.wstrName.begin(), setting.wstrName.end());
                    rgExpected.emplace_back(strName, "?");
                }
            }
        }
        for (const auto &expected : row.rgExpected)
        {
            for (auto it = rgExpected.begin(); it != rgExpected.end();)
            {
                if (expected.first == "*" || it->first == expected.first)
                {
                    if (expected.second == "-")
                    {
                        it = rgExpected.erase(it);
                        continue;
                    }
                    it->second = expected.second;
                }
                ++it;
            }
        }
        std::vector<std::pair<std::string, std::string>> rgActual;
        for (auto it = phone.MemberBegin(); it != phone.MemberEnd(); ++it)
        {
            rgActual.emplace_back(it->name.GetString(), Compact(it->value));
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
    };
    for (const Row &row : rgRows)
    {
        SCOPED_TRACE(row.szCase);
        DeleteKey(c_wszConnIdKey);
        if (row.iKind >= 1)
        {
            SetString(c_wszConnIdKey, L"Other", L"x");
        }
        if (row.iKind == 2)
        {
            SetString(c_wszConnIdKey, c_wszConnIdValue, row.wstrValue);
        }
        else if (row.iKind == 3)
        {
            HKEY hKey = nullptr;
            ASSERT_EQ(ERROR_SUCCESS,
                      RegOpenKeyExW(HKEY_LOCAL_MACHINE, c_wszConnIdKey, 0, KEY_WRITE, &hKey));
            RegSetValueExW(hKey, c_wszConnIdValue, 0, REG_BINARY,
                           reinterpret_cast<const BYTE *>(row.wstrValue.c_str()),
                           static_cast<DWORD>(row.wstrValue.size() * sizeof(wchar_t)));
            RegCloseKey(hKey);
        }
        std::wstring wstrConnId = CTraceDocument::ReadWiFiConnId();
        EXPECT_EQ(row.strExpected, std::string(wstrConnId.begin(), wstrConnId.end()));
        CTraceDocument document;
        document.Begin(c_guidActivity, c_guidSession, c_guidLog);
        rapidjson::Document trace;
        ParseStrict(document.CurrentText(), trace);
        EXPECT_EQ(row.strExpected, trace["WiFiConnID"].GetString());
    }
    DeleteKey(c_wszConnIdKey);
}
