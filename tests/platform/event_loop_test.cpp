#include "platform/event_loop.h"

#include <gtest/gtest.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <atomic>
#include <chrono>
#include <fstream>
#include <future>
#include <mutex>
#include <thread>
#include <vector>

#include "tests/common/log_capture.h"

namespace android {
namespace Orvane {
namespace {

using std::chrono::milliseconds;
using std::chrono::seconds;
using std::chrono::steady_clock;

pid_t CurrentTid() {
    return static_cast<pid_t>(syscall(SYS_gettid));
}

class CallbackHandler : public EventHandler {
public:
    explicit CallbackHandler(std::function<EVENT_RET(sp<Event>&)> callback) : callback(std::move(callback)) {}
    EVENT_RET OnEvent(sp<Event>& event) override { return callback(event); }

private:
    std::function<EVENT_RET(sp<Event>&)> callback;
};

// An event that reports its own destruction.
class TrackedEvent : public Event {
public:
    explicit TrackedEvent(std::atomic<bool>& destroyed) : Event("test"), destroyed(destroyed) {}
    ~TrackedEvent() override { destroyed = true; }

private:
    std::atomic<bool>& destroyed;
};

// Holds a started loop's thread inside a task until Open(), so that entries can be queued
// while it is busy.
class Gate {
public:
    explicit Gate(const sp<EventLoop>& loop) {
        std::shared_future<void> opened = gate.get_future().share();
        loop->AddTask([this, opened] {
            entered = true;
            opened.wait();
        });
        EXPECT_TRUE(WaitUntil([this] { return entered.load(); }));
    }
    void Open() { gate.set_value(); }

private:
    std::promise<void> gate;
    std::atomic<bool> entered{false};
};

class EventLoopTest : public ::testing::Test {
protected:
    void SetUp() override {
        loop = new EventLoop("test_loop");
        loop->StartLoop();
    }

    // The loop thread's id, learnt by running a task on it.
    pid_t LoopTid() {
        std::atomic<pid_t> tid{0};
        loop->AddTask([&tid] { tid = CurrentTid(); });
        EXPECT_TRUE(WaitUntil([&tid] { return tid.load() != 0; }));
        return tid;
    }

    // Runs an empty task and waits for it: every entry due before it has run by then.
    void Drain() {
        std::atomic<bool> done{false};
        loop->AddTask([&done] { done = true; });
        ASSERT_TRUE(WaitUntil([&done] { return done.load(); }));
    }

