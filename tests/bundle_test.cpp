#include <gtest/gtest.h>

#include "platform/bundle/Bundle.h"
#include "platform/plist/Plist.h"
#include "tests/support/Bundles.h"
#include "tests/support/TestSupport.h"

namespace bundle = corvane::bundle;
using corvane::Value;

TEST(Bundle, OpensByPathAndByExecutable) {
    axtest::TempDir dir;
    std::string app = axtest::makeBundle(dir.path(), "Example.app", axtest::appInfo("com.example.app"),
                                         "/bin/true");
    std::string appex = axtest::makeBundle(app + "/PlugIns", "Share.appex",
                                           axtest::plugInInfo("com.example.app.share", corvane::dict({})),
                                           "/bin/true");
    // An executable that no bundle names, and a file in a directory without any bundle.
    axtest::writeFile(app + "/helper", "#!/bin/sh\n", 0755);
    axtest::writeFile(dir / "loose/tool", "x", 0755);

    struct Case {
        std::string executable;
        std::optional<std::string> bundlePath;
    };
    const Case cases[] = {
        {app + "/app", app},
        {appex + "/plugin", appex},
        {app + "/PlugIns/../app", app},
        {app + "/helper", std::nullopt},
        {dir / "loose/tool", std::nullopt},
        {dir / "missing", std::nullopt},
    };
    for (const auto& c : cases) {
        auto b = bundle::Bundle::openExecutable(c.executable);
        ASSERT_TRUE(b);
        EXPECT_EQ(b->property(bundle::kPropertyBundlePath), c.bundlePath) << c.executable;
    }

    auto b = bundle::Bundle::openPath(app + "/./");
    ASSERT_TRUE(b);
    EXPECT_EQ(b->property(2), app);
    EXPECT_EQ(b->property(3), app + "/app");
    EXPECT_EQ(b->property(9), app);
    EXPECT_EQ(b->property(4), std::nullopt);
    EXPECT_EQ(b->infoDictionary()["KFBundleIdentifier"], Value("com.example.app"));
    EXPECT_FALSE(b->receiptPath());
    axtest::writeFile(app + "/Receipt", "receipt bytes");
    EXPECT_EQ(b->receiptPath(), app + "/Receipt");
    EXPECT_FALSE(bundle::Bundle::openPath(dir / "nothing"));
    EXPECT_FALSE(bundle::Bundle::openPath(app + "/app"));  // a file is no bundle
}

TEST(Bundle, InfoPlistIsCachedUntilFlushed) {
    axtest::TempDir dir;
    std::string app = axtest::makeBundle(dir.path(), "A.app", axtest::appInfo("com.example.a"));
    auto b = bundle::Bundle::openPath(app);
    EXPECT_EQ(b->infoDictionary()["KFBundleIdentifier"], Value("com.example.a"));
    EXPECT_TRUE(corvane::plist::writeXMLFile(app + "/Info.plist", axtest::appInfo("com.example.b")).ok());
    EXPECT_EQ(b->infoDictionary()["KFBundleIdentifier"], Value("com.example.a"));
    b->flush();
    EXPECT_EQ(b->infoDictionary()["KFBundleIdentifier"], Value("com.example.b"));
    // Broken or absent metadata reads as none, and an executable name with a slash is refused.
    axtest::writeFile(app + "/Info.plist", "not a plist");
    b->flush();
    EXPECT_TRUE(b->infoDictionary().isNull());
    EXPECT_FALSE(b->property(3));
    EXPECT_TRUE(corvane::plist::writeXMLFile(app + "/Info.plist", corvane::dict({{"KFBundleExecutable", "../x"}})).ok());
    b->flush();
    EXPECT_FALSE(b->property(3));
}
