#include <spawn.h>
#include <sys/resource.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cstdio>
#include <random>
#include <string>
#include <vector>

#include <benchmark/benchmark.h>

#include "utils/file_util.h"
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

}  // namespace
}  // namespace Orvane
}  // namespace android

BENCHMARK_MAIN();
