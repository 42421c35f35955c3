#include "tools/telvanectl/ctltraceformat.h"

#include <stdio.h>

std::string CtlFormatFileTime(ULONGLONG ullFileTime)
{
    FILETIME ft;
    ft.dwLowDateTime = static_cast<DWORD>(ullFileTime);
    ft.dwHighDateTime = static_cast<DWORD>(ullFileTime >> 32);
    SYSTEMTIME st;
    if (ullFileTime == 0 || !FileTimeToSystemTime(&ft, &st))
    {
        return "-";
    }
    char sz[64];
    snprintf(sz, sizeof(sz), "%04u-%02u-%02u %02u:%02u:%02u.%03u UTC", st.wYear, st.wMonth, st.wDay,
             st.wHour, st.wMinute, st.wSecond, st.wMilliseconds);
    return sz;
}

std::string CtlPrettyJson(std::string_view text)
{
    std::string strOut;
    strOut.reserve(text.size() + text.size() / 4);
    size_t cIndent = 0;
    auto newLine = [&]() {
        strOut += '\n';
        strOut.append(2 * cIndent, ' ');
    };
    auto nextSignificant = [&](size_t pos) {
        while (pos < text.size() &&
               (text[pos] == ' ' || text[pos] == '\t' || text[pos] == '\r' || text[pos] == '\n'))
        {
            pos++;
        }
        return pos;
    };
    for (size_t pos = 0; pos < text.size(); pos++)
    {
        char ch = text[pos];
        switch (ch)
        {
        case '"': {
            // Copy the whole string, escapes included.
            size_t end = pos + 1;
            while (end < text.size() && text[end] != '"')
            {
                end += text[end] == '\\' ? 2 : 1;
            }
            end = end < text.size() ? end + 1 : text.size();
            strOut.append(text.substr(pos, end - pos));
            pos = end - 1;
            break;
        }
        case '{':
        case '[': {
            size_t next = nextSignificant(pos + 1);
            if (next < text.size() && text[next] == (ch == '{' ? '}' : ']'))
            {
                strOut += ch;
                strOut += text[next];
                pos = next;
                break;
            }
            strOut += ch;
            cIndent++;
            newLine();
            break;
        }
        case '}':
        case ']':
            cIndent = cIndent > 0 ? cIndent - 1 : 0;
            newLine();
            strOut += ch;
            break;
        case ',':
            strOut += ch;
            newLine();
            break;
        case ':':
            strOut += ": ";
            break;
        case ' ':
        case '\t':
        case '\r':
        case '\n':
            break;
        default:
            strOut += ch;
            break;
        }
    }
    strOut += '\n';
    return strOut;
}
