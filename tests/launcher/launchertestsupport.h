// Helpers of the launcher suites: the prefix made ready for a test (platform component
// registered, test application installed, Wi-Fi connected, mains power, chambers working,
// no web service role), the policy file written as the web service would have it, the states
// published as the phone does, and what the chamber stand-in recorded. Every helper changes
// machine-wide state of the prefix, so the suites run one test at a time, on the test thread.
#pragma once

#include "platform/statenotify/statenotify.h"
#include "service/statesubscription.h"
#include "tests/common/tracesession.h"

#include <gtest/gtest.h>
#include <map>
#include <string>
#include <vector>

namespace launchertest
{
using namespace testsupport;

const WNF_STATE_NAME c_ullPowerSourceStateName = 0x41C61D22A3BC2875ull;

// Trace lines of the launcher, as the session records them.
const char c_szCallbackToggled[] =
    "1001|CUDPTestLauncher::WnfNotificationCallback() - backlight toggled";
const char c_szHandlerToggled[] =
    "1001|CUDPTestLauncher::Dispatch_BacklightChangedup  () - backlight toggled";
const char c_szLoadingConfig[] =
    "1001|CUDPTestLauncher::Dispatch_BacklightChangedup  () - loading UDP config";
const char c_szConfigExpired[] =
    "1001|CUDPTestLauncher::Dispatch_BacklightChangedup  () - config expired, refreshing";
const char c_szNotAsked[] =
    "1001|CUDPTestLauncher::Dispatch_BacklightChangedup  () - asked not to run test";
const char c_szLaunched[] =
    "1001|CUDPTestLauncher::Dispatch_BacklightChangedup  () - UDP app launched";
const char c_szStillRunning[] = "1001|CUDPTestLauncher::Dispatch_BacklightChanged() - process is "
                                "still running, ignoring this call";
const char c_szDestroyingIgnored[] =
    "1001|CUDPTestLauncher::Dispatch_BacklightChanged() - destroying, ignoring this call";
const char c_szStillWaiting[] = "1001|CUDPTestLauncher::Dispatch_AdvanceDestruction() - still "
                                "waiting on outstanding operation";
const char c_szFinishedDestruction[] = "1001|CUDPTestLauncher::Dispatch_AdvanceDestruction() - "
                                       "finished destruction, signaling event";

// Members of the policy file by name, each as JSON text, so that a case can write any text in
// any member.
typedef std::map<std::string, std::string> PolicyMembers;
// The policy file under its real name: the defaults open every gate (enabled, a loopback
// relay on port 47310, expiring in a day, never tested), and each member given replaces its
// default.
void WritePolicyFile(const PolicyMembers &members);

// Publishes the state with these bytes, or with the four bytes of a value.
void Publish(WNF_STATE_NAME stateName, const std::vector<BYTE> &vbData);
void Publish(WNF_STATE_NAME stateName, DWORD dwValue);

// What the chamber stand-in recorded of the processes it started.
DWORD ChamberLaunchCount();
std::wstring ChamberLastCommandLine();

// Base of the suites' fixtures: the prefix prepared as described at the top and put back
// afterwards, the main provider's events and the failure reports captured.
class CLauncherTest : public ::testing::Test
{
protected:
    void SetUp() override { PreparePrefix(); }
    void TearDown() override;
    // Puts the prefix as SetUp leaves it, for cases that need it fresh.
    void PreparePrefix();

    FailureCapture m_failures;
    CTraceSession m_trace;
};
} // namespace launchertest
