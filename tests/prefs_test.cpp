#include <gtest/gtest.h>

#include <filesystem>

#include "platform/plist/Plist.h"
#include "platform/prefs/Prefs.h"
#include "tests/support/TestSupport.h"

namespace prefs = corvane::prefs;
using corvane::Value;

TEST(Prefs, EveryReadSeesTheFileAsItIsNow) {
    axtest::PlatformRoot root;
    const std::string domain = "com.corvane.annexa.userprefs";
    EXPECT_TRUE(prefs::copyValue("exclusions", domain).isNull());
    Value exclusions(corvane::Array{corvane::dict({{"KSExtensionIdentifier", "com.example.a"}})});
    ASSERT_TRUE(prefs::setValue("exclusions", exclusions, domain).ok());
    EXPECT_EQ(prefs::copyValue("exclusions", domain), exclusions);
    // Another writer replaces the file behind our back: the next read sees it.
    ASSERT_TRUE(corvane::plist::writeXMLFile(prefs::domainPath(domain),
                                              corvane::dict({{"exclusions", "not an array"}})).ok());
    EXPECT_EQ(prefs::copyValue("exclusions", domain), Value("not an array"));
    ASSERT_TRUE(prefs::setValue("exclusions", Value(), domain).ok());
    EXPECT_TRUE(prefs::copyValue("exclusions", domain).isNull());
    // A file that is no property list reads as no values at all.
    axtest::writeFile(prefs::domainPath(domain), "garbage");
    EXPECT_TRUE(prefs::copyValue("exclusions", domain).isNull());
    EXPECT_EQ(prefs::domainPath(domain).rfind(root.path(), 0), 0u);
}

// Reads are served from memory until a file changes; no change may slip past: rewrites of the
// same size in quick succession (replaced, which may reuse an inode, or written in place), and a
// directory removed and made again.
TEST(Prefs, NoChangeIsMissedBetweenReads) {
    axtest::PlatformRoot root;
    const std::string domain = "com.example.quick";
    const std::string path = prefs::domainPath(domain);
    for (int i = 0; i < 40; ++i) {
        Value value("value" + std::to_string(i % 10));
        if (i % 2) {
            ASSERT_TRUE(corvane::plist::writeXMLFile(path, corvane::dict({{"k", value}})).ok());
        } else {
            axtest::writeFile(path, *corvane::plist::toXML(corvane::dict({{"k", value}})));
        }
        ASSERT_EQ(prefs::copyValue("k", domain), value) << "rewrite " << i;
    }
    std::filesystem::remove_all(path.substr(0, path.rfind('/')));
    EXPECT_TRUE(prefs::copyValue("k", domain).isNull());
    ASSERT_TRUE(prefs::setValue("k", "again", domain).ok());
    EXPECT_EQ(prefs::copyValue("k", domain), Value("again"));
}

TEST(Prefs, SearchListAndUnusableDomains) {
    axtest::PlatformRoot root;
    ASSERT_TRUE(prefs::setValue("k", 1, "a").ok());
    ASSERT_TRUE(prefs::setValue("k", 2, "b").ok());
    prefs::UserDefaults defaults;
    defaults.addSuite("b");
    defaults.addSuite("a");
    EXPECT_EQ(defaults.objectForKey("k"), Value(2));
    EXPECT_TRUE(defaults.objectForKey("missing").isNull());
    for (const char* bad : {"", "../x", ".hidden", "a/b"}) {
        EXPECT_FALSE(prefs::setValue("k", 1, bad).ok()) << bad;
        EXPECT_TRUE(prefs::copyValue("k", bad).isNull()) << bad;
    }
}
