// What the device information stand-in and its control share: the key, the names and the
// defaults of a typical phone. Internal to this folder.
#pragma once

#include <windows.h>

#define DEVICE_INFO_KEY L"Software\\Telvane\\Standins\\DeviceInfo"
#define DEVICE_INFO_FAIL_VALUE L"Fail"
#define DEVICE_INFO_FAIL_ALL L"*"
#define DEVICE_INFO_FAIL_BUILD L"Build"

struct DEVICE_INFO_TEXT_DEFAULT
{
    const wchar_t *wszName;
    const wchar_t *wszDefault;
};

// Item order: the index is the item number.
const DEVICE_INFO_TEXT_DEFAULT c_rgDeviceInfoItems[] = {
    {L"Manufacturer", L"Orvex Mobile"},
    {L"RomVersion", L"02540.00019.15326.36002"},
    {L"PhoneMobileOperatorName", L"000-88"},
    {L"PhoneMobileOperatorDisplayName", L"Telvane Mobile"},
    {L"PhoneModelName", L"Lumen 640"},
    {L"PhoneManufacturerModelName", L"RM-1073_1001"},
    {L"PhoneHardwareRevision", L"1.1.0.0"},
    {L"PhoneSOCVersion", L"8926"},
    {L"PhoneFirmwareRevision", L"02540.00019.15326.36002"},
    {L"PhoneRadioHardwareRevision", L"1.1"},
    {L"PhoneRadioSoftwareRevision", L"BO25c43.00021.0001"},
    {L"PhoneBootLoaderVersion", L"1.1.3.2"},
    {L"PhoneSupportPhoneNumber", L"+1 800 555 0100"},
    {L"PhoneSupportLink", L"https://support.example.com/lumen"},
    {L"PhoneOEMSupportLink", L"https://oem.example.com/support"},
    {L"PhoneFriendlyName", L"Lumen 640"},
};
static_assert(sizeof(c_rgDeviceInfoItems) / sizeof(c_rgDeviceInfoItems[0]) == 16, "sixteen items");

const DEVICE_INFO_TEXT_DEFAULT c_rgDeviceInfoBuildTexts[] = {
    {L"Branch", L"WPB_CXE_R1"},
    {L"BuildTimeStamp", L"151214-1700"},
};

struct DEVICE_INFO_NUMBER_DEFAULT
{
    const wchar_t *wszName;
    DWORD dwDefault;
};

const DEVICE_INFO_NUMBER_DEFAULT c_rgDeviceInfoBuildNumbers[] = {
    {L"ParentBranchBuild", 10586}, {L"OV_MajorVersion", 10},
    {L"OV_MinorVersion", 0},       {L"QFELevel", 107},
    {L"BuildNumber", 10586},
};
