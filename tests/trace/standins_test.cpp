// The misuse the two stand-ins refuse as the phone's libraries do. The service's own calls
// never commit it (the trace document and sink tests drive those), so only these calls show
// that a faulty service would be caught. Runs on the test thread.
#include "platform/deviceinfo/deviceinfo.h"
#include "platform/submission/submission.h"
#include "tests/trace/deliverystate.h"

#include <cwchar>
#include <string>

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
