#include "platform/event_loop.h"

#include <sys/syscall.h>
#include <unistd.h>

#include <atomic>
#include <fstream>
#include <future>

#include "tests/platform/platform_test_util.h"

namespace android::Orvane {

using std::chrono::milliseconds;

struct CallbackHandler : EventHandler {
    explicit CallbackHandler(std::function<EVENT_RET(sp<Event>&)> f) : callback(std::move(f)) {}
    EVENT_RET OnEvent(sp<Event>& event) override { return callback(event); }
    std::function<EVENT_RET(sp<Event>&)> callback;
};

class EventLoopTest : public ::testing::Test {
protected:
    void SetUp() override { loop_->StartLoop(); }
    // The loop thread's kernel id; every entry due before this call has run when it returns.
    pid_t Drain() {
        auto tid = std::make_shared<std::atomic<pid_t>>(0);
        loop_->AddTask([tid] { *tid = static_cast<pid_t>(syscall(SYS_gettid)); });
        EXPECT_TRUE(WaitUntil([&] { return *tid != 0; }, std::chrono::seconds(60)));
        return *tid;
    }
    // Queues a new event for `handler`; the returned reference empties once the event is released.
    wp<Event> Queue(const sp<EventHandler>& handler, unsigned long delaySeconds = 0) {
        sp<Event> event = new Event("test");
        loop_->AddEvent(handler, event, delaySeconds);
        return event;
    }

