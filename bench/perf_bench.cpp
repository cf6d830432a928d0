// Performance monitor costs: one report over 500 processes (the pressure file, the /proc
// samples, the ranking and the event), the wake-ups and CPU of the plugin while triggers are
// armed and nothing happens, and its share of one CPU while pressure lasts.
#include <dirent.h>
#include <signal.h>
#include <sys/resource.h>
#include <sys/syscall.h>
#include <sys/wait.h>
#include <unistd.h>

#include <atomic>
#include <chrono>
#include <fstream>
#include <string>
#include <thread>
#include <vector>

#include <android-base/file.h>
#include <benchmark/benchmark.h>

#include "plugins/perf_log_analyzer.h"
#include "tests/common/fake_plugin_context.h"

namespace android {
namespace Orvane {
namespace {

constexpr int kProcesses = 500;

// Children that sleep until the benchmark ends, so that /proc lists at least `count` processes.
class SleepingChildren {
public:
    explicit SleepingChildren(int count) {
        for (int i = 0; i < count; ++i) {
            pid_t pid = fork();
            if (pid == 0) {
                pause();
                _exit(0);
            }
            children_.push_back(pid);
        }
    }
    ~SleepingChildren() {
        for (pid_t pid : children_) {
            kill(pid, SIGKILL);
            waitpid(pid, nullptr, 0);
        }
    }

private:
    std::vector<pid_t> children_;
};

size_t ProcessCount() {
    size_t count = 0;
    DIR* proc = opendir("/proc");
    while (struct dirent* entry = readdir(proc)) {
        count += entry->d_name[0] >= '1' && entry->d_name[0] <= '9';
    }
    closedir(proc);
    return count;
}

// The tid of this process's thread of that name; 0 when there is none.
pid_t ThreadByName(const std::string& name) {
    DIR* tasks = opendir("/proc/self/task");
    pid_t tid = 0;
    while (struct dirent* task = readdir(tasks)) {
        std::string comm;
        if (android::base::ReadFileToString(std::string("/proc/self/task/") + task->d_name + "/comm", &comm) &&
            comm == name + "\n") {
            tid = atoi(task->d_name);
        }
    }
    closedir(tasks);
    return tid;
}

// Voluntary and involuntary context switches of one thread so far.
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

// CPU time of one thread so far, in clock ticks.
uint64_t ThreadTicks(pid_t tid) {
    std::string row;
    uint64_t ticks = 0;
    std::string comm;
    android::base::ReadFileToString("/proc/self/task/" + std::to_string(tid) + "/stat", &row);
    PerfParser::ParseStat(row, ticks, comm);
    return ticks;
}

double ProcessCpuSeconds() {
    struct rusage usage;
    getrusage(RUSAGE_SELF, &usage);
    return usage.ru_utime.tv_sec + usage.ru_stime.tv_sec + (usage.ru_utime.tv_usec + usage.ru_stime.tv_usec) / 1e6;
}

double SomeAvg10(const char* resource) {
    std::string text;
    Pressure pressure;
    android::base::ReadFileToString(std::string("/proc/pressure/") + resource, &text);
    return PerfParser::ParsePressure(text, pressure) ? pressure.some.avg10 : -1;
}

// A plugin on its own loop with the given settings, as the platform loads it.
struct LoadedPlugin {
    explicit LoadedPlugin(const std::string& settings)
        : context(folder.path, std::string(folder.path) + "/"), plugin(new PerfLogAnalyzer()) {
        android::base::WriteStringToFile(settings, std::string(folder.path) + "/perf_config.xml");
        plugin->SetPluginContext(&context);
        sp<EventLoop> loop = new EventLoop("perf_loop");
        loop->StartLoop();
        std::atomic<pid_t> tid{0};
        loop->AddTask([&tid] { tid = static_cast<pid_t>(syscall(SYS_gettid)); });
        while (tid.load() == 0) {
            std::this_thread::yield();
        }
        loopTid = tid;
        plugin->SetLooper(loop);
        plugin->OnLoad();
        for (int i = 0; i < 5000 && (watcher = ThreadByName("perf_psi")) == 0; ++i) {
            std::this_thread::sleep_for(std::chrono::milliseconds(1));
        }
    }
    ~LoadedPlugin() { plugin->OnUnload(); }

