#include "lib/jsonvalue.h"

#include <charconv>
#include <cmath>
#include <memory>

// Frees subtrees without recursion: a document read from a file or a server, or built
// by nesting holders, may be far deeper than a thread stack allows frames.
class JsonTreeDestroyer
{
public:
    // Deletes everything pNode owns; pNode itself is left to its caller.
    static void DeleteChildren(JsonValue *pNode) noexcept
    {
        // Containers waiting to be emptied, chained through their own link field, so
        // that deleting never needs memory it may not get.
        JsonValue *pPending = nullptr;
        TakeChildren(pNode, pPending);
        while (pPending != nullptr)
        {
            JsonValue *p = pPending;
            pPending = *Link(p);
            TakeChildren(p, pPending);
            delete p; // already empty: its own destructor has nothing left to free
        }
    }

private:
    static JsonValue **Link(JsonValue *pContainer)
    {
        if (pContainer->Type() == JsonNodeType::Object)
        {
            return &static_cast<JsonObjectNode *>(pContainer)->m_pNextToDestroy;
        }
        return &static_cast<JsonArrayNode *>(pContainer)->m_pNextToDestroy;
    }

    static void Dispose(JsonValue *pChild, JsonValue *&pPending)
    {
        if (pChild == nullptr)
        {
            return;
        }
        if (pChild->Type() == JsonNodeType::Scalar)
        {
            delete pChild;
            return;
        }
        *Link(pChild) = pPending;
        pPending = pChild;
    }

    static void TakeChildren(JsonValue *pNode, JsonValue *&pPending)
    {
        if (pNode->Type() == JsonNodeType::Object)
        {
            std::vector<JsonMember> &members = static_cast<JsonObjectNode *>(pNode)->m_members;
            for (JsonMember &member : members)
            {
                Dispose(member.pValue, pPending);
            }
            members.clear();
        }
        else if (pNode->Type() == JsonNodeType::Array)
        {
            std::vector<JsonValue *> &elements = static_cast<JsonArrayNode *>(pNode)->m_elements;
            for (JsonValue *pElement : elements)
            {
                Dispose(pElement, pPending);
            }
            elements.clear();
        }
    }
};

namespace
{
const char c_rgchHex[] = "0123456789abcdef";

// Bytes a quoted string carries as they are: printable ASCII except the three escaped.
struct PlainByteTable
{
    bool rgf[256];
    constexpr PlainByteTable()
        : rgf()
    {
        for (int b = 0x20; b < 0x7F; b++)
        {
            rgf[b] = b != '"' && b != '\\' && b != '/';
        }
    }
};
constexpr PlainByteTable c_plainBytes;

template <class T>
void AppendInteger(std::string &strOut, T value)
{
    char rgch[24];
    std::to_chars_result result = std::to_chars(rgch, rgch + sizeof(rgch), value);
    strOut.append(rgch, result.ptr);
}

// Writes a container and everything below it without recursion: the walk keeps its own
// stack of open containers, one entry per level.
void AppendTree(std::string &strOut, const JsonValue &root)
{
    struct Frame
    {
        const JsonValue *pNode;
        size_t iNext;
    };
    std::vector<Frame> rgStack;
    const JsonValue *pValue = &root;
    while (pValue != nullptr)
    {
        switch (pValue->Type())
        {
        case JsonNodeType::Object:
            strOut += '{';
            rgStack.push_back({pValue, 0});
            break;
        case JsonNodeType::Array:
            strOut += '[';
            rgStack.push_back({pValue, 0});
            break;
        default:
            static_cast<const JsonScalar *>(pValue)->AppendJson(strOut);
            break;
        }

        // Close finished containers until one has a next child to write.
        pValue = nullptr;
        while (pValue == nullptr && !rgStack.empty())
        {
            Frame &frame = rgStack.back();
            if (frame.pNode->Type() == JsonNodeType::Object)
            {
                const std::vector<JsonMember> &members =
                    static_cast<const JsonObjectNode *>(frame.pNode)->Members();
                if (frame.iNext < members.size())
                {
                    const JsonMember &member = members[frame.iNext];
                    if (frame.iNext++ > 0)
                    {
                        strOut += ',';
                    }
                    // Names are the service's own constants or names the reader took
                    // from a document with their escapes intact: copied unescaped.
                    strOut += '"';
                    strOut += member.strName;
                    strOut += "\":";
                    pValue = member.pValue;
                    continue;
                }
                strOut += '}';
            }
            else
            {
                const std::vector<JsonValue *> &elements =
                    static_cast<const JsonArrayNode *>(frame.pNode)->Elements();
                if (frame.iNext < elements.size())
                {
                    if (frame.iNext > 0)
                    {
                        strOut += ',';
                    }
                    pValue = elements[frame.iNext++];
                    continue;
                }
                strOut += ']';
            }
            rgStack.pop_back();
        }
    }
}
} // namespace

