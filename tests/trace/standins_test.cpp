// The two stand-ins called directly, as the service and other callers use them: argument
// checks, failure switches and the submission spool's files.
#include "platform/deviceinfo/deviceinfo.h"
#include "platform/deviceinfo/deviceinfocontrol.h"
#include "platform/submission/submission.h"
#include "platform/submission/submissioncontrol.h"
#include "tests/trace/deliverystate.h"

#include <cwchar>
#include <string>

namespace
{
using StandInTest = tracetest::CDeliveryTest;

void FillProfile(CrowdsourcingProfile_t &profile, const wchar_t *wszName)
{
    wcscpy(profile.wszProfileName, wszName);
    for (DWORD i = 0; i < 8; i++)
    {
        profile.rgdwSettings[i] = i + 1;
    }
}
} // namespace

TEST_F(StandInTest, QueryPhoneInformationChecksItsArguments)
{
    struct Row
    {
        const char *szCase;
        DWORD dwItem;
        DWORD cchBuffer;
        DWORD dwFlags;
        BOOL fExpected;
        DWORD dwError;
    };
    const Row rgRows[] = {
        {"first item", 0, 1024, 0, TRUE, 0},
        {"last item", 15, 1024, 0, TRUE, 0},
        {"item 16", 16, 1024, 0, FALSE, ERROR_INVALID_PARAMETER},
        {"flags", 0, 1024, 1, FALSE, ERROR_INVALID_PARAMETER},
        {"empty buffer", 0, 0, 0, FALSE, ERROR_INVALID_PARAMETER},
        {"buffer one short", 0, 12, 0, FALSE, ERROR_INSUFFICIENT_BUFFER},
        {"buffer just right", 0, 13, 0, TRUE, 0}, // "Orvex Mobile" and its NUL
    };
    for (const Row &row : rgRows)
    {
        SCOPED_TRACE(row.szCase);
        wchar_t wszBuffer[1024];
        SetLastError(0);
        EXPECT_EQ(row.fExpected,
                  QueryPhoneInformation(row.dwItem, wszBuffer, row.cchBuffer, row.dwFlags));
        if (!row.fExpected)
        {
            EXPECT_EQ(row.dwError, GetLastError());
        }
    }
    wchar_t wszBuffer[1024];
    ASSERT_TRUE(QueryPhoneInformation(PhoneInformationManufacturer, wszBuffer, 1024, 0));
    EXPECT_STREQ(L"Orvex Mobile", wszBuffer);
}

TEST_F(StandInTest, GetPhoneBuildInfoFailsWithANegativeResultAndLeavesTheRecord)
{
    PHONE_BUILD_INFO build = {};
    EXPECT_EQ(E_POINTER, GetPhoneBuildInfo(nullptr));

    // A branch longer than the field is cut to fit with its NUL.
    ASSERT_TRUE(DeviceInfoSet(L"Branch", std::wstring(100, L'b')));
    EXPECT_EQ(S_OK, GetPhoneBuildInfo(&build));
    EXPECT_EQ(std::wstring(63, L'b'), build.wszBranch);

    ASSERT_TRUE(DeviceInfoSetFailing(L"Build", true));
    PHONE_BUILD_INFO untouched = {};
    EXPECT_LT(GetPhoneBuildInfo(&untouched), 0);
    EXPECT_EQ(0, untouched.wszBranch[0]);
    ASSERT_TRUE(DeviceInfoSetFailing(L"Build", false));
    EXPECT_EQ(S_OK, GetPhoneBuildInfo(&untouched));
}

TEST_F(StandInTest, TheSubmitterRefusesMisuseAndObeysItsFailureSwitches)
{
    struct Row
    {
        const char *szCase;
        bool fPrepared; // the profile came from the default constructor
        const wchar_t *wszName;
        DWORD dwInitSwitch; // InitResult
        bool fInit;         // Init is called before SubmitData
        DWORD dwInitExpected;
        DWORD dwSubmitExpected;
    };
    const Row rgRows[] = {
        {"normal", true, L"P", 0, true, 0, 0},
        {"no Init", true, L"P", 0, false, 0, ERROR_INVALID_STATE},
        {"empty name", true, L"", 0, true, ERROR_INVALID_PARAMETER, ERROR_INVALID_STATE},
        {"profile not prepared", false, L"P", 0, true, ERROR_INVALID_PARAMETER,
         ERROR_INVALID_STATE},
        {"Init told to fail", true, L"P", 0x80004005, true, 0x80004005, ERROR_INVALID_STATE},
    };
    for (const Row &row : rgRows)
    {
        SCOPED_TRACE(row.szCase);
        SubmissionClear();
        ASSERT_TRUE(SubmissionSetResult(c_wszSubmissionInitResult, row.dwInitSwitch));
        CrowdsourcingProfile_t profile;
        FillProfile(profile, row.wszName);
        if (!row.fPrepared)
        {
            memset(profile.rgbLibraryState, 0, sizeof(profile.rgbLibraryState));
        }
        CrowdsourcingDataSubmitter_t submitter(profile, nullptr, 0, nullptr);
        if (row.fInit)
        {
            EXPECT_EQ(row.dwInitExpected, submitter.Init());
        }
        EXPECT_EQ(row.dwSubmitExpected,
                  submitter.SubmitData(reinterpret_cast<const BYTE *>("{}"), 2, nullptr));
        EXPECT_EQ(row.dwSubmitExpected == 0 ? 1u : 0u, SubmissionList().size());
    }
}
