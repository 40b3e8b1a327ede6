#include <gtest/gtest.h>

#include "Annexa/AXUtilities.h"

using annexa::compareVersionString;
using annexa::Ordering;
using annexa::Value;

TEST(AXUtilities, CompareVersionString) {
    struct Case {
        const char* a;
        const char* b;
        Ordering expected;
    };
    const Case cases[] = {
        {"1.10", "1.9", Ordering::Descending},
        {"2", "10", Ordering::Ascending},
        {"1.0", "1.0", Ordering::Same},
        {"1.0", "1.0.1", Ordering::Ascending},
        {"1.0", "1.0.0", Ordering::Ascending},
        {"2.0", "2", Ordering::Descending},
        {"1.99", "2", Ordering::Ascending},
        {"a", "A", Ordering::Descending},
        {"v1.2b", "v1.2a", Ordering::Descending},
        {"", "", Ordering::Same},
        {"", "0", Ordering::Ascending},
        {"99999999999999999999999", "99999999999999999999998", Ordering::Descending},
        {"01", "1", Ordering::Same},
        {"1a", "1.", Ordering::Descending},
        {" 1", "1", Ordering::Ascending},
    };
    for (const auto& c : cases) {
        EXPECT_EQ(compareVersionString(c.a, c.b), c.expected) << c.a << " vs " << c.b;
        EXPECT_EQ(static_cast<int>(compareVersionString(c.b, c.a)), -static_cast<int>(c.expected))
            << c.b << " vs " << c.a;
    }
}

TEST(AXUtilities, MakeErrorAndFormat) {
    auto e = annexa::makeError(annexa::AXErrorCode::InvalidRequest, nullptr);
    EXPECT_EQ(e.domain, "Annexa");
    EXPECT_EQ(e.code, 4);
    EXPECT_FALSE(e.text);
    auto f = annexa::makeErrorWithFormat(annexa::AXErrorCode::PlugInUnusable, "missing \"%@\" key in Info.plist or SDK",
                                         std::string("KSExtensionProtocol"));
    EXPECT_EQ(f.text, "missing \"KSExtensionProtocol\" key in Info.plist or SDK");
    EXPECT_FALSE(annexa::makeErrorWithFormat(annexa::AXErrorCode::PlugInUnusable, nullptr).text);
}

TEST(AXUtilities, DictionaryChanging) {
    Value d = corvane::dict({{"a", 1}, {"b", 2}});
    EXPECT_EQ(Value(annexa::dictionaryChanging(d, "a", Value())), corvane::dict({{"b", 2}}));
    EXPECT_EQ(Value(annexa::dictionaryChanging(d, "c", Value())), d);
    EXPECT_EQ(Value(annexa::dictionaryChanging(d, "a", 3)), corvane::dict({{"a", 3}, {"b", 2}}));
    EXPECT_EQ(d, corvane::dict({{"a", 1}, {"b", 2}}));  // the receiver is unchanged
    EXPECT_EQ(Value(annexa::dictionaryChanging(Value(), "x", 1)), corvane::dict({{"x", 1}}));
}

TEST(AXUtilities, LogHandlesAreMadeOnce) {
    EXPECT_EQ(&annexa::logOps(), &annexa::logOps());
    EXPECT_EQ(annexa::logOps().category(), "ops");
    EXPECT_EQ(annexa::logTraffic().category(), "traffic");
    EXPECT_EQ(annexa::logExtension().category(), "extension");
    EXPECT_EQ(annexa::logVt().category(), "vt");
    EXPECT_EQ(annexa::logVt().subsystem(), "com.corvane.Annexa");
}
