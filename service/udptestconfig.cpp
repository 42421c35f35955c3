#include "service/udptestconfig.h"

namespace
{
// A day in 100-ns units, as the single-precision constant the spacing is computed with.
constexpr float c_flTicksPerDay = 864000016384.0f;
// 2^63: the first spacing that no signed 64-bit count holds.
constexpr float c_flTicksLimit = 9223372036854775808.0f;
} // namespace

void ResetUdpConfig(UdpTestConfig *pConfig)
{
    UdpTestConfig reset;
    reset.acOnly = false;
    reset.maxTestDay = 0.0f;
    *pConfig = std::move(reset);
}

bool UdpRelayNameIsValid(const std::string &strName)
{
    if (strName.empty() || strName.size() > c_cchUdpRelayNameMax || strName[0] == '-')
    {
        return false;
    }
    for (char ch : strName)
    {
        bool fAllowed = (ch >= 'a' && ch <= 'z') || (ch >= 'A' && ch <= 'Z') ||
                        (ch >= '0' && ch <= '9') || ch == '.' || ch == '-' || ch == ':';
        if (!fAllowed)
        {
            return false;
        }
    }
    return true;
}

bool UdpConfigHasRelay(const UdpTestConfig &config)
{
    const std::string &strRelay = config.remoteIp.empty() ? config.relayFqdn : config.remoteIp;
    return !strRelay.empty() && strRelay != "null";
}

bool UdpTestSpacingPassed(uint64_t ullLastTest, float flMaxTestDay, uint64_t ullNow)
{
    if (ullLastTest == 0)
    {
        return true;
    }
    // Written so that a NaN fails the test too.
    if (!(flMaxTestDay > 0.0f))
    {
        return false;
    }
    float flInterval = c_flTicksPerDay / flMaxTestDay;
    if (!(flInterval < c_flTicksLimit))
    {
        return false;
    }
    uint64_t ullInterval = static_cast<uint64_t>(static_cast<int64_t>(flInterval));
    if (ullInterval > UINT64_MAX - ullLastTest)
    {
        return false;
    }
    return ullLastTest + ullInterval < ullNow;
}
