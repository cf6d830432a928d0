// The SQL layer: statement and query texts, the schema of a file and its upgrade, and files that
// are hostile, broken, read-only or full.

#include "storage/sql_database.h"

#include <dirent.h>
#include <sqlite3.h>
#include <unistd.h>

#include <atomic>
#include <filesystem>
#include <thread>

#include <gtest/gtest.h>

#include "storage/event_database.h"
#include "storage/event_database_helper.h"
#include "storage/event_query.h"
#include "storage/event_table.h"
#include "tests/common/fake_plugin_context.h"
#include "tests/common/log_capture.h"
#include "tests/storage/storage_test_util.h"
#include "utils/time_util.h"

namespace android::Orvane {

// An SQLite file system that wraps the platform's and can pretend that the disk is full (every
// write fails with SQLITE_FULL once a byte budget is spent) or that every database file it opens
// is read-only. Installed as the default, so the code under test opens files as usual.
struct FaultyVfs {
    static inline std::atomic<int64_t> writeBudget{-1};  // bytes still writable; -1 means unlimited
    static inline std::atomic<bool> readOnly{false};
    static inline std::atomic<int> failWrites{0};  // writes that fail before the disk has room again
    static inline sqlite3_vfs *real = nullptr, vfs;
    // The platform gives the database, its journal and its write-ahead log methods of their own;
    // each gets a copy whose writes go through Write.
    static inline const sqlite3_io_methods* realIo[4] = {};
    static inline sqlite3_io_methods io[4];

