#include <gtest/gtest.h>

#include "Annexa/AXBundle.h"
#include "tests/support/Bundles.h"
#include "tests/support/TestSupport.h"

using annexa::AXBundle;
using annexa::Value;
namespace log = corvane::log;

TEST(AXBundle, ReadersOfAnApplicationAndItsExecutable) {
    axtest::TempDir dir;
    std::string app = axtest::makeBundle(dir.path(), "Example.app", axtest::appInfo("com.example.app"),
                                         "/bin/true");
    auto byExe = AXBundle::initWithExecutablePath(app + "/app");
    EXPECT_EQ(byExe->path(), app);
    EXPECT_EQ(byExe->url(), byExe->path());
    EXPECT_EQ(byExe->executablePath(), app + "/app");
    EXPECT_EQ(byExe->plugInsPath(), app + "/PlugIns");
    EXPECT_EQ(byExe->bundleDirectory("Resources"), app + "/Resources");
    EXPECT_EQ(byExe->bundleIdentifier(), std::optional<std::string>("com.example.app"));
    EXPECT_EQ(byExe->infoDictionary()["KFBundleExecutable"], Value("app"));

    // No bundle around the path: it is opened as a bundle directory itself (here: not one).
    auto loose = AXBundle::initWithExecutablePath(dir.path());
    EXPECT_EQ(loose->path(), dir.path());
    EXPECT_FALSE(loose->bundleIdentifier());
    auto nothing = AXBundle::initWithPath(dir / "missing");
    EXPECT_FALSE(nothing->path());
    EXPECT_FALSE(nothing->plugInsPath());
    EXPECT_FALSE(nothing->executablePath());
}

TEST(AXBundle, WithoutInfoPlistBothMessagesAreLogged) {
    axtest::TempDir dir;
    axtest::writeFile(dir / "Empty.app/app", "x", 0755);
    log::CaptureSink capture;
    auto b = AXBundle::initWithPath(dir / "Empty.app");
    EXPECT_TRUE(b->infoDictionary().isNull());
    EXPECT_FALSE(b->bundleIdentifier());
    EXPECT_EQ(capture.count("failed to retrieve Info.plist for " + dir.path() + "/Empty.app through <AXBundle"), 1u);
    EXPECT_EQ(capture.count("failed to convert Info.plist to dictionary: "), 1u);
    // No executable named: the executable path is the bundle path.
    EXPECT_EQ(b->executablePath(), dir / "Empty.app");
}
