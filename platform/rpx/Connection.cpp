// Connection: the public face of one connection (docs/rpx-wire.md).
#include <sys/socket.h>
#include <sys/un.h>
#include <fcntl.h>

#include <atomic>

#include "platform/rpx/ConnectionImpl.h"

namespace corvane::rpx {

Connection::Connection(std::shared_ptr<Impl> impl, PeerIdentity peer)
    : impl_(std::move(impl)), peer_(std::move(peer)) {}

Connection::~Connection() {
    std::shared_ptr<void> context;
    std::function<void(std::shared_ptr<void>)> finalizer;
    {
        MutexLock lock(impl_->mutex);
        impl_->closeLocked();
        context = std::move(impl_->context);
        finalizer = std::move(impl_->finalizer);
    }
    impl_->runReady();
    if (finalizer) finalizer(std::move(context));
}

std::shared_ptr<Connection> Connection::connect(const std::string& name, dispatch::QueuePtr queue) {
    int fd = socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
    std::string path = endpointPath(name);
    struct sockaddr_un addr {};
    addr.sun_family = AF_UNIX;
    bool ok = fd >= 0 && path.size() < sizeof addr.sun_path;
    if (ok) {
        std::memcpy(addr.sun_path, path.c_str(), path.size() + 1);
        // A local connect completes at once, fails, or, while the listener's backlog is full,
        // waits in the kernel for room (for at most a second): queued there beside any other
        // process that waits, rather than trying again now and then and losing each time to a
        // process that floods the listener.
        struct timeval patience {1, 0};
        ::setsockopt(fd, SOL_SOCKET, SO_SNDTIMEO, &patience, sizeof patience);
        int rc;
        while ((rc = ::connect(fd, reinterpret_cast<sockaddr*>(&addr), sizeof addr)) != 0 && errno == EINTR) {
        }
        struct timeval forever {0, 0};
        ok = rc == 0 && ::setsockopt(fd, SOL_SOCKET, SO_SNDTIMEO, &forever, sizeof forever) == 0 &&
             ::fcntl(fd, F_SETFL, ::fcntl(fd, F_GETFL) | O_NONBLOCK) == 0;
    }
    if (!ok && fd >= 0) {
        ::close(fd);
        fd = -1;
    }
    return open(fd, std::move(queue), kDefaultClientMaxFrame);
}

std::shared_ptr<Connection> Connection::adopt(std::shared_ptr<FileDescriptor> socket,
                                              dispatch::QueuePtr queue, size_t maxFrameSize) {
    int fd = socket ? socket->release() : -1;
    if (fd >= 0) {
        int flags = ::fcntl(fd, F_GETFL);
        int type = 0;
        socklen_t length = sizeof type;
        bool stream = ::getsockopt(fd, SOL_SOCKET, SO_TYPE, &type, &length) == 0 && type == SOCK_STREAM;
        if (flags < 0 || !stream || ::fcntl(fd, F_SETFL, flags | O_NONBLOCK) != 0 ||
            ::fcntl(fd, F_SETFD, FD_CLOEXEC) != 0) {
            ::close(fd);
            fd = -1;
        }
    }
    return open(fd, std::move(queue), maxFrameSize);
}

std::shared_ptr<Connection> Connection::open(int fd, dispatch::QueuePtr queue, size_t maxFrameSize) {
    PeerIdentity peer;
    if (fd >= 0) peer = identityOfSocket(fd);
    auto impl = std::make_shared<Impl>(fd, std::move(queue), maxFrameSize);
    impl->peerPid = peer.pid;
    auto connection = std::shared_ptr<Connection>(new Connection(impl, std::move(peer)));
    if (fd >= 0) {
        impl->start();
    } else {
        MutexLock lock(impl->mutex);
        impl->invalid = true;
        Event ev;
        ev.error = ErrorKind::ConnectionInvalid;
        impl->held.push_back(std::move(ev));
    }
    return connection;
}

size_t Connection::queuedOutgoingBytes() const {
    MutexLock lock(impl_->mutex);
    return impl_->outBytes;
}

void Connection::setEventHandler(std::function<void(const Event&)> handler) {
    MutexLock lock(impl_->mutex);
    impl_->handler = std::move(handler);
}

void Connection::setContext(std::shared_ptr<void> context,
                            std::function<void(std::shared_ptr<void>)> finalizer) {
    MutexLock lock(impl_->mutex);
    impl_->context = std::move(context);
    impl_->finalizer = std::move(finalizer);
}

std::shared_ptr<void> Connection::context() const {
    MutexLock lock(impl_->mutex);
    return impl_->context;
}

void Connection::resume() {
    {
        MutexLock lock(impl_->mutex);
        if (impl_->resumed) return;
        impl_->resumed = true;
        impl_->updateInterest();  // reading begins now
        auto held = std::move(impl_->held);
        impl_->held.clear();
        for (auto& ev : held) impl_->postEvent(std::move(ev));
    }
    impl_->runReady();
}

void Connection::cancel() {
    {
        MutexLock lock(impl_->mutex);
        impl_->closeLocked();
    }
    impl_->runReady();
}

bool Connection::isValid() const {
    MutexLock lock(impl_->mutex);
    return !impl_->invalid;
}

void Connection::send(const Value& message) {
    {
        MutexLock lock(impl_->mutex);
        if (impl_->invalid) return;
        impl_->sendFrame(wire::FrameKind::Message, impl_->nextId++, message);
    }
    impl_->runReady();
}

void Connection::sendWithReply(const Value& message, dispatch::QueuePtr queue,
                               std::function<void(const Reply&)> completion) {
    {
        MutexLock lock(impl_->mutex);
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
            MutexLock lock(impl_->mutex);
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
        MutexLock lock(impl_->mutex);
        if (impl_->unanswered.erase(messageId) && impl_->unfinished) --impl_->unfinished;
        if (impl_->invalid) return;
        // Writing may fail the connection, and an answered request may resume reading.
        impl_->sendFrame(wire::FrameKind::Reply, messageId, reply);
    }
    impl_->runReady();
}

void Connection::setMaxFrameSize(size_t bytes) {
    MutexLock lock(impl_->mutex);
    impl_->reader.setMaxFrame(bytes);
}

std::string Connection::description() const {
    return "<rpx connection pid=" + std::to_string(peer_.pid) + (isValid() ? "" : " invalid") + ">";
}

}  // namespace corvane::rpx
