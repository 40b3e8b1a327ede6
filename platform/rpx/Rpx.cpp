#include "platform/rpx/Rpx.h"

#include <fcntl.h>
#include <signal.h>
#include <poll.h>
#include <sys/epoll.h>
#include <sys/eventfd.h>
#include <sys/signalfd.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <sys/un.h>
#include <unistd.h>

#include <atomic>
#include <cerrno>
#include <chrono>
#include <condition_variable>
#include <cstdio>
#include <cstring>
#include <deque>
#include <map>
#include <mutex>
#include <set>
#include <thread>
#include <unordered_map>

#include "platform/layout/Layout.h"
#include "platform/log/Log.h"
#include "platform/rpx/Wire.h"

#ifndef SO_PEERPIDFD
#define SO_PEERPIDFD 77
#endif

namespace corvane::rpx {

namespace {

// Reading stops while more than this much is queued for a peer, or while it has this many
// requests unanswered or events undelivered, and starts again below half of it.
constexpr size_t kHighWaterBytes = 8u << 20;
constexpr size_t kMaxUnfinished = 256;

const log::Handle& rpxLog() {
    static const log::Handle h("com.corvane.rpx", "rpx");
    return h;
}

std::atomic<uint64_t> gOutstandingWork{0};

// ---- the I/O thread

class IoLoop {
public:
    static IoLoop& shared() {
        static IoLoop* loop = new IoLoop();  // lives for the process's life
        return *loop;
    }

    void add(int fd, uint32_t events, std::function<void(uint32_t)> handler) {
        {
            std::lock_guard lock(mutex_);
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
        std::lock_guard lock(mutex_);
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
                    std::lock_guard lock(mutex_);
                    auto it = handlers_.find(events[i].data.fd);
                    if (it != handlers_.end()) handler = it->second;
                }
                if (handler) (*handler)(events[i].events);
            }
        }
    }

    int epoll_ = -1;
    std::mutex mutex_;
    std::unordered_map<int, std::shared_ptr<std::function<void(uint32_t)>>> handlers_;
    std::thread thread_;
};

std::string readLink(const std::string& path, size_t max) {
    std::string buf(max, '\0');
    ssize_t n = readlink(path.c_str(), buf.data(), max);
    if (n <= 0 || static_cast<size_t>(n) >= max) return {};
    buf.resize(static_cast<size_t>(n));
    return buf;
}

uint64_t startTimeOf(pid_t pid) {
    FILE* f = std::fopen(("/proc/" + std::to_string(pid) + "/stat").c_str(), "re");
    if (!f) return 0;
    char buf[1024];
    size_t n = std::fread(buf, 1, sizeof buf - 1, f);
    std::fclose(f);
    buf[n] = 0;
    // Field 22; the command name (field 2) may hold spaces and parentheses, so count from the last
    // ')'.
    char* p = std::strrchr(buf, ')');
    if (!p) return 0;
    int field = 2;
    for (; *p && field < 22; ++p)
        if (*p == ' ') ++field;
    return std::strtoull(p, nullptr, 10);
}

std::shared_ptr<FileDescriptor> peerPidfd(int sock, pid_t pid) {
    int pidfd = -1;
    socklen_t len = sizeof pidfd;
    if (getsockopt(sock, SOL_SOCKET, SO_PEERPIDFD, &pidfd, &len) == 0 && pidfd >= 0)
        return std::make_shared<FileDescriptor>(pidfd);
    long fd = syscall(SYS_pidfd_open, pid, 0);
    if (fd >= 0) return std::make_shared<FileDescriptor>(static_cast<int>(fd));
    return nullptr;
}

PeerIdentity identityOfSocket(int sock) {
    struct ucred cred {};
    socklen_t len = sizeof cred;
    if (getsockopt(sock, SOL_SOCKET, SO_PEERCRED, &cred, &len) != 0) return {};
    return identityOfProcess(cred.pid, cred.uid, cred.gid, peerPidfd(sock, cred.pid));
}

// Every live connection, for termination.
std::mutex gLiveMutex;
std::set<std::shared_ptr<Connection::Impl>>& live() {
    static auto* s = new std::set<std::shared_ptr<Connection::Impl>>();
    return *s;
}

}  // namespace

