// Termination: SIGTERM becomes the termination-imminent event on every live connection.
#include <signal.h>
#include <sys/signalfd.h>

#include <atomic>
#include <chrono>
#include <thread>

#include "platform/rpx/ConnectionImpl.h"

namespace corvane::rpx {

// Every live connection, for termination.
Mutex internal::gLiveMutex;
std::set<std::shared_ptr<Connection::Impl>>& internal::live() {
    static auto* s = new std::set<std::shared_ptr<Connection::Impl>>();
    return *s;
}

void handleTermination() {
    sigset_t set;
    sigemptyset(&set);
    sigaddset(&set, SIGTERM);
    pthread_sigmask(SIG_BLOCK, &set, nullptr);
    int sfd = signalfd(-1, &set, SFD_CLOEXEC | SFD_NONBLOCK);
    if (sfd < 0) return;
    IoLoop::shared().add(sfd, EPOLLIN, [sfd](uint32_t) {
        struct signalfd_siginfo info {};
        if (::read(sfd, &info, sizeof info) != static_cast<ssize_t>(sizeof info)) return;
        std::vector<std::shared_ptr<Connection::Impl>> connections;
        {
            MutexLock lock(gLiveMutex);
            connections.assign(live().begin(), live().end());
        }
        // Deliver the event, wait (boundedly) until every handler has seen it, then end.
        auto remaining = std::make_shared<std::atomic<size_t>>(connections.size());
        for (auto& impl : connections) {
            {
                MutexLock lock(impl->mutex);
                Event ev;
                ev.error = ErrorKind::TerminationImminent;
                impl->postEvent(std::move(ev));
            }
            if (impl->inlineDelivery) {
                impl->runReady();
                --*remaining;
            } else {
                impl->delivery->async([remaining] { --*remaining; });
            }
        }
        std::thread([remaining] {
            for (int i = 0; i < 200 && *remaining > 0; ++i)
                std::this_thread::sleep_for(std::chrono::milliseconds(10));
            std::fflush(nullptr);
            _exit(0);
        }).detach();
    });
}

}  // namespace corvane::rpx
