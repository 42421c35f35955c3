// The registry helpers against the prefix's real registry, each test under a key of its own.
// Test thread only.
#include "servicelib/reghelper.h"
#include "tests/common/testsupport.h"

#include <gtest/gtest.h>

using namespace testsupport;

namespace
{
// Each test's keys live under a base of its own, removed when it ends; test thread only.
class RegHelper : public ::testing::Test
{
protected:
    void TearDown() override { RegDeleteTreeW(HKEY_LOCAL_MACHINE, m_wstrBase.c_str()); }
    std::wstring Path(const wchar_t *wszSub) const { return m_wstrBase + L"\\" + wszSub; }

    const std::wstring m_wstrBase = L"SOFTWARE\\TelvaneTest\\" + UniqueName(L"Reg");
};

std::wstring Raw(const std::wstring &wstrKey, const wchar_t *wszValue, DWORD dwTypeExpected)
{
    DWORD dwType = 0;
    std::wstring wstrRaw;
    EXPECT_TRUE(HklmReadRaw(wstrKey, wszValue, &dwType, &wstrRaw));
    EXPECT_EQ(dwTypeExpected, dwType);
    return wstrRaw;
}
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
    EXPECT_EQ(HKEY_LOCAL_MACHINE, RegHelperCreateKey(L""));
    RegHelperCloseKey(HKEY_LOCAL_MACHINE);
    HKEY hKey = RegHelperOpenKey(L"SOFTWARE", false);
    EXPECT_NE(nullptr, hKey);
    RegHelperCloseKey(hKey);
    EXPECT_EQ(0u, failures.Count());
}

// Values as other writers leave them, read back as text and as a list.
TEST_F(RegHelper, ReadsValuesAsOtherWritersLeaveThem)
{
    // Longer than the first expansion buffer, so the expansion grows too.
    std::wstring wstrDir = L"C:\\" + std::wstring(600, L'd');
    ASSERT_TRUE(SetEnvironmentVariableW(L"TELVANE_TEST_DIR", wstrDir.c_str()));
    std::wstring wstrLong;
    for (int i = 0; i < 5000; i++)
    {
        wstrLong.push_back(static_cast<wchar_t>(L'a' + i % 26));
    }
    const std::wstring wstrVar = L"%TELVANE_TEST_DIR%\\telvane.dll";
    struct
    {
        const wchar_t *wszName;
        DWORD dwType;
        std::wstring wstrData;
        DWORD cb; // 0: the whole of wstrData
        std::wstring wstrText;
        std::vector<std::wstring> rgList;
    } rgCases[] = {
        // Past the first buffer; and of an odd byte count, which must still fit after growing.
        {L"Long", REG_SZ, wstrLong, 0, wstrLong, {wstrLong}},
        {L"Odd", REG_SZ, std::wstring(401, L'z'), 801, std::wstring(400, L'z'), {}},
        // Trailing zeros are not part of the text.
        {L"Padded", REG_SZ, std::wstring(L"abc\0\0\0", 6), 0, L"abc", {L"abc"}},
        {L"Expand", REG_EXPAND_SZ, wstrVar, 0, wstrDir + L"\\telvane.dll", {}},
        {L"Plain", REG_SZ, wstrVar, 0, wstrVar, {}},
        // An unknown variable stays as written, as the platform expands it.
        {L"Unknown", REG_EXPAND_SZ, L"%TELVANE_NO_SUCH_VAR%", 0, L"%TELVANE_NO_SUCH_VAR%", {}},
        // Neither extra zeros at the end nor an empty entry in the middle (which ends the list
        // for other readers) give empty entries.
        {L"Multi",
         REG_MULTI_SZ,
         std::wstring(L"x\0y\0\0\0\0", 7),
         0,
         std::wstring(L"x\0y", 3),
         {L"x", L"y"}},
        {L"Gap",
         REG_MULTI_SZ,
         std::wstring(L"a\0\0b\0\0", 6),
         0,
         std::wstring(L"a\0\0b", 4),
         {L"a", L"b"}},
    };
    std::wstring wstrKey = Path(L"Read");
    for (const auto &testCase : rgCases)
    {
        SCOPED_TRACE(Narrow(testCase.wszName));
        DWORD cb = testCase.cb != 0
                       ? testCase.cb
                       : static_cast<DWORD>(testCase.wstrData.size() * sizeof(wchar_t));
        HklmSetBytes(wstrKey, testCase.wszName, testCase.dwType, testCase.wstrData.data(), cb);
        EXPECT_EQ(testCase.wstrText, RegHelperGetString(wstrKey.c_str(), testCase.wszName));
        if (!testCase.rgList.empty())
        {
            EXPECT_EQ(testCase.rgList, RegHelperGetMultiString(wstrKey.c_str(), testCase.wszName));
        }
    }
    SetEnvironmentVariableW(L"TELVANE_TEST_DIR", nullptr);
}

// What the helpers write is what every other reader expects: the text and one terminator, a
// list without empty entries and its closing zero.
TEST_F(RegHelper, WritesWhatOtherReadersExpect)
{
    std::wstring wstrKey = Path(L"Write");
    RegHelperSetString(wstrKey.c_str(), L"Text", L"some text", REG_SZ);
    EXPECT_EQ(std::wstring(L"some text\0", 10), Raw(wstrKey, L"Text", REG_SZ));
    RegHelperSetString(wstrKey.c_str(), L"Expand", L"%x%", REG_EXPAND_SZ);
    EXPECT_EQ(std::wstring(L"%x%\0", 4), Raw(wstrKey, L"Expand", REG_EXPAND_SZ));

    std::vector<std::wstring> rgList = {L"Telvane", L"Other", L"Third"};
    RegHelperSetMultiString(wstrKey.c_str(), L"Group", rgList);
    EXPECT_EQ(std::wstring(L"Telvane\0Other\0Third\0\0", 21), Raw(wstrKey, L"Group", REG_MULTI_SZ));
    EXPECT_EQ(rgList, RegHelperGetMultiString(wstrKey.c_str(), L"Group"));
    RegHelperSetMultiString(wstrKey.c_str(), L"Gaps", {L"a", L"", L"b"});
    EXPECT_EQ(std::wstring(L"a\0b\0\0", 5), Raw(wstrKey, L"Gaps", REG_MULTI_SZ));

    RegHelperSetDword(wstrKey.c_str(), L"Number", 0x12345678);
    DWORD dw = 0;
    ASSERT_TRUE(HklmReadDword(wstrKey, L"Number", &dw));
    EXPECT_EQ(0x12345678u, dw);
}

TEST_F(RegHelper, KeysAndDeletion)
{
    FailureCapture failures;
    std::wstring wstrKey = Path(L"Deep\\Er\\Key");
    HKEY hKey = RegHelperCreateKey(wstrKey.c_str());
    ASSERT_NE(nullptr, hKey);
    RegHelperCloseKey(hKey);
    RegHelperSetDword(wstrKey.c_str(), L"Number", 1);
    RegHelperDeleteValue(wstrKey.c_str(), L"Number");
    DWORD dw = 0;
    EXPECT_FALSE(HklmReadDword(wstrKey, L"Number", &dw));

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
