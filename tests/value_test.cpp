#include <gtest/gtest.h>
#include <unistd.h>

#include <cmath>
#include <limits>

#include "platform/value/Value.h"

using corvane::Array;
using corvane::Date;
using corvane::Dictionary;
using corvane::UUID;
using corvane::Value;

TEST(Value, NumbersAndBooleansCompareByValue) {
    struct Case {
        Value a, b;
        bool equal;
    };
    const Case cases[] = {
        {Value(true), Value(1), true},
        {Value(true), Value(1u), true},
        {Value(true), Value(1.0), true},
        {Value(false), Value(0), true},
        {Value(false), Value(0.0), true},
        {Value(true), Value(2), false},
        {Value(false), Value(""), false},
        {Value(true), Value("1"), false},
        {Value(int64_t{-1}), Value(std::numeric_limits<uint64_t>::max()), false},
        {Value(int64_t{5}), Value(uint64_t{5}), true},
        {Value(1.5), Value(1), false},
        {Value(std::numeric_limits<int64_t>::max()),
         Value(static_cast<uint64_t>(std::numeric_limits<int64_t>::max())), true},
        {Value(), Value(false), false},
        {Value(Array{}), Value(false), false},
        {Value(Array{Value(1)}), Value(Array{Value(true)}), true},
        {corvane::dict({{"a", 1}}), corvane::dict({{"a", 1.0}}), true},
        {corvane::dict({{"a", 1}}), corvane::dict({{"b", 1}}), false},
    };
    for (const auto& c : cases) {
        EXPECT_EQ(c.a == c.b, c.equal) << c.a.description() << " vs " << c.b.description();
        EXPECT_EQ(c.b == c.a, c.equal) << "symmetry";
    }
}

TEST(Value, UuidTextIsUpperCaseAndParsesEitherCase) {
    auto u = UUID::parse("01234567-89ab-cdef-0123-456789abcdef");
    ASSERT_TRUE(u);
    EXPECT_EQ(u->string(), "01234567-89AB-CDEF-0123-456789ABCDEF");
    for (const char* bad : {"", "01234567-89AB-CDEF-0123-456789ABCDE", "0123456789AB-CDEF-0123-456789ABCDEF0",
                            "01234567-89AB-CDEF-0123-456789ABCDEG", "01234567_89AB-CDEF-0123-456789ABCDEF"})
        EXPECT_FALSE(UUID::parse(bad)) << bad;
    EXPECT_NE(UUID::random(), UUID::random());
}

TEST(Value, TextNotationRoundTripsEveryKind) {
    int fd = dup(0);
    Dictionary d{
        {"null", Value()},
        {"bool", Value(false)},
        {"int", Value(int64_t{-5})},
        {"uint", Value(uint64_t{5})},
        {"huge", Value(std::numeric_limits<uint64_t>::max())},
        {"min", Value(std::numeric_limits<int64_t>::min())},
        {"double", Value(1.5)},
        {"wholeDouble", Value(2.0)},
        {"tiny", Value(1e-300)},
        {"inf", Value(-std::numeric_limits<double>::infinity())},
        {"string", Value("quote \" backslash \\ newline \n tab \t control \x01 é")},
        {"data", Value::data(corvane::Bytes{0x0a, 0x1b, 0xff})},
        {"date", Value(Date{1795341600250000})},
        {"old date", Value(Date{-1})},
        {"uuid", Value(UUID::random())},
        {"array", Value(Array{Value(1), Value(Array{}), corvane::dict({})})},
        {"fd", Value(std::make_shared<corvane::FileDescriptor>(fd))},
    };
    Value v(d);
    std::string text = v.description();
    auto back = Value::parse(text);
    ASSERT_TRUE(back) << text;
    EXPECT_EQ(*back, v) << text << "\n" << back->description();
    // The kinds survive, not only the numeric values.
    EXPECT_EQ((*back)["uint"].kind(), Value::Kind::UInt64);
    EXPECT_EQ((*back)["int"].kind(), Value::Kind::Int64);
    EXPECT_EQ((*back)["wholeDouble"].kind(), Value::Kind::Double);
}

