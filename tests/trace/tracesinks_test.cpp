// Delivery of closed logs through the real registry values, the prefix's file system and the
// submission stand-in's spool: which sinks each pair of values selects, the trace file's
// folder and names, and the submission's profile and call order.
#include "service/ctracedocument.h"
#include "service/tracesinks.h"

#include "inc/handleholder.h"
#include "tests/common/tracesession.h"
#include "tests/trace/deliverystate.h"

#include <algorithm>
#include <string>
#include <thread>
#include <vector>

using namespace testsupport;
using namespace tracetest;

namespace
{

const std::string c_strReadingPreference = "1001|CServiceOperation::Reading User Preference key";
const std::string c_strReadingTest = "1001|CServiceOperation::Reading Test Registry key";
const std::string c_strJustFile =
    "1001|CServiceOperation::Test Registry key value set, sending to just file";
const std::string c_strBoth =
    "1001|CServiceOperation::Test Registry key value set, sending to both file and Vantor";
const std::string c_strWritingFile = "1001|CServiceOperation::Writing trace to filesystem";
const std::string c_strWritingVantor = "1001|CServiceOperation::Writing trace to Vantor";

using TraceSinksTest = CDeliveryTest;

// One log with one record, flushed as the final log.
void FlushOneLog()
{
    CTraceDocument document;
    document.Begin(c_guidActivity, c_guidSession, c_guidLog);
    Record(document, c_guidActivity, std::string("{\"Event\":\"Connect\"}", 20));
    document.FlushAndRestart(true);
}

// The journal without thread IDs.
std::vector<std::string> JournalCalls()
{
    std::vector<std::string> rgCalls;
    for (const std::string &strLine : SubmissionReadJournal())
    {
        rgCalls.push_back(strLine.substr(strLine.find(' ') + 1));
    }
    return rgCalls;
}

// A registry value's state before a flush: 0 value missing, 1 a DWORD, 2 the number as a
// REG_SZ, 3 key missing (only for keys no one else uses: the service's own Parameters key
// also holds its installation).
struct ValueState
{
    int iKind;
    DWORD dwValue;
};

void Apply(const wchar_t *wszKey, const wchar_t *wszValue, const ValueState &state)
{
    HklmDeleteValue(wszKey, wszValue);
    if (state.iKind == 3)
    {
        HklmDeleteKey(wszKey);
    }
    else if (state.iKind == 1)
    {
        HklmSetDword(wszKey, wszValue, state.dwValue);
    }
    else if (state.iKind == 2)
    {
        HklmSetString(wszKey, wszValue, std::to_wstring(state.dwValue));
    }
}
} // namespace

