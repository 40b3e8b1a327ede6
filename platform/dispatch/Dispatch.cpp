#include "platform/dispatch/Dispatch.h"

#include <pthread.h>
#include <sys/resource.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <cstdio>
#include <cstdlib>
#include <condition_variable>
#include <deque>
#include <mutex>
#include <optional>

namespace corvane::dispatch {

struct Queue::State {
    State(std::string l, QoS q) : label(std::move(l)), qos(q) {}
    const std::string label;
    const QoS qos;
    std::mutex mutex;
    std::condition_variable wake;
    std::deque<std::function<void()>> tasks;
    bool stopping = false;
};

namespace {

thread_local const void* tCurrent = nullptr;

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

template <class State>
void drain(const std::shared_ptr<State>& state) {
    // Thread names are at most 15 bytes.
    pthread_setname_np(pthread_self(), state->label.substr(0, 15).c_str());
    int nice = niceFor(state->qos);
    if (nice != 0) {
        // Per-thread nice value; raising priority fails without CAP_SYS_NICE, which is fine.
        (void)setpriority(PRIO_PROCESS, static_cast<id_t>(syscall(SYS_gettid)), nice);
    }
    tCurrent = state.get();
    for (;;) {
        std::function<void()> task;
        {
            std::unique_lock lock(state->mutex);
            state->wake.wait(lock, [&] { return state->stopping || !state->tasks.empty(); });
            if (state->tasks.empty()) break;
            task = std::move(state->tasks.front());
            state->tasks.pop_front();
        }
        task();
    }
    tCurrent = nullptr;
}

}  // namespace

std::shared_ptr<Queue> Queue::create(std::string label, QoS qos) {
    return std::shared_ptr<Queue>(new Queue(std::move(label), qos));
}

Queue::Queue(std::string label, QoS qos)
    : state_(std::make_shared<State>(std::move(label), qos)) {
    thread_ = std::thread([state = state_] { drain(state); });
}

Queue::~Queue() {
    {
        std::lock_guard lock(state_->mutex);
        state_->stopping = true;
    }
    state_->wake.notify_all();
    if (std::this_thread::get_id() == thread_.get_id()) {
        // The last owner let go from a task of this very queue: the thread drains what is left
        // and ends by itself, keeping the shared state alive until then.
        thread_.detach();
    } else {
        thread_.join();
    }
}

const std::string& Queue::label() const { return state_->label; }
QoS Queue::qos() const { return state_->qos; }

void Queue::async(std::function<void()> task) {
    {
        std::lock_guard lock(state_->mutex);
        state_->tasks.push_back(std::move(task));
    }
    state_->wake.notify_one();
}

void Queue::sync(const std::function<void()>& task) {
    if (isCurrent()) fail("sync onto the current queue would deadlock", state_->label);
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

bool Queue::isCurrent() const { return tCurrent == state_.get(); }

void Queue::assertCurrent() const {
    if (!isCurrent()) fail("must run on this queue", state_->label);
}

void Queue::assertNotCurrent() const {
    if (isCurrent()) fail("must not run on this queue", state_->label);
}

}  // namespace corvane::dispatch
