// Listener: a named endpoint that accepts connections.
#include <sys/socket.h>
#include <sys/timerfd.h>
#include <sys/un.h>
#include <systemd/sd-daemon.h>

#include <algorithm>
#include <chrono>
#include <map>
#include <vector>

#include "platform/layout/Layout.h"
#include "platform/rpx/ConnectionImpl.h"

namespace corvane::rpx {

namespace {
constexpr int kAcceptsPerWakeup = 16;
constexpr size_t kRememberedProcesses = 1024;
// How long accepting pauses after a wake-up that closed connections of a barred process: long
// enough that a flooding process spends most of its time blocked in connect() (after 10 ms pauses
// it still kept a core busy sending into the backlog); a well-behaved client's connect waits in the
// kernel meanwhile and is taken at the next wake-up.
constexpr long kBarredPauseNanoseconds = 50'000'000;
}  // namespace

struct Listener::Impl : std::enable_shared_from_this<Listener::Impl> {
    Mutex mutex;
    int fd GUARDED_BY(mutex) = -1;
    std::string path;               // set at creation, then fixed
    bool inherited = false;         // the service manager's socket: its file is not ours to remove
    dispatch::QueuePtr queue;       // set at creation, then fixed
    dispatch::QueuePtr delivery;    // set at creation, then fixed
    std::function<void(ConnectionPtr)> handler GUARDED_BY(mutex);
    size_t maxFrame GUARDED_BY(mutex) = kDefaultListenerMaxFrame;
    bool inlineDelivery GUARDED_BY(mutex) = false;
    bool resumed GUARDED_BY(mutex) = false;
    // Held open so that, out of descriptors, a waiting connection can still be taken off the
    // backlog and closed instead of being reported again and again.
    int spare GUARDED_BY(mutex) = -1;
    // The accepted connections of each process, to bound them.
    std::map<pid_t, std::vector<std::weak_ptr<Connection::Impl>>> byProcess GUARDED_BY(mutex);
    std::chrono::steady_clock::time_point lastRefusalLog GUARDED_BY(mutex);
    // Ends a pause of accepting (a one-shot timer, made on first use).
    int pauseTimer GUARDED_BY(mutex) = -1;

    ~Impl() NO_THREAD_SAFETY_ANALYSIS {
        if (spare >= 0) ::close(spare);
        if (pauseTimer >= 0) {
            IoLoop::shared().remove(pauseTimer);
            ::close(pauseTimer);
        }
    }

    // Stops watching the socket for a moment. Connections of a barred process were just closed
    // unread: while accepting pauses, a flood of them fills the backlog and its connect() blocks,
    // instead of keeping the I/O thread and a core busy with accepting and closing. Connections
    // already accepted are served meanwhile; new ones wait at most a few pauses.
    void pauseAccepting() REQUIRES(mutex) {
        if (pauseTimer < 0) {
            pauseTimer = timerfd_create(CLOCK_MONOTONIC, TFD_CLOEXEC | TFD_NONBLOCK);
            if (pauseTimer < 0) return;
            std::weak_ptr<Impl> weak = shared_from_this();
            int timer = pauseTimer;
            IoLoop::shared().add(timer, EPOLLIN, [weak, timer](uint32_t) {
                // The listener first: while it lives, so does its timer's descriptor.
                auto impl = weak.lock();
                if (!impl) return;
                uint64_t expirations;
                if (::read(timer, &expirations, sizeof expirations) != sizeof expirations) return;
                impl->resumeAccepting();
            });
        }
        struct itimerspec once {};
        once.it_value.tv_nsec = kBarredPauseNanoseconds;
        if (timerfd_settime(pauseTimer, 0, &once, nullptr) != 0) return;
        IoLoop::shared().modify(fd, 0);
    }

    // Out of descriptors: takes one connection off the backlog with the spare descriptor and closes
    // it. False when even that fails (the backlog then waits for the next event).
    bool shedOne() REQUIRES(mutex) {
        if (spare < 0) return false;
        ::close(spare);
        int client = accept4(fd, nullptr, nullptr, SOCK_CLOEXEC);
        if (client >= 0) ::close(client);
        spare = ::open("/dev/null", O_RDONLY | O_CLOEXEC);
        logRefusal("out of file descriptors; a new connection was closed");
        return client >= 0;
    }

