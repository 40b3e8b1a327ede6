#include "platform/spawn/Watcher.h"

#include <pthread.h>
#include <sys/epoll.h>
#include <sys/eventfd.h>
#include <unistd.h>

#include <cstdlib>
#include <vector>

namespace corvane::spawn {

Watcher::Watcher(dispatch::QueuePtr queue)
    : queue_(std::move(queue)), epoll_(::epoll_create1(EPOLL_CLOEXEC)), wakeup_(::eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK)) {
    if (epoll_ < 0 || wakeup_ < 0) std::abort();
    epoll_event ev{};
    ev.events = EPOLLIN;
    ev.data.u64 = 0;
    ::epoll_ctl(epoll_, EPOLL_CTL_ADD, wakeup_, &ev);
    thread_ = std::thread([this] { run(); });
}

Watcher::~Watcher() {
    {
        MutexLock lock(mutex_);
        stopping_ = true;
    }
    wake();
    thread_.join();
    ::close(epoll_);
    ::close(wakeup_);
}

void Watcher::wake() {
    uint64_t one = 1;
    [[maybe_unused]] ssize_t n = ::write(wakeup_, &one, sizeof one);
}

uint64_t Watcher::whenReadable(int fd, std::function<void()> callback) {
    MutexLock lock(mutex_);
    uint64_t id = next_++;
    entries_[id] = Entry{std::move(callback), fd, {}};
    epoll_event ev{};
    ev.events = EPOLLIN | EPOLLONESHOT;
    ev.data.u64 = id;
    if (::epoll_ctl(epoll_, EPOLL_CTL_ADD, fd, &ev) != 0) std::abort();  // a bad descriptor is our bug
    return id;
}

uint64_t Watcher::after(std::chrono::milliseconds delay, std::function<void()> callback) {
    uint64_t id;
    {
        MutexLock lock(mutex_);
        id = next_++;
        Clock::time_point deadline = Clock::now() + delay;
        entries_[id] = Entry{std::move(callback), -1, deadline};
        timers_.emplace(deadline, id);
    }
    wake();
    return id;
}

void Watcher::cancel(uint64_t id) {
    MutexLock lock(mutex_);
    auto it = entries_.find(id);
    if (it == entries_.end()) return;
    if (it->second.fd >= 0) {
        ::epoll_ctl(epoll_, EPOLL_CTL_DEL, it->second.fd, nullptr);
    } else {
        auto [first, last] = timers_.equal_range(it->second.deadline);
        for (auto t = first; t != last; ++t) {
            if (t->second == id) {
                timers_.erase(t);
                break;
            }
        }
    }
    entries_.erase(it);
}

// On the queue: the entry is taken out only now, so that a cancel that ran first wins.
void Watcher::fire(uint64_t id) {
    std::function<void()> callback;
    {
        MutexLock lock(mutex_);
        auto it = entries_.find(id);
        if (it == entries_.end()) return;
        if (it->second.fd >= 0) ::epoll_ctl(epoll_, EPOLL_CTL_DEL, it->second.fd, nullptr);
        callback = std::move(it->second.callback);
        entries_.erase(it);
    }
    callback();
}

void Watcher::post(uint64_t id) {
    queue_->async([weak = weak_from_this(), id] {
        if (auto self = weak.lock()) self->fire(id);
    });
}

void Watcher::run() {
    pthread_setname_np(pthread_self(), "spawn.watcher");
    std::vector<uint64_t> due;
    for (;;) {
        int timeout = -1;
        {
            MutexLock lock(mutex_);
            if (stopping_) return;
            auto now = Clock::now();
            while (!timers_.empty() && timers_.begin()->first <= now) {
                due.push_back(timers_.begin()->second);
                timers_.erase(timers_.begin());
            }
            if (!timers_.empty()) {
                auto wait = std::chrono::ceil<std::chrono::milliseconds>(timers_.begin()->first - now);
                timeout = static_cast<int>(std::min<int64_t>(wait.count(), 60'000));
            }
        }
        for (uint64_t id : due) post(id);
        due.clear();
        epoll_event events[16];
        int n = ::epoll_wait(epoll_, events, 16, timeout);
        for (int i = 0; i < n; ++i) {
            uint64_t id = events[i].data.u64;
            if (id == 0) {
                uint64_t count;
                [[maybe_unused]] ssize_t r = ::read(wakeup_, &count, sizeof count);
                continue;
            }
            post(id);
        }
    }
}

}  // namespace corvane::spawn