PeerIdentity identityOfProcess(pid_t pid, uid_t uid, gid_t gid, std::shared_ptr<FileDescriptor> pidfd) {
    PeerIdentity p;
    p.pid = pid;
    p.uid = uid;
    p.gid = gid;
    std::string exe = "/proc/" + std::to_string(pid) + "/exe";
    p.executablePath = readLink(exe, 2048);
    p.auditToken.pid = pid;
    p.auditToken.uid = uid;
    p.auditToken.gid = gid;
    p.auditToken.pidfd = std::move(pidfd);
    struct stat st {};
    if (::stat(exe.c_str(), &st) == 0) {
        p.auditToken.exeDevice = st.st_dev;
        p.auditToken.exeInode = st.st_ino;
    }
    p.auditToken.startTime = startTimeOf(pid);
    return p;
}

const char* errorDescription(ErrorKind kind) {
    switch (kind) {
        case ErrorKind::ConnectionInvalid: return "Connection invalid";
        case ErrorKind::TerminationImminent: return "Termination imminent";
    }
    return "?";
}

std::string Event::description() const {
    return error ? errorDescription(*error) : message.description();
}

std::string Reply::description() const { return error ? errorDescription(*error) : value.description(); }

std::string endpointPath(const std::string& name) { return layout::runtimeDir() + "/rpx/" + name; }

// ---- connection internals

struct Connection::Impl : std::enable_shared_from_this<Connection::Impl> {
    struct Outgoing {
        std::string bytes;
        size_t offset = 0;
        std::vector<std::shared_ptr<FileDescriptor>> fds;  // sent with the first byte
    };
    // A completion without a queue is internal (a synchronous wait) and runs right where the
    // reply is read, saving a thread hop.
    struct Pending {
        dispatch::QueuePtr queue;
        std::function<void(const Reply&)> completion;

        void complete(Reply reply) {
            if (!queue) {
                completion(reply);
                return;
            }
            queue->async([c = std::move(completion), r = std::move(reply)] { c(r); });
        }
    };

    Impl(int socket, dispatch::QueuePtr deliveryQueue, size_t maxFrame)
        : fd(socket), delivery(std::move(deliveryQueue)), reader(maxFrame, kMaxDepth) {}
    ~Impl() {
        if (pollFd >= 0) ::close(pollFd);
    }
    Impl(const Impl&) = delete;
    Impl& operator=(const Impl&) = delete;

    std::mutex mutex;
    int fd;
    dispatch::QueuePtr delivery;
    wire::FrameReader reader;
    std::function<void(const Event&)> handler;
    std::shared_ptr<void> context;
    std::function<void(std::shared_ptr<void>)> finalizer;
    bool resumed = false;
    bool invalid = false;
    bool readPaused = false;
    bool wantWrite = false;
    std::deque<Event> held;  // events before resume
    // Inline delivery (Listener::setInlineDelivery): events wait in `ready` for a thread to run
    // them; `running` says one does, so handlers never overlap. Set before start, then fixed.
    bool inlineDelivery = false;
    std::deque<Event> ready;
    bool running = false;
    // A synchronous sender reads the socket itself while it waits, instead of being woken by the
    // I/O thread, which leaves the socket alone meanwhile. One such reader at a time; it polls a
    // duplicate of the socket, which stays open (and reports the hang-up) when the connection
    // closes under it.
    bool syncReader = false;
    int pollFd = -1;
    std::deque<Outgoing> out;
    size_t outBytes = 0;
    std::map<uint64_t, Pending> pending;
    uint64_t nextId = 1;
    size_t unfinished = 0;  // events delivered but not handled, plus requests not yet answered
    std::set<uint64_t> unanswered;
    pid_t peerPid = 0;
    // An accepted connection keeps itself alive until its invalid event has been delivered.
    std::shared_ptr<Connection> self;

    // While paused, neither input nor a half-close is asked for: epoll is level-triggered and
    // would report them again and again. A peer that is gone entirely still shows as EPOLLHUP.
    uint32_t interest() const {
        return (readPaused || syncReader ? 0u : static_cast<uint32_t>(EPOLLIN | EPOLLRDHUP)) |
               (wantWrite ? static_cast<uint32_t>(EPOLLOUT) : 0u);
    }

    void updateInterest() {
        if (fd >= 0) IoLoop::shared().modify(fd, interest());
    }

