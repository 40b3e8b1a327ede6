#include "platform/dispatch/Dispatch.h"

#include <pthread.h>
#include <sched.h>
#include <sys/resource.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <algorithm>
#include <cstdio>
#include <cstdlib>
#include <chrono>
#include <deque>
#include <map>
#include <mutex>
#include <optional>
#include <unordered_map>
#include <unordered_set>
#include <vector>

namespace corvane::dispatch {

struct Queue::State {
    State(std::string l, QoS q) : label(std::move(l)), qos(q) {}
    const std::string label;
    const QoS qos;
    Mutex mutex;
    ConditionVariable wake;
    std::deque<std::function<void()>> tasks GUARDED_BY(mutex);
    // Tasks queued with asyncAfter, by the time they join `tasks`.
    std::multimap<std::chrono::steady_clock::time_point, std::function<void()>> timed GUARDED_BY(mutex);
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
        // Never above the process's own priority: that would take a privilege an ordinary user
        // lacks, so a daemon run by root would schedule its threads unlike the same daemon run by
        // the user (a request thread above the I/O thread it waits on). Short slices instead.
        case QoS::UserInitiated: return 0;
        case QoS::UserInteractive: return 0;
    }
    return 0;
}

[[noreturn]] void fail(const char* what, const std::string& label) {
    std::fprintf(stderr, "dispatch: %s (queue \"%s\")\n", what, label.c_str());
    std::fflush(stderr);
    std::abort();
}

