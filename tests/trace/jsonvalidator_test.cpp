// The strict validator: each case beside RapidJSON's verdict on the same bytes, so the two
// independent readings of the grammar and of UTF-8 must agree; depth without recursion.
#include "lib/jsonvalidator.h"

#include <gtest/gtest.h>
#include <rapidjson/document.h>

#include <string>

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
    struct Row
    {
        std::string strText;
        bool fValid;
    };
    const Row rgRows[] = {
        // Every kind of value as the root, with white space around.
        {"{}", true},
        {"[]", true},
        {" \t\r\n{ } \n", true},
        {"\"\"", true},
        {"0", true},
        {"-0", true},
        {"-12.5e+3", true},
        {"1E-7", true},
        {"true", true},
        {"false", true},
        {"null", true},
        {"{\"a\":[1,{\"b\":null}],\"c\":\"d\"}", true},
        {"[1, 2 ,3]", true},
        {"\"\\\" \\\\ \\/ \\b \\f \\n \\r \\t \\u0041 \\u00e9 \\uD83D\\uDE00\"", true},
        {"\"\xC2\x80 \xDF\xBF \xE0\xA0\x80 \xED\x9F\xBF \xEE\x80\x80 \xF0\x90\x80\x80 "
         "\xF4\x8F\xBF\xBF\"",
         true},
        // Grammar.
        {"", false},
        {" ", false},
        {"{", false},
        {"[1,]", false},
        {"{\"a\":1,}", false},
        {"{\"a\" 1}", false},
        {"{a:1}", false},
        {"{\"a\":1 \"b\":2}", false},
        {"[1 2]", false},
        {"[1}", false},
        {"{\"a\":1]", false},
        {"{}}", false},
        {"1 2", false},
        {"{} x", false},
        {"01", false},
        {"-", false},
        {"1.", false},
        {".5", false},
        {"1e", false},
        {"+1", false},
        {"tru", false},
        {"nulll", false},
        {"True", false},
        {"'a'", false},
        {"\"a", false},
        {"\"\\x\"", false},
        {"\"\\u12\"", false},
        {"\"\\u12G4\"", false},
        {"\"a\tb\"", false},
        {"\"a\nb\"", false},
        {"\f1", false},
        // UTF-8: truncated, stray continuation, overlong, surrogates, past U+10FFFF.
        {"\"\xC3\"", false},
        {"\"\x80\"", false},
        {"\"\xC0\xAF\"", false},
        {"\"\xC1\xBF\"", false},
        {"\"\xE0\x80\xAF\"", false},
        {"\"\xED\xA0\x80\"", false},
        {"\"\xF0\x80\x80\xAF\"", false},
        {"\"\xF4\x90\x80\x80\"", false},
        {"\"\xF5\x80\x80\x80\"", false},
        {"\"\xFF\"", false},
        {"\xEF\xBB\xBF{}", false},
        {"\xBB"
         "2",
         false},
        // UTF-16 escapes: a high surrogate needs its low one.
        {"\"\\uD800\"", false},
        {"\"\\uD800\\u0041\"", false},
        {"\"\\uDBFF\\uDFFF\"", true},
    };
    for (const Row &row : rgRows)
    {
        SCOPED_TRACE(testing::PrintToString(row.strText));
        EXPECT_EQ(row.fValid, JsonValidateText(row.strText));
        EXPECT_EQ(row.fValid, RapidJsonAccepts(row.strText));
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