    // At most one line a second: a flood of refusals must not flood the log as well.
    void logRefusal(const char* why) REQUIRES(mutex) {
        auto now = std::chrono::steady_clock::now();
        if (now - lastRefusalLog < std::chrono::seconds(1)) return;
        lastRefusalLog = now;
        log::error(rpxLog(), "rpx: %{public}s (%{public}s)", why, path);
    }

    // Whether the process may have one more connection; counts the new one when it may. A
    // connection counts until it is gone entirely, also when it has ended but still waits to be
    // set up or to deliver its end: what a flood of connections holds stays bounded too.
    bool admit(pid_t pid, const std::shared_ptr<Connection::Impl>& impl) REQUIRES(mutex) {
        auto gone = [](const std::weak_ptr<Connection::Impl>& w) { return w.expired(); };
        // Processes come and go: now and then the table forgets those without connections.
        if (byProcess.size() > kRememberedProcesses) {
            for (auto it = byProcess.begin(); it != byProcess.end();) {
                auto& list = it->second;
                list.erase(std::remove_if(list.begin(), list.end(), gone), list.end());
                it = list.empty() ? byProcess.erase(it) : std::next(it);
            }
        }
        auto& mine = byProcess[pid];
        mine.erase(std::remove_if(mine.begin(), mine.end(), gone), mine.end());
        if (mine.size() >= limits().connectionsPerProcess) return false;
        mine.push_back(impl);
        return true;
    }

    void resumeAccepting() EXCLUDES(mutex) {
        {
            MutexLock lock(mutex);
            if (fd < 0) return;
            if (spare < 0) spare = ::open("/dev/null", O_RDONLY | O_CLOEXEC);
            IoLoop::shared().modify(fd, EPOLLIN);
        }
        onAcceptable();
    }

    void onAcceptable() {
        bool closedBarred = false;
        acceptSome(closedBarred);
        if (closedBarred) {
            MutexLock lock(mutex);
            if (fd >= 0) pauseAccepting();
        }
    }

