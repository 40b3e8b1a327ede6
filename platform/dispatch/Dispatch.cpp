#include "platform/dispatch/Dispatch.h"

#include <pthread.h>
#include <sys/resource.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <cstdio>
#include <cstdlib>
#include <optional>

namespace corvane::dispatch {

namespace {

thread_local Queue* tCurrent = nullptr;

int niceFor(QoS qos) {
    switch (qos) {
        case QoS::Background: return 10;
        case QoS::Utility: return 5;
        case QoS::Default: return 0;
        case QoS::UserInitiated: return -5;
        case QoS::UserInteractive: return -10;
    }
    return 0;
}

[[noreturn]] void fail(const char* what, const std::string& label) {
    std::fprintf(stderr, "dispatch: %s (queue \"%s\")\n", what, label.c_str());
    std::fflush(stderr);
    std::abort();
}

}  // namespace

std::shared_ptr<Queue> Queue::create(std::string label, QoS qos) {
    return std::shared_ptr<Queue>(new Queue(std::move(label), qos));
}

Queue::Queue(std::string label, QoS qos) : label_(std::move(label)), qos_(qos) {
    thread_ = std::thread([this] { run(); });
}

Queue::~Queue() {
    {
        std::lock_guard lock(mutex_);
        stopping_ = true;
    }
    wake_.notify_all();
    if (std::this_thread::get_id() == thread_.get_id()) {
        // The last owner let go from a task of this very queue: the thread ends by itself once
        // the current task returns.
        thread_.detach();
    } else {
        thread_.join();
    }
}

void Queue::run() {
    // Thread names are at most 15 bytes.
    pthread_setname_np(pthread_self(), label_.substr(0, 15).c_str());
    int nice = niceFor(qos_);
    if (nice != 0) {
        // Per-thread nice value; raising priority fails without CAP_SYS_NICE, which is fine.
        (void)setpriority(PRIO_PROCESS, static_cast<id_t>(syscall(SYS_gettid)), nice);
    }
    tCurrent = this;
    for (;;) {
        std::function<void()> task;
        {
            std::unique_lock lock(mutex_);
            wake_.wait(lock, [this] { return stopping_ || !tasks_.empty(); });
            if (tasks_.empty()) break;
            task = std::move(tasks_.front());
            tasks_.pop_front();
        }
        task();
    }
    tCurrent = nullptr;
}

void Queue::async(std::function<void()> task) {
    {
        std::lock_guard lock(mutex_);
        tasks_.push_back(std::move(task));
    }
    wake_.notify_one();
}

void Queue::sync(const std::function<void()>& task) {
    if (isCurrent()) fail("sync onto the current queue would deadlock", label_);
    std::mutex doneMutex;
    std::condition_variable doneCv;
    bool done = false;
    async([&] {
        task();
        std::lock_guard lock(doneMutex);
        done = true;
        doneCv.notify_one();
    });
    std::unique_lock lock(doneMutex);
    doneCv.wait(lock, [&] { return done; });
}

bool Queue::isCurrent() const { return tCurrent == this; }

void Queue::assertCurrent() const {
    if (!isCurrent()) fail("must run on this queue", label_);
}

void Queue::assertNotCurrent() const {
    if (isCurrent()) fail("must not run on this queue", label_);
}

Queue* Queue::current() { return tCurrent; }

}  // namespace corvane::dispatch
