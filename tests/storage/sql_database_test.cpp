#include "storage/sql_database.h"

#include <gtest/gtest.h>
#include <sys/stat.h>

#include <fstream>
#include <sstream>

#include "storage/event_table.h"
#include "tests/common/log_capture.h"
#include "tests/storage/faulty_vfs.h"
#include "tests/storage/storage_test_util.h"

namespace android {
namespace Orvane {
namespace {

class TwoColumnTable : public BaseTable {
public:
    TwoColumnTable() : BaseTable("t") {
        AddField(new SqlField("a", SqlFieldType::INTEGER, false));
        AddField(new SqlField("b", SqlFieldType::TEXT));
    }
};

class EmptyTable : public BaseTable {
public:
    EmptyTable() : BaseTable("empty") {}
};

std::string ReadFile(const std::string& path) {
    std::ifstream in(path, std::ios::binary);
    std::stringstream content;
    content << in.rdbuf();
    return content.str();
}

std::string IntegrityOf(const sp<SqlDatabase>& db) {
    auto rows = db->QueryRecord("PRAGMA integrity_check", {"integrity_check"});
    return rows.empty() ? "no answer: " + db->GetLastError() : rows[0]["integrity_check"];
}

size_t CountRows(const sp<SqlDatabase>& db, const std::string& table) {
    auto rows = db->QueryRecord("select count(*) from " + table, {"n"});
    return rows.empty() ? 0 : std::stoul(rows[0]["n"]);
}

std::string Clause(const sp<SqlField>& field) {
    return field->GetFieldStatement();
}

TEST(SqlFieldTest, ClausesAndCreateStatement) {
    EXPECT_EQ(Clause(new SqlField("id", SqlFieldType::INTEGER, true, true, false)),
              "id INTEGER NOT NULL PRIMARY KEY AUTOINCREMENT");
    EXPECT_EQ(Clause(new SqlField("r", SqlFieldType::REAL)), "r REAL");
    EXPECT_EQ(Clause(new SqlField("s", SqlFieldType::TEXT, false)), "s TEXT NOT NULL");
    // An unknown type leaves the clause ending in the blank.
    EXPECT_EQ(Clause(new SqlField("u", static_cast<SqlFieldType>(9))), "u ");
    EXPECT_EQ(Clause(new SqlField("p", SqlFieldType::INTEGER, true, false, true)), "p INTEGER PRIMARY KEY");

    sp<BaseTable> table = new TwoColumnTable();
    EXPECT_EQ(table->GenerateCreateTableStatement(), "create table IF NOT EXISTS t(a INTEGER NOT NULL,b TEXT)");
    EXPECT_EQ(table->GetFieldNameList(), (std::vector<std::string>{"a", "b"}));
    ASSERT_NE(table->GetField("b"), nullptr);
    EXPECT_EQ(table->GetField("b")->GetType(), SqlFieldType::TEXT);
    EXPECT_EQ(table->GetField("B"), nullptr);
    EXPECT_EQ(sp<BaseTable>(new EmptyTable())->GenerateCreateTableStatement(), "");
}

TEST(BaseTableTest, InsertAndUpdateTexts) {
    sp<BaseTable> raw = new RawEventTable();
    EXPECT_EQ(raw->BuildInsertStatement({"event_id", "extra_data"}, {"7", "a'b"}),
              "insert into raw_events (event_id,extra_data)  values ( 7,'a''b') ");
    // Unknown names are skipped together with their values; INTEGER values stay verbatim.
    EXPECT_EQ(raw->BuildInsertStatement({"nope", "event_id", "param_list"}, {"x", "it's", "it's"}),
              "insert into raw_events (event_id,param_list)  values ( it's,'it''s') ");
    EXPECT_EQ(raw->BuildInsertStatement({"nope"}, {"1"}), "");
    EXPECT_EQ(raw->BuildInsertStatement({}, {}), "");
    // Extra values beyond the names are ignored.
    EXPECT_EQ(raw->BuildInsertStatement({"timestamp"}, {"5", "6"}),
              "insert into raw_events (timestamp)  values ( 5) ");

    EXPECT_EQ(raw->BuildUpdateStatement({"event_id", "nope", "extra_data"}, {"7", "z", "it's"}),
              "update raw_events set event_id=7, extra_data='it''s'");
    EXPECT_EQ(raw->BuildUpdateStatement({"nope"}, {"7"}), "");
    EXPECT_EQ(raw->BuildUpdateStatement({}, {}), "");
}

TEST(SqlDatabaseTest, OpenCloseAndExecute) {
    TempDir dir;
    LogCapture log;
    sp<SqlDatabase> noPath = new SqlDatabase("");
    EXPECT_FALSE(noPath->Open());
    EXPECT_FALSE(log.Contains(ANDROID_LOG_ERROR, "failed open db"));

    sp<SqlDatabase> missingFolder = new SqlDatabase(dir.File("no/such/folder/x.db"));
    EXPECT_FALSE(missingFolder->Open());
    EXPECT_TRUE(log.Contains(ANDROID_LOG_ERROR, "Open failed open db " + dir.File("no/such/folder/x.db")));
    EXPECT_FALSE(missingFolder->IsOpen());

    std::string path = dir.File("t.db");
    sp<SqlDatabase> db = new SqlDatabase(path);
    EXPECT_FALSE(db->Execute("select 1", false));  // no connection yet
    ASSERT_TRUE(db->Open());
    struct stat st {};
    ASSERT_EQ(stat(path.c_str(), &st), 0);
    EXPECT_EQ(st.st_mode & 0777, 0640u);
    auto pragma = db->QueryRecord("PRAGMA cache_size", {"cache_size"});
    ASSERT_EQ(pragma.size(), 1u);
    EXPECT_EQ(pragma[0]["cache_size"], "10");
    pragma = db->QueryRecord("PRAGMA synchronous", {"synchronous"});
    ASSERT_EQ(pragma.size(), 1u);
    EXPECT_EQ(pragma[0]["synchronous"], "1");

    EXPECT_FALSE(db->ExecuteSql("select * from nowhere"));
    EXPECT_NE(db->GetLastError().find("no such table"), std::string::npos);
    EXPECT_TRUE(log.Contains(ANDROID_LOG_WARN, "ExecuteSql failed execute sql " + path +
                                                   ", err:no such table: nowhere, sql:select * from nowhere"));
    // The last error is cleared by the next statement.
    EXPECT_TRUE(db->ExecuteSql("create table t(a INTEGER NOT NULL,b TEXT)"));
    EXPECT_EQ(db->GetLastError(), "");

    // Reopening an open database keeps working on the same file.
    EXPECT_TRUE(db->ExecuteSql("insert into t (a,b) values (1,'x')"));
    ASSERT_TRUE(db->Open());
    EXPECT_EQ(CountRows(db, "t"), 1u);
    db->Close();
    EXPECT_FALSE(db->IsOpen());
    EXPECT_TRUE(db->QueryRecord("select a from t", {"a"}).empty());
    db->Close();  // twice is harmless
}

TEST(SqlDatabaseTest, QueryRecordKeysRowsByExpectedNames) {
    TempDir dir;
    sp<SqlDatabase> db = new SqlDatabase(dir.File("q.db"));
    ASSERT_TRUE(db->Open());
    ASSERT_TRUE(db->ExecuteSql("create table t(a INTEGER, b TEXT, c TEXT)"));
    ASSERT_TRUE(db->ExecuteSql("insert into t values (1, NULL, 'x'), (2, 'y', NULL), (3, '', 'z')"));

    LogCapture log;
    // Three columns against two names: every row is dropped with its own line, none kept.
    EXPECT_TRUE(db->QueryRecord("select a,b,c from t", {"a", "b"}).empty());
    EXPECT_EQ(log.Count(ANDROID_LOG_ERROR, "GetExecResult failed result cnt=3,expCnt=2,"), 3u);

    // Rows are keyed by the given names, not by SQLite's; NULL reads as "".
    auto rows = db->QueryRecord("select a,b from t order by a", {"first", "second"});
    ASSERT_EQ(rows.size(), 3u);
    EXPECT_EQ(rows[0], (SqlRow{{"first", "1"}, {"second", ""}}));
    EXPECT_EQ(rows[1], (SqlRow{{"first", "2"}, {"second", "y"}}));
    // A repeated name keeps the later column.
    rows = db->QueryRecord("select a,c from t order by a limit 1", {"k", "k"});
    ASSERT_EQ(rows.size(), 1u);
    EXPECT_EQ(rows[0], (SqlRow{{"k", "x"}}));

    log.Clear();
    EXPECT_TRUE(db->QueryRecord("select a from missing", {"a"}).empty());
    EXPECT_TRUE(log.Contains(ANDROID_LOG_ERROR, "QueryRecord failed QueryRecord " + dir.File("q.db") +
                                                    ", err:no such table: missing, sql:select a from missing"));
    // The callback ignores calls without a database or without data.
    char* value = nullptr;
    EXPECT_EQ(SqlDatabase::GetExecResult(nullptr, 1, &value, &value), 0);
    db->Close();  // the destructor leaves closing to the owner
}

TEST(SqlDatabaseTest, TruncateTableRestartsIds) {
    TempDir dir;
    sp<SqlDatabase> db = new SqlDatabase(dir.File("t.db"));
    ASSERT_TRUE(db->Open());
    sp<BaseTable> raw = new RawEventTable();
    ASSERT_TRUE(db->ExecuteSql(raw->GenerateCreateTableStatement()));
    for (int i = 0; i < 3; i++) {
        ASSERT_TRUE(db->ExecuteSql(raw->BuildInsertStatement({"event_id", "timestamp"}, {"1", "2"})));
    }
    ASSERT_TRUE(db->TruncateTable("raw_events"));
    EXPECT_EQ(CountRows(db, "raw_events"), 0u);
    ASSERT_TRUE(db->ExecuteSql(raw->BuildInsertStatement({"event_id", "timestamp"}, {"1", "2"})));
    auto rows = db->QueryRecord("select id from raw_events", {"id"});
    ASSERT_EQ(rows.size(), 1u);
    EXPECT_EQ(rows[0]["id"], "1");

    LogCapture log;
    EXPECT_FALSE(db->TruncateTable("missing"));
    EXPECT_TRUE(log.Contains(ANDROID_LOG_WARN, "TruncateTable failed truncate table " + dir.File("t.db") +
                                                   ":missing, no such table: missing"))
        << log.Dump();
    db->Close();
    EXPECT_FALSE(db->TruncateTable("raw_events"));
}

TEST(SqlDatabaseTest, HostileTextsRoundTripByteExact) {
    TempDir dir;
    sp<SqlDatabase> db = new SqlDatabase(dir.File("h.db"));
    ASSERT_TRUE(db->Open());
    sp<BaseTable> raw = new RawEventTable();
    ASSERT_TRUE(db->ExecuteSql(raw->GenerateCreateTableStatement()));
    std::string megabyte(1 << 20, 'q');
    for (size_t i = 0; i < megabyte.size(); i += 997) {
        megabyte[i] = "'%;\"\\"[i % 5];
    }
    const std::vector<std::string> texts = {
        "it's",
        "''''",
        "100% sure_%",
        "a; b; c;",
        "'; drop table event_info; --",
        "x'); delete from raw_events; insert into raw_events (event_id) values ('",
        "\xff\xfe\xc3\x28 invalid \xe2\x82",
        "line\nbreak\ttab\r",
        "",
        megabyte,
    };
    for (const auto& text : texts) {
        ASSERT_TRUE(db->ExecuteSql(raw->BuildInsertStatement({"event_id", "timestamp", "param_list"},
                                                           {"1", "2", text})));
    }
    auto rows = db->QueryRecord("select param_list from raw_events order by id", {"param_list"});
    ASSERT_EQ(rows.size(), texts.size());
    for (size_t i = 0; i < texts.size(); i++) {
        EXPECT_EQ(rows[i]["param_list"], texts[i]) << "text " << i;
    }
    EXPECT_EQ(IntegrityOf(db), "ok");
    db->Close();
}

TEST(SqlDatabaseTest, FileThatIsNotADatabaseIsLeftAlone) {
    TempDir dir;
    std::string path = dir.File("garbage.db");
    std::string garbage(8192, '\x5a');
    garbage.replace(0, 19, "this is no database");
    {
        std::ofstream out(path, std::ios::binary);
        out << garbage;
    }
    LogCapture log;
    sp<SqlDatabase> db = new SqlDatabase(path);
    db->Open();  // SQLite reads the header lazily, so the open itself may still succeed
    EXPECT_FALSE(db->ExecuteSql("create table t(a INTEGER)"));
    EXPECT_NE(db->GetLastError().find("not a database"), std::string::npos) << db->GetLastError();
    EXPECT_TRUE(db->QueryRecord("select a from t", {"a"}).empty());
    db->Close();
    EXPECT_EQ(ReadFile(path), garbage);
}

class FaultyDiskTest : public ::testing::Test {
protected:
    void SetUp() override { FaultyVfs::Install(); }
    void TearDown() override { FaultyVfs::Heal(); }