TEST(Value, TextNotationReadsTheDocumentedForms) {
    struct Case {
        const char* text;
        Value expected;
    };
    const Case cases[] = {
        {"5", Value(5)},
        {" -5 ", Value(-5)},
        {"5u", Value(5u)},
        {"1.5", Value(1.5)},
        {"1e3", Value(1000.0)},
        {"true", Value(true)},
        {"null", Value()},
        {"<0a1B>", Value::data(corvane::Bytes{0x0a, 0x1b})},
        {"<>", Value::data(corvane::Bytes{})},
        {"@2026-11-22T10:00:00Z", Value(Date{1795341600000000})},
        {"@2026-11-22T10:00:00.5Z", Value(Date{1795341600500000})},
        {"@1970-01-01T00:00:00Z", Value(Date{0})},
        {"uuid(01234567-89AB-CDEF-0123-456789ABCDEF)",
         Value(*UUID::parse("01234567-89AB-CDEF-0123-456789ABCDEF"))},
        {"\"\\u00e9\\ud83d\\ude00\"", Value("é😀")},
        {"{ \"k\" : [ 1 , 2 ] }", corvane::dict({{"k", Value(Array{Value(1), Value(2)})}})},
    };
    for (const auto& c : cases) {
        auto v = Value::parse(c.text);
        ASSERT_TRUE(v) << c.text;
        EXPECT_EQ(*v, c.expected) << c.text;
        EXPECT_EQ(v->kind(), c.expected.kind()) << c.text;
    }
    for (const char* bad : {"", "5 5", "-5u", "{1: 2}", "[1,]", "{\"a\" 1}", "<0>", "<zz>",
                            "@2026-02-30T00:00:00Z", "@2026-11-22T25:00:00Z", "@2026-11-22", "uuid(x)",
                            "\"\\ud800\"", "\"\xff\"", "\"a\nb\"", "99999999999999999999",
                            "fd(99999)", "tru", "[[[[", "'a'"})
        EXPECT_FALSE(Value::parse(bad)) << bad;
    std::string deep(100000, '[');
    EXPECT_FALSE(Value::parse(deep));
}

// Every kind, and every edge of the mapping: what JSON writes, and that it reads back to the same
// value of the same kind (an unsigned integer up to 2^53 reads back signed, and equal).
TEST(Value, JsonRoundTripsEveryKindThroughTaggedObjects) {
    int fd = dup(0);
    const UUID uuid = *UUID::parse("01234567-89AB-CDEF-0123-456789ABCDEF");
    struct Case {
        Value value;
        const char* json;  // null: not checked, only the round trip
        Value::Kind kindBack;
    };
    using K = Value::Kind;
    const Case cases[] = {
        {Value(), "null", K::Null},
        {Value(true), "true", K::Bool},
        {Value(int64_t{-5}), "-5", K::Int64},
        {Value(uint64_t{5}), "5", K::Int64},
        {Value(int64_t{1} << 53), "9007199254740992", K::Int64},
        {Value(-(int64_t{1} << 53)), "-9007199254740992", K::Int64},
        {Value((int64_t{1} << 53) + 1), "{\"$int64\":\"9007199254740993\"}", K::Int64},
        {Value(std::numeric_limits<int64_t>::min()), "{\"$int64\":\"-9223372036854775808\"}", K::Int64},
        {Value((uint64_t{1} << 53) + 1), "{\"$uint64\":\"9007199254740993\"}", K::UInt64},
        {Value(std::numeric_limits<uint64_t>::max()), "{\"$uint64\":\"18446744073709551615\"}", K::UInt64},
        {Value(2.0), "2.0", K::Double},
        {Value(1e-300), "1e-300", K::Double},
        {Value(std::numeric_limits<double>::infinity()), "{\"$double\":\"inf\"}", K::Double},
        {Value(-std::numeric_limits<double>::infinity()), "{\"$double\":\"-inf\"}", K::Double},
        {Value("quote \" \\ \n \x01 é $uuid"), nullptr, K::String},
        {Value::data(corvane::Bytes{0x0a, 0x1b, 0xff, 0x00}), "{\"$data\":\"Chv/AA==\"}", K::Data},
        {Value::data(corvane::Bytes{}), "{\"$data\":\"\"}", K::Data},
        {Value(Date{1795341600250000}), "{\"$date\":\"2026-11-22T10:00:00.25Z\"}", K::Date},
        {Value(Date{-1}), nullptr, K::Date},
        {Value(uuid), "{\"$uuid\":\"01234567-89AB-CDEF-0123-456789ABCDEF\"}", K::UUID},
        {Value(std::make_shared<corvane::FileDescriptor>(fd)), nullptr, K::Fd},
        // A dictionary that would read as a tag is escaped; one with more keys is not.
        {corvane::dict({{"$uuid", "not one"}}), "{\"$dictionary\":{\"$uuid\":\"not one\"}}", K::Dictionary},
        {corvane::dict({{"$x", corvane::dict({{"$y", 1}})}}), "{\"$dictionary\":{\"$x\":{\"$dictionary\":{\"$y\":1}}}}",
         K::Dictionary},
        {corvane::dict({{"$uuid", 1}, {"b", 2}}), "{\"$uuid\":1,\"b\":2}", K::Dictionary},
        {Value(Array{Value(uuid), Value(Array{}), corvane::dict({})}), nullptr, K::Array},
        {corvane::dict({{"version", Value(3u)}, {"uuids", Value(Array{Value(uuid)})}}),
         "{\"uuids\":[{\"$uuid\":\"01234567-89AB-CDEF-0123-456789ABCDEF\"}],\"version\":3}", K::Dictionary},
    };
    for (const auto& c : cases) {
        std::string json = c.value.json();
        if (c.json) {
            EXPECT_EQ(json, c.json);
        }
        auto back = Value::parseJson(json);
        ASSERT_TRUE(back) << json << ": " << back.error().description();
        EXPECT_EQ(*back, c.value) << json << " read back as " << back->description();
        EXPECT_EQ(back->kind(), c.kindBack) << json;
        // A descriptor reads back as a duplicate, the same open file under another number.
        if (c.kindBack != K::Fd) {
            EXPECT_EQ(back->json(), json);
        }
    }
    auto nan = Value::parseJson(Value(std::nan("")).json());
    ASSERT_TRUE(nan);
    EXPECT_TRUE(std::isnan(*nan->doubleValue()));
}

