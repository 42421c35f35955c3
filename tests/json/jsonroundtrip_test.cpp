// Property: random trees written, read back and written again give the same text, also
// when the text read carries white space wherever JSON allows it.
#include "lib/jsonreader.h"

#include <gtest/gtest.h>

#include <cstring>
#include <memory>
#include <random>
#include <string>

namespace
{
// Makes trees and their spaced text from one seed; each test iteration owns one.
class RandomTrees
{
public:
    explicit RandomTrees(uint32_t ulSeed)
        : m_rng(ulSeed)
    {
    }

    uint32_t Below(uint32_t ulLimit) { return static_cast<uint32_t>(m_rng() % ulLimit); }

    JsonValue *Container(unsigned int cDepth)
    {
        if (Below(2) == 0)
        {
            std::unique_ptr<JsonObjectNode> object(new JsonObjectNode());
            for (uint32_t i = Below(cDepth == 0 ? 1 : 8); i > 0; i--)
            {
                object->Append(Name(), Value(cDepth));
            }
            return object.release();
        }
        std::unique_ptr<JsonArrayNode> array(new JsonArrayNode());
        for (uint32_t i = Below(cDepth == 0 ? 1 : 8); i > 0; i--)
        {
            array->Append(Value(cDepth));
        }
        return array.release();
    }

    // A name the writer can put between quotes unescaped and the reader can find again:
    // any bytes but the terminator, '"' and backslash.
    std::string Name()
    {
        std::string str;
        for (uint32_t i = Below(6); i > 0; i--)
        {
            char ch = static_cast<char>(1 + Below(255));
            str += ch == '"' || ch == '\\' ? ':' : ch;
        }
        return str;
    }

    JsonValue *Value(unsigned int cDepth)
    {
        switch (Below(cDepth == 0 ? 9 : 11))
        {
        case 0: {
            // Any bytes but the terminator; never empty, which reads back as null.
            std::string str;
            for (uint32_t i = 1 + Below(8); i > 0; i--)
            {
                str += static_cast<char>(1 + Below(255));
            }
            return new JsonQuotedString(str);
        }
        case 1:
            return new JsonNull();
        case 2:
            return new JsonBool(Below(2) == 1);
        case 3:
            return new JsonUInt32(static_cast<uint32_t>(m_rng()));
        case 4:
            return new JsonInt64(static_cast<int64_t>(Bits64()));
        case 5:
            return new JsonUInt64(Bits64());
        case 6: {
            float fl = 0;
            uint32_t ul = static_cast<uint32_t>(m_rng());
            std::memcpy(&fl, &ul, sizeof(fl));
            return new JsonFloat(fl);
        }
        case 7: {
            double dbl = 0;
            uint64_t ull = Bits64();
            std::memcpy(&dbl, &ull, sizeof(dbl));
            return new JsonDouble(dbl);
        }
        case 8: {
            // Raw JSON as a client hands it in: another tree's compact text.
            std::unique_ptr<JsonValue> inner(Container(cDepth == 0 ? 0 : cDepth - 1));
            std::string str;
            return new JsonRawText(inner->ToString(str));
        }
        default:
            return Container(cDepth - 1);
        }
    }

    // The same text as the writer's, with random white space between the tokens.
    void AppendSpaced(std::string &strOut, const JsonValue &value)
    {
        Space(strOut);
        if (value.Type() == JsonNodeType::Object)
        {
            const JsonObjectNode &object = static_cast<const JsonObjectNode &>(value);
            strOut += '{';
            for (size_t i = 0; i < object.Members().size(); i++)
            {
                Space(strOut);
                if (i > 0)
                {
                    strOut += ',';
                    Space(strOut);
                }
                strOut += '"' + object.Members()[i].strName + '"';
                Space(strOut);
                strOut += ':';
                AppendSpaced(strOut, *object.Members()[i].pValue);
            }
            Space(strOut);
            strOut += '}';
        }
        else if (value.Type() == JsonNodeType::Array)
        {
            const JsonArrayNode &array = static_cast<const JsonArrayNode &>(value);
            strOut += '[';
            for (size_t i = 0; i < array.Elements().size(); i++)
            {
                if (i > 0)
                {
                    strOut += ',';
                }
                AppendSpaced(strOut, *array.Elements()[i]);
            }
            Space(strOut);
            strOut += ']';
        }
        else
        {
            static_cast<const JsonScalar &>(value).AppendJson(strOut);
        }
        Space(strOut);
    }

private:
    uint64_t Bits64() { return (static_cast<uint64_t>(m_rng()) << 32) | m_rng(); }

    void Space(std::string &strOut)
    {
        static const char c_rgchSpace[] = {' ', '\t', '\n', '\r'};
        for (uint32_t i = Below(4) == 0 ? Below(3) : 0; i > 0; i--)
        {
            strOut += c_rgchSpace[Below(4)];
        }
    }

    std::mt19937 m_rng;
};

std::string Text(const JsonValue &value)
{
    std::string str;
    return value.ToString(str);
}
} // namespace

TEST(JsonRoundTrip, RandomTreesReadBackToTheSameText)
{
    size_t cbChecked = 0;
    for (uint32_t ulSeed = 1; ulSeed <= 500; ulSeed++)
    {
        RandomTrees trees(ulSeed);
        std::unique_ptr<JsonValue> tree(trees.Container(5));
        std::string strText = Text(*tree);

        std::unique_ptr<JsonValue> reread(JsonReader::FromJsonString(strText.c_str()));
        ASSERT_EQ(strText, Text(*reread)) << "seed " << ulSeed;

        std::string strSpaced;
        trees.AppendSpaced(strSpaced, *tree);
        std::unique_ptr<JsonValue> respaced(JsonReader::FromJsonString(strSpaced.c_str()));
        ASSERT_EQ(strText, Text(*respaced)) << "seed " << ulSeed << "\n" << strSpaced;
        cbChecked += strText.size();
    }
    // The trees are not trivially small.
    EXPECT_GT(cbChecked, 100000u);
}