    // Back-pressure: stop reading from a peer that does not keep up, resume when it has.
    void checkPressure() {
        bool over = outBytes > kHighWaterBytes || unfinished > kMaxUnfinished;
        bool under = outBytes <= kHighWaterBytes / 2 && unfinished <= kMaxUnfinished / 2;
        if (!readPaused && over) {
            readPaused = true;
            updateInterest();
        } else if (readPaused && under) {
            readPaused = false;
            updateInterest();
            // Frames already read wait in the buffer; epoll will not mention them again.
            drainFrames();
        }
    }

    // Hands on the complete frames already read, as long as the peer keeps up. One read can hold
    // thousands of small requests, so the pause is checked frame by frame. Called with the mutex
    // held.
    void drainFrames() {
        wire::Frame frame;
        std::string error;
        while (!readPaused && !invalid) {
            auto status = reader.next(frame, error);
            if (status == wire::FrameReader::Status::NeedMore) return;
            if (status == wire::FrameReader::Status::Error) {
                log::error(rpxLog(), "rpx: closing connection to pid %d: %{public}s", peerPid, error);
                closeLocked();
                return;
            }
            handleFrame(std::move(frame));
            checkPressure();
        }
    }

    void postEvent(Event ev) {
        // Called with the mutex held.
        if (!resumed) {
            held.push_back(std::move(ev));
            return;
        }
        ++unfinished;
        if (inlineDelivery) {
            ready.push_back(std::move(ev));
            return;
        }
        delivery->async([impl = shared_from_this(), ev = std::move(ev)] { impl->runHandler(ev); });
    }

    // Inline delivery: runs the ready events on this thread unless another thread already does (it
    // will see them). Called without the mutex, after every operation that may have made an event
    // ready.
    void runReady() {
        if (!inlineDelivery) return;
        auto keep = shared_from_this();  // the last event may release the connection's own hold
        std::unique_lock lock(mutex);
        if (running) return;
        running = true;
        while (!ready.empty()) {
            Event ev = std::move(ready.front());
            ready.pop_front();
            lock.unlock();
            runHandler(ev);
            lock.lock();
        }
        running = false;
    }

    void runHandler(const Event& ev) {
        std::function<void(const Event&)> h;
        {
            std::lock_guard lock(mutex);
            h = handler;
        }
        if (h) h(ev);
        std::shared_ptr<Connection> last;
        {
            std::lock_guard lock(mutex);
            if (unfinished) --unfinished;
            if (ev.error == ErrorKind::ConnectionInvalid) {
                // The last event: let go of the handler (and whatever it holds) and of ourselves.
                handler = nullptr;
                held.clear();
                last = std::move(self);
            } else if (!invalid) {
                checkPressure();
            }
        }
        // `last` may be the final owner of the connection; it goes here, outside the lock.
    }

    // Writes what the socket takes now. Called with the mutex held.
    void flush() {
        while (!out.empty() && fd >= 0) {
            Outgoing& o = out.front();
            struct iovec iov {o.bytes.data() + o.offset, o.bytes.size() - o.offset};
            struct msghdr msg {};
            msg.msg_iov = &iov;
            msg.msg_iovlen = 1;
            std::vector<char> control;
            if (o.offset == 0 && !o.fds.empty()) {
                control.resize(CMSG_SPACE(sizeof(int) * o.fds.size()));
                msg.msg_control = control.data();
                msg.msg_controllen = control.size();
                struct cmsghdr* c = CMSG_FIRSTHDR(&msg);
                c->cmsg_level = SOL_SOCKET;
                c->cmsg_type = SCM_RIGHTS;
                c->cmsg_len = CMSG_LEN(sizeof(int) * o.fds.size());
                auto* slots = reinterpret_cast<int*>(CMSG_DATA(c));
                for (size_t i = 0; i < o.fds.size(); ++i) slots[i] = o.fds[i]->get();
            }
            ssize_t n = sendmsg(fd, &msg, MSG_NOSIGNAL | MSG_DONTWAIT);
            if (n < 0) {
                if (errno == EINTR) continue;
                if (errno == EAGAIN || errno == EWOULDBLOCK) break;
                closeLocked();
                return;
            }
            o.offset += static_cast<size_t>(n);
            outBytes -= static_cast<size_t>(n);
            if (o.offset == o.bytes.size()) {
                out.pop_front();
            } else {
                o.fds.clear();  // they went with the first bytes
            }
        }
        bool want = !out.empty() && fd >= 0;
        if (want != wantWrite) {
            wantWrite = want;
            updateInterest();
        }
        if (fd >= 0) checkPressure();
    }

