#include "platform/dispatch/Dispatch.h"

#include <pthread.h>
#include <sched.h>
#include <sys/resource.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <cstdio>
#include <cstdlib>
#include <algorithm>
#include <deque>
#include <vector>
#include <mutex>
#include <optional>

namespace corvane::dispatch {

struct Queue::State {
    State(std::string l, QoS q) : label(std::move(l)), qos(q) {}
    const std::string label;
    const QoS qos;
    Mutex mutex;
    ConditionVariable wake;
    std::deque<std::function<void()>> tasks GUARDED_BY(mutex);
    bool stopping GUARDED_BY(mutex) = false;
    // A task is running, on the queue's thread or on a caller's (see sync): the queue runs one
    // task at a time wherever it runs.
    bool busy GUARDED_BY(mutex) = false;
};

namespace {

// The queues whose task this thread is running, innermost last: a task that enters another queue
// synchronously runs on the same thread, inside the first one's task.
thread_local std::vector<const void*> tCurrent;

struct Entered {
    explicit Entered(const void* queue) { tCurrent.push_back(queue); }
    ~Entered() { tCurrent.pop_back(); }
    Entered(const Entered&) = delete;
    Entered& operator=(const Entered&) = delete;
};

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
    if (state->qos >= QoS::UserInitiated) requestShortSlices();
    Entered entered(state.get());
    for (;;) {
        std::function<void()> task;
        {
            MutexLock lock(state->mutex);
            while (!(state->stopping && state->tasks.empty()) && (state->busy || state->tasks.empty()))
                state->wake.wait(lock);
            if (state->tasks.empty()) break;
            task = std::move(state->tasks.front());
            state->tasks.pop_front();
            state->busy = true;
        }
        task();
        task = nullptr;  // what it captured goes before the next task runs
        MutexLock lock(state->mutex);
        state->busy = false;
    }
}

// An idle queue runs a synchronous task right on the caller's thread, as its one running task: the
// same order and exclusion as on its own thread, without two thread switches. False (nothing run)
// when the queue is busy or has tasks waiting.
template <class State>
bool runHereIfIdle(State& state, const std::function<void()>& task) {
    {
        MutexLock lock(state.mutex);
        if (state.busy || !state.tasks.empty() || state.stopping) return false;
        state.busy = true;
    }
    {
        Entered entered(&state);
        task();
    }
    MutexLock lock(state.mutex);
    state.busy = false;
    // The queue's thread waits only for tasks; wake it when some came meanwhile.
    if (!state.tasks.empty()) state.wake.notify_one();
    return true;
}

}  // namespace

void requestShortSlices() {
    // The kernel's struct sched_attr (its first version); <linux/sched/types.h> cannot be included
    // beside <sched.h>.
    struct {
        uint32_t size;
        uint32_t policy;
        uint64_t flags;
        int32_t nice;
        uint32_t priority;
        uint64_t runtime;
        uint64_t deadline;
        uint64_t period;
    } attr{};
    attr.size = sizeof attr;
    attr.policy = SCHED_OTHER;
    attr.nice = getpriority(PRIO_PROCESS, static_cast<id_t>(syscall(SYS_gettid)));
    attr.runtime = 100 * 1000;  // nanoseconds: the shortest slice the kernel grants
    (void)syscall(SYS_sched_setattr, 0, &attr, 0);
}

std::shared_ptr<Queue> Queue::create(std::string label, QoS qos) {
    return std::shared_ptr<Queue>(new Queue(std::move(label), qos));
}

Queue::Queue(std::string label, QoS qos)
    : state_(std::make_shared<State>(std::move(label), qos)) {
    thread_ = std::thread([state = state_] { drain(state); });
}

Queue::~Queue() {
    {
        MutexLock lock(state_->mutex);
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
        MutexLock lock(state_->mutex);
        state_->tasks.push_back(std::move(task));
    }
    state_->wake.notify_one();
}

void Queue::sync(const std::function<void()>& task) {
    if (isCurrent()) fail("sync onto the current queue would deadlock", state_->label);
    if (runHereIfIdle(*state_, task)) return;
    struct Done {
        Mutex mutex;
        ConditionVariable cv;
        bool done GUARDED_BY(mutex) = false;
    } done;
    async([&] {
        task();
        MutexLock lock(done.mutex);
        done.done = true;
        done.cv.notify_one();
    });
    MutexLock lock(done.mutex);
    while (!done.done) done.cv.wait(lock);
}

bool Queue::runIfIdle(const std::function<void()>& task) {
    return runHereIfIdle(*state_, task);
}

bool Queue::isCurrent() const {
    return std::find(tCurrent.begin(), tCurrent.end(), state_.get()) != tCurrent.end();
}

void Queue::assertCurrent() const {
    if (!isCurrent()) fail("must run on this queue", state_->label);
}

void Queue::assertNotCurrent() const {
    if (isCurrent()) fail("must not run on this queue", state_->label);
}

}  // namespace corvane::dispatch
