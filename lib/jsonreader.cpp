#include "lib/jsonreader.h"

#include <cstring>
#include <memory>

namespace
{
// Only these four bytes are white space to the reader; form feed and vertical tab are not.
inline bool IsJsonSpace(char ch)
{
    return ch == ' ' || ch == '\t' || ch == '\n' || ch == '\r';
}

inline void SkipSpace(const char *&pszCursor)
{
    while (IsJsonSpace(*pszCursor))
    {
        pszCursor++;
    }
}

// What each byte means to the scans below; most bytes are plain and cost one lookup.
enum ScanClass : unsigned char
{
    ScanPlain = 0,
    ScanTerminator,
    ScanBackslash,
    ScanQuote,
    ScanScalarEnd, // ',' ']' '}'
    ScanNameEnd,   // ':'
};

struct ScanTable
{
    unsigned char rgClass[256];
    constexpr ScanTable()
        : rgClass()
    {
        rgClass[0] = ScanTerminator;
        rgClass[static_cast<unsigned char>('\\')] = ScanBackslash;
        rgClass[static_cast<unsigned char>('"')] = ScanQuote;
        rgClass[static_cast<unsigned char>(',')] = ScanScalarEnd;
        rgClass[static_cast<unsigned char>(']')] = ScanScalarEnd;
        rgClass[static_cast<unsigned char>('}')] = ScanScalarEnd;
        rgClass[static_cast<unsigned char>(':')] = ScanNameEnd;
    }
};
constexpr ScanTable c_scan;

// Returns the first byte from pch on, met outside quotes, of class EndClass, or the
// terminator. A '"' switches between inside and outside quotes; a backslash takes a
// following '"' or backslash with it, so an escaped quote neither opens nor closes a string.
template <ScanClass EndClass>
const char *ScanOutsideQuotes(const char *pch)
{
    bool fInQuotes = false;
    for (;; pch++)
    {
        unsigned char bClass = c_scan.rgClass[static_cast<unsigned char>(*pch)];
        if (bClass == ScanPlain)
        {
            continue;
        }
        if (bClass == ScanTerminator)
        {
            return pch;
        }
        if (bClass == ScanBackslash)
        {
            // pch[1] exists: at worst it is the terminator.
            if (pch[1] == '"' || pch[1] == '\\')
            {
                pch++;
            }
        }
        else if (bClass == ScanQuote)
        {
            fInQuotes = !fInQuotes;
        }
        else if (bClass == EndClass && !fInQuotes)
        {
            return pch;
        }
    }
}

JsonValue *NewNullText()
{
    return new JsonRawText("null");
}
} // namespace

JsonValue *JsonReader::FromJsonString(const char *szText, const char **ppszEnd)
{
    const char *pszCursor = szText != nullptr ? szText : "";
    JsonReader reader;
    std::unique_ptr<JsonValue> root(reader.ReadValue(pszCursor));
    if (ppszEnd != nullptr)
    {
        *ppszEnd = szText != nullptr ? pszCursor : nullptr;
    }
    if (reader.m_fTooDeep)
    {
        return NewNullText();
    }
    return root.release();
}

JsonReader::~JsonReader()
{
    // Only an exception leaves values here; the nodes took all others.
    for (JsonMember &member : m_rgMemberStack)
    {
        delete member.pValue;
    }
    for (JsonValue *pValue : m_rgElementStack)
    {
        delete pValue;
    }
}

bool JsonReader::EnterContainer(const char *&pszCursor)
{
    if (m_cDepth >= c_cMaxDepth)
    {
        m_fTooDeep = true;
        pszCursor += std::strlen(pszCursor);
        return false;
    }
    m_cDepth++;
    pszCursor++;
    SkipSpace(pszCursor);
    return true;
}

JsonValue *JsonReader::ReadValue(const char *&pszCursor)
{
    SkipSpace(pszCursor);
    if (*pszCursor == '[')
    {
        return ReadArray(pszCursor);
    }
    if (*pszCursor == '{')
    {
        return ReadObject(pszCursor);
    }
    return ReadScalar(pszCursor);
}

