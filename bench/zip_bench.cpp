#include <spawn.h>
#include <sys/resource.h>
#include <sys/wait.h>
#include <unistd.h>

#include <atomic>
#include <cstdio>
#include <random>
#include <string>
#include <thread>
#include <vector>

#include <benchmark/benchmark.h>

#include "config/event_quota_xml_parser.h"
#include "platform/plugin_factory.h"
#include "plugins/event_log_processor.h"
#include "storage/event_database.h"
#include "storage/event_database_helper.h"
#include "tests/common/fake_plugin_context.h"
#include "utils/file_util.h"
#include "utils/sys_env.h"
#include "utils/zip_pack.h"

extern char** environ;

namespace android {
namespace Orvane {
namespace {

// 20 log files of 1 MiB and 200 small files of 4 KiB, shaped like the logs a fault pack holds.
class LogFiles {
public:
    LogFiles() {
        char pattern[] = "/tmp/zip_bench.XXXXXX";
        dir_ = mkdtemp(pattern);
        FileUtil::CreateDirectory(dir_ + "/logs", 0775);
        std::mt19937 random(42);
        static const char* const kTags[] = {"ActivityManager", "WindowManager",  "binder",  "qxev",
                                            "SurfaceFlinger",  "PackageManager", "thermal", "audio_hw"};
        static const char* const kWords[] = {"start", "proc",  "for",     "activity", "timeout", "pid",  "uid",
                                             "frame", "state", "changed", "from",     "to",      "took", "ms"};
        auto next = [&](unsigned bound) { return static_cast<unsigned>(random() % bound); };
        auto makeText = [&](size_t bytes) {
            std::string text;
            while (text.size() < bytes) {
                char head[64];
                snprintf(head, sizeof(head), "11-23 %02u:%02u:%02u.%03u %5u %5u %c ", next(24), next(60), next(60),
                         next(1000), 1000 + next(9000), 1000 + next(9000), "VDIWE"[next(5)]);
                text += head;
                text += kTags[next(8)];
                text += ":";
                for (unsigned w = 0, words = 4 + next(10); w < words; ++w) {
                    text += " ";
                    text += next(4) == 0 ? std::to_string(next(100000)) : kWords[next(14)];
                }
                text += "\n";
            }
            text.resize(bytes);
            return text;
        };
        for (int i = 0; i < 20; ++i) {
            Add("logs/main_" + std::to_string(i) + ".log", makeText(1 << 20));
        }
        for (int i = 0; i < 200; ++i) {
            Add("logs/small_" + std::to_string(i) + ".txt", makeText(4096));
        }
    }
    ~LogFiles() {
        uint64_t freed = 0;
        FileUtil::DeleteDirectoryOrFile(dir_, freed, true);
    }

    const std::vector<std::string>& Paths() const { return paths_; }
    int64_t Bytes() const { return bytes_; }
    std::string Output(const char* name) const { return dir_ + "/" + name; }
    const std::string& Dir() const { return dir_; }

private:
    void Add(const std::string& name, const std::string& content) {
        paths_.push_back(dir_ + "/" + name);
        FileUtil::SaveStringToFile(paths_.back(), content, true);
        bytes_ += static_cast<int64_t>(content.size());
    }

