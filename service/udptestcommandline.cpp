#include "service/udptestcommandline.h"

namespace
{
void CommandLineAppendOption(std::string &strOut, const char *szOption, uint32_t ulValue)
{
    strOut += szOption;
    strOut += ' ';
    strOut += std::to_string(ulValue);
    strOut += ' ';
}
} // namespace

std::string &BuildTestCommandLine(const UdpTestConfig &config, std::string &strOut)
{
    strOut.clear();
    if (config.verbose)
    {
        strOut += "-verbose ";
    }
    if (!config.remoteIp.empty())
    {
        strOut += "-remoteIP "; // only a flag: the address itself is the last argument
    }
    if (!config.localIp.empty())
    {
        strOut += "-localIP ";
        strOut += config.localIp;
        strOut += ' ';
    }
    if (config.localPort != 0)
    {
        CommandLineAppendOption(strOut, "-localPort", config.localPort);
    }
    if (config.delay != c_ulUdpTestDefaultDelay)
    {
        CommandLineAppendOption(strOut, "-delay", config.delay);
    }
    if (config.numPackets != c_ulUdpTestDefaultPackets)
    {
        CommandLineAppendOption(strOut, "-count", config.numPackets);
    }
    if (config.packetSize != c_ulUdpTestDefaultPacketSize)
    {
        CommandLineAppendOption(strOut, "-size", config.packetSize);
    }
    strOut += config.remoteIp.empty() ? config.relayFqdn : config.remoteIp;
    strOut += ' ';
    strOut += std::to_string(config.relayPort);
    return strOut;
}
