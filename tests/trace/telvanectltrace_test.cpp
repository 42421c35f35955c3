// telvanectl's trace and stand-in commands as a person runs them, as a child process against
// the traces and stand-in state of the build's prefix.
#include "service/ctracedocument.h"
#include "service/tracesinks.h"

#include "tests/trace/deliverystate.h"

#include <algorithm>
#include <string>

using namespace testsupport;
using namespace tracetest;

namespace
{

using TelvanectlTraceTest = CDeliveryTest;

// The child's output with its line ends as "\n" (the console runtime writes "\r\n").
ChildResult Ctl(const std::wstring &wstrArguments)
{
    ChildResult result = RunTelvanectl(wstrArguments);
    result.strOutput.erase(std::remove(result.strOutput.begin(), result.strOutput.end(), '\r'),
                           result.strOutput.end());
    return result;
}

size_t Count(const std::string &str, const std::string &strPart)
{
    size_t c = 0;
    for (size_t pos = str.find(strPart); pos != std::string::npos; pos = str.find(strPart, pos + 1))
    {
        c++;
    }
    return c;
}

// Two logs of one run: the first to a file only, the second to a file and a submission.
void DeliverTwoLogs()
{
    AllowDelivery(1);
    CTraceDocument document;
    document.Begin(c_guidActivity, c_guidSession, c_guidLog);
    Record(document, c_guidActivity, "{\"Event\":\"Connect\",\"Rssi\":-61}");
    document.FlushAndRestart(false);
    HklmSetDword(c_wszTestLoggingKey, c_wszTestLoggingValue, 2);
    Record(document, c_guidLog, "[1,2]");
    document.AddExecutionTime();
    document.FlushAndRestart(true);
}
} // namespace

TEST_F(TelvanectlTraceTest, ListAndShowFindFilesAndSubmissionsAndSkipPartialFiles)
{
    DeliverTwoLogs();
    // A file still being written under its temporary name is not a trace yet.
    const std::wstring wstrPartial = std::wstring(c_wszTraceFolder) +
                                     L"\\00000000-0000-0000-0000-000000000001" +
                                     TraceSinks::c_wszTemporarySuffix;
    ASSERT_TRUE(WriteFileText(wstrPartial, "{\"Log"));

    ChildResult result = Ctl(L"trace list");
    EXPECT_EQ(0u, result.dwExitCode) << result.strOutput;
    EXPECT_EQ(3u, Count(result.strOutput, GuidText(c_guidLog))) << result.strOutput;
    EXPECT_EQ(1u, Count(result.strOutput, " submission ")) << result.strOutput;
    EXPECT_EQ(2u, Count(result.strOutput, " file ")) << result.strOutput;
    EXPECT_EQ(0u, Count(result.strOutput, ".tmp")) << result.strOutput;
    EXPECT_NE(std::string::npos, result.strOutput.find("3 trace(s)"));
    // Newest first: the two logs of LogCount 2 come before the first log.
    size_t posFirst = result.strOutput.find(" 1 false");
    size_t posLast = result.strOutput.rfind(" 2 true");
    EXPECT_NE(std::string::npos, posFirst) << result.strOutput;
    EXPECT_LT(posLast, posFirst) << result.strOutput;

    DeleteFileW(wstrPartial.c_str());
    std::vector<std::wstring> rgNames = FileNames(c_wszTraceFolder);
    ASSERT_EQ(2u, rgNames.size());

    // By LogID: every log of the run, in LogCount order (the second twice: file and
    // submission).
    std::string strLogId = GuidText(c_guidLog);
    result = Ctl(L"trace show " + Widen(strLogId));
    ASSERT_EQ(0u, result.dwExitCode) << result.strOutput;
    EXPECT_EQ(3u, Count(result.strOutput, "Trace C:\\")) << result.strOutput;
    EXPECT_EQ(1u, Count(result.strOutput, "LogCount       1   LogEnd false")) << result.strOutput;
    EXPECT_EQ(2u, Count(result.strOutput, "LogCount       2   LogEnd true")) << result.strOutput;
    EXPECT_LT(result.strOutput.find("LogEnd false"), result.strOutput.find("LogEnd true"));
    EXPECT_NE(std::string::npos, result.strOutput.find("Phone          Orvex Mobile Lumen 640, "
                                                       "build 10.0.10586.107 (WPB_CXE_R1)"))
        << result.strOutput;
    EXPECT_NE(std::string::npos, result.strOutput.find("  \"LogID\": \"" + strLogId + "\",\n"))
        << result.strOutput;
    EXPECT_NE(std::string::npos, result.strOutput.find("      \"Value\": {\n"
                                                       "        \"Event\": \"Connect\",\n"
                                                       "        \"Rssi\": -61\n"
                                                       "      }\n"))
        << result.strOutput;

    // By file name in the trace folder, and by full path.
    result = Ctl(L"trace show " + rgNames[0]);
    EXPECT_EQ(0u, result.dwExitCode) << result.strOutput;
    EXPECT_EQ(1u, Count(result.strOutput, "Trace C:\\Data\\Test\\WiFiLog\\"));
    result = Ctl(L"trace show " + std::wstring(c_wszTraceFolder) + L"\\" + rgNames[1]);
    EXPECT_EQ(0u, result.dwExitCode) << result.strOutput;

    result = Ctl(L"trace show 99999999-0000-0000-0000-000000000000");
    EXPECT_EQ(1u, result.dwExitCode) << result.strOutput;
}

