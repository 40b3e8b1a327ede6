#include <gtest/gtest.h>
#include <sys/stat.h>

#include <filesystem>
#include <functional>

#include "platform/containers/Containers.h"
#include "tests/support/TestSupport.h"

namespace containers = corvane::containers;

TEST(Containers, LookupCreatesPrivateDirectoriesAndRefusesBadNames) {
    axtest::PlatformRoot root;
    auto missing = containers::lookupDataContainer(10, "com.corvane.axd", false);
    ASSERT_FALSE(missing);
    EXPECT_EQ(missing.error().code, containers::kNotFound);
    auto made = containers::lookupDataContainer(10, "com.corvane.axd", true);
    ASSERT_TRUE(made) << made.error().description();
    EXPECT_EQ(*made, root.path() + "/home/.local/share/corvane/containers/10/com.corvane.axd");
    struct stat st {};
    stat(made->c_str(), &st);
    EXPECT_EQ(st.st_mode & 0777, 0700u);
    EXPECT_EQ(*containers::lookupDataContainer(10, "com.corvane.axd", false), *made);
    for (const char* bad : {"", "..", ".hidden", "a/b"}) {
        auto r = containers::lookupDataContainer(4, bad, true);
        ASSERT_FALSE(r) << bad;
        EXPECT_EQ(r.error().code, containers::kInvalidArgument);
    }
    // Something in the way: an error code, not a crash.
    axtest::writeFile(root.path() + "/home/.local/share/corvane/containers/4", "file");
    auto blocked = containers::lookupDataContainer(4, "com.example", true);
    ASSERT_FALSE(blocked);
    EXPECT_EQ(blocked.error().code, containers::kCannotCreate);
}

// Opening for a sandbox never follows a symbolic link, wherever below the containers root it is,
// and never makes anything on the far side of one.
TEST(Containers, OpeningForASandboxFollowsNoSymbolicLink) {
    axtest::PlatformRoot root;
    std::string base = root.path() + "/home/.local/share/corvane/containers";
    std::string outside = root / "outside";
    ::mkdir(outside.c_str(), 0755);
    auto opened = containers::openDataContainer(4, "com.example.p", true);
    ASSERT_TRUE(opened) << opened.error().description();
    EXPECT_EQ(opened->path, base + "/4/com.example.p");
    auto tmp = containers::openBeneath(*opened, "tmp", true);
    ASSERT_TRUE(tmp) << tmp.error().description();
    EXPECT_EQ(tmp->path, base + "/4/com.example.p/tmp");

    struct Case {
        const char* name;
        std::string replaced;  // made a symbolic link to `outside`
        std::function<corvane::Result<containers::OpenedDirectory>()> open;
    };
    const Case cases[] = {
        {"the container", base + "/4/com.example.q",
         [] { return containers::openDataContainer(4, "com.example.q", true); }},
        {"its class", base + "/7", [] { return containers::openDataContainer(7, "com.example.q", true); }},
        {"its tmp", base + "/4/com.example.p/tmp",
         [&] { return containers::openBeneath(*opened, "tmp", true); }},
    };
    for (const auto& c : cases) {
        std::filesystem::remove_all(c.replaced);
        std::filesystem::create_directory_symlink(outside, c.replaced);
        auto refused = c.open();
        ASSERT_FALSE(refused) << c.name;
        EXPECT_EQ(refused.error().code, containers::kSymbolicLink) << c.name;
        EXPECT_NE(refused.error().description().find(c.replaced), std::string::npos) << refused.error().description();
        EXPECT_TRUE(std::filesystem::is_empty(outside)) << c.name;
    }
    EXPECT_FALSE(containers::openBeneath(*opened, "../x", true));
}
