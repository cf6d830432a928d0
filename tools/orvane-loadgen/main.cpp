// orvane-loadgen: drives a running daemon through its kernel event device and measures what
// it sustains end to end, from the write on the node to the commit in its event database, what
// that costs in disk writes and memory, and how much memory it takes under a flood.
// Progress is read from the daemon's own statistics (the "stats" dump over its service socket):
// the events its storage has handled (stored or dropped) and the events whose commit returned.
#include <errno.h>
#include <fcntl.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/mman.h>
#include <time.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <chrono>
#include <cinttypes>
#include <map>
#include <string>
#include <thread>
#include <vector>

#include <android-base/file.h>
#include <android-base/unique_fd.h>

#include "host/service/host_binder_server.h"

namespace {

using android::String16;
using android::base::unique_fd;
using android::Orvane::IBinder;
using android::Orvane::Parcel;
using Clock = std::chrono::steady_clock;

double Seconds(Clock::duration span) {
    return std::chrono::duration<double>(span).count();
}

// The daemon's counters, read through its dump transaction.
class DaemonCounters {
public:
    explicit DaemonCounters(const std::string& workDir) : socket_(workDir + "/orvane.sock") {}

    // Reads them again; false when the daemon did not answer.
    bool Read() {
        unique_fd out(memfd_create("orvane-stats", MFD_CLOEXEC));
        android::Orvane::HostBinderClient client;
        if (!out.ok() || !client.Connect(socket_)) {
            return false;
        }
        Parcel data;
        Parcel reply;
        data.writeFileDescriptor(out.get());
        data.writeInt32(1);
        data.writeString16(String16("stats"));
        if (client.Transact(IBinder::DUMP_TRANSACTION, data, &reply) != android::OK) {
            return false;
        }
        std::string text;
        lseek(out.get(), 0, SEEK_SET);
        android::base::ReadFdToString(out.get(), &text);
        values_.clear();
        char name[128];
        unsigned long long value = 0;
        for (const char* line = text.c_str(); *line != '\0';) {
            if (sscanf(line, "%127s %llu", name, &value) == 2) {
                values_[name] = value;
            }
            const char* next = strchr(line, '\n');
            line = next == nullptr ? line + strlen(line) : next + 1;
        }
        return true;
    }
    uint64_t Get(const std::string& name) const {
        auto it = values_.find(name);
        return it == values_.end() ? 0 : it->second;
    }
    bool Has(const std::string& name) const { return values_.count(name) != 0; }
    // Fault events the storage has decided on: stored, failed or dropped.
    uint64_t Handled() const {
        return Get("storage.events.stored") + Get("storage.events.store_failed") +
               Get("storage.events.dropped.over_daily_quota") + Get("storage.events.dropped.punished");
    }
    // Events whose commit has returned. A daemon that commits each statement on its own has no
    // such counter: what it stored is committed.
    uint64_t Committed() const { return Has("storage.events.committed") ? Get("storage.events.committed") : Handled(); }
    uint64_t Commits() const { return Get("storage.db.commits"); }

private:
    std::string socket_;
    std::map<std::string, uint64_t> values_;
};

struct ProcessUsage {
    double cpuSeconds = 0;
    long peakRssKb = 0;       // VmHWM
    long rssKb = 0;           // VmRSS
    long pssKb = 0;           // smaps_rollup Pss
    long privateDirtyKb = 0;  // smaps_rollup Private_Dirty
    uint64_t writeBytes = 0;  // io write_bytes: what reached the storage layer
    uint64_t writeCalls = 0;  // io syscw
};

// Scans `path` for "key value" lines with the given formats.
void ScanLines(const std::string& path, const std::vector<std::pair<const char*, void*>>& formats) {
    FILE* file = fopen(path.c_str(), "r");
    if (file == nullptr) {
        return;
    }
    char line[256];
    while (fgets(line, sizeof(line), file) != nullptr) {
        for (const auto& [format, out] : formats) {
            sscanf(line, format, out);
        }
    }
    fclose(file);
}

ProcessUsage ReadUsage(pid_t pid) {
    ProcessUsage usage;
    std::string proc = "/proc/" + std::to_string(pid);
    if (FILE* stat = fopen((proc + "/stat").c_str(), "r")) {
        unsigned long user = 0;
        unsigned long system = 0;
        if (fscanf(stat, "%*d (%*[^)]) %*c %*d %*d %*d %*d %*d %*u %*u %*u %*u %*u %lu %lu", &user, &system) == 2) {
            usage.cpuSeconds = static_cast<double>(user + system) / sysconf(_SC_CLK_TCK);
        }
        fclose(stat);
    }
    ScanLines(proc + "/status", {{"VmHWM: %ld kB", &usage.peakRssKb}, {"VmRSS: %ld kB", &usage.rssKb}});
    ScanLines(proc + "/smaps_rollup",
              {{"Pss: %ld kB", &usage.pssKb}, {"Private_Dirty: %ld kB", &usage.privateDirtyKb}});
    ScanLines(proc + "/io", {{"write_bytes: %" SCNu64, &usage.writeBytes}, {"syscw: %" SCNu64, &usage.writeCalls}});
    return usage;
}

// The largest PSS and private dirty memory seen while a phase runs.
struct MemoryPeak {
    void Sample(pid_t pid) {
        ProcessUsage now = ReadUsage(pid);
        pssKb = std::max(pssKb, now.pssKb);
        privateDirtyKb = std::max(privateDirtyKb, now.privateDirtyKb);
    }
    long pssKb = 0;
    long privateDirtyKb = 0;
};

bool WriteRecord(int fd, uint32_t id, const char* params) {
    std::string record =
            "EventId " + std::to_string(id) + " -t " + std::to_string(time(nullptr)) + " -paraList " + params;
    return write(fd, record.data(), record.size()) == static_cast<ssize_t>(record.size());
}

// Polls the counters until `done` holds or `timeout` passes without progress of `progress`.
template <typename Done, typename Progress>
bool PollUntil(DaemonCounters& counters, Done done, Progress progress, Clock::duration timeout,
               Clock::duration period) {
    Clock::time_point lastChange = Clock::now();
    uint64_t last = 0;
    while (counters.Read() || Clock::now() - lastChange < timeout) {
        if (done()) {
            return true;
        }
        uint64_t now = progress();
        if (now != last) {
            last = now;
            lastChange = Clock::now();
        } else if (Clock::now() - lastChange >= timeout) {
            return false;
        }
        std::this_thread::sleep_for(period);
    }
    return false;
}

// Writes records of `ids` distinct ids, round robin, as fast as the daemon handles them, for
// `seconds`, then waits until it has committed everything. The daemon queues what it reads
// without bound, so the writer holds back once it is more than kMaxBacklog events ahead.
int Throughput(int node, DaemonCounters& counters, pid_t pid, uint32_t ids, double seconds) {
    constexpr uint32_t kFirstId = 903000000;
    constexpr uint64_t kWarmUp = 2000;
    constexpr uint64_t kMaxBacklog = 2000;
    constexpr auto kPoll = std::chrono::milliseconds(20);
    uint64_t written = 0;
    auto writeNext = [&] {
        if (!WriteRecord(node, kFirstId + static_cast<uint32_t>(written % ids), "{\"load\":1}")) {
            fprintf(stderr, "orvane-loadgen: write failed: %s\n", strerror(errno));
            exit(1);
        }
        ++written;
    };
    if (!counters.Read()) {
        fprintf(stderr, "orvane-loadgen: the daemon does not answer on its socket\n");
        return 1;
    }
    uint64_t handledBase = counters.Handled();
    auto handled = [&] { return counters.Handled() - handledBase; };
    auto settled = [&] { return handled() >= written && counters.Committed() >= counters.Handled(); };
    while (written < kWarmUp) {
        writeNext();
    }
    PollUntil(counters, settled, handled, std::chrono::seconds(5), kPoll);

    ProcessUsage before = ReadUsage(pid);
    uint64_t commitsBefore = counters.Commits();
    uint64_t storedBefore = counters.Get("storage.events.stored");
    MemoryPeak memory;
    Clock::time_point start = Clock::now();
    Clock::time_point lastPoll = start;
    uint64_t first = written;
    uint64_t seenHandled = handled();
    while (Seconds(Clock::now() - start) < seconds) {
        if (written - seenHandled > kMaxBacklog || Clock::now() - lastPoll >= kPoll) {
            counters.Read();
            memory.Sample(pid);
            seenHandled = handled();
            lastPoll = Clock::now();
            if (written - seenHandled > kMaxBacklog) {
                std::this_thread::sleep_for(std::chrono::milliseconds(2));
            }
            continue;
        }
        writeNext();
    }
    double writeSeconds = Seconds(Clock::now() - start);
    bool drained = PollUntil(counters, settled, handled, std::chrono::seconds(5), std::chrono::milliseconds(2));
    double totalSeconds = Seconds(Clock::now() - start);
    memory.Sample(pid);
    ProcessUsage after = ReadUsage(pid);
    uint64_t events = written - first;
    uint64_t stored = counters.Get("storage.events.stored") - storedBefore;
    uint64_t diskBytes = after.writeBytes - before.writeBytes;
    std::string commits = "n/a";
    if (counters.Has("storage.db.commits")) {
        char text[32];
        snprintf(text, sizeof(text), "%.3f", static_cast<double>(counters.Commits() - commitsBefore) / events);
        commits = text;
    }
    printf("ids=%u events=%llu stored=%llu write_s=%.1f drained_s=%.1f end_to_end_per_s=%.0f stored_per_s=%.0f "
           "commits_per_event=%s disk_bytes_per_event=%.0f disk_bytes_per_stored=%.0f write_calls_per_event=%.2f "
           "daemon_cpu_us_per_event=%.1f pss_kb=%ld private_dirty_kb=%ld daemon_peak_rss_kb=%ld written=%llu%s\n",
           ids, static_cast<unsigned long long>(events), static_cast<unsigned long long>(stored), writeSeconds,
           totalSeconds, events / totalSeconds, stored / totalSeconds, commits.c_str(),
           static_cast<double>(diskBytes) / events, stored > 0 ? static_cast<double>(diskBytes) / stored : 0.0,
           static_cast<double>(after.writeCalls - before.writeCalls) / events,
           (after.cpuSeconds - before.cpuSeconds) * 1e6 / events, memory.pssKb, memory.privateDirtyKb, after.peakRssKb,
           static_cast<unsigned long long>(written), drained ? "" : " NOT_DRAINED");
    return drained ? 0 : 1;
}

// Writes `rate` records a second, each of a new id so that each is stored, and times each from
// its write until the daemon reports its commit.
int Latency(int node, DaemonCounters& counters, double rate, double seconds) {
    constexpr uint32_t kFirstId = 904000000;
    constexpr auto kTimeout = std::chrono::seconds(2);
    if (!counters.Read()) {
        fprintf(stderr, "orvane-loadgen: the daemon does not answer on its socket\n");
        return 1;
    }
    auto period = std::chrono::duration_cast<Clock::duration>(std::chrono::duration<double>(1.0 / rate));
    uint32_t count = static_cast<uint32_t>(rate * seconds);
    std::vector<double> latencies;
    uint32_t missed = 0;
    Clock::time_point due = Clock::now();
    for (uint32_t i = 1; i <= count; ++i) {
        std::this_thread::sleep_until(due);
        due += period;
        counters.Read();
        uint64_t target = counters.Committed() + 1;
        Clock::time_point written = Clock::now();
        WriteRecord(node, kFirstId + i, "{\"latency\":1}");
        bool seen = false;
        while (!seen && Clock::now() - written < kTimeout) {
            seen = counters.Read() && counters.Committed() >= target;
        }
        if (!seen) {
            ++missed;
            continue;
        }
        latencies.push_back(Seconds(Clock::now() - written) * 1e3);
    }
    if (latencies.empty()) {
        fprintf(stderr, "orvane-loadgen: no event was committed in time\n");
        return 1;
    }
    std::sort(latencies.begin(), latencies.end());
    auto at = [&](double share) { return latencies[std::min(latencies.size() - 1, size_t(share * latencies.size()))]; };
    printf("rate_per_s=%.0f events=%zu median_ms=%.2f p99_ms=%.2f max_ms=%.2f missed=%u written=%u\n", rate,
           latencies.size(), at(0.5), at(0.99), latencies.back(), missed, count);
    return 0;
}

// Writes `records` records of about `bytes` bytes each from `writers` threads, each on its own
// descriptor, as fast as the node takes them, then waits until the daemon has gone idle (no CPU
// time for a second). Reports the daemon's resident memory before, its peak (VmHWM) and after.
// The ids cycle through `ids` values so that storage keeps a realistic share.
int Flood(const char* node, pid_t pid, uint32_t ids, uint64_t records, size_t bytes, int writers) {
    constexpr uint32_t kFirstId = 905100000;
    ProcessUsage before = ReadUsage(pid);
    if (before.rssKb == 0) {
        fprintf(stderr, "orvane-loadgen: no daemon with pid %d\n", pid);
        return 1;
    }
    std::atomic<uint64_t> next{0};
    std::atomic<bool> failed{false};
    std::atomic<bool> settled{false};
    MemoryPeak memory;
    std::thread sampler([&] {
        while (!settled) {
            memory.Sample(pid);
            std::this_thread::sleep_for(std::chrono::milliseconds(100));
        }
    });
    Clock::time_point start = Clock::now();
    std::vector<std::thread> threads;
    for (int w = 0; w < writers; ++w) {
        threads.emplace_back([&] {
            unique_fd fd(open(node, O_WRONLY | O_CLOEXEC));
            if (!fd.ok()) {
                fprintf(stderr, "orvane-loadgen: cannot open %s: %s\n", node, strerror(errno));
                failed = true;
                return;
            }
            std::string params = "{\"flood\":\"" + std::string(bytes > 64 ? bytes - 64 : 1, 'f') + "\"}";
            for (uint64_t i; !failed && (i = next++) < records;) {
                if (!WriteRecord(fd.get(), kFirstId + static_cast<uint32_t>(i % ids), params.c_str())) {
                    fprintf(stderr, "orvane-loadgen: write failed: %s\n", strerror(errno));
                    failed = true;
                }
            }
        });
    }
    for (std::thread& thread : threads) {
        thread.join();
    }
    double writeSeconds = Seconds(Clock::now() - start);
    // Idle once a second passes without CPU time.
    for (double cpu = -1; ReadUsage(pid).cpuSeconds != cpu;) {
        cpu = ReadUsage(pid).cpuSeconds;
        std::this_thread::sleep_for(std::chrono::seconds(1));
    }
    settled = true;
    sampler.join();
    double settleSeconds = Seconds(Clock::now() - start);
    ProcessUsage after = ReadUsage(pid);
    printf("records=%llu bytes_per_record=%zu writers=%d write_s=%.1f settled_s=%.1f rss_before_kb=%ld "
           "peak_rss_kb=%ld rss_after_kb=%ld peak_pss_kb=%ld peak_private_dirty_kb=%ld\n",
           static_cast<unsigned long long>(std::min<uint64_t>(next, records)), bytes, writers, writeSeconds,
           settleSeconds, before.rssKb, after.peakRssKb, after.rssKb, memory.pssKb, memory.privateDirtyKb);
    return failed ? 1 : 0;
}

int Usage() {
    fprintf(stderr,
            "usage: orvane-loadgen throughput NODE WORKDIR DAEMON_PID IDS SECONDS\n"
            "       orvane-loadgen latency NODE WORKDIR RATE SECONDS\n"
            "       orvane-loadgen flood NODE DAEMON_PID IDS RECORDS BYTES WRITERS\n"
            "NODE is the daemon's kernel event device (qxev), WORKDIR its work folder.\n");
    return 2;
}

}  // namespace

int main(int argc, char** argv) {
    if (argc == 8 && strcmp(argv[1], "flood") == 0) {
        return Flood(argv[2], atoi(argv[3]), static_cast<uint32_t>(std::max(1, atoi(argv[4]))),
                     strtoull(argv[5], nullptr, 10), static_cast<size_t>(std::max(1, atoi(argv[6]))),
                     std::max(1, atoi(argv[7])));
    }
    bool throughput = argc == 7 && strcmp(argv[1], "throughput") == 0;
    bool latency = argc == 6 && strcmp(argv[1], "latency") == 0;
    if (!throughput && !latency) {
        return Usage();
    }
    unique_fd node(open(argv[2], O_WRONLY | O_CLOEXEC));
    if (!node.ok()) {
        fprintf(stderr, "orvane-loadgen: cannot open %s: %s\n", argv[2], strerror(errno));
        return 1;
    }
    DaemonCounters counters(argv[3]);
    return throughput ? Throughput(node.get(), counters, atoi(argv[4]),
                                   static_cast<uint32_t>(std::max(1, atoi(argv[5]))), atof(argv[6]))
                      : Latency(node.get(), counters, atof(argv[4]), atof(argv[5]));
}