TEST(Value, JsonReaderTakesOnlyJsonAndWellFormedTags) {
    struct Case {
        const char* text;
        const char* error;  // null: accepted
    };
    const Case cases[] = {
        {"{\"a\": [1, 2.5, \"x\"]}", nullptr},
        {"18446744073709551615", nullptr},
        {"{\"$dictionary\": {}}", nullptr},
        {"5u", "at offset 1"},
        {"uuid(01234567-89AB-CDEF-0123-456789ABCDEF)", "expected a JSON value"},
        {"<00>", "expected a JSON value"},
        {"@2026-11-22T10:00:00Z", "expected a JSON value"},
        {"nan", "expected a JSON value"},
        {"-18446744073709551615", "within 64 bits"},
        {"{\"$uuid\": \"x\"}", "\"$uuid\" object: expected a UUID"},
        {"{\"$uuid\": 5}", "expected a string"},
        {"{\"$data\": \"!!\"}", "expected base64"},
        {"{\"$data\": \"AA===\"}", "expected base64"},
        {"{\"$date\": \"2026-02-30T00:00:00Z\"}", "expected a date"},
        {"{\"$date\": \"2026-11-22T10:00:00Z x\"}", "expected a date"},
        {"{\"$double\": \"NaN\"}", "\"nan\", \"inf\" or \"-inf\""},
        {"{\"$int64\": \"9223372036854775808\"}", "a signed 64-bit integer"},
        {"{\"$int64\": \"1e3\"}", "a signed 64-bit integer"},
        {"{\"$uint64\": \"-1\"}", "an unsigned 64-bit integer"},
        {"{\"$fd\": -1}", "a descriptor number"},
        {"{\"$fd\": 99999}", "a descriptor open in this process"},
        {"{\"$dictionary\": 1}", "expected an object"},
        {"[{\"$uid\": \"x\"}]", "unknown tag \"$uid\""},
    };
    for (const auto& c : cases) {
        auto v = Value::parseJson(c.text);
        if (!c.error) {
            EXPECT_TRUE(v) << c.text << ": " << v.error().description();
            continue;
        }
        ASSERT_FALSE(v) << c.text;
        EXPECT_NE(v.error().description().find(c.error), std::string::npos) << c.text << ": " << v.error().description();
    }
    std::string deep(100000, '[');
    EXPECT_FALSE(Value::parseJson(deep));
}

TEST(Value, NumericReadings) {
    EXPECT_EQ(Value(true).int64Value(), 1);
    EXPECT_EQ(Value(2.9).int64Value(), 2);
    EXPECT_EQ(Value(-2.9).int64Value(), -2);
    EXPECT_EQ(Value(1e300).int64Value(), std::numeric_limits<int64_t>::max());
    EXPECT_EQ(Value("1").int64Value(), std::nullopt);
    EXPECT_EQ(Value(0.0).boolValue(), false);
    EXPECT_EQ(Value(3).boolValue(), true);
    EXPECT_TRUE(Value(1).isTrue());
    EXPECT_TRUE(Value(0u).isFalse());
    EXPECT_FALSE(Value("true").isTrue());
}