    void acceptSome(bool& closedBarred) {
        // A few connections per wake-up: the I/O thread serves every connection, and a flood of
        // new ones must not keep it from the others (epoll reports the rest again at once).
        for (int taken = 0; taken < kAcceptsPerWakeup; ++taken) {
            int client;
            {
                MutexLock lock(mutex);
                if (fd < 0) return;
                client = accept4(fd, nullptr, nullptr, SOCK_CLOEXEC | SOCK_NONBLOCK);
                if (client < 0 && (errno == EMFILE || errno == ENFILE)) {
                    if (shedOne()) continue;
                    // Not even the spare helped (another thread took the descriptor it freed):
                    // stop watching the socket for a moment instead of being told again at once.
                    IoLoop::shared().modify(fd, 0);
                    std::weak_ptr<Impl> weak = shared_from_this();
                    afterSweep([weak] {
                        if (auto impl = weak.lock()) impl->resumeAccepting();
                    });
                    return;
                }
            }
            if (client < 0) {
                if (errno == EINTR) continue;
                return;
            }
            // The pid alone first: a refused connection costs no more than that.
            struct ucred cred {};
            socklen_t credLength = sizeof cred;
            getsockopt(client, SOL_SOCKET, SO_PEERCRED, &cred, &credLength);
            if (connectionsBarred(cred.pid)) {
                closeSoon(client);
                closedBarred = true;
                continue;
            }
            size_t frameLimit;
            bool inlined;
            {
                MutexLock lock(mutex);
                frameLimit = maxFrame;
                inlined = inlineDelivery;
            }
            auto impl = std::make_shared<Connection::Impl>(client, delivery, frameLimit);
            impl->peerPid = cred.pid;
            impl->accepted = true;
            impl->inlineDelivery = inlined;
            {
                MutexLock lock(mutex);
                if (!admit(cred.pid, impl)) {
                    logRefusal("a process reached its limit of connections; a new one was closed");
                    MutexLock closing(impl->mutex);
                    impl->closeLocked();
                    continue;
                }
            }
            PeerIdentity peer = identityOfSocket(client);
            auto connection = std::shared_ptr<Connection>(new Connection(impl, std::move(peer)));
            {
                MutexLock lock(impl->mutex);
                impl->self = connection;
            }
            impl->start();
            std::function<void(ConnectionPtr)> h;
            {
                MutexLock lock(mutex);
                h = handler;
            }
            queue->async([h, connection] {
                if (h) h(connection);
            });
        }
    }
};

Listener::Listener(std::shared_ptr<Impl> impl) : impl_(std::move(impl)) {}

Listener::~Listener() { cancel(); }

namespace {

// The bound path of a Unix socket, or "".
std::string boundPath(int fd) {
    struct sockaddr_un addr {};
    socklen_t length = sizeof addr;
    if (::getsockname(fd, reinterpret_cast<sockaddr*>(&addr), &length) != 0 || addr.sun_family != AF_UNIX ||
        length <= offsetof(sockaddr_un, sun_path) || addr.sun_path[0] == '\0') {
        return "";
    }
    return std::string(addr.sun_path, strnlen(addr.sun_path, length - offsetof(sockaddr_un, sun_path)));
}

// The listening sockets a service manager handed this process (socket activation), read once:
// each is taken by the listener whose endpoint it serves, found by its name (LISTEN_FDNAMES) or by
// the path it is bound to. Descriptors that are no listening Unix stream socket are closed.
Mutex gInheritedMutex;
std::vector<std::pair<std::string, int>>& inheritedSockets() REQUIRES(gInheritedMutex) {
    static auto* sockets = [] {
        auto* list = new std::vector<std::pair<std::string, int>>();
        char** names = nullptr;
        int count = sd_listen_fds_with_names(1, &names);
        for (int i = 0; i < count; ++i) {
            int fd = SD_LISTEN_FDS_START + i;
            std::string name = names && names[i] ? names[i] : "";
            if (sd_is_socket_unix(fd, SOCK_STREAM, 1, nullptr, 0) > 0) {
                ::fcntl(fd, F_SETFD, FD_CLOEXEC);
                ::fcntl(fd, F_SETFL, ::fcntl(fd, F_GETFL) | O_NONBLOCK);
                list->emplace_back(name, fd);
            } else {
                log::error(rpxLog(), "ignoring inherited descriptor %d (%{public}@): not a listening Unix stream socket", fd, name);
                ::close(fd);
            }
        }
        if (names) {
            for (int i = 0; i < count; ++i) free(names[i]);
            free(names);
        }
        return list;
    }();
    return *sockets;
}

int takeInheritedSocket(const std::string& name, const std::string& path) {
    MutexLock lock(gInheritedMutex);
    auto& sockets = inheritedSockets();
    for (auto it = sockets.begin(); it != sockets.end(); ++it) {
        if (it->first == name || boundPath(it->second) == path) {
            int fd = it->second;
            sockets.erase(it);
            return fd;
        }
    }
    return -1;
}

}  // namespace

void closeUnclaimedSockets() {
    MutexLock lock(gInheritedMutex);
    for (const auto& [name, fd] : inheritedSockets()) {
        log::error(rpxLog(), "closing passed socket %{public}@ (%{public}@): no endpoint of this process serves it",
                   boundPath(fd), name);
        ::close(fd);
    }
    inheritedSockets().clear();
}

Result<std::shared_ptr<Listener>> Listener::create(const std::string& name, dispatch::QueuePtr queue) {
    if (name.empty() || name.find('/') != std::string::npos || name[0] == '.')
        return Error::posix(EINVAL, "invalid endpoint name: " + name);
    if (int inherited = takeInheritedSocket(name, endpointPath(name)); inherited >= 0) {
        log::info(rpxLog(), "serving %{public}@ on the socket the service manager passed", name);
        return adoptListening(inherited, endpointPath(name), std::move(queue), true);
    }
    std::string dir = layout::runtimeDir() + "/rpx";
    if (Status made = layout::makeDirectories(dir, 0700); !made.ok()) return made.error();
    std::string path = endpointPath(name);
    struct sockaddr_un addr {};
    addr.sun_family = AF_UNIX;
    if (path.size() >= sizeof addr.sun_path) return Error::posix(ENAMETOOLONG, path);
    std::memcpy(addr.sun_path, path.c_str(), path.size() + 1);

    // A socket file left by a dead listener refuses connections: replace it. A live one answers:
    // refuse to take its name.
    int probe = socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
    if (probe >= 0) {
        int rc = ::connect(probe, reinterpret_cast<sockaddr*>(&addr), sizeof addr);
        ::close(probe);
        if (rc == 0)
            return Error{kPosixErrorDomain, EADDRINUSE,
                         "endpoint \"" + name + "\" is already served by another process"};
    }
    // The socket is bound under a private name and renamed into place once it listens, so the
    // endpoint's name never shows a socket that refuses connections (a client or a second daemon
    // would take it for a dead one).
    std::string staging = dir + "/." + name + "." + std::to_string(::getpid());
    struct sockaddr_un stagingAddr {};
    stagingAddr.sun_family = AF_UNIX;
    if (staging.size() >= sizeof stagingAddr.sun_path) return Error::posix(ENAMETOOLONG, staging);
    std::memcpy(stagingAddr.sun_path, staging.c_str(), staging.size() + 1);
    ::unlink(staging.c_str());
    int fd = socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0);
    if (fd < 0) return Error::posix(errno, "socket");
    if (bind(fd, reinterpret_cast<sockaddr*>(&stagingAddr), sizeof stagingAddr) != 0 || listen(fd, 128) != 0 ||
        ::rename(staging.c_str(), path.c_str()) != 0) {
        int err = errno;
        ::close(fd);
        ::unlink(staging.c_str());
        return Error::posix(err, path);
    }
    return adoptListening(fd, path, std::move(queue), false);
}

