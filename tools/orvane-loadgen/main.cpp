// orvane-loadgen: drives a running daemon through its kernel event device and measures what
// it sustains end to end, from the write on the node to the commit in its event database, and
// how much memory it takes under a flood.
// Commits are observed, not queried: the database runs in rollback-journal mode, so each commit
// deletes "event.db-journal" in the work folder, and inotify reports that without taking a lock
// the daemon would have to wait for.
#include <errno.h>
#include <fcntl.h>
#include <poll.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/inotify.h>
#include <time.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <chrono>
#include <string>
#include <thread>
#include <vector>

#include <android-base/unique_fd.h>

namespace {

using android::base::unique_fd;
using Clock = std::chrono::steady_clock;

double Seconds(Clock::duration span) {
    return std::chrono::duration<double>(span).count();
}

// Counts the daemon's commits as they happen.
class CommitWatch {
public:
    bool Open(const std::string& workDir) {
        fd_.reset(inotify_init1(IN_NONBLOCK | IN_CLOEXEC));
        return fd_.ok() && inotify_add_watch(fd_.get(), workDir.c_str(), IN_DELETE) >= 0;
    }
    // Waits up to `timeoutMs` for commits; returns how many arrived (0 on time-out).
    int Wait(int timeoutMs) {
        struct pollfd watch = {fd_.get(), POLLIN, 0};
        if (poll(&watch, 1, timeoutMs) <= 0) {
            return 0;
        }
        return Drain();
    }
    // Takes the commits already reported without waiting.
    int Drain() {
        alignas(inotify_event) char buffer[4096];
        int commits = 0;
        ssize_t length;
        while ((length = read(fd_.get(), buffer, sizeof(buffer))) > 0) {
            for (char* at = buffer; at < buffer + length;) {
                auto* event = reinterpret_cast<inotify_event*>(at);
                if (event->len > 0 && strcmp(event->name, "event.db-journal") == 0) {
                    ++commits;
                }
                at += sizeof(inotify_event) + event->len;
            }
        }
        if (commits > 0) {
            lastCommit = Clock::now();
        }
        return commits;
    }
    Clock::time_point lastCommit;

private:
    unique_fd fd_;
};

struct ProcessUsage {
    double cpuSeconds = 0;
    long peakRssKb = 0;  // VmHWM
    long rssKb = 0;      // VmRSS
};

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
    if (FILE* status = fopen((proc + "/status").c_str(), "r")) {
        char line[256];
        while (fgets(line, sizeof(line), status) != nullptr) {
            sscanf(line, "VmHWM: %ld kB", &usage.peakRssKb);
            sscanf(line, "VmRSS: %ld kB", &usage.rssKb);
        }
        fclose(status);
    }
    return usage;
}

bool WriteRecord(int fd, uint32_t id, const char* params) {
    std::string record =
            "EventId " + std::to_string(id) + " -t " + std::to_string(time(nullptr)) + " -paraList " + params;
    return write(fd, record.data(), record.size()) == static_cast<ssize_t>(record.size());
}

