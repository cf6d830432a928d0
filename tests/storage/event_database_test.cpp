#include "storage/event_database.h"

#include <gtest/gtest.h>

#include "storage/event_table.h"
#include "tests/common/log_capture.h"
#include "tests/storage/storage_test_util.h"

namespace android {
namespace Orvane {
namespace {

// Runs raw SQL on a file outside the code under test, to prepare and inspect it.
std::vector<SqlRow> Raw(const std::string& path, const std::string& sql, const std::vector<std::string>& names) {
    sp<SqlDatabase> db = new SqlDatabase(path);
    EXPECT_TRUE(db->Open());
    std::vector<SqlRow> rows = db->QueryRecord(sql, names);
    EXPECT_EQ(db->GetLastError(), "") << sql;
    db->Close();
    return rows;
}

std::vector<std::string> ColumnsOf(const std::string& path, const std::string& table) {
    std::vector<std::string> names;
    for (auto& row : Raw(path, "select name from pragma_table_info('" + table + "')", {"name"})) {
        names.push_back(row["name"]);
    }
    return names;
}

class EventDatabaseTest : public ::testing::Test {
protected:
    void TearDown() override { db_->Close(); }

    TempDir dir_;
    std::string path_ = dir_.File("event.db");
    sp<EventDatabase> db_ = new EventDatabase();
};

TEST_F(EventDatabaseTest, SingleInstance) {
    EXPECT_EQ(EventDatabase::getInstance().get(), EventDatabase::getInstance().get());
    EXPECT_NE(EventDatabase::getInstance(), nullptr);
}

TEST_F(EventDatabaseTest, FreshFileGetsSixTablesInNameOrder) {
    LogCapture log;
    db_->InitDatabase(path_);
    ASSERT_TRUE(db_->IsInitialised());
    const std::vector<std::pair<std::string, std::string>> expected = {
        {"db_version",
         "create table IF NOT EXISTS db_version(id INTEGER NOT NULL PRIMARY KEY AUTOINCREMENT,db_version INTEGER NOT "
         "NULL,dev_version TEXT NOT NULL,start_time INTEGER NOT NULL,activate_time INTEGER)"},
        {"event_daily",
         "create table IF NOT EXISTS event_daily(id INTEGER NOT NULL PRIMARY KEY AUTOINCREMENT,event_id INTEGER NOT "
         "NULL,daily_cnt INTEGER NOT NULL,over_cnt INTEGER NOT NULL,hour_cnt INTEGER NOT NULL,next_expire_time "
         "INTEGER,last_happen_time INTEGER,last_log_time INTEGER)"},
        {"event_info",
         "create table IF NOT EXISTS event_info(id INTEGER NOT NULL PRIMARY KEY AUTOINCREMENT,event_id INTEGER NOT "
         "NULL,trace_id TEXT,pspan_id TEXT,span_id TEXT,version_id INTEGER NOT NULL,occured_cnt INTEGER,first_time "
         "INTEGER,param_list TEXT,expire INTEGER,visible INTEGER)"},
        {"raw_events",
         "create table IF NOT EXISTS raw_events(id INTEGER NOT NULL PRIMARY KEY AUTOINCREMENT,event_id INTEGER NOT "
         "NULL,extra_data TEXT,timestamp INTEGER NOT NULL,param_list TEXT)"},
        {"upload",
         "create table IF NOT EXISTS upload(id INTEGER NOT NULL PRIMARY KEY AUTOINCREMENT,year INTEGER NOT NULL,m1 "
         "TEXT,m2 TEXT,m3 TEXT,m4 TEXT,m5 TEXT,M6 TEXT,M7 TEXT,M8 TEXT,m9 TEXT,m10 TEXT,m11 TEXT,m12 TEXT)"},
        {"version",
         "create table IF NOT EXISTS version(id INTEGER NOT NULL PRIMARY KEY AUTOINCREMENT,version TEXT NOT NULL)"},
    };
    std::vector<std::string> created;
    for (const auto& line : log.Lines()) {
        if (line.message.rfind("InitDatabase create table ", 0) == 0) {
            created.push_back(line.message.substr(26));
        }
    }
    std::vector<std::string> names;
    for (const auto& [name, statement] : expected) {
        names.push_back(name);
        ASSERT_NE(db_->GetTable(name), nullptr) << name;
        EXPECT_EQ(db_->GetTable(name)->GenerateCreateTableStatement(), statement);
        EXPECT_TRUE(log.Contains(ANDROID_LOG_DEBUG, statement)) << "not run: " << statement;
    }
    EXPECT_EQ(created, names);
    EXPECT_EQ(db_->GetTable("nothing"), nullptr);
    // A fresh file is not upgraded.
    EXPECT_FALSE(log.Contains(ANDROID_LOG_DEBUG, "pragma_table_info"));
    db_->Close();
    EXPECT_EQ(ColumnsOf(path_, "upload"), (std::vector<std::string>{"id", "year", "m1", "m2", "m3", "m4", "m5", "M6",
                                                                     "M7", "M8", "m9", "m10", "m11", "m12"}));
    EXPECT_EQ(ColumnsOf(path_, "raw_events"),
              (std::vector<std::string>{"id", "event_id", "extra_data", "timestamp", "param_list"}));

    LogCapture again;
    db_->InitDatabase(path_);
    db_->InitDatabase(path_);
    EXPECT_EQ(again.Count(ANDROID_LOG_WARN, "InitDatabase init data base already init"), 1u);
    EXPECT_EQ(again.Count(ANDROID_LOG_INFO, "Add column"), 0u);
}

TEST_F(EventDatabaseTest, OldFileIsUpgradedOnce) {
    Raw(path_,
        "create table event_daily(id INTEGER NOT NULL PRIMARY KEY AUTOINCREMENT,event_id INTEGER NOT NULL,"
        "daily_cnt INTEGER NOT NULL,over_cnt INTEGER NOT NULL,hour_cnt INTEGER NOT NULL,next_expire_time INTEGER,"
        "last_happen_time INTEGER);"
        "create table db_version(id INTEGER NOT NULL PRIMARY KEY AUTOINCREMENT,db_version INTEGER NOT NULL,"
        "dev_version TEXT NOT NULL,start_time INTEGER NOT NULL,activate_time INTEGER);"
        "insert into db_version (db_version,dev_version,start_time) values (3,'v1',100),(5,'v2',200);"
        "insert into event_daily (event_id,daily_cnt,over_cnt,hour_cnt) values (9,1,0,1);"
        // An old event_info without a NOT NULL column that cannot be added to a table with rows.
        "create table event_info(id INTEGER NOT NULL PRIMARY KEY AUTOINCREMENT,event_id INTEGER NOT NULL);"
        "insert into event_info (event_id) values (1);",
        {});
    LogCapture log;
    db_->InitDatabase(path_);
    ASSERT_TRUE(db_->IsInitialised());
    EXPECT_TRUE(log.Contains(ANDROID_LOG_INFO, "UpdateTableColumn Add column last_log_time"));
    EXPECT_TRUE(log.Contains(ANDROID_LOG_DEBUG, ":ALTER TABLE event_daily ADD COLUMN last_log_time INTEGER"));
    EXPECT_TRUE(log.Contains(ANDROID_LOG_INFO, "UpdateTableColumn query db_version ret=1"));
    // The failed event_info upgrade is logged and the remaining tables are still made.
    EXPECT_TRUE(log.Contains(ANDROID_LOG_INFO, "UpdateTableColumn Add column version_id"));
    EXPECT_EQ(log.Count(ANDROID_LOG_INFO, "InitDatabase update failed"), 1u);
    db_->Close();

    auto revisions = Raw(path_, "select db_version from db_version order by id", {"v"});
    ASSERT_EQ(revisions.size(), 2u);
    EXPECT_EQ(revisions[0]["v"], "3");
    EXPECT_EQ(revisions[1]["v"], "7");  // raised once for each of the two upgraded tables
    EXPECT_EQ(ColumnsOf(path_, "event_daily").back(), "last_log_time");
    EXPECT_EQ(ColumnsOf(path_, "version"), (std::vector<std::string>{"id", "version"}));
    auto kept = Raw(path_, "select event_id from event_daily", {"e"});
    ASSERT_EQ(kept.size(), 1u);
    EXPECT_EQ(kept[0]["e"], "9");

    // Nothing is missing the second time, except what SQLite refuses to add.
    LogCapture second;
    db_->InitDatabase(path_);
    EXPECT_FALSE(second.Contains(ANDROID_LOG_INFO, "Add column last_log_time"));
    db_->Close();
    revisions = Raw(path_, "select db_version from db_version order by id desc limit 1", {"v"});
    EXPECT_TRUE(second.Contains(ANDROID_LOG_INFO, "UpdateTableColumn Add column version_id"));
    EXPECT_EQ(revisions[0]["v"], "8");  // only the repeated event_info attempt raised it
}

TEST_F(EventDatabaseTest, FailedCreateStopsTheRemainingTables) {
    Raw(path_, "create table x(a INTEGER); create index event_info on x(a);", {});
    LogCapture log;
    db_->InitDatabase(path_);
    EXPECT_TRUE(db_->IsInitialised());
    EXPECT_TRUE(log.Contains(ANDROID_LOG_WARN, "already an index named event_info"));
    EXPECT_FALSE(log.Contains(ANDROID_LOG_DEBUG, "InitDatabase create table raw_events"));
    // The tables made before the failure are usable.
    EXPECT_EQ(db_->InsertAndGetID(TBL_EVENT_DAILY, {COL_EVENT_ID, COL_DAILY_CNT, COL_OVER_CNT, COL_HOUR_CNT},
                                  {"1", "1", "0", "1"}),
              1);
    db_->Close();
    EXPECT_TRUE(ColumnsOf(path_, "version").empty());
}

TEST_F(EventDatabaseTest, OperationsCheckTheirInput) {
    LogCapture log;
    EXPECT_FALSE(db_->Insert(TBL_RAW_EVENTS, {COL_EVENT_ID}, {"1"}));
    EXPECT_TRUE(log.Contains(ANDROID_LOG_ERROR, "Insert database not init"));
    EXPECT_FALSE(db_->Update(TBL_RAW_EVENTS, {COL_EVENT_ID}, {"1"}, EventQuery()));
    EXPECT_TRUE(log.Contains(ANDROID_LOG_ERROR, "Update database not init"));
    EXPECT_TRUE(db_->Query(TBL_RAW_EVENTS, EventQuery().Select({COL_ID}), -1).empty());
    EXPECT_TRUE(log.Contains(ANDROID_LOG_ERROR, "Query database not init"));
    EXPECT_FALSE(db_->Delete(TBL_RAW_EVENTS, EventQuery()));
    EXPECT_TRUE(log.Contains(ANDROID_LOG_ERROR, "Delete database not init"));
    EXPECT_EQ(db_->InsertAndGetID(TBL_RAW_EVENTS, {COL_EVENT_ID}, {"1"}), 0);
    EXPECT_TRUE(log.Contains(ANDROID_LOG_ERROR, "InsertAndGetID insert raw_events failed"));
    EXPECT_FALSE(db_->TruncateAndCreate(TBL_RAW_EVENTS));

    db_->InitDatabase(path_);
    log.Clear();
    EXPECT_FALSE(db_->Insert(TBL_RAW_EVENTS, {COL_EVENT_ID, COL_TIMESTAMP}, {"1"}));
    EXPECT_FALSE(db_->Update(TBL_RAW_EVENTS, {}, {}, EventQuery()));
    EXPECT_EQ(log.Count(ANDROID_LOG_ERROR, "names must not empty, and names size must equal values's"), 2u);
    EXPECT_TRUE(log.Contains(ANDROID_LOG_ERROR, "Insert names must not empty"));
    EXPECT_TRUE(log.Contains(ANDROID_LOG_ERROR, "Update names must not empty"));
    EXPECT_FALSE(db_->Insert("nowhere", {COL_EVENT_ID}, {"1"}));
    EXPECT_TRUE(log.Contains(ANDROID_LOG_ERROR, "Insert get tbl nowhere failed"));
    EXPECT_FALSE(db_->Insert(TBL_RAW_EVENTS, {"bogus"}, {"1"}));
    EXPECT_TRUE(log.Contains(ANDROID_LOG_ERROR, "Insert generate sql failed"));
    EXPECT_FALSE(db_->Update("nowhere", {COL_EVENT_ID}, {"1"}, EventQuery()));
    EXPECT_FALSE(log.Contains(ANDROID_LOG_DEBUG, "start execute sql"));  // none of these reached SQLite

    // Query and Delete do not consult the registry: SQLite answers.
    EXPECT_TRUE(db_->Query("nowhere", EventQuery().Select({COL_ID}), 1).empty());
    EXPECT_TRUE(log.Contains(ANDROID_LOG_ERROR, "no such table: nowhere, sql:select id from nowhere limit 1"));
    EXPECT_FALSE(db_->Delete("nowhere", EventQuery().And(COL_ID, EventQuery::EQ, int64_t{1})));
    EXPECT_TRUE(log.Contains(ANDROID_LOG_WARN, "sql:delete from nowhere  where id = '1'"));
    EXPECT_TRUE(db_->Query(TBL_RAW_EVENTS, EventQuery(), 1).empty());
}

TEST_F(EventDatabaseTest, RowsInsertUpdateQueryDelete) {
    db_->InitDatabase(path_);
    const std::vector<std::string> cols = {COL_EVENT_ID, COL_TIMESTAMP, COL_PARAM_LIST};
    EXPECT_EQ(db_->InsertAndGetID(TBL_RAW_EVENTS, cols, {"100", "1", "'; drop table event_info; --"}), 1);
    EXPECT_EQ(db_->InsertAndGetID(TBL_RAW_EVENTS, cols, {"101", "2", "50% of a;b"}), 2);
    EXPECT_EQ(db_->InsertAndGetID(TBL_RAW_EVENTS, cols, {"102", "3", "x"}), 3);

    EventQuery byParam;
    byParam.Select({COL_ID, COL_EVENT_ID}).And(COL_PARAM_LIST, EventQuery::EQ, "'; drop table event_info; --");
    auto rows = db_->Query(TBL_RAW_EVENTS, byParam, -1);
    ASSERT_EQ(rows.size(), 1u);
    EXPECT_EQ(rows[0], (SqlRow{{COL_ID, "1"}, {COL_EVENT_ID, "100"}}));
    EXPECT_FALSE(ColumnsOf(path_, TBL_EVENT_INFO).empty());

    EventQuery like;
    like.Select({COL_EVENT_ID}).And(COL_PARAM_LIST, EventQuery::LIKE, "a;b").Order(COL_ID, false);
    rows = db_->Query(TBL_RAW_EVENTS, like, -1);
    ASSERT_EQ(rows.size(), 1u);
    EXPECT_EQ(rows[0][COL_EVENT_ID], "101");
    // A percent sign in a value stays a wildcard: contains "%" matches every text.
    EXPECT_EQ(db_->Query(TBL_RAW_EVENTS, EventQuery(like).Clear().Select({COL_ID}).And(COL_PARAM_LIST, EventQuery::LIKE, "%"), -1).size(), 3u);

    // An update without conditions rewrites every row.
    EXPECT_TRUE(db_->Update(TBL_RAW_EVENTS, {COL_EXTRA_DATA}, {"it's"}, EventQuery()));
    EventQuery all;
    all.Select({COL_EXTRA_DATA}).Order(COL_ID, true);
    rows = db_->Query(TBL_RAW_EVENTS, all, -1);
    ASSERT_EQ(rows.size(), 3u);
    for (auto& row : rows) {
        EXPECT_EQ(row[COL_EXTRA_DATA], "it's");
    }
    EXPECT_TRUE(db_->Update(TBL_RAW_EVENTS, {COL_EXTRA_DATA}, {"two"},
                            EventQuery().And(COL_ID, EventQuery::EQ, int64_t{2})));
    EXPECT_EQ(db_->Query(TBL_RAW_EVENTS, all, 0).size(), 0u);
    EXPECT_EQ(db_->Query(TBL_RAW_EVENTS, all, -1)[1][COL_EXTRA_DATA], "two");

    EXPECT_TRUE(db_->Delete(TBL_RAW_EVENTS, EventQuery().And(COL_EVENT_ID, EventQuery::GE, int64_t{102})));
    EXPECT_EQ(db_->Query(TBL_RAW_EVENTS, all, -1).size(), 2u);
    EXPECT_EQ(db_->InsertAndGetID(TBL_RAW_EVENTS, cols, {"103", "4", ""}), 4);

    ASSERT_TRUE(db_->TruncateAndCreate(TBL_RAW_EVENTS));
    EXPECT_TRUE(db_->Query(TBL_RAW_EVENTS, all, -1).empty());
    EXPECT_EQ(db_->InsertAndGetID(TBL_RAW_EVENTS, cols, {"104", "5", ""}), 1);
    EXPECT_FALSE(db_->TruncateAndCreate("nowhere"));

    EXPECT_TRUE(db_->Delete(TBL_RAW_EVENTS, EventQuery()));
    EXPECT_TRUE(db_->Query(TBL_RAW_EVENTS, all, -1).empty());

    LogCapture log;
    db_->Close();
    EXPECT_TRUE(log.Contains(ANDROID_LOG_INFO, "Close event data base closed"));
    EXPECT_FALSE(db_->IsInitialised());
    EXPECT_EQ(db_->GetTable(TBL_RAW_EVENTS), nullptr);
    // Reopening starts over and finds the stored rows.
    db_->InitDatabase(path_);
    EXPECT_EQ(db_->InsertAndGetID(TBL_RAW_EVENTS, cols, {"105", "6", ""}), 2);
}

}  // namespace
}  // namespace Orvane
}  // namespace android
