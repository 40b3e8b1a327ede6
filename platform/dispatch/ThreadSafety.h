// Clang thread-safety annotations, and the mutex the analysis understands.
//
// A serial queue is a capability: state that lives on a queue is GUARDED_BY it, functions that must
// run there REQUIRE it, and code that enters the queue tells the analysis so with
// Queue::assertCurrent() (an ASSERT_CAPABILITY). A Mutex is a capability too: fields it protects
// are GUARDED_BY it, functions called with it held REQUIRE it, and MutexLock holds it for a scope.
// Other compilers see plain code.
#pragma once

#include <atomic>
#include <chrono>
#include <condition_variable>
#include <cstdio>
#include <cstdlib>
#include <mutex>
#include <thread>

#if defined(__clang__)
#define AX_TSA(x) __attribute__((x))
#else
#define AX_TSA(x)
#endif

#define CAPABILITY(x) AX_TSA(capability(x))
#define SCOPED_CAPABILITY AX_TSA(scoped_lockable)
#define GUARDED_BY(x) AX_TSA(guarded_by(x))
#define PT_GUARDED_BY(x) AX_TSA(pt_guarded_by(x))
#define REQUIRES(...) AX_TSA(requires_capability(__VA_ARGS__))
#define EXCLUDES(...) AX_TSA(locks_excluded(__VA_ARGS__))
#define ACQUIRE(...) AX_TSA(acquire_capability(__VA_ARGS__))
#define RELEASE(...) AX_TSA(release_capability(__VA_ARGS__))
#define ASSERT_CAPABILITY(x) AX_TSA(assert_capability(x))
#define RETURN_CAPABILITY(x) AX_TSA(lock_returned(x))
#define NO_THREAD_SAFETY_ANALYSIS AX_TSA(no_thread_safety_analysis)

namespace corvane {

class ConditionVariable;

// A std::mutex that clang's analysis can check, and that knows which thread holds it.
class CAPABILITY("mutex") Mutex {
public:
    void lock() ACQUIRE() {
        mutex_.lock();
        owner_.store(std::this_thread::get_id(), std::memory_order_relaxed);
    }
    void unlock() RELEASE() {
        owner_.store(std::thread::id(), std::memory_order_relaxed);
        mutex_.unlock();
    }
    // Aborts unless the calling thread holds the mutex; tells the analysis that it does (for code,
    // such as a lambda, that runs under a lock its caller took).
    void assertHeld() const ASSERT_CAPABILITY(this) {
        if (owner_.load(std::memory_order_relaxed) != std::this_thread::get_id()) {
            std::fputs("Mutex::assertHeld: the calling thread does not hold the mutex\n", stderr);
            std::abort();
        }
    }

private:
    friend class ConditionVariable;
    std::mutex mutex_;
    std::atomic<std::thread::id> owner_{};
};

// Holds a Mutex from construction to the end of the scope; a ConditionVariable waits on it.
class SCOPED_CAPABILITY MutexLock {
public:
    explicit MutexLock(Mutex& mutex) ACQUIRE(mutex) : mutex_(mutex) { mutex_.lock(); }
    ~MutexLock() RELEASE() { mutex_.unlock(); }
    MutexLock(const MutexLock&) = delete;
    MutexLock& operator=(const MutexLock&) = delete;

private:
    friend class ConditionVariable;
    Mutex& mutex_;
};

// A condition variable over a MutexLock: waiting unlocks the mutex and locks it again before it
// returns. It is a std::condition_variable on the Mutex's own std::mutex, not a
// condition_variable_any: that one notifies under an inner lock of its own, so a waiter woken on
// the same core first blocks on that lock, and every hand-over costs two wake-ups.
class ConditionVariable {
public:
    void notify_one() noexcept { cv_.notify_one(); }
    void notify_all() noexcept { cv_.notify_all(); }
    void wait(MutexLock& lock) NO_THREAD_SAFETY_ANALYSIS {
        Mutex& mutex = lock.mutex_;
        std::unique_lock<std::mutex> held(mutex.mutex_, std::adopt_lock);
        mutex.owner_.store(std::thread::id(), std::memory_order_relaxed);
        cv_.wait(held);
        mutex.owner_.store(std::this_thread::get_id(), std::memory_order_relaxed);
        held.release();  // the scope of `lock` still owns the mutex
    }
    template <class Predicate>
    void wait(MutexLock& lock, Predicate ready) {
        while (!ready()) wait(lock);
    }
    // Waits until notified or until `deadline` (or spuriously), whichever comes first.
    void waitUntil(MutexLock& lock, std::chrono::steady_clock::time_point deadline) NO_THREAD_SAFETY_ANALYSIS {
        Mutex& mutex = lock.mutex_;
        std::unique_lock<std::mutex> held(mutex.mutex_, std::adopt_lock);
        mutex.owner_.store(std::thread::id(), std::memory_order_relaxed);
        cv_.wait_until(held, deadline);
        mutex.owner_.store(std::this_thread::get_id(), std::memory_order_relaxed);
        held.release();
    }

private:
    std::condition_variable cv_;
};

}  // namespace corvane
