// Event loop costs: throughput of delay-0 tasks posted from another thread, hand-overs between
// two loops under load, post-to-run latency of a sleeping loop, and proof that an idle loop
// stays asleep. The loops report to statistics, as the platform's do.
#include <sys/syscall.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <chrono>
#include <fstream>
#include <memory>
#include <string>
#include <thread>
#include <vector>

#include <benchmark/benchmark.h>

#include "platform/event_loop.h"
#include "utils/time_util.h"

namespace android {
namespace Orvane {
namespace {

pid_t LoopTid(const sp<EventLoop>& loop) {
    std::atomic<pid_t> tid{0};
    loop->AddTask([&tid] { tid = static_cast<pid_t>(syscall(SYS_gettid)); });
    while (tid.load() == 0) {
        std::this_thread::yield();
    }
    return tid;
}

// Voluntary and involuntary context switches of one thread of this process so far.
long ContextSwitches(pid_t tid) {
    std::ifstream status("/proc/self/task/" + std::to_string(tid) + "/status");
    long total = 0;
    std::string line;
    while (std::getline(status, line)) {
        if (line.find("ctxt_switches:") != std::string::npos) {
            total += std::stol(line.substr(line.find(':') + 1));
        }
    }
    return total;
}

// Batches of delay-0 tasks posted by the benchmark thread and run by the loop.
void BM_TaskThroughput(benchmark::State& state) {
    const int batch = static_cast<int>(state.range(0));
    sp<EventLoop> loop = new EventLoop("bench_loop", std::make_shared<DaemonStats>());
    loop->StartLoop();
    std::atomic<int> ran{0};
    for (auto _ : state) {
        ran = 0;
        for (int i = 0; i < batch; i++) {
            loop->AddTask([&ran] { ran.fetch_add(1, std::memory_order_relaxed); });
        }
        while (ran.load(std::memory_order_relaxed) != batch) {
            std::this_thread::yield();
        }
    }
    state.SetItemsProcessed(state.iterations() * batch);
}
BENCHMARK(BM_TaskThroughput)->Arg(10000)->UseRealTime();

// A pipeline under load: a loop with a backlog of entries, each doing a little work and handing
// one entry on to a second loop, as a storage step hands events to the next plugin. Reports the
// receiver's thread switches per hand-over beside the rate.
void BM_HandOverUnderLoad(benchmark::State& state) {
    const int batch = static_cast<int>(state.range(0));
    sp<EventLoop> producer = new EventLoop("bench_producer", std::make_shared<DaemonStats>());
    sp<EventLoop> receiver = new EventLoop("bench_receiver", std::make_shared<DaemonStats>());
    producer->StartLoop();
    receiver->StartLoop();
    pid_t receiverTid = LoopTid(receiver);
    long switchesBefore = ContextSwitches(receiverTid);
    std::atomic<int> received{0};
    std::atomic<bool> hold{true};
    for (auto _ : state) {
        received = 0;
        hold = true;
        producer->AddTask([&hold] {
            while (hold.load()) {
                std::this_thread::yield();
            }
        });
        for (int i = 0; i < batch; i++) {
            producer->AddTask([&receiver, &received] {
                uint64_t until = TimeUtil::GetNanoSecondSinceSystemStart() + 20000;  // 20 us of work
                while (static_cast<uint64_t>(TimeUtil::GetNanoSecondSinceSystemStart()) < until) {
                }
                receiver->AddTask([&received] { received.fetch_add(1, std::memory_order_relaxed); });
            });
        }
        hold = false;
        while (received.load(std::memory_order_relaxed) != batch) {
            std::this_thread::yield();
        }
    }
    state.SetItemsProcessed(state.iterations() * batch);
    state.counters["receiver_switches_per_handover"] =
            static_cast<double>(ContextSwitches(receiverTid) - switchesBefore) / (state.iterations() * batch);
    producer->StopLoop();
    receiver->StopLoop();
}
BENCHMARK(BM_HandOverUnderLoad)->Arg(2000)->UseRealTime();

// One task at a time into a sleeping loop: the time from AddTask to the task's start.
void BM_PostToRunLatency(benchmark::State& state) {
    sp<EventLoop> loop = new EventLoop("bench_loop", std::make_shared<DaemonStats>());
    loop->StartLoop();
    std::vector<int64_t> latenciesNs;
    latenciesNs.reserve(100000);
    for (auto _ : state) {
        std::atomic<bool> ran{false};
        int64_t postedNs = TimeUtil::GetNanoSecondSinceSystemStart();
        loop->AddTask([&] {
            latenciesNs.push_back(TimeUtil::GetNanoSecondSinceSystemStart() - postedNs);
            ran.store(true, std::memory_order_release);
        });
        while (!ran.load(std::memory_order_acquire)) {
            std::this_thread::yield();
        }
        state.PauseTiming();
        // Let the loop fall asleep again so that every sample includes a wake-up.
        std::this_thread::sleep_for(std::chrono::microseconds(200));
        state.ResumeTiming();
    }
    std::sort(latenciesNs.begin(), latenciesNs.end());
    state.counters["median_us"] = latenciesNs[latenciesNs.size() / 2] / 1000.0;
    state.counters["p99_us"] = latenciesNs[latenciesNs.size() * 99 / 100] / 1000.0;
}
BENCHMARK(BM_PostToRunLatency)->Iterations(5000)->UseRealTime();

// Context switches of the loop thread over 10 idle seconds, with an empty queue (0) and with
// one entry due in an hour (1).
void BM_IdleLoopWakeups(benchmark::State& state) {
    sp<EventLoop> loop = new EventLoop("bench_idle", std::make_shared<DaemonStats>());
    loop->StartLoop();
    pid_t tid = LoopTid(loop);
    if (state.range(0) == 1) {
        loop->AddTask([] {}, 3600);
    }
    std::this_thread::sleep_for(std::chrono::milliseconds(100));  // let it settle into its sleep
    long switches = 0;
    for (auto _ : state) {
        long before = ContextSwitches(tid);
        std::this_thread::sleep_for(std::chrono::seconds(10));
        switches = ContextSwitches(tid) - before;
    }
    state.counters["ctxt_switches"] = static_cast<double>(switches);
}
BENCHMARK(BM_IdleLoopWakeups)->Arg(0)->Arg(1)->Iterations(1)->UseRealTime()->Unit(benchmark::kSecond);

}  // namespace
}  // namespace Orvane
}  // namespace android

BENCHMARK_MAIN();
