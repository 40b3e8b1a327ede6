#include <gtest/gtest.h>
#include <sys/stat.h>

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
