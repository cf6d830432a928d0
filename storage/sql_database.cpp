#include "storage/sql_database.h"

#include <sqlite3.h>

#include "utils/file_util.h"
#include "utils/orvane_log.h"
#include "utils/string_util.h"

namespace android {
namespace Orvane {

namespace {
constexpr int64_t kSoftHeapLimit = 102400;
constexpr mode_t kDbFileMode = 0640;
// Set up as Android sets up its own system databases. A write-ahead log: a commit appends the
// pages it changed to "-wal" and a reader never blocks the writer. Synchronous NORMAL: the log
// is synced only when it is checkpointed into the file, so a killed process loses no commit and
// a power loss loses at most the commits since the last checkpoint, never the file's integrity.
// The log is checkpointed once it holds 100 pages and cut back to 512 KiB afterwards.
constexpr const char* kPragmas[] = {
        "PRAGMA cache_size=10;",          "PRAGMA journal_mode=WAL;",          "PRAGMA synchronous=NORMAL;",
        "PRAGMA wal_autocheckpoint=100;", "PRAGMA journal_size_limit=524288;",
};

const char* TypeWord(SqlFieldType type) {
    switch (type) {
        case SqlFieldType::INTEGER:
            return "INTEGER";
        case SqlFieldType::TEXT:
            return "TEXT";
        case SqlFieldType::REAL:
            return "REAL";
    }
    return "";
}
}  // namespace

SqlField::SqlField(const std::string& name, SqlFieldType type) : SqlField(name, type, false, false, true) {}

SqlField::SqlField(const std::string& name, SqlFieldType type, bool nullable)
    : SqlField(name, type, false, false, nullable) {}

SqlField::SqlField(const std::string& name, SqlFieldType type, bool primaryKey, bool autoIncrement, bool nullable)
    : name_(name),
      type_(type),
      primaryKey_(primaryKey),
      autoIncrement_(autoIncrement),
      nullable_(nullable),
      hasDefault_(false) {}

std::string SqlField::GetFieldStatement() const {
    std::string clause = name_ + " " + TypeWord(type_);
    if (!nullable_) {
        clause += " NOT NULL";
    }
    if (primaryKey_) {
        clause += " PRIMARY KEY";
    }
    if (autoIncrement_) {
        clause += " AUTOINCREMENT";
    }
    if (hasDefault_) {
        clause += " default '" + defaultValue_ + "'";
    }
    return clause;
}

std::vector<std::string> BaseTable::GetFieldNameList() const {
    std::vector<std::string> names;
    names.reserve(fields_.size());
    for (const auto& field : fields_) {
        names.push_back(field->GetName());
    }
    return names;
}

sp<SqlField> BaseTable::GetField(const std::string& name) const {
    for (const auto& field : fields_) {
        if (field->GetName() == name) {
            return field;
        }
    }
    return nullptr;
}

std::string BaseTable::GenerateCreateTableStatement() const {
    if (fields_.empty()) {
        return "";
    }
    std::string sql = "create table IF NOT EXISTS " + tableName_ + "(";
    for (size_t i = 0; i < fields_.size(); i++) {
        if (i > 0) {
            sql += ",";
        }
        sql += fields_[i]->GetFieldStatement();
    }
    return sql + ")";
}

std::string BaseTable::SqlValue(const sp<SqlField>& field, std::string value) {
    if (field->GetType() != SqlFieldType::TEXT) {
        return value;
    }
    return "'" + StringUtil::EscapeSqliteChar(value) + "'";
}

std::string BaseTable::BuildInsertStatement(std::vector<std::string> names, std::vector<std::string> values) const {
    std::string nameList;
    std::string valueList;
    for (size_t i = 0; i < names.size() && i < values.size(); i++) {
        sp<SqlField> field = GetField(names[i]);
        if (field == nullptr) {
            continue;
        }
        valueList += SqlValue(field, std::move(values[i])) + ",";
        nameList += names[i] + ",";
    }
    nameList = StringUtil::TrimStr(nameList, ',');
    valueList = StringUtil::TrimStr(valueList, ',');
    if (nameList.empty()) {
        return "";
    }
    return "insert into " + tableName_ + " (" + nameList + ") " + " values ( " + valueList + ") ";
}

std::string BaseTable::BuildUpdateStatement(std::vector<std::string> names, std::vector<std::string> values) const {
    std::string pairs;
    for (size_t i = 0; i < names.size() && i < values.size(); i++) {
        sp<SqlField> field = GetField(names[i]);
        if (field == nullptr) {
            continue;
        }
        if (!pairs.empty()) {
            pairs += ", ";
        }
        pairs += names[i] + "=" + SqlValue(field, std::move(values[i]));
    }
    if (pairs.empty()) {
        return "";
    }
    return "update " + tableName_ + " set " + pairs;
}

bool SqlDatabase::Open() {
    if (path_.empty()) {
        return false;
    }
    Close();
    // Both fail harmlessly once SQLite is initialised; they matter for the first open only.
    sqlite3_config(SQLITE_CONFIG_SMALL_MALLOC, 1);
    sqlite3_soft_heap_limit64(kSoftHeapLimit);
    lastCode_ = sqlite3_open_v2(path_.c_str(), &handle_,
                                SQLITE_OPEN_READWRITE | SQLITE_OPEN_CREATE | SQLITE_OPEN_NOFOLLOW, nullptr);
    if (lastCode_ != SQLITE_OK) {
        lastError_ = sqlite3_errmsg(handle_);
        OLOGE("%s failed open db %s, %s", path_.c_str(), lastError_.c_str());
        // A failed open still allocates a handle that must be released.
        sqlite3_close(handle_);
        handle_ = nullptr;
        return false;
    }
    sqlite3_busy_timeout(handle_, kBusyTimeoutMs);
    for (const char* pragma : kPragmas) {
        if (!Execute(pragma, false)) {
            OLOGE("%s failed db %s set %s, %s", path_.c_str(), pragma, lastError_.c_str());
        }
    }
    FileUtil::ChangeMode(path_, kDbFileMode);
    return true;
}

void SqlDatabase::Close() {
    if (handle_ == nullptr) {
        return;
    }
    sqlite3_close(handle_);
    lastError_.clear();
    lastCode_ = SQLITE_OK;
    results_.clear();
    handle_ = nullptr;
}

bool SqlDatabase::Execute(const std::string& sql, bool wantRows) {
    lastError_.clear();
    results_.clear();
    if (handle_ == nullptr) {
        lastCode_ = SQLITE_MISUSE;
        return false;
    }
    OLOGD("%s start execute sql %s:%s", path_.c_str(), sql.c_str());
    char* error = nullptr;
    lastCode_ = sqlite3_exec(handle_, sql.c_str(), wantRows ? &SqlDatabase::GetExecResult : nullptr,
                             wantRows ? this : nullptr, &error);
    if (lastCode_ == SQLITE_OK) {
        return true;
    }
    if (error != nullptr) {
        lastError_ = error;
        sqlite3_free(error);
    }
    return false;
}

bool SqlDatabase::LastFailureIsCorruption() const {
    return lastCode_ == SQLITE_CORRUPT || lastCode_ == SQLITE_NOTADB;
}

bool SqlDatabase::InTransaction() const {
    return handle_ != nullptr && sqlite3_get_autocommit(handle_) == 0;
}

int64_t SqlDatabase::GetChanges() const {
    return handle_ == nullptr ? 0 : sqlite3_changes(handle_);
}

bool SqlDatabase::ExecuteSql(const std::string& sql) {
    bool ok = Execute(sql, false);
    if (!ok) {
        OLOGW_LIMITED("%s failed execute sql %s, err:%s, sql:%s", path_.c_str(), lastError_.c_str(), sql.c_str());
    }
    return ok;
}

int SqlDatabase::GetExecResult(void* context, int columnCount, char** values, char** columnNames) {
    if (context == nullptr || values == nullptr || columnNames == nullptr) {
        return 0;
    }
    auto* db = static_cast<SqlDatabase*>(context);
    const std::vector<std::string>& names = db->expectedFieldNames_;
    if (columnCount < 0 || static_cast<size_t>(columnCount) != names.size()) {
        OLOGE("%s failed result cnt=%d,expCnt=%d,", columnCount, static_cast<int>(names.size()));
        return 0;
    }
    SqlRow row;
    for (int i = 0; i < columnCount; i++) {
        row[names[i]] = values[i] != nullptr ? values[i] : "";
    }
    if (!row.empty()) {
        db->results_.push_back(std::move(row));
    }
    return 0;
}

std::vector<SqlRow> SqlDatabase::QueryRecord(const std::string& sql, const std::vector<std::string>& fieldNames) {
    if (handle_ == nullptr) {
        return results_;
    }
    expectedFieldNames_ = fieldNames;
    if (!Execute(sql, true)) {
        OLOGE_LIMITED("%s failed QueryRecord %s, err:%s, sql:%s", path_.c_str(), lastError_.c_str(), sql.c_str());
    }
    expectedFieldNames_.clear();
    return results_;
}

}  // namespace Orvane
}  // namespace android
