#include "platform/event_thread_pool.h"

#include <gtest/gtest.h>
#include <pthread.h>

#include <atomic>
#include <string>
#include <vector>

#include "tests/platform/platform_test_util.h"

namespace android {
namespace Orvane {
namespace {

TEST(EventThreadPoolTest, DueTasksRunByPriorityThenDueTime) {
    sp<EventThreadPool> pool = new EventThreadPool(1, "pool_prio");
    Journal order;
    Gate gate;
    std::atomic<bool> blocking{false};
    ASSERT_TRUE(pool->Start());
    ASSERT_TRUE(pool->AddTask(
            [&] {
                blocking = true;
                gate.Wait();
            },
            "block", 0, 0));
    ASSERT_TRUE(WaitUntil([&] { return blocking.load(); }));

    // Queued while the only thread is busy: priority first, then insertion (due) order.
    pool->AddTask([&] { order.Add("p5-first"); }, "a", 0, 5);
    pool->AddTask([&] { order.Add("p1"); }, "b", 0, 1);
    pool->AddTask([&] { order.Add("p5-second"); }, "c", 0, 5);
    pool->AddTask([&] { order.Add("p-3"); }, "d", 0, -3);
    // Not due yet: must not overtake lower-priority tasks that are due.
    pool->AddTask([&] { order.Add("delayed-p0"); }, "e", 1, 0);
    gate.Open();

    ASSERT_TRUE(WaitUntil([&] { return order.Records().size() == 5; }));
    EXPECT_EQ(order.Entries(), std::vector<std::string>({"p-3", "p1", "p5-first", "p5-second", "delayed-p0"}));
}

TEST(EventThreadPoolTest, DelayedTasksRunInDueOrderOnNamedThreads) {
    sp<EventThreadPool> pool = new EventThreadPool(2, "pool_delay");
    Journal order;
    Journal threadNames;
    auto task = [&](const std::string& label) {
        return [&, label] {
            char name[16] = {0};
            pthread_getname_np(pthread_self(), name, sizeof(name));
            threadNames.Add(name);
            order.Add(label);
        };
    };
    // Added before Start: queued, then run once the threads exist.
    ASSERT_TRUE(pool->AddTask(task("two"), "two", 2, 0));
    ASSERT_TRUE(pool->AddTask(task("one"), "one", 1, 9));
    ASSERT_TRUE(pool->Start());
    EXPECT_FALSE(pool->Start());
    auto start = std::chrono::steady_clock::now();
    ASSERT_TRUE(WaitUntil([&] { return order.Records().size() == 2; }));
    EXPECT_GE(std::chrono::steady_clock::now() - start, std::chrono::milliseconds(1500));
    EXPECT_EQ(order.Entries(), std::vector<std::string>({"one", "two"}));
    EXPECT_EQ(threadNames.Entries(), std::vector<std::string>({"pool_delay", "pool_delay"}));
}

TEST(EventThreadPoolTest, ThreadsRunTasksSideBySide) {
    sp<EventThreadPool> pool = new EventThreadPool(3, "pool_par");
    ASSERT_TRUE(pool->Start());
    std::atomic<int> running{0};
    Gate gate;
    for (int i = 0; i < 3; i++) {
        pool->AddTask(
                [&] {
                    running++;
                    gate.Wait();
                },
                "wait", 0, 0);
    }
    // Only possible when all three tasks hold a thread at once.
    EXPECT_TRUE(WaitUntil([&] { return running.load() == 3; }));
    gate.Open();
}

TEST(EventThreadPoolTest, StopDropsPendingTasksAndRefusesNewOnes) {
    LogCapture capture;
    sp<EventThreadPool> pool = new EventThreadPool(1, "pool_stop");
    ASSERT_TRUE(pool->Start());
    Gate gate;
    std::atomic<bool> started{false};
    std::atomic<bool> finished{false};
    std::atomic<int> dropped{0};
    pool->AddTask(
            [&] {
                started = true;
                gate.Wait();
                finished = true;
            },
            "running", 0, 0);
    ASSERT_TRUE(WaitUntil([&] { return started.load(); }));
    pool->AddTask([&] { dropped++; }, "pending", 0, 0);
    pool->AddTask([&] { dropped++; }, "later", 1, 0);
    EXPECT_EQ(pool->GetPendingCount(), 2u);

    std::thread opener([&] {
        // Opened once Stop has emptied the queues; Stop must then still wait for the running task.
        WaitUntil([&] { return pool->GetPendingCount() == 0; });
        gate.Open();
    });
    pool->Stop();
    opener.join();
    EXPECT_TRUE(finished.load());
    EXPECT_EQ(dropped.load(), 0);
    EXPECT_EQ(pool->GetPendingCount(), 0u);
    EXPECT_TRUE(capture.Contains(ANDROID_LOG_INFO, "Stop pool pool_stop stopped, 2 tasks dropped"));

    EXPECT_FALSE(pool->AddTask([&] { dropped++; }, "refused", 0, 0));
    EXPECT_TRUE(capture.Contains(ANDROID_LOG_WARN, "AddTask pool pool_stop refuses task refused: stopped"));
    EXPECT_FALSE(pool->Start());
    pool->Stop();
}

TEST(EventThreadPoolTest, StopFromOwnTaskDoesNotDeadlock) {
    sp<EventThreadPool> pool = new EventThreadPool(2, "pool_self");
    ASSERT_TRUE(pool->Start());
    std::atomic<bool> done{false};
    pool->AddTask(
            [&] {
                pool->Stop();
                done = true;
            },
            "stopper", 0, 0);
    EXPECT_TRUE(WaitUntil([&] { return done.load(); }));
    EXPECT_FALSE(pool->AddTask([] {}, "late", 0, 0));
}

TEST(EventThreadPoolTest, ThrowingTaskIsLoggedAndPoolGoesOn) {
    LogCapture capture;
    sp<EventThreadPool> pool = new EventThreadPool(1, "pool_throw");
    ASSERT_TRUE(pool->Start());
    std::atomic<bool> after{false};
    pool->AddTask([] { throw std::runtime_error("boom"); }, "thrower", 0, 0);
    pool->AddTask([&] { after = true; }, "after", 0, 0);
    EXPECT_TRUE(WaitUntil([&] { return after.load(); }));
    EXPECT_TRUE(capture.Contains(ANDROID_LOG_ERROR, "WorkerLoop pool pool_throw task thrower failed: boom"));
}

}  // namespace
}  // namespace Orvane
}  // namespace android
