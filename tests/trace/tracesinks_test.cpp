// Delivery of closed logs through the real registry values, the prefix's file system and the
// submission stand-in's spool: which sinks each pair of values selects, the trace file's
// folder and names, and the submission's profile and call order.
#include "service/ctracedocument.h"
#include "service/tracesinks.h"

#include "platform/submission/submissioncontrol.h"
#include "tests/trace/tracetestsupport.h"

#include <rpc.h>

#include <gtest/gtest.h>

#include <algorithm>
#include <string>
#include <vector>

using namespace tracetest;

namespace
{
const GUID c_guidActivity = {
    0x11111111, 0x2222, 0x4333, {0x84, 0x44, 0x55, 0x55, 0x55, 0x55, 0x55, 0x55}};
const GUID c_guidSession = {
    0x66666666, 0x7777, 0x4888, {0x89, 0x99, 0xaa, 0xaa, 0xaa, 0xaa, 0xaa, 0xaa}};
const GUID c_guidLog = {
    0xcccccccc, 0xdddd, 0x4eee, {0x8f, 0xff, 0x00, 0x11, 0x22, 0x33, 0x44, 0x55}};

const char c_szReadingPreference[] = "CServiceOperation::Reading User Preference key";
const char c_szReadingTest[] = "CServiceOperation::Reading Test Registry key";
const char c_szJustFile[] = "CServiceOperation::Test Registry key value set, sending to just file";
const char c_szBoth[] =
    "CServiceOperation::Test Registry key value set, sending to both file and Vantor";
const char c_szWritingFile[] = "CServiceOperation::Writing trace to filesystem";
const char c_szWritingVantor[] = "CServiceOperation::Writing trace to Vantor";

class TraceSinksTest : public testing::Test
{
protected:
    void SetUp() override { ResetDeliveryState(); }
    void TearDown() override { ResetDeliveryState(); }
};

// One log with one record, flushed as the final log.
void FlushOneLog()
{
    CTraceDocument document;
    document.Begin(c_guidActivity, c_guidSession, c_guidLog);
    const char szEvent[] = "{\"Event\":\"Connect\"}";
    document.RecordEvent(c_guidActivity, reinterpret_cast<const BYTE *>(szEvent), sizeof(szEvent));
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

// A registry value's state before a flush: missing, a DWORD, or a string.
struct ValueState
{
    // 0: value missing, 1: DWORD, 2: REG_SZ, 3: key missing (only for keys no one else uses:
    // the service's own Parameters key also holds its installation)
    int iKind;
    DWORD dwValue;
};

void Apply(const wchar_t *wszKey, const wchar_t *wszValue, const ValueState &state)
{
    if (state.iKind == 3)
    {
        DeleteKey(wszKey);
        return;
    }
    DeleteValue(wszKey, wszValue);
    if (state.iKind == 1)
    {
        SetDword(wszKey, wszValue, state.dwValue);
    }
    else if (state.iKind == 2)
    {
        SetString(wszKey, wszValue, std::to_wstring(state.dwValue));
    }
}
} // namespace

TEST_F(TraceSinksTest, TheTwoValuesChooseTheSinks)
{
    const ValueState c_missing = {0, 0};
    const ValueState c_keyMissing = {3, 0};
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
        {"preference key missing", c_keyMissing, dword(2), 0, 0},
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
        Apply(c_wszTestKey, c_wszTestValue, row.testLogging);
        TraceSession session;
        FlushOneLog();

        std::vector<std::string> rgFiles = TraceFileTexts();
        std::vector<SUBMISSION_RECORD> rgSubmissions = SubmissionList();
        EXPECT_EQ(row.cFiles, rgFiles.size());
        EXPECT_EQ(row.cSubmissions, rgSubmissions.size());
        bool fAllowed = (row.preference.iKind == 1 && (row.preference.dwValue & 3) == 3) ||
                        (row.preference.iKind == 2 && row.preference.dwValue == 3);
        EXPECT_EQ(1u, session.CountMessages(c_szReadingPreference));
        EXPECT_EQ(fAllowed ? 1u : 0u, session.CountMessages(c_szReadingTest));
        EXPECT_EQ(row.cFiles, session.CountMessages(c_szWritingFile));
        EXPECT_EQ(row.cSubmissions, session.CountMessages(c_szWritingVantor));
        EXPECT_EQ(row.cFiles == 1 && row.cSubmissions == 0 ? 1u : 0u,
                  session.CountMessages(c_szJustFile));
        EXPECT_EQ(row.cFiles == 1 && row.cSubmissions == 1 ? 1u : 0u,
                  session.CountMessages(c_szBoth));
        // File and submission carry the same text: the log with "LogEnd".
        if (row.cFiles == 1 && row.cSubmissions == 1)
        {
            EXPECT_EQ(rgFiles[0], rgSubmissions[0].strData);
        }
        for (const SUBMISSION_RECORD &submission : rgSubmissions)
        {
            rapidjson::Document trace;
            ParseStrict(submission.strData, trace);
            EXPECT_TRUE(trace["LogEnd"].GetBool());
        }
    }
}

