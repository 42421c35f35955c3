// Reading text into trees: the lenient rules, the choices where they leave a gap, and the
// bound on nesting.
#include "lib/jsonreader.h"

#include <gtest/gtest.h>

#include <cstring>
#include <memory>
#include <string>

namespace
{
std::unique_ptr<JsonValue> Read(const std::string &strText, const char **ppszEnd = nullptr)
{
    return std::unique_ptr<JsonValue>(JsonReader::FromJsonString(strText.c_str(), ppszEnd));
}

std::string Text(const JsonValue &value)
{
    std::string str;
    return value.ToString(str);
}

const JsonObjectNode &AsObject(const std::unique_ptr<JsonValue> &value)
{
    EXPECT_EQ(JsonNodeType::Object, value->Type());
    return static_cast<const JsonObjectNode &>(*value);
}

const JsonArrayNode &AsArray(const std::unique_ptr<JsonValue> &value)
{
    EXPECT_EQ(JsonNodeType::Array, value->Type());
    return static_cast<const JsonArrayNode &>(*value);
}

// The member's text, or "<absent>".
std::string MemberText(const JsonObjectNode &object, const char *szName)
{
    std::string strText;
    return object.GetMemberText(szName, strText) ? strText : "<absent>";
}

// The raw text of a scalar element.
std::string ScalarText(const JsonValue *pValue)
{
    EXPECT_EQ(JsonNodeType::Scalar, pValue->Type());
    return static_cast<const JsonRawText *>(pValue)->Text();
}

std::string Repeat(const std::string &str, size_t c)
{
    std::string strOut;
    strOut.reserve(str.size() * c);
    for (size_t i = 0; i < c; i++)
    {
        strOut += str;
    }
    return strOut;
}
} // namespace

TEST(JsonReader, KeepsScalarsRawAndLeavesCheckingToCallers)
{
    std::unique_ptr<JsonValue> spaced = Read(" \t\r\n{\"x\" : \"v\" , \"n\":5}");
    const JsonObjectNode &object = AsObject(spaced);
    ASSERT_EQ(2u, object.Members().size());
    EXPECT_EQ("v", MemberText(object, "x"));
    EXPECT_EQ("5", MemberText(object, "n"));
    uint32_t ulNumber = 0;
    EXPECT_TRUE(object.GetMemberNumber("n", ulNumber));
    EXPECT_EQ(5u, ulNumber);

    // Escapes are never decoded; an escaped quote does not end the string.
    EXPECT_EQ("a\\\"b", MemberText(AsObject(Read("{\"s\":\"a\\\"b\"}")), "s"));
    EXPECT_EQ("C:\\\\", MemberText(AsObject(Read("{\"s\":\"C:\\\\\"}")), "s"));
    EXPECT_EQ("a,b}", MemberText(AsObject(Read("{\"s\":\"a,b}\"}")), "s"));
    // An empty string reads as the text null.
    EXPECT_EQ("null", MemberText(AsObject(Read("{\"s\":\"\"}")), "s"));
    EXPECT_EQ("null", MemberText(AsObject(Read("{\"s\":}")), "s"));

    std::unique_ptr<JsonValue> gaps = Read("[1,,2]");
    const JsonArrayNode &array = AsArray(gaps);
    ASSERT_EQ(3u, array.Elements().size());
    EXPECT_EQ("1", ScalarText(array.Elements()[0]));
    EXPECT_EQ("null", ScalarText(array.Elements()[1]));
    EXPECT_EQ("2", ScalarText(array.Elements()[2]));

    // An unterminated object keeps what it has and stops on the terminator.
    std::string strOpen = "{\"a\":1";
    const char *pszEnd = nullptr;
    std::unique_ptr<JsonValue> open = Read(strOpen, &pszEnd);
    EXPECT_EQ("1", MemberText(AsObject(open), "a"));
    EXPECT_EQ('\0', *pszEnd);
    EXPECT_EQ(strOpen.size(), static_cast<size_t>(pszEnd - strOpen.c_str()));

    // No grammar check: a missing comma goes unnoticed, stray text joins the scalar.
    std::unique_ptr<JsonValue> loose = Read("{\"a\":[] \"b\":2, \"c\":tru e ,\"d\":x]}");
    EXPECT_EQ("[]", MemberText(AsObject(loose), "a"));
    EXPECT_EQ("2", MemberText(AsObject(loose), "b"));
    EXPECT_EQ("tru e", MemberText(AsObject(loose), "c"));
    EXPECT_EQ("x", MemberText(AsObject(loose), "d"));
    EXPECT_EQ("1 \"b\":2", MemberText(AsObject(Read("{\"a\":1 \"b\":2}")), "a"));

    // Scalar roots come back like any other root; the callers reject them.
    std::unique_ptr<JsonValue> number = Read("  42  ");
    EXPECT_EQ("42", ScalarText(number.get()));
    EXPECT_EQ("null", ScalarText(Read("").get()));
    EXPECT_EQ("null", ScalarText(Read("\"\"").get()));
    EXPECT_EQ("null",
              ScalarText(std::unique_ptr<JsonValue>(JsonReader::FromJsonString(nullptr)).get()));
    // Form feed is not white space: the text is one scalar up to the brace.
    EXPECT_EQ("\f{", ScalarText(Read("\f{}").get()));
}

