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

}  // namespace

Status post(const std::string& name) {
    if (!validName(name)) return badName(name);
    std::string dir = directory();
    if (Status made = layout::makeDirectories(dir, 0700); !made.ok()) return made;
    std::string path = dir + "/" + name;
    int fd = ::open(path.c_str(), O_RDWR | O_CREAT | O_CLOEXEC, 0600);
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
    alignas(struct inotify_event) char buf[4096];
    for (;;) {
        struct pollfd fds[2] = {{inotifyFd_, POLLIN, 0}, {stopFd_, POLLIN, 0}};
        if (poll(fds, 2, -1) < 0) {
            if (errno == EINTR) continue;
            return;
        }
        if (fds[1].revents) return;
        bool seen = false;
        for (;;) {
            ssize_t n = ::read(inotifyFd_, buf, sizeof buf);
            if (n <= 0) break;
            for (char* p = buf; p < buf + n;) {
                auto* ev = reinterpret_cast<struct inotify_event*>(p);
                if (ev->len && name_ == ev->name) seen = true;
                p += sizeof(struct inotify_event) + ev->len;
            }
        }
        if (seen) queue_->async(handler_);
    }
}

}  // namespace corvane::notify