TEST_F(TraceSinksTest, TheTwoValuesChooseTheSinks)
{
    const ValueState c_missing = {0, 0};
    auto dword = [](DWORD dw) { return ValueState{1, dw}; };
    auto text = [](DWORD dw) { return ValueState{2, dw}; };
    struct Row
    {
        const char *szCase;
        ValueState preference;  // "EnableWifiCrowdsourcing"
        ValueState testLogging; // "EnableTestLogging"
        size_t cFiles;
        size_t cSubmissions;
    };
    const Row rgRows[] = {
        {"preference key missing", {3, 0}, dword(2), 0, 0},
        {"preference missing", c_missing, dword(2), 0, 0},
        {"preference 1", dword(1), dword(2), 0, 0},
        {"preference 2", dword(2), dword(2), 0, 0},
        {"preference 3", dword(3), dword(2), 1, 1},
        {"preference 7", dword(7), dword(2), 1, 1},
        {"preference 0xFFFFFFFF", dword(0xFFFFFFFF), dword(2), 1, 1},
        // The type is not checked: the text "3" is read as the number 0x33.
        {"preference as the text 3", text(3), dword(1), 1, 0},
        {"preference as the text 4", text(4), dword(1), 0, 0},
        {"preference as a text longer than 4 bytes", text(13), dword(1), 0, 0},
        {"test value missing", dword(3), c_missing, 0, 1},
        {"test value 0", dword(3), dword(0), 0, 0},
        {"test value 1", dword(3), dword(1), 1, 0},
        {"test value 2", dword(3), dword(2), 1, 1},
        {"test value 3", dword(3), dword(3), 0, 0},
        {"test value not a DWORD", dword(3), text(1), 0, 1},
    };
    for (const Row &row : rgRows)
    {
        SCOPED_TRACE(row.szCase);
        ResetDeliveryState();
        Apply(c_wszPreferenceKey, c_wszPreferenceValue, row.preference);
        Apply(c_wszTestLoggingKey, c_wszTestLoggingValue, row.testLogging);
        CTraceSession session;
        FlushOneLog();

        std::vector<DeliveredLog> rgFiles = DeliveredLogs();
        std::vector<SUBMISSION_RECORD> rgSubmissions = SubmissionList();
        EXPECT_EQ(row.cFiles, rgFiles.size());
        EXPECT_EQ(row.cSubmissions, rgSubmissions.size());
        bool fAllowed = (row.preference.iKind == 1 && (row.preference.dwValue & 3) == 3) ||
                        (row.preference.iKind == 2 && row.preference.dwValue == 3);
        bool fBoth = row.cFiles == 1 && row.cSubmissions == 1;
        EXPECT_EQ(1u, session.CountLines(c_strReadingPreference));
        EXPECT_EQ(fAllowed ? 1u : 0u, session.CountLines(c_strReadingTest));
        EXPECT_EQ(row.cFiles, session.CountLines(c_strWritingFile));
        EXPECT_EQ(row.cSubmissions, session.CountLines(c_strWritingVantor));
        EXPECT_EQ(row.cFiles == 1 && row.cSubmissions == 0 ? 1u : 0u,
                  session.CountLines(c_strJustFile));
        EXPECT_EQ(fBoth ? 1u : 0u, session.CountLines(c_strBoth));
        // File and submission carry the same text, the final log's; the file comes first.
        if (fBoth)
        {
            EXPECT_EQ(rgFiles[0].strText, rgSubmissions[0].strData);
            std::vector<std::string> rgLines = session.Lines();
            EXPECT_LT(std::find(rgLines.begin(), rgLines.end(), c_strWritingFile),
                      std::find(rgLines.begin(), rgLines.end(), c_strWritingVantor));
        }
        for (const SUBMISSION_RECORD &submission : rgSubmissions)
        {
            rapidjson::Document trace;
            ParseStrict(submission.strData, trace);
            EXPECT_TRUE(trace["LogEnd"].GetBool());
        }
    }
}

// A failing file sink stops only the file: without C:\Data\Test (only the last folder is
// made: a device without it is not a test device), or with a file named like the folder (used
// unchanged, and every open under it fails).
TEST_F(TraceSinksTest, AFailingFileSinkStopsOnlyTheFile)
{
    RemoveTree(L"C:\\Data\\Test");
    HklmSetDword(c_wszPreferenceKey, c_wszPreferenceValue, 3);
    HklmSetDword(c_wszTestLoggingKey, c_wszTestLoggingValue, 2);
    CTraceSession session;
    FlushOneLog();
    EXPECT_EQ(INVALID_FILE_ATTRIBUTES, GetFileAttributesW(L"C:\\Data\\Test"));
    EXPECT_EQ(1u, session.CountLines(c_strWritingFile));
    EXPECT_EQ(1u, SubmissionList().size());

    CreateFolders(L"C:\\Data\\Test");
    ASSERT_TRUE(WriteFileText(c_wszTraceFolder, ""));
    std::wstring wstrPath;
    EXPECT_EQ(S_OK, TraceSinks::MakeTraceFileName(wstrPath));
    EXPECT_EQ(0u, wstrPath.find(std::wstring(c_wszTraceFolder) + L"\\"));
    EXPECT_TRUE(FAILED(TraceSinks::WriteTraceToFile("{}", 2)));
    FlushOneLog();
    EXPECT_EQ(2u, SubmissionList().size());
    DeleteFileW(c_wszTraceFolder);

    // With its parent there, the folder appears.
    FlushOneLog();
    EXPECT_EQ(1u, FileNames(c_wszTraceFolder).size());
    EXPECT_EQ(3u, SubmissionList().size());
}