    static int Write(sqlite3_file* file, const void* buffer, int size, sqlite3_int64 offset) {
        if (failWrites > 0 && failWrites-- > 0)
            return SQLITE_FULL;
        int64_t budget = writeBudget.load();
        if (budget >= 0)
            writeBudget = budget < size ? 0 : budget - size;
        if (budget >= 0 && budget < size)
            return SQLITE_FULL;
        for (size_t i = 0; i < std::size(io); i++)
            if (file->pMethods == &io[i])
                return realIo[i]->xWrite(file, buffer, size, offset);
        return SQLITE_IOERR_WRITE;
    }
    // Opens with the platform's file system, then sends the file's writes through Write.
    static int Open(sqlite3_vfs*, sqlite3_filename name, sqlite3_file* file, int flags, int* outFlags) {
        if (readOnly && (flags & SQLITE_OPEN_MAIN_DB) != 0)
            flags = (flags & ~(SQLITE_OPEN_READWRITE | SQLITE_OPEN_CREATE)) | SQLITE_OPEN_READONLY;
        int rc = real->xOpen(real, name, file, flags, outFlags);
        for (size_t i = 0; rc == SQLITE_OK && file->pMethods != nullptr && i < std::size(io); i++) {
            if (realIo[i] == nullptr)
                io[i] = *(realIo[i] = file->pMethods), io[i].xWrite = Write;
            if (file->pMethods == realIo[i]) {
                file->pMethods = &io[i];
                break;
            }
        }
        return rc;
    }
    // Makes the faulty file system the default one; idempotent.
    static void Install() {
        if (real == nullptr) {
            sqlite3_initialize();
            vfs = *(real = sqlite3_vfs_find(nullptr));
            vfs.pNext = nullptr;
            vfs.zName = "faulty";
            vfs.xOpen = Open;
            sqlite3_vfs_register(&vfs, 1);
        }
    }
    // Restores a healthy disk.
    static void Heal() { writeBudget = -1, readOnly = false, failWrites = 0; }
};

TEST(EventTableTest, StatementTexts) {
    const auto create = [](BaseTable* table) { return sp<BaseTable>(table)->GenerateCreateTableStatement(); };
    sp<BaseTable> raw = new RawEventTable();
    // TEXT is quoted and escaped, INTEGER stands verbatim; unknown names are skipped with their values.
    const Texts names = {"nope", "timestamp", "param_list"}, values = {"x", "5", "'; drop table event_info; --", "6"};
    const std::pair<std::string, std::string> texts[] = {
            {create(new EventTable()),
             "create table IF NOT EXISTS event_info(id INTEGER NOT NULL PRIMARY KEY AUTOINCREMENT,event_id "
             "INTEGER NOT NULL,trace_id TEXT,pspan_id TEXT,span_id TEXT,version_id INTEGER NOT NULL,occured_cnt "
             "INTEGER,first_time INTEGER,param_list TEXT,expire INTEGER,visible INTEGER)"},
            {create(new EventDailyTable()),
             "create table IF NOT EXISTS event_daily(id INTEGER NOT NULL PRIMARY KEY AUTOINCREMENT,event_id "
             "INTEGER NOT NULL,daily_cnt INTEGER NOT NULL,over_cnt INTEGER NOT NULL,hour_cnt INTEGER NOT NULL,"
             "next_expire_time INTEGER,last_happen_time INTEGER,last_log_time INTEGER)"},
            {create(new EventVersionTable()),
             "create table IF NOT EXISTS version(id INTEGER NOT NULL PRIMARY KEY AUTOINCREMENT,version TEXT NOT NULL)"},
            {create(new EventDBVersionTable()),
             "create table IF NOT EXISTS db_version(id INTEGER NOT NULL PRIMARY KEY AUTOINCREMENT,db_version "
             "INTEGER NOT NULL,dev_version TEXT NOT NULL,start_time INTEGER NOT NULL,activate_time INTEGER)"},
            {create(new EventUploadTable()),
             "create table IF NOT EXISTS upload(id INTEGER NOT NULL PRIMARY KEY AUTOINCREMENT,year INTEGER NOT "
             "NULL,m1 TEXT,m2 TEXT,m3 TEXT,m4 TEXT,m5 TEXT,M6 TEXT,M7 TEXT,M8 TEXT,m9 TEXT,m10 TEXT,m11 TEXT,"
             "m12 TEXT)"},
            {create(new RawEventTable()),
             "create table IF NOT EXISTS raw_events(id INTEGER NOT NULL PRIMARY KEY AUTOINCREMENT,event_id "
             "INTEGER NOT NULL,extra_data TEXT,timestamp INTEGER NOT NULL,param_list TEXT)"},
            {raw->BuildInsertStatement(names, values),
             "insert into raw_events (timestamp,param_list)  values ( 5,'''; drop table event_info; --') "},
            {raw->BuildUpdateStatement(names, values),
             "update raw_events set timestamp=5, param_list='''; drop table event_info; --'"},
            {raw->BuildInsertStatement({"nope"}, {"1"}) + raw->BuildUpdateStatement({"nope"}, {"1"}), ""},
    };
    for (const auto& [built, expected] : texts)
        EXPECT_EQ(built, expected);
}

using Q = EventQuery;

TEST(EventQueryTest, ConditionWhereAndQueryTexts) {
    // By operator value; values outside the enumeration render nothing.
    const char* texts[] = {"",        "c = 'v'",  "c != 'v'",     "c < 'v'",          "c <= 'v'",
                           "c > 'v'", "c >= 'v'", "c like '%v%'", "c not like '%v%'", ""};
    for (int op = 0; op < 10; op++)
        EXPECT_EQ(Q::GenerateCondStatement("c", Q::Op(op), "v"), texts[op]) << op;
    EXPECT_EQ(Q::GenerateCondStatement("c", Q::LIKE, "'; drop table x; --"), "c like '%''; drop table x; --%'");
    Q plain, groups, open, ordered, mixed;
    // Without a select list there is no query; unknown operators add nothing, not even a connector.
    plain.And("e", Q::EQ, 7).And("x", Q::Op(9), "1");
    // A closed group is joined again; an open one takes the next condition without a connector.
    groups.Select({"id"}).And("e", Q::EQ, "7").AddBeginGroup(true).And("d", Q::GT, 3).AddEndGroup();
    groups.AddBeginGroup(false).AppendWhereStatement("a", Q::EQ, "1", false);
    groups.AppendWhereStatement("b", Q::EQ, "2", false).AddEndGroup().Where("c", Q::LE, -5);
    open.AddBeginGroup(false).And("a", Q::EQ, "1").AddBeginGroup(true).Where("b", Q::NE, "2");
    // Repeated columns are selected once; ordering alone makes the WHERE part an order clause.
    ordered.Select({"id", "db_version"}).Select({"id"}).Order("id", false);
    // Ascending columns come first, whatever the order of the calls.
    mixed.Select({"z"}).Order("c", false).Order("a", true).Order("b", true).And("x", Q::EQ, "1");
    const std::tuple<Q*, std::string, std::string> cases[] = {
            {&plain, "  where e = '7'", ""},
            {&groups, "  where e = '7' and (d > '3')  or ( a = '1' or b = '2')  and c <= '-5'",
             "select id from t where e = '7' and (d > '3')  or ( a = '1' or b = '2')  and c <= '-5' limit -1"},
            {&open, "  where  (a = '1' and (b != '2'", ""},
            {&ordered, " order by id desc", "select id,db_version from t order by id desc limit -1"},
            {&mixed, "  where x = '1'order by a, b asc, c desc",
             "select z from t where x = '1' order by a, b asc, c desc limit -1"},
    };
    for (const auto& [query, where, select] : cases) {
        EXPECT_EQ(query->GetWhereStatement(), where);
        EXPECT_EQ(query->BuildQueryStatement("t", -1), select);
    }
}

class SqlFileTest : public ::testing::Test {
protected:
    void SetUp() override {
        FaultyVfs::Install();
        ASSERT_TRUE(db_->Open());
        ASSERT_TRUE(db_->ExecuteSql(raw_->GenerateCreateTableStatement()));
    }
    void TearDown() override { FaultyVfs::Heal(), db_->Close(); }
    bool Insert(const std::string& params) {
        return db_->ExecuteSql(raw_->BuildInsertStatement({"event_id", "timestamp", "param_list"}, {"1", "2", params}));
    }
    // The file's integrity and its number of rows, seen by a healthy connection of its own.
    void ExpectIntact(size_t rows) {
        db_->Close(), FaultyVfs::Heal();
        EXPECT_EQ(Column(path_, "PRAGMA integrity_check"), Texts{"ok"});
        EXPECT_EQ(Column(path_, "select count(*) from raw_events"), Texts{std::to_string(rows)});
        ASSERT_TRUE(db_->Open());
    }

