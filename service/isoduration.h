// ISO 8601 durations as the policy web service gives them ("P1DT12H"). Platform-free, so the
// parser also builds natively for fuzzing; any thread may call it.
#pragma once

#include <cstdint>

// Results, numerically the HRESULTs the policy code returns (S_OK, E_INVALIDARG).
constexpr int32_t c_hrIsoDurationOk = 0;
constexpr int32_t c_hrIsoDurationInvalid = static_cast<int32_t>(0x80070057u);

struct DurationParts
{
    uint16_t years = 0;
    uint16_t months = 0;
    uint16_t days = 0;
    uint16_t hours = 0;
    uint16_t minutes = 0;
    uint16_t seconds = 0;
};

// Parses szText (terminated; null reads as empty) into *pParts, which it zeroes first. A
// leading '-' is ignored, fractions are dropped, weeks add seven days each; every count and
// the day total stop at 0xFFFF instead of wrapping.
int32_t ParseIsoDuration(const char *szText, DurationParts *pParts);

// The lifetime the parts give, in 100-ns units: days, hours, minutes and seconds. Years and
// months have no fixed length and count as zero.
uint64_t IsoDurationTicks(const DurationParts &parts);
