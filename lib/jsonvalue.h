// The in-memory JSON tree: one abstract node class with an object, an array and the scalar
// classes, and its compact text form (ToString). Platform-free (no Windows headers) so the
// tree, its writer and its reader also build natively for fuzzing.
#pragma once

#include <cstdint>
#include <string>
#include <string_view>
#include <vector>

enum class JsonNodeType : uint32_t
{
    Scalar = 0,
    Object = 1,
    Array = 2,
};

// Base of every node. A tree is built and read by one thread at a time (its owner's
// serialized queue); whoever holds the root deletes it, and with it the whole tree.
class JsonValue
{
public:
    JsonValue(const JsonValue &) = delete;
    JsonValue &operator=(const JsonValue &) = delete;

    // Deleting a node deletes everything it owns. Containers free their subtree without
    // recursion, so a tree of any depth can be deleted on a small thread stack.
    virtual ~JsonValue() = default;

    // Replaces strOut with this node's compact JSON text and returns it. Containers walk
    // their subtree without recursion, so a tree of any depth can be written.
    virtual std::string &ToString(std::string &strOut) const;

    JsonNodeType Type() const { return m_type; }

protected:
    explicit JsonValue(JsonNodeType type)
        : m_type(type)
    {
    }

private:
    const JsonNodeType m_type;
};

// Common base of the scalar classes: each writes its own text, and the writer of a
// container appends it in place instead of building a string per scalar.
class JsonScalar : public JsonValue
{
public:
    // Appends the text this scalar has inside a document.
    virtual void AppendJson(std::string &strOut) const = 0;

    // Appends the text a member lookup hands out (GetMemberText, GetMemberNumber). The
    // same as the document text, except for a string read from a document: its bare text.
    virtual void AppendMemberText(std::string &strOut) const { AppendJson(strOut); }

protected:
    JsonScalar()
        : JsonValue(JsonNodeType::Scalar)
    {
    }
};

struct JsonMember
{
    std::string strName;
    JsonValue *pValue; // owned
};

// Members in insertion order; names may repeat. Owned by its parent node or by whoever
// holds the root, and used on that owner's thread.
class JsonObjectNode : public JsonValue
{
public:
    JsonObjectNode()
        : JsonValue(JsonNodeType::Object)
    {
    }
    ~JsonObjectNode() override;

    void AddBool(std::string strName, bool fValue);
    // The value is moved in: a caller that hands over its string with std::move finds it
    // empty afterwards, one that passes a named string keeps it.
    void AddString(std::string strName, std::string strValue);
    // null for a null pointer, otherwise a quoted string (an empty text gives "").
    void AddStringOrNull(std::string strName, const char *szValue);
    void AddDword(std::string strName, uint32_t ulValue);
    void AddUlonglong(std::string strName, uint64_t ullValue);
    void AddInt64(std::string strName, int64_t llValue);
    void AddFloat(std::string strName, float flValue);
    void AddDouble(std::string strName, double dblValue);
    // Appends the member unchanged and takes ownership of the value, also when appending
    // throws. Every operation above ends here.
    void Append(std::string strName, JsonValue *pValue);
    void Reserve(size_t cMembers) { m_members.reserve(cMembers); }

    // The value of the first member with exactly this name (byte for byte), or null.
    JsonValue *FindMember(std::string_view strName) const;
    // False when there is no such member; else the member's text: a string's bare text,
    // another scalar's JSON text, a container's whole JSON text.
    bool GetMemberText(std::string_view strName, std::string &strText) const;
    // Reads the member's text (as GetMemberText) like a stream extraction of a 32-bit
    // unsigned long: leading white space skipped, an optional sign, decimal digits up to
    // the first other byte, a negative value wrapping around. Returns false and leaves
    // ulValue alone when there is no such member. When the text holds no number, or one
    // that does not fit, stores 0 or 0xFFFFFFFF and returns false: the caller gets a
    // defined value and learns that the member was not a number.
    bool GetMemberNumber(std::string_view strName, uint32_t &ulValue) const;

