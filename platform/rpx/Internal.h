// Implementation of rpx shared by its files; not part of the public interface.
#pragma once

#include <sys/epoll.h>

#include <atomic>
#include <chrono>
#include <cstdint>
#include <functional>
#include <memory>
#include <set>
#include <thread>
#include <unordered_map>

#include "platform/dispatch/ThreadSafety.h"
#include "platform/log/Log.h"
#include "platform/rpx/Rpx.h"

namespace corvane::rpx::internal {

// Reading stops while more than this much is queued for a peer (in bytes, or in replies that its
// socket could not take: small replies to a peer that never reads would otherwise be made by the
// hundred thousand before their bytes count), or while it has this many requests unanswered or
// events undelivered, and starts again below half of it. A connection's own requests and messages
// waiting to go never stop it reading: the replies it waits for come that way.
inline constexpr size_t kHighWaterBytes = 8u << 20;
inline constexpr size_t kMaxQueuedReplies = 64;
inline constexpr size_t kMaxUnfinished = 32;
// Frames from this size on are charged to their connection's reading allowance
// (read-mib-per-second).
inline constexpr size_t kLargeFrameBytes = 64u << 10;

const log::Handle& rpxLog();

// The process's one I/O thread: an epoll loop that calls each descriptor's handler with the events
// it got. Thread-safe.
class IoLoop {
public:
    static IoLoop& shared() {
        static IoLoop* loop = new IoLoop();  // lives for the process's life
        return *loop;
    }

    void add(int fd, uint32_t events, std::function<void(uint32_t)> handler) {
        {
            MutexLock lock(mutex_);
            handlers_[fd] = std::make_shared<std::function<void(uint32_t)>>(std::move(handler));
        }
        struct epoll_event ev {};
        ev.events = events;
        ev.data.fd = fd;
        epoll_ctl(epoll_, EPOLL_CTL_ADD, fd, &ev);
    }
    void modify(int fd, uint32_t events) {
        struct epoll_event ev {};
        ev.events = events;
        ev.data.fd = fd;
        epoll_ctl(epoll_, EPOLL_CTL_MOD, fd, &ev);
    }
    void remove(int fd) {
        epoll_ctl(epoll_, EPOLL_CTL_DEL, fd, nullptr);
        MutexLock lock(mutex_);
        handlers_.erase(fd);
    }

private:
    IoLoop() {
        epoll_ = epoll_create1(EPOLL_CLOEXEC);
        thread_ = std::thread([this] { run(); });
        thread_.detach();
    }

    void run() {
        pthread_setname_np(pthread_self(), "rpx-io");
        dispatch::requestShortSlices();
        struct epoll_event events[64];
        for (;;) {
            int n = epoll_wait(epoll_, events, 64, -1);
            if (n < 0) {
                if (errno == EINTR) continue;
                return;
            }
            for (int i = 0; i < n; ++i) {
                std::shared_ptr<std::function<void(uint32_t)>> handler;
                {
                    MutexLock lock(mutex_);
                    auto it = handlers_.find(events[i].data.fd);
                    if (it != handlers_.end()) handler = it->second;
                }
                if (handler) (*handler)(events[i].events);
            }
        }
    }

    int epoll_ = -1;
    Mutex mutex_;
    std::unordered_map<int, std::shared_ptr<std::function<void(uint32_t)>>> handlers_ GUARDED_BY(mutex_);
    std::thread thread_;
};


// Replies queued for all peers together, in bytes.
extern std::atomic<size_t> gQueuedReplyBytes;
// Connections closed since memory was last given back to the system.
extern std::atomic<size_t> gClosedSinceTrim;

// Starts, once per process, the timer that ends connections stuck in a partial frame and gives
// memory back after bursts of connections.
void startSweeper();
// Runs `task` on the I/O thread at the sweeper's next round (within a second).
void afterSweep(std::function<void()> task);
// Runs `task` on the I/O thread once `delay` has passed.
void afterDelay(std::chrono::nanoseconds delay, std::function<void()> task);

// Counts a protocol violation by the peer process of an accepted connection: past
// `violations-per-second` of them in a second, its new connections are refused for a while
// (a quarter of a second, twice as long each time it goes on, up to eight seconds).
void recordViolation(pid_t pid);
// Whether new connections of the process are refused now.
bool connectionsBarred(pid_t pid);

// Closes the socket of a peer that broke the protocol on the reaper thread, at the lowest priority,
// or here when the reaper is already behind.
void closeSoon(int fd);

// The identity of the process at the other end of a connected socket.
PeerIdentity identityOfSocket(int sock);

// Every live connection, for termination.
extern Mutex gLiveMutex;
std::set<std::shared_ptr<Connection::Impl>>& live() REQUIRES(gLiveMutex);

}  // namespace corvane::rpx::internal
