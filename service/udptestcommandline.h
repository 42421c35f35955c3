// The argument text of the UDP echo test application, built from the policy record.
// Platform-free so it builds natively for fuzzing; any thread may call it.
#pragma once

#include "service/udptestconfig.h"

#include <string>

// Replaces strOut with the arguments and returns it: each option that differs from the
// application's default, each followed by one space, then the relay (remoteIp when set, else
// relayFqdn), a space and the relay port. Numbers are unsigned decimal.
std::string &BuildTestCommandLine(const UdpTestConfig &config, std::string &strOut);
