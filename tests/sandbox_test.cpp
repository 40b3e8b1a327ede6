#include <gtest/gtest.h>
#include <linux/filter.h>
#include <linux/seccomp.h>
#include <sched.h>
#include <sys/prctl.h>
#include <sys/wait.h>
#include <unistd.h>

#include <fcntl.h>
#include <sys/stat.h>

#include <cerrno>
#include <filesystem>

#include "platform/sandbox/Sandbox.h"
#include "tests/support/TestSupport.h"

using namespace corvane;
namespace sb = corvane::sandbox;

namespace {

std::string readAll(int fd) {
    std::string out;
    char buf[256];
    ssize_t n;
    off_t off = 0;
    while ((n = pread(fd, buf, sizeof buf, off)) > 0) {
        out.append(buf, static_cast<size_t>(n));
        off += n;
    }
    return out;
}

}  // namespace

TEST(Sandbox, IssuingNamesTheCanonicalPath) {
    axtest::PlatformRoot root;
    axtest::writeFile(root / "dir/file", "contents");
    std::filesystem::create_directory_symlink(root / "dir", root / "link");
    auto token = sb::issueFileReadExtension(sb::kReadOnlyClass, root / "link/../dir/./file", sb::kCanonicalPath);
    ASSERT_TRUE(token);
    auto parsed = sb::parseToken(*token);
    ASSERT_TRUE(parsed);
    EXPECT_EQ(parsed->path, std::filesystem::canonical(root / "dir/file").string());
    EXPECT_TRUE(sb::verifyToken(*parsed));
    struct stat st {};
    stat((root.path() + "/home/.local/share/corvane/sandbox/token.key").c_str(), &st);
    EXPECT_EQ(st.st_mode & 0777, 0600u);

    auto missing = sb::issueFileReadExtension(sb::kReadOnlyClass, root / "missing", sb::kCanonicalPath);
    ASSERT_FALSE(missing);
    EXPECT_EQ(missing.error().code, ENOENT);
    auto otherClass = sb::issueFileReadExtension("com.corvane.sandbox.read-write", root / "dir/file", sb::kCanonicalPath);
    ASSERT_FALSE(otherClass);
    EXPECT_EQ(otherClass.error().code, EINVAL);
}

TEST(Sandbox, ForgedAlteredOrTruncatedTokensAreRefused) {
    axtest::PlatformRoot root;
    axtest::writeFile(root / "secret", "s");
    axtest::writeFile(root / "other", "o");
    std::string good = *sb::issueFileReadExtension(sb::kReadOnlyClass, root / "secret", sb::kCanonicalPath);
    std::string other = *sb::issueFileReadExtension(sb::kReadOnlyClass, root / "other", sb::kCanonicalPath);
    std::vector<std::pair<std::string, std::string>> cases;
    // Every single changed character.
    for (size_t i = 0; i < good.size(); ++i) {
        std::string t = good;
        t[i] = t[i] == '0' ? '1' : '0';
        cases.emplace_back("byte " + std::to_string(i), t);
    }
    cases.emplace_back("truncated", good.substr(0, good.size() - 2));
    cases.emplace_back("empty", "");
    cases.emplace_back("another path with this path's MAC",
                       other.substr(0, other.rfind(';')) + good.substr(good.rfind(';')));
    {
        // A token made under another user's key (another platform root has another key).
        axtest::PlatformRoot elsewhere;
        axtest::writeFile(elsewhere / "x", "x");
        std::string foreign = *sb::issueFileReadExtension(sb::kReadOnlyClass, elsewhere / "x", sb::kCanonicalPath);
        cases.emplace_back("made with another key", foreign);
    }
    for (const auto& [name, token] : cases) {
        auto parsed = sb::parseToken(token);
        EXPECT_FALSE(parsed && sb::verifyToken(*parsed)) << name;
    }
    EXPECT_TRUE(sb::verifyToken(*sb::parseToken(good)));
}

