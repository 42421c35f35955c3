#include "service/isoduration.h"

namespace
{
constexpr uint16_t c_usMaxCount = 0xFFFF;

uint16_t IsoDurationAdd(uint16_t usBase, uint32_t ulMore)
{
    uint32_t ulSum = static_cast<uint32_t>(usBase) + ulMore;
    return ulSum > c_usMaxCount ? c_usMaxCount : static_cast<uint16_t>(ulSum);
}

// Reads decimal digits at the cursor (none reads as 0) and skips a fraction after them. A
// number past 16 bits stops at 0xFFFF: a wrapped count would shorten a long lifetime to an
// arbitrary short one.
uint16_t IsoDurationReadNumber(const char *&pch)
{
    uint32_t ul = 0;
    for (; *pch >= '0' && *pch <= '9'; pch++)
    {
        ul = ul * 10 + static_cast<uint32_t>(*pch - '0');
        if (ul > c_usMaxCount)
        {
            ul = c_usMaxCount;
        }
    }
    if (*pch == '.' || *pch == ',')
    {
        pch++;
        while (*pch >= '0' && *pch <= '9')
        {
            pch++;
        }
    }
    return static_cast<uint16_t>(ul);
}
} // namespace

int32_t ParseIsoDuration(const char *szText, DurationParts *pParts)
{
    if (pParts == nullptr)
    {
        return c_hrIsoDurationInvalid;
    }
    *pParts = DurationParts();
    const char *pch = szText != nullptr ? szText : "";
    if (*pch == '-')
    {
        pch++; // a negative lifetime means nothing to us: the sign is ignored
    }
    if (*pch != 'P')
    {
        return c_hrIsoDurationInvalid;
    }
    pch++;

    bool fUnitSeen = false;
    bool fDateUnit = true;
    while (*pch != '\0' && fDateUnit)
    {
        uint16_t usCount = IsoDurationReadNumber(pch);
        switch (*pch)
        {
        case 'Y':
            pParts->years = usCount;
            break;
        case 'M':
            pParts->months = usCount;
            break;
        case 'W':
            pParts->days = IsoDurationAdd(pParts->days, 7u * usCount);
            break;
        case 'D':
            pParts->days = IsoDurationAdd(pParts->days, usCount);
            break;
        default:
            // Not a date unit: the time part (or garbage, or the end) starts here, and the
            // number read in front of it counts for nothing.
            fDateUnit = false;
            continue;
        }
        fUnitSeen = true;
        pch++;
    }

    if (*pch == 'T')
    {
        for (;;)
        {
            pch++; // past the 'T', then past each unit
            if (*pch == '\0')
            {
                return fUnitSeen ? c_hrIsoDurationOk : c_hrIsoDurationInvalid;
            }
            uint16_t usCount = IsoDurationReadNumber(pch);
            switch (*pch)
            {
            case 'H':
                pParts->hours = usCount;
                break;
            case 'M':
                pParts->minutes = usCount;
                break;
            case 'S':
                pParts->seconds = usCount;
                break;
            default:
                return c_hrIsoDurationInvalid;
            }
            fUnitSeen = true;
        }
    }
    return *pch == '\0' && fUnitSeen ? c_hrIsoDurationOk : c_hrIsoDurationInvalid;
}

uint64_t IsoDurationTicks(const DurationParts &parts)
{
    uint64_t ullSeconds =
        ((static_cast<uint64_t>(parts.days) * 24 + parts.hours) * 60 + parts.minutes) * 60 +
        parts.seconds;
    return ullSeconds * 10000000ull;
}