std::shared_ptr<Listener> Listener::adoptListening(int fd, const std::string& path, dispatch::QueuePtr queue,
                                                   bool inherited) {
    auto impl = std::make_shared<Impl>();
    {
        MutexLock lock(impl->mutex);
        impl->fd = fd;
        impl->spare = ::open("/dev/null", O_RDONLY | O_CLOEXEC);
    }
    impl->path = path;
    impl->inherited = inherited;
    impl->queue = std::move(queue);
    impl->delivery = dispatch::Queue::create("rpx.delivery");
    return std::shared_ptr<Listener>(new Listener(impl));
}

void Listener::setConnectionHandler(std::function<void(ConnectionPtr)> handler) {
    MutexLock lock(impl_->mutex);
    impl_->handler = std::move(handler);
}

void Listener::setMaxFrameSize(size_t bytes) {
    MutexLock lock(impl_->mutex);
    impl_->maxFrame = bytes;
}

void Listener::setInlineDelivery(bool enabled) {
    MutexLock lock(impl_->mutex);
    impl_->inlineDelivery = enabled;
}

void Listener::resume() {
    MutexLock lock(impl_->mutex);
    if (impl_->resumed || impl_->fd < 0) return;
    impl_->resumed = true;
    std::weak_ptr<Impl> weak = impl_;
    IoLoop::shared().add(impl_->fd, EPOLLIN, [weak](uint32_t) {
        if (auto impl = weak.lock()) impl->onAcceptable();
    });
}

void Listener::cancel() {
    MutexLock lock(impl_->mutex);
    if (impl_->fd < 0) return;
    if (impl_->resumed) IoLoop::shared().remove(impl_->fd);
    ::close(impl_->fd);
    impl_->fd = -1;
    if (!impl_->inherited) ::unlink(impl_->path.c_str());
}

const std::string& Listener::path() const { return impl_->path; }

}  // namespace corvane::rpx

namespace corvane::rpx {

Result<std::shared_ptr<Listener>> serveRequests(const std::string& name, dispatch::QueuePtr queue,
                                                std::function<Value(const Connection&, const Value&)> answer) {
    auto listener = Listener::create(name, std::move(queue));
    if (!listener) return listener.error();
    (*listener)->setConnectionHandler([answer = std::move(answer)](ConnectionPtr c) {
        std::weak_ptr<Connection> weak = c;
        c->setEventHandler([weak, answer](const Event& ev) {
            auto connection = weak.lock();
            if (!connection || ev.isError() || !ev.wantsReply) return;
            connection->sendReply(ev.messageId, answer(*connection, ev.message));
        });
        c->resume();
    });
    (*listener)->resume();
    return *listener;
}

}  // namespace corvane::rpx
