// Cost of storing one fault event through the storage bookkeeping, against the same SQL run
// straight through sqlite3_exec with the same settings, and how both grow with the number of
// stored events (a 1,000,000-row database is made once and kept under $ORVANE_BENCH_DIR).
// The database lives in $ORVANE_BENCH_DIR (default /tmp); put it on a tmpfs (/dev/shm) to
// see the bookkeeping's own cost without the disk flushes.

#include <fcntl.h>
#include <sqlite3.h>
#include <stdio.h>
#include <stdlib.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <fstream>
#include <string>

#include <android-base/unique_fd.h>
#include <android/log.h>
#include <benchmark/benchmark.h>

#include "storage/event_database_helper.h"
#include "tests/common/fake_plugin_context.h"
#include "utils/file_util.h"

namespace android {
namespace Orvane {
namespace {

constexpr uint32_t kEventId = 901000001;
constexpr char kOsVersion[] = "bench";

std::string BenchRoot() {
    const char* dir = getenv("ORVANE_BENCH_DIR");
    return std::string(dir != nullptr && dir[0] != '\0' ? dir : "/tmp") + "/";
}

// A fresh work folder with a quota document that never drops the benchmark's event.
class BenchFolder {
public:
    BenchFolder() {
        std::string pattern = BenchRoot() + "orvane_bench_XXXXXX";
        char* made = mkdtemp(pattern.data());
        path_ = std::string(made != nullptr ? made : "/tmp") + "/";
        std::ofstream(path_ + "event_quota.xml")
                << "<?xml version=\"1.0\"?>\n<Quota><" << kOsVersion << "><Event eventId=\"" << kEventId
                << "\" dailyCnt=\"2000000000\"/></" << kOsVersion << "></Quota>\n";
    }
    ~BenchFolder() {
        uint64_t freed = 0;
        FileUtil::DeleteDirectoryOrFile(path_, freed, true);
    }
    const std::string& Path() const { return path_; }

private:
    std::string path_;
};

// The event database of a folder, opened by the storage bookkeeping as the storage plugin opens
// it, and closed when this goes.
struct OpenStore {
    explicit OpenStore(const std::string& folder) : context(folder, folder) {
        helper->Init(&context, "event.db", kOsVersion);
        day = helper->GetDbStartTime();
    }
    ~OpenStore() { database->Close(); }