    std::string dir_;
    std::vector<std::string> paths_;
    int64_t bytes_ = 0;
};

const LogFiles& GetLogFiles() {
    static LogFiles files;
    return files;
}

void BM_ZipPack(benchmark::State& state) {
    const LogFiles& files = GetLogFiles();
    const std::string output = files.Output("pack.zip");
    for (auto _ : state) {
        ZipPack pack;
        if (!pack.CreateZip(output) || !pack.AddFiles(files.Paths())) {
            state.SkipWithError("packing failed");
            break;
        }
        pack.Close();
    }
    state.SetBytesProcessed(state.iterations() * files.Bytes());
    state.counters["zip_bytes"] = static_cast<double>(FileUtil::GetFileSize(output));
}
BENCHMARK(BM_ZipPack)->Unit(benchmark::kMillisecond)->Iterations(5)->UseRealTime();

// Info-ZIP's zip at the same compression level on the same files, run as a child process.
void BM_InfoZip(benchmark::State& state) {
    const LogFiles& files = GetLogFiles();
    const std::string output = files.Output("infozip.zip");
    std::vector<std::string> args = {"zip", "-q", "-6", output};
    args.insert(args.end(), files.Paths().begin(), files.Paths().end());
    std::vector<char*> argv;
    for (std::string& arg : args) {
        argv.push_back(arg.data());
    }
    argv.push_back(nullptr);
    double childCpuSeconds = 0;
    for (auto _ : state) {
        state.PauseTiming();
        unlink(output.c_str());  // zip would otherwise update the existing archive
        state.ResumeTiming();
        pid_t pid = 0;
        int status = 0;
        struct rusage usage = {};
        if (posix_spawnp(&pid, "zip", nullptr, nullptr, argv.data(), environ) != 0 ||
            wait4(pid, &status, 0, &usage) != pid || !WIFEXITED(status) || WEXITSTATUS(status) != 0) {
            state.SkipWithError("zip failed");
            break;
        }
        childCpuSeconds +=
                usage.ru_utime.tv_sec + usage.ru_stime.tv_sec + (usage.ru_utime.tv_usec + usage.ru_stime.tv_usec) / 1e6;
    }
    state.SetBytesProcessed(state.iterations() * files.Bytes());
    // The benchmark's own CPU time leaves out the child; this is the child's, per iteration.
    state.counters["child_cpu_ms"] = childCpuSeconds * 1000 / static_cast<double>(state.iterations());
    state.counters["zip_bytes"] = static_cast<double>(FileUtil::GetFileSize(output));
}
BENCHMARK(BM_InfoZip)->Unit(benchmark::kMillisecond)->Iterations(5)->UseRealTime();

// The log processor with rules that take all the files above, a policy that allows them and a
// quota whose log space holds them: a whole collection as a fault event gets it.
class Collector {
public:
    static constexpr uint32_t kEventId = 901000001;

    explicit Collector(const LogFiles& files) : etc_(files.Dir() + "/etc/"), work_(files.Dir() + "/work/") {
        FileUtil::CreateDirectory(etc_, 0775);
        FileUtil::CreateDirectory(work_, 0775);
        std::string logs = files.Dir() + "/logs/";
        FileUtil::SaveStringToFile(etc_ + "event_upload.xml",
                                   "<EventUpload><LogRule eventId=\"" + std::to_string(kEventId) +
                                           "\"><Dynamic dir=\"" + logs +
                                           "\" pattern=\"main_\\d+\\.log\" count=\"20\"/><Dynamic dir=\"" + logs +
                                           "\" pattern=\"small_\\d+\\.txt\" count=\"200\"/></LogRule></EventUpload>",
                                   true);
        FileUtil::SaveStringToFile(etc_ + "privacy_policy.xml",
                                   "<PrivacyPolicy><Levels switchOn=\"1\" switchOff=\"1\"/><LogPaths><Allow prefix=\"" +
                                           files.Dir() + "/\"/></LogPaths></PrivacyPolicy>",
                                   true);
        // Both sections: the processor's version is the device's ("unknown"), storage's "bench".
        std::string section =
                "<Summary defDailyCnt=\"2000000000\"/><Domain name=\"k\" eventMin=\"901000000\" "
                "eventMax=\"901999999\" dailyCnt=\"2000000000\" maxLogCnt=\"8\" logSpace=\"40000\"/>";
        FileUtil::SaveStringToFile(
                etc_ + "event_quota.xml",
                "<EventQuota><unknown>" + section + "</unknown><bench>" + section + "</bench></EventQuota>", true);
        SysEnv::SetSysProperity("persist.sys.orvane.upload_switch", "1");  // packs go to <domain>/
        processor_ = static_cast<EventLogProcessor*>(PluginFactory::CreatePlugin("EventLogProcessor").get());
        processor_->SetPluginContext(&context_);
        processor_->OnLoad();
    }

