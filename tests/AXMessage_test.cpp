#include <gtest/gtest.h>
#include <unistd.h>

#include "Annexa/AXMessage.h"

using annexa::Value;
using corvane::dict;

TEST(AXMessage, TypedGetters) {
    Value m = dict({{"paths", Value(corvane::Array{Value("/a")})}, {"rules", dict({{"k", 1}})}, {"n", 3}});
    struct Case {
        const char* key;
        bool array;
        bool dictionary;
    };
    const Case cases[] = {{"paths", true, false}, {"rules", false, true}, {"n", false, false}, {"missing", false, false}};
    for (const auto& c : cases) {
        EXPECT_EQ(annexa::rpx_dictionary_get_array(m, c.key) != nullptr, c.array) << c.key;
        EXPECT_EQ(annexa::rpx_dictionary_get_dictionary(m, c.key) != nullptr, c.dictionary) << c.key;
    }
    EXPECT_EQ(annexa::rpx_dictionary_get_array(Value("not a dictionary"), "paths"), nullptr);
}

TEST(AXMessage, ConversionKeepsKindsAndRefusesWhatCannotBeCarried) {
    Value every = dict({{"i", int64_t{-1}}, {"u", uint64_t{1}}, {"d", 1.5}, {"b", false}, {"s", "x"},
                        {"data", Value::data("ab", 2)}, {"date", Value(corvane::Date{7})},
                        {"uuid", Value(corvane::UUID::random())}, {"a", Value(corvane::Array{Value(1)})}});
    Value in = annexa::convertMessageToValue(every);
    EXPECT_EQ(in, every);
    EXPECT_EQ(in["u"].kind(), Value::Kind::UInt64);
    EXPECT_EQ(in["b"].kind(), Value::Kind::Bool);
    EXPECT_EQ(annexa::convertValueToMessage(in), every);
    auto fd = std::make_shared<corvane::FileDescriptor>(dup(0));
    for (const Value& bad : {dict({{"x", Value()}}), Value(corvane::Array{Value(1), Value(fd)}), Value()}) {
        EXPECT_TRUE(annexa::convertMessageToValue(bad).isNull()) << bad.description();
        EXPECT_TRUE(annexa::convertValueToMessage(bad).isNull()) << bad.description();
    }
}