// Operations flush on their own threads: when the folder is missing, several of them may
// find it missing and all try to create it; the ones that lose that race still get a name.
TEST_F(TraceSinksTest, FlushesRacingToCreateTheFolderAllGetAName)
{
    const int c_cRounds = 40;
    const int c_cThreads = 4;
    int cFailed = 0;
    for (int iRound = 0; iRound < c_cRounds; iRound++)
    {
        RemoveTree(TraceSinks::c_wszTraceDirectory);
        ASSERT_EQ(INVALID_FILE_ATTRIBUTES, GetFileAttributesW(TraceSinks::c_wszTraceDirectory));
        CKernelHandle start(CreateEventW(nullptr, TRUE, FALSE, nullptr));
        ASSERT_TRUE(start.IsValid());
        HRESULT rghr[c_cThreads];
        std::vector<std::thread> rgThreads;
        for (int i = 0; i < c_cThreads; i++)
        {
            rgThreads.emplace_back([&, i]() {
                WaitForSingleObject(start.Get(), INFINITE);
                std::wstring wstrPath;
                rghr[i] = TraceSinks::MakeTraceFileName(wstrPath);
            });
        }
        SetEvent(start.Get());
        for (int i = 0; i < c_cThreads; i++)
        {
            rgThreads[i].join();
            cFailed += rghr[i] == S_OK ? 0 : 1;
        }
    }
    EXPECT_EQ(0, cFailed) << "of " << c_cRounds * c_cThreads;
}

// The library's calls in its order whatever fails, the submitter and the profile destroyed on
// every path; a failure is traced with the code that failed.
TEST_F(TraceSinksTest, TheSubmissionFollowsTheLibrarysCallOrder)
{
    struct Row
    {
        DWORD dwInit;
        DWORD dwSubmit;
        std::vector<std::string> rgCalls; // between the constructors and the destructors
        const char *szFailure;
    };
    // "%" stands for the text's length.
    const Row rgRows[] = {
        {0x1234, 0, {"Init() = 0x1234"}, "1002|Vantor Init()|1234"},
        {0,
         ERROR_NOT_ENOUGH_MEMORY,
         {"Init() = 0x0", "SubmitData(% bytes, null) = 0x8"},
         "1002|Vantor SubmitData()|8"},
        {0x5, 0x6, {"Init() = 0x5"}, "1002|Vantor Init()|5"},
        {0, 0, {"Init() = 0x0", "SubmitData(% bytes, null) = 0x0"}, nullptr},
    };
    for (const Row &row : rgRows)
    {
        SCOPED_TRACE(row.rgCalls.back());
        ResetDeliveryState();
        AllowDelivery(2);
        ASSERT_TRUE(SubmissionSetResult(c_wszSubmissionInitResult, row.dwInit));
        ASSERT_TRUE(SubmissionSetResult(c_wszSubmissionSubmitResult, row.dwSubmit));
        CTraceSession session;
        FlushOneLog();
        std::vector<DeliveredLog> rgFiles = DeliveredLogs();
        ASSERT_EQ(1u, rgFiles.size());
        std::vector<std::string> rgExpected = {
            "CrowdsourcingProfile_t()", "CrowdsourcingDataSubmitter_t(profile, null 0 null)"};
        for (std::string strCall : row.rgCalls)
        {
            size_t pos = strCall.find('%');
            rgExpected.push_back(
                pos == std::string::npos
                    ? strCall
                    : strCall.replace(pos, 1, std::to_string(rgFiles[0].strText.size())));
        }
        rgExpected.push_back("~CrowdsourcingDataSubmitter_t()");
        rgExpected.push_back("~CrowdsourcingProfile_t()");
        EXPECT_EQ(rgExpected, JournalCalls());
        bool fFails = row.szFailure != nullptr;
        EXPECT_EQ(fFails ? 1u : 0u, session.CountLines(fFails ? row.szFailure : ""));
        EXPECT_EQ(fFails ? 1u : 0u,
                  session.Count("Vantor Init()") + session.Count("Vantor SubmitData()"));
        EXPECT_EQ(fFails ? 0u : 1u, SubmissionList().size());
    }

    // The 120 bytes as the library received them: the name with zeros to 64 bytes, the
    // eight settings, and the library's 24 bytes as its constructor left them.
    std::vector<SUBMISSION_RECORD> rgSubmissions = SubmissionList();
    ASSERT_EQ(1u, rgSubmissions.size());
    EXPECT_EQ("ZARI_DavoDuvuri_Z1", rgSubmissions[0].strProfileName);
    EXPECT_EQ("null 0 null", rgSubmissions[0].strTarget);
    EXPECT_EQ("null", rgSubmissions[0].strGuid);
    const DWORD rgdwSettings[8] = {0xFFFFFFFF, 1, 1, 0, 1, 1, 4096, 500};
    std::vector<BYTE> rgbExpected(120, 0);
    const char szName[] = "ZARI_DavoDuvuri_Z1";
    for (size_t i = 0; szName[i] != '\0'; i++)
    {
        rgbExpected[2 * i] = static_cast<BYTE>(szName[i]);
    }
    memcpy(&rgbExpected[64], rgdwSettings, sizeof(rgdwSettings));
    memcpy(&rgbExpected[96], "CSPROF\1", 8);
    EXPECT_EQ(rgbExpected, rgSubmissions[0].rgbProfile);
}

