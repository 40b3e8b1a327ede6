#include "platform/notify/Notify.h"

#include <fcntl.h>
#include <poll.h>
#include <sys/eventfd.h>
#include <sys/file.h>
#include <sys/inotify.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>

#include "platform/layout/Layout.h"

namespace corvane::notify {

namespace {

std::string directory() { return layout::runtimeDir() + "/notify"; }

bool validName(const std::string& name) {
    return !name.empty() && name != "." && name != ".." && name.find('/') == std::string::npos &&
           name.find('\0') == std::string::npos && name.size() < 256;
}

Error badName(const std::string& name) {
    return Error{kPosixErrorDomain, EINVAL, "invalid notification name: " + name};
}

enum class Drained { Nothing, Named, WatchGone };

// Reads every event waiting on a non-blocking inotify descriptor: whether one named `name` (any
// name when empty) came, or the watch itself ended (the directory went, or events were lost).
Drained drainEvents(int fd, const std::string& name) {
    alignas(struct inotify_event) char buf[4096];
    Drained result = Drained::Nothing;
    ssize_t n;
    while ((n = ::read(fd, buf, sizeof buf)) > 0) {
        for (char* p = buf; p < buf + n;) {
            auto* ev = reinterpret_cast<struct inotify_event*>(p);
            if (ev->mask & (IN_Q_OVERFLOW | IN_IGNORED | IN_DELETE_SELF | IN_MOVE_SELF)) {
                result = Drained::WatchGone;
            } else if (ev->len && (name.empty() || name == ev->name) && result == Drained::Nothing) {
                result = Drained::Named;
            }
            p += sizeof(struct inotify_event) + ev->len;
        }
    }
    return result;
}

}  // namespace

Status post(const std::string& name) {
    if (!validName(name)) return badName(name);
    std::string dir = directory();
    std::string path = dir + "/" + name;
    // The directory is made the first time only: a post is one open where it exists.
    int fd = ::open(path.c_str(), O_RDWR | O_CREAT | O_CLOEXEC, 0600);
    if (fd < 0 && errno == ENOENT) {
        if (Status made = layout::makeDirectories(dir, 0700); !made.ok()) return made;
        fd = ::open(path.c_str(), O_RDWR | O_CREAT | O_CLOEXEC, 0600);
    }
    if (fd < 0) return Error::posix(errno, path);
    // The lock makes read-increment-write one step across processes.
    while (flock(fd, LOCK_EX) != 0) {
        if (errno != EINTR) {
            int err = errno;
            ::close(fd);
            return Error::posix(err, path);
        }
    }
    uint64_t counter = 0;
    if (pread(fd, &counter, sizeof counter, 0) != static_cast<ssize_t>(sizeof counter)) counter = 0;
    ++counter;
    ssize_t n = pwrite(fd, &counter, sizeof counter, 0);
    int err = n == static_cast<ssize_t>(sizeof counter) ? 0 : errno;
    ::close(fd);  // closing a written file is what observers see (IN_CLOSE_WRITE)
    if (err) return Error::posix(err, path);
    return {};
}

uint64_t count(const std::string& name) {
    if (!validName(name)) return 0;
    std::string path = directory() + "/" + name;
    int fd = ::open(path.c_str(), O_RDONLY | O_CLOEXEC);
    if (fd < 0) return 0;
    flock(fd, LOCK_SH);
    uint64_t counter = 0;
    if (pread(fd, &counter, sizeof counter, 0) != static_cast<ssize_t>(sizeof counter)) counter = 0;
    ::close(fd);
    return counter;
}

Result<std::unique_ptr<Observer>> Observer::observe(const std::string& name,
                                                    dispatch::QueuePtr queue,
                                                    std::function<void()> handler) {
    if (!validName(name)) return badName(name);
    std::string dir = directory();
    if (Status made = layout::makeDirectories(dir, 0700); !made.ok()) return made.error();
    int in = inotify_init1(IN_CLOEXEC | IN_NONBLOCK);
    if (in < 0) return Error::posix(errno, "inotify_init1");
    if (inotify_add_watch(in, dir.c_str(), IN_CLOSE_WRITE | IN_MOVED_TO) < 0) {
        int err = errno;
        ::close(in);
        return Error::posix(err, dir);
    }
    int stop = eventfd(0, EFD_CLOEXEC);
    if (stop < 0) {
        int err = errno;
        ::close(in);
        return Error::posix(err, "eventfd");
    }
    return std::unique_ptr<Observer>(
        new Observer(name, in, stop, std::move(queue), std::move(handler)));
}

Observer::Observer(std::string name, int inotifyFd, int stopFd, dispatch::QueuePtr queue,
                   std::function<void()> handler)
    : name_(std::move(name)),
      inotifyFd_(inotifyFd),
      stopFd_(stopFd),
      queue_(std::move(queue)),
      handler_(std::move(handler)) {
    thread_ = std::thread([this] { watch(); });
}

Observer::~Observer() {
    uint64_t one = 1;
    (void)!::write(stopFd_, &one, sizeof one);
    thread_.join();
    ::close(inotifyFd_);
    ::close(stopFd_);
}

void Observer::watch() {
    for (;;) {
        struct pollfd fds[2] = {{inotifyFd_, POLLIN, 0}, {stopFd_, POLLIN, 0}};
        if (poll(fds, 2, -1) < 0) {
            if (errno == EINTR) continue;
            return;
        }
        if (fds[1].revents) return;
        if (drainEvents(inotifyFd_, name_) == Drained::Named) queue_->async(handler_);
    }
}

ChangeWatch::ChangeWatch(std::string directory, std::string name)
    : directory_(std::move(directory)), name_(std::move(name)) {}

ChangeWatch::~ChangeWatch() {
    if (fd_ >= 0) ::close(fd_);
}

bool ChangeWatch::changed() {
    if (fd_ >= 0) {
        // In an ancestor, any event may be a step toward the directory.
        Drained drained = drainEvents(fd_, watchingAncestor_ ? std::string() : name_);
        if (drained == Drained::Nothing) return false;
        if (drained == Drained::Named && !watchingAncestor_) return true;
    }
    watch();
    return true;
}

void ChangeWatch::watch() {
    if (fd_ >= 0) ::close(fd_);
    watchingAncestor_ = false;
    fd_ = inotify_init1(IN_CLOEXEC | IN_NONBLOCK);
    if (fd_ < 0) return;
    constexpr uint32_t kGone = IN_DELETE_SELF | IN_MOVE_SELF;
    constexpr uint32_t kEvents = IN_MODIFY | IN_CLOSE_WRITE | IN_CREATE | IN_DELETE | IN_MOVED_FROM | IN_MOVED_TO | kGone;
    if (inotify_add_watch(fd_, directory_.c_str(), kEvents) >= 0) return;
    // A directory that does not exist yet holds no files that could change: watch the nearest
    // ancestor that exists until a step toward it appears.
    for (std::string dir = directory_; errno == ENOENT && dir.size() > 1;) {
        size_t slash = dir.rfind('/');
        dir = slash == 0 || slash == std::string::npos ? "/" : dir.substr(0, slash);
        if (inotify_add_watch(fd_, dir.c_str(), IN_CREATE | IN_MOVED_TO | kGone) >= 0) {
            watchingAncestor_ = true;
            return;
        }
    }
    ::close(fd_);
    fd_ = -1;
}

}  // namespace corvane::notify
