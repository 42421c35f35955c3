// The strict validator on nesting far deeper than a stack could take one frame per level.
// Its verdicts on grammar, UTF-8 and the nesting bound are checked against RapidJSON by
// fuzz/fuzz_json_validator.cpp, and through the trace document by TraceDocumentTest.
#include "lib/jsonvalidator.h"

#include <gtest/gtest.h>

#include <string>

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