    TempDir dir_;
    std::string path_ = dir_.File("t.db");
    sp<SqlDatabase> db_ = new SqlDatabase(path_);
    sp<BaseTable> raw_ = new RawEventTable();
};

// The event store on files that were damaged, replaced by a link, or sit on a full disk.
class HostileFileTest : public ::testing::Test {
protected:
    void SetUp() override { FaultyVfs::Install(); }
    void TearDown() override { FaultyVfs::Heal(), EventDatabase::getInstance()->Close(); }
    bool Init() {
        EventDatabase::getInstance()->Close();
        helper_ = new EventDatabaseHelper();
        return helper_->Init(&context_, "event.db", "OS3");
    }
    // Events of distinct ids, which no quota or pacing rule drops.
    void Store(int n, const std::string& tag) {
        for (int i = 0; i < n; i++)
            helper_->ProcessFaultEvent(MakeEvent(2, 902000000 + i, now_ - 100 + i, tag + std::to_string(i)));
    }
    // The files of the work folder but the database itself and its write-ahead log, by name.
    Texts Others() {
        Texts names;
        for (const auto& entry : std::filesystem::directory_iterator(dir_.path_))
            if (entry.path().filename() != "event.db" && entry.path().filename() != "event.db-wal" &&
                entry.path().filename() != "event.db-shm")
                names.push_back(entry.path().filename());
        std::sort(names.begin(), names.end());
        return names;
    }
    uint64_t Stat(const std::string& name) { return context_.GetStats().Value(name); }

