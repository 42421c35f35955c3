// The strict validator: each case beside RapidJSON's verdict on the same bytes, so the two
// independent readings of the grammar and of UTF-8 must agree; depth without recursion.
#include "lib/jsonvalidator.h"

#include <gtest/gtest.h>
#include <rapidjson/document.h>

#include <string>
#include <vector>

namespace
{
bool RapidJsonAccepts(const std::string &str)
{
    rapidjson::Document document;
    // Terminated text (the length-counted reading skips stray bytes of a byte-order mark),
    // padded: a UTF-8 sequence cut off by the terminator makes RapidJSON read past it.
    document.Parse<rapidjson::kParseValidateEncodingFlag | rapidjson::kParseIterativeFlag>(
        (str + std::string(4, '\0')).c_str());
    return !document.HasParseError();
}
} // namespace

TEST(JsonValidator, AgreesWithAStrictParser)
{
    const std::vector<std::string> rgstrValid = {
        // Every kind of value as the root, with white space around.
        "{}", "[]", " \t\r\n{ } \n", "\"\"", "0", "-0", "-12.5e+3", "1E-7", "true", "false", "null",
        "{\"a\":[1,{\"b\":null}],\"c\":\"d\"}", "[1, 2 ,3]",
        "\"\\\" \\\\ \\/ \\b \\f \\n \\r \\t \\u0041 \\u00e9 \\uD83D\\uDE00\"",
        "\"\xC2\x80 \xDF\xBF \xE0\xA0\x80 \xED\x9F\xBF \xEE\x80\x80 \xF0\x90\x80\x80 "
        "\xF4\x8F\xBF\xBF\"",
        // UTF-16 escapes: a high surrogate with its low one.
        "\"\\uDBFF\\uDFFF\""};
    const std::vector<std::string> rgstrInvalid = {
        // Grammar.
        "", " ", "{", "[1,]", "{\"a\":1,}", "{\"a\" 1}", "{a:1}", "{\"a\":1 \"b\":2}", "[1 2]",
        "[1}", "{\"a\":1]", "{}}", "1 2", "{} x", "01", "-", "1.", ".5", "1e", "+1", "tru", "nulll",
        "True", "'a'", "\"a", "\"\\x\"", "\"\\u12\"", "\"\\u12G4\"", "\"a\tb\"", "\"a\nb\"", "\f1",
        // UTF-8: truncated, stray continuation, overlong, surrogates, past U+10FFFF.
        "\"\xC3\"", "\"\x80\"", "\"\xC0\xAF\"", "\"\xC1\xBF\"", "\"\xE0\x80\xAF\"",
        "\"\xED\xA0\x80\"", "\"\xF0\x80\x80\xAF\"", "\"\xF4\x90\x80\x80\"", "\"\xF5\x80\x80\x80\"",
        "\"\xFF\"", "\xEF\xBB\xBF{}", "\xBB\x32",
        // UTF-16 escapes: a high surrogate needs its low one.
        "\"\\uD800\"", "\"\\uD800\\u0041\""};
    for (bool fValid : {true, false})
    {
        for (const std::string &strText : fValid ? rgstrValid : rgstrInvalid)
        {
            SCOPED_TRACE(testing::PrintToString(strText));
            EXPECT_EQ(fValid, JsonValidateText(strText));
            EXPECT_EQ(fValid, RapidJsonAccepts(strText));
        }
    }
    // A lone low surrogate escape: RapidJSON lets it through and encodes a surrogate into
    // its UTF-8; we refuse it, since that text is not valid Unicode.
    EXPECT_FALSE(JsonValidateText("\"\\uDC00\""));
    EXPECT_FALSE(JsonValidateText("\"\\u0041\\uDC00\""));
    // A zero byte ends RapidJSON's terminated text; no JSON text holds one.
    EXPECT_FALSE(JsonValidateText(std::string("\"a\0b\"", 5)));
    EXPECT_FALSE(JsonValidateText(std::string("{}\0", 3)));
    EXPECT_FALSE(JsonValidateText(std::string("{}\0 ", 4)));
}

TEST(JsonValidator, NestingDepthCostsNoStack)
{
    const size_t cDepth = 1000000;
    std::string str(cDepth, '[');
    EXPECT_FALSE(JsonValidateText(str));
    str.append(cDepth, ']');
    EXPECT_TRUE(JsonValidateText(str));
    str.back() = '}';
    EXPECT_FALSE(JsonValidateText(str));
    std::string strObjects;
    for (size_t i = 0; i < cDepth / 10; i++)
    {
        strObjects += "{\"a\":";
    }
    strObjects += "0";
    strObjects.append(cDepth / 10, '}');
    EXPECT_TRUE(JsonValidateText(strObjects));
}

TEST(JsonValidator, RefusesContainersNestedPastTheBound)
{
    struct Row
    {
        std::string strText;
        size_t cMaxDepth;
        bool fValid;
    };
    const Row rgRows[] = {
        {"1", 0, true},
        {"\"[[{\"", 0, true},
        {"[]", 0, false},
        {"{}", 1, true},
        {"[[1]]", 1, false},
        {"[[1]]", 2, true},
        {"[[],[],{\"a\":[]}]", 3, true},
        {"[[],[],{\"a\":[]}]", 2, false},
        {"{\"a\":{\"b\":[{}]}}", 4, true},
        {"{\"a\":{\"b\":[{}]}}", 3, false},
        {std::string(253, '[') + std::string(253, ']'), 253, true},
        {std::string(254, '[') + std::string(254, ']'), 253, false},
    };
    for (const Row &row : rgRows)
    {
        SCOPED_TRACE(row.strText.substr(0, 40) + " within " + std::to_string(row.cMaxDepth));
        EXPECT_EQ(row.fValid, JsonValidateText(row.strText, row.cMaxDepth));
        // Without a bound, each of them is JSON.
        EXPECT_TRUE(JsonValidateText(row.strText));
    }
}