TEST(JsonReader, ChoicesWhereTheRulesLeaveAGap)
{
    // A '}' where an element should start closes the array as ']' would.
    EXPECT_EQ("[1]", Text(*Read("[1}")));
    // A string read back is written with its quotes and its escapes as they came.
    EXPECT_EQ("{\"a\":[1],\"b\":\"v\\/\"}", Text(*Read("{\"a\":[1},\"b\":\"v\\/\"}")));
    EXPECT_EQ("[[]]", Text(*Read("[[}]")));
    // A comma and white space before the close add no element.
    EXPECT_EQ("[1]", Text(*Read("[1, ]")));

    // A name part shorter than two bytes gives an empty name; two bytes are both dropped.
    EXPECT_EQ("{\"\":1}", Text(*Read("{a:1}")));
    EXPECT_EQ("{\"\":1}", Text(*Read("{:1}")));
    EXPECT_EQ("{\"\":1}", Text(*Read("{ab:1}")));
    EXPECT_EQ("{\"\":1}", Text(*Read("{\"\":1}")));
    EXPECT_EQ("{\"b\":1}", Text(*Read("{abc :1}")));
    EXPECT_EQ("{\"a:b\":1}", Text(*Read("{\"a:b\":1}"))); // a colon in quotes is no end

    // Once no member can follow, reading ends at the terminator.
    const char *pszEnd = nullptr;
    std::string strText = "[{\"x\"},2,[3]]";
    EXPECT_EQ("[{}]", Text(*Read(strText, &pszEnd)));
    EXPECT_EQ(strText.c_str() + strText.size(), pszEnd);
    // Many unfinished objects: one pass, not one rescan of the rest per object.
    std::string strHostile = "[" + Repeat("{,", 500000);
    EXPECT_EQ("[{}]", Text(*Read(strHostile)));
}

TEST(JsonReader, MemberNumberReadsLikeAStreamWithDefinedFailures)
{
    JsonObjectNode object;
    object.Append("list", new JsonRawText("[5]"));
    object.AddString("quoted", "12"); // a string built in code keeps its quotes in its text
    struct Case
    {
        const char *szName; // also the member's raw text, unless added above
        bool fRead;
        uint32_t ulValue;
    };
    const Case rgCases[] = {
        {" \t\v\f\n\r42abc", true, 42},
        {"+7", true, 7},
        {"-1", true, 0xFFFFFFFF}, // a stream wraps a negative value into the unsigned type
        {"4294967295", true, 0xFFFFFFFF},
        {"4294967296", false, 0xFFFFFFFF},
        {"99999999999999999999999", false, 0xFFFFFFFF},
        {"abc", false, 0},
        {"null", false, 0},
        {"- 5", false, 0},
        {"", false, 0},
        {"0x10", true, 0},
        {"list", false, 0},
        {"quoted", false, 0},
        {"missing", false, 12345}, // never added: untouched
    };
    for (const Case &c : rgCases)
    {
        if (object.FindMember(c.szName) == nullptr && strcmp(c.szName, "missing") != 0)
        {
            object.Append(c.szName, new JsonRawText(c.szName));
        }
        uint32_t ulValue = 12345;
        EXPECT_EQ(c.fRead, object.GetMemberNumber(c.szName, ulValue)) << c.szName;
        EXPECT_EQ(c.ulValue, ulValue) << c.szName;
    }

    // Read from a document, a quoted number is its bare digits.
    std::unique_ptr<JsonValue> root = Read("{\"port\":\"443\",\"n\": 17 }");
    uint32_t ulPort = 0;
    uint32_t ulN = 0;
    EXPECT_TRUE(AsObject(root).GetMemberNumber("port", ulPort));
    EXPECT_TRUE(AsObject(root).GetMemberNumber("n", ulN));
    EXPECT_EQ(443u, ulPort);
    EXPECT_EQ(17u, ulN);
}

TEST(JsonReader, NestingDeeperThanTheBoundReadsAsNull)
{
    const size_t cMax = JsonReader::c_cMaxDepth;
    EXPECT_EQ(256u, cMax);

    // At the bound everything reads; one level more and the whole text is the scalar
    // null, which every caller rejects as a root.
    std::string strArrays = Repeat("[", cMax) + Repeat("]", cMax);
    EXPECT_EQ(strArrays, Text(*Read(strArrays)));
    std::string strObjects = Repeat("{\"a\":", cMax - 1) + "{}" + Repeat("}", cMax - 1);
    EXPECT_EQ(strObjects, Text(*Read(strObjects)));

    const std::string rgstrTooDeep[] = {
        Repeat("[", cMax + 1) + Repeat("]", cMax + 1),
        Repeat("{\"a\":", cMax) + "{}" + Repeat("}", cMax),
        "{\"ok\":1,\"deep\":" + Repeat("[", cMax) + "]",
        Repeat("[", 1000000),
        Repeat("{\"\":", 300000),
    };
    for (const std::string &str : rgstrTooDeep)
    {
        const char *pszEnd = nullptr;
        std::unique_ptr<JsonValue> root = Read(str, &pszEnd);
        ASSERT_EQ(JsonNodeType::Scalar, root->Type()) << str.substr(0, 40);
        EXPECT_EQ("null", ScalarText(root.get()));
        EXPECT_FALSE(static_cast<const JsonRawText *>(root.get())->IsQuoted());
        EXPECT_EQ(str.c_str() + str.size(), pszEnd);
    }

    // The bound counts open containers, not how many there were.
    std::string strSiblings = "[" + Repeat(Repeat("[", cMax - 1) + Repeat("]", cMax - 1) + ",", 3);
    strSiblings.back() = ']';
    EXPECT_EQ(strSiblings, Text(*Read(strSiblings)));
}
