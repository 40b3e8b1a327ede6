// The sweeper: once a second, ends connections stuck in a partial frame, and after a burst of
// closed connections gives the freed memory back to the system.
#include <malloc.h>
#include <sys/timerfd.h>

#include <chrono>
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

}  // namespace corvane::rpx
