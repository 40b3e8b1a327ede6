// The sweeper: once a second, ends connections stuck in a partial frame, and after a burst of
// closed connections gives the freed memory back to the system. Beside it, the timer that runs
// tasks on the I/O thread after a delay.
#include <malloc.h>
#include <sys/timerfd.h>

#include <chrono>
#include <map>
#include <mutex>
#include <vector>

#include "platform/rpx/ConnectionImpl.h"

namespace corvane::rpx {

namespace {

// Enough closed connections to have left memory worth trimming.
constexpr size_t kTrimAfterClosed = 32;

Mutex gLaterMutex;
std::vector<std::function<void()>>& later() REQUIRES(gLaterMutex) {
    static auto* tasks = new std::vector<std::function<void()>>();
    return *tasks;
}

void sweep() {
    std::vector<std::function<void()>> due;
    {
        MutexLock lock(gLaterMutex);
        due.swap(later());
    }
    for (auto& task : due) task();
    std::vector<std::shared_ptr<Connection::Impl>> connections;
    {
        MutexLock lock(gLiveMutex);
        connections.assign(live().begin(), live().end());
    }
    auto now = std::chrono::steady_clock::now();
    for (auto& impl : connections) impl->endIfStuck(now);
    connections.clear();
    if (gClosedSinceTrim.load() >= kTrimAfterClosed) {
        gClosedSinceTrim = 0;
        malloc_trim(0);
    }
}

}  // namespace

void internal::afterSweep(std::function<void()> task) {
    startSweeper();
    MutexLock lock(gLaterMutex);
    later().push_back(std::move(task));
}

void internal::startSweeper() {
    static std::once_flag once;
    std::call_once(once, [] {
        int tfd = timerfd_create(CLOCK_MONOTONIC, TFD_CLOEXEC | TFD_NONBLOCK);
        if (tfd < 0) return;
        struct itimerspec every {};
        every.it_interval.tv_sec = 1;
        every.it_value.tv_sec = 1;
        timerfd_settime(tfd, 0, &every, nullptr);
        IoLoop::shared().add(tfd, EPOLLIN, [tfd](uint32_t) {
            uint64_t expirations;
            if (::read(tfd, &expirations, sizeof expirations) != sizeof expirations) return;
            sweep();
        });
    });
}

namespace {

Mutex gDelayedMutex;
int gDelayTimer GUARDED_BY(gDelayedMutex) = -1;
std::multimap<std::chrono::steady_clock::time_point, std::function<void()>>& delayed() REQUIRES(gDelayedMutex) {
    static auto* tasks = new std::multimap<std::chrono::steady_clock::time_point, std::function<void()>>();
    return *tasks;
}

// Sets the timer to the earliest task, or disarms it.
void armDelayTimer() REQUIRES(gDelayedMutex) {
    struct itimerspec at {};
    if (!delayed().empty()) {
        auto wait = delayed().begin()->first - std::chrono::steady_clock::now();
        auto ns = std::max<int64_t>(1, std::chrono::duration_cast<std::chrono::nanoseconds>(wait).count());
        at.it_value.tv_sec = ns / 1'000'000'000;
        at.it_value.tv_nsec = ns % 1'000'000'000;
    }
    timerfd_settime(gDelayTimer, 0, &at, nullptr);
}

void runDueTasks() {
    std::vector<std::function<void()>> due;
    {
        MutexLock lock(gDelayedMutex);
        uint64_t expirations;
        (void)!::read(gDelayTimer, &expirations, sizeof expirations);
        auto now = std::chrono::steady_clock::now();
        auto& tasks = delayed();
        while (!tasks.empty() && tasks.begin()->first <= now) {
            due.push_back(std::move(tasks.begin()->second));
            tasks.erase(tasks.begin());
        }
        armDelayTimer();
    }
    for (auto& task : due) task();
}

}  // namespace

void internal::afterDelay(std::chrono::nanoseconds delay, std::function<void()> task) {
    MutexLock lock(gDelayedMutex);
    if (gDelayTimer < 0) {
        gDelayTimer = timerfd_create(CLOCK_MONOTONIC, TFD_CLOEXEC | TFD_NONBLOCK);
        if (gDelayTimer < 0) {
            // No timer to be had: the sweeper's next round is later, but still comes.
            afterSweep(std::move(task));
            return;
        }
        IoLoop::shared().add(gDelayTimer, EPOLLIN, [](uint32_t) { runDueTasks(); });
    }
    delayed().emplace(std::chrono::steady_clock::now() + delay, std::move(task));
    armDelayTimer();
}

}  // namespace corvane::rpx
