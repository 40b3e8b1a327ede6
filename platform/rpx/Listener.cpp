// Listener: a named endpoint that accepts connections.
#include <sys/socket.h>
#include <sys/un.h>

#include "platform/layout/Layout.h"
#include "platform/rpx/ConnectionImpl.h"

namespace corvane::rpx {

struct Listener::Impl : std::enable_shared_from_this<Listener::Impl> {
    Mutex mutex;
    int fd GUARDED_BY(mutex) = -1;
    std::string path;               // set at creation, then fixed
    dispatch::QueuePtr queue;       // set at creation, then fixed
    dispatch::QueuePtr delivery;    // set at creation, then fixed
    std::function<void(ConnectionPtr)> handler GUARDED_BY(mutex);
    size_t maxFrame GUARDED_BY(mutex) = kDefaultListenerMaxFrame;
    bool inlineDelivery GUARDED_BY(mutex) = false;
    bool resumed GUARDED_BY(mutex) = false;

    void onAcceptable() {
        for (;;) {
            int client;
            {
                MutexLock lock(mutex);
                if (fd < 0) return;
                client = accept4(fd, nullptr, nullptr, SOCK_CLOEXEC | SOCK_NONBLOCK);
            }
            if (client < 0) {
                if (errno == EINTR) continue;
                return;
            }
            PeerIdentity peer = identityOfSocket(client);
            size_t frameLimit;
            bool inlined;
            {
                MutexLock lock(mutex);
                frameLimit = maxFrame;
                inlined = inlineDelivery;
            }
            auto impl = std::make_shared<Connection::Impl>(client, delivery, frameLimit);
            impl->peerPid = peer.pid;
            impl->inlineDelivery = inlined;
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
    auto impl = std::make_shared<Impl>();
    {
        MutexLock lock(impl->mutex);
        impl->fd = fd;
    }
    impl->path = path;
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
    ::unlink(impl_->path.c_str());
}

const std::string& Listener::path() const { return impl_->path; }

}  // namespace corvane::rpx
