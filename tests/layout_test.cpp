#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <gtest/gtest.h>

#include "platform/layout/Layout.h"
#include "tests/support/TestSupport.h"

namespace layout = corvane::layout;

TEST(Layout, CanonicalPathIsWhatRealpathWouldSay) {
    axtest::TempDir dir;
    // The temporary directory itself may lie behind a link (/tmp on some systems).
    char real[PATH_MAX];
    ASSERT_NE(::realpath(dir.path().c_str(), real), nullptr);
    const std::string base = real;
    axtest::writeFile(dir / "a/b/file", "x");
    ASSERT_EQ(::symlink("a/b", (dir / "link").c_str()), 0);
    ASSERT_EQ(::symlink("missing", (dir / "dangling").c_str()), 0);
    ASSERT_EQ(::mkfifo((dir / "fifo").c_str(), 0600), 0);
    // A file that is open elsewhere and then removed has no name left.
    axtest::writeFile(dir / "gone", "x");
    int held = ::open((dir / "gone").c_str(), O_RDONLY);
    ASSERT_GE(held, 0);
    ASSERT_EQ(::unlink((dir / "gone").c_str()), 0);

    struct Case {
        std::string given;
        std::optional<std::string> canonical;
    };
    const Case cases[] = {
        {dir / "a/b/file", base + "/a/b/file"},
        {dir / "a/./b/../b/file", base + "/a/b/file"},
        {dir / "link/file", base + "/a/b/file"},
        {dir / "link", base + "/a/b"},
        {dir / "fifo", base + "/fifo"},  // named, never opened
        {dir / "dangling", std::nullopt},
        {dir / "gone", std::nullopt},
        {dir / "a/b/file/x", std::nullopt},
        {"", std::nullopt},
    };
    for (const Case& c : cases) {
        SCOPED_TRACE(c.given);
        EXPECT_EQ(layout::canonicalPath(c.given), c.canonical);
    }
    ::close(held);
}