namespace
{
// What the trace folder holds each time the sink writes, and how the writes behave.
std::vector<std::vector<std::wstring>> s_rgFolderDuringWrites;
DWORD s_cbWriteLimit = 0;   // bytes a call writes at most
int s_iFailingWrite = 0;    // the call that fails (counted from 1), 0: none
bool s_fNoProgress = false; // succeed without writing
int s_cWrites = 0;

BOOL WINAPI SeamWriteFile(HANDLE hFile, LPCVOID pvData, DWORD cbData, LPDWORD pcbWritten,
                          LPOVERLAPPED pOverlapped)
{
    s_rgFolderDuringWrites.push_back(FileNames(c_wszTraceFolder));
    *pcbWritten = 0;
    if (++s_cWrites == s_iFailingWrite)
    {
        SetLastError(ERROR_DISK_FULL);
        return FALSE;
    }
    if (s_fNoProgress)
    {
        return TRUE;
    }
    DWORD cb = cbData < s_cbWriteLimit ? cbData : s_cbWriteLimit;
    return WriteFile(hFile, pvData, cb, pcbWritten, pOverlapped);
}

// Delivery to file and submission through the write seam, on the test thread.
class TraceFileWriteTest : public CDeliveryTest
{
protected:
    void SetUp() override
    {
        CDeliveryTest::SetUp();
        s_rgFolderDuringWrites.clear();
        s_cbWriteLimit = 100;
        s_iFailingWrite = 0;
        s_fNoProgress = false;
        s_cWrites = 0;
        TraceSinks::SetWriteFileForTest(SeamWriteFile);
        AllowDelivery(2);
    }
    void TearDown() override
    {
        TraceSinks::SetWriteFileForTest(nullptr);
        CDeliveryTest::TearDown();
    }
};
} // namespace

TEST_F(TraceFileWriteTest, ReadersSeeOnlyCompleteFilesAndFailedWritesLeaveNone)
{
    FlushOneLog();
    std::vector<SUBMISSION_RECORD> rgSubmissions = SubmissionList();
    ASSERT_EQ(1u, rgSubmissions.size());
    size_t cbText = rgSubmissions[0].strData.size();
    // Short writes: the sink goes on until every byte is written.
    EXPECT_EQ(static_cast<int>((cbText + 99) / 100), s_cWrites);
    std::vector<std::wstring> rgNames = FileNames(c_wszTraceFolder);
    ASSERT_EQ(1u, rgNames.size());
    for (const std::vector<std::wstring> &rgDuring : s_rgFolderDuringWrites)
    {
        EXPECT_EQ(std::vector<std::wstring>{rgNames[0] + L".tmp"}, rgDuring);
    }
    // The final name is a lower-case GUID, no braces, no extension; the file holds the text
    // and nothing else.
    EXPECT_EQ(Narrow(rgNames[0]), GuidText(ParseGuid(Narrow(rgNames[0]).c_str())));
    EXPECT_EQ(rgSubmissions[0].strData,
              ReadFileText(std::wstring(c_wszTraceFolder) + L"\\" + rgNames[0]));

    // A failed write leaves no file, and the submission still happens.
    DeleteFileW((std::wstring(c_wszTraceFolder) + L"\\" + rgNames[0]).c_str());
    struct Row
    {
        const char *szCase;
        int iFailingWrite;
        bool fNoProgress;
    };
    const Row rgRows[] = {
        {"first write fails", 1, false},
        {"third write fails", 3, false},
        {"a write makes no progress", 0, true},
    };
    for (const Row &row : rgRows)
    {
        SCOPED_TRACE(row.szCase);
        SubmissionClear();
        s_cWrites = 0;
        s_iFailingWrite = row.iFailingWrite;
        s_fNoProgress = row.fNoProgress;
        FlushOneLog();
        EXPECT_TRUE(FileNames(c_wszTraceFolder).empty());
        EXPECT_EQ(row.fNoProgress ? 1 : row.iFailingWrite, s_cWrites);
        EXPECT_EQ(1u, SubmissionList().size());
    }
}
