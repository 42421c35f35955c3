// GUIDs as the service core uses them: compared bytewise as map keys, never interpreted, and
// written into trace messages as lower-case 8-4-4-4-12 text. Free helpers, any thread.
#pragma once

#include <windows.h>

#include <cstdio>
#include <cstring>

struct GuidKeyLess
{
    bool operator()(const GUID &a, const GUID &b) const
    {
        return std::memcmp(&a, &b, sizeof(GUID)) < 0;
    }
};

inline bool GuidKeyEqual(const GUID &a, const GUID &b)
{
    return std::memcmp(&a, &b, sizeof(GUID)) == 0;
}

// 36 characters and the NUL.
struct GuidKeyText
{
    explicit GuidKeyText(const GUID &guid)
    {
        std::snprintf(m_sz, sizeof(m_sz), "%08lx-%04x-%04x-%02x%02x-%02x%02x%02x%02x%02x%02x",
                      static_cast<unsigned long>(guid.Data1), guid.Data2, guid.Data3, guid.Data4[0],
                      guid.Data4[1], guid.Data4[2], guid.Data4[3], guid.Data4[4], guid.Data4[5],
                      guid.Data4[6], guid.Data4[7]);
    }
    const char *Get() const { return m_sz; }

private:
    char m_sz[40];
};