    bool sendFrame(wire::FrameKind kind, uint64_t id, const Value& body) {
        std::vector<int> raw;
        auto bytes = wire::encodeFrame(wire::Frame{kind, id, body}, raw, kMaxDepth);
        if (!bytes) {
            log::error(rpxLog(), "rpx: message to pid %d nested too deeply; not sent", peerPid);
            return false;
        }
        Outgoing o;
        o.bytes = std::move(*bytes);
        for (int f : raw) {
            int copy = fcntl(f, F_DUPFD_CLOEXEC, 0);
            if (copy < 0) {
                log::error(rpxLog(), "rpx: cannot pass a descriptor to pid %d: %{public}s", peerPid,
                           std::strerror(errno));
                return false;
            }
            o.fds.push_back(std::make_shared<FileDescriptor>(copy));
        }
        if (invalid) return false;
        outBytes += o.bytes.size();
        out.push_back(std::move(o));
        flush();
        return true;
    }

    // The connection ends: no more I/O, pending replies fail, the invalid event is delivered.
    // Called with the mutex held.
    void closeLocked() {
        if (invalid) return;
        invalid = true;
        if (fd >= 0) {
            IoLoop::shared().remove(fd);
            ::shutdown(fd, SHUT_RDWR);  // wakes a synchronous reader polling its duplicate
            ::close(fd);
            fd = -1;
        }
        out.clear();
        outBytes = 0;
        for (auto& [id, p] : pending) p.complete(Reply{ErrorKind::ConnectionInvalid, Value()});
        pending.clear();
        {
            std::lock_guard lock(gLiveMutex);
            live().erase(shared_from_this());
        }
        Event ev;
        ev.error = ErrorKind::ConnectionInvalid;
        postEvent(std::move(ev));
    }

    enum class ReadStatus { More, Drained, Closed };

    // One read from the socket and the frames it completes. Called with the mutex held.
    ReadStatus readOnce() {
        char buf[65536];
        struct iovec iov {buf, sizeof buf};
        alignas(struct cmsghdr) char control[CMSG_SPACE(sizeof(int) * 64)];
        struct msghdr msg {};
        msg.msg_iov = &iov;
        msg.msg_iovlen = 1;
        msg.msg_control = control;
        msg.msg_controllen = sizeof control;
        ssize_t n = recvmsg(fd, &msg, MSG_DONTWAIT | MSG_CMSG_CLOEXEC);
        if (n < 0) {
            if (errno == EINTR) return ReadStatus::More;
            if (errno == EAGAIN || errno == EWOULDBLOCK) return ReadStatus::Drained;
            closeLocked();
            return ReadStatus::Closed;
        }
        for (struct cmsghdr* c = CMSG_FIRSTHDR(&msg); c; c = CMSG_NXTHDR(&msg, c)) {
            if (c->cmsg_level != SOL_SOCKET || c->cmsg_type != SCM_RIGHTS) continue;
            size_t count = (c->cmsg_len - CMSG_LEN(0)) / sizeof(int);
            auto* slots = reinterpret_cast<int*>(CMSG_DATA(c));
            for (size_t i = 0; i < count; ++i) reader.appendFd(std::make_shared<FileDescriptor>(slots[i]));
        }
        if (msg.msg_flags & MSG_CTRUNC) {
            log::error(rpxLog(), "rpx: closing connection to pid %d: too many descriptors", peerPid);
            closeLocked();
            return ReadStatus::Closed;
        }
        if (n == 0) {
            closeLocked();
            return ReadStatus::Closed;
        }
        reader.append(buf, static_cast<size_t>(n));
        drainFrames();
        return ReadStatus::More;
    }

    void onReadable() {
        for (;;) {
            std::unique_lock lock(mutex);
            if (fd < 0 || readPaused || syncReader) return;
            if (readOnce() != ReadStatus::More) return;
        }
    }

    // Becomes the synchronous reader, if the connection allows one now. Called with the mutex held.
    bool claimSyncReader() {
        if (syncReader || fd < 0 || invalid || readPaused) return false;
        if (pollFd < 0) pollFd = fcntl(fd, F_DUPFD_CLOEXEC, 0);
        if (pollFd < 0) return false;
        syncReader = true;
        updateInterest();
        return true;
    }