    FakePluginContext context;
    sp<EventDatabaseHelper> helper = new EventDatabaseHelper();
    sp<EventDatabase> database = EventDatabase::getInstance();
    uint64_t day = 0;  // the day the database counts in
};

// A fault event as the kernel source makes it.
sp<Event> FaultEvent(uint32_t id, uint64_t happenTime, const std::string& params) {
    sp<Event> event = new Event("bench");
    event->eventType = 2;
    event->eventId = id;
    event->happenTime = happenTime;
    event->SetValue("param_list", params);
    return event;
}

// Fills event_info with `rows` events of 5,000 other ids over the last 60 days, in one
// transaction: a store that has grown, while the benchmark's own id has only the rows of today
// that the run adds (on a phone its daily quota bounds them).
void Prefill(const std::string& dbPath, int64_t rows, uint64_t day) {
    sqlite3* db = nullptr;
    sqlite3_open(dbPath.c_str(), &db);
    sqlite3_exec(db, "BEGIN", nullptr, nullptr, nullptr);
    for (int64_t i = 0; i < rows; i++) {
        std::string sql =
                "insert into event_info (event_id,version_id,occured_cnt,first_time,param_list,expire,visible) "
                " values ( " +
                std::to_string(kEventId + 1 + i % 5000) + ",1,1," + std::to_string(day + 50 - 86400 * (i / 5000 % 60)) +
                ",'{\"prefill\":" + std::to_string(i) + "}',0,0) ";
        sqlite3_exec(db, sql.c_str(), nullptr, nullptr, nullptr);
    }
    sqlite3_exec(db, "COMMIT", nullptr, nullptr, nullptr);
    sqlite3_close(db);
}

// Copies a file and flushes the copy, so that the first fsync of a timed commit does not also
// write out the hundred megabytes the set-up has just copied.
void CopyToDisk(const std::string& from, const std::string& to) {
    {
        std::ifstream in(from, std::ios::binary);
        std::ofstream(to, std::ios::binary) << in.rdbuf();
    }
    base::unique_fd fd(open(to.c_str(), O_RDONLY | O_CLOEXEC));
    if (fd.get() < 0 || fsync(fd.get()) != 0) {
        fprintf(stderr, "cannot flush %s\n", to.c_str());
        abort();
    }
}

// A database made by the real code and prefilled with `rows` rows, in `folder`. A big prefill is
// made once and kept under $ORVANE_BENCH_DIR, then copied: its day is the one stored in it.
void MakeDatabase(const std::string& folder, int64_t rows) {
    std::string kept = BenchRoot() + "orvane_bench_grown_" + std::to_string(rows) + ".db";
    if (rows >= 100000 && FileUtil::FileExists(kept)) {
        CopyToDisk(kept, folder + "event.db");
        return;
    }
    uint64_t day = OpenStore(folder).day;
    Prefill(folder + "event.db", rows, day);
    if (rows >= 100000) {
        CopyToDisk(folder + "event.db", kept);
    }
}

// One event as the storage plugin stores it when nothing else is queued: its statements in one
// transaction, committed at once. Reports the commit's own time beside the whole event's.
void BM_ProcessFaultEvent(benchmark::State& state) {
    BenchFolder folder;
    MakeDatabase(folder.Path(), state.range(0));
    OpenStore store(folder.Path());
    int64_t n = 0;
    double commitSeconds = 0;
    for (auto _ : state) {
        sp<Event> event = FaultEvent(kEventId, store.day + 100, "{\"n\":" + std::to_string(n++) + "}");
        store.database->BeginEvent();
        store.helper->ProcessFaultEvent(event);
        store.database->EndEvent();
        auto commitStart = std::chrono::steady_clock::now();
        store.database->Commit();
        commitSeconds += std::chrono::duration<double>(std::chrono::steady_clock::now() - commitStart).count();
        if (!event->GetValue("dropReason").empty()) {
            state.SkipWithError("event dropped");
            break;
        }
    }
    state.counters["commit_us"] = commitSeconds * 1e6 / static_cast<double>(std::max<int64_t>(n, 1));
    state.counters["commits_per_event"] = static_cast<double>(store.context.GetStats().Value("storage.db.commits")) /
                                          static_cast<double>(std::max<int64_t>(n, 1));
}

// The storage loop under load: 5,000 ids in turn, all within quota, sharing transactions of
// the group-commit size as a backlog makes them. The cost per event on the storage thread.
void BM_StoreUnderLoad(benchmark::State& state) {
    constexpr int kIds = 5000;
    BenchFolder folder;
    std::ofstream(folder.Path() + "event_quota.xml")
            << "<?xml version=\"1.0\"?>\n<Quota><" << kOsVersion << "><Domain name=\"load\" eventMin=\"" << kEventId
            << "\" eventMax=\"" << kEventId + kIds << "\" dailyCnt=\"2000000000\"/></" << kOsVersion << "></Quota>\n";
    OpenStore store(folder.Path());
    int64_t n = 0;
    for (auto _ : state) {
        sp<Event> event =
                FaultEvent(kEventId + static_cast<uint32_t>(n % kIds), store.day + 100 + n / 1000, "{\"load\":1}");
        n++;
        store.database->BeginEvent();
        store.helper->ProcessFaultEvent(event);
        if (store.database->EndEvent()) {
            store.database->Commit();
        }
        if (!event->GetValue("dropReason").empty()) {
            state.SkipWithError("event dropped");
            break;
        }
    }
    store.database->Commit();
}

int IgnoreRows(void*, int, char**, char**) {
    return 0;
}

// The statements ProcessFaultEvent runs for a kept event whose counter row exists and whose
// parameter text is new today, with the same pragmas and heap settings.
void BM_DirectSql(benchmark::State& state) {
    BenchFolder folder;
    std::string path = folder.Path() + "event.db";
    MakeDatabase(folder.Path(), state.range(0));
    uint64_t day = OpenStore(folder.Path()).day;
    sqlite3_soft_heap_limit64(102400);
    sqlite3* db = nullptr;
    sqlite3_open(path.c_str(), &db);
    for (const char* pragma : {"PRAGMA cache_size=10;", "PRAGMA journal_mode=WAL;", "PRAGMA synchronous=NORMAL;",
                               "PRAGMA wal_autocheckpoint=100;", "PRAGMA journal_size_limit=524288;"}) {
        sqlite3_exec(db, pragma, nullptr, nullptr, nullptr);
    }
    std::string id = std::to_string(kEventId);
    std::string happen = std::to_string(day + 100);
    sqlite3_exec(db,
                 ("insert into event_daily (event_id,daily_cnt,over_cnt,hour_cnt,next_expire_time,last_happen_time,"
                  "last_log_time)  values ( " +
                  id + ",1,0,1," + std::to_string(day + 3700) + "," + happen + ",0) ")
                         .c_str(),
                 nullptr, nullptr, nullptr);
    int64_t n = 0;
    for (auto _ : state) {
        std::string params = "{\"n\":" + std::to_string(n) + "}";
        std::string daily =
                "select id,event_id,daily_cnt,over_cnt,hour_cnt,next_expire_time,last_happen_time,"
                "last_log_time from event_daily where event_id = '" +
                id + "' limit 1";
        std::string update = "update event_daily set daily_cnt=" + std::to_string(n + 2) +
                             ", hour_cnt=" + std::to_string(n + 2) +
                             ", next_expire_time=" + std::to_string(day + 3700) +
                             ", over_cnt=0, last_happen_time=" + happen + ", last_log_time=0  where id = '1'";
        std::string lookup = "select id,occured_cnt from event_info where event_id = '" + id +
                             "' and version_id = '1' and param_list = '" + params + "' and first_time >= '" +
                             std::to_string(day) + "' and first_time < '" + std::to_string(day + 86400) + "' limit 1";
        std::string insert =
                "insert into event_info (event_id,version_id,occured_cnt,first_time,param_list,expire,"
                "visible)  values ( " +
                id + ",1,1," + happen + ",'" + params + "',0,0) ";
        sqlite3_exec(db, daily.c_str(), IgnoreRows, nullptr, nullptr);
        sqlite3_exec(db, "BEGIN IMMEDIATE", nullptr, nullptr, nullptr);
        sqlite3_exec(db, update.c_str(), nullptr, nullptr, nullptr);
        sqlite3_exec(db, lookup.c_str(), IgnoreRows, nullptr, nullptr);
        sqlite3_exec(db, insert.c_str(), nullptr, nullptr, nullptr);
        sqlite3_exec(db, "COMMIT", nullptr, nullptr, nullptr);
        n++;
    }
    sqlite3_close(db);
}

long StatusKiB(const std::string& field) {
    std::ifstream status("/proc/self/status");
    std::string line;
    while (std::getline(status, line)) {
        if (line.rfind(field, 0) == 0) {
            return strtol(line.c_str() + field.size(), nullptr, 10);
        }
    }
    return -1;
}

// Peak resident set of the process after storing a stream of 10,000 events; run it alone
// (--benchmark_filter=BM_StoreStream) so that no other benchmark raised the peak first.
void BM_StoreStreamMemory(benchmark::State& state) {
    long before = StatusKiB("VmHWM:");
    for (auto _ : state) {
        BenchFolder folder;
        OpenStore store(folder.Path());
        for (int i = 0; i < 10000; i++) {
            store.helper->ProcessFaultEvent(
                    FaultEvent(kEventId + i % 50, store.day + 100 + i,
                               "{\"pkg\":\"com.example.app\",\"n\":" + std::to_string(i % 500) + "}"));
        }
    }
    state.counters["VmHWM_before_KiB"] = static_cast<double>(before);
    state.counters["VmHWM_KiB"] = static_cast<double>(StatusKiB("VmHWM:"));
    state.counters["RssAnon_KiB"] = static_cast<double>(StatusKiB("RssAnon:"));
    state.counters["RssFile_KiB"] = static_cast<double>(StatusKiB("RssFile:"));
    state.counters["sqlite_peak_KiB"] = static_cast<double>(sqlite3_memory_highwater(0) / 1024);
}

// A fixed count of events on both sides, so that both tables grow alike during the run; the
// growth curve at 0, 100,000 and 1,000,000 rows of event_info.
BENCHMARK(BM_ProcessFaultEvent)->Arg(0)->Arg(100000)->Arg(1000000)->Iterations(500)->Unit(benchmark::kMicrosecond);
BENCHMARK(BM_DirectSql)->Arg(0)->Arg(100000)->Arg(1000000)->Iterations(500)->Unit(benchmark::kMicrosecond);
BENCHMARK(BM_StoreUnderLoad)->Iterations(50000)->Unit(benchmark::kMicrosecond);
BENCHMARK(BM_StoreStreamMemory)->Iterations(1)->Unit(benchmark::kMillisecond);

}  // namespace
}  // namespace Orvane
}  // namespace android

int main(int argc, char** argv) {
    // Debug lines are off in production builds of the log; they would measure the terminal.
    __android_log_set_minimum_priority(ANDROID_LOG_INFO);
    benchmark::Initialize(&argc, argv);
    benchmark::RunSpecifiedBenchmarks();
    benchmark::Shutdown();
    return 0;
}