// How long a queue runs tasks back to back before it lets other threads on its processor run.
constexpr std::chrono::microseconds kYieldAfter{200};

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
    auto busySince = std::chrono::steady_clock::now();
    for (;;) {
        std::function<void()> task;
        {
            MutexLock lock(state->mutex);
            for (;;) {
                auto now = std::chrono::steady_clock::now();
                while (!state->timed.empty() && state->timed.begin()->first <= now) {
                    state->tasks.push_back(std::move(state->timed.begin()->second));
                    state->timed.erase(state->timed.begin());
                }
                if (state->stopping && state->tasks.empty()) break;
                if (!state->busy && !state->tasks.empty()) break;
                if (state->timed.empty() || state->stopping) {
                    state->wake.wait(lock);
                } else {
                    state->wake.waitUntil(lock, state->timed.begin()->first);
                }
                busySince = std::chrono::steady_clock::now();
            }
            if (state->tasks.empty()) break;
            task = std::move(state->tasks.front());
            state->tasks.pop_front();
            state->busy = true;
        }
        task();
        task = nullptr;  // what it captured goes before the next task runs
        // A queue that runs task after task would keep its processor until the scheduler takes it
        // away, however short its slices: a thread woken on the same processor meanwhile (a client
        // waiting for its reply, the I/O thread with a new request) would wait milliseconds. It
        // gives the processor up between tasks instead, a few times a millisecond; with nothing
        // else to run, that costs one system call.
        if (auto now = std::chrono::steady_clock::now(); now - busySince > kYieldAfter) {
            sched_yield();
            busySince = now;
        }
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

void Queue::asyncAfter(std::chrono::nanoseconds delay, std::function<void()> task) {
    {
        MutexLock lock(state_->mutex);
        state_->timed.emplace(std::chrono::steady_clock::now() + delay, std::move(task));
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

// ---- turns

struct Turns::State : std::enable_shared_from_this<Turns::State> {
    using Clock = std::chrono::steady_clock;
    explicit State(const QueuePtr& q) : queue(q) {}

    const std::weak_ptr<Queue> queue;
    Mutex mutex;
    std::unordered_map<uint64_t, std::deque<std::function<void()>>> waiting GUARDED_BY(mutex);
    std::deque<uint64_t> rotation GUARDED_BY(mutex);    // waiting parties that may go now, next first
    std::unordered_set<uint64_t> held GUARDED_BY(mutex);  // waiting parties past their share
    // The current window: when it ends, and how long each party served in it ran.
    Clock::time_point windowEnd GUARDED_BY(mutex);
    std::unordered_map<uint64_t, Clock::duration> used GUARDED_BY(mutex);
    uint64_t holds GUARDED_BY(mutex) = 0;       // times a party was held
    bool running GUARDED_BY(mutex) = false;     // a run is queued or running
    bool timerSet GUARDED_BY(mutex) = false;    // a run is queued for the window's end

    // A new window when the current one is over: every share starts again.
    void roll(Clock::time_point now) REQUIRES(mutex) {
        if (now < windowEnd) return;
        windowEnd = now + kWindow;
        used.clear();
        for (uint64_t party : held) rotation.push_back(party);
        held.clear();
    }

    bool pastShare(uint64_t party) REQUIRES(mutex) {
        auto ran = used.find(party);
        if (ran == used.end()) return false;
        size_t parties = used.size();
        for (const auto& entry : waiting) parties += used.count(entry.first) ? 0 : 1;
        // A share is never less than a tenth of the window: a party that asks for little (a host's
        // few lookups) is never held back, however many parties there are.
        return parties > 1 && ran->second > std::max<Clock::duration>(kWindow / parties, kWindow / 10);
    }

    void hold(uint64_t party) REQUIRES(mutex) {
        held.insert(party);
        ++holds;
        if (timerSet) return;
        auto q = queue.lock();
        if (!q) return;
        timerSet = true;
        q->asyncAfter(windowEnd - Clock::now(), [self = shared_from_this()] {
            MutexLock lock(self->mutex);
            self->timerSet = false;
            self->roll(Clock::now());
            self->startRunning();
        });
    }

    void startRunning() REQUIRES(mutex) {
        if (running || rotation.empty()) return;
        auto q = queue.lock();
        if (!q) return;
        running = true;
        q->async([self = shared_from_this()] { self->runNext(); });
    }

    void runNext() {
        uint64_t party;
        std::function<void()> task;
        {
            MutexLock lock(mutex);
            roll(Clock::now());
            if (rotation.empty()) {
                running = false;
                return;
            }
            party = rotation.front();
            rotation.pop_front();
            auto tasks = waiting.find(party);
            task = std::move(tasks->second.front());
            tasks->second.pop_front();
            if (tasks->second.empty()) {
                waiting.erase(tasks);
            } else {
                rotation.push_back(party);
            }
        }
        auto started = Clock::now();
        task();
        task = nullptr;
        MutexLock lock(mutex);
        used[party] += Clock::now() - started;
        if (waiting.count(party) && pastShare(party)) {
            std::erase(rotation, party);
            hold(party);
        }
        running = false;
        startRunning();
    }
};

Turns::Turns(const QueuePtr& queue) : state_(std::make_shared<State>(queue)) {}

void Turns::async(uint64_t party, std::function<void()> task) {
    MutexLock lock(state_->mutex);
    state_->roll(State::Clock::now());
    auto& tasks = state_->waiting[party];
    bool first = tasks.empty();
    tasks.push_back(std::move(task));
    if (first) {
        if (state_->pastShare(party)) {
            state_->hold(party);
        } else {
            state_->rotation.push_back(party);
        }
    }
    state_->startRunning();
}

uint64_t Turns::holdCount() const {
    MutexLock lock(state_->mutex);
    return state_->holds;
}

bool Turns::runIfIdle(uint64_t party, const std::function<void()>& task) {
    {
        MutexLock lock(state_->mutex);
        state_->roll(State::Clock::now());
        if (state_->waiting.count(party) || state_->pastShare(party)) return false;
    }
    auto queue = state_->queue.lock();
    if (!queue) return false;
    auto started = State::Clock::now();
    if (!queue->runIfIdle(task)) return false;
    MutexLock lock(state_->mutex);
    state_->used[party] += State::Clock::now() - started;
    return true;
}

}  // namespace corvane::dispatch