// Writes records of `ids` distinct ids, round robin, as fast as the daemon stores them, for
// `seconds`, then waits until it has committed everything. The daemon queues what it reads
// without bound, so the writer holds back once it is more than kMaxBacklog events ahead of the
// commits; commits per event are learnt from a warm-up burst first.
int Throughput(int node, CommitWatch& commits, pid_t pid, uint32_t ids, double seconds) {
    constexpr uint32_t kFirstId = 903000000;
    constexpr uint64_t kWarmUp = 2000;
    constexpr double kMaxBacklog = 2000;
    uint64_t written = 0;
    auto writeNext = [&] {
        if (!WriteRecord(node, kFirstId + static_cast<uint32_t>(written % ids), "{\"load\":1}")) {
            fprintf(stderr, "orvane-loadgen: write failed: %s\n", strerror(errno));
            exit(1);
        }
        ++written;
    };
    commits.Drain();
    while (written < kWarmUp) {
        writeNext();
    }
    uint64_t warmUpCommits = 0;
    for (int arrived; (arrived = commits.Wait(2000)) > 0;) {
        warmUpCommits += arrived;
    }
    double perEvent = std::max(1.0, static_cast<double>(warmUpCommits) / kWarmUp);

    ProcessUsage before = ReadUsage(pid);
    Clock::time_point start = Clock::now();
    uint64_t first = written;
    // The backlog is estimated from the commits since `counted`; a daemon gone quiet has
    // caught up, which corrects the estimate when the mix of commits per event shifts.
    uint64_t counted = written;
    uint64_t committed = 0;
    while (Seconds(Clock::now() - start) < seconds) {
        double backlog = static_cast<double>(written - counted) - committed / perEvent;
        if (backlog > kMaxBacklog) {
            int arrived = commits.Wait(200);
            committed += arrived;
            if (arrived == 0) {
                counted = written;
                committed = 0;
            }
            continue;
        }
        writeNext();
        if (written % 64 == 0) {
            committed += commits.Drain();
        }
    }
    double writeSeconds = Seconds(Clock::now() - start);
    // Drained once no commit has come for two seconds.
    while (commits.Wait(2000) > 0) {
    }
    double totalSeconds = Seconds(commits.lastCommit - start);
    ProcessUsage after = ReadUsage(pid);
    uint64_t events = written - first;
    printf("ids=%u events=%llu commits_per_event=%.2f write_s=%.1f drained_s=%.1f end_to_end_per_s=%.0f "
           "daemon_cpu_us_per_event=%.1f daemon_peak_rss_kb=%ld written=%llu\n",
           ids, static_cast<unsigned long long>(events), perEvent, writeSeconds, totalSeconds, events / totalSeconds,
           (after.cpuSeconds - before.cpuSeconds) * 1e6 / events, after.peakRssKb,
           static_cast<unsigned long long>(written));
    return 0;
}

// Writes `rate` records a second, each of a new id so that each is stored, and times each from
// its write to the last commit it causes.
int Latency(int node, CommitWatch& commits, double rate, double seconds) {
    constexpr uint32_t kFirstId = 904000000;
    constexpr int kTimeoutMs = 2000;
    // How many commits one stored event makes, from the first one on a quiet daemon.
    commits.Drain();
    WriteRecord(node, kFirstId, "{\"latency\":1}");
    int perEvent = 0;
    for (int arrived; (arrived = commits.Wait(500)) > 0;) {
        perEvent += arrived;
    }
    if (perEvent == 0) {
        fprintf(stderr, "orvane-loadgen: no commit seen for a stored event\n");
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
        Clock::time_point written = Clock::now();
        WriteRecord(node, kFirstId + i, "{\"latency\":1}");
        int seen = 0;
        while (seen < perEvent) {
            int arrived = commits.Wait(kTimeoutMs);
            if (arrived == 0) {
                break;
            }
            seen += arrived;
        }
        if (seen < perEvent) {
            ++missed;
            continue;
        }
        latencies.push_back(Seconds(commits.lastCommit - written) * 1e3);
    }
    // Late commits of missed events must land before the daemon is stopped.
    while (commits.Wait(2000) > 0) {
    }
    if (latencies.empty()) {
        fprintf(stderr, "orvane-loadgen: no event was committed in time\n");
        return 1;
    }
    std::sort(latencies.begin(), latencies.end());
    auto at = [&](double share) { return latencies[std::min(latencies.size() - 1, size_t(share * latencies.size()))]; };
    printf("rate_per_s=%.0f events=%zu commits_per_event=%d median_ms=%.2f p99_ms=%.2f max_ms=%.2f missed=%u "
           "written=%u\n",
           rate, latencies.size(), perEvent, at(0.5), at(0.99), latencies.back(), missed, count + 1);
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
    double settleSeconds = Seconds(Clock::now() - start);
    ProcessUsage after = ReadUsage(pid);
    printf("records=%llu bytes_per_record=%zu writers=%d write_s=%.1f settled_s=%.1f rss_before_kb=%ld "
           "peak_rss_kb=%ld rss_after_kb=%ld\n",
           static_cast<unsigned long long>(std::min<uint64_t>(next, records)), bytes, writers, writeSeconds,
           settleSeconds, before.rssKb, after.peakRssKb, after.rssKb);
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
    CommitWatch commits;
    if (!commits.Open(argv[3])) {
        fprintf(stderr, "orvane-loadgen: cannot watch %s: %s\n", argv[3], strerror(errno));
        return 1;
    }
    return throughput ? Throughput(node.get(), commits, atoi(argv[4]),
                                   static_cast<uint32_t>(std::max(1, atoi(argv[5]))), atof(argv[6]))
                      : Latency(node.get(), commits, atof(argv[4]), atof(argv[5]));
}
