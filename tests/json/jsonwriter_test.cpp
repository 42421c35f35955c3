// The tree's operations and its compact text form, on the test's main thread.
#include "lib/jsonvalue.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <cstdio>
#include <cstring>
#include <limits>
#include <memory>
#include <string>

namespace
{
std::string Text(const JsonValue &value)
{
    std::string str = "left over";
    return value.ToString(str);
}

std::string QuotedText(const std::string &strPayload)
{
    return Text(JsonQuotedString(strPayload));
}

std::string DoubleText(double dbl)
{
    return Text(JsonDouble(dbl));
}
} // namespace

TEST(JsonWriter, SampleTreeMemberOrderAndDuplicates)
{
    JsonObjectNode root;
    std::unique_ptr<JsonArrayNode> array(new JsonArrayNode());
    array->Append(new JsonUInt32(1));
    array->Append(new JsonQuotedString("x"));
    root.Append("a", array.release());
    root.AddBool("b", true);
    EXPECT_EQ("{\"a\":[1,\"x\"],\"b\":true}", Text(root));

    EXPECT_EQ("{}", Text(JsonObjectNode()));
    EXPECT_EQ("[]", Text(JsonArrayNode()));

    // Duplicates stay, in order; lookups find the first.
    JsonObjectNode dup;
    dup.AddDword("n", 1);
    dup.AddDword("n", 2);
    dup.AddBool("N", false);
    EXPECT_EQ("{\"n\":1,\"n\":2,\"N\":false}", Text(dup));
    std::string strText;
    ASSERT_TRUE(dup.GetMemberText("n", strText));
    EXPECT_EQ("1", strText);
    EXPECT_EQ(dup.Members()[0].pValue, dup.FindMember("n"));
    EXPECT_EQ(dup.Members()[2].pValue, dup.FindMember("N")); // case-sensitive
    EXPECT_EQ(nullptr, dup.FindMember("n "));
    EXPECT_FALSE(dup.GetMemberText("missing", strText));
    EXPECT_EQ("1", strText); // untouched

    // Null versus empty text, and every other scalar kind the builders make.
    JsonObjectNode kinds;
    kinds.AddStringOrNull("p", nullptr);
    kinds.AddStringOrNull("e", "");
    kinds.AddStringOrNull("s", "v");
    kinds.AddInt64("i", -5);
    kinds.AddUlonglong("u", 7);
    kinds.AddFloat("f", 0.5f);
    kinds.AddDouble("d", 2.5);
    kinds.AddBool("no", false);
    kinds.Append("raw", new JsonRawText("{\"k\":[1]}"));
    kinds.Append("gap", nullptr); // a missing value is written as null, never dereferenced
    EXPECT_EQ("{\"p\":null,\"e\":\"\",\"s\":\"v\",\"i\":-5,\"u\":7,\"f\":0.5,\"d\":2.5,"
              "\"no\":false,\"raw\":{\"k\":[1]},\"gap\":null}",
              Text(kinds));

    // Names are copied as they are, even when that breaks the text.
    JsonObjectNode names;
    names.AddDword("a\"b/", 1);
    EXPECT_EQ("{\"a\"b/\":1}", Text(names));
}

TEST(JsonWriter, EscapeTableByteForByte)
{
    // The payload ends at its first zero byte.
    EXPECT_EQ("\"ab\"", QuotedText(std::string("ab\0cd", 5)));
    EXPECT_EQ("\"\\u0001\\u00e9\\\"\"", QuotedText("\x01\xe9\"")); // escapes side by side

    // Short escapes for these, \u00xx for every other control or non-ASCII byte.
    const char c_szShort[] = "\"\\/\b\t\n\f\r";
    const char c_szLetters[] = "\"\\/btnfr";
    for (int b = 1; b < 256; b++)
    {
        const char *pchShort = strchr(c_szShort, b);
        char szExpected[8] = {static_cast<char>(b), '\0'};
        if (pchShort != nullptr)
        {
            snprintf(szExpected, sizeof(szExpected), "\\%c", c_szLetters[pchShort - c_szShort]);
        }
        else if (b < 0x20 || b >= 0x7F)
        {
            snprintf(szExpected, sizeof(szExpected), "\\u%.4x", b);
        }
        // Between plain bytes, so both the run copying and the escape are exercised.
        std::string strPayload = std::string("x") + static_cast<char>(b) + "y";
        EXPECT_EQ("\"x" + std::string(szExpected) + "y\"", QuotedText(strPayload)) << "byte " << b;
    }
}

