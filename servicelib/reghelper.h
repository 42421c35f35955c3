// Registry helpers for installation and configuration. Every path is relative to
// HKEY_LOCAL_MACHINE; an empty or null path means HKEY_LOCAL_MACHINE itself, which is never
// closed. Results the callers expect (a missing key or value) come back as null keys or
// empty text; anything else the registry returns is a fatal error named after the helper.
// Free functions without state: callable from any thread.
#pragma once

#include <windows.h>
#include <string>
#include <vector>

// Opens for KEY_READ, or KEY_READ | KEY_WRITE with fWrite; a missing key gives null.
HKEY RegHelperOpenKey(const wchar_t *wszPath, bool fWrite);
HKEY RegHelperCreateKey(const wchar_t *wszPath);
void RegHelperCloseKey(HKEY hKey);

// Deletes the key whose path is the two parts joined as they stand (no separator is added);
// either part may be null. A missing key is not an error.
void RegHelperDeleteKey(const wchar_t *wszFirst, const wchar_t *wszSecond);
void RegHelperDeleteValue(const wchar_t *wszPath, const wchar_t *wszValue);

// The value's text without trailing zero characters, REG_EXPAND_SZ expanded; empty when the
// key or the value is missing.
std::wstring RegHelperGetString(const wchar_t *wszPath, const wchar_t *wszValue);
// The strings of a REG_MULTI_SZ value in order; empty strings are not list entries.
std::vector<std::wstring> RegHelperGetMultiString(const wchar_t *wszPath, const wchar_t *wszValue);

// Writes the text with one terminator on a key created when missing. The text may hold
// zero characters of its own (a joined multi-string).
void RegHelperSetString(const wchar_t *wszPath, const wchar_t *wszValue,
                        const std::wstring &wstrText, DWORD dwType);
// Writes each non-empty string followed by a zero, then the closing zero.
void RegHelperSetMultiString(const wchar_t *wszPath, const wchar_t *wszValue,
                             const std::vector<std::wstring> &rgStrings);
void RegHelperSetDword(const wchar_t *wszPath, const wchar_t *wszValue, DWORD dwValue);