TEST_F(TraceSinksTest, WithoutTheTestFolderNoFileIsWrittenAndTheSubmissionStillHappens)
{
    RemoveDirectoryTree(L"C:\\Data\\Test");
    AllowDelivery(2);
    TraceSession session;
    FlushOneLog();
    EXPECT_EQ(INVALID_FILE_ATTRIBUTES, GetFileAttributesW(L"C:\\Data\\Test"));
    EXPECT_EQ(1u, session.CountMessages(c_szWritingFile));
    EXPECT_EQ(1u, SubmissionList().size());

    // Only the last folder is made: with its parent back, the folder appears.
    CreateDirectoryW(L"C:\\Data\\Test", nullptr);
    FlushOneLog();
    EXPECT_EQ(1u, TraceFileNames().size());
    EXPECT_EQ(2u, SubmissionList().size());
}

TEST_F(TraceSinksTest, EachLogGetsANewFileNamedByAGuid)
{
    AllowDelivery(1);
    CTraceDocument document;
    document.Begin(c_guidActivity, c_guidSession, c_guidLog);
    for (int i = 0; i < 2; i++)
    {
        document.RecordEvent(c_guidLog, reinterpret_cast<const BYTE *>("1"), 1);
        document.FlushAndRestart(i == 1);
    }
    std::vector<std::wstring> rgNames = TraceFileNames();
    ASSERT_EQ(2u, rgNames.size());
    for (const std::wstring &wstrName : rgNames)
    {
        // Lower-case 8-4-4-4-12, no braces, no extension, and nothing temporary left.
        ASSERT_EQ(36u, wstrName.size());
        GUID guid;
        EXPECT_EQ(RPC_S_OK,
                  UuidFromStringW(
                      reinterpret_cast<RPC_WSTR>(const_cast<wchar_t *>(wstrName.c_str())), &guid));
        EXPECT_EQ(std::string(wstrName.begin(), wstrName.end()), GuidText(guid));
    }
    std::vector<std::string> rgTexts = TraceFileTexts();
    ASSERT_EQ(2u, rgTexts.size());
    // The file holds the text and nothing else: no BOM, no terminator, no line end.
    EXPECT_EQ('{', rgTexts[0].front());
    EXPECT_EQ('}', rgTexts[0].back());
}

TEST_F(TraceSinksTest, AFolderInTheWayOrAFileNamedLikeTheFolderStopsOnlyTheFile)
{
    // "WiFiLog" exists as a file: it is used unchanged and every open under it fails.
    HANDLE hFile = CreateFileW(TraceSinks::c_wszTraceDirectory, GENERIC_WRITE, 0, nullptr,
                               CREATE_ALWAYS, FILE_ATTRIBUTE_NORMAL, nullptr);
    ASSERT_NE(INVALID_HANDLE_VALUE, hFile);
    CloseHandle(hFile);
    std::wstring wstrPath;
    EXPECT_EQ(S_OK, TraceSinks::MakeTraceFileName(wstrPath));
    EXPECT_EQ(0u, wstrPath.find(std::wstring(TraceSinks::c_wszTraceDirectory) + L"\\"));
    EXPECT_TRUE(FAILED(TraceSinks::WriteTraceToFile("{}", 2)));
    AllowDelivery(2);
    FlushOneLog();
    EXPECT_EQ(1u, SubmissionList().size());
    DeleteFileW(TraceSinks::c_wszTraceDirectory);
}

TEST_F(TraceSinksTest, TheSubmissionCarriesTheProfileInTheLibrarysCallOrder)
{
    AllowDelivery(2);
    FlushOneLog();
    std::vector<SUBMISSION_RECORD> rgSubmissions = SubmissionList();
    ASSERT_EQ(1u, rgSubmissions.size());
    const SUBMISSION_RECORD &submission = rgSubmissions[0];
    EXPECT_EQ("ZARI_DavoDuvuri_Z1", submission.strProfileName);
    EXPECT_EQ("null 0 null", submission.strTarget);
    EXPECT_EQ("null", submission.strGuid);
    const DWORD rgdwSettings[8] = {0xFFFFFFFF, 1, 1, 0, 1, 1, 4096, 500};
    for (int i = 0; i < 8; i++)
    {
        EXPECT_EQ(rgdwSettings[i], submission.rgdwSettings[i]) << i;
    }

    // The 120 bytes as the library received them: the name with zeros to 64 bytes, the
    // eight settings, and the library's 24 bytes as its constructor left them.
    std::vector<BYTE> rgbExpected(120, 0);
    const wchar_t wszName[] = L"ZARI_DavoDuvuri_Z1";
    for (size_t i = 0; wszName[i] != L'\0'; i++)
    {
        rgbExpected[2 * i] = static_cast<BYTE>(wszName[i]);
    }
    for (int i = 0; i < 8; i++)
    {
        memcpy(&rgbExpected[64 + 4 * i], &rgdwSettings[i], 4);
    }
    const BYTE rgbSignature[8] = {'C', 'S', 'P', 'R', 'O', 'F', 1, 0};
    memcpy(&rgbExpected[96], rgbSignature, sizeof(rgbSignature));
    EXPECT_EQ(rgbExpected, submission.rgbProfile);

    std::string strLength = std::to_string(submission.strData.size());
    EXPECT_EQ((std::vector<std::string>{
                  "CrowdsourcingProfile_t()",
                  "CrowdsourcingDataSubmitter_t(profile, null 0 null)",
                  "Init() = 0x0",
                  "SubmitData(" + strLength + " bytes, null) = 0x0",
                  "~CrowdsourcingDataSubmitter_t()",
                  "~CrowdsourcingProfile_t()",
              }),
              JournalCalls());
}