std::string &JsonValue::ToString(std::string &strOut) const
{
    strOut.clear();
    AppendTree(strOut, *this);
    return strOut;
}

void JsonAppendEscaped(std::string &strOut, std::string_view strText)
{
    // The payload ends at its first zero byte. Every byte is one character: the service
    // never leaves the C locale, so the text is walked byte by byte.
    size_t cch = strText.find('\0');
    if (cch == std::string_view::npos)
    {
        cch = strText.size();
    }
    const char *pch = strText.data();
    const char *pchEnd = pch + cch;
    const char *pchRun = pch;
    for (; pch < pchEnd; pch++)
    {
        unsigned char b = static_cast<unsigned char>(*pch);
        if (c_plainBytes.rgf[b])
        {
            continue;
        }
        strOut.append(pchRun, pch);
        pchRun = pch + 1;
        switch (b)
        {
        case '"':
            strOut += "\\\"";
            break;
        case '\\':
            strOut += "\\\\";
            break;
        case '/':
            strOut += "\\/";
            break;
        case '\b':
            strOut += "\\b";
            break;
        case '\t':
            strOut += "\\t";
            break;
        case '\n':
            strOut += "\\n";
            break;
        case '\f':
            strOut += "\\f";
            break;
        case '\r':
            strOut += "\\r";
            break;
        default: {
            // "\u%.4x" of the byte taken as unsigned.
            const char rgch[6] = {'\\', 'u', '0', '0', c_rgchHex[b >> 4], c_rgchHex[b & 0xF]};
            strOut.append(rgch, sizeof(rgch));
            break;
        }
        }
    }
    strOut.append(pchRun, pchEnd);
}

void JsonAppendDouble(std::string &strOut, double dblValue)
{
    if (!std::isfinite(dblValue))
    {
        strOut += "null";
        return;
    }
    // The same text as %.12g in the C locale, independent of the runtime's printf.
    char rgch[32];
    std::to_chars_result result =
        std::to_chars(rgch, rgch + sizeof(rgch), dblValue, std::chars_format::general, 12);
    strOut.append(rgch, result.ptr);
}

void JsonQuotedString::AppendJson(std::string &strOut) const
{
    strOut += '"';
    JsonAppendEscaped(strOut, m_strValue);
    strOut += '"';
}

void JsonRawText::AppendJson(std::string &strOut) const
{
    if (m_fQuoted)
    {
        strOut += '"';
        strOut += m_strText;
        strOut += '"';
        return;
    }
    strOut += m_strText;
}

void JsonRawText::AppendMemberText(std::string &strOut) const
{
    strOut += m_strText;
}

void JsonNull::AppendJson(std::string &strOut) const
{
    strOut += "null";
}

void JsonBool::AppendJson(std::string &strOut) const
{
    strOut += m_fValue ? "true" : "false";
}

void JsonUInt32::AppendJson(std::string &strOut) const
{
    AppendInteger(strOut, m_ulValue);
}

void JsonInt64::AppendJson(std::string &strOut) const
{
    AppendInteger(strOut, m_llValue);
}

void JsonUInt64::AppendJson(std::string &strOut) const
{
    AppendInteger(strOut, m_ullValue);
}

void JsonFloat::AppendJson(std::string &strOut) const
{
    JsonAppendDouble(strOut, static_cast<double>(m_flValue));
}

void JsonDouble::AppendJson(std::string &strOut) const
{
    JsonAppendDouble(strOut, m_dblValue);
}

JsonObjectNode::~JsonObjectNode()
{
    JsonTreeDestroyer::DeleteChildren(this);
}

