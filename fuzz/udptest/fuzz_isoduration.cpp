// Feeds any text to the duration parser and checks what an accepted duration must look like.
#include "service/isoduration.h"

#include <cstdlib>
#include <cstring>
#include <string>

namespace
{
void FuzzCheck(bool f)
{
    if (!f)
    {
        std::abort();
    }
}
} // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t *pb, size_t cb)
{
    std::string strText(reinterpret_cast<const char *>(pb), cb); // a zero byte ends the text
    DurationParts parts;
    int32_t hr = ParseIsoDuration(strText.c_str(), &parts);
    FuzzCheck(hr == c_hrIsoDurationOk || hr == c_hrIsoDurationInvalid);
    const char *sz = strText.c_str();
    if (hr == c_hrIsoDurationOk)
    {
        FuzzCheck(sz[0] == 'P' || (sz[0] == '-' && sz[1] == 'P'));
        // A 16-bit day count and its hours, minutes and seconds never overflow the ticks.
        FuzzCheck(IsoDurationTicks(parts) <=
                  65535ull * 86400 * 10000000 + (65535ull * 3600 + 65535ull * 61) * 10000000);
        // A date-only duration followed by an empty time part means the same.
        if (strText.find('T') == std::string::npos && strlen(sz) == strText.size())
        {
            DurationParts partsWithTime;
            FuzzCheck(ParseIsoDuration((strText + "T").c_str(), &partsWithTime) ==
                      c_hrIsoDurationOk);
            FuzzCheck(IsoDurationTicks(partsWithTime) == IsoDurationTicks(parts));
        }
    }
    return 0;
}