    // The synchronous reader's loop: reads until `done` says the awaited reply came, the
    // connection ends, or reading must pause (then the I/O thread takes over again).
    void readAsSyncReader(const std::function<bool()>& done) {
        for (;;) {
            if (done()) break;
            struct pollfd p {pollFd, POLLIN, 0};
            if (::poll(&p, 1, -1) < 0 && errno != EINTR) break;
            bool stop;
            {
                std::lock_guard lock(mutex);
                stop = fd < 0 || readPaused;
                // Until the socket is empty, or the awaited reply has come (what follows it is
                // the I/O thread's again).
                while (!stop && !done()) {
                    ReadStatus status = readOnce();
                    if (status != ReadStatus::More) {
                        stop = status == ReadStatus::Closed;
                        break;
                    }
                    stop = fd < 0 || readPaused;
                }
            }
            runReady();
            if (stop) break;
        }
        std::lock_guard lock(mutex);
        syncReader = false;
        updateInterest();
    }

    void handleFrame(wire::Frame frame) {
        if (frame.kind == wire::FrameKind::Reply) {
            auto it = pending.find(frame.id);
            if (it == pending.end()) return;  // a reply nobody waits for any more
            it->second.complete(Reply{std::nullopt, std::move(frame.body)});
            pending.erase(it);
            return;
        }
        Event ev;
        ev.message = std::move(frame.body);
        ev.messageId = frame.id;
        ev.wantsReply = frame.kind == wire::FrameKind::Request;
        if (ev.wantsReply) {
            unanswered.insert(frame.id);
            ++unfinished;
        }
        postEvent(std::move(ev));
    }

    void onEvents(uint32_t events) {
        if (events & (EPOLLIN | EPOLLRDHUP | EPOLLHUP | EPOLLERR)) onReadable();
        if (events & EPOLLOUT) {
            std::lock_guard lock(mutex);
            flush();
        }
        if (events & (EPOLLHUP | EPOLLERR)) {
            std::lock_guard lock(mutex);
            // Read what is left first (above), then end. A synchronous reader reads what is left
            // itself and ends the connection when it reaches the end.
            if (fd >= 0 && !(events & EPOLLIN) && !syncReader) closeLocked();
        }
        runReady();
    }

    void start() {
        std::lock_guard lock(mutex);
        if (fd < 0) return;
        {
            std::lock_guard liveLock(gLiveMutex);
            live().insert(shared_from_this());
        }
        std::weak_ptr<Impl> weak = shared_from_this();
        IoLoop::shared().add(fd, interest(), [weak](uint32_t events) {
            if (auto impl = weak.lock()) impl->onEvents(events);
        });
    }
};

// ---- Connection

Connection::Connection(std::shared_ptr<Impl> impl, PeerIdentity peer)
    : impl_(std::move(impl)), peer_(std::move(peer)) {}

Connection::~Connection() {
    std::shared_ptr<void> context;
    std::function<void(std::shared_ptr<void>)> finalizer;
    {
        std::lock_guard lock(impl_->mutex);
        impl_->closeLocked();
        context = std::move(impl_->context);
        finalizer = std::move(impl_->finalizer);
    }
    impl_->runReady();
    if (finalizer) finalizer(std::move(context));
}

std::shared_ptr<Connection> Connection::connect(const std::string& name, dispatch::QueuePtr queue) {
    int fd = socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0);
    std::string path = endpointPath(name);
    struct sockaddr_un addr {};
    addr.sun_family = AF_UNIX;
    bool ok = fd >= 0 && path.size() < sizeof addr.sun_path;
    if (ok) {
        std::memcpy(addr.sun_path, path.c_str(), path.size() + 1);
        // A local connect completes at once or fails; EAGAIN means the backlog is full: retry
        // briefly.
        int rc;
        int tries = 0;
        while ((rc = ::connect(fd, reinterpret_cast<sockaddr*>(&addr), sizeof addr)) != 0 &&
               (errno == EAGAIN || errno == EINTR) && ++tries < 200)
            std::this_thread::sleep_for(std::chrono::milliseconds(5));
        ok = rc == 0;
    }
    PeerIdentity peer;
    if (ok) {
        peer = identityOfSocket(fd);
    } else if (fd >= 0) {
        ::close(fd);
        fd = -1;
    }
    auto impl = std::make_shared<Impl>(fd, std::move(queue), kDefaultClientMaxFrame);
    impl->peerPid = peer.pid;
    auto connection = std::shared_ptr<Connection>(new Connection(impl, std::move(peer)));
    if (ok) {
        impl->start();
    } else {
        std::lock_guard lock(impl->mutex);
        impl->invalid = true;
        Event ev;
        ev.error = ErrorKind::ConnectionInvalid;
        impl->held.push_back(std::move(ev));
    }
    return connection;
}

