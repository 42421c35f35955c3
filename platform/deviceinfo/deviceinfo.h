// Stand-in for the phone's device information library: the build record and the sixteen
// device-information items, and no more. Values come from the stand-in's registry key
// (deviceinfocontrol.h), with defaults of a typical phone; any item, or the build record,
// can be made to fail there. The functions may be called from any thread.
#pragma once

#include <windows.h>

// Filled by GetPhoneBuildInfo; the caller zeroes it first. 276 bytes, little-endian.
struct PHONE_BUILD_INFO
{
    WCHAR wszBranch[64];    // NUL-terminated, at most 63 characters
    WCHAR wszTimeStamp[64]; // the build's time-stamp text, NUL-terminated
    DWORD dwParentBranchBuild;
    DWORD dwMajorVersion;
    DWORD dwMinorVersion;
    DWORD dwQfeLevel;
    DWORD dwBuildNumber;
};
static_assert(sizeof(PHONE_BUILD_INFO) == 276, "the build record is 276 bytes");

// Device-information items, in the order the trace lists them.
enum PHONE_INFORMATION_ITEM : DWORD
{
    PhoneInformationManufacturer = 0,
    PhoneInformationRomVersion = 1,
    PhoneInformationMobileOperatorName = 2,
    PhoneInformationMobileOperatorDisplayName = 3,
    PhoneInformationModelName = 4,
    PhoneInformationManufacturerModelName = 5,
    PhoneInformationHardwareRevision = 6,
    PhoneInformationSocVersion = 7,
    PhoneInformationFirmwareRevision = 8,
    PhoneInformationRadioHardwareRevision = 9,
    PhoneInformationRadioSoftwareRevision = 10,
    PhoneInformationBootLoaderVersion = 11,
    PhoneInformationSupportPhoneNumber = 12,
    PhoneInformationSupportLink = 13,
    PhoneInformationOemSupportLink = 14,
    PhoneInformationFriendlyName = 15,
};
const DWORD c_cPhoneInformationItems = 16;

#ifdef __cplusplus
extern "C"
{
#endif

    // Fills the record; a negative result means failure (then the record is left as it was).
    HRESULT WINAPI GetPhoneBuildInfo(PHONE_BUILD_INFO *pBuildInfo);

    // Copies the item's NUL-terminated text into wszBuffer (cchBuffer characters); dwFlags
    // must be 0. Returns non-zero on success; 0 with the last error set when the item is
    // unknown or failing, or its text does not fit.
    BOOL WINAPI QueryPhoneInformation(DWORD dwItem, PWSTR wszBuffer, DWORD cchBuffer,
                                      DWORD dwFlags);

#ifdef __cplusplus
}
#endif
