#include <gtest/gtest.h>
#include <pthread.h>

#include <atomic>
#include <future>
#include <string>
#include <mutex>
#include <thread>
#include <vector>

#include "platform/dispatch/Dispatch.h"
#include "tests/support/TestSupport.h"

using corvane::dispatch::QoS;
using corvane::dispatch::Queue;

TEST(Dispatch, TasksRunInOrderOnOneNamedThread) {
    auto q = Queue::create("AXDatabase", QoS::UserInitiated);
    std::vector<int> order;
    std::vector<std::string> names;
    for (int i = 0; i < 100; ++i)
        q->async([&, i] {
            order.push_back(i);
            char name[16] = {};
            pthread_getname_np(pthread_self(), name, sizeof name);
            names.emplace_back(name);
        });
    q->sync([] {});
    ASSERT_EQ(order.size(), 100u);
    for (int i = 0; i < 100; ++i) EXPECT_EQ(order[i], i);
    for (const auto& n : names) EXPECT_EQ(n, "AXDatabase");
    EXPECT_EQ(q->qos(), QoS::UserInitiated);
}

TEST(Dispatch, IsCurrentOnlyOnTheQueue) {
    auto a = Queue::create("a");
    auto b = Queue::create("b");
    EXPECT_FALSE(a->isCurrent());
    bool onA = false;
    bool bFromA = true;
    a->sync([&] {
        onA = a->isCurrent();
        bFromA = b->isCurrent();
        b->sync([&] { EXPECT_TRUE(b->isCurrent()); });  // entering another queue is fine
    });
    EXPECT_TRUE(onA);
    EXPECT_FALSE(bFromA);
    EXPECT_EQ(a->syncResult([] { return 42; }), 42);
}

TEST(Dispatch, RunIfIdleRunsHereOnlyOnAnIdleQueue) {
    auto q = Queue::create("service");
    std::thread::id ranOn;
    bool current = false;
    EXPECT_TRUE(q->runIfIdle([&] {
        ranOn = std::this_thread::get_id();
        current = q->isCurrent();
    }));
    EXPECT_EQ(ranOn, std::this_thread::get_id());
    EXPECT_TRUE(current);

    // Busy: a task is running on the queue's thread; nothing runs here, and the queue stays one
    // task at a time.
    std::mutex gate;
    std::unique_lock<std::mutex> held(gate);
    std::atomic<bool> started{false};
    q->async([&] {
        started = true;
        std::lock_guard<std::mutex> wait(gate);
    });
    while (!started) std::this_thread::yield();
    bool ran = false;
    EXPECT_FALSE(q->runIfIdle([&] { ran = true; }));
    EXPECT_FALSE(ran);
    // Inside a task of its own the queue is busy too.
    held.unlock();
    q->sync([&] { EXPECT_FALSE(q->runIfIdle([&] { ran = true; })); });
    EXPECT_FALSE(ran);
}

TEST(DispatchDeathTest, SyncOntoTheCurrentQueueAborts) {
    GTEST_FLAG_SET(death_test_style, "threadsafe");
    EXPECT_DEATH(
        {
            auto q = Queue::create("serverSync");
            q->sync([&] { q->sync([] {}); });
        },
        "sync onto the current queue would deadlock \\(queue \"serverSync\"\\)");
}

TEST(DispatchDeathTest, AssertCurrentAbortsElsewhere) {
    GTEST_FLAG_SET(death_test_style, "threadsafe");
    EXPECT_DEATH(
        {
            auto q = Queue::create("AXDatabase");
            q->assertCurrent();
        },
        "must run on this queue \\(queue \"AXDatabase\"\\)");
}

TEST(Dispatch, DestroyingAQueueDrainsQueuedWork) {
    std::atomic<int> ran{0};
    {
        auto q = Queue::create("drain");
        for (int i = 0; i < 50; ++i) q->async([&] { ++ran; });
    }
    EXPECT_EQ(ran.load(), 50);
}

TEST(Dispatch, LastOwnerReleasedFromItsOwnTask) {
    auto q = Queue::create("self");
    std::atomic<bool> done{false};
    Queue* raw = q.get();
    raw->async([q = std::move(q), &done]() mutable {
        q.reset();  // the queue's destructor runs on its own thread
        done = true;
    });
    for (int i = 0; i < 1000 && !done; ++i) usleep(1000);
    EXPECT_TRUE(done);
}

