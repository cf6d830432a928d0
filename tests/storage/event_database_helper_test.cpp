#include "storage/event_database_helper.h"

#include <gtest/gtest.h>

#include <fstream>
#include <functional>
#include <sstream>

#include "storage/event_table.h"
#include "tests/common/log_capture.h"
#include "tests/storage/fake_plugin_context.h"
#include "tests/storage/faulty_vfs.h"
#include "tests/storage/storage_test_util.h"
#include "utils/dev_info.h"
#include "utils/file_util.h"
#include "utils/time_util.h"

namespace android {
namespace Orvane {
namespace {

constexpr char OS_VERSION[] = "OS3";
constexpr uint32_t ID_QUOTA_2 = 901000002;   // its own daily count of 2
constexpr uint32_t ID_QUOTA_48 = 901000001;  // the domain's 48, logs once a day
constexpr uint32_t ID_SPACED = 902000001;    // 200 a day, logs at least 30 s apart
constexpr uint64_t DAY = 86400;

void WriteFile(const std::string& path, const std::string& content) {
    std::ofstream out(path, std::ios::binary);
    out << content;
}

std::string ReadFile(const std::string& path) {
    std::ifstream in(path, std::ios::binary);
    std::stringstream content;
    content << in.rdbuf();
    return content.str();
}

class EventDatabaseHelperTest : public ::testing::Test {
protected:
    void SetUp() override {
        WriteFile(config_.File("event_quota.xml"),
                  "<?xml version=\"1.0\" encoding=\"utf-8\"?>\n<Quota>\n<OS3>\n"
                  "  <Summary defDailyCnt=\"200\"/>\n"
                  "  <Domain name=\"fault\" eventMin=\"901000000\" eventMax=\"901999999\" dailyCnt=\"48\"/>\n"
                  "  <Domain name=\"spaced\" eventMin=\"902000000\" eventMax=\"902999999\" logSame=\"true\"/>\n"
                  "  <Event eventId=\"901000002\" dailyCnt=\"2\"/>\n"
                  "</OS3>\n</Quota>\n");
        WriteFile(config_.File("event.xml"),
                  "<?xml version=\"1.0\" encoding=\"UTF-8\"?>\n<Events>\n"
                  "  <Event id=\"902000001\" FaultType=\"FAULT\" Extend=\"S:30\">\n  </Event>\n</Events>\n");
        context_ = new FakePluginContext(work_.Path(), config_.Path());
        helper_ = new EventDatabaseHelper();
        ASSERT_TRUE(helper_->Init(context_, "event.db", OS_VERSION));
        start_ = helper_->GetDbStartTime();
    }
    void TearDown() override {
        EventDatabase::getInstance()->Close();
        delete context_;
    }

    sp<Event> Fault(uint32_t id, uint64_t happenTime, const std::string& params = "p") {
        sp<Event> event = new Event("test");
        event->eventType = 2;
        event->eventId = id;
        event->happenTime = happenTime;
        event->SetValue("param_list", params);
        return event;
    }
    sp<Event> Store(uint32_t id, uint64_t happenTime, const std::string& params = "p") {
        sp<Event> event = Fault(id, happenTime, params);
        helper_->ProcessFaultEvent(event);
        return event;
    }
    SqlRow Daily(uint32_t id) {
        EventQuery query;
        query.Select(sp<BaseTable>(new EventDailyTable())->GetFieldNameList()).And(COL_EVENT_ID, EventQuery::EQ, int64_t{id});
        auto rows = EventDatabase::getInstance()->Query(TBL_EVENT_DAILY, query, -1);
        EXPECT_LE(rows.size(), 1u);
        return rows.empty() ? SqlRow() : rows[0];
    }
    std::vector<SqlRow> Infos(uint32_t id) {
        EventQuery query;
        query.Select(sp<BaseTable>(new EventTable())->GetFieldNameList()).And(COL_EVENT_ID, EventQuery::EQ, int64_t{id}).Order(COL_ID, true);
        return EventDatabase::getInstance()->Query(TBL_EVENT_INFO, query, -1);
    }
    std::vector<SqlRow> All(const std::string& table, const std::vector<std::string>& columns) {
        EventQuery query;
        query.Select(columns).Order(COL_ID, true);
        return EventDatabase::getInstance()->Query(table, query, -1);
    }
    std::string DumpOf(const std::function<void(int)>& dump) {
        std::string path = work_.File("dump.txt");
        FILE* file = fopen(path.c_str(), "w+");
        dump(fileno(file));
        fclose(file);
        return ReadFile(path);
    }