    const std::vector<JsonMember> &Members() const { return m_members; }

private:
    friend class JsonTreeDestroyer;
    std::vector<JsonMember> m_members;
    JsonValue *m_pNextToDestroy = nullptr; // list link while a tree is being deleted
};

// Elements in insertion order; owned and used like JsonObjectNode.
class JsonArrayNode : public JsonValue
{
public:
    JsonArrayNode()
        : JsonValue(JsonNodeType::Array)
    {
    }
    ~JsonArrayNode() override;

    // Appends the element and takes ownership of it, also when appending throws.
    void Append(JsonValue *pValue);
    void Reserve(size_t cElements) { m_elements.reserve(cElements); }

    const std::vector<JsonValue *> &Elements() const { return m_elements; }

private:
    friend class JsonTreeDestroyer;
    std::vector<JsonValue *> m_elements;
    JsonValue *m_pNextToDestroy = nullptr; // list link while a tree is being deleted
};

// The scalar classes below own nothing but their payload and live inside one tree.

// A string written quoted, with the escapes of JsonAppendEscaped.
class JsonQuotedString : public JsonScalar
{
public:
    explicit JsonQuotedString(std::string strValue)
        : m_strValue(std::move(strValue))
    {
    }
    void AppendJson(std::string &strOut) const override;
    const std::string &Value() const { return m_strValue; }

private:
    std::string m_strValue;
};

// Text inserted into a document unchanged: JSON handed in by a client (AddRawJson,
// AddObject) and every scalar the reader finds. A string the reader found keeps its
// escapes but loses its quotes (fQuoted): member lookups hand out that bare text, and
// the writer puts the quotes back so that a tree read from a document writes as JSON.
class JsonRawText : public JsonScalar
{
public:
    explicit JsonRawText(std::string strText, bool fQuoted = false)
        : m_strText(std::move(strText))
        , m_fQuoted(fQuoted)
    {
    }
    void AppendJson(std::string &strOut) const override;
    void AppendMemberText(std::string &strOut) const override;
    const std::string &Text() const { return m_strText; }
    bool IsQuoted() const { return m_fQuoted; }

private:
    std::string m_strText;
    bool m_fQuoted;
};

class JsonNull : public JsonScalar
{
public:
    void AppendJson(std::string &strOut) const override;
};

class JsonBool : public JsonScalar
{
public:
    explicit JsonBool(bool fValue)
        : m_fValue(fValue)
    {
    }
    void AppendJson(std::string &strOut) const override;

private:
    bool m_fValue;
};

class JsonUInt32 : public JsonScalar
{
public:
    explicit JsonUInt32(uint32_t ulValue)
        : m_ulValue(ulValue)
    {
    }
    void AppendJson(std::string &strOut) const override;

private:
    uint32_t m_ulValue;
};

class JsonInt64 : public JsonScalar
{
public:
    explicit JsonInt64(int64_t llValue)
        : m_llValue(llValue)
    {
    }
    void AppendJson(std::string &strOut) const override;

private:
    int64_t m_llValue;
};

class JsonUInt64 : public JsonScalar
{
public:
    explicit JsonUInt64(uint64_t ullValue)
        : m_ullValue(ullValue)
    {
    }
    void AppendJson(std::string &strOut) const override;

private:
    uint64_t m_ullValue;
};

// Written widened to double, so 0.1f shows its float error (0.10000000149).
class JsonFloat : public JsonScalar
{
public:
    explicit JsonFloat(float flValue)
        : m_flValue(flValue)
    {
    }
    void AppendJson(std::string &strOut) const override;

private:
    float m_flValue;
};

class JsonDouble : public JsonScalar
{
public:
    explicit JsonDouble(double dblValue)
        : m_dblValue(dblValue)
    {
    }
    void AppendJson(std::string &strOut) const override;

private:
    double m_dblValue;
};

// Appends the bytes of szText up to its first zero byte, escaped for a quoted string.
void JsonAppendEscaped(std::string &strOut, std::string_view strText);
// Appends a number as %.12g writes it (12 significant digits, exponent form below 1e-4
// and from 1e12). NaN and infinities have no JSON form and are written as null.
void JsonAppendDouble(std::string &strOut, double dblValue);