TEST_F(TelvanectlTraceTest, PlatformCommandsDriveTheStandIns)
{
    ChildResult result = Ctl(L"platform device set PhoneFriendlyName \"Kitchen phone\"");
    EXPECT_EQ(0u, result.dwExitCode) << result.strOutput;
    EXPECT_EQ(0u, Ctl(L"platform device fail PhoneSOCVersion").dwExitCode);
    EXPECT_EQ(0u, Ctl(L"platform device set BuildNumber 22000").dwExitCode);
    EXPECT_EQ(1u, Ctl(L"platform device set BuildNumber many").dwExitCode);
    EXPECT_EQ(1u, Ctl(L"platform device fail NoSuchItem").dwExitCode);
    result = Ctl(L"platform device show");
    EXPECT_NE(std::string::npos, result.strOutput.find("set      Kitchen phone"))
        << result.strOutput;
    EXPECT_NE(std::string::npos, result.strOutput.find("PhoneSOCVersion                  fails"))
        << result.strOutput;

    CTraceDocument document;
    document.Begin(c_guidActivity, c_guidSession, c_guidLog);
    rapidjson::Document trace;
    ParseStrict(document.CurrentText(), trace);
    EXPECT_STREQ("Kitchen phone", trace["Phone"]["PhoneFriendlyName"].GetString());
    EXPECT_FALSE(trace["Phone"].HasMember("PhoneSOCVersion"));
    EXPECT_EQ(22000u, trace["Phone"]["BuildNumber"].GetUint());
    EXPECT_EQ(0u, Ctl(L"platform device reset").dwExitCode);
    EXPECT_TRUE(DeviceInfoGetFailures().empty());

    EXPECT_EQ(0u, Ctl(L"platform submission fail 0x1f").dwExitCode);
    EXPECT_EQ(0x1fu, SubmissionGetResult(c_wszSubmissionInitResult));
    EXPECT_EQ(0u, Ctl(L"platform submission fail submit 5").dwExitCode);
    EXPECT_EQ(5u, SubmissionGetResult(c_wszSubmissionSubmitResult));
    EXPECT_EQ(2u, Ctl(L"platform submission fail 0").dwExitCode);
    result = Ctl(L"platform submission list");
    EXPECT_NE(std::string::npos, result.strOutput.find("Init fails, SubmitData fails"))
        << result.strOutput;
    EXPECT_EQ(0u, Ctl(L"platform submission ok").dwExitCode);
    EXPECT_EQ(0u, SubmissionGetResult(c_wszSubmissionInitResult));

    AllowDelivery(2);
    Record(document, c_guidLog, "1");
    document.FlushAndRestart(true);
    result = Ctl(L"platform submission list");
    EXPECT_NE(std::string::npos, result.strOutput.find("1 submission(s)")) << result.strOutput;
    EXPECT_NE(std::string::npos, result.strOutput.find("ZARI_DavoDuvuri_Z1")) << result.strOutput;
}