    TempDir work_;
    TempDir config_;
    FakePluginContext* context_ = nullptr;
    sp<EventDatabaseHelper> helper_;
    uint64_t start_ = 0;
};

TEST_F(EventDatabaseHelperTest, StartUpFindsOrMakesTheVersionRows) {
    EXPECT_EQ(start_, static_cast<uint64_t>(TimeUtil::GetZeroTimestampSec(TimeUtil::GetTimestampSecond())));
    EXPECT_EQ(helper_->GetVersionId(), 1);
    EXPECT_EQ(helper_->GetDbVersionRowId(), 1);
    auto dbVersion = All(TBL_DB_VERSION, {COL_DB_VERSION, COL_DEV_VERSION, COL_START_TIME});
    ASSERT_EQ(dbVersion.size(), 1u);
    EXPECT_EQ(dbVersion[0], (SqlRow{{COL_DB_VERSION, "1"}, {COL_DEV_VERSION, "OS3"}, {COL_START_TIME, std::to_string(start_)}}));
    // A day that moved on is remembered across restarts.
    Store(ID_QUOTA_48, start_ + DAY + 5);
    uint64_t moved = helper_->GetDbStartTime();
    EXPECT_GT(moved, start_);

    EventDatabase::getInstance()->Close();
    sp<EventDatabaseHelper> same = new EventDatabaseHelper();
    ASSERT_TRUE(same->Init(context_, "event.db", OS_VERSION));
    EXPECT_EQ(same->GetVersionId(), 1);
    EXPECT_EQ(same->GetDbVersionRowId(), 1);
    EXPECT_EQ(same->GetDbStartTime(), moved);

    EventDatabase::getInstance()->Close();
    sp<EventDatabaseHelper> upgraded = new EventDatabaseHelper();
    ASSERT_TRUE(upgraded->Init(context_, "event.db", "OS4"));
    EXPECT_EQ(upgraded->GetVersionId(), 2);
    EXPECT_EQ(upgraded->GetDbVersionRowId(), 1);
    EXPECT_EQ(All(TBL_VERSION, {COL_VERSION}).size(), 2u);

    sp<EventDatabaseHelper> orphan = new EventDatabaseHelper();
    EXPECT_FALSE(orphan->Init(nullptr, "event.db", OS_VERSION));
    orphan->ProcessFaultEvent(Fault(ID_QUOTA_48, start_ + 1));  // no context: nothing happens
}

TEST_F(EventDatabaseHelperTest, DailyQuotaDropsAndReportsOnce) {
    uint64_t t0 = start_ + 1000;
    EXPECT_EQ(Store(ID_QUOTA_2, t0)->GetValue("dropReason"), "");
    EXPECT_EQ(Daily(ID_QUOTA_2)[COL_DAILY_CNT], "1");
    EXPECT_EQ(Daily(ID_QUOTA_2)[COL_NEXT_EXPIRE_TIME], std::to_string(t0 + 3600));
    EXPECT_EQ(Store(ID_QUOTA_2, t0 + 4000)->GetValue("dropReason"), "");  // a new hour period
    LogCapture log;
    EXPECT_EQ(Store(ID_QUOTA_2, t0 + 5000)->GetValue("dropReason"), "over daily quota");
    EXPECT_TRUE(log.Contains(ANDROID_LOG_INFO,
                             "DetectDropByTime event 901000002 over daily cnt drop it, dailyCnt=2 maxCnt=2"));
    EXPECT_TRUE(log.Contains(ANDROID_LOG_DEBUG, "DetectDropByTime event 901000002 parser maxCnt=2 lastTime="));
    SqlRow row = Daily(ID_QUOTA_2);
    EXPECT_EQ(row[COL_DAILY_CNT], "3");
    EXPECT_EQ(row[COL_OVER_CNT], "1");
    EXPECT_EQ(row[COL_LAST_HAPPEN_TIME], std::to_string(t0 + 4000));  // drops leave it

    ASSERT_TRUE(WaitUntil([&] { return context_->Inserted().size() == 1; }));
    auto [pipeline, report] = context_->Inserted()[0];
    EXPECT_EQ(pipeline, "dftFaultEvent");
    EXPECT_EQ(report->eventId, 908001001u);
    EXPECT_EQ(report->eventType, 2u);
    EXPECT_EQ(report->sender, "EventStorageManager");
    EXPECT_EQ(report->GetValue("param_list"), "{\"EventId\":901000002,\"DailyCnt\":2,\"MaxCnt\":2}");

    EXPECT_EQ(Store(ID_QUOTA_2, t0 + 9000)->GetValue("dropReason"), "over daily quota");
    EXPECT_EQ(Daily(ID_QUOTA_2)[COL_DAILY_CNT], "4");
    EXPECT_EQ(Daily(ID_QUOTA_2)[COL_OVER_CNT], "2");
    // Only the two kept events are recorded, in one row of the day.
    auto infos = Infos(ID_QUOTA_2);
    ASSERT_EQ(infos.size(), 1u);
    EXPECT_EQ(infos[0][COL_OCCURED_CNT], "2");
    EXPECT_EQ(infos[0][COL_FIRST_TIME], std::to_string(t0 + 4000));
    // Give the shared loop time to post a second report if it wrongly would.
    sp<Event> marker = new Event("marker");
    context_->GetSharedWorkLoop()->AddTask([&] { context_->InsertEventToPipeline("marker", marker); });
    ASSERT_TRUE(WaitUntil([&] { return context_->Inserted().size() == 2; }));
    EXPECT_EQ(context_->Inserted()[1].first, "marker");
}

TEST_F(EventDatabaseHelperTest, HourlyPacingPunishesBurstsAndAdvancesPeriods) {
    uint64_t t0 = start_ + 2 * 3600;
    Store(ID_QUOTA_48, t0);
    // dailyCnt 1 leaves 47, so one event per period is free; the next must wait (day left)/47.
    LogCapture log;
    EXPECT_EQ(Store(ID_QUOTA_48, t0 + 10)->GetValue("dropReason"), "event happen too sequence, drop it by punish");
    EXPECT_TRUE(log.Contains(ANDROID_LOG_INFO,
                             "DetectDropByTime event 901000001 over hour cnt drop it, hourCnt=2 halfCnt=1, maxCnt=48"));
    SqlRow row = Daily(ID_QUOTA_48);
    EXPECT_EQ(row[COL_DAILY_CNT], "1");
    EXPECT_EQ(row[COL_OVER_CNT], "1");
    EXPECT_EQ(row[COL_HOUR_CNT], "1");
    EXPECT_EQ(row[COL_LAST_HAPPEN_TIME], std::to_string(t0));

    uint64_t spaced = t0 + (start_ + DAY - t0) / 47 + 1;
    EXPECT_EQ(Store(ID_QUOTA_48, spaced)->GetValue("dropReason"), "");
    row = Daily(ID_QUOTA_48);
    EXPECT_EQ(row[COL_DAILY_CNT], "2");
    EXPECT_EQ(row[COL_HOUR_CNT], "2");
    EXPECT_EQ(row[COL_LAST_HAPPEN_TIME], std::to_string(spaced));

    // After a quiet spell the period moves by one hour per event, so both of these open one.
    uint64_t late = t0 + 5 * 3600;
    EXPECT_EQ(Store(ID_QUOTA_48, late)->GetValue("dropReason"), "");
    EXPECT_EQ(Daily(ID_QUOTA_48)[COL_NEXT_EXPIRE_TIME], std::to_string(t0 + 7200));
    EXPECT_EQ(Daily(ID_QUOTA_48)[COL_HOUR_CNT], "1");
    EXPECT_EQ(Store(ID_QUOTA_48, late + 1)->GetValue("dropReason"), "");
    EXPECT_EQ(Daily(ID_QUOTA_48)[COL_NEXT_EXPIRE_TIME], std::to_string(t0 + 10800));
    EXPECT_EQ(Daily(ID_QUOTA_48)[COL_DAILY_CNT], "4");
    EXPECT_EQ(Infos(ID_QUOTA_48)[0][COL_OCCURED_CNT], "4");
}

TEST_F(EventDatabaseHelperTest, NewDayEmptiesCountersAndMovesTheStart) {
    Store(ID_QUOTA_2, start_ + 100);
    Store(ID_QUOTA_48, start_ + 200);
    Store(ID_QUOTA_2, start_ + 5000);
    Store(ID_QUOTA_2, start_ + 6000);  // dropped
    // A clock set back never starts a new day, nor does the last second of the day.
    EXPECT_FALSE(helper_->ProcessNewDayEvent(Fault(ID_QUOTA_2, start_ - 3 * DAY)));
    EXPECT_FALSE(helper_->ProcessNewDayEvent(Fault(ID_QUOTA_2, start_ + DAY - 1)));

    LogCapture log;
    uint64_t next = start_ + DAY + 500;
    EXPECT_EQ(Store(ID_QUOTA_2, next)->GetValue("dropReason"), "");
    uint64_t newStart = static_cast<uint64_t>(TimeUtil::GetZeroTimestampSec(static_cast<int64_t>(next)));
    EXPECT_EQ(helper_->GetDbStartTime(), newStart);
    EXPECT_TRUE(log.Contains(ANDROID_LOG_DEBUG, "ProcessNewDayEvent daily tbl truncate event happen time " +
                                                    std::to_string(next) + ", start time=" + std::to_string(newStart) +
                                                    "db time =" + std::to_string(start_ + DAY)));
    auto daily = All(TBL_EVENT_DAILY, {COL_ID, COL_EVENT_ID, COL_DAILY_CNT, COL_OVER_CNT});
    ASSERT_EQ(daily.size(), 1u);
    EXPECT_EQ(daily[0], (SqlRow{{COL_ID, "1"}, {COL_EVENT_ID, "901000002"}, {COL_DAILY_CNT, "1"}, {COL_OVER_CNT, "0"}}));
    EXPECT_EQ(All(TBL_DB_VERSION, {COL_START_TIME})[0][COL_START_TIME], std::to_string(newStart));
    // The same event on the new day is a new event_info row.
    auto infos = Infos(ID_QUOTA_2);
    ASSERT_EQ(infos.size(), 2u);
    EXPECT_EQ(infos[0][COL_OCCURED_CNT], "2");
    EXPECT_EQ(infos[1][COL_OCCURED_CNT], "1");
}

TEST_F(EventDatabaseHelperTest, OccurrencesAreCountedPerParameterText) {
    std::string megabyte(1 << 20, 'm');
    megabyte[7] = '\'';
    const std::vector<std::string> params = {"'; drop table event_info; --", "100%", "\xff\xfe bad utf8", megabyte};
    uint64_t t = start_ + 100;
    for (const auto& text : params) {
        for (int i = 0; i < 2; i++) {
            t += 4000;  // past each hour period, so pacing keeps them all
            EXPECT_EQ(Store(ID_SPACED, t, text)->GetValue("dropReason"), "");
        }
    }
    sp<Event> marked = Fault(ID_SPACED, t + 4000, "marked");
    marked->SetValue("expire", "1");
    marked->SetValue("visible", "1); drop table version; --");
    helper_->ProcessFaultEvent(marked);

    auto infos = Infos(ID_SPACED);
    ASSERT_EQ(infos.size(), params.size() + 1);
    for (size_t i = 0; i < params.size(); i++) {
        EXPECT_EQ(infos[i][COL_PARAM_LIST], params[i]) << "row " << i;
        EXPECT_EQ(infos[i][COL_OCCURED_CNT], "2");
        EXPECT_EQ(infos[i][COL_VERSION_ID], "1");
        EXPECT_EQ(infos[i][COL_EXPIRE], "0");
        EXPECT_EQ(infos[i][COL_VISIBLE], "0");
        // first_time follows the latest occurrence
        EXPECT_EQ(infos[i][COL_FIRST_TIME], std::to_string(start_ + 100 + 4000 * (2 * i + 2)));
    }
    EXPECT_EQ(infos.back()[COL_EXPIRE], "1");
    EXPECT_EQ(infos.back()[COL_VISIBLE], "0");
    EXPECT_EQ(All(TBL_VERSION, {COL_VERSION}).size(), 1u);
}

TEST_F(EventDatabaseHelperTest, LogCatchTimes) {
    // Without collection rules no log is caught and the last-log time never moves.
    sp<Event> first = Store(ID_QUOTA_48, start_ + 100);
    EXPECT_EQ(first->GetValue("noCatchLog"), "NO_LOG_CONFIG");
    EXPECT_EQ(Daily(ID_QUOTA_48)[COL_LAST_LOG_TIME], "0");

    helper_->SetLogRuleLookup([](uint32_t id) { return id != ID_QUOTA_2; });
    EXPECT_EQ(Store(ID_QUOTA_2, start_ + 100)->GetValue("noCatchLog"), "NO_LOG_CONFIG");

    // Spacing of 30 s from the catalogue, same logs allowed.
    uint64_t t = start_ + 1000;
    EXPECT_EQ(Store(ID_SPACED, t)->GetValue("noCatchLog"), "");
    EXPECT_EQ(Daily(ID_SPACED)[COL_LAST_LOG_TIME], std::to_string(t));
    EXPECT_EQ(Store(ID_SPACED, t + 10)->GetValue("noCatchLog"), "WAIT_LOG_CATCH");
    EXPECT_EQ(Daily(ID_SPACED)[COL_LAST_LOG_TIME], std::to_string(t));
    EXPECT_EQ(Store(ID_SPACED, t + 30)->GetValue("noCatchLog"), "");
    EXPECT_EQ(Daily(ID_SPACED)[COL_LAST_LOG_TIME], std::to_string(t + 30));

    // Without "logSame" an id's logs are caught once per counting day.
    uint64_t u = start_ + 2000;
    EXPECT_EQ(Store(ID_QUOTA_48 + 5, u)->GetValue("noCatchLog"), "");
    EXPECT_EQ(Store(ID_QUOTA_48 + 5, u + 3600)->GetValue("noCatchLog"), "WAIT_LOG_CATCH");
    EXPECT_EQ(Daily(ID_QUOTA_48 + 5)[COL_LAST_LOG_TIME], std::to_string(u));
    EXPECT_EQ(Store(ID_QUOTA_48 + 5, start_ + DAY + 10)->GetValue("noCatchLog"), "");
}

TEST_F(EventDatabaseHelperTest, RawEventsAndActivationTime) {
    sp<Event> raw = new Event("test");
    raw->eventType = 4;
    raw->eventId = 150000;
    raw->happenTime = 1234;
    raw->SetValue("param_list", "a'b");
    helper_->SaveRawEvent(raw);
    EXPECT_EQ(raw->GetValue("rawEventDbID"), "1");
    helper_->SaveRawEvent(raw);
    EXPECT_EQ(raw->GetValue("rawEventDbID"), "2");
    auto rows = All(TBL_RAW_EVENTS, {COL_EVENT_ID, COL_EXTRA_DATA, COL_TIMESTAMP, COL_PARAM_LIST});
    ASSERT_EQ(rows.size(), 2u);
    EXPECT_EQ(rows[0], (SqlRow{{COL_EVENT_ID, "150000"}, {COL_EXTRA_DATA, ""}, {COL_TIMESTAMP, "1234"},
                               {COL_PARAM_LIST, "a'b"}}));

    sp<Event> activate = new Event("test");
    activate->eventType = 1;
    activate->eventId = 105;
    activate->happenTime = 1700000000;
    helper_->SaveUserActivateTime(activate);
    EXPECT_EQ(All(TBL_DB_VERSION, {COL_ACTIVATE_TIME})[0][COL_ACTIVATE_TIME], "1700000000");
    EXPECT_EQ(DevInfo::GetActivateTime(), 1700000000u);

    // A failed insert says 0.
    EventDatabase::getInstance()->Close();
    helper_->SaveRawEvent(raw);
    EXPECT_EQ(raw->GetValue("rawEventDbID"), "0");
}

TEST_F(EventDatabaseHelperTest, AbridgeRemovesOldestEventsAndShrinksTheFile) {
    sp<EventDatabase> db = EventDatabase::getInstance();
    uint64_t now = TimeUtil::GetTimestampSecond();
    std::string filler(4000, 'f');
    const std::vector<uint64_t> ages = {90 * DAY, 61 * DAY, 40 * DAY, 20 * DAY, 2 * DAY};
    for (uint64_t age : ages) {
        for (int i = 0; i < 10; i++) {
            ASSERT_TRUE(db->Insert(TBL_EVENT_INFO, {COL_EVENT_ID, COL_VERSION_ID, COL_FIRST_TIME, COL_PARAM_LIST},
                                   {"901000001", "1", std::to_string(now - age), filler}));
            ASSERT_TRUE(db->Insert(TBL_RAW_EVENTS, {COL_EVENT_ID, COL_TIMESTAMP, COL_PARAM_LIST},
                                   {"150000", std::to_string(now - age), filler}));
        }
    }
    ASSERT_TRUE(db->Insert(TBL_EVENT_INFO, {COL_EVENT_ID, COL_VERSION_ID, COL_FIRST_TIME}, {"1", "1", std::to_string(now + DAY)}));
    Store(ID_QUOTA_48, now - 60);
    auto countOf = [&](const std::string& table) {
        return All(table, {COL_ID}).size();
    };

    // A generous limit: one round removes only what is older than 60 days.
    LogCapture log;
    helper_->AbridgeDbSize(UINT32_MAX);
    EXPECT_EQ(log.Count(ANDROID_LOG_INFO, "AbridgeDbSize round "), 1u);
    EXPECT_TRUE(log.Contains(ANDROID_LOG_INFO, "AbridgeDbSize round 1 cut-off"));
    EXPECT_EQ(countOf(TBL_EVENT_INFO), 3u * 10 + 1 + 1);
    EXPECT_EQ(countOf(TBL_RAW_EVENTS), 3u * 10);

    // An unreachable limit: eight rounds, each halving the distance to now.
    int64_t before = FileUtil::GetFileSize(helper_->GetDbPath());
    log.Clear();
    helper_->AbridgeDbSize(1);
    EXPECT_EQ(log.Count(ANDROID_LOG_INFO, "AbridgeDbSize round "), 8u);
    EXPECT_EQ(countOf(TBL_EVENT_INFO), 2u);  // today's event and the one from the future
    EXPECT_EQ(countOf(TBL_RAW_EVENTS), 0u);
    EXPECT_EQ(countOf(TBL_EVENT_DAILY), 1u);
    EXPECT_EQ(countOf(TBL_DB_VERSION), 1u);
    EXPECT_LT(FileUtil::GetFileSize(helper_->GetDbPath()), before / 2);
}

TEST_F(EventDatabaseHelperTest, DumpCommands) {
    for (int i = 0; i < 25; i++) {
        Store(ID_SPACED, start_ + 100 + 4000 * i, "row" + std::to_string(i));
    }
    std::string out = DumpOf([&](int fd) { helper_->DumpQueryDb(fd, {"query", "event_info"}); });
    std::vector<std::string> lines;
    std::stringstream stream(out);
    for (std::string line; std::getline(stream, line);) {
        lines.push_back(line);
    }
    ASSERT_EQ(lines.size(), 21u);
    EXPECT_EQ(lines[0],
              "id | event_id | trace_id | pspan_id | span_id | version_id | occured_cnt | first_time | param_list | "
              "expire | visible");
    EXPECT_EQ(lines[1], "25 | 902000001 |  |  |  | 1 | 1 | " + std::to_string(start_ + 100 + 4000 * 24) +
                            " | row24 | 0 | 0");
    EXPECT_EQ(DumpOf([&](int fd) { helper_->DumpQueryDb(fd, {"query", "version", "1"}); }), "id | version\n1 | OS3\n");
    EXPECT_EQ(DumpOf([&](int fd) { helper_->DumpQueryDb(fd, {"query", "sqlite_master"}); }),
              "unknown table sqlite_master\n");
    EXPECT_EQ(DumpOf([&](int fd) { helper_->DumpQueryDb(fd, {"query"}); }), "usage: query <table> [limit]\n");
    EXPECT_EQ(DumpOf([&](int fd) { helper_->DumpQueryDb(fd, {"query", "version", "x"}); }),
              "usage: query <table> [limit]\n");

    auto update = [&](std::vector<std::string> args) {
        return DumpOf([&](int fd) { helper_->DumpUpdateDb(fd, args); });
    };
    EXPECT_EQ(update({"update", "event_info", "visible", "1", "id", "3"}), "update ok\n");
    EXPECT_EQ(update({"update", "event_info", "param_list", "x'; drop table version; --", "id", "4"}), "update ok\n");
    EXPECT_EQ(update({"update", "event_info", "visible", "1; drop table version", "id", "3"}),
              "invalid value 1; drop table version\n");
    EXPECT_EQ(update({"update", "event_info", "nope", "1", "id", "3"}), "unknown column nope\n");
    EXPECT_EQ(update({"update", "event_info", "visible", "1", "id = 1 or 1", "1"}), "unknown column id = 1 or 1\n");
    EXPECT_EQ(update({"update", "sqlite_sequence", "seq", "1", "name", "x"}), "unknown table sqlite_sequence\n");
    EXPECT_EQ(update({"update", "event_info"}),
              "usage: update <table> <column> <value> <whereColumn> <whereValue>\n");
    auto infos = Infos(ID_SPACED);
    EXPECT_EQ(infos[2][COL_VISIBLE], "1");
    EXPECT_EQ(infos[3][COL_PARAM_LIST], "x'; drop table version; --");
    EXPECT_EQ(All(TBL_VERSION, {COL_VERSION}).size(), 1u);
}

TEST_F(EventDatabaseHelperTest, BrokenFilesNeverStopTheFlow) {
    EventDatabase::getInstance()->Close();
    std::string path = work_.File("event.db");
    std::string garbage(4096, 'g');
    WriteFile(path, garbage);
    LogCapture log;
    sp<EventDatabaseHelper> broken = new EventDatabaseHelper();
    broken->Init(context_, "event.db", OS_VERSION);
    for (int i = 0; i < 5; i++) {
        sp<Event> event = Fault(ID_QUOTA_48, start_ + 100 + i);
        broken->ProcessFaultEvent(event);
        EXPECT_EQ(event->GetValue("dropReason"), "");
    }
    EXPECT_TRUE(log.Contains(ANDROID_LOG_WARN, "file is not a database"));
    EXPECT_EQ(ReadFile(path), garbage);
}

TEST_F(EventDatabaseHelperTest, FullDiskKeepsCommittedEvents) {
    EventDatabase::getInstance()->Close();
    FaultyVfs::Install();
    sp<EventDatabaseHelper> helper = new EventDatabaseHelper();
    ASSERT_TRUE(helper->Init(context_, "event.db", OS_VERSION));
    std::string params(3000, 'x');
    uint64_t t = start_ + 10;
    for (int i = 0; i < 10; i++) {
        helper->ProcessFaultEvent(Fault(ID_SPACED, t += 4000, params + std::to_string(i)));
    }
    FaultyVfs::g_writeBudget = 30000;
    for (int i = 10; i < 40; i++) {
        helper->ProcessFaultEvent(Fault(ID_SPACED, t += 4000, params + std::to_string(i)));
    }
    FaultyVfs::Heal();
    EventDatabase::getInstance()->Close();
    sp<SqlDatabase> check = new SqlDatabase(work_.File("event.db"));
    ASSERT_TRUE(check->Open());
    auto integrity = check->QueryRecord("PRAGMA integrity_check", {"r"});
    ASSERT_EQ(integrity.size(), 1u);
    EXPECT_EQ(integrity[0]["r"], "ok");
    auto stored = check->QueryRecord("select param_list from event_info order by id", {"p"});
    ASSERT_GE(stored.size(), 10u);
    EXPECT_LT(stored.size(), 40u);
    for (size_t i = 0; i < stored.size(); i++) {
        EXPECT_EQ(stored[i]["p"], params + std::to_string(i));
    }
    check->Close();
}

}  // namespace
}  // namespace Orvane
}  // namespace android