    TemporaryDir folder;
    FakePluginContext context;
    sp<PerfLogAnalyzer> plugin;
    pid_t watcher = 0;
    pid_t loopTid = 0;
};

// One report as the plugin makes it when a trigger fires, with at least 500 processes listed:
// the pressure file, the samples (two for cpu and io, one for memory; the second second's wait
// is not counted), the ranking with names, and the event. Arg: 0 cpu, 1 memory, 2 io.
void BM_OneReport(benchmark::State& state) {
    SleepingChildren children(kProcesses);
    PerfResource resource = static_cast<PerfResource>(state.range(0));
    ProcessSampler sampler;
    size_t events = 0;
    for (auto _ : state) {
        PerfLogAnalyzer::Report report;
        report.resource = resource;
        report.trigger = "some 1000000 2000000";
        std::string text;
        android::base::ReadFileToString(std::string("/proc/pressure/") + ProcessSampler::ResourceName(resource), &text);
        PerfParser::ParsePressure(text, report.pressure);
        if (ProcessSampler::MeasuresGrowth(resource)) {
            report.before = sampler.Sample(resource);
        }
        std::vector<TopProcess> top = sampler.Top(resource, report.before, sampler.Sample(resource), 5);
        sp<Event> event = PerfLogAnalyzer::BuildEvent(report, top);
        events += event->GetValue("param_list").size() > 0;
    }
    state.counters["processes"] = static_cast<double>(ProcessCount());
    state.counters["events"] = static_cast<double>(events);
}
BENCHMARK(BM_OneReport)->Arg(0)->Arg(1)->Arg(2)->Unit(benchmark::kMillisecond)->UseRealTime();

// Triggers armed and nothing to report: context switches of the watcher thread and CPU of the
// whole process over 10 s. Arg 0: the shipped settings (cpu, memory, io); arg 1: memory only,
// the resource under no pressure on a development host. "fired" counts triggers that real
// pressure fired meanwhile; "cpu_some_avg10" is the CPU pressure at the end.
void BM_IdleWithTriggersArmed(benchmark::State& state) {
    std::string settings;
    if (state.range(0) == 0) {
        android::base::ReadFileToString(std::string(ORVANE_SOURCE_DIR) + "/etc/perf_config.xml", &settings);
    } else {
        settings = R"(<PerfConfig><Resource name="memory" someStallUs="300000" fullStallUs="100000"
                      windowUs="2000000"/></PerfConfig>)";
    }
    LoadedPlugin loaded(settings);
    if (loaded.watcher == 0) {
        state.SkipWithError("no trigger could be armed on this machine");
        return;
    }
    std::this_thread::sleep_for(std::chrono::milliseconds(100));
    long switches = 0;
    double cpu = 0;
    for (auto _ : state) {
        long before = ContextSwitches(loaded.watcher);
        double cpuBefore = ProcessCpuSeconds();
        std::this_thread::sleep_for(std::chrono::seconds(10));
        switches = ContextSwitches(loaded.watcher) - before;
        cpu = ProcessCpuSeconds() - cpuBefore;
    }
    DaemonStats& stats = loaded.context.GetStats();
    state.counters["watcher_ctxt_switches"] = static_cast<double>(switches);
    state.counters["process_cpu_ms"] = cpu * 1000;
    state.counters["fired"] = static_cast<double>(stats.Value("perf.fired.cpu") + stats.Value("perf.fired.memory") +
                                                  stats.Value("perf.fired.io"));
    state.counters["cpu_some_avg10"] = SomeAvg10("cpu");
}
BENCHMARK(BM_IdleWithTriggersArmed)->Arg(0)->Arg(1)->Iterations(1)->UseRealTime()->Unit(benchmark::kSecond);

// Lasting CPU pressure for 60 s (two spinning threads per CPU at the lowest priority, with at
// least 500 processes listed) against a trigger that fires every window: the plugin's threads'
// share of one CPU with a cool-down of Arg seconds, and the events it sent.
void BM_UnderLastingPressure(benchmark::State& state) {
    SleepingChildren children(kProcesses);
    LoadedPlugin loaded(R"(<PerfConfig><Resource name="cpu" someStallUs="100000" windowUs="2000000" coolDownSec=")" +
                        std::to_string(state.range(0)) + R"(" topCount="5"/></PerfConfig>)");
    if (loaded.watcher == 0) {
        state.SkipWithError("no trigger could be armed on this machine");
        return;
    }
    constexpr int kSeconds = 60;
    uint64_t ticks = 0;
    for (auto _ : state) {
        uint64_t before = ThreadTicks(loaded.watcher) + ThreadTicks(loaded.loopTid);
        std::atomic<bool> stop{false};
        std::vector<std::thread> spinners;
        for (unsigned i = 0; i < 2 * std::thread::hardware_concurrency(); ++i) {
            spinners.emplace_back([&stop] {
                setpriority(PRIO_PROCESS, static_cast<id_t>(syscall(SYS_gettid)), 19);
                while (!stop.load(std::memory_order_relaxed)) {
                }
            });
        }
        std::this_thread::sleep_for(std::chrono::seconds(kSeconds));
        stop = true;
        for (std::thread& spinner : spinners) {
            spinner.join();
        }
        ticks = ThreadTicks(loaded.watcher) + ThreadTicks(loaded.loopTid) - before;
    }
    double cpuSeconds = static_cast<double>(ticks) / static_cast<double>(sysconf(_SC_CLK_TCK));
    state.counters["plugin_cpu_percent"] = 100.0 * cpuSeconds / kSeconds;
    state.counters["fired"] = static_cast<double>(loaded.context.GetStats().Value("perf.fired.cpu"));
    state.counters["events"] = static_cast<double>(loaded.context.Inserted().size());
}
BENCHMARK(BM_UnderLastingPressure)->Arg(10)->Arg(600)->Iterations(1)->UseRealTime()->Unit(benchmark::kSecond);

}  // namespace
}  // namespace Orvane
}  // namespace android

BENCHMARK_MAIN();
