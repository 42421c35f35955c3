// The registry helpers against the prefix's real registry, each test under a key of its own.
#include "servicelib/reghelper.h"
#include "tests/common/testsupport.h"
#include "tests/common/scmtest.h"

#include <gtest/gtest.h>

#include <thread>

using testsupport::FailureCapture;

namespace
{
const DWORD c_dwWaitMs = 10000;

class RegHelper : public ::testing::Test
{
protected:
    void SetUp() override { m_wstrBase = L"SOFTWARE\\TelvaneTest\\" + testsupport::UniqueName(L"Reg"); }
    void TearDown() override { RegDeleteTreeW(HKEY_LOCAL_MACHINE, m_wstrBase.c_str()); }

    std::wstring Path(const wchar_t *wszSub) const { return m_wstrBase + L"\\" + wszSub; }

    void WriteRaw(const std::wstring &wstrPath, const wchar_t *wszValue, DWORD dwType,
                  const void *pvData, DWORD cb)
    {
        HKEY hKey = nullptr;
        ASSERT_EQ(ERROR_SUCCESS, RegCreateKeyExW(HKEY_LOCAL_MACHINE, wstrPath.c_str(), 0, nullptr,
                                                 0, KEY_WRITE, nullptr, &hKey, nullptr));
        ASSERT_EQ(ERROR_SUCCESS,
                  RegSetValueExW(hKey, wszValue, 0, dwType, static_cast<const BYTE *>(pvData), cb));
        RegCloseKey(hKey);
    }

    std::wstring m_wstrBase;
};
} // namespace

TEST_F(RegHelper, MissingKeysAndValuesAreTolerated)
{
    FailureCapture failures;
    std::wstring wstrMissing = Path(L"Missing");
    EXPECT_EQ(nullptr, RegHelperOpenKey(wstrMissing.c_str(), false));
    EXPECT_EQ(nullptr, RegHelperOpenKey(wstrMissing.c_str(), true));
    EXPECT_EQ(L"", RegHelperGetString(wstrMissing.c_str(), L"Value"));
    EXPECT_TRUE(RegHelperGetMultiString(wstrMissing.c_str(), L"Value").empty());
    RegHelperDeleteValue(wstrMissing.c_str(), L"Value");
    RegHelperDeleteKey(wstrMissing.c_str(), nullptr);

    std::wstring wstrKey = Path(L"Present");
    RegHelperSetDword(wstrKey.c_str(), L"Other", 7);
    EXPECT_EQ(L"", RegHelperGetString(wstrKey.c_str(), L"Value"));
    RegHelperDeleteValue(wstrKey.c_str(), L"Value");

    // The root is HKEY_LOCAL_MACHINE itself and is never closed.
    EXPECT_EQ(HKEY_LOCAL_MACHINE, RegHelperOpenKey(nullptr, false));
    EXPECT_EQ(HKEY_LOCAL_MACHINE, RegHelperOpenKey(L"", true));
    RegHelperCloseKey(HKEY_LOCAL_MACHINE);
    HKEY hKey = RegHelperOpenKey(L"SOFTWARE", false);
    EXPECT_NE(nullptr, hKey);
    RegHelperCloseKey(hKey);
    EXPECT_EQ(0u, failures.Count());
}

TEST_F(RegHelper, StringsGrowPastTheFirstBuffer)
{
    std::wstring wstrKey = Path(L"Long");
    std::wstring wstrLong;
    for (int i = 0; i < 5000; i++)
    {
        wstrLong.push_back(static_cast<wchar_t>(L'a' + i % 26));
    }
    RegHelperSetString(wstrKey.c_str(), L"Long", wstrLong, REG_SZ);
    EXPECT_EQ(wstrLong, RegHelperGetString(wstrKey.c_str(), L"Long"));

    // Written as the text plus one terminator.
    DWORD dwType = 0;
    std::wstring wstrRaw;
    ASSERT_TRUE(testsupport::HklmReadRaw(wstrKey, L"Long", &dwType, &wstrRaw));
    EXPECT_EQ(static_cast<DWORD>(REG_SZ), dwType);
    EXPECT_EQ(wstrLong + std::wstring(1, L'\0'), wstrRaw);

    // Trailing zeros of a value are not part of the text.
    const wchar_t wszPadded[] = L"abc\0\0\0";
    WriteRaw(wstrKey, L"Padded", REG_SZ, wszPadded, sizeof(wszPadded));
    EXPECT_EQ(L"abc", RegHelperGetString(wstrKey.c_str(), L"Padded"));

    // A long value of an odd byte count still fits after growing (it must not loop).
    std::wstring wstrOdd(400, L'z');
    WriteRaw(wstrKey, L"Odd", REG_SZ, wstrOdd.c_str(), 801);
    std::wstring wstrRead;
    HANDLE hDone = CreateEventW(nullptr, TRUE, FALSE, nullptr);
    std::thread reader([&] {
        wstrRead = RegHelperGetString(wstrKey.c_str(), L"Odd");
        SetEvent(hDone);
    });
    DWORD dwWait = WaitForSingleObject(hDone, c_dwWaitMs);
    ASSERT_EQ(static_cast<DWORD>(WAIT_OBJECT_0), dwWait) << "RegHelperGetString never returned";
    reader.join();
    CloseHandle(hDone);
    EXPECT_EQ(wstrOdd, wstrRead);
}