TEST(Sandbox, TheBrokerInAnotherProcessGrantsExactlyTheTokensPath) {
    axtest::PlatformRoot root;
    axtest::writeFile(root / "granted.txt", "granted bytes");
    axtest::writeFile(root / "bundle/Info.plist", "info");
    axtest::Process broker({axtest::binary("sandbox_broker_host")});
    ASSERT_TRUE(broker.waitForOut("ready")) << broker.err();

    std::string token = *sb::issueFileReadExtension(sb::kReadOnlyClass, root / "granted.txt", sb::kCanonicalPath);
    int64_t handle = sb::consumeExtension(token);
    ASSERT_GT(handle, 0);
    EXPECT_EQ(readAll(static_cast<int>(handle)), "granted bytes");
    // Read-only: writing through the descriptor fails.
    EXPECT_LT(write(static_cast<int>(handle), "x", 1), 0);
    EXPECT_EQ(sb::releaseExtension(handle), 0);

    // A directory token gives a descriptor to open files beneath it.
    std::string dirToken = *sb::issueFileReadExtension(sb::kReadOnlyClass, root / "bundle", sb::kCanonicalPath);
    int64_t dir = sb::consumeExtension(dirToken);
    ASSERT_GT(dir, 0);
    int inside = openat(static_cast<int>(dir), "Info.plist", O_RDONLY);
    ASSERT_GE(inside, 0);
    EXPECT_EQ(readAll(inside), "info");
    close(inside);
    sb::releaseExtension(dir);

    std::string altered = token;
    altered[altered.size() - 1] = altered.back() == 'a' ? 'b' : 'a';
    EXPECT_EQ(sb::consumeExtension(altered), -1);
    // A symbolic link put in the granted file's place is not followed, nor one put in place of a
    // directory on its way.
    std::filesystem::remove(root / "granted.txt");
    std::filesystem::create_symlink(root / "bundle/Info.plist", root / "granted.txt");
    EXPECT_EQ(sb::consumeExtension(token), -1);
    std::string throughLink = *sb::issueFileReadExtension(sb::kReadOnlyClass, root / "bundle/Info.plist", sb::kCanonicalPath);
    std::filesystem::rename(root / "bundle", root / "elsewhere");
    std::filesystem::create_directory_symlink(root / "elsewhere", root / "bundle");
    EXPECT_EQ(sb::consumeExtension(throughLink), -1);
}

TEST(Sandbox, AResolvedPathIsGrantedAsGivenOnlyWhenPlain) {
    axtest::PlatformRoot root;
    std::string missing = root / "not/there/yet";  // not looked at
    struct Case {
        std::string path;
        bool granted;
    } cases[] = {
        {missing, true},
        {"/", true},
        {"", false},
        {"relative/path", false},
        {"/a/../b", false},
        {"/a/./b", false},
        {"/a//b", false},
        {"/a/b/", false},
        {"/a/..", false},
        {std::string("/a\0b", 4), false},
    };
    for (const auto& c : cases) {
        auto token = sb::issueFileReadExtension(sb::kReadOnlyClass, c.path, sb::kResolvedPath);
        ASSERT_EQ(static_cast<bool>(token), c.granted) << c.path;
        if (!token) {
            EXPECT_EQ(token.error().code, EINVAL) << c.path;
            continue;
        }
        auto parsed = sb::parseToken(*token);
        ASSERT_TRUE(parsed) << c.path;
        EXPECT_EQ(parsed->path, c.path);
        EXPECT_TRUE(sb::verifyToken(*parsed));
    }
}

TEST(Sandbox, ConfinementIsDetected) {
    EXPECT_FALSE(sb::isSandboxed(getpid()));
    EXPECT_TRUE(sb::isSandboxed(999999999));  // unknown counts as sandboxed

    int ready[2];
    ASSERT_EQ(pipe(ready), 0);
    pid_t seccomp = fork();
    if (seccomp == 0) {
        // Allow everything, but run under a seccomp filter.
        struct sock_filter allow[] = {BPF_STMT(BPF_RET | BPF_K, SECCOMP_RET_ALLOW)};
        struct sock_fprog prog = {1, allow};
        prctl(PR_SET_NO_NEW_PRIVS, 1, 0, 0, 0);
        if (prctl(PR_SET_SECCOMP, SECCOMP_MODE_FILTER, &prog) != 0) _exit(1);
        (void)!write(ready[1], "s", 1);
        pause();
        _exit(0);
    }
    char c;
    ASSERT_EQ(read(ready[0], &c, 1), 1);
    EXPECT_TRUE(sb::isSandboxed(seccomp));
    kill(seccomp, SIGKILL);
    waitpid(seccomp, nullptr, 0);

    pid_t namespaced = fork();
    if (namespaced == 0) {
        if (unshare(CLONE_NEWUSER) != 0) {
            (void)!write(ready[1], "n", 1);  // not allowed here
        } else {
            (void)!write(ready[1], "u", 1);
        }
        pause();
        _exit(0);
    }
    ASSERT_EQ(read(ready[0], &c, 1), 1);
    if (c == 'u') {
        EXPECT_TRUE(sb::isSandboxed(namespaced));
    }
    kill(namespaced, SIGKILL);
    waitpid(namespaced, nullptr, 0);
}
