// Builds a JSON tree from text. Lenient on purpose: it never reports an error, keeps every
// scalar as raw text (quotes removed, escapes not decoded) and leaves all checking to its
// callers, which accept only an object root. Platform-free, so it also builds natively for
// fuzzing.
#pragma once

#include "lib/jsonvalue.h"

// Runs on the caller's thread; one reader per call, nothing shared between calls.
class JsonReader
{
public:
    // Containers nested deeper than this make the whole text read as the scalar null, a
    // root every caller rejects. The read functions recurse once per level, so without a
    // bound a hostile file or server answer would overflow the stack.
    static constexpr unsigned long c_cMaxDepth = 256;

    // szText ends with a zero byte (a null pointer reads like empty text). The result is
    // never null and belongs to the caller. ppszEnd, when given, receives where reading
    // stopped (null for a null text).
    static JsonValue *FromJsonString(const char *szText, const char **ppszEnd = nullptr);

private:
    JsonReader() = default;
    ~JsonReader();
    JsonReader(const JsonReader &) = delete;
    JsonReader &operator=(const JsonReader &) = delete;

    // Each read function starts at the cursor and leaves it after what it consumed; none
    // moves past the terminating zero.
    JsonValue *ReadValue(const char *&pszCursor);
    JsonValue *ReadObject(const char *&pszCursor);
    JsonValue *ReadArray(const char *&pszCursor);
    static JsonValue *ReadScalar(const char *&pszCursor);
    // Called on a '[' or '{': steps past it and the white space after it, or returns
    // false, with the cursor moved to the terminator so every open container ends, when
    // one more level would pass c_cMaxDepth.
    bool EnterContainer(const char *&pszCursor);

    unsigned long m_cDepth = 0;
    bool m_fTooDeep = false;
    // Members and elements of the containers being read, innermost last. They move into
    // their node once the container ends, so each node allocates its vector once.
    std::vector<JsonMember> m_rgMemberStack;
    std::vector<JsonValue *> m_rgElementStack;
};
