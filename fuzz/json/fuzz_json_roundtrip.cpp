// Reader, writer, reader: whatever tree the reader makes of any bytes, its written text
// reads again without harm.
#include "fuzz/json/fuzzjsonsupport.h"
#include "lib/jsonreader.h"

#include <cstdlib>
#include <string>

extern "C" int LLVMFuzzerTestOneInput(const uint8_t *pbData, size_t cbData)
{
    std::unique_ptr<char[]> szText = FuzzJsonTerminatedCopy(pbData, cbData);
    std::unique_ptr<JsonValue> first(JsonReader::FromJsonString(szText.get()));
    std::string strFirst;
    first->ToString(strFirst);

    std::unique_ptr<char[]> szWritten =
        FuzzJsonTerminatedCopy(reinterpret_cast<const uint8_t *>(strFirst.data()), strFirst.size());
    const char *pszEnd = nullptr;
    std::unique_ptr<JsonValue> second(JsonReader::FromJsonString(szWritten.get(), &pszEnd));
    FuzzJsonCheckEnd(szWritten.get(), pszEnd);
    FuzzJsonUseTree(*second);
    return 0;
}
