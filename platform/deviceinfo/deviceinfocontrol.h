// How tests and telvanectl drive the device information stand-in: its registry key under
// HKEY_LOCAL_MACHINE holds one value per item or build field that overrides the default
// (text items as REG_SZ, build numbers as REG_DWORD), and "Fail", a REG_MULTI_SZ of the
// names that fail ("Build" for the build record, "*" for every call). Free functions
// without state: any thread, any process.
#pragma once

#include <windows.h>

#include <string>
#include <vector>

extern const wchar_t c_wszDeviceInfoKey[];

// The build record's names: "Branch", "BuildTimeStamp" (text), "ParentBranchBuild",
// "BuildNumber", "QFELevel", "OV_MajorVersion", "OV_MinorVersion" (numbers); "Build" names
// the record as a whole in the failure list.
extern const wchar_t c_wszDeviceInfoBuild[];

struct DEVICE_INFO_SETTING
{
    std::wstring wstrName;  // item key ("Manufacturer") or build field name
    std::wstring wstrValue; // text, or the number in decimal
    bool fNumber;           // a build number
    bool fOverridden;       // set in the registry, not the default
};

// The sixteen item keys in item order ("Manufacturer" ... "PhoneFriendlyName").
const wchar_t *DeviceInfoItemName(DWORD dwItem);

// Every item and build field with its current value, items first.
std::vector<DEVICE_INFO_SETTING> DeviceInfoGetSettings();
// The names that currently fail.
std::vector<std::wstring> DeviceInfoGetFailures();

// Overrides one item or build field; false (nothing written) for an unknown name or a
// build number that is not a decimal 32-bit number.
bool DeviceInfoSet(const std::wstring &wstrName, const std::wstring &wstrValue);
// Makes a name fail (an item key, "Build" or "*"), or stops it failing.
bool DeviceInfoSetFailing(const std::wstring &wstrName, bool fFail);
// Back to the defaults: every override and failure removed.
void DeviceInfoReset();
