// The reader alone, on any bytes: it must end, stay inside the text, and give a tree that
// lookups and the writer can use.
#include "fuzz/json/fuzzjsonsupport.h"
#include "lib/jsonreader.h"

extern "C" int LLVMFuzzerTestOneInput(const uint8_t *pbData, size_t cbData)
{
    std::unique_ptr<char[]> szText = FuzzJsonTerminatedCopy(pbData, cbData);
    const char *pszEnd = nullptr;
    std::unique_ptr<JsonValue> root(JsonReader::FromJsonString(szText.get(), &pszEnd));
    if (!root)
    {
        std::abort(); // the reader gives a tree for every input
    }
    FuzzJsonCheckEnd(szText.get(), pszEnd);
    FuzzJsonUseTree(*root);
    return 0;
}