JsonValue *JsonReader::ReadObject(const char *&pszCursor)
{
    if (!EnterContainer(pszCursor))
    {
        return NewNullText();
    }
    size_t iFirst = m_rgMemberStack.size();
    if (*pszCursor == '}')
    {
        pszCursor++;
    }
    else
    {
        while (*pszCursor != '\0')
        {
            const char *pchColon = ScanOutsideQuotes<ScanNameEnd>(pszCursor);
            if (*pchColon == '\0')
            {
                // No member can follow. Ending at the terminator (rather than where the
                // name began) keeps reading linear: otherwise every enclosing container
                // would scan the same rest again, once per unfinished object ("[{,{,{,").
                pszCursor = pchColon;
                break;
            }

            // The name lies strictly between the first byte of the name part and its last
            // byte that is not white space (normally the two quotes). A name part of fewer
            // than two bytes, as in {a:1} or {:1}, gives an empty name.
            const char *pchLast = pchColon;
            while (pchLast > pszCursor && IsJsonSpace(pchLast[-1]))
            {
                pchLast--;
            }
            std::string strName;
            if (pchLast - pszCursor >= 2)
            {
                strName.assign(pszCursor + 1, pchLast - 1);
            }

            pszCursor = pchColon + 1;
            std::unique_ptr<JsonValue> value(ReadValue(pszCursor));
            m_rgMemberStack.push_back({std::move(strName), value.get()});
            value.release();

            SkipSpace(pszCursor);
            if (*pszCursor == ',')
            {
                pszCursor++;
                SkipSpace(pszCursor);
            }
            if (*pszCursor == '}')
            {
                pszCursor++;
                break;
            }
        }
    }
    m_cDepth--;

    std::unique_ptr<JsonObjectNode> object(new JsonObjectNode());
    object->Reserve(m_rgMemberStack.size() - iFirst);
    for (size_t i = iFirst; i < m_rgMemberStack.size(); i++)
    {
        JsonMember &member = m_rgMemberStack[i];
        JsonValue *pValue = member.pValue;
        member.pValue = nullptr; // the node owns it from here on, even if appending throws
        object->Append(std::move(member.strName), pValue);
    }
    m_rgMemberStack.resize(iFirst);
    return object.release();
}

JsonValue *JsonReader::ReadArray(const char *&pszCursor)
{
    if (!EnterContainer(pszCursor))
    {
        return NewNullText();
    }
    size_t iFirst = m_rgElementStack.size();
    // A '}' where an element should start would make no progress: it closes the array as
    // ']' would, so "[1}" is the array [1].
    while (*pszCursor != ']' && *pszCursor != '}' && *pszCursor != '\0')
    {
        std::unique_ptr<JsonValue> value(ReadValue(pszCursor));
        m_rgElementStack.push_back(value.get());
        value.release();
        SkipSpace(pszCursor);
        if (*pszCursor == ',')
        {
            pszCursor++;
            SkipSpace(pszCursor);
        }
    }
    if (*pszCursor != '\0')
    {
        pszCursor++;
    }
    m_cDepth--;

    std::unique_ptr<JsonArrayNode> array(new JsonArrayNode());
    array->Reserve(m_rgElementStack.size() - iFirst);
    for (size_t i = iFirst; i < m_rgElementStack.size(); i++)
    {
        JsonValue *pValue = m_rgElementStack[i];
        m_rgElementStack[i] = nullptr;
        array->Append(pValue);
    }
    m_rgElementStack.resize(iFirst);
    return array.release();
}

JsonValue *JsonReader::ReadScalar(const char *&pszCursor)
{
    const char *pchBegin = pszCursor;
    pszCursor = ScanOutsideQuotes<ScanScalarEnd>(pszCursor);
    const char *pchEnd = pszCursor;
    while (pchEnd > pchBegin && IsJsonSpace(pchEnd[-1]))
    {
        pchEnd--;
    }
    bool fQuoted = false;
    if (pchEnd > pchBegin && *pchBegin == '"')
    {
        fQuoted = true;
        pchBegin++;
        if (pchEnd > pchBegin)
        {
            pchEnd--;
        }
    }
    if (pchEnd == pchBegin)
    {
        // Nothing left, an empty string literal included, reads as null.
        return NewNullText();
    }
    return new JsonRawText(std::string(pchBegin, pchEnd), fQuoted);
}
