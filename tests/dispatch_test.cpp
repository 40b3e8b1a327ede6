#include <gtest/gtest.h>
#include <pthread.h>

#include <atomic>
#include <mutex>
#include <thread>
#include <vector>

#include "platform/dispatch/Dispatch.h"

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