    // A database with `count` committed rows of about 1 KiB each.
    void Fill(const sp<SqlDatabase>& db, int count) {
        ASSERT_TRUE(db->ExecuteSql(raw_->GenerateCreateTableStatement()));
        for (int i = 0; i < count; i++) {
            ASSERT_TRUE(InsertRow(db, i));
        }
    }
    bool InsertRow(const sp<SqlDatabase>& db, int i) {
        return db->ExecuteSql(raw_->BuildInsertStatement({"event_id", "timestamp", "param_list"},
                                                       {std::to_string(i), "0", std::string(1024, 'a' + i % 26)}));
    }
    sp<BaseTable> raw_ = new RawEventTable();
};

TEST_F(FaultyDiskTest, ReadOnlyFileFailsWritesAndKeepsRows) {
    TempDir dir;
    std::string path = dir.File("ro.db");
    sp<SqlDatabase> db = new SqlDatabase(path);
    ASSERT_TRUE(db->Open());
    Fill(db, 5);
    db->Close();

    FaultyVfs::g_readOnly = true;
    LogCapture log;
    ASSERT_TRUE(db->Open());
    EXPECT_FALSE(InsertRow(db, 99));
    EXPECT_NE(db->GetLastError().find("readonly"), std::string::npos) << db->GetLastError();
    EXPECT_TRUE(log.Contains(ANDROID_LOG_WARN, "ExecuteSql failed execute sql " + path));
    EXPECT_FALSE(db->TruncateTable("raw_events"));
    EXPECT_EQ(CountRows(db, "raw_events"), 5u);
    db->Close();

    FaultyVfs::Heal();
    ASSERT_TRUE(db->Open());
    EXPECT_EQ(IntegrityOf(db), "ok");
    EXPECT_EQ(CountRows(db, "raw_events"), 5u);
    db->Close();
}

TEST_F(FaultyDiskTest, FullDiskLosesNoCommittedRow) {
    TempDir dir;
    std::string path = dir.File("full.db");
    sp<SqlDatabase> db = new SqlDatabase(path);
    ASSERT_TRUE(db->Open());
    Fill(db, 10);

    // Each insert writes journal and database pages; the budget runs out within a few rows,
    // sometimes in the middle of a commit.
    FaultyVfs::g_writeBudget = 40000;
    int committed = 10;
    int failures = 0;
    for (int i = 10; i < 60; i++) {
        if (InsertRow(db, i)) {
            committed++;
        } else {
            failures++;
        }
    }
    EXPECT_GT(failures, 0);
    EXPECT_LT(committed, 60);
    db->Close();

    FaultyVfs::Heal();
    ASSERT_TRUE(db->Open());
    EXPECT_EQ(IntegrityOf(db), "ok");
    EXPECT_EQ(CountRows(db, "raw_events"), static_cast<size_t>(committed));
    // Once space is back, writing goes on.
    EXPECT_TRUE(InsertRow(db, 60));
    EXPECT_EQ(CountRows(db, "raw_events"), static_cast<size_t>(committed + 1));
    db->Close();
}

}  // namespace
}  // namespace Orvane
}  // namespace android
