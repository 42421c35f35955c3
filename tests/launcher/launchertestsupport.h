// Helpers of the launcher suites: the prefix made ready for a test (platform component
// registered, test application installed, Wi-Fi connected, mains power, chambers working,
// no web service role), the policy file written as the web service would have it, the
// backlight published as the phone does, and what the chamber stand-in recorded. Every
// helper changes machine-wide state of the prefix, so the suites run one test at a time.
#pragma once

#include "tests/udp/udptestsupport.h"

#include <windows.h>
#include <functional>
#include <string>
#include <vector>

namespace launchertest
{
// A generous bound for waits on things that happen (a hang, not a measurement).
const DWORD c_dwWaitMs = 30000;

// The policy file's members as JSON texts, so that a case can write any text in any member.
// The defaults open every gate: enabled, a loopback relay, expiring in a day, never tested.
struct PolicyFile
{
    std::string strEnabled = "true";
    std::string strRelay = "\"127.0.0.1\"";
    std::string strRelayPort = "0";
    std::string strExpiration; // empty: a day from now
    std::string strLastTest = "0";
    std::string strNumPackets = "20";
    std::string strMaxTestDay = "1";
    std::string strPolicy = "\"ACOnly\"";

    std::string Text() const;
};

// The policy file with these members, under its real name.
void WritePolicyFile(const PolicyFile &policy);
// The policy file as the service last wrote it (empty when there is none).
std::string ReadPolicyFile();

// Sets the prefix up as described at the top; Cleanup undoes what is not the phone's own.
void PreparePrefix();
void CleanupPrefix();

// Publishes the backlight or the power-source state with these bytes.
void PublishBacklight(const std::vector<BYTE> &vbData);
void PublishBacklight(DWORD dwValue);
void PublishPowerSource(DWORD dwValue);
void PublishPowerSource(const std::vector<BYTE> &vbData);

// What the chamber stand-in recorded of the processes it started.
DWORD ChamberLaunchCount();
std::wstring ChamberLastCommandLine();

// Polls (every few milliseconds) until the condition holds or c_dwWaitMs passed.
bool WaitUntil(const std::function<bool()> &pred);

// The trace session's lines, and a wait for a line to be there (count times).
size_t CountLines(const udptest::TraceSession &trace, const std::string &strLine);
bool WaitForLine(const udptest::TraceSession &trace, const std::string &strLine, size_t c = 1);

// Trace lines of the launcher, as the session records them.
extern const char c_szCallbackToggled[];
extern const char c_szHandlerToggled[];
extern const char c_szLoadingConfig[];
extern const char c_szConfigExpired[];
extern const char c_szNotAsked[];
extern const char c_szLaunched[];
extern const char c_szStillRunning[];
extern const char c_szDestroyingIgnored[];
extern const char c_szStillWaiting[];
extern const char c_szFinishedDestruction[];
} // namespace launchertest