TEST(JsonWriter, NumbersTwelveSignificantDigits)
{
    EXPECT_EQ("0.1", DoubleText(0.1));
    EXPECT_EQ("2.5", DoubleText(2.5));
    EXPECT_EQ("1.23456789012e+12", DoubleText(1234567890123.0));
    EXPECT_EQ("123456789012", DoubleText(123456789012.0)); // below 1e12: no exponent
    EXPECT_EQ("0.0001", DoubleText(0.0001));
    EXPECT_EQ("1e-05", DoubleText(0.00001));
    EXPECT_EQ("-3", DoubleText(-3.0));
    EXPECT_EQ("0", DoubleText(0.0));
    EXPECT_EQ("0.333333333333", DoubleText(1.0 / 3.0));
    EXPECT_EQ("1e+300", DoubleText(1e300));
    EXPECT_EQ("0.10000000149", Text(JsonFloat(0.1f)));
    EXPECT_EQ("1", Text(JsonFloat(1.0f)));
    // No JSON form: null, not "inf" or "nan" that no reader takes.
    EXPECT_EQ("null", DoubleText(std::numeric_limits<double>::infinity()));
    EXPECT_EQ("null", DoubleText(-std::numeric_limits<double>::infinity()));
    EXPECT_EQ("null", DoubleText(std::numeric_limits<double>::quiet_NaN()));
    EXPECT_EQ("null", Text(JsonFloat(std::numeric_limits<float>::infinity())));

    EXPECT_EQ("4294967295", Text(JsonUInt32(0xFFFFFFFF)));
    EXPECT_EQ("0", Text(JsonUInt32(0)));
    EXPECT_EQ("18446744073709551615", Text(JsonUInt64(0xFFFFFFFFFFFFFFFFull)));
    EXPECT_EQ("-9223372036854775808", Text(JsonInt64(std::numeric_limits<int64_t>::min())));
    EXPECT_EQ("9223372036854775807", Text(JsonInt64(std::numeric_limits<int64_t>::max())));
    EXPECT_EQ("true", Text(JsonBool(true)));
    EXPECT_EQ("null", Text(JsonNull()));
}

TEST(JsonWriter, DeepTreesWriteAndFreeWithoutRecursion)
{
    // Far deeper than a thread stack could take one frame per level.
    const size_t cDepth = 200000;
    JsonValue *pRoot = new JsonArrayNode();
    JsonValue *pInner = pRoot;
    for (size_t i = 1; i < cDepth; i++)
    {
        if (i % 2 == 0)
        {
            JsonArrayNode *pArray = new JsonArrayNode();
            static_cast<JsonObjectNode *>(pInner)->Append("o", pArray);
            pInner = pArray;
        }
        else
        {
            JsonObjectNode *pObject = new JsonObjectNode();
            static_cast<JsonArrayNode *>(pInner)->Append(new JsonUInt32(static_cast<uint32_t>(i)));
            static_cast<JsonArrayNode *>(pInner)->Append(pObject);
            pInner = pObject;
        }
    }
    std::string strText;
    pRoot->ToString(strText);
    EXPECT_EQ("[1,{\"o\":[3,{\"o\":[", strText.substr(0, 17));
    EXPECT_EQ(cDepth, static_cast<size_t>(std::count(strText.begin(), strText.end(), '[') +
                                          std::count(strText.begin(), strText.end(), '{')));
    // The deepest object is empty; every container closes at the end, innermost first.
    EXPECT_EQ(strText.size() - cDepth - 1, strText.find_last_not_of("]}"));
    EXPECT_EQ("{}]}]", strText.substr(strText.size() - cDepth - 1, 5));
    delete pRoot;
}
