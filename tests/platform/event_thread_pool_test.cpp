#include "platform/event_thread_pool.h"

#include "tests/platform/platform_test_util.h"

namespace android::Orvane {

TEST(EventThreadPoolTest, TasksRunByPriorityThenDueTimeAndStopDropsPendingOnes) {
    LogCapture capture;
    sp<EventThreadPool> pool = new EventThreadPool(1, "pool_test");
    Journal order;
    Gate gate, running;
    auto task = [&](const std::string& label) { return [&, label] { order.Add(label); }; };
    // Added before Start: must not overtake due tasks of lower priority (higher value).
    pool->AddTask(task("delayed-p0"), "e", 1, 0);
    ASSERT_TRUE(pool->Start());
    std::atomic<bool> held{false};
    pool->AddTask(
            [&] {
                held = true;
                gate.Wait();
            },
            "block", 0, 0);
    ASSERT_TRUE(WaitUntil([&] { return held.load(); }));
    // Queued while the only thread is held: priority first, then insertion (due) order.
    pool->AddTask(task("p5-first"), "a", 0, 5);
    pool->AddTask(task("p1"), "b", 0, 1);
    pool->AddTask(task("p5-second"), "c", 0, 5);
    pool->AddTask(task("p-3"), "d", 0, -3);
    gate.Open();
    ASSERT_TRUE(order.WaitForSize(5));
    EXPECT_EQ(order.Entries(), std::vector<std::string>({"p-3", "p1", "p5-first", "p5-second", "delayed-p0"}));

    // Stop waits for the running task, drops the pending ones and refuses new ones.
    std::atomic<int> finished{0};
    pool->AddTask(
            [&] {
                running.Wait();
                finished++;
            },
            "running", 0, 0);
    ASSERT_TRUE(WaitUntil([&] { return pool->GetPendingCount() == 0; }));  // the thread holds it
    pool->AddTask([&] { finished += 10; }, "pending", 0, 0);
    pool->AddTask([&] { finished += 10; }, "later", 1, 0);
    // Opened once Stop has emptied the queues; Stop must then still wait for the running task.
    std::thread opener([&] {
        WaitUntil([&] { return pool->GetPendingCount() == 0; });
        running.Open();
    });
    pool->Stop();
    opener.join();
    EXPECT_EQ(finished.load(), 1);
    EXPECT_TRUE(capture.Contains(ANDROID_LOG_INFO, "Stop pool pool_test stopped, 2 tasks dropped"));
    EXPECT_FALSE(pool->AddTask([] {}, "refused", 0, 0));
    EXPECT_TRUE(capture.Contains(ANDROID_LOG_WARN, "AddTask pool pool_test refuses task refused: stopped"));
}

}  // namespace android::Orvane