    TempDir dir_;
    std::string path_ = dir_.File("event.db");
    FakePluginContext context_{dir_.path_, dir_.path_};
    sp<EventDatabaseHelper> helper_;
    uint64_t now_ = TimeUtil::GetTimestampSecond();
};

TEST_F(SqlFileTest, OldFileIsUpgradedOnce) {
    ASSERT_TRUE(db_->ExecuteSql(
            "create table event_daily(id INTEGER NOT NULL PRIMARY KEY AUTOINCREMENT,event_id INTEGER NOT NULL,"
            "daily_cnt INTEGER NOT NULL,over_cnt INTEGER NOT NULL,hour_cnt INTEGER NOT NULL,next_expire_time INTEGER,"
            "last_happen_time INTEGER); create table db_version(id INTEGER NOT NULL PRIMARY KEY AUTOINCREMENT,"
            "db_version INTEGER NOT NULL,dev_version TEXT NOT NULL,start_time INTEGER NOT NULL,activate_time INTEGER);"
            "insert into db_version (db_version,dev_version,start_time) values (3,'v1',100),(5,'v2',200);"
            "insert into event_daily (event_id,daily_cnt,over_cnt,hour_cnt) values (9,1,0,1);"));
    sp<EventDatabase> db = new EventDatabase();
    for (size_t start = 0; start < 2; start++) {  // only the first start adds the column and raises the revision
        LogCapture log;
        db->InitDatabase(path_);
        ASSERT_TRUE(db->IsInitialised());
        db->Close();
        EXPECT_EQ(log.Count(ANDROID_LOG_DEBUG, ":ALTER TABLE event_daily ADD COLUMN last_log_time INTEGER"), 1 - start);
        EXPECT_EQ(log.Count(ANDROID_LOG_INFO, "UpdateTableColumn Add column "), 1 - start);
        EXPECT_EQ(Column(path_, "select db_version from db_version order by id"), (Texts{"3", "6"}));
        EXPECT_EQ(Column(path_, "select event_id || '/' || ifnull(last_log_time, '-') from event_daily"), Texts{"9/-"});
        // The six tables and sqlite_sequence.
        EXPECT_EQ(Column(path_, "select count(*) from sqlite_master where type = 'table'"), Texts{"7"});
        // The lookups of every stored event find their rows through an index, with values quoted as
        // the query builder quotes them.
        EXPECT_EQ(
                Column(path_, "select name from sqlite_master where type = 'index' and sql is not null order by name"),
                (Texts{"event_daily_event", "event_info_day_lookup"}));
        const std::string plans[] = {
                "explain query plan select id,occured_cnt from event_info where event_id = '901' and version_id = "
                "'1' and param_list = 'p' and first_time >= '100' and first_time < '86500' limit 1",
                "explain query plan select id from event_daily where event_id = '901' limit 1"};
        for (const auto& plan : plans) {
            Texts steps = Column(path_, plan, 3);  // the plan step's text
            ASSERT_EQ(steps.size(), 1u) << plan;
            EXPECT_NE(steps[0].find(" INDEX event_"), std::string::npos) << steps[0];
        }
    }
}

TEST_F(SqlFileTest, HostileTextsRoundTripByteExact) {
    const std::string megabyte = std::string(1 << 19, '\'') + std::string(1 << 19, '%');
    const Texts texts = {"it's", "'; drop table event_info; --", "\xff\xfe\xc3\x28", "a\nb\tc\r", "", megabyte};
    for (const auto& text : texts)
        ASSERT_TRUE(Insert(text));
    EXPECT_EQ(Column(path_, "select param_list from raw_events order by id"), texts);
    ExpectIntact(texts.size());
}

TEST_F(SqlFileTest, FileThatIsNoDatabaseFailsLoudlyAndIsLeftAlone) {
    LogCapture log;
    const std::string garbage = "this is no database" + std::string(8192, 'Z');
    db_->Close();  // the last connection folds its write-ahead log into the file as it closes
    WriteFile(path_, garbage);
    ASSERT_TRUE(db_->Open());  // SQLite reads the header lazily
    EXPECT_FALSE(db_->ExecuteSql("create table t(a INTEGER)"));
    EXPECT_TRUE(log.Contains(ANDROID_LOG_WARN, "ExecuteSql failed execute sql " + path_ +
                                                       ", err:file is not a database, sql:create table t(a INTEGER)"));
    EXPECT_EQ(ReadFile(path_), garbage);
}

// A file that is no database, lost its end or has a page of garbage is moved aside (one copy, the
// newest), a fresh database with its version rows takes its place, and the event at hand is stored.
TEST_F(HostileFileTest, CorruptFileIsMovedAsideAndStoringGoesOn) {
    size_t eventInfoPage = 0;  // the root page of event_info, which every event's lookup reads
    const std::string badPage(4096, 'X');
    const std::pair<std::function<void(std::string&)>, std::string> damages[] = {
            {[](std::string& file) { file = "this is no database" + std::string(8192, 'Z'); }, "this is no database"},
            {[](std::string& file) { file.resize(file.size() / 2); }, "SQLite format 3"},
            {[&](std::string& file) { file.replace((eventInfoPage - 1) * 4096, 4096, badPage); }, badPage},
    };
    LogCapture log;
    uint64_t recovered = 0;
    for (const auto& [damage, mark] : damages) {
        ASSERT_TRUE(Init());
        Store(200, "stored before the damage ");
        EventDatabase::getInstance()->Close();
        eventInfoPage = std::stoul(Column(path_, "select rootpage from sqlite_master where name = 'event_info'")[0]);
        std::string file = ReadFile(path_);
        damage(file);
        WriteFile(path_, file);
        WriteFile(path_ + ".corrupt-20200101000000", "an older copy");
        Init();
        Store(1, "after ");
        recovered++;
        EXPECT_EQ(Column(path_, "select param_list from event_info"), Texts{"after 0"}) << mark;
        EXPECT_EQ(Column(path_, "select (select count(*) from version)||'/'||(select count(*) from db_version)"),
                  Texts{"1/1"});
        Texts others = Others();
        ASSERT_EQ(others.size(), 1u) << others[0];
        EXPECT_EQ(others[0].rfind("event.db.corrupt-" + TimeUtil::GetTimeDateStr(now_, "%Y%m%d"), 0), 0u);
        std::string copy = ReadFile(dir_.File(others[0]));
        EXPECT_TRUE(copy.size() == file.size() && copy.find(mark) != std::string::npos) << "no damaged copy";
        EXPECT_EQ(Stat("storage.db.recovered"), recovered);
        EXPECT_EQ(Stat("storage.events.store_failed"), 0u);
        std::filesystem::remove(dir_.File(others[0]));
        std::filesystem::remove(path_);
    }
    // One line as worded; the recoveries that follow within seconds are collapsed into a count.
    EXPECT_EQ(log.Count(ANDROID_LOG_ERROR, "MoveAside db " + path_ + " is corrupt ("), 1u);
}

// A database name that is a link is refused, whether the link points at nothing or at a database.
TEST_F(HostileFileTest, SymbolicLinkIsRefused) {
    TempDir elsewhere;
    const std::string target = elsewhere.File("target.db");
    ASSERT_EQ(symlink(target.c_str(), path_.c_str()), 0);
    LogCapture log;
    EXPECT_FALSE(Init());
    Store(1, "");
    EXPECT_FALSE(std::filesystem::exists(target));
    {
        sp<SqlDatabase> real = new SqlDatabase(target);
        ASSERT_TRUE(real->Open() && real->ExecuteSql("create table t(a INTEGER)"));
        real->Close();
    }
    std::string content = ReadFile(target);
    EXPECT_FALSE(Init());
    Store(1, "");
    EXPECT_EQ(ReadFile(target), content);
    EXPECT_EQ(log.Count(ANDROID_LOG_ERROR, "InitDatabase refusing db " + path_ + ", it is a symbolic link"), 2u)
            << log.Dump();
    EXPECT_EQ(Stat("storage.db.link_refused"), 2u);
}

// On a full disk every statement fails: the failures are counted, and their lines collapsed (the
// wording of the first is checked with the file that is no database).
TEST_F(HostileFileTest, FullDiskFailuresAreLoggedOnceAndCounted) {
    ASSERT_TRUE(Init());
    Store(1, "stored ");
    LogCapture log;
    FaultyVfs::writeBudget = 0;
    Store(100, "lost ");
    size_t failures = 0;
    for (const auto& line : log.Lines())
        failures += line.priority >= ANDROID_LOG_WARN ? 1 : 0;
    // At most the first failed statement (unless a test before this one in the process just logged one)
    // and the first lost event's insert.
    EXPECT_LE(failures, 2u) << log.Dump();
    EXPECT_LE(log.Count(ANDROID_LOG_WARN, "ExecuteSql failed execute sql " + path_ + ", err:database or disk is full"),
              1u);
    EXPECT_EQ(Stat("storage.events.store_failed"), 100u);
    EXPECT_GE(Stat("storage.db.errors"), 200u);
    FaultyVfs::Heal();
    Store(1, "space is back ");
    EXPECT_EQ(Column(path_, "select count(*) from event_info"), Texts{"2"});
}

// A statement that fails inside a shared transaction (a write refused once) costs its own event
// only: the events before it in the transaction and after it are committed, whether or not SQLite
// rolled the transaction back.
TEST_F(HostileFileTest, FailedEventInASharedTransactionCostsOnlyItself) {
    ASSERT_TRUE(Init());
    sp<EventDatabase> db = EventDatabase::getInstance();
    auto event = [&](int n, const std::string& tag) {
        db->BeginEvent();
        Store(n, tag);
        EXPECT_FALSE(db->EndEvent());
    };
    for (int round = 0; round < 2; round++) {
        // Large parameter texts spill the small page cache, so the batch writes before its commit.
        event(20, "before" + std::to_string(round) + std::string(2000, 'b'));
        FaultyVfs::failWrites = 1;
        event(1, "failed" + std::to_string(round) + std::string(8000, 'f'));
        FaultyVfs::Heal();
        event(1, "after" + std::to_string(round));
        db->Commit();
        EXPECT_FALSE(db->HasOpenBatch());
        EXPECT_EQ(Column(path_, "select count(*) from event_info where param_list like 'before" +
                                        std::to_string(round) + "%'"),
                  Texts{"20"});
        EXPECT_EQ(Column(path_,
                         "select count(*) from event_info where param_list like 'after" + std::to_string(round) + "%'"),
                  Texts{"1"});
    }
    EXPECT_EQ(Stat("storage.events.lost"), 0u);
    EXPECT_GE(Stat("storage.db.errors"), 2u);
    EXPECT_EQ(Column(path_, "PRAGMA integrity_check"), Texts{"ok"});
}

// Only the thread that holds the event database may use it; Close hands it over.
TEST_F(HostileFileTest, DatabaseBelongsToOneThreadAtATime) {
    GTEST_FLAG_SET(death_test_style, "threadsafe");
    ASSERT_TRUE(Init());
    EXPECT_DEATH(std::thread([this] { Store(1, ""); }).join(), "called on thread");
    EventDatabase::getInstance()->Close();
    std::thread([this] {
        EXPECT_TRUE(Init());
        Store(1, "from another thread");
        EventDatabase::getInstance()->Close();
    }).join();
    EXPECT_EQ(Column(path_, "select param_list from event_info"), Texts{"from another thread0"});
}

TEST_F(SqlFileTest, ReadOnlyOrFullDiskLosesNoCommittedRow) {
    for (int i = 0; i < 10; i++)
        ASSERT_TRUE(Insert(std::string(1024, 'a' + i)));
    db_->Close();
    FaultyVfs::readOnly = true;
    ASSERT_TRUE(db_->Open());
    EXPECT_FALSE(Insert("x"));
    EXPECT_NE(db_->GetLastError().find("readonly"), std::string::npos) << db_->GetLastError();
    EXPECT_FALSE(db_->ExecuteSql("delete from raw_events"));
    ExpectIntact(10);
    // Each insert writes journal and database pages; the budget runs out within a few rows, sometimes
    // in the middle of a commit.
    FaultyVfs::writeBudget = 40000;
    size_t committed = 10;
    for (int i = 10; i < 60; i++)
        committed += Insert(std::string(1024, 'a' + i % 26)) ? 1 : 0;
    EXPECT_LT(committed, 60u);
    ExpectIntact(committed);
    EXPECT_TRUE(Insert("space is back"));
    ExpectIntact(committed + 1);
}

}  // namespace android::Orvane