    sp<EventLoop> loop_ = new EventLoop("test_loop");
};

TEST_F(EventLoopTest, EntriesFromConcurrentProducersRunOnceEachOneAtATimeInDueOrder) {
    constexpr int kThreads = 4, kPerThread = 2000;
    std::vector<std::atomic<int>> runs(kThreads * kPerThread);
    std::vector<int> delays;  // only the loop's thread touches it
    Gate gate;
    loop_->AddTask([&gate] { gate.Wait(); });  // due first, so it holds the loop from the start
    // Queued in mixed order while the loop is busy: the due time alone decides.
    std::vector<std::thread> producers;
    for (int t = 0; t < kThreads; t++) {
        producers.emplace_back([&, t] {
            for (int index = t * kPerThread; index < (t + 1) * kPerThread; index++) {
                loop_->AddTask(
                        [&, index] {
                            runs[index]++;
                            delays.push_back(index % 3);
                        },
                        index % 3);
            }
        });
    }
    for (auto& producer : producers)
        producer.join();
    gate.Open();
    ASSERT_TRUE(WaitUntil([&] { return std::count(runs.begin(), runs.end(), 1) == kThreads * kPerThread; }));
    Drain();
    EXPECT_TRUE(std::is_sorted(delays.begin(), delays.end()));
}

TEST_F(EventLoopTest, RepeatingTaskDriftsByItsRunTimeAndZeroIntervalRunsOnce) {
    Journal starts;
    std::atomic<int> zeroRepeats{0};
    // The task's own run time of 200 ms adds to its period.
    loop_->AddTask(
            [&starts] {
                starts.Add("run");
                std::this_thread::sleep_for(milliseconds(200));
            },
            1, true);
    loop_->AddTask([&zeroRepeats] { zeroRepeats++; }, 0, true);
    ASSERT_TRUE(starts.WaitForSize(3));
    Drain();
    EXPECT_EQ(zeroRepeats, 1);
    auto records = starts.Records();
    auto span = std::chrono::duration_cast<milliseconds>(records[2].when - records[0].when).count();
    EXPECT_TRUE(span >= 2400 && span < 4000) << "two periods took " << span << " ms";
}

TEST_F(EventLoopTest, WaitResultBlocksUntilRunAndFailsOnlyOnMinusOne) {
    pid_t tid = Drain();
    std::atomic<EVENT_RET> next{0};
    std::atomic<int> runs{0};
    sp<EventHandler> handler = new CallbackHandler([&](sp<Event>&) {
        std::this_thread::sleep_for(std::chrono::milliseconds(50));  // the caller must wait this out
        runs += syscall(SYS_gettid) == tid;
        return next.load();
    });
    sp<Event> event = new Event("test");
    for (EVENT_RET ret : {0, -1, 1, 7, -2}) {
        next = ret;
        int before = runs;
        EXPECT_EQ(loop_->AddEventWaitResult(handler, event), ret != -1) << ret;
        EXPECT_EQ(runs, before + 1) << "returned before the handler ran on the loop, result " << ret;
    }
    EXPECT_FALSE(loop_->AddEventWaitResult(nullptr, event));
    EXPECT_EQ(loop_->AddEvent(handler, nullptr), UINT64_MAX);
}

// A caller waiting for an entry that only its own thread could run, or that a stopped loop never
// runs, would wait for good: both are refused at once with one error line.
TEST_F(EventLoopTest, WaitResultRefusedOnItsOwnLoopAndOnAStoppedLoop) {
    LogCapture capture;
    std::atomic<int> runs{0};
    sp<EventHandler> handler = new CallbackHandler([&runs](sp<Event>&) { return ++runs; });
    sp<Event> event = new Event("test");
    // 0 while waiting, then 1 for false and 2 for true. The task holds the loop, so a loop stuck
    // waiting for itself is left behind instead of hanging the test's teardown.
    auto result = std::make_shared<std::atomic<int>>(0);
    loop_->AddTask([loop = loop_, handler, event, result] { *result = loop->AddEventWaitResult(handler, event) + 1; });
    ASSERT_TRUE(WaitUntil([&] { return *result != 0; })) << "a wait on the loop's own thread hangs";
    EXPECT_EQ(*result, 1);
    EXPECT_EQ(capture.Count(ANDROID_LOG_ERROR, "AddEventWaitResult"), 1u) << capture.Dump();
    // From another thread the same call runs the handler.
    EXPECT_TRUE(loop_->AddEventWaitResult(handler, event));
    EXPECT_EQ(runs, 1);

    loop_->StopLoop();
    capture.Clear();
    *result = 0;
    std::thread waiter(
            [loop = loop_, handler, event, result] { *result = loop->AddEventWaitResult(handler, event) + 1; });
    bool returned = WaitUntil([&] { return *result != 0; });
    returned ? waiter.join() : waiter.detach();
    ASSERT_TRUE(returned) << "a wait on a stopped loop hangs";
    EXPECT_EQ(*result, 1);
    EXPECT_EQ(runs, 1);
    EXPECT_EQ(capture.Count(ANDROID_LOG_ERROR, "AddEventWaitResult"), 1u) << capture.Dump();
}

TEST_F(EventLoopTest, BacklogAndItsHighWaterMarkAndSlowEntriesAreReported) {
    LogCapture capture;
    auto stats = std::make_shared<DaemonStats>();
    sp<EventLoop> loop = new EventLoop("stats_loop", stats);
    loop->StartLoop();
    Gate gate;
    loop->AddTask([&gate] { gate.Wait(); });
    ASSERT_TRUE(WaitUntil([&] { return loop->GetBacklog() == 0; }));  // taken: it holds the loop
    for (int i = 0; i < 5; i++) {
        loop->AddTask([] {});
    }
    loop->AddTask([] {}, 60);
    EXPECT_EQ(loop->GetBacklog(), 6u);
    gate.Open();
    ASSERT_TRUE(WaitUntil([&] { return loop->GetBacklog() == 1; }));  // the one due in a minute
    EXPECT_EQ(stats->Value("loop.stats_loop.backlog_high"), 6u);
    // Only what runs 301 ms or more counts as slow, with the loop's line for it.
    loop->AddTask([] { std::this_thread::sleep_for(milliseconds(320)); });
    loop->AddTask([] { std::this_thread::sleep_for(milliseconds(5)); });
    std::atomic<bool> done{false};
    loop->AddTask([&done] { done = true; });
    ASSERT_TRUE(WaitUntil([&] { return done.load(); }));
    EXPECT_EQ(stats->Value("loop.stats_loop.slow"), 1u);
    EXPECT_EQ(capture.Count(ANDROID_LOG_DEBUG, "ProcessEventLoop onevent name stats_loop  consume time 3"), 1u)
            << capture.Dump();
    loop->StopLoop();
}

TEST_F(EventLoopTest, EntryQueuedAsTheLoopFallsAsleepStillRuns) {
    // Ping-pong: each entry is queued the moment the one before has run, that is while the loop
    // decides whether to sleep; a wake lost there would leave the loop asleep for good.
    for (int round = 0; round < 20000; round++) {
        auto ran = std::make_shared<std::promise<void>>();
        std::future<void> done = ran->get_future();
        loop_->AddTask([ran] { ran->set_value(); });
        ASSERT_EQ(done.wait_for(std::chrono::seconds(60)), std::future_status::ready) << "round " << round;
    }
}

// A loop with a backlog may hold back the wake of a loop it hands entries to, but only for about
// a millisecond, not until its backlog is gone, nor for the rest of an entry that keeps handing
// over; and an entry that never ends (an event source's read loop) has no backlog behind it, so
// what it hands over is never held back.
TEST_F(EventLoopTest, HandOverFromABusyLoopWaitsBoundedlyAndFromAnEndlessEntryNotAtAll) {
    sp<EventLoop> receiver = new EventLoop("receiver_loop");
    receiver->StartLoop();
    constexpr int kBacklog = 2000;
    std::atomic<int> producerRan{0};
    std::atomic<int> receivedAfter{-1};
    Gate gate;  // holds the producer until its whole backlog is queued
    loop_->AddTask([&gate] { gate.Wait(); });
    loop_->AddTask([&] { receiver->AddTask([&] { receivedAfter = producerRan.load(); }); });
    for (int i = 0; i < kBacklog; i++) {
        loop_->AddTask([&producerRan] {
            usleep(1000);  // an entry's work
            producerRan++;
        });
    }
    gate.Open();
    ASSERT_TRUE(WaitUntil([&] { return receivedAfter >= 0; }, std::chrono::seconds(60)));
    EXPECT_LT(receivedAfter, kBacklog / 2);
    ASSERT_TRUE(WaitUntil([&] { return producerRan == kBacklog; }, std::chrono::seconds(60)));

    auto answered = std::make_shared<std::promise<void>>();
    std::future<void> answer = answered->get_future();
    std::promise<bool> heard;
    loop_->AddTask([&] {
        receiver->AddTask([answered] { answered->set_value(); });
        heard.set_value(answer.wait_for(std::chrono::seconds(10)) == std::future_status::ready);
    });
    EXPECT_TRUE(heard.get_future().get());

    // An entry that goes on handing over while its loop has a backlog holds no wake past the
    // bound either: its next hand-over releases the earlier ones.
    auto reached = std::make_shared<std::atomic<bool>>(false);
    std::promise<bool> released;
    Gate held;
    loop_->AddTask([&held] { held.Wait(); });
    loop_->AddTask([&] {
        receiver->AddTask([reached] { *reached = true; });
        auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(10);
        while (!*reached && std::chrono::steady_clock::now() < deadline) {
            usleep(2000);              // the entry's work
            receiver->AddTask([] {});  // and its next hand-over
        }
        released.set_value(reached->load());
    });
    loop_->AddTask([] {});  // the backlog behind that entry
    held.Open();
    EXPECT_TRUE(released.get_future().get());
    receiver->StopLoop();
}

TEST_F(EventLoopTest, NewEntryWakesSleepingLoopAndStopLeavesEntriesUnrunTillDestructionReleasesThem) {
    std::string stat = "/proc/self/task/" + std::to_string(Drain()) + "/stat";
    std::atomic<int> ran{0};
    sp<EventHandler> handler = new CallbackHandler([&ran](sp<Event>&) { return ran += 100; });
    wp<Event> queued = Queue(handler, 30);
    // Wait for the loop to fall asleep with a 30 s time-out (state "S" after the name).
    ASSERT_TRUE(WaitUntil([&] {
        std::string line;
        std::getline(std::ifstream(stat), line);
        return line.find(") S ") != std::string::npos;
    }));
    loop_->AddTask([&ran] { ran++; });
    EXPECT_TRUE(WaitUntil([&ran] { return ran == 1; }, std::chrono::seconds(5)));
    loop_->StopLoop();
    // The thread is gone, so nothing queued from now on can run.
    EXPECT_TRUE(WaitUntil([&] { return !std::ifstream(stat).good(); }));
    wp<Event> late = Queue(handler);
    loop_->AddTask([&ran] { ran++; });
    EXPECT_TRUE(queued.promote() != nullptr && late.promote() != nullptr);
    loop_ = nullptr;
    EXPECT_TRUE(queued.promote() == nullptr && late.promote() == nullptr);
    EXPECT_TRUE(ran == 1 && handler->getStrongCount() == 1) << ran << " runs, " << handler->getStrongCount() << " refs";
}

TEST_F(EventLoopTest, LoopReleasedByItsOwnEntryShutsDownCleanly) {
    wp<Event> queued = Queue(new EventHandler(), 30);
    Gate gate;
    loop_->AddTask([&gate] { gate.Wait(); });  // due first, so it holds the loop from the start
    std::atomic<bool> released{false};
    loop_->AddTask([self = loop_, &released]() mutable {
        self = nullptr;
        released = true;  // orders the gate's end after its last use, where TSan can see it
    });
    loop_ = nullptr;  // the task now holds the only reference
    gate.Open();
    EXPECT_TRUE(WaitUntil([&] { return released && queued.promote() == nullptr; }));
}

}  // namespace android::Orvane