void Connection::setEventHandler(std::function<void(const Event&)> handler) {
    std::lock_guard lock(impl_->mutex);
    impl_->handler = std::move(handler);
}

void Connection::setContext(std::shared_ptr<void> context,
                            std::function<void(std::shared_ptr<void>)> finalizer) {
    std::lock_guard lock(impl_->mutex);
    impl_->context = std::move(context);
    impl_->finalizer = std::move(finalizer);
}

std::shared_ptr<void> Connection::context() const {
    std::lock_guard lock(impl_->mutex);
    return impl_->context;
}

void Connection::resume() {
    {
        std::lock_guard lock(impl_->mutex);
        if (impl_->resumed) return;
        impl_->resumed = true;
        auto held = std::move(impl_->held);
        impl_->held.clear();
        for (auto& ev : held) impl_->postEvent(std::move(ev));
    }
    impl_->runReady();
}

void Connection::cancel() {
    {
        std::lock_guard lock(impl_->mutex);
        impl_->closeLocked();
    }
    impl_->runReady();
}

bool Connection::isValid() const {
    std::lock_guard lock(impl_->mutex);
    return !impl_->invalid;
}

void Connection::send(const Value& message) {
    {
        std::lock_guard lock(impl_->mutex);
        if (impl_->invalid) return;
        impl_->sendFrame(wire::FrameKind::Message, impl_->nextId++, message);
    }
    impl_->runReady();
}

void Connection::sendWithReply(const Value& message, dispatch::QueuePtr queue,
                               std::function<void(const Reply&)> completion) {
    {
        std::lock_guard lock(impl_->mutex);
        uint64_t id = impl_->nextId++;
        Impl::Pending pending{std::move(queue), std::move(completion)};
        // The frame may also fail the connection while being written; then no reply will come.
        if (impl_->invalid || !impl_->sendFrame(wire::FrameKind::Request, id, message) || impl_->invalid) {
            pending.complete(Reply{ErrorKind::ConnectionInvalid, Value()});
        } else {
            impl_->pending.emplace(id, std::move(pending));
        }
    }
    impl_->runReady();
}

Reply Connection::sendWithReplySync(const Value& message) {
    return dispatch::waitForCallback<Reply>([&](std::function<void(const Reply&)> report) {
        // The reply is read on this thread when it can be: no other thread need wake up for it.
        auto came = std::make_shared<std::atomic<bool>>(false);
        auto done = [came, report = std::move(report)](const Reply& r) {
            came->store(true);
            report(r);
        };
        bool reading;
        {
            std::lock_guard lock(impl_->mutex);
            uint64_t id = impl_->nextId++;
            Impl::Pending pending{nullptr, std::move(done)};
            // The frame may also fail the connection while being written; then no reply will come.
            if (impl_->invalid || !impl_->sendFrame(wire::FrameKind::Request, id, message) || impl_->invalid) {
                pending.complete(Reply{ErrorKind::ConnectionInvalid, Value()});
                reading = false;
            } else {
                impl_->pending.emplace(id, std::move(pending));
                reading = impl_->claimSyncReader();
            }
        }
        impl_->runReady();
        if (reading) impl_->readAsSyncReader([&] { return came->load(); });
    });
}

void Connection::sendReply(uint64_t messageId, const Value& reply) {
    {
        std::lock_guard lock(impl_->mutex);
        if (impl_->unanswered.erase(messageId) && impl_->unfinished) --impl_->unfinished;
        if (impl_->invalid) return;
        // Writing may fail the connection, and an answered request may resume reading.
        impl_->sendFrame(wire::FrameKind::Reply, messageId, reply);
    }
    impl_->runReady();
}

void Connection::setMaxFrameSize(size_t bytes) {
    std::lock_guard lock(impl_->mutex);
    impl_->reader.setMaxFrame(bytes);
}