// Parties take turns: a party that queued many tasks first delays the others' by one task each
// round, each party's tasks keep their order, and a task that queues its party's next one (work in
// slices) goes to the back of the round.
TEST(Dispatch, TurnsServeEveryPartyInRotation) {
    auto queue = corvane::dispatch::Queue::create("test.turns");
    corvane::dispatch::Turns turns(queue);
    std::vector<std::string> ran;
    std::mutex mutex;
    auto note = [&](std::string what) {
        std::lock_guard lock(mutex);
        ran.push_back(std::move(what));
    };
    std::promise<void> release;
    auto gate = release.get_future().share();
    queue->async([gate] { gate.wait(); });  // holds the queue while the rest is queued
    for (int i = 1; i <= 4; ++i) turns.async(1, [&, i] { note("a" + std::to_string(i)); });
    turns.async(2, [&] {
        note("b1");
        turns.async(2, [&] { note("b1 again"); });
    });
    turns.async(2, [&] { note("b2"); });
    turns.async(3, [&] { note("c1"); });
    release.set_value();
    EXPECT_TRUE(axtest::eventually([&] {
        std::lock_guard lock(mutex);
        return ran.size() == 8;
    }));
    std::lock_guard lock(mutex);
    EXPECT_EQ(ran, (std::vector<std::string>{"a1", "b1", "c1", "a2", "b2", "a3", "b1 again", "a4"}));
}

// While another party is served, a party that runs long waits for later windows even when the
// queue has nothing else to do; alone, it is never held back.
TEST(Dispatch, TurnsHoldAPartyPastItsShareWhileOthersAreServed) {
    constexpr auto kTask = std::chrono::milliseconds(2);
    constexpr int kTasks = 20;  // 40 ms of work
    // How often the heavy party was held, and whether the light one, always waiting, was served
    // between the heavy one's tasks. (Counted, not timed: a loaded machine stretches every time.)
    struct Outcome {
        uint64_t holds;
        int lightServed;
    };
    auto run = [&](bool withOther) {
        auto queue = corvane::dispatch::Queue::create("test.shares");
        corvane::dispatch::Turns turns(queue);
        std::atomic<int> left{kTasks};
        std::atomic<int> lightServed{0};
        std::promise<void> finished, lightStopped;
        std::function<void()> light = [&] {
            ++lightServed;
            if (left > 0) {
                turns.async(2, light);  // always waiting, never long
            } else {
                lightStopped.set_value();
            }
        };
        for (int i = 0; i < kTasks; ++i) {
            turns.async(1, [&] {
                std::this_thread::sleep_for(kTask);
                if (--left == 0) finished.set_value();
            });
        }
        if (withOther) turns.async(2, light);
        finished.get_future().wait();
        if (withOther) lightStopped.get_future().wait();
        return Outcome{turns.holdCount(), lightServed.load()};
    };
    // Two parties: the heavy one gets a little more than half of each 10 ms window, so its 40 ms
    // of work is held in several windows, while the light one goes on being served.
    Outcome shared = run(true);
    EXPECT_GE(shared.holds, 3u);
    EXPECT_GE(shared.lightServed, kTasks);
    // Alone it is never held.
    EXPECT_EQ(run(false).holds, 0u) << "held back while alone";
}

// A task run in place counts in its party's share like a queued one: past the share, the party's
// next task is refused in place (and queued by the caller) while another party's still runs there.
TEST(Dispatch, TurnsRunATaskInPlaceOnlyWithinItsPartysShare) {
    auto queue = corvane::dispatch::Queue::create("test.inplace");
    corvane::dispatch::Turns turns(queue);
    auto start = std::chrono::steady_clock::now();
    bool ran = false;
    EXPECT_TRUE(turns.runIfIdle(1, [&] { std::this_thread::sleep_for(std::chrono::milliseconds(6)); }));
    EXPECT_TRUE(turns.runIfIdle(2, [&] { ran = true; }));
    EXPECT_TRUE(ran);
    bool heavyAgain = turns.runIfIdle(1, [] {});
    bool lightAgain = turns.runIfIdle(2, [] {});
    // Within the window both parties are served in it, and the heavy one ran more than half of it.
    if (std::chrono::steady_clock::now() - start < std::chrono::milliseconds(9)) {
        EXPECT_FALSE(heavyAgain);
        EXPECT_TRUE(lightAgain);
    }
    // A queue that is busy runs nothing in place.
    std::promise<void> release;
    std::shared_future<void> released = release.get_future().share();
    std::promise<void> running;
    queue->async([&running, released] {
        running.set_value();
        released.wait();
    });
    running.get_future().wait();
    EXPECT_FALSE(turns.runIfIdle(3, [] {}));
    release.set_value();
    queue->sync([] {});
}
