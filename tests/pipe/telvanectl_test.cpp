// telvanectl.exe as a child process against the test service side of each pipe.
#include "tests/common/testsupport.h"
#include "tests/pipe/testpipeserver.h"

#include <gtest/gtest.h>
#include <thread>

using namespace pipetest;
using testsupport::ChildResult;
using testsupport::RunChild;

namespace
{
const wchar_t c_wszActivityId[] = L"{0a1b2c3d-0000-4000-8000-000000000001}";
const wchar_t c_wszLogId[] = L"0a1b2c3d-0000-4000-8000-000000000002";
const wchar_t c_wszEventText[] = L"11111111-2222-3333-4444-555555555555";
const wchar_t c_wszEventFile[] = L"{66666666-7777-8888-9999-aaaaaaaaaaaa}";
const wchar_t c_wszCollectorId[] = L"cccccccc-0000-4000-8000-00000000000c";

GUID ParseGuid(const wchar_t *wsz)
{
    std::wstring text = wsz;
    if (text.front() == L'{')
    {
        text = text.substr(1, 36);
    }
    GUID guid = {};
    unsigned long ul;
    unsigned int rgu[10];
    swscanf(text.c_str(), L"%8lx-%4x-%4x-%2x%2x-%2x%2x%2x%2x%2x%2x", &ul, &rgu[0], &rgu[1], &rgu[2],
            &rgu[3], &rgu[4], &rgu[5], &rgu[6], &rgu[7], &rgu[8], &rgu[9]);
    guid.Data1 = ul;
    guid.Data2 = static_cast<USHORT>(rgu[0]);
    guid.Data3 = static_cast<USHORT>(rgu[1]);
    for (int i = 0; i < 8; i++)
    {
        guid.Data4[i] = static_cast<BYTE>(rgu[2 + i]);
    }
    return guid;
}

// A file in the temporary folder holding the bytes; deleted with the object.
class CTempFile
{
public:
    explicit CTempFile(const std::vector<BYTE> &vb)
    {
        wchar_t wszDir[MAX_PATH];
        wchar_t wszPath[MAX_PATH];
        GetTempPathW(MAX_PATH, wszDir);
        GetTempFileNameW(wszDir, L"tvc", 0, wszPath);
        m_path = wszPath;
        HANDLE hFile = CreateFileW(wszPath, GENERIC_WRITE, 0, nullptr, CREATE_ALWAYS,
                                   FILE_ATTRIBUTE_NORMAL, nullptr);
        DWORD cbWritten = 0;
        WriteFile(hFile, vb.data(), static_cast<DWORD>(vb.size()), &cbWritten, nullptr);
        CloseHandle(hFile);
    }
    ~CTempFile() { DeleteFileW(m_path.c_str()); }
    const std::wstring &Path() const { return m_path; }

private:
    std::wstring m_path;
};

std::wstring Tool()
{
    return L"\"" + testsupport::BinDir() + L"telvanectl.exe\"";
}
} // namespace

TEST(Telvanectl, PrintsUsageOnBadArguments)
{
    const wchar_t *rgwszArgs[] = {
        L"",
        L"frobnicate",
        L"activity",
        L"activity not-a-guid 0a1b2c3d-0000-4000-8000-000000000002",
        L"activity --timeout soon {0a1b2c3d-0000-4000-8000-000000000001} "
        L"0a1b2c3d-0000-4000-8000-000000000002",
        L"activity {0a1b2c3d-0000-4000-8000-000000000001} 0a1b2c3d-0000-4000-8000-000000000002 "
        L"novalue",
        L"collector cccccccc-0000-4000-8000-00000000000c",
        L"collector --requests 0 cccccccc-0000-4000-8000-00000000000c x",
        L"collector --bogus cccccccc-0000-4000-8000-00000000000c x",
    };
    for (const wchar_t *wszArgs : rgwszArgs)
    {
        ChildResult result = RunChild(Tool() + L" " + wszArgs);
        EXPECT_EQ(2u, result.dwExitCode) << testsupport::Narrow(wszArgs);
        EXPECT_NE(std::string::npos, result.strOutput.find("usage: telvanectl activity"))
            << result.strOutput;
    }

    // A sign or a value past 32 bits is no number of milliseconds or requests: read leniently,
    // "-1" would become a wait without end on a pipe nobody serves.
    std::wstring none = UniquePipeName(L"ctlnumbers");
    const wchar_t *rgwszNumbers[] = {
        L"activity --timeout -1",
        L"activity --timeout 4294967296",
        L"activity --timeout 99999999999999999999999",
        L"collector --timeout 100 --requests -2",
    };
    for (const wchar_t *wszNumbers : rgwszNumbers)
    {
        std::wstring args =
            std::wstring(wszNumbers) + L" --pipe " + none + L" " +
            (wszNumbers[0] == L'a' ? std::wstring(c_wszActivityId) + L" " + c_wszLogId
                                   : std::wstring(c_wszCollectorId) + L" x");
        ChildResult result = RunChild(Tool() + L" " + args, {}, pipetest::c_dwWaitMs);
        EXPECT_FALSE(result.fTimedOut) << testsupport::Narrow(args);
        EXPECT_EQ(2u, result.dwExitCode) << testsupport::Narrow(args) << "\n" << result.strOutput;
    }
}

