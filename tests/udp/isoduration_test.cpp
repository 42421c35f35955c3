#include "service/isoduration.h"

#include <gtest/gtest.h>

namespace
{
struct DurationCase
{
    const char *szText;
    int32_t hr;
    uint64_t ullSeconds; // the lifetime it gives, when it parses
};

const uint64_t c_ullDay = 86400;

const DurationCase c_rgDurationCases[] = {
    {"P1D", c_hrIsoDurationOk, c_ullDay},
    {"PT30M", c_hrIsoDurationOk, 1800},
    {"P1W2DT1H", c_hrIsoDurationOk, 9 * c_ullDay + 3600},
    {"P1Y", c_hrIsoDurationOk, 0}, // years and months have no fixed length: expires at once
    {"P2M", c_hrIsoDurationOk, 0},
    {"P1Y2M3DT4H5M6S", c_hrIsoDurationOk, 3 * c_ullDay + 4 * 3600 + 5 * 60 + 6},
    {"-P1D", c_hrIsoDurationOk, c_ullDay},  // the sign is ignored
    {"P1.5D", c_hrIsoDurationOk, c_ullDay}, // fractions are dropped
    {"PT0,75H10S", c_hrIsoDurationOk, 10},
    {"P2W", c_hrIsoDurationOk, 14 * c_ullDay},
    {"P1D2D", c_hrIsoDurationOk, 3 * c_ullDay},       // days add up
    {"PT1H2H", c_hrIsoDurationOk, 2 * 3600},          // a repeated time unit replaces
    {"P1DT", c_hrIsoDurationOk, c_ullDay},            // a date unit was seen before the empty time
    {"PD", c_hrIsoDurationOk, 0},                     // a unit without digits counts zero
    {"P5T1H", c_hrIsoDurationOk, 3600},               // digits before the 'T' belong to no unit
    {"P70000D", c_hrIsoDurationOk, 65535 * c_ullDay}, // counts stop at 16 bits, not wrap
    {"P9999W", c_hrIsoDurationOk, 65535 * c_ullDay},
    {"P", c_hrIsoDurationInvalid, 0},
    {"PT", c_hrIsoDurationInvalid, 0},
    {"1D", c_hrIsoDurationInvalid, 0},
    {"P5", c_hrIsoDurationInvalid, 0},
    {"P1DX", c_hrIsoDurationInvalid, 0},
    {"", c_hrIsoDurationInvalid, 0},
    {"p1d", c_hrIsoDurationInvalid, 0},
    {"PT1D", c_hrIsoDurationInvalid, 0},
    {"PT1H2", c_hrIsoDurationInvalid, 0},
    {"P1H", c_hrIsoDurationInvalid, 0},
    {"--P1D", c_hrIsoDurationInvalid, 0},
    {"null", c_hrIsoDurationInvalid, 0}, // what the reader makes of an empty string
};
} // namespace

TEST(ParseIsoDuration, Table)
{
    for (const DurationCase &c : c_rgDurationCases)
    {
        SCOPED_TRACE(c.szText);
        DurationParts parts;
        parts.days = 77; // the parser starts from zero
        EXPECT_EQ(c.hr, ParseIsoDuration(c.szText, &parts));
        if (c.hr == c_hrIsoDurationOk)
        {
            EXPECT_EQ(c.ullSeconds * 10000000ull, IsoDurationTicks(parts));
        }
    }
}

TEST(ParseIsoDuration, KeepsYearsAndMonthsAndNullArguments)
{
    DurationParts parts;
    ASSERT_EQ(c_hrIsoDurationOk, ParseIsoDuration("P3Y4M", &parts));
    EXPECT_EQ(3, parts.years);
    EXPECT_EQ(4, parts.months);
    EXPECT_EQ(0u, IsoDurationTicks(parts));
    EXPECT_EQ(c_hrIsoDurationInvalid, ParseIsoDuration(nullptr, &parts));
    EXPECT_EQ(c_hrIsoDurationInvalid, ParseIsoDuration("P1D", nullptr));
}
