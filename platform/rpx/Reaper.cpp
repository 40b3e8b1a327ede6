// The reaper: closes the sockets of peers that broke the protocol on a thread of its own, at the
// lowest scheduling priority. Closing a socket frees whatever the peer sent and nobody read, and a
// peer can send hundreds of descriptors per message: the kernel then releases each of them, which
// would keep the I/O thread from every other connection for as long. The I/O thread hands such a
// socket over and goes on; the reaper runs when nothing more urgent wants the processor.
#include <pthread.h>
#include <sched.h>
#include <unistd.h>

#include <thread>
#include <vector>

#include "platform/rpx/Internal.h"

namespace corvane::rpx {

namespace {

// Sockets waiting to be closed, at most. Past it the caller closes the socket itself: the number of
// descriptors axd holds stays bounded however far behind the reaper falls.
constexpr size_t kMaxWaiting = 16;

class Reaper {
public:
    static Reaper& shared() {
        static Reaper* reaper = new Reaper();  // lives for the process's life
        return *reaper;
    }

    bool take(int fd) EXCLUDES(mutex_) {
        {
            MutexLock lock(mutex_);
            if (waiting_.size() >= kMaxWaiting) return false;
            waiting_.push_back(fd);
        }
        wake_.notify_one();
        return true;
    }

private:
    Reaper() { std::thread([this] { run(); }).detach(); }

    void run() EXCLUDES(mutex_) {
        pthread_setname_np(pthread_self(), "rpx-reaper");
        struct sched_param idle {};
        pthread_setschedparam(pthread_self(), SCHED_IDLE, &idle);
        for (;;) {
            std::vector<int> due;
            {
                MutexLock lock(mutex_);
                while (waiting_.empty()) wake_.wait(lock);
                due.swap(waiting_);
            }
            for (int fd : due) ::close(fd);
        }
    }

    Mutex mutex_;
    ConditionVariable wake_;
    std::vector<int> waiting_ GUARDED_BY(mutex_);
};

}  // namespace

void internal::closeSoon(int fd) {
    if (fd < 0) return;
    if (!Reaper::shared().take(fd)) ::close(fd);
}

}  // namespace corvane::rpx