TEST(Telvanectl, ActivitySendsStartEventsAndStop)
{
    std::wstring name = UniquePipeName(L"ctlactivity");
    CTestPipeServer *pServer = CTestPipeServer::Start(false, name);
    std::vector<BYTE> fileValue = Pattern(3000, 9);
    CTempFile file(fileValue);

    ChildResult result =
        RunChild(Tool() + L" activity --pipe " + name + L" " + c_wszActivityId + L" " + c_wszLogId +
                 L" " + c_wszEventText + L"=h\u00e9llo " + c_wszEventFile + L"=@" + file.Path());
    EXPECT_EQ(0u, result.dwExitCode) << result.strOutput;
    EXPECT_NE(std::string::npos, result.strOutput.find("sent event 66666666-7777-8888-9999-"
                                                       "aaaaaaaaaaaa: 3000 bytes"))
        << result.strOutput;

    ASSERT_TRUE(pServer->WaitForEnd()) << "the stop message arrived";
    EXPECT_TRUE(SameGuid(pServer->ActivityID(), ParseGuid(c_wszActivityId)));
    EXPECT_TRUE(SameGuid(pServer->LogID(), ParseGuid(c_wszLogId)));
    std::vector<ReceivedItem> items = pServer->Items();
    ASSERT_EQ(2u, items.size());
    EXPECT_TRUE(SameGuid(items[0].id, ParseGuid(c_wszEventText)));
    EXPECT_EQ(std::vector<BYTE>({'h', 0xC3, 0xA9, 'l', 'l', 'o'}), items[0].vb) << "UTF-8 text";
    EXPECT_TRUE(SameGuid(items[1].id, ParseGuid(c_wszEventFile)));
    EXPECT_EQ(fileValue, items[1].vb);
    pServer->Finish();

    // Nobody listening is a failure with the reason, not a hang.
    result = RunChild(Tool() + L" activity --timeout 100 --pipe " + UniquePipeName(L"none") + L" " +
                      c_wszActivityId + L" " + c_wszLogId);
    EXPECT_EQ(1u, result.dwExitCode);
    EXPECT_NE(std::string::npos, result.strOutput.find("connecting to the activity pipe failed: "
                                                       "0x80070002"))
        << result.strOutput;
}

TEST(Telvanectl, CollectorAnswersRequestsWithTheFile)
{
    std::wstring name = UniquePipeName(L"ctlcollector");
    CTestPipeServer *pServer = CTestPipeServer::Start(true, name);
    std::vector<BYTE> fileValue = Pattern(5000, 4);
    CTempFile file(fileValue);

    ChildResult result;
    std::thread tool([&] {
        result = RunChild(Tool() + L" collector --requests 2 --pipe " + name + L" " +
                          c_wszCollectorId + L" " + file.Path());
    });
    bool fRegistered = pServer->WaitForRegistration();
    if (fRegistered)
    {
        for (BYTE b = 1; b <= 2; b++)
        {
            pServer->SendStartCollection(TestGuid(b), TestGuid(static_cast<BYTE>(b + 10)));
            EXPECT_TRUE(pServer->WaitForItems(b));
        }
    }
    tool.join();
    ASSERT_TRUE(fRegistered) << result.strOutput;
    EXPECT_EQ(0u, result.dwExitCode) << result.strOutput;
    EXPECT_TRUE(SameGuid(pServer->CollectorID(), ParseGuid(c_wszCollectorId)));
    std::vector<ReceivedItem> items = pServer->Items();
    ASSERT_EQ(2u, items.size());
    EXPECT_EQ(fileValue, items[0].vb);
    EXPECT_EQ(fileValue, items[1].vb);
    EXPECT_TRUE(pServer->WaitForEnd()) << "the tool breaks the pipe after its requests";
    EXPECT_NE(std::string::npos, result.strOutput.find("answered with 5000 bytes"));
    pServer->Finish();
}