std::string Connection::description() const {
    return "<rpx connection pid=" + std::to_string(peer_.pid) + (isValid() ? "" : " invalid") + ">";
}

// ---- Listener

struct Listener::Impl : std::enable_shared_from_this<Listener::Impl> {
    std::mutex mutex;
    int fd = -1;
    std::string path;
    dispatch::QueuePtr queue;
    dispatch::QueuePtr delivery;
    std::function<void(ConnectionPtr)> handler;
    size_t maxFrame = kDefaultListenerMaxFrame;
    bool inlineDelivery = false;
    bool resumed = false;

    void onAcceptable() {
        for (;;) {
            int client;
            {
                std::lock_guard lock(mutex);
                if (fd < 0) return;
                client = accept4(fd, nullptr, nullptr, SOCK_CLOEXEC | SOCK_NONBLOCK);
            }
            if (client < 0) {
                if (errno == EINTR) continue;
                return;
            }
            PeerIdentity peer = identityOfSocket(client);
            auto impl = std::make_shared<Connection::Impl>(client, delivery, maxFrame);
            impl->peerPid = peer.pid;
            {
                std::lock_guard lock(mutex);
                impl->inlineDelivery = inlineDelivery;
            }
            auto connection = std::shared_ptr<Connection>(new Connection(impl, std::move(peer)));
            impl->self = connection;
            impl->start();
            std::function<void(ConnectionPtr)> h;
            {
                std::lock_guard lock(mutex);
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

Result<std::shared_ptr<Listener>> Listener::create(const std::string& name, dispatch::QueuePtr queue) {
    if (name.empty() || name.find('/') != std::string::npos || name[0] == '.')
        return Error::posix(EINVAL, "invalid endpoint name: " + name);
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
    ::unlink(path.c_str());
    int fd = socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0);
    if (fd < 0) return Error::posix(errno, "socket");
    if (bind(fd, reinterpret_cast<sockaddr*>(&addr), sizeof addr) != 0 || listen(fd, 128) != 0) {
        int err = errno;
        ::close(fd);
        return Error::posix(err, path);
    }
    auto impl = std::make_shared<Impl>();
    impl->fd = fd;
    impl->path = path;
    impl->queue = std::move(queue);
    impl->delivery = dispatch::Queue::create("rpx.delivery");
    return std::shared_ptr<Listener>(new Listener(impl));
}

void Listener::setConnectionHandler(std::function<void(ConnectionPtr)> handler) {
    std::lock_guard lock(impl_->mutex);
    impl_->handler = std::move(handler);
}

void Listener::setMaxFrameSize(size_t bytes) {
    std::lock_guard lock(impl_->mutex);
    impl_->maxFrame = bytes;
}

void Listener::setInlineDelivery(bool enabled) {
    std::lock_guard lock(impl_->mutex);
    impl_->inlineDelivery = enabled;
}

void Listener::resume() {
    std::lock_guard lock(impl_->mutex);
    if (impl_->resumed || impl_->fd < 0) return;
    impl_->resumed = true;
    std::weak_ptr<Impl> weak = impl_;
    IoLoop::shared().add(impl_->fd, EPOLLIN, [weak](uint32_t) {
        if (auto impl = weak.lock()) impl->onAcceptable();
    });
}

void Listener::cancel() {
    std::lock_guard lock(impl_->mutex);
    if (impl_->fd < 0) return;
    if (impl_->resumed) IoLoop::shared().remove(impl_->fd);
    ::close(impl_->fd);
    impl_->fd = -1;
    ::unlink(impl_->path.c_str());
}

const std::string& Listener::path() const { return impl_->path; }

// ---- termination and outstanding work

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
            std::lock_guard lock(gLiveMutex);
            connections.assign(live().begin(), live().end());
        }
        // Deliver the event, wait (boundedly) until every handler has seen it, then end.
        auto remaining = std::make_shared<std::atomic<size_t>>(connections.size());
        for (auto& impl : connections) {
            {
                std::lock_guard lock(impl->mutex);
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

void beginWork() { gOutstandingWork.fetch_add(1); }
void endWork() { gOutstandingWork.fetch_sub(1); }
uint64_t outstandingWork() { return gOutstandingWork.load(); }

}  // namespace corvane::rpx
