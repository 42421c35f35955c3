#include "lib/jsonreader.h"
#include "service/udptestpolicy.h"

#include <gtest/gtest.h>
#include <memory>

namespace
{
struct ApplyCase
{
    const char *szName;
    const char *szJson;
    HRESULT hr;
    bool fEnabled;
    bool fAcOnly;
    float flMaxTestDay;
    bool fFromNow;          // the expiration is now plus ullExpiration
    uint64_t ullExpiration; // 4: the starting record's
    uint64_t ullLastTest;
    const char *szRelay;
    uint32_t ulRelayPort;
    uint32_t ulPackets;
};

// Every field differs from what any case sets, so an unchanged field shows.
UdpTestConfig StartRecord()
{
    UdpTestConfig config;
    ResetUdpConfig(&config);
    config.relayFqdn = "old.relay";
    config.relayPort = 1;
    config.numPackets = 2;
    config.maxTestDay = 3.0f;
    config.expiration = 4;
    config.lastTest = 5;
    return config;
}

const uint64_t c_ullTicksPerSecond = 10000000;
const HRESULT c_hrInvalid = E_INVALIDARG;

// clang-format off
const ApplyCase c_rgApplyCases[] = {
    {"every member, absolute expiration",
     R"({"Enabled":true,"RelayFQDN":"r.example","RelayPort":47210,"Expiration":131000000000000000,)"
     R"("LastTest":130000000000000000,"NumPackets":100,"MaxTestDay":2.5,"Policy":"BattAC"})",
     S_OK, true, false, 2.5f, false, 131000000000000000ull, 130000000000000000ull,
     "r.example", 47210, 100},
    {"DurationValid wins over Expiration",
     R"({"Enabled":"true","DurationValid":"P1D","Expiration":7,"Policy":"BattAC"})",
     S_OK, true, false, 3.0f, true, 86400 * c_ullTicksPerSecond, 5, "old.relay", 1, 2},
    {"Enabled TRUE", R"({"Enabled":"TRUE","Expiration":9})",
     S_OK, true, true, 3.0f, false, 9, 5, "old.relay", 1, 2},
    {"Enabled 1", R"({"Enabled":1,"Expiration":9})",
     S_OK, false, true, 3.0f, false, 9, 5, "old.relay", 1, 2},
    {"Enabled yes", R"({"Enabled":"yes","Expiration":9})",
     S_OK, false, true, 3.0f, false, 9, 5, "old.relay", 1, 2},
    {"Policy battac", R"({"Expiration":9,"Policy":"battac"})",
     S_OK, false, true, 3.0f, false, 9, 5, "old.relay", 1, 2},
    {"Policy ACOnly", R"({"Expiration":9,"Policy":"ACOnly"})",
     S_OK, false, true, 3.0f, false, 9, 5, "old.relay", 1, 2},
    {"no expiration at all: members before it stay applied",
     R"({"Enabled":true,"RelayFQDN":"r2","RelayPort":7,"NumPackets":8,"MaxTestDay":0.5,)"
     R"("LastTest":99,"Policy":"BattAC"})",
     c_hrInvalid, true, false, 0.5f, false, 4, 5, "r2", 7, 8},
    {"no expiration: Policy not applied either", R"({"Policy":"ACOnly"})",
     c_hrInvalid, false, false, 3.0f, false, 4, 5, "old.relay", 1, 2},
    {"bad duration", R"({"Enabled":true,"DurationValid":"P5","Expiration":9,"LastTest":99})",
     c_hrInvalid, true, false, 3.0f, false, 4, 5, "old.relay", 1, 2},
    {"empty duration reads as null", R"({"DurationValid":"","Expiration":9})",
     c_hrInvalid, false, false, 3.0f, false, 4, 5, "old.relay", 1, 2},
    {"numbers that are not numbers keep their fields",
     R"({"RelayPort":"abc","NumPackets":"","MaxTestDay":"fast","Expiration":9,"LastTest":"never"})",
     S_OK, false, true, 3.0f, false, 9, 5, "old.relay", 1, 2},
    {"numbers out of range keep their fields",
     R"({"RelayPort":99999999999,"MaxTestDay":1e99,"Expiration":99999999999999999999})",
     c_hrInvalid, false, false, 3.0f, false, 4, 5, "old.relay", 1, 2},
    {"an expiration that is not a number is none",
     R"({"Enabled":true,"Expiration":"soon"})",
     c_hrInvalid, true, false, 3.0f, false, 4, 5, "old.relay", 1, 2},
    {"numbers with trailing text read their digits",
     R"({"RelayPort":" 47211x","MaxTestDay":"-1","Expiration":"12abc"})",
     S_OK, false, true, -1.0f, false, 12, 5, "old.relay", 47211, 2},
    {"a relay name that is no host name is refused, the rest not applied",
     R"({"Enabled":true,"RelayFQDN":"x & calc","RelayPort":9,"NumPackets":9,"Expiration":9})",
     c_hrInvalid, true, false, 3.0f, false, 4, 5, "old.relay", 1, 2},
    {"a relay name that would read as an option is refused",
     R"({"RelayFQDN":"-verbose","Expiration":9})",
     c_hrInvalid, false, false, 3.0f, false, 4, 5, "old.relay", 1, 2},
    {"an empty relay name reads as null and is kept",
     R"({"RelayFQDN":"","Expiration":9})",
     S_OK, false, true, 3.0f, false, 9, 5, "null", 1, 2},
    {"empty object", "{}",
     c_hrInvalid, false, false, 3.0f, false, 4, 5, "old.relay", 1, 2},
};
// clang-format on
} // namespace

TEST(ApplyUdpConfig, Table)
{
    for (const ApplyCase &c : c_rgApplyCases)
    {
        SCOPED_TRACE(c.szName);
        std::unique_ptr<JsonValue> pRoot(JsonReader::FromJsonString(c.szJson));
        ASSERT_EQ(JsonNodeType::Object, pRoot->Type());
        UdpTestConfig config = StartRecord();
        uint64_t ullBefore = UdpConfigNow();
        EXPECT_EQ(c.hr, ApplyUdpConfig(&config, static_cast<JsonObjectNode *>(pRoot.get())));
        uint64_t ullAfter = UdpConfigNow();
        EXPECT_EQ(c.fEnabled, config.enabled);
        EXPECT_EQ(c.fAcOnly, config.acOnly);
        EXPECT_EQ(c.flMaxTestDay, config.maxTestDay);
        EXPECT_LE((c.fFromNow ? ullBefore : 0) + c.ullExpiration, config.expiration);
        EXPECT_GE((c.fFromNow ? ullAfter : 0) + c.ullExpiration, config.expiration);
        EXPECT_EQ(c.ullLastTest, config.lastTest);
        EXPECT_EQ(c.szRelay, config.relayFqdn);
        EXPECT_EQ(c.ulRelayPort, config.relayPort);
        EXPECT_EQ(c.ulPackets, config.numPackets);
    }
}
