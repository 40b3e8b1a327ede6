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
