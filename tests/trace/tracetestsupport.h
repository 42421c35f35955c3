// Helpers of the trace suite: the delivery registry values and folders of the build's prefix,
// a trace session that records the service's events, and strict parsing of written traces
// with RapidJSON (an implementation independent of ours).
#pragma once

#include <windows.h>

#include <rapidjson/document.h>

#include <string>
#include <vector>

namespace tracetest
{
// Every test of the suite starts from here: no delivery values, no "ConnID", no trace
// files, an empty submission spool, both stand-ins at their defaults.
void ResetDeliveryState();

// A registry value under HKEY_LOCAL_MACHINE: set as a DWORD or a string, or deleted (its key
// too, with fDeleteKey).
void SetDword(const wchar_t *wszKey, const wchar_t *wszValue, DWORD dwValue);
void SetString(const wchar_t *wszKey, const wchar_t *wszValue, const std::wstring &wstrValue);
void DeleteValue(const wchar_t *wszKey, const wchar_t *wszValue);
void DeleteKey(const wchar_t *wszKey);

extern const wchar_t c_wszPreferenceKey[];
extern const wchar_t c_wszPreferenceValue[];
extern const wchar_t c_wszTestKey[];
extern const wchar_t c_wszTestValue[];
extern const wchar_t c_wszConnIdKey[];
extern const wchar_t c_wszConnIdValue[];

// Delivery allowed (3) and the test value set: the shortest way to have logs written.
void AllowDelivery(DWORD dwTestLogging);

// Names of the files in the trace folder (C:\Data\Test\WiFiLog), sorted; empty when the
// folder is missing.
std::vector<std::wstring> TraceFileNames();
std::string ReadFileText(const std::wstring &wstrPath);
// The texts of every trace file, ordered by their "LogCount".
std::vector<std::string> TraceFileTexts();
void RemoveDirectoryTree(const std::wstring &wstrPath);

// Events of the main provider while it lives, each as "<id>|<field>|<field>...".
class TraceSession
{
public:
    TraceSession();
    ~TraceSession();
    std::vector<std::string> Lines() const;
    // How many lines are exactly "1001|<szText>" (a message) or start "1002|<szText>|" (a
    // failure with its code after).
    size_t CountMessages(const char *szText) const;
    size_t CountFailures(const char *szText) const;
};

// Parses strictly (UTF-8 checked, nothing after the value); the test fails on any error.
void ParseStrict(const std::string &strText, rapidjson::Document &document);
// The member names of an object, in document order.
std::vector<std::string> MemberNames(const rapidjson::Value &object);

GUID ParseGuid(const char *szText);
std::string GuidText(const GUID &guid);
} // namespace tracetest