    sp<EventLoop> loop;
};

TEST_F(EventLoopTest, EntriesFromSeveralThreadsRunInDueOrder) {
    std::mutex ranMutex;
    std::vector<unsigned long> ranDelays;
    Gate gate(loop);
    // Queued in mixed order while the loop is busy: the due time alone decides.
    std::vector<std::thread> producers;
    for (int t = 0; t < 3; t++) {
        producers.emplace_back([&, t] {
            for (int i = 0; i < 6; i++) {
                unsigned long delay = static_cast<unsigned long>((i + t) % 3);
                loop->AddTask([&, delay] {
                    std::lock_guard<std::mutex> lock(ranMutex);
                    ranDelays.push_back(delay);
                }, delay);
            }
        });
    }
    for (auto& producer : producers) {
        producer.join();
    }
    gate.Open();
    ASSERT_TRUE(WaitUntil([&] {
        std::lock_guard<std::mutex> lock(ranMutex);
        return ranDelays.size() == 18;
    }));
    std::lock_guard<std::mutex> lock(ranMutex);
    EXPECT_TRUE(std::is_sorted(ranDelays.begin(), ranDelays.end()));
}

TEST_F(EventLoopTest, RepeatingTaskDriftsByItsRunTimeAndZeroIntervalRunsOnce) {
    std::mutex startsMutex;
    std::vector<steady_clock::time_point> starts;
    const milliseconds runTime(200);
    uint64_t id = loop->AddTask([&] {
        {
            std::lock_guard<std::mutex> lock(startsMutex);
            starts.push_back(steady_clock::now());
        }
        std::this_thread::sleep_for(runTime);  // the task's own run time
    }, 1, true);
    EXPECT_NE(id, UINT64_MAX);

    std::atomic<int> zeroRepeats{0};
    loop->AddTask([&zeroRepeats] { zeroRepeats++; }, 0, true);

    ASSERT_TRUE(WaitUntil([&] {
        std::lock_guard<std::mutex> lock(startsMutex);
        return starts.size() >= 3;
    }));
    Drain();
    EXPECT_EQ(zeroRepeats, 1);
    loop->StopLoop();
    std::lock_guard<std::mutex> lock(startsMutex);
    for (size_t i = 1; i < starts.size(); i++) {
        auto period = std::chrono::duration_cast<milliseconds>(starts[i] - starts[i - 1]);
        EXPECT_GE(period.count(), 1000 + runTime.count()) << "run " << i;
        EXPECT_LT(period.count(), 1000 + runTime.count() + 800) << "run " << i;
    }
}

TEST_F(EventLoopTest, NewEntryWakesLoopSleepingOnDistantEntry) {
    pid_t tid = LoopTid();
    std::atomic<bool> distantRan{false};
    loop->AddTask([&distantRan] { distantRan = true; }, 30);
    // Wait for the loop to fall asleep with a 30 s time-out.
    auto state = [tid] {
        std::ifstream stat("/proc/self/task/" + std::to_string(tid) + "/stat");
        std::string line;
        std::getline(stat, line);
        size_t close = line.rfind(')');
        return close == std::string::npos || close + 2 >= line.size() ? '?' : line[close + 2];
    };
    ASSERT_TRUE(WaitUntil([&] { return state() == 'S'; }));

    std::atomic<bool> ran{false};
    auto posted = steady_clock::now();
    loop->AddTask([&ran] { ran = true; });
    EXPECT_TRUE(WaitUntil([&ran] { return ran.load(); }, seconds(5)));
    EXPECT_LT(steady_clock::now() - posted, seconds(5));
    EXPECT_FALSE(distantRan);
    loop = nullptr;  // drops the distant entry unrun
}

TEST_F(EventLoopTest, EventsReachTheirHandlerOnTheLoopThread) {
    pid_t tid = LoopTid();
    std::atomic<pid_t> handledOn{0};
    std::atomic<uint32_t> handledId{0};
    sp<EventHandler> handler = new CallbackHandler([&](sp<Event>& event) {
        handledId = event->eventId;
        handledOn = CurrentTid();
        return -1;  // ignored for asynchronous entries
    });
    sp<Event> event = new Event("test");
    event->eventId = 902902;
    EXPECT_NE(loop->AddEvent(handler, event), UINT64_MAX);
    ASSERT_TRUE(WaitUntil([&] { return handledOn.load() != 0; }));
    EXPECT_EQ(handledOn, tid);
    EXPECT_EQ(handledId, 902902u);
    Drain();
}

TEST_F(EventLoopTest, WaitResultBlocksUntilRunAndReportsOnlyMinusOneAsFailure) {
    pid_t tid = LoopTid();
    std::atomic<EVENT_RET> next{0};
    std::atomic<int> runs{0};
    std::atomic<pid_t> ranOn{0};
    sp<EventHandler> handler = new CallbackHandler([&](sp<Event>&) {
        std::this_thread::sleep_for(milliseconds(50));  // the caller must wait this out
        ranOn = CurrentTid();
        runs++;
        return next.load();
    });
    sp<Event> event = new Event("test");
    for (EVENT_RET ret : {0, -1, 1, 7, -2}) {
        next = ret;
        int before = runs;
        bool result = loop->AddEventWaitResult(handler, event);
        EXPECT_EQ(runs, before + 1) << "returned before the handler ran, result " << ret;
        EXPECT_EQ(result, ret != -1) << "result " << ret;
    }
    EXPECT_EQ(ranOn, tid);
}

TEST_F(EventLoopTest, EmptyHandlerEventOrTaskIsRefusedWithAnErrorOrDroppedWithAWarning) {
    LogCapture log;
    sp<EventHandler> handler = new EventHandler();
    sp<Event> event = new Event("test");
    EXPECT_EQ(loop->AddEvent(nullptr, event), UINT64_MAX);
    EXPECT_EQ(loop->AddEvent(handler, nullptr, 1, true), UINT64_MAX);
    EXPECT_FALSE(loop->AddEventWaitResult(nullptr, event));
    EXPECT_FALSE(loop->AddEventWaitResult(handler, nullptr));
    EXPECT_EQ(log.Count(ANDROID_LOG_ERROR, "AddEvent handler or event is nullptr"), 2u) << log.Dump();
    EXPECT_EQ(log.Count(ANDROID_LOG_ERROR, "AddEventWaitResult handler or event is nullptr"), 2u);
    EXPECT_EQ(event->getStrongCount(), 1);

    // An empty task is queued, found wanting when due, and the loop goes on.
    loop->AddTask(nullptr);
    Drain();
    EXPECT_TRUE(log.Contains(ANDROID_LOG_WARN, "ProcessEvent Loop event not execute, no task or handler test_loop"))
            << log.Dump();
}

TEST_F(EventLoopTest, StopLeavesEntriesUnrunAndDestructionReleasesThem) {
    LogCapture log;
    pid_t tid = LoopTid();
    std::atomic<int> ran{0};
    std::atomic<bool> queuedDestroyed{false};
    std::atomic<bool> lateDestroyed{false};
    sp<EventHandler> handler = new CallbackHandler([&ran](sp<Event>&) {
        ran++;
        return 0;
    });
    sp<Event> queued = new TrackedEvent(queuedDestroyed);
    loop->AddEvent(handler, queued, 30);
    loop->StopLoop();
    // The thread ends, so nothing queued from now on can run.
    EXPECT_TRUE(WaitUntil([tid] { return !std::ifstream("/proc/self/task/" + std::to_string(tid) + "/stat").good(); }));

    sp<Event> late = new TrackedEvent(lateDestroyed);
    EXPECT_NE(loop->AddEvent(handler, late), UINT64_MAX);
    loop->AddTask([&ran] { ran++; });
    EXPECT_EQ(late->getStrongCount(), 2);  // ours and the queue's
    loop->StartLoop();
    EXPECT_TRUE(log.Contains(ANDROID_LOG_ERROR, "StartLoop name :test_loop thread already exist"));

    queued = nullptr;
    late = nullptr;
    EXPECT_FALSE(queuedDestroyed);
    EXPECT_FALSE(lateDestroyed);
    loop = nullptr;
    EXPECT_TRUE(queuedDestroyed);
    EXPECT_TRUE(lateDestroyed);
    EXPECT_EQ(ran, 0);
    EXPECT_EQ(handler->getStrongCount(), 1);
    EXPECT_TRUE(log.Contains(ANDROID_LOG_DEBUG, "~EventLoop name :test_loop exit"));
}

TEST_F(EventLoopTest, LoopReleasedByItsOwnEntryShutsDownCleanly) {
    std::atomic<bool> queuedDestroyed{false};
    sp<Event> queued = new TrackedEvent(queuedDestroyed);
    loop->AddEvent(new EventHandler(), queued, 30);
    queued = nullptr;
    Gate gate(loop);
    sp<EventLoop> self = loop;
    loop->AddTask([self]() mutable { self = nullptr; });
    self = nullptr;
    loop = nullptr;  // the task now holds the only reference
    gate.Open();
    EXPECT_TRUE(WaitUntil([&] { return queuedDestroyed.load(); }));
}

TEST_F(EventLoopTest, ConcurrentProducersRunEveryEntryExactlyOnceOneAtATime) {
    constexpr int kThreads = 4;
    constexpr int kPerThread = 5000;
    std::vector<std::atomic<int>> runs(kThreads * kPerThread);
    std::atomic<int> total{0};
    std::atomic<int> inside{0};
    std::atomic<bool> overlapped{false};
    auto enter = [&](int index) {
        if (inside.fetch_add(1) != 0) {
            overlapped = true;
        }
        runs[index]++;
        inside--;
        total++;
    };
    sp<EventHandler> handler = new CallbackHandler([&](sp<Event>& event) {
        enter(event->GetIntValue("index"));
        return 0;
    });
    std::vector<std::thread> producers;
    for (int t = 0; t < kThreads; t++) {
        producers.emplace_back([&, t] {
            for (int i = 0; i < kPerThread; i++) {
                int index = t * kPerThread + i;
                if (i % 2 == 0) {
                    loop->AddTask([&enter, index] { enter(index); });
                } else {
                    sp<Event> event = new Event("producer");
                    event->SetValue("index", index);
                    // The loop holds the only reference, so the event also dies there.
                    loop->AddEvent(handler, std::move(event));
                }
            }
        });
    }
    for (auto& producer : producers) {
        producer.join();
    }
    ASSERT_TRUE(WaitUntil([&] { return total.load() == kThreads * kPerThread; }, seconds(60)));
    Drain();
    EXPECT_EQ(total, kThreads * kPerThread);
    EXPECT_FALSE(overlapped);
    for (size_t i = 0; i < runs.size(); i++) {
        ASSERT_EQ(runs[i], 1) << "entry " << i;
    }
}

TEST(EventLoopLogTest, StartAndSlowEntriesAreLogged) {
    LogCapture log;
    sp<EventLoop> loop = new EventLoop("slow_loop");
    EXPECT_EQ(loop->GetName(), "slow_loop");
    loop->StartLoop();
    EXPECT_TRUE(log.Contains(ANDROID_LOG_INFO, "StartLoop slow_loop, run ret=0")) << log.Dump();

    std::atomic<bool> fastDone{false};
    loop->AddTask([] { std::this_thread::sleep_for(milliseconds(320)); });
    loop->AddTask([&fastDone] { fastDone = true; });
    ASSERT_TRUE(WaitUntil([&fastDone] { return fastDone.load(); }));
    EXPECT_EQ(log.Count(ANDROID_LOG_DEBUG, "ProcessEventLoop onevent name slow_loop  consume time 3"), 1u)
            << log.Dump();
}

}  // namespace
}  // namespace Orvane
}  // namespace android
