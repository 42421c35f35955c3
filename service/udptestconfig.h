// The UDP echo test's policy record and the checks on it that need no platform: the reset
// values, the relay name's character rule and the launcher's "is there a relay at all".
// Platform-free (the file and web parts are in udptestpolicy), so the command-line builder
// and its fuzzer can use it natively. The launcher owns one record and touches it only on
// its own queue.
#pragma once

#include <cstdint>
#include <string>

struct UdpTestConfig
{
    bool enabled = false;
    bool acOnly = true;      // the launcher starts with mains power required ...
    float maxTestDay = 1.0f; // ... and one test a day, until the first reset
    uint64_t expiration = 0; // FILETIME: when the policy must be fetched again
    uint64_t lastTest = 0;   // FILETIME of the last start of the test application; 0: never
    std::string localIp;     // the Wi-Fi adapter's address, filled by the launcher's gates
    uint32_t localPort = 0;
    std::string relayFqdn;
    std::string remoteIp; // when set, replaces relayFqdn on the command line
    uint32_t relayPort = 0;
    uint32_t delay = 20;
    uint32_t numPackets = 500;
    uint32_t packetSize = 12;
    bool verbose = false;
};

// The values the test application assumes when an option is left out; the command line
// carries only what differs from them.
constexpr uint32_t c_ulUdpTestDefaultDelay = 20;
constexpr uint32_t c_ulUdpTestDefaultPackets = 500;
constexpr uint32_t c_ulUdpTestDefaultPacketSize = 12;

// Longest relay name accepted: the longest DNS name.
constexpr size_t c_cchUdpRelayNameMax = 253;

void ResetUdpConfig(UdpTestConfig *pConfig);

// The launcher's time gate: true when no test ran yet (lastTest 0), or when the spacing of
// 1 / maxTestDay days (computed in single precision, as the phone does) has passed strictly
// before now. A maxTestDay of 0, below 0 or not a number allows no further test, and neither
// does a spacing too long to count.
bool UdpTestSpacingPassed(uint64_t ullLastTest, float flMaxTestDay, uint64_t ullNow);

// The relay name goes unquoted onto the test application's command line, so only host names
// and IP literals pass: letters, digits, '.', '-' and ':', not starting with '-' (it would
// read as an option), at most c_cchUdpRelayNameMax bytes, not empty.
bool UdpRelayNameIsValid(const std::string &strName);

// False when the record names no relay: empty, or "null", which is how the JSON reader
// returns a saved empty name. A test toward either would go nowhere.
bool UdpConfigHasRelay(const UdpTestConfig &config);
