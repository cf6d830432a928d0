#ifndef ORVANE_STORAGE_SQL_DATABASE_H
#define ORVANE_STORAGE_SQL_DATABASE_H

#include <cstdint>
#include <map>
#include <string>
#include <vector>

#include <utils/RefBase.h>

struct sqlite3;

namespace android {
namespace Orvane {

// Column types; any other value renders no type word.
enum class SqlFieldType : int32_t {
    INTEGER = 1,
    TEXT = 2,
    REAL = 3,
};

// One row of a query: column name to its text (NULL reads as the empty string).
using SqlRow = std::map<std::string, std::string>;

// One column of a table. Immutable after construction, so any thread may read it.
class SqlField : public RefBase {
public:
    SqlField(const std::string& name, SqlFieldType type);
    SqlField(const std::string& name, SqlFieldType type, bool nullable);
    SqlField(const std::string& name, SqlFieldType type, bool primaryKey, bool autoIncrement, bool nullable);

    const std::string& GetName() const { return name_; }
    SqlFieldType GetType() const { return type_; }
    // The column's clause of a CREATE TABLE or ADD COLUMN statement.
    std::string GetFieldStatement() const;

private:
    std::string name_;
    SqlFieldType type_;
    bool primaryKey_;
    bool autoIncrement_;
    bool nullable_;
    bool hasDefault_;
    std::string defaultValue_;
};

// A named, ordered list of columns that renders its table's statements. Filled by the
// concrete table's constructor and read-only afterwards, so any thread may read it.
class BaseTable : public RefBase {
public:
    const std::string& GetTableName() const { return tableName_; }
    std::vector<std::string> GetFieldNameList() const;
    const std::vector<sp<SqlField>>& GetFields() const { return fields_; }
    sp<SqlField> GetField(const std::string& name) const;
    std::string GenerateCreateTableStatement() const;
    // Names and values are paired by position; unknown names are skipped with their values.
    std::string BuildInsertStatement(std::vector<std::string> names, std::vector<std::string> values) const;
    // Without the WHERE clause, which the caller appends.
    std::string BuildUpdateStatement(std::vector<std::string> names, std::vector<std::string> values) const;

protected:
    explicit BaseTable(const std::string& tableName) : tableName_(tableName) {}
    void AddField(const sp<SqlField>& field) { fields_.push_back(field); }

private:
    // The value as it stands in SQL: TEXT quoted and escaped, everything else verbatim.
    static std::string SqlValue(const sp<SqlField>& field, std::string value);

    std::string tableName_;
    std::vector<sp<SqlField>> fields_;
};

// One connection to one database file. No lock of its own and per-call state in the object:
// every call on one instance must come from one thread at a time (the event database's owner
// loop serialises them).
class SqlDatabase : public RefBase {
public:
    // How long a statement waits for another connection's lock (a reader such as a shell or a
    // backup) before it fails with "database is locked".
    static constexpr int kBusyTimeoutMs = 10000;

    explicit SqlDatabase(const std::string& path) : path_(path) {}

    // Opens read-write, creating the file; a path through a symbolic link is not opened.
    bool Open();
    void Close();
    bool Execute(const std::string& sql, bool wantRows);
    bool ExecuteSql(const std::string& sql);
    // Rows keyed by `fieldNames`, which must list the selected columns in SELECT order.
    std::vector<SqlRow> QueryRecord(const std::string& sql, const std::vector<std::string>& fieldNames);

    const std::string& GetPath() const { return path_; }
    const std::string& GetLastError() const { return lastError_; }
    // SQLite's result code of the last open or statement.
    int GetLastCode() const { return lastCode_; }
    // True when the last open or statement found that the file is no database or is damaged.
    bool LastFailureIsCorruption() const;
    // True between BEGIN and its COMMIT or ROLLBACK, which SQLite may do itself on a failure.
    bool InTransaction() const;
    // Rows changed by the last statement.
    int64_t GetChanges() const;
    bool IsOpen() const { return handle_ != nullptr; }

    // Row callback of sqlite3_exec; `context` is the database that runs the query.
    static int GetExecResult(void* context, int columnCount, char** values, char** columnNames);

private:
    std::vector<std::string> expectedFieldNames_;
    sqlite3* handle_ = nullptr;
    std::string path_;
    std::string lastError_;
    int lastCode_ = 0;
    std::vector<SqlRow> results_;
};

}  // namespace Orvane
}  // namespace android

#endif  // ORVANE_STORAGE_SQL_DATABASE_H
