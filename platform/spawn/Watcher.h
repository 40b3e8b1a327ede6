// One thread that waits for descriptors to become readable (process descriptors, here) and for
// timers, and runs the callbacks on a serial queue.
//
// Thread-safe; owned through a shared_ptr. A callback cancelled on its queue before it ran does not run.
#pragma once

#include <chrono>
#include <cstdint>
#include <functional>
#include <map>
#include <memory>
#include <thread>

#include "platform/dispatch/Dispatch.h"
#include "platform/dispatch/ThreadSafety.h"

namespace corvane::spawn {

class Watcher : public std::enable_shared_from_this<Watcher> {
public:
    explicit Watcher(dispatch::QueuePtr queue);
    ~Watcher();
    Watcher(const Watcher&) = delete;
    Watcher& operator=(const Watcher&) = delete;

    // Runs `callback` once, when `fd` becomes readable. The descriptor must stay open until then
    // or until the watch is cancelled.
    uint64_t whenReadable(int fd, std::function<void()> callback);
    // Runs `callback` once, after `delay`.
    uint64_t after(std::chrono::milliseconds delay, std::function<void()> callback);
    void cancel(uint64_t id);

private:
    using Clock = std::chrono::steady_clock;
    struct Entry {
        std::function<void()> callback;
        int fd = -1;
        Clock::time_point deadline;
    };

    void run();
    void fire(uint64_t id);
    void post(uint64_t id);
    void wake();

    const dispatch::QueuePtr queue_;
    const int epoll_;
    const int wakeup_;
    Mutex mutex_;
    uint64_t next_ GUARDED_BY(mutex_) = 1;
    std::map<uint64_t, Entry> entries_ GUARDED_BY(mutex_);
    std::multimap<Clock::time_point, uint64_t> timers_ GUARDED_BY(mutex_);
    bool stopping_ GUARDED_BY(mutex_) = false;
    std::thread thread_;
};

}  // namespace corvane::spawn
