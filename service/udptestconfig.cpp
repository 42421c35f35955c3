#include "service/udptestconfig.h"

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
