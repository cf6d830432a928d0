#include "storage/event_database.h"

#include <dirent.h>
#include <errno.h>
#include <sqlite3.h>
#include <stdlib.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <memory>

#include <android-base/file.h>
#include <utils/Mutex.h>
#include <utils/Timers.h>

#include "storage/event_table.h"
#include "utils/file_util.h"
#include "utils/orvane_log.h"
#include "utils/string_util.h"
#include "utils/time_util.h"
#include "utils/trace.h"

namespace android {
namespace Orvane {

namespace {
// Guards the creation of the single instance, nothing else.
Mutex g_instanceMutex;
sp<EventDatabase> g_instance GUARDED_BY(g_instanceMutex);

// A damaged file is kept beside the fresh one as <name>.corrupt-<time>, with its companions.
constexpr char kCorruptInfix[] = ".corrupt-";
constexpr const char* kCompanionSuffixes[] = {"-journal", "-wal", "-shm"};
// Rows per trimming statement: each statement's journal must fit on a nearly full disk; a
// statement that still fails is retried with half as many rows.
constexpr int64_t kDeleteBatchRows = 256;
// What every stored event looks up: its counter row by id, and the day's rows of its id in
// event_info, which the daily quota keeps few. Without them each lookup reads the whole table.
// The parameter text stays out of the index: it can be kilobytes, and would be stored twice.
constexpr const char* kIndexes[] = {
        "CREATE INDEX IF NOT EXISTS event_info_day_lookup ON event_info(event_id, first_time)",
        "CREATE INDEX IF NOT EXISTS event_daily_event ON event_daily(event_id)",
};

void Bump(DaemonStats::Counter* counter) {
    if (counter != nullptr) {
        counter->fetch_add(1, std::memory_order_relaxed);
    }
}

bool IsSymbolicLink(const std::string& path) {
    struct stat st;
    return lstat(path.c_str(), &st) == 0 && S_ISLNK(st.st_mode);
}

// Removes a file and its companions; false when the file itself stays.
bool RemoveWithCompanions(const std::string& path) {
    for (const char* suffix : kCompanionSuffixes) {
        unlink((path + suffix).c_str());
    }
    return unlink(path.c_str()) == 0 || errno == ENOENT;
}
}  // namespace

sp<EventDatabase> EventDatabase::getInstance() {
    Mutex::Autolock lock(g_instanceMutex);
    if (g_instance == nullptr) {
        g_instance = new EventDatabase();
    }
    return g_instance;
}

void EventDatabase::SetStats(DaemonStats* stats) {
    owner_.Check(__func__);
    errors_ = stats != nullptr ? &stats->Get("storage.db.errors") : nullptr;
    recovered_ = stats != nullptr ? &stats->Get("storage.db.recovered") : nullptr;
    linksRefused_ = stats != nullptr ? &stats->Get("storage.db.link_refused") : nullptr;
    commits_ = stats != nullptr ? &stats->Get("storage.db.commits") : nullptr;
    committedEvents_ = stats != nullptr ? &stats->Get("storage.events.committed") : nullptr;
    batchesRescued_ = stats != nullptr ? &stats->Get("storage.db.batch_rescued") : nullptr;
    eventsLost_ = stats != nullptr ? &stats->Get("storage.events.lost") : nullptr;
}

void EventDatabase::InitDatabase(const std::string& path) {
    owner_.Check(__func__);
    if (initialised_) {
        OLOGW("%s init data base already init");
        return;
    }
    tables_.clear();
    for (sp<BaseTable> table :
         std::initializer_list<sp<BaseTable>>{new EventTable(), new EventDailyTable(), new EventVersionTable(),
                                              new EventDBVersionTable(), new EventUploadTable(), new RawEventTable()}) {
        tables_[table->GetTableName()] = table;
    }
    database_ = new SqlDatabase(path);
    // A link would let whoever placed it choose which file the daemon writes.
    if (IsSymbolicLink(path)) {
        OLOGE("%s refusing db %s, it is a symbolic link", path.c_str());
        Bump(linksRefused_);
        return;
    }
    OpenFile();
}

void EventDatabase::OpenFile() {
    // A batch open on a file that is being replaced went with it.
    ForgetBatch();
    bool existed = FileUtil::FileExists(database_->GetPath());
    if (!database_->Open()) {
        Bump(errors_);
        return;
    }
    initialised_ = true;
    for (const auto& [name, table] : tables_) {
        OLOG_AS(ANDROID_LOG_DEBUG, "InitDatabase", "%s create table %s", name.c_str());
        if (!Run(table->GenerateCreateTableStatement())) {
            return;
        }
        if (existed && !UpdateTableColumn(table)) {
            OLOG_AS(ANDROID_LOG_INFO, "InitDatabase", "%s update failed");
        }
    }
    for (const char* index : kIndexes) {
        Run(index);
    }
}

bool EventDatabase::Run(const std::string& sql) {
    owner_.Check(__func__);
    if (inEvent_ && !batchOpen_) {
        OpenBatch();
    }
    bool ok = database_->ExecuteSql(sql);
    if (!ok && Failed()) {
        ok = database_->ExecuteSql(sql);
        if (!ok) {
            Bump(errors_);
        }
    } else if (!ok && batchOpen_ && !database_->InTransaction()) {
        RescueBatch();
    }
    if (ok && batchOpen_) {
        if (!eventInBatch_) {
            batch_.emplace_back();
            eventInBatch_ = true;
        }
        batch_.back().push_back(sql);
    } else if (ok) {
        Bump(commits_);
    }
    return ok;
}

void EventDatabase::BeginEvent() {
    owner_.Check(__func__);
    inEvent_ = true;
    eventInBatch_ = false;
}

bool EventDatabase::EndEvent() {
    owner_.Check(__func__);
    inEvent_ = false;
    eventInBatch_ = false;
    return batchOpen_ &&
           (batch_.size() >= kMaxBatchEvents || systemTime(SYSTEM_TIME_MONOTONIC) - batchOpenedNs_ >= kMaxBatchNs);
}

void EventDatabase::OpenBatch() {
    if (!initialised_) {
        return;
    }
    // IMMEDIATE takes the write lock now (waiting out the busy time-out), so that no statement of
    // the batch can meet a lock later.
    if (!database_->ExecuteSql("BEGIN IMMEDIATE")) {
        Bump(errors_);
        return;
    }
    batchOpen_ = true;
    batchOpenedNs_ = systemTime(SYSTEM_TIME_MONOTONIC);
}

void EventDatabase::Commit() {
    owner_.Check(__func__);
    CommitBatch();
}

void EventDatabase::CommitBatch() {
    if (!batchOpen_) {
        return;
    }
    if (database_->ExecuteSql("COMMIT")) {
        Bump(commits_);
        if (committedEvents_ != nullptr) {
            committedEvents_->fetch_add(batch_.size(), std::memory_order_relaxed);
        }
        ForgetBatch();
        return;
    }
    Bump(errors_);
    database_->Execute("ROLLBACK", false);
    RescueBatch();
}

// SQLite rolls a transaction back by itself on some failures (a full disk, an I/O error), and a
// failed COMMIT leaves nothing stored. The batch's events are then run again, each in a
// transaction of its own, so that only an event that fails again is lost.
void EventDatabase::RescueBatch() {
    std::vector<std::vector<std::string>> events = std::move(batch_);
    ForgetBatch();
    Bump(batchesRescued_);
    for (const auto& statements : events) {
        bool ok = database_->ExecuteSql("BEGIN IMMEDIATE");
        for (size_t i = 0; ok && i < statements.size(); i++) {
            ok = database_->ExecuteSql(statements[i]);
        }
        if (ok && database_->ExecuteSql("COMMIT")) {
            Bump(commits_);
            Bump(committedEvents_);
            continue;
        }
        database_->Execute("ROLLBACK", false);
        Bump(eventsLost_);
    }
    OLOGE_LIMITED("%s a shared transaction of %zu events failed, each was run again on its own", events.size());
}

void EventDatabase::ForgetBatch() {
    batchOpen_ = false;
    eventInBatch_ = false;
    batch_.clear();
}

std::vector<SqlRow> EventDatabase::Fetch(const std::string& sql, const std::vector<std::string>& fieldNames) {
    owner_.Check(__func__);
    std::vector<SqlRow> rows = database_->QueryRecord(sql, fieldNames);
    if (database_->GetLastCode() == SQLITE_OK) {
        return rows;
    }
    if (!Failed()) {
        // A read that had to make room in the page cache writes, and may fail like a write.
        if (batchOpen_ && !database_->InTransaction()) {
            RescueBatch();
        }
        return rows;
    }
    rows = database_->QueryRecord(sql, fieldNames);
    if (database_->GetLastCode() != SQLITE_OK) {
        Bump(errors_);
    }
    return rows;
}

// Counts a failed statement; true when it found the file damaged and a fresh one took its place.
bool EventDatabase::Failed() {
    Bump(errors_);
    return database_->LastFailureIsCorruption() && RecoverFromCorruption();
}

// What Android does with a damaged database: the file goes, a fresh one with empty tables comes,
// and the owner puts its start-up rows back. A damaged fresh file is not replaced again at once.
bool EventDatabase::RecoverFromCorruption() {
    if (recovering_) {
        return false;
    }
    recovering_ = true;
    MoveAside();
    if (database_ != nullptr) {
        OpenFile();
    }
    if (initialised_ && recoveryListener_) {
        recoveryListener_();
    }
    recovering_ = false;
    return initialised_;
}

void EventDatabase::MoveAside() {
    std::string path = database_->GetPath();
    std::string reason = database_->GetLastError();
    database_->Close();
    initialised_ = false;
    // Only the newest damaged copy is kept.
    std::string folder = base::Dirname(path);
    std::string prefix = base::Basename(path) + kCorruptInfix;
    std::unique_ptr<DIR, int (*)(DIR*)> dir(opendir(folder.c_str()), closedir);
    for (struct dirent* entry; dir != nullptr && (entry = readdir(dir.get())) != nullptr;) {
        if (StringUtil::StartsWith(entry->d_name, prefix)) {
            unlink((folder + "/" + entry->d_name).c_str());
        }
    }
    std::string copy = path + kCorruptInfix + TimeUtil::GetTimeDateStr(TimeUtil::GetTimestampSecond(), "%Y%m%d%H%M%S");
    bool moved = FileUtil::MoveFile(path, copy);
    for (const char* suffix : kCompanionSuffixes) {
        // A journal left behind would be rolled back into the fresh file.
        if (moved && FileUtil::FileExists(path + suffix) && !FileUtil::MoveFile(path + suffix, copy + suffix)) {
            unlink((path + suffix).c_str());
        }
    }
    if (!moved && !RemoveWithCompanions(path)) {
        OLOGE_LIMITED("%s db %s is corrupt (%s) and cannot be moved or removed, storing stops", path.c_str(),
                      reason.c_str());
        database_ = nullptr;
        return;
    }
    OLOGE_LIMITED("%s db %s is corrupt (%s), moved to %s, starting a fresh one", path.c_str(), reason.c_str(),
                  moved ? copy.c_str() : "nowhere");
    Bump(recovered_);
}

sp<BaseTable> EventDatabase::GetTable(const std::string& name) {
    owner_.Check(__func__);
    auto it = tables_.find(name);
    return it == tables_.end() ? nullptr : it->second;
}

bool EventDatabase::CheckLists(const char* op, const std::vector<std::string>& names,
                               const std::vector<std::string>& values) {
    if (names.empty() || names.size() != values.size()) {
        OLOG_AS(ANDROID_LOG_ERROR, op, "%s names must not empty, and names size must equal values's");
        return false;
    }
    return true;
}

bool EventDatabase::Insert(const std::string& table, std::vector<std::string> names, std::vector<std::string> values) {
    ScopedTrace trace("DB_Insert");
    if (!CheckLists(__func__, names, values)) {
        return false;
    }
    if (!initialised_) {
        OLOGE_LIMITED("%s database not init");
        return false;
    }
    sp<BaseTable> tbl = GetTable(table);
    if (tbl == nullptr) {
        OLOGE("%s get tbl %s failed", table.c_str());
        return false;
    }
    std::string sql = tbl->BuildInsertStatement(std::move(names), std::move(values));
    if (sql.empty()) {
        OLOGE("%s generate sql failed");
        return false;
    }
    return Run(sql);
}

int32_t EventDatabase::InsertAndGetID(const std::string& table, std::vector<std::string> names,
                                      std::vector<std::string> values) {
    if (!Insert(table, std::move(names), std::move(values))) {
        OLOGE_LIMITED("%s insert %s failed", table.c_str());
        return 0;
    }
    std::vector<SqlRow> rows = Fetch("select id from " + table + " order by id desc limit 1", {kColId});
    OLOGD("%s get id from %s", table.c_str());
    return rows.empty() ? 0 : StringUtil::ConvertInt(rows[0][kColId]);
}

bool EventDatabase::Update(const std::string& table, std::vector<std::string> names, std::vector<std::string> values,
                           EventQuery query) {
    ScopedTrace trace("DB_Update");
    if (!CheckLists(__func__, names, values)) {
        return false;
    }
    if (!initialised_) {
        OLOGE_LIMITED("%s database not init");
        return false;
    }
    sp<BaseTable> tbl = GetTable(table);
    if (tbl == nullptr) {
        return false;
    }
    return Run(tbl->BuildUpdateStatement(std::move(names), std::move(values)) + query.GetWhereStatement());
}

std::vector<SqlRow> EventDatabase::Query(const std::string& table, EventQuery query, int32_t limit) {
    ScopedTrace trace("DB_Query");
    if (!initialised_) {
        OLOGE_LIMITED("%s database not init");
        return {};
    }
    std::string sql = query.BuildQueryStatement(table, limit);
    if (sql.empty()) {
        return {};
    }
    return Fetch(sql, query.GetSelectList());
}

bool EventDatabase::Delete(const std::string& table, EventQuery query) {
    if (!initialised_) {
        OLOGE_LIMITED("%s database not init");
        return false;
    }
    return Run("delete from " + table + query.GetWhereStatement());
}

int64_t EventDatabase::DeleteOldest(const std::string& table, const std::string& timeColumn, int64_t maxRows) {
    return DeleteInBatches(table, timeColumn, "", maxRows);
}

int64_t EventDatabase::DeleteOlderThan(const std::string& table, const std::string& timeColumn, int64_t cutOff) {
    return DeleteInBatches(table, timeColumn,
                           " where " + timeColumn + " is null or " + timeColumn + " < " + std::to_string(cutOff),
                           INT64_MAX);
}

int64_t EventDatabase::DeleteInBatches(const std::string& table, const std::string& timeColumn,
                                       const std::string& condition, int64_t maxRows) {
    if (!initialised_) {
        OLOGE_LIMITED("%s database not init");
        return 0;
    }
    int64_t deleted = 0;
    int64_t batch = kDeleteBatchRows;
    while (deleted < maxRows && initialised_) {
        batch = std::min(batch, maxRows - deleted);
        std::string oldest = "select id from " + table + condition + " order by " + timeColumn + ", id limit " +
                             std::to_string(batch);
        if (!Run("delete from " + table + " where id in (" + oldest + ")")) {
            if (batch == 1) {
                break;
            }
            batch /= 2;
            continue;
        }
        int64_t changes = database_->GetChanges();
        if (changes == 0) {
            break;
        }
        deleted += changes;
    }
    return deleted;
}

bool EventDatabase::TruncateAndCreate(const std::string& table) {
    if (!initialised_) {
        return false;
    }
    owner_.Check(__func__);
    if (!Run("delete from " + table)) {
        OLOGW_LIMITED("%s failed truncate table %s", table.c_str());
        return false;
    }
    Run("DELETE FROM sqlite_sequence WHERE name='" + table + "'");
    sp<BaseTable> tbl = GetTable(table);
    if (tbl == nullptr) {
        return false;
    }
    return Run(tbl->GenerateCreateTableStatement());
}

bool EventDatabase::UpdateTableColumn(const sp<BaseTable>& table) {
    if (database_ == nullptr || table == nullptr) {
        return false;
    }
    const std::string& name = table->GetTableName();
    std::vector<SqlRow> existing = Fetch("select name from pragma_table_info('" + name + "')", {"name"});
    if (existing.empty()) {
        OLOGI("%s query table %s failed", name.c_str());
        return false;
    }
    bool ok = true;
    bool added = false;
    for (const auto& field : table->GetFields()) {
        bool present = std::any_of(existing.begin(), existing.end(),
                                   [&](const SqlRow& row) { return row.at("name") == field->GetName(); });
        if (present) {
            continue;
        }
        OLOGI("%s Add column %s", field->GetName().c_str());
        bool alterOk = Run("ALTER TABLE " + name + " ADD COLUMN " + field->GetFieldStatement());
        ok = ok && alterOk;
        added = true;
    }
    if (added) {
        RaiseDbRevision();
    }
    return ok;
}

void EventDatabase::RaiseDbRevision() {
    EventQuery newest;
    newest.Select({kColId, kColDbVersion}).Order(kColId, false);
    std::vector<SqlRow> rows = Query(kTblDbVersion, newest, 1);
    OLOG_AS(ANDROID_LOG_INFO, "UpdateTableColumn", "%s query %s ret=%zu", kTblDbVersion, rows.size());
    if (rows.empty()) {
        return;
    }
    EventQuery byId;
    byId.And(kColId, EventQuery::EQ, rows[0][kColId]);
    int64_t revision = static_cast<int64_t>(StringUtil::ConvertInt(rows[0][kColDbVersion])) + 1;
    Update(kTblDbVersion, {kColDbVersion}, {std::to_string(revision)}, byId);
}

bool EventDatabase::Vacuum() {
    if (!initialised_) {
        OLOGE_LIMITED("%s database not init");
        return false;
    }
    Commit();
    return Run("VACUUM");
}

int64_t EventDatabase::GetLiveSize() {
    if (!initialised_) {
        OLOGE_LIMITED("%s database not init");
        return -1;
    }
    std::vector<SqlRow> rows =
            Fetch("select (page_count - freelist_count) * page_size from pragma_page_count, pragma_freelist_count, "
                  "pragma_page_size",
                  {"size"});
    return rows.empty() ? -1 : strtoll(rows[0]["size"].c_str(), nullptr, 10);
}

void EventDatabase::Close() {
    if (database_ != nullptr) {
        OLOGI("%s event data base closed");
        CommitBatch();
        initialised_ = false;
        database_->Close();
        database_ = nullptr;
        tables_.clear();
    }
    recoveryListener_ = nullptr;
    errors_ = recovered_ = linksRefused_ = commits_ = committedEvents_ = batchesRescued_ = eventsLost_ = nullptr;
    inEvent_ = false;
    owner_.Detach();
}

}  // namespace Orvane
}  // namespace android
