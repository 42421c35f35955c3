// Builds the argument text from a record made of the input: a header of flags and numbers,
// then the relay name, the remote address and the local address separated by zero bytes.
// Checks that the text ends with the relay and its port, and that a relay name the policy
// accepts stays exactly one argument.
#include "service/udptestcommandline.h"

#include <cstdlib>
#include <cstring>
#include <string>
#include <vector>

namespace
{
void FuzzCheck(bool f)
{
    if (!f)
    {
        std::abort();
    }
}

uint32_t FuzzTake32(const uint8_t *&pb, size_t &cb)
{
    uint32_t ul = 0;
    size_t cbTake = cb < 4 ? cb : 4;
    memcpy(&ul, pb, cbTake);
    pb += cbTake;
    cb -= cbTake;
    return ul;
}

std::vector<std::string> FuzzSplit(const std::string &str)
{
    std::vector<std::string> rg;
    size_t pos = 0;
    for (;;)
    {
        size_t end = str.find(' ', pos);
        rg.push_back(str.substr(pos, end == std::string::npos ? std::string::npos : end - pos));
        if (end == std::string::npos)
        {
            return rg;
        }
        pos = end + 1;
    }
}
} // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t *pb, size_t cb)
{
    UdpTestConfig config;
    uint32_t ulFlags = FuzzTake32(pb, cb);
    config.verbose = (ulFlags & 1) != 0;
    config.localPort = (ulFlags & 2) != 0 ? FuzzTake32(pb, cb) : 0;
    config.delay = (ulFlags & 4) != 0 ? FuzzTake32(pb, cb) : 20;
    config.numPackets = (ulFlags & 8) != 0 ? FuzzTake32(pb, cb) : 500;
    config.packetSize = (ulFlags & 16) != 0 ? FuzzTake32(pb, cb) : 12;
    config.relayPort = FuzzTake32(pb, cb);
    std::string strRest(reinterpret_cast<const char *>(pb), cb);
    std::string *rgpstr[] = {&config.relayFqdn, &config.remoteIp, &config.localIp};
    size_t pos = 0;
    for (std::string *pstr : rgpstr)
    {
        if (pos > strRest.size())
        {
            break;
        }
        size_t end = strRest.find('\0', pos);
        *pstr = strRest.substr(pos, end == std::string::npos ? std::string::npos : end - pos);
        pos = end == std::string::npos ? strRest.size() + 1 : end + 1;
    }

    std::string strArgs;
    BuildTestCommandLine(config, strArgs);
    const std::string &strRelay = config.remoteIp.empty() ? config.relayFqdn : config.remoteIp;
    std::string strTail = strRelay + " " + std::to_string(config.relayPort);
    FuzzCheck(strArgs.size() >= strTail.size());
    FuzzCheck(strArgs.compare(strArgs.size() - strTail.size(), strTail.size(), strTail) == 0);

    // With names the policy accepts, the relay and the port are the last two arguments.
    bool fRelayOk = UdpRelayNameIsValid(strRelay);
    bool fLocalOk = config.localIp.empty() || UdpRelayNameIsValid(config.localIp);
    if (fRelayOk && fLocalOk)
    {
        std::vector<std::string> rgArgs = FuzzSplit(strArgs);
        FuzzCheck(rgArgs.size() >= 2);
        FuzzCheck(rgArgs[rgArgs.size() - 2] == strRelay);
        FuzzCheck(rgArgs.back() == std::to_string(config.relayPort));
        for (const std::string &strArg : rgArgs)
        {
            FuzzCheck(!strArg.empty());
        }
        FuzzCheck(UdpConfigHasRelay(config) == (strRelay != "null"));
        // Only the options themselves start with '-': a name never reads as one.
        FuzzCheck(config.verbose == (rgArgs[0] == "-verbose"));
    }
    if (fRelayOk)
    {
        FuzzCheck(strRelay.find_first_of(" \t\"&|<>^%\r\n") == std::string::npos);
        FuzzCheck(strRelay[0] != '-');
    }
    return 0;
}
