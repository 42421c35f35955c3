// The misuse the two stand-ins refuse as the phone's libraries do (the service's own calls,
// which the trace document and sink tests drive, never commit it, so only these calls show a
// faulty service would be caught), and the spool that tests and telvanectl read. Runs on the
// test thread.
#include "platform/deviceinfo/deviceinfo.h"
#include "platform/submission/submission.h"
#include "tests/trace/deliverystate.h"

#include <cwchar>
#include <string>
#include <vector>

using StandInTest = tracetest::CDeliveryTest;

TEST_F(StandInTest, MisuseIsRefused)
{
    wchar_t wszBuffer[16];
    const DWORD rgdwBad[][3] = {{16, 16, 0}, {0, 16, 1}, {0, 0, 0}}; // item, buffer, flags
    for (const DWORD *pdw : rgdwBad)
    {
        SetLastError(0);
        EXPECT_FALSE(QueryPhoneInformation(pdw[0], wszBuffer, pdw[1], pdw[2])) << pdw[0] << pdw[1];
        EXPECT_EQ(static_cast<DWORD>(ERROR_INVALID_PARAMETER), GetLastError());
    }
    EXPECT_EQ(E_POINTER, GetPhoneBuildInfo(nullptr));
    // A branch longer than the field is cut to fit with its NUL.
    ASSERT_TRUE(DeviceInfoSet(L"Branch", std::wstring(100, L'b')));
    PHONE_BUILD_INFO build = {};
    EXPECT_EQ(S_OK, GetPhoneBuildInfo(&build));
    EXPECT_EQ(std::wstring(63, L'b'), build.wszBranch);

    // A profile with no name, one the default constructor did not prepare, or no Init.
    for (int iCase = 0; iCase < 3; iCase++)
    {
        SCOPED_TRACE(iCase);
        CrowdsourcingProfile_t profile;
        wcscpy(profile.wszProfileName, iCase == 0 ? L"" : L"P");
        if (iCase == 1)
        {
            memset(profile.rgbLibraryState, 0, sizeof(profile.rgbLibraryState));
        }
        CrowdsourcingDataSubmitter_t submitter(profile, nullptr, 0, nullptr);
        if (iCase < 2)
        {
            EXPECT_EQ(static_cast<DWORD>(ERROR_INVALID_PARAMETER), submitter.Init());
        }
        EXPECT_EQ(static_cast<DWORD>(ERROR_INVALID_STATE),
                  submitter.SubmitData(reinterpret_cast<const BYTE *>("{}"), 2, nullptr));
    }
    EXPECT_TRUE(SubmissionList().empty());
}

TEST_F(StandInTest, TheSpoolKeepsEachAcceptedSubmissionWholeNewestFirst)
{
    std::string strData("binary\0data\r\n\xff", 15);
    {
        CrowdsourcingProfile_t profile;
        wcscpy(profile.wszProfileName, L"Other_Profile");
        profile.rgdwSettings[7] = 8;
        CrowdsourcingDataSubmitter_t submitter(profile, L"https://upload", 7, nullptr);
        EXPECT_EQ(0u, submitter.Init());
        EXPECT_EQ(0u,
                  submitter.SubmitData(reinterpret_cast<const BYTE *>(strData.data()),
                                       static_cast<DWORD>(strData.size()), &tracetest::c_guidLog));
        EXPECT_EQ(0u, submitter.SubmitData(nullptr, 0, nullptr));
    }
    std::vector<SUBMISSION_RECORD> rgRecords = SubmissionList();
    ASSERT_EQ(2u, rgRecords.size());
    EXPECT_EQ("", rgRecords[0].strData);
    EXPECT_EQ("null", rgRecords[0].strGuid);
    const SUBMISSION_RECORD &record = rgRecords[1];
    EXPECT_EQ(strData, record.strData);
    EXPECT_EQ("Other_Profile", record.strProfileName);
    EXPECT_EQ("https://upload 7 null", record.strTarget);
    EXPECT_EQ(testsupport::GuidText(tracetest::c_guidLog), record.strGuid);
    EXPECT_EQ(8u, record.rgdwSettings[7]);
    EXPECT_LE(rgRecords[1].ullSubmitted, rgRecords[0].ullSubmitted);

    // Only complete files count: a temporary one or a cut one is not listed.
    std::wstring wstrCut = record.wstrPath.substr(0, record.wstrPath.size() - 4) + L"0.sub";
    std::string strFile = testsupport::ReadFileText(record.wstrPath);
    ASSERT_TRUE(testsupport::WriteFileText(wstrCut, strFile.substr(0, strFile.size() - 1)));
    EXPECT_EQ(2u, SubmissionList().size());
}
