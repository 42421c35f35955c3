#include "lib/jsonvalidator.h"

#include <cstdint>
#include <vector>

namespace
{
class CJsonValidator
{
public:
    explicit CJsonValidator(std::string_view text)
        : m_p(reinterpret_cast<const uint8_t *>(text.data()))
        , m_pEnd(m_p + text.size())
    {
    }

    bool Run();

private:
    enum class State
    {
        Value,     // a value must come next
        FirstName, // after '{': a member name or '}'
        Name,      // after ',' in an object: a member name
        AfterValue,
    };

    void SkipWhiteSpace()
    {
        while (m_p < m_pEnd && (*m_p == ' ' || *m_p == '\t' || *m_p == '\n' || *m_p == '\r'))
        {
            m_p++;
        }
    }
    bool Literal(const char *sz);
    bool Number();
    bool String();
    bool Escape();
    bool Hex4(uint32_t &ulValue);
    bool Utf8Sequence();
    bool Continuation(uint8_t bLow, uint8_t bHigh)
    {
        if (m_p >= m_pEnd || *m_p < bLow || *m_p > bHigh)
        {
            return false;
        }
        m_p++;
        return true;
    }

    const uint8_t *m_p;
    const uint8_t *const m_pEnd;
    std::vector<uint8_t> m_rgbOpen; // '{' or '[' of each open container, innermost last
};

bool CJsonValidator::Run()
{
    State state = State::Value;
    for (;;)
    {
        SkipWhiteSpace();
        if (state == State::AfterValue)
        {
            if (m_rgbOpen.empty())
            {
                return m_p == m_pEnd;
            }
            if (m_p == m_pEnd)
            {
                return false;
            }
            uint8_t bOpen = m_rgbOpen.back();
            uint8_t b = *m_p++;
            if (b == ',')
            {
                state = bOpen == '{' ? State::Name : State::Value;
            }
            else if ((b == '}' && bOpen == '{') || (b == ']' && bOpen == '['))
            {
                m_rgbOpen.pop_back();
            }
            else
            {
                return false;
            }
            continue;
        }
        if (m_p == m_pEnd)
        {
            return false;
        }
        if (state == State::FirstName || state == State::Name)
        {
            if (state == State::FirstName && *m_p == '}')
            {
                m_p++;
                m_rgbOpen.pop_back();
                state = State::AfterValue;
                continue;
            }
            if (*m_p != '"' || !String())
            {
                return false;
            }
            SkipWhiteSpace();
            if (m_p == m_pEnd || *m_p != ':')
            {
                return false;
            }
            m_p++;
            state = State::Value;
            continue;
        }
        // A value.
        switch (*m_p)
        {
        case '{':
            m_p++;
            m_rgbOpen.push_back('{');
            state = State::FirstName;
            continue;
        case '[':
            m_p++;
            m_rgbOpen.push_back('[');
            SkipWhiteSpace();
            if (m_p < m_pEnd && *m_p == ']')
            {
                m_p++;
                m_rgbOpen.pop_back();
                state = State::AfterValue;
            }
            continue;
        case '"':
            if (!String())
            {
                return false;
            }
            break;
        case 't':
            if (!Literal("true"))
            {
                return false;
            }
            break;
        case 'f':
            if (!Literal("false"))
            {
                return false;
            }
            break;
        case 'n':
            if (!Literal("null"))
            {
                return false;
            }
            break;
        default:
            if (!Number())
            {
                return false;
            }
            break;
        }
        state = State::AfterValue;
    }
}

bool CJsonValidator::Literal(const char *sz)
{
    for (; *sz != '\0'; sz++, m_p++)
    {
        if (m_p == m_pEnd || *m_p != static_cast<uint8_t>(*sz))
        {
            return false;
        }
    }
    return true;
}

bool CJsonValidator::Number()
{
    auto digit = [this]() { return m_p < m_pEnd && *m_p >= '0' && *m_p <= '9'; };
    auto digits = [&]() {
        if (!digit())
        {
            return false;
        }
        while (digit())
        {
            m_p++;
        }
        return true;
    };
    if (m_p < m_pEnd && *m_p == '-')
    {
        m_p++;
    }
    if (m_p < m_pEnd && *m_p == '0')
    {
        m_p++;
    }
    else if (!digits())
    {
        return false;
    }
    if (m_p < m_pEnd && *m_p == '.')
    {
        m_p++;
        if (!digits())
        {
            return false;
        }
    }
    if (m_p < m_pEnd && (*m_p == 'e' || *m_p == 'E'))
    {
        m_p++;
        if (m_p < m_pEnd && (*m_p == '+' || *m_p == '-'))
        {
            m_p++;
        }
        if (!digits())
        {
            return false;
        }
    }
    return true;
}

// Cursor on the opening quote; leaves it after the closing one.
bool CJsonValidator::String()
{
    m_p++;
    for (;;)
    {
        if (m_p == m_pEnd)
        {
            return false;
        }
        uint8_t b = *m_p;
        if (b == '"')
        {
            m_p++;
            return true;
        }
        if (b < 0x20)
        {
            return false;
        }
        if (b == '\\')
        {
            m_p++;
            if (!Escape())
            {
                return false;
            }
        }
        else if (b < 0x80)
        {
            m_p++;
        }
        else if (!Utf8Sequence())
        {
            return false;
        }
    }
}

// Cursor after the backslash.
bool CJsonValidator::Escape()
{
    if (m_p == m_pEnd)
    {
        return false;
    }
    switch (*m_p++)
    {
    case '"':
    case '\\':
    case '/':
    case 'b':
    case 'f':
    case 'n':
    case 'r':
    case 't':
        return true;
    case 'u': {
        uint32_t ulUnit = 0;
        if (!Hex4(ulUnit))
        {
            return false;
        }
        if (ulUnit >= 0xDC00 && ulUnit <= 0xDFFF)
        {
            return false;
        }
        if (ulUnit < 0xD800 || ulUnit > 0xDBFF)
        {
            return true;
        }
        // A high surrogate: the low one must follow at once.
        uint32_t ulLow = 0;
        if (m_pEnd - m_p < 2 || m_p[0] != '\\' || m_p[1] != 'u')
        {
            return false;
        }
        m_p += 2;
        return Hex4(ulLow) && ulLow >= 0xDC00 && ulLow <= 0xDFFF;
    }
    default:
        return false;
    }
}

bool CJsonValidator::Hex4(uint32_t &ulValue)
{
    ulValue = 0;
    for (int i = 0; i < 4; i++, m_p++)
    {
        if (m_p == m_pEnd)
        {
            return false;
        }
        uint8_t b = *m_p;
        uint32_t ulDigit;
        if (b >= '0' && b <= '9')
        {
            ulDigit = b - '0';
        }
        else if (b >= 'a' && b <= 'f')
        {
            ulDigit = b - 'a' + 10;
        }
        else if (b >= 'A' && b <= 'F')
        {
            ulDigit = b - 'A' + 10;
        }
        else
        {
            return false;
        }
        ulValue = ulValue * 16 + ulDigit;
    }
    return true;
}

// Cursor on a lead byte of 0x80 or above: one well-formed sequence of RFC 3629, table 3-7
// of the Unicode standard (no overlong forms, no surrogates, nothing past U+10FFFF).
bool CJsonValidator::Utf8Sequence()
{
    uint8_t b = *m_p++;
    if (b >= 0xC2 && b <= 0xDF)
    {
        return Continuation(0x80, 0xBF);
    }
    if (b == 0xE0)
    {
        return Continuation(0xA0, 0xBF) && Continuation(0x80, 0xBF);
    }
    if ((b >= 0xE1 && b <= 0xEC) || b == 0xEE || b == 0xEF)
    {
        return Continuation(0x80, 0xBF) && Continuation(0x80, 0xBF);
    }
    if (b == 0xED)
    {
        return Continuation(0x80, 0x9F) && Continuation(0x80, 0xBF);
    }
    if (b == 0xF0)
    {
        return Continuation(0x90, 0xBF) && Continuation(0x80, 0xBF) && Continuation(0x80, 0xBF);
    }
    if (b >= 0xF1 && b <= 0xF3)
    {
        return Continuation(0x80, 0xBF) && Continuation(0x80, 0xBF) && Continuation(0x80, 0xBF);
    }
    if (b == 0xF4)
    {
        return Continuation(0x80, 0x8F) && Continuation(0x80, 0xBF) && Continuation(0x80, 0xBF);
    }
    return false;
}
} // namespace

bool JsonValidateText(std::string_view text)
{
    CJsonValidator validator(text);
    return validator.Run();
}