TEST_F(RegHelper, ExpandSzIsExpandedAndSzIsNot)
{
    std::wstring wstrKey = Path(L"Expand");
    // Longer than the first expansion buffer, so the expansion grows too.
    std::wstring wstrDir = L"C:\\" + std::wstring(600, L'd');
    ASSERT_TRUE(SetEnvironmentVariableW(L"TELVANE_TEST_DIR", wstrDir.c_str()));
    RegHelperSetString(wstrKey.c_str(), L"Expand", L"%TELVANE_TEST_DIR%\\telvane.dll",
                       REG_EXPAND_SZ);
    RegHelperSetString(wstrKey.c_str(), L"Plain", L"%TELVANE_TEST_DIR%\\telvane.dll", REG_SZ);
    EXPECT_EQ(wstrDir + L"\\telvane.dll", RegHelperGetString(wstrKey.c_str(), L"Expand"));
    EXPECT_EQ(L"%TELVANE_TEST_DIR%\\telvane.dll", RegHelperGetString(wstrKey.c_str(), L"Plain"));
    // An unknown variable stays as written, as the platform expands it.
    RegHelperSetString(wstrKey.c_str(), L"Unknown", L"%TELVANE_NO_SUCH_VAR%", REG_EXPAND_SZ);
    EXPECT_EQ(L"%TELVANE_NO_SUCH_VAR%", RegHelperGetString(wstrKey.c_str(), L"Unknown"));
    SetEnvironmentVariableW(L"TELVANE_TEST_DIR", nullptr);
}

TEST_F(RegHelper, MultiStringsRoundTripWithoutEmptyEntries)
{
    std::wstring wstrKey = Path(L"Multi");
    std::vector<std::wstring> rgList = {L"Telvane", L"Other", L"Third"};
    RegHelperSetMultiString(wstrKey.c_str(), L"Group", rgList);
    EXPECT_EQ(rgList, RegHelperGetMultiString(wstrKey.c_str(), L"Group"));

    DWORD dwType = 0;
    std::wstring wstrRaw;
    ASSERT_TRUE(testsupport::HklmReadRaw(wstrKey, L"Group", &dwType, &wstrRaw));
    EXPECT_EQ(static_cast<DWORD>(REG_MULTI_SZ), dwType);
    EXPECT_EQ(std::wstring(L"Telvane\0Other\0Third\0\0", 21), wstrRaw);

    // Extra zeros at the end (as other writers leave them) give no empty entries.
    const wchar_t wszPadded[] = L"x\0y\0\0\0\0";
    WriteRaw(wstrKey, L"Padded", REG_MULTI_SZ, wszPadded, sizeof(wszPadded));
    EXPECT_EQ((std::vector<std::wstring>{L"x", L"y"}),
              RegHelperGetMultiString(wstrKey.c_str(), L"Padded"));

    // Nor does an empty entry in the middle, which ends the list for other readers.
    const wchar_t wszGap[] = L"a\0\0b\0\0";
    WriteRaw(wstrKey, L"Gap", REG_MULTI_SZ, wszGap, sizeof(wszGap));
    EXPECT_EQ((std::vector<std::wstring>{L"a", L"b"}),
              RegHelperGetMultiString(wstrKey.c_str(), L"Gap"));

    // An empty entry would end the list for every other reader: it is not written.
    RegHelperSetMultiString(wstrKey.c_str(), L"Gaps", {L"a", L"", L"b"});
    ASSERT_TRUE(testsupport::HklmReadRaw(wstrKey, L"Gaps", &dwType, &wstrRaw));
    EXPECT_EQ(std::wstring(L"a\0b\0\0", 5), wstrRaw);
    EXPECT_EQ((std::vector<std::wstring>{L"a", L"b"}),
              RegHelperGetMultiString(wstrKey.c_str(), L"Gaps"));

    // A plain string reads as a list of one.
    RegHelperSetString(wstrKey.c_str(), L"Single", L"alone", REG_SZ);
    EXPECT_EQ((std::vector<std::wstring>{L"alone"}),
              RegHelperGetMultiString(wstrKey.c_str(), L"Single"));
}

TEST_F(RegHelper, DwordsKeysAndDeletion)
{
    FailureCapture failures;
    std::wstring wstrKey = Path(L"Deep\\Er\\Key");
    RegHelperSetDword(wstrKey.c_str(), L"Number", 0x12345678);
    DWORD dw = 0;
    ASSERT_TRUE(testsupport::HklmReadDword(wstrKey, L"Number", &dw));
    EXPECT_EQ(0x12345678u, dw);

    HKEY hKey = RegHelperCreateKey(wstrKey.c_str());
    ASSERT_NE(nullptr, hKey);
    RegHelperCloseKey(hKey);

    RegHelperDeleteValue(wstrKey.c_str(), L"Number");
    EXPECT_FALSE(testsupport::HklmReadDword(wstrKey, L"Number", &dw));

    // The two parts join as they stand: no separator is added between them.
    std::wstring wstrParent = Path(L"Deep\\Er");
    RegHelperDeleteKey(wstrParent.c_str(), L"Key");
    hKey = RegHelperOpenKey(wstrKey.c_str(), false);
    EXPECT_NE(nullptr, hKey);
    RegHelperCloseKey(hKey);
    RegHelperDeleteKey((wstrParent + L"\\").c_str(), L"Key");
    EXPECT_EQ(nullptr, RegHelperOpenKey(wstrKey.c_str(), false));
    EXPECT_EQ(0u, failures.Count());

    // Anything but "not found" is a fatal error under the helper's name.
    RegHelperDeleteKey(Path(L"Deep").c_str(), nullptr);
    ASSERT_EQ(1u, failures.Count());
    EXPECT_TRUE(failures.Contains(L"RegHelperDeleteKey: Fatal error 0x5 from RegDeleteKeyEx"));
}