TEST_F(TraceSinksTest, FailuresOfTheLibraryAreTracedWithItsCode)
{
    struct Row
    {
        const char *szCase;
        DWORD dwInit;
        DWORD dwSubmit;
        size_t cInitFailures;
        size_t cSubmitFailures;
        size_t cSubmitCalls;
    };
    const Row rgRows[] = {
        {"Init fails", 0x1234, 0, 1, 0, 0},
        {"SubmitData fails", 0, ERROR_NOT_ENOUGH_MEMORY, 0, 1, 1},
        {"both would fail", 0x5, 0x6, 1, 0, 0},
    };
    for (const Row &row : rgRows)
    {
        SCOPED_TRACE(row.szCase);
        ResetDeliveryState();
        SetDword(c_wszPreferenceKey, c_wszPreferenceValue, 3);
        ASSERT_TRUE(SubmissionSetResult(c_wszSubmissionInitResult, row.dwInit));
        ASSERT_TRUE(SubmissionSetResult(c_wszSubmissionSubmitResult, row.dwSubmit));
        TraceSession session;
        FlushOneLog();
        EXPECT_EQ(row.cInitFailures, session.CountFailures("Vantor Init()"));
        EXPECT_EQ(row.cSubmitFailures, session.CountFailures("Vantor SubmitData()"));
        std::vector<std::string> rgLines = session.Lines();
        std::string strExpected = row.dwInit != 0
                                      ? "1002|Vantor Init()|" + std::to_string(row.dwInit)
                                      : "1002|Vantor SubmitData()|" + std::to_string(row.dwSubmit);
        EXPECT_NE(rgLines.end(), std::find(rgLines.begin(), rgLines.end(), strExpected));
        EXPECT_TRUE(SubmissionList().empty());
        std::vector<std::string> rgCalls = JournalCalls();
        size_t cSubmitCalls = 0;
        for (const std::string &strCall : rgCalls)
        {
            cSubmitCalls += strCall.rfind("SubmitData(", 0) == 0 ? 1 : 0;
        }
        EXPECT_EQ(row.cSubmitCalls, cSubmitCalls);
        // The submitter and the profile are destroyed on every path, in that order.
        ASSERT_GE(rgCalls.size(), 2u);
        EXPECT_EQ("~CrowdsourcingDataSubmitter_t()", rgCalls[rgCalls.size() - 2]);
        EXPECT_EQ("~CrowdsourcingProfile_t()", rgCalls.back());
    }
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
    s_rgFolderDuringWrites.push_back(TraceFileNames());
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

class TraceFileWriteTest : public TraceSinksTest
{
protected:
    void SetUp() override
    {
        TraceSinksTest::SetUp();
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
        TraceSinksTest::TearDown();
    }
};

bool IsTemporaryName(const std::wstring &wstrName)
{
    return wstrName.size() == 36 + 4 && wstrName.compare(36, 4, L".tmp") == 0;
}
} // namespace

TEST_F(TraceFileWriteTest, AReaderSeesOnlyTheTemporaryNameUntilTheFileIsComplete)
{
    FlushOneLog();
    std::vector<SUBMISSION_RECORD> rgSubmissions = SubmissionList();
    ASSERT_EQ(1u, rgSubmissions.size());
    size_t cbText = rgSubmissions[0].strData.size();
    // Short writes: the sink goes on until every byte is written.
    EXPECT_EQ(static_cast<int>((cbText + 99) / 100), s_cWrites);
    for (const std::vector<std::wstring> &rgNames : s_rgFolderDuringWrites)
    {
        ASSERT_EQ(1u, rgNames.size());
        EXPECT_TRUE(IsTemporaryName(rgNames[0])) << testing::PrintToString(rgNames[0]);
    }
    std::vector<std::wstring> rgNames = TraceFileNames();
    ASSERT_EQ(1u, rgNames.size());
    EXPECT_EQ(36u, rgNames[0].size());
    EXPECT_EQ(rgNames[0] + L".tmp", s_rgFolderDuringWrites[0][0]);
    EXPECT_EQ(rgSubmissions[0].strData,
              ReadFileText(std::wstring(TraceSinks::c_wszTraceDirectory) + L"\\" + rgNames[0]));
}

TEST_F(TraceFileWriteTest, AFailedWriteLeavesNoFileAndTheSubmissionStillHappens)
{
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
        EXPECT_TRUE(TraceFileNames().empty());
        EXPECT_EQ(row.fNoProgress ? 1 : row.iFailingWrite, s_cWrites);
        EXPECT_EQ(1u, SubmissionList().size());
    }
}
