#include "service/udptestcommandline.h"

#include <gtest/gtest.h>
#include <functional>
#include <limits>

namespace
{
struct CommandLineCase
{
    const char *szName;
    std::function<void(UdpTestConfig &)> change; // applied to a reset record with a relay
    const char *szExpected;
};

UdpTestConfig RelayConfig()
{
    UdpTestConfig config;
    ResetUdpConfig(&config);
    config.relayFqdn = "relay.example.net";
    config.relayPort = 47210;
    return config;
}
} // namespace

TEST(BuildTestCommandLine, Table)
{
    const CommandLineCase rgCases[] = {
        {"defaults give the relay alone", [](UdpTestConfig &) {}, "relay.example.net 47210"},
        {"what the service sets",
         [](UdpTestConfig &c) {
             c.localIp = "192.168.1.20";
             c.numPackets = 100;
         },
         "-localIP 192.168.1.20 -count 100 relay.example.net 47210"},
        {"every option, in order",
         [](UdpTestConfig &c) {
             c.verbose = true;
             c.remoteIp = "10.0.0.1";
             c.localIp = "10.0.0.2";
             c.localPort = 5000;
             c.delay = 0;
             c.numPackets = 0;
             c.packetSize = 1400;
         },
         "-verbose -remoteIP -localIP 10.0.0.2 -localPort 5000 -delay 0 -count 0 -size 1400 "
         "10.0.0.1 47210"},
        {"remoteIp replaces the relay name", [](UdpTestConfig &c) { c.remoteIp = "::1"; },
         "-remoteIP ::1 47210"},
        {"largest numbers are unsigned",
         [](UdpTestConfig &c) {
             c.numPackets = 0xFFFFFFFF;
             c.relayPort = 0xFFFFFFFF;
         },
         "-count 4294967295 relay.example.net 4294967295"},
        {"no relay at all", [](UdpTestConfig &c) { c.relayFqdn.clear(); }, " 47210"},
    };
    for (const CommandLineCase &c : rgCases)
    {
        SCOPED_TRACE(c.szName);
        UdpTestConfig config = RelayConfig();
        c.change(config);
        std::string strOut = "left over";
        EXPECT_EQ(c.szExpected, BuildTestCommandLine(config, strOut));
    }
}

TEST(UdpTestConfig, ResetAndInitialValues)
{
    UdpTestConfig config; // as the launcher is built: mains power, one test a day
    EXPECT_TRUE(config.acOnly);
    EXPECT_EQ(1.0f, config.maxTestDay);
    // Every field changed, then reset: the command line shows nothing but the defaults.
    config = {true, true, 5.0f, 6, 7, "1.2.3.4", 8, "relay", "::1", 9, 10, 11, 13, true};
    ResetUdpConfig(&config);
    std::string strLine;
    EXPECT_EQ(" 0", BuildTestCommandLine(config, strLine));
    EXPECT_FALSE(config.enabled || config.acOnly);
    EXPECT_EQ(0.0f, config.maxTestDay);
    EXPECT_EQ(0u, config.expiration + config.lastTest);
}

TEST(UdpRelayName, Rules)
{
    // "null": a real host could be called so; the launcher refuses it separately.
    for (const char *szName : {"relay.example.net", "10.0.0.1", "fe80::1", "my-relay", "null"})
    {
        EXPECT_TRUE(UdpRelayNameIsValid(szName)) << szName;
    }
    for (const char *szName :
         {"", "-verbose", "relay net", "relay\"", "relay&calc", "[::1]", "relay_1", "r\xc3\xa9lay"})
    {
        EXPECT_FALSE(UdpRelayNameIsValid(szName)) << szName;
    }
    EXPECT_TRUE(UdpRelayNameIsValid(std::string(253, 'a')));
    EXPECT_FALSE(UdpRelayNameIsValid(std::string(254, 'a')));

    // No relay: no name, or "null" (the reader's reading of a saved empty name), also when
    // the address that replaces the name says so.
    UdpTestConfig config;
    EXPECT_FALSE(UdpConfigHasRelay(config));
    config.relayFqdn = "null";
    EXPECT_FALSE(UdpConfigHasRelay(config));
    config.relayFqdn = "relay";
    EXPECT_TRUE(UdpConfigHasRelay(config));
    config.remoteIp = "null";
    EXPECT_FALSE(UdpConfigHasRelay(config));
}

TEST(UdpTestSpacing, Table)
{
    const uint64_t ullLast = 134000000000000000ull;
    const uint64_t ullHalfDay = 432000008192ull; // 864000016384 / 2, the single-precision day
    struct
    {
        const char *szName;
        uint64_t ullLastTest;
        float flMaxTestDay;
        uint64_t ullNow;
        bool fPassed;
    } rgCases[] = {
        {"never tested", 0, 0.0f, 1, true},
        {"two a day: half a day and one tick later", ullLast, 2.0f, ullLast + ullHalfDay + 1, true},
        {"two a day: exactly half a day later", ullLast, 2.0f, ullLast + ullHalfDay, false},
        {"one a day: a day later", ullLast, 1.0f, ullLast + 864000016384ull + 1, true},
        {"one a day: a little less", ullLast, 1.0f, ullLast + 863999999999ull, false},
        {"zero a day", ullLast, 0.0f, UINT64_MAX, false},
        {"negative", ullLast, -1.0f, UINT64_MAX, false},
        {"not a number", ullLast, std::numeric_limits<float>::quiet_NaN(), UINT64_MAX, false},
        {"a spacing past 64 bits", ullLast, 1e-30f, UINT64_MAX, false},
        {"a spacing past the end of time", UINT64_MAX - 5, 1.0f, UINT64_MAX, false},
        {"very many a day", ullLast, 1e30f, ullLast + 1, true},
    };
    for (const auto &c : rgCases)
    {
        SCOPED_TRACE(c.szName);
        EXPECT_EQ(c.fPassed, UdpTestSpacingPassed(c.ullLastTest, c.flMaxTestDay, c.ullNow));
    }
}
