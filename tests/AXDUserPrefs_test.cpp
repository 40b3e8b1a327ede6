#include <gtest/gtest.h>

#include "axd/AXDUserPrefs.h"
#include "tests/support/TestSupport.h"

using annexa::AXDUserPrefs;
using annexa::Value;

TEST(AXDUserPrefs, ExclusionsAreReadAnewAndOddShapesCountAsNone) {
    axtest::PlatformRoot root;
    AXDUserPrefs prefs;
    EXPECT_TRUE(prefs.exclusions().isNull());
    EXPECT_TRUE(prefs.exclusionPatterns().empty());
    Value a = corvane::dict({{"KSExtensionIdentifier", "com.example.a"}});
    struct Case {
        Value stored;
        size_t patterns;
    };
    const Case cases[] = {
        {Value(corvane::Array{a, corvane::dict({})}), 2},
        {Value(corvane::Array{a, Value("x"), Value(3)}), 1},
        {a, 0},
        {Value("exclusions"), 0},
        {Value(corvane::Array{}), 0},
    };
    for (const auto& c : cases) {
        // Written by another party between two reads; no restart, no cache.
        ASSERT_TRUE(corvane::prefs::setValue(AXDUserPrefs::kExclusionsKey, c.stored, AXDUserPrefs::kDomain).ok());
        EXPECT_EQ(prefs.exclusions(), c.stored);
        EXPECT_EQ(prefs.exclusionPatterns().size(), c.patterns) << c.stored.description();
    }
    EXPECT_EQ(prefs.suites(), std::vector<std::string>{"com.corvane.annexa.userprefs"});
}
