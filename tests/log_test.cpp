#include <gtest/gtest.h>

#include "platform/log/Log.h"

namespace log = corvane::log;
using corvane::Array;
using corvane::Value;

TEST(LogFormat, EveryDirective) {
    struct Case {
        std::string expected;
        std::string actual;
    };
    int x = 0;
    char ptr[32];
    std::snprintf(ptr, sizeof ptr, "%p", static_cast<void*>(&x));
    const Case cases[] = {
        {"client 42 requested add", log::formatText("client %d requested %{public}s", 42, "add")},
        {"used 4294967295 u", log::formatText("used %u u", -1)},
        {"big 18446744073709551615", log::formatText("big %llu", uint64_t{18446744073709551615ULL})},
        {"flags 0xdeadbeef", log::formatText("flags 0x%lx", 0xdeadbeefUL)},
        {"100% sure", log::formatText("100%% sure")},
        {"at {\"a\": 1}", log::formatText("at %@", corvane::dict({{"a", 1}}))},
        {"p " + std::string(ptr), log::formatText("p %p", static_cast<const void*>(&x))},
        {"s (null)", log::formatText("s %s", static_cast<const char*>(nullptr))},
        {"e unsupported", log::formatText("e %@", corvane::Error{"Annexa", 4, "unsupported"})},
        {"missing <missing>", log::formatText("missing %d")},
        {"v -5", log::formatText("v %d", int64_t{-5})},
        {"[ 7]", log::formatText("[%2d]", 7)},
        {"trailing %", log::formatText("trailing %")},
        {"odd %k", log::formatText("odd %k", 1)},
        {"unsupported protocol version -1 (current 3)",
         log::formatText("unsupported protocol version %d (current %d)", uint64_t{0xffffffffffffffffULL}, 3)},
    };
    for (const auto& c : cases) EXPECT_EQ(c.actual, c.expected);
}

TEST(LogFormat, PrivateArgumentsAreRedactedUnlessPublic) {
    // A text Value prints its own characters, as a string does (a quoted "%@" shows them once);
    // other values print in the notation.
    const log::Arg args[] = {log::Arg(7), log::Arg("secret"), log::Arg("shown"), log::Arg(Value("obj")),
                             log::Arg(Value("pub")), log::Arg(Value(Array{Value("x")}))};
    EXPECT_EQ(log::format("%d %s %{public}s %@ %{public}@ %{public}@", args, true),
              "7 <private> shown <private> pub [\"x\"]");
    EXPECT_EQ(log::format("%d %s %{public}s %@ \"%{public}@\" %@", args, false),
              "7 secret shown obj \"pub\" [\"x\"]");
}

TEST(LogCapture, RecordsEveryLevelWithItsCategory) {
    log::CaptureSink capture(false);
    auto ops = log::makeHandle("com.corvane.Annexa", "ops");
    ASSERT_TRUE(ops);
    log::debug(*ops, "client %d is dead", 12);
    log::error(*ops, "unable to save annotations:%{public}@ error:%@", std::string("/x"),
               std::string("y"));
    auto records = capture.records();
    ASSERT_EQ(records.size(), 2u);
    EXPECT_EQ(records[0].level, log::Level::Debug);
    EXPECT_EQ(records[0].category, "ops");
    EXPECT_EQ(records[0].message, "client 12 is dead");
    EXPECT_EQ(records[1].message, "unable to save annotations:/x error:<private>");
    EXPECT_FALSE(log::makeHandle("com.corvane.Annexa", ""));
    EXPECT_FALSE(log::makeHandle("com.corvane.Annexa", "bad\ncategory"));
}
