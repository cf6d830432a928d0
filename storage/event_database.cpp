#include "storage/event_database.h"

#include <stdlib.h>

#include <algorithm>
#include <mutex>

#include "storage/event_table.h"
#include "utils/file_util.h"
#include "utils/orvane_log.h"
#include "utils/string_util.h"
#include "utils/trace.h"

namespace android {
namespace Orvane {

namespace {
// Guards the creation of the single instance, nothing else.
std::mutex g_eventDatabaseMutex;
}  // namespace

sp<EventDatabase> EventDatabase::getInstance() {
    static sp<EventDatabase> instance;
    std::lock_guard<std::mutex> lock(g_eventDatabaseMutex);
    if (instance == nullptr) {
        instance = new EventDatabase();
    }
    return instance;
}

void EventDatabase::InitDatabase(const std::string& path) {
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
    bool existed = FileUtil::FileExists(path);
    if (!database_->Open()) {
        return;
    }
    initialised_ = true;
    for (const auto& [name, table] : tables_) {
        OLOGD("%s create table %s", name.c_str());
        if (!database_->ExecuteSql(table->GenerateCreateTableStatement())) {
            return;
        }
        if (existed && !UpdateTableColumn(table)) {
            OLOGI("%s update failed");
        }
    }
}

sp<BaseTable> EventDatabase::GetTable(const std::string& name) const {
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
        OLOGE("%s database not init");
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
    return database_->ExecuteSql(sql);
}

int32_t EventDatabase::InsertAndGetID(const std::string& table, std::vector<std::string> names,
                                      std::vector<std::string> values) {
    if (!Insert(table, std::move(names), std::move(values))) {
        OLOGE("%s insert %s failed", table.c_str());
        return 0;
    }
    std::vector<SqlRow> rows =
            database_->QueryRecord("select id from " + table + " order by id desc limit 1", {kColId});
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
        OLOGE("%s database not init");
        return false;
    }
    sp<BaseTable> tbl = GetTable(table);
    if (tbl == nullptr) {
        return false;
    }
    return database_->ExecuteSql(tbl->BuildUpdateStatement(std::move(names), std::move(values)) +
                                 query.GetWhereStatement());
}

std::vector<SqlRow> EventDatabase::Query(const std::string& table, EventQuery query, int32_t limit) {
    ScopedTrace trace("DB_Query");
    if (!initialised_) {
        OLOGE("%s database not init");
        return {};
    }
    std::string sql = query.BuildQueryStatement(table, limit);
    if (sql.empty()) {
        return {};
    }
    return database_->QueryRecord(sql, query.GetSelectList());
}

bool EventDatabase::Delete(const std::string& table, EventQuery query) {
    if (!initialised_) {
        OLOGE("%s database not init");
        return false;
    }
    return database_->ExecuteSql("delete from " + table + query.GetWhereStatement());
}

bool EventDatabase::TruncateAndCreate(const std::string& table) {
    if (!initialised_ || !database_->TruncateTable(table)) {
        return false;
    }
    sp<BaseTable> tbl = GetTable(table);
    if (tbl == nullptr) {
        return false;
    }
    return database_->ExecuteSql(tbl->GenerateCreateTableStatement());
}

bool EventDatabase::UpdateTableColumn(const sp<BaseTable>& table) {
    if (database_ == nullptr || table == nullptr) {
        return false;
    }
    const std::string& name = table->GetTableName();
    std::vector<SqlRow> existing =
            database_->QueryRecord("select name from pragma_table_info('" + name + "')", {"name"});
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
        bool alterOk = database_->ExecuteSql("ALTER TABLE " + name + " ADD COLUMN " + field->GetFieldStatement());
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
        OLOGE("%s database not init");
        return false;
    }
    return database_->ExecuteSql("VACUUM");
}

int64_t EventDatabase::GetLiveSize() {
    if (!initialised_) {
        OLOGE("%s database not init");
        return -1;
    }
    std::vector<SqlRow> rows = database_->QueryRecord(
            "select (page_count - freelist_count) * page_size from pragma_page_count, pragma_freelist_count, "
            "pragma_page_size",
            {"size"});
    return rows.empty() ? -1 : strtoll(rows[0]["size"].c_str(), nullptr, 10);
}

void EventDatabase::Close() {
    if (database_ == nullptr) {
        return;
    }
    OLOGI("%s event data base closed");
    initialised_ = false;
    database_->Close();
    database_ = nullptr;
    tables_.clear();
}

}  // namespace Orvane
}  // namespace android
