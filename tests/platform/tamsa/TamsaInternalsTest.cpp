// The store's building blocks where a fault would only shift results slightly: the JSON reader and
// writer of numbers and texts, and the SIMD cosine kernel against the plain loop.
#include "TamsaCosine.h"
#include "TamsaJson.h"

#include <gtest/gtest.h>

#include <charconv>
#include <cmath>
#include <cstring>
#include <random>

namespace {

TEST(TamsaJson, FloatsWrittenReadBackExactly)
{
    std::mt19937 random(5);
    std::uniform_int_distribution<uint32_t> bits;
    char buffer[32];
    int checked = 0;
    for (int i = 0; i < 300000; ++i) {
        uint32_t word = bits(random);
        float value = 0;
        std::memcpy(&value, &word, sizeof value);
        if (!std::isfinite(value)) {
            continue;
        }
        const int length = tamsa::formatFloat(value, buffer);
        double parsed = 0;
        ASSERT_EQ(tamsa::parseNumber(buffer, buffer + length, &parsed), buffer + length)
            << std::string(buffer, length);
        ASSERT_EQ(float(parsed), value) << std::string(buffer, length);
        ++checked;
    }
    EXPECT_GT(checked, 250000);
}

TEST(TamsaJson, NumbersParseLikeTheStandardLibrary)
{
    for (const char* text : {"0", "-0", "1", "0.1", "123456789012345678901234", "1e22", "1e23", "-2.5E-3",
                             "0.000001234", "9007199254740993", "1.7976931348623157e308", "4.9e-324"}) {
        double fast = 0;
        double reference = 0;
        const char* end = text + std::strlen(text);
        ASSERT_EQ(tamsa::parseNumber(text, end, &fast), end) << text;
        std::from_chars(text, end, reference);
        EXPECT_EQ(fast, reference) << text;
    }
    double value = 0;
    const char* huge = "1e999";
    ASSERT_NE(tamsa::parseNumber(huge, huge + 5, &value), nullptr);
    EXPECT_TRUE(std::isinf(value));
    for (const char* bad : {"-", ".5", "1.", "1e", "+1", "x"}) {
        EXPECT_EQ(tamsa::parseNumber(bad, bad + std::strlen(bad), &value), nullptr) << bad;
    }
}

TEST(TamsaJson, ParsesAndWritesDocumentsAndRefusesBrokenOnes)
{
    tamsa::JsonValue value;
    ASSERT_TRUE(tamsa::JsonValue::parse(
        R"( {"a":[1,2.5,-3],"b":"x\"\u00e9\ud83d\ude00\ud800\udc00","c":[1,"t",null],"d":{}} )", &value));
    EXPECT_TRUE(value.member("a")->numberArray);
    EXPECT_FALSE(value.member("c")->numberArray);
    EXPECT_EQ(value.member("b")->text, "x\"\xC3\xA9\xF0\x9F\x98\x80\xF0\x90\x80\x80");
    EXPECT_EQ(value.serialize(), "{\"a\":[1,2.5,-3],\"b\":\"x\\\"\xC3\xA9\xF0\x9F\x98\x80\xF0\x90\x80\x80\","
                                 "\"c\":[1,\"t\",null],\"d\":{}}");
    tamsa::JsonValue id;
    ASSERT_TRUE(tamsa::JsonValue::parse("18446744073709551615", &id));
    EXPECT_EQ(id.serialize(), "18446744073709551615") << "numbers keep their text";
    for (const char* bad : {"", "{", "[1,]", "{\"a\"}", "{\"a\":1,}", "01", "\"\x01\"", "[1] x", "tru", "NaN",
                            "\"\\q\"", "\"\\u12\"",
                            // Not UTF-8: a stray continuation byte, a cut sequence, overlong forms,
                            // an encoded surrogate, beyond U+10FFFF, bytes UTF-8 never uses.
                            "\"a\x97\"",
                            "\"\xC7"
                            "4\"",
                            "\"\xE4\xBA\"", "\"\xC0\xAF\"", "\"\xE0\x80\xAF\"", "\"\xED\xA0\x80\"",
                            "\"\xF4\x90\x80\x80\"", "\"\xF8\x88\x80\x80\x80\"", "\"\xFF\"", "{\"\xE9\":1}"}) {
        EXPECT_FALSE(tamsa::JsonValue::parse(bad, &value)) << bad;
    }
    // Every well-formed sequence length, at the edges of what is allowed.
    ASSERT_TRUE(
        tamsa::JsonValue::parse("\"\xC2\x80\xDF\xBF\xE0\xA0\x80\xED\x9F\xBF\xEE\x80\x80\xF0\x90\x80\x80"
                                "\xF4\x8F\xBF\xBF\xE4\xBA\xAC\"",
                                &value));
    EXPECT_EQ(
        value.text,
        "\xC2\x80\xDF\xBF\xE0\xA0\x80\xED\x9F\xBF\xEE\x80\x80\xF0\x90\x80\x80\xF4\x8F\xBF\xBF\xE4\xBA\xAC");
    EXPECT_FALSE(tamsa::JsonValue::parse(std::string(200000, '['), &value));
    EXPECT_FALSE(tamsa::JsonValue::parse(std::string(100000, '{'), &value));
    EXPECT_TRUE(tamsa::JsonValue::parse(std::string(60, '[') + std::string(60, ']'), &value));
}

TEST(TamsaCosine, SimdKernelMatchesThePlainLoop)
{
    std::mt19937 random(9);
    std::normal_distribution<float> normal(0.0f, 0.05f);
    for (size_t n : {512u, 511u, 17u, 3u, 0u}) {
        std::vector<float> q(n), x(n);
        for (int trial = 0; trial < 200; ++trial) {
            for (size_t i = 0; i < n; ++i) {
                q[i] = normal(random);
                x[i] = normal(random) + (trial % 2 ? q[i] : 0.0f);
            }
            float plainDot = 0, plainNorm = 0, simdDot = 0, simdNorm = 0, queryNorm = 0, unused = 0;
            tamsa::dotNormScalar()(q.data(), x.data(), n, &plainDot, &plainNorm);
            tamsa::dotNormBest()(q.data(), x.data(), n, &simdDot, &simdNorm);
            tamsa::dotNormScalar()(q.data(), q.data(), n, &unused, &queryNorm);
            const float plain = tamsa::cosineFromParts(plainDot, queryNorm, plainNorm);
            const float simd = tamsa::cosineFromParts(simdDot, queryNorm, simdNorm);
            ASSERT_NEAR(plain, simd, 1e-5) << tamsa::dotNormBestName() << " n=" << n;
        }
    }
    EXPECT_EQ(tamsa::cosineFromParts(0, 0, 0), 1.0f);
    EXPECT_EQ(tamsa::cosineFromParts(0, 1, 0), 0.0f);
    EXPECT_EQ(tamsa::cosineFromParts(-1, 1, 1), 0.0f);
    EXPECT_NEAR(tamsa::cosineFromParts(24, 25, 25), 0.96f, 1e-6) << "[3,4] against [4,3]";
}

} // namespace
