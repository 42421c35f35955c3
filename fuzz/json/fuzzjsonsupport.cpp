#include "fuzz/json/fuzzjsonsupport.h"

#include <cstdlib>
#include <cstring>
#include <string>

// The service's definition reports through its fatal-error path, which native builds do
// not have; here a broken reference count ends the run so libFuzzer reports it.
void TaggedRefFailure(const wchar_t *, const wchar_t *, unsigned long, const wchar_t *)
{
    std::abort();
}

std::unique_ptr<char[]> FuzzJsonTerminatedCopy(const uint8_t *pbData, size_t cbData)
{
    std::unique_ptr<char[]> szText(new char[cbData + 1]);
    if (cbData != 0)
    {
        std::memcpy(szText.get(), pbData, cbData);
    }
    szText[cbData] = '\0';
    return szText;
}

void FuzzJsonCheckEnd(const char *szText, const char *pszEnd)
{
    if (pszEnd < szText || pszEnd > szText + std::strlen(szText))
    {
        std::abort();
    }
}

void FuzzJsonUseTree(const JsonValue &root)
{
    std::string strText;
    root.ToString(strText);
    if (root.Type() != JsonNodeType::Object)
    {
        return;
    }
    const JsonObjectNode &object = static_cast<const JsonObjectNode &>(root);
    for (const JsonMember &member : object.Members())
    {
        uint32_t ulNumber = 0;
        if (!object.GetMemberText(member.strName, strText) ||
            object.FindMember(member.strName) == nullptr)
        {
            std::abort(); // a member that lookups cannot find
        }
        object.GetMemberNumber(member.strName, ulNumber);
    }
    object.GetMemberText("Enabled", strText);
}
