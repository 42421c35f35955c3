// The strict validator on any bytes, against RapidJSON's strict reading of the same bytes
// (iterative, UTF-8 checked): what the validator accepts RapidJSON must accept, except a
// valid number too big for a double. What RapidJSON accepts the validator must accept when
// the text is ASCII without a lone low surrogate escape: beyond that RapidJSON 1.1 is laxer
// (it lets such escapes through, and a UTF-8 sequence cut off by the end of the text).
// A text the validator accepts must also stay valid inside an array and invalid with a
// stray byte after it.
#include "lib/jsonvalidator.h"

#include <rapidjson/document.h>

#include <cstdint>
#include <cstdlib>
#include <cstring>
#include <string>

namespace
{
bool HasLoneLowSurrogateEscape(const std::string &str)
{
    for (size_t i = 0; i + 5 < str.size(); i++)
    {
        if (str[i] == '\\' && str[i + 1] == 'u' && (str[i + 2] == 'd' || str[i + 2] == 'D') &&
            std::strchr("cdefCDEF", str[i + 3]) != nullptr)
        {
            return true;
        }
    }
    return false;
}
} // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t *pbData, size_t cbData)
{
    std::string str(reinterpret_cast<const char *>(pbData), cbData);
    bool fValid = JsonValidateText(str);
    // RapidJSON reads terminated text (its length-counted reading skips stray bytes of a
    // byte-order mark): a zero byte, which no JSON text holds, cannot be compared. It reads
    // up to three bytes past the terminator when a UTF-8 sequence is cut off there, so the
    // copy it gets has room for that.
    if (str.find('\0') != std::string::npos)
    {
        if (fValid)
        {
            std::abort();
        }
        return 0;
    }

    rapidjson::Document document;
    document.Parse<rapidjson::kParseValidateEncodingFlag | rapidjson::kParseIterativeFlag>(
        (str + std::string(4, '\0')).c_str());
    bool fRapidValid = !document.HasParseError();
    if (fValid && !fRapidValid && document.GetParseError() != rapidjson::kParseErrorNumberTooBig)
    {
        std::abort();
    }
    bool fAscii = true;
    for (unsigned char b : str)
    {
        fAscii = fAscii && b < 0x80;
    }
    if (!fValid && fRapidValid && fAscii && !HasLoneLowSurrogateEscape(str))
    {
        std::abort();
    }
    if (fValid)
    {
        if (!JsonValidateText("[" + str + "]") || JsonValidateText(str + "x") ||
            JsonValidateText(str + "\x80"))
        {
            std::abort();
        }
    }
    return 0;
}
