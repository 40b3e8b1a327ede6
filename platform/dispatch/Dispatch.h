// Named serial work queues.
//
// A Queue is one named thread (pthread_setname_np) draining a list of tasks in submission order,
// one task at a time. `async` queues a task; `sync` runs one and waits for it: on an idle queue
// (nothing running, nothing waiting) right on the caller's thread, as the queue's one running task,
// else queued behind the others. A task must not `sync` onto a queue it runs on: that would wait for
// itself forever, so it is a programming error and aborts with a message. "Must run on queue X" is written `X->assertCurrent()`, which aborts elsewhere and tells
// clang's thread-safety analysis that the queue's capability is held.
//
// A queue lives as long as someone holds its shared_ptr; destroying it drains the tasks already
// queued, then ends the thread. Tasks should capture a weak or shared owner, never a raw `this`.
//
// Thread-safety: every member is safe to call from any thread.
#pragma once

#include <chrono>
#include <cstdint>
#include <functional>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <thread>
#include <type_traits>

#include "platform/dispatch/ThreadSafety.h"

namespace corvane::dispatch {

// Priority classes. Background and utility queues run their thread at a higher nice value (lower
// priority); no class raises a thread above the process's own priority, which would need
// CAP_SYS_NICE and so differ between root and the user. User-initiated and user-interactive queues
// ask for short time slices instead (see requestShortSlices), which needs no privilege.
enum class QoS { Background, Utility, Default, UserInitiated, UserInteractive };

// Asks the scheduler to run the calling thread in short slices (0.1 ms instead of the default of
// about 3 ms). The fair scheduler then lets such a thread, woken, run before a thread of equal
// priority that has been running for a while: a thread that serves requests answers within a
// slice even while another process keeps a processor busy. Without the kernel's support
// (before Linux 6.12) it changes nothing.
void requestShortSlices();

class CAPABILITY("queue") Queue {
public:
    static std::shared_ptr<Queue> create(std::string label, QoS qos = QoS::Default);
    ~Queue();
    Queue(const Queue&) = delete;
    Queue& operator=(const Queue&) = delete;

    void async(std::function<void()> task);
    // Queues the task once `delay` has passed (behind what is queued by then). A queue that is
    // destroyed first never runs it.
    void asyncAfter(std::chrono::nanoseconds delay, std::function<void()> task);
    // Runs the task on the queue and waits until it has run.
    void sync(const std::function<void()>& task);
    // Runs the task at once on the caller's thread, as the queue's one running task, when the queue
    // is idle (nothing running, nothing waiting); false, and nothing run, otherwise. For a caller
    // that would rather run a short task itself than wake the queue's thread for it.
    bool runIfIdle(const std::function<void()>& task);
    // Runs `fn` on the queue and returns its result.
    template <class F>
    auto syncResult(F&& fn) -> std::invoke_result_t<F> {
        using R = std::invoke_result_t<F>;
        if constexpr (std::is_void_v<R>) {
            sync(std::function<void()>(std::forward<F>(fn)));
        } else {
            std::optional<R> result;
            sync([&] { result.emplace(fn()); });
            return std::move(*result);
        }
    }

    bool isCurrent() const;
    // Aborts with a message naming the queue unless called on it.
    void assertCurrent() const ASSERT_CAPABILITY(this);
    // Aborts unless called off the queue (entering it synchronously would deadlock).
    void assertNotCurrent() const;

    const std::string& label() const;
    QoS qos() const;

private:
    struct State;
    Queue(std::string label, QoS qos);

    // Shared with the queue's thread, which outlives the Queue object when the last owner lets go
    // from one of the queue's own tasks.
    std::shared_ptr<State> state_;
    std::thread thread_;
};

using QueuePtr = std::shared_ptr<Queue>;

// Tasks of many parties on one queue, taken in turns. Each party's tasks run in the order it gave
// them, and the parties with tasks waiting take one task each in rotation: a party with a thousand
// tasks waiting delays another party's next task by at most one of its own. And while several
// parties are served, none takes more than its share of the queue's time: in each window
// (kWindow), a party whose tasks ran longer than the window divided by the parties served or
// waiting in it (and than a tenth of the window) waits for the next window, even when nothing else
// waits, so that a party that floods the queue leaves the processors to the others too. A party
// alone is never held back.
//
// One task of the Turns is queued on the queue at a time; other tasks of the queue run between.
class Turns {
public:
    static constexpr std::chrono::milliseconds kWindow{10};

    explicit Turns(const QueuePtr& queue);
    void async(uint64_t party, std::function<void()> task);
    // Runs the task at once on the caller's thread (Queue::runIfIdle), its time counted in the
    // party's share, when the queue is idle and the party has no task waiting and is within its
    // share; false, and nothing run, otherwise.
    bool runIfIdle(uint64_t party, const std::function<void()>& task);
    // How many times a party has been held past its share so far.
    uint64_t holdCount() const;

private:
    struct State;
    std::shared_ptr<State> state_;  // shared with the queued run, which may outlive this object
};

// Starts an operation that reports once through a callback, and blocks the calling thread until it
// has: `start` receives the callback and may call it from any thread. Returns what was reported.
template <class T>
T waitForCallback(const std::function<void(std::function<void(const T&)>)>& start) {
    struct Slot {
        Mutex mutex;
        ConditionVariable ready;
        std::optional<T> value GUARDED_BY(mutex);
    };
    // Shared, so a callback that is still unlocking after the waiter returned touches live memory.
    auto slot = std::make_shared<Slot>();
    start([slot](const T& value) {
        MutexLock lock(slot->mutex);
        slot->value = value;
        slot->ready.notify_one();
    });
    MutexLock lock(slot->mutex);
    while (!slot->value) slot->ready.wait(lock);
    return std::move(*slot->value);
}

}  // namespace corvane::dispatch