void JsonObjectNode::Append(std::string strName, JsonValue *pValue)
{
    std::unique_ptr<JsonValue> value(pValue != nullptr ? pValue : new JsonNull());
    if (m_members.capacity() == 0)
    {
        m_members.reserve(4); // built objects are mostly small: skip the first regrowths
    }
    m_members.push_back({std::move(strName), value.get()});
    value.release();
}

void JsonObjectNode::AddBool(std::string strName, bool fValue)
{
    Append(std::move(strName), new JsonBool(fValue));
}

void JsonObjectNode::AddString(std::string strName, std::string strValue)
{
    Append(std::move(strName), new JsonQuotedString(std::move(strValue)));
}

void JsonObjectNode::AddStringOrNull(std::string strName, const char *szValue)
{
    if (szValue == nullptr)
    {
        Append(std::move(strName), new JsonNull());
        return;
    }
    Append(std::move(strName), new JsonQuotedString(szValue));
}

void JsonObjectNode::AddDword(std::string strName, uint32_t ulValue)
{
    Append(std::move(strName), new JsonUInt32(ulValue));
}

void JsonObjectNode::AddUlonglong(std::string strName, uint64_t ullValue)
{
    Append(std::move(strName), new JsonUInt64(ullValue));
}

void JsonObjectNode::AddInt64(std::string strName, int64_t llValue)
{
    Append(std::move(strName), new JsonInt64(llValue));
}

void JsonObjectNode::AddFloat(std::string strName, float flValue)
{
    Append(std::move(strName), new JsonFloat(flValue));
}

void JsonObjectNode::AddDouble(std::string strName, double dblValue)
{
    Append(std::move(strName), new JsonDouble(dblValue));
}

JsonValue *JsonObjectNode::FindMember(std::string_view strName) const
{
    for (const JsonMember &member : m_members)
    {
        if (member.strName == strName)
        {
            return member.pValue;
        }
    }
    return nullptr;
}

bool JsonObjectNode::GetMemberText(std::string_view strName, std::string &strText) const
{
    const JsonValue *pValue = FindMember(strName);
    if (pValue == nullptr)
    {
        return false;
    }
    if (pValue->Type() == JsonNodeType::Scalar)
    {
        strText.clear();
        static_cast<const JsonScalar *>(pValue)->AppendMemberText(strText);
        return true;
    }
    pValue->ToString(strText);
    return true;
}

bool JsonObjectNode::GetMemberNumber(std::string_view strName, uint32_t &ulValue) const
{
    std::string strText;
    if (!GetMemberText(strName, strText))
    {
        return false;
    }
    // The white space a stream skips: space, TAB, LF, VT, FF, CR.
    const char *pch = strText.c_str();
    while (*pch == ' ' || (*pch >= '\t' && *pch <= '\r'))
    {
        pch++;
    }
    bool fNegative = false;
    if (*pch == '+' || *pch == '-')
    {
        fNegative = *pch == '-';
        pch++;
    }
    if (*pch < '0' || *pch > '9')
    {
        ulValue = 0;
        return false;
    }
    uint64_t ullValue = 0;
    bool fOverflow = false;
    for (; *pch >= '0' && *pch <= '9'; pch++)
    {
        ullValue = ullValue * 10 + static_cast<uint64_t>(*pch - '0');
        if (ullValue > 0xFFFFFFFFull)
        {
            fOverflow = true;
            ullValue = 0xFFFFFFFFull; // keeps the product in range for the next digit
        }
    }
    if (fOverflow)
    {
        ulValue = 0xFFFFFFFF;
        return false;
    }
    uint32_t ul = static_cast<uint32_t>(ullValue);
    ulValue = fNegative ? 0u - ul : ul;
    return true;
}

JsonArrayNode::~JsonArrayNode()
{
    JsonTreeDestroyer::DeleteChildren(this);
}

void JsonArrayNode::Append(JsonValue *pValue)
{
    std::unique_ptr<JsonValue> value(pValue != nullptr ? pValue : new JsonNull());
    if (m_elements.capacity() == 0)
    {
        m_elements.reserve(4);
    }
    m_elements.push_back(value.get());
    value.release();
}
