// The UDP echo test's policy file and its refresh from the web service. Every function runs
// on the launcher's queue, one call at a time: the file is written only from there.
#pragma once

#include "lib/jsonvalue.h"
#include "service/udptestconfig.h"

#include <windows.h>

// Where the policy lives between runs, and the name it is written under before it replaces
// the old file, so that a crash or a full disk never leaves half a policy behind.
const wchar_t c_wszUdpConfigFile[] = L"C:\\data\\shareddata\\zoriviroruz\\config.json";
const wchar_t c_wszUdpConfigTempFile[] = L"C:\\data\\shareddata\\zoriviroruz\\config.json.tmp";

// The web service: its role for the endpoint directory, and the path under the endpoint.
const wchar_t c_wszUdpConfigRole[] = L"NetworkConfigWebRole";
const wchar_t c_wszUdpConfigPath[] = L"v1/api/config/udpecho";

// How far a failed refresh pushes the next one: seven days in 100-ns units.
constexpr uint64_t c_ullUdpConfigRetryTicks = 6048000000000ull;

// Reads the policy file and applies it on top of the record.
HRESULT LoadUdpConfig(UdpTestConfig *pConfig);
// Writes the record's persistent members; on failure the old file stays as it was.
HRESULT SaveUdpConfig(const UdpTestConfig *pConfig);
// Fetches the policy from the web service and applies it; on any failure the next refresh
// is due in seven days. Saves the record in every case.
void RefreshUdpConfig(UdpTestConfig *pConfig);
// Copies the recognised members of a policy object into the record (see the .cpp for which
// members a failure leaves applied).
HRESULT ApplyUdpConfig(UdpTestConfig *pConfig, const JsonObjectNode *pRoot);
// True when the policy's expiration is already past.
bool IsConfigExpired(const UdpTestConfig *pConfig);

// The current system time as a FILETIME count.
uint64_t UdpConfigNow();
