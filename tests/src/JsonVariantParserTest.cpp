// The fast reader of the store's texts takes the common texts itself, to the tree QJsonDocument
// gives, and refuses what QJsonDocument refuses.
#include "JsonVariantParser.h"

#include <QJsonDocument>

#include <gtest/gtest.h>

#include <cstring>

TEST(JsonVariantParserTest, ReadsTheCommonTextsItself)
{
    for (const QByteArray text :
         {R"({"Thumbnail":[{"image":"QUJD+/=","feature":[0.25,-1,1e-3]}],"k":{"a":[]}})",
          R"(["a", "b\n\"\u00e9", {"x": [1, "y", null, true, false]}, [] ])",
          "[\"\xc3\xa9\xe6\x97\xa5\", \"12345678\xc3\xa9\", \"\", \"1234567\", \"12345678\"]",
          "[1, -0.5, 1.5e1, 2E-2, 123456789012345678, 1234567890123456789, 9007199254740993.0]",
          "[12345678901234567890123, 1e300, 0.1234567890123456789, -1.0000000000000000000001]"}) {
        bool ok = false;
        EXPECT_EQ(JsonVariantParser::parse(text.constData(), std::size_t(text.size()), &ok),
                  QJsonDocument::fromJson(text).toVariant())
            << text.constData();
        EXPECT_TRUE(ok) << text.constData();
    }
    for (const char* refused : {"[1.]", "[1e]", "[01]", "{\"a\":1", "[1,]", "[\"open"}) {
        bool ok = true;
        EXPECT_FALSE(JsonVariantParser::parse(refused, std::strlen(refused), &ok).isValid()) << refused;
        EXPECT_FALSE(ok) << refused;
    }
}
