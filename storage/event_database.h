#ifndef ORVANE_STORAGE_EVENT_DATABASE_H
#define ORVANE_STORAGE_EVENT_DATABASE_H

#include <cstdint>
#include <functional>
#include <map>
#include <string>
#include <vector>

#include <utils/RefBase.h>

#include "storage/event_query.h"
#include "storage/sql_database.h"
#include "utils/daemon_stats.h"
#include "utils/thread_checker.h"

namespace android {
namespace Orvane {

// The process-wide access point to the event database file: opens it, creates and upgrades
// its tables, runs table-level statements, and replaces a damaged file by a fresh one.
// Threads: takes no lock. One thread at a time owns the instance (the storage plugin's loop,
// which also runs the dump commands); every operation but Close checks that at run time, and
// Close releases it so that another thread may open it again. Only the creation of the
// instance is locked.
class EventDatabase : public RefBase {
public:
    // Told, on the owning thread, that a damaged file was replaced by a fresh, empty one.
    using RecoveryListener = std::function<void()>;

    static sp<EventDatabase> getInstance();

    void InitDatabase(const std::string& path);
    bool IsInitialised() const { return initialised_; }
    // Where failures, recoveries and refusals are counted; forgotten on Close.
    void SetStats(DaemonStats* stats);
    void SetRecoveryListener(RecoveryListener listener) { recoveryListener_ = std::move(listener); }
    sp<BaseTable> GetTable(const std::string& name);
    bool Insert(const std::string& table, std::vector<std::string> names, std::vector<std::string> values);
    // The id of the new row, 0 on failure.
    int32_t InsertAndGetID(const std::string& table, std::vector<std::string> names, std::vector<std::string> values);
    // A query without conditions updates every row.
    bool Update(const std::string& table, std::vector<std::string> names, std::vector<std::string> values,
                EventQuery query);
    std::vector<SqlRow> Query(const std::string& table, EventQuery query, int32_t limit);
    // A query without conditions deletes every row.
    bool Delete(const std::string& table, EventQuery query);
    // Deletes up to `maxRows` rows of the table, oldest first by `timeColumn` (a row without a
    // time counts as oldest), in statements small enough for a nearly full disk. The rows deleted.
    int64_t DeleteOldest(const std::string& table, const std::string& timeColumn, int64_t maxRows);
    // Same, for the rows whose time lies before `cutOff`, however many.
    int64_t DeleteOlderThan(const std::string& table, const std::string& timeColumn, int64_t cutOff);
    // Empties the table, restarts its ids and creates it again.
    bool TruncateAndCreate(const std::string& table);
    // Adds the declared columns that the file's table lacks.
    bool UpdateTableColumn(const sp<BaseTable>& table);
    // Group commit. The statements of one event run between BeginEvent and EndEvent; the events
    // of a batch share one transaction, which their first write opens and Commit closes. Outside
    // BeginEvent and EndEvent each statement commits on its own. EndEvent tells whether the batch
    // is due: kMaxBatchEvents events in it, or kMaxBatchNs since it opened.
    static constexpr size_t kMaxBatchEvents = 256;
    static constexpr int64_t kMaxBatchNs = 100000000;
    void BeginEvent();
    bool EndEvent();
    bool HasOpenBatch() const { return batchOpen_; }
    void Commit();
    // Rebuilds the file so that the space of deleted rows is given back; commits an open batch first.
    bool Vacuum();
    // Bytes of the pages that hold data, which is what a vacuum would leave; -1 on failure.
    int64_t GetLiveSize();
    void Close();

    EventDatabase() = default;

private:
    static bool CheckLists(const char* op, const std::vector<std::string>& names,
                           const std::vector<std::string>& values);
    // Opens the file and creates (and for an existing file upgrades) the tables.
    void OpenFile();
    // Every statement goes through these two: a failure is counted, and a file found damaged is
    // replaced before the statement runs once more on the fresh one.
    bool Run(const std::string& sql);
    std::vector<SqlRow> Fetch(const std::string& sql, const std::vector<std::string>& fieldNames);
    bool Failed();
    bool RecoverFromCorruption();
    void MoveAside();
    int64_t DeleteInBatches(const std::string& table, const std::string& timeColumn, const std::string& condition,
                            int64_t maxRows);
    void RaiseDbRevision();
    void OpenBatch();
    void CommitBatch();
    void RescueBatch();
    void ForgetBatch();

    bool initialised_ = false;
    sp<SqlDatabase> database_;
    std::map<std::string, sp<BaseTable>> tables_;
    bool recovering_ = false;
    RecoveryListener recoveryListener_;
    bool inEvent_ = false;
    bool batchOpen_ = false;
    int64_t batchOpenedNs_ = 0;
    // The write statements of each event in the open batch, to run again should SQLite roll the
    // batch back on a failure; the last entry is the event under way once it has written.
    std::vector<std::vector<std::string>> batch_;
    bool eventInBatch_ = false;
    DaemonStats::Counter* errors_ = nullptr;
    DaemonStats::Counter* recovered_ = nullptr;
    DaemonStats::Counter* linksRefused_ = nullptr;
    DaemonStats::Counter* commits_ = nullptr;
    DaemonStats::Counter* committedEvents_ = nullptr;
    DaemonStats::Counter* batchesRescued_ = nullptr;
    DaemonStats::Counter* eventsLost_ = nullptr;
    ThreadChecker owner_;
};

}  // namespace Orvane
}  // namespace android

#endif  // ORVANE_STORAGE_EVENT_DATABASE_H
