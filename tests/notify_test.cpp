#include <gtest/gtest.h>
#include <sys/wait.h>
#include <unistd.h>

#include <atomic>
#include <chrono>
#include <thread>

#include "platform/notify/Notify.h"
#include "tests/support/TestSupport.h"

namespace notify = corvane::notify;
using corvane::dispatch::Queue;

TEST(Notify, PostsFromAnotherProcessReachAnObserver) {
    axtest::PlatformRoot root;
    const std::string name = "com.corvane.annexa.annotation-change";
    // The poster is forked before this process starts any thread, and posts when told to.
    int go[2];
    ASSERT_EQ(pipe(go), 0);
    pid_t pid = fork();
    ASSERT_GE(pid, 0);
    if (pid == 0) {
        char c;
        if (read(go[0], &c, 1) != 1) _exit(2);
        _exit(notify::post(name).ok() ? 0 : 1);
    }
    auto queue = Queue::create("observer");
    std::atomic<int> calls{0};
    auto observer = notify::Observer::observe(name, queue, [&] { ++calls; });
    ASSERT_TRUE(observer) << observer.error().description();
    auto other = notify::Observer::observe("other.name", queue, [&] { calls += 100; });
    ASSERT_TRUE(other);
    ASSERT_EQ(write(go[1], "g", 1), 1);
    int status = 0;
    waitpid(pid, &status, 0);
    ASSERT_EQ(WEXITSTATUS(status), 0);

    EXPECT_TRUE(axtest::eventually([&] { return calls > 0; }));
    EXPECT_EQ(calls.load(), 1);
    EXPECT_EQ(notify::count(name), 1u);
    EXPECT_EQ(notify::count("other.name"), 0u);
}

TEST(Notify, CountersAreExactUnderConcurrentPosters) {
    axtest::PlatformRoot root;
    const int kProcs = 4;
    const int kPosts = 50;
    std::vector<pid_t> kids;
    for (int p = 0; p < kProcs; ++p) {
        pid_t pid = fork();
        if (pid == 0) {
            for (int i = 0; i < kPosts; ++i)
                if (!notify::post("n").ok()) _exit(1);
            _exit(0);
        }
        kids.push_back(pid);
    }
    for (pid_t pid : kids) {
        int status = 0;
        waitpid(pid, &status, 0);
        EXPECT_EQ(WEXITSTATUS(status), 0);
    }
    EXPECT_EQ(notify::count("n"), static_cast<uint64_t>(kProcs * kPosts));
    for (const char* bad : {"", ".", "..", "a/b"}) EXPECT_FALSE(notify::post(bad).ok()) << bad;
}
