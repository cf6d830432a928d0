// Start-up of the plugin platform and the flow of events through a pipeline.
#include <stdlib.h>

#include <atomic>
#include <chrono>
#include <fstream>
#include <memory>
#include <string>
#include <vector>

#include <benchmark/benchmark.h>
#include <utils/Condition.h>
#include <utils/Mutex.h>

#include "platform/pipeline.h"
#include "platform/plugin_factory.h"
#include "platform/plugin_platform.h"

namespace android {
namespace Orvane {
namespace {

// Counts the events that reached the end of the pipeline and wakes whoever waits for a number.
class Finish {
public:
    void Arrive() {
        Mutex::Autolock lock(mutex_);
        if (++count_ >= target_) {
            done_.signal();
        }
    }
    void Expect(uint64_t more) {
        Mutex::Autolock lock(mutex_);
        target_ = count_ + more;
    }
    void Wait() {
        Mutex::Autolock lock(mutex_);
        while (count_ < target_) {
            done_.wait(mutex_);
        }
    }

private:
    Mutex mutex_;
    Condition done_;
    uint64_t count_ GUARDED_BY(mutex_) = 0;
    uint64_t target_ GUARDED_BY(mutex_) = 0;
};

class BenchStep : public Plugin {
public:
    void OnLoad() override { SetVersion(GetName() + "-1.0"); }
    EVENT_RET OnEvent(sp<Event>& event) override {
        event->SetValue("step", GetName());
        if (finish_ != nullptr) {
            finish_->Arrive();
        }
        return 0;
    }
    void SetFinish(Finish* finish) { finish_ = finish; }

private:
    Finish* finish_ = nullptr;
};

PluginFactory::Register<BenchStep> g_bench0("BenchStep0");
PluginFactory::Register<BenchStep> g_bench1("BenchStep1");
PluginFactory::Register<BenchStep> g_bench2("BenchStep2");
PluginFactory::Register<BenchStep> g_bench3("BenchStep3");
PluginFactory::Register<BenchStep> g_bench4("BenchStep4");
PluginFactory::Register<BenchStep> g_bench5("BenchStep5");
PluginFactory::Register<BenchStep> g_bench6("BenchStep6");
PluginFactory::Register<BenchStep> g_bench7("BenchStep7");

// From a fresh platform to IsReady(): 8 plugins on 4 loops, two pipelines.
void BM_StartupToReady(benchmark::State& state) {
    char pattern[] = "/tmp/platform_bench_XXXXXX";
    std::string root = mkdtemp(pattern);
    std::string configDir = root + "/etc";
    std::string workDir = root + "/work";
    std::string cloudDir = root + "/cloud";
    system(("mkdir -p " + configDir).c_str());
    std::ofstream(configDir + "/plugin_config") << "plugins:8\n"
                                                   "BenchStep0[thread:bench_a]:0 static\n"
                                                   "BenchStep1[thread:bench_a]:0 static\n"
                                                   "BenchStep2[thread:bench_b]:0 static\n"
                                                   "BenchStep3[thread:bench_b]:0 static\n"
                                                   "BenchStep4[thread:bench_c]:0 static\n"
                                                   "BenchStep5[thread:bench_c]:0 static\n"
                                                   "BenchStep6[thread:bench_d]:0 static\n"
                                                   "BenchStep7[thread:bench_d]:0 static\n"
                                                   "pipelines:2\n"
                                                   "first: BenchStep0 BenchStep2 BenchStep4\n"
                                                   "second: BenchStep1 BenchStep3 BenchStep5 BenchStep7\n";
    std::vector<std::string> args = {"orvane",       "-configDir", configDir, "-workDir", workDir,
                                     "-cloudCfgDir", cloudDir,     "-region", "CN"};
    std::vector<char*> argv;
    for (auto& arg : args) {
        argv.push_back(&arg[0]);
    }
    for (auto _ : state) {
        auto start = std::chrono::steady_clock::now();
        auto platform = std::make_unique<PluginPlatform>();
        platform->ParseArgs(static_cast<int>(argv.size()), argv.data());
        bool started = platform->StartPlatform();
        auto end = std::chrono::steady_clock::now();
        if (!started || !platform->IsReady() || platform->GetPlugins().size() != 8) {
            state.SkipWithError("platform did not start with its 8 plugins");
            break;
        }
        state.SetIterationTime(std::chrono::duration<double>(end - start).count());
        platform.reset();  // stops the loops, outside the measured time
    }
    system(("rm -rf " + root).c_str());
}
BENCHMARK(BM_StartupToReady)->UseManualTime()->Unit(benchmark::kMillisecond)->Iterations(50);

// Events through a 3-plugin pipeline, from the first step to the end of the last, with the
// plugins on `range(0)` distinct loops.
void BM_PipelineThroughput(benchmark::State& state) {
    const int loopCount = static_cast<int>(state.range(0));
    constexpr int kBatch = 1000;
    std::vector<sp<EventLoop>> loops;
    for (int i = 0; i < loopCount; i++) {
        loops.push_back(new EventLoop("bench_loop" + std::to_string(i)));
        loops.back()->StartLoop();
    }
    Finish finish;
    std::vector<sp<Plugin>> plugins;
    for (int i = 0; i < 3; i++) {
        sp<BenchStep> step = new BenchStep();
        step->SetName("BenchStep" + std::to_string(i));
        step->SetLooper(loops[i % loopCount]);
        if (i == 2) {
            step->SetFinish(&finish);
        }
        plugins.push_back(step);
    }
    sp<Pipeline> pipeline = new Pipeline("bench", plugins);
    std::vector<sp<Event>> batch(kBatch);
    for (auto _ : state) {
        // The events are made by their source before they enter the pipeline: not timed.
        for (int i = 0; i < kBatch; i++) {
            batch[i] = new Event("bench");
            batch[i]->eventId = 901000000 + i;
        }
        finish.Expect(kBatch);
        auto start = std::chrono::steady_clock::now();
        for (auto& event : batch) {
            pipeline->ProcessPipeline(std::move(event), 0);
        }
        finish.Wait();
        state.SetIterationTime(std::chrono::duration<double>(std::chrono::steady_clock::now() - start).count());
    }
    state.SetItemsProcessed(state.iterations() * kBatch);
    state.SetLabel(std::to_string(loopCount) + " loop(s)");
    plugins.clear();
    pipeline = nullptr;
    for (auto& loop : loops) {
        loop->StopLoop();
    }
}
BENCHMARK(BM_PipelineThroughput)->Arg(3)->Arg(1)->Unit(benchmark::kMillisecond)->UseManualTime();

}  // namespace
}  // namespace Orvane
}  // namespace android

BENCHMARK_MAIN();