    // A fault event as storage hands it on; OnEvent names its pack and queues its collection.
    sp<Event> Fault() {
        sp<Event> event = new Event("bench");
        event->eventType = 2;
        event->eventId = kEventId;
        event->happenTime = time(nullptr);
        return event;
    }
    uint64_t Made() { return context_.GetStats().Value("logproc.pack.made"); }
    std::string Etc() const { return etc_; }

    std::string etc_, work_;
    FakePluginContext context_{work_, etc_};
    sp<EventLogProcessor> processor_;
};

// A whole collection on the calling thread: rules, listings, privacy checks, packing under the
// space cap, the temporary name and the rename; compare with BM_InfoZip of the same run.
void BM_CollectAndPack(benchmark::State& state) {
    const LogFiles& files = GetLogFiles();
    Collector collector(files);
    for (auto _ : state) {
        sp<Event> event = collector.Fault();
        event->SetValue("EVENT_LOG_ZIP_NAME", "EventId_bench_sn_20260101000000_901000001.zip");
        collector.processor_->ProcessEventLog(event);
        state.PauseTiming();
        std::string pack = collector.work_ + "901/EventId_bench_sn_20260101000000_901000001.zip";
        state.counters["zip_bytes"] = static_cast<double>(FileUtil::GetFileSize(pack));
        FileUtil::DeleteFile(pack);
        state.ResumeTiming();
    }
    if (collector.Made() != static_cast<uint64_t>(state.iterations())) {
        state.SkipWithError("a collection made no pack");
    }
    state.SetBytesProcessed(state.iterations() * files.Bytes());
}
BENCHMARK(BM_CollectAndPack)->Unit(benchmark::kMillisecond)->Iterations(5)->UseRealTime();

// The pipeline's own work (storage's bookkeeping of fault events, on the calling thread) while
// state.range(0) collections of the files above are being packed at all times on the workers.
void BM_StoreWhilePacking(benchmark::State& state) {
    const LogFiles& files = GetLogFiles();
    Collector collector(files);
    sp<EventDatabaseHelper> helper = new EventDatabaseHelper();
    helper->Init(&collector.context_, "event.db", "bench");
    const uint64_t inFlight = static_cast<uint64_t>(state.range(0));
    std::atomic<bool> running{true};
    std::thread feeder([&] {
        uint64_t queued = 0;
        while (running.load()) {
            if (queued - collector.Made() < inFlight) {
                sp<Event> event = collector.Fault();
                collector.processor_->OnEvent(event);
                queued++;
            } else {
                usleep(1000);
            }
        }
    });
    while (inFlight > 0 && collector.Made() == 0) {
        usleep(1000);  // packing is under way before the measurement starts
    }
    uint64_t madeBefore = collector.Made();
    int64_t n = 0;
    uint64_t day = helper->GetDbStartTime();
    for (auto _ : state) {
        sp<Event> event = new Event("bench");
        event->eventType = 2;
        event->eventId = Collector::kEventId;
        event->happenTime = day + 100;
        event->SetValue("param_list", "{\"n\":" + std::to_string(n++) + "}");
        helper->ProcessFaultEvent(event);
    }
    state.counters["packs_made"] = static_cast<double>(collector.Made() - madeBefore);
    running = false;
    feeder.join();
    EventDatabase::getInstance()->Close();
    state.SetItemsProcessed(state.iterations());
}
BENCHMARK(BM_StoreWhilePacking)->Arg(0)->Arg(4)->Unit(benchmark::kMicrosecond)->MinTime(5)->UseRealTime();

}  // namespace
}  // namespace Orvane
}  // namespace android

BENCHMARK_MAIN();
