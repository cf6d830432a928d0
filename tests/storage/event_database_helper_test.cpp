#include "storage/event_database_helper.h"

#include <sched.h>
#include <sys/mount.h>
#include <sys/statvfs.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <filesystem>
#include <random>
#include <sstream>

#include <android-base/unique_fd.h>
#include <gtest/gtest.h>

#include "storage/event_table.h"
#include "tests/common/fake_plugin_context.h"
#include "tests/common/log_capture.h"
#include "tests/storage/storage_test_util.h"
#include "utils/time_util.h"

namespace android::Orvane {

constexpr uint32_t kIdQuota2 = 901000002;   // its own daily count of 2
constexpr uint32_t kIdQuota48 = 901000001;  // its domain's 48
constexpr uint32_t kIdOther = 902000001;    // the default of 200
constexpr uint32_t kIdMany = 903000001;     // a quota that no test reaches
constexpr uint64_t kDay = 86400;
const auto kS = [](uint64_t value) { return std::to_string(value); };

const char kQuotaDocument[] =
        "<?xml version=\"1.0\" encoding=\"utf-8\"?>\n<Quota>\n<OS3>\n  <Summary defDailyCnt=\"200\"/>\n"
        "  <Domain name=\"fault\" eventMin=\"901000000\" eventMax=\"901999999\" dailyCnt=\"48\"/>\n"
        "  <Event eventId=\"901000002\" dailyCnt=\"2\"/>\n  <Event eventId=\"903000001\" dailyCnt=\"1000000\"/>\n"
        "</OS3>\n</Quota>\n";

uint64_t Now() {
    return TimeUtil::GetTimestampSecond();
}

uint64_t Midnight(uint64_t seconds) {
    return static_cast<uint64_t>(TimeUtil::GetZeroTimestampSec(static_cast<int64_t>(seconds)));
}

class EventDatabaseHelperTest : public ::testing::Test {
protected:
    // The counting days of these tests lie in the past, so that no happen time is ahead of the clock.
    void SetUp() override {
        WriteFile(config_.File("event_quota.xml"), kQuotaDocument);
        ASSERT_TRUE(helper_->Init(&context_, "event.db", "OS3"));
        EventDatabase::getInstance()->Close();
        Column(path_, "update db_version set start_time = " + kS(Midnight(Now() - 3 * kDay)));
        Restart();
    }
    void TearDown() override { EventDatabase::getInstance()->Close(); }
    // Closes the database and starts over with a new helper, as a restart of the daemon does.
    void Restart() {
        EventDatabase::getInstance()->Close();
        helper_ = new EventDatabaseHelper();
        ASSERT_TRUE(helper_->Init(&context_, "event.db", "OS3"));
        start_ = helper_->GetDbStartTime();
    }
    // Stores a fault event and tells why it was dropped, if it was.
    std::string Store(uint32_t id, uint64_t happenTime, const std::string& params = "p") {
        sp<Event> event = MakeEvent(2, id, happenTime, params);
        helper_->ProcessFaultEvent(event);
        return event->GetValue("dropReason");
    }
    // Columns of an id's rows in a table, read from the file: '/' between columns, ';' between rows.
    std::string Rows(const std::string& table, uint32_t id, std::string columns) {
        for (size_t at; (at = columns.find(',')) != std::string::npos;)
            columns.replace(at, 1, "||'/'||");
        return Column(path_, "select group_concat(v, ';') from (select " + columns + " as v from " + table +
                                     " where event_id=" + kS(id) + " order by id)")[0];
    }
    uint64_t Stat(const std::string& name) { return context_.GetStats().Value(name); }

    TempDir work_, config_;
    std::string path_ = work_.File("event.db");
    FakePluginContext context_{work_.path_, config_.path_};
    sp<EventDatabaseHelper> helper_ = new EventDatabaseHelper();
    uint64_t start_ = 0;
};

TEST_F(EventDatabaseHelperTest, DailyQuotaNewDayAndOneReportPerDay) {
    EXPECT_EQ(DumpOf([&](int fd) { helper_->DumpQuota(fd, "901000002"); }),
              "EventId 901000002 quota :\n    dailyCnt = 2\n    logCnt = 10    realLog = 0    logSpace = 300    "
              "sameLog = 0    inSub = 0\n    minEvent = 901000000    maxEvent = 901999999\n");
    uint64_t t0 = start_ + 1000;
    EXPECT_EQ(Store(kIdQuota48, t0), "");
    LogCapture log;
    for (uint64_t t : {t0, t0 + 4000, t0 + 5000, t0 + 9000})  // an hour period apart: only the quota decides
        EXPECT_EQ(Store(kIdQuota2, t), t < t0 + 5000 ? "" : "over daily quota");
    EXPECT_TRUE(log.Contains(ANDROID_LOG_INFO,
                             "DetectDropByTime event 901000002 over daily cnt drop it, dailyCnt=2 maxCnt=2"));
    // Drops are counted but leave the last happen time; the two kept events are one row of the day.
    EXPECT_EQ(Rows(kTblEventDaily, kIdQuota2, "daily_cnt,over_cnt,last_happen_time"), "4/2/" + kS(t0 + 4000));
    EXPECT_EQ(Rows(kTblEventInfo, kIdQuota2, "occured_cnt,first_time"), "2/" + kS(t0 + 4000));

    // A clock set back never starts a new day, nor does the last second of the day.
    EXPECT_FALSE(helper_->ProcessNewDayEvent(MakeEvent(2, kIdQuota2, start_ - 3 * kDay)));
    EXPECT_FALSE(helper_->ProcessNewDayEvent(MakeEvent(2, kIdQuota2, start_ + kDay - 1)));
    uint64_t next = start_ + kDay + 500;
    EXPECT_EQ(Store(kIdQuota2, next), "");
    // The counters and their ids start over, event_info starts a new row, and the new day survives a restart.
    EXPECT_EQ(Column(path_, "select event_id||'/'||id||'/'||daily_cnt||'/'||over_cnt from event_daily"),
              Texts{"901000002/1/1/0"});
    EXPECT_EQ(Rows(kTblEventInfo, kIdQuota2, "occured_cnt"), "2;1");
    Restart();
    EXPECT_EQ(helper_->GetDbStartTime(), Midnight(next));
    EXPECT_EQ(Store(kIdQuota2, next + 4000), "");
    EXPECT_EQ(Store(kIdQuota2, next + 4001), "over daily quota");
    EXPECT_EQ(Stat("storage.events.stored"), 5u);
    EXPECT_EQ(Stat("storage.events.dropped.over_daily_quota"), 3u);
    EXPECT_EQ(Stat("storage.events.store_failed") + Stat("storage.db.errors"), 0u);

    // The first drop of each day is reported; a marker queued after the drops shows that no other report is coming.
    context_.GetSharedWorkLoop()->AddTask([this] { context_.InsertEventToPipeline("marker", MakeEvent(0, 0, 0)); });
    ASSERT_TRUE(WaitUntil([&] { return context_.Inserted().size() >= 3; }));
    std::string inserted;
    for (const auto& [pipeline, e] : context_.Inserted())
        inserted += pipeline + " " + kS(e->eventType) + " " + kS(e->eventId) + " " + kS(e->happenTime) +
                    e->GetValue("param_list") + "\n";
    const std::string report = "dftFaultEvent 2 908001001 ";
    const std::string params = "{\"EventId\":901000002,\"DailyCnt\":2,\"MaxCnt\":2}\n";
    EXPECT_EQ(inserted, report + kS(t0 + 5000) + params + report + kS(next + 4001) + params + "marker 0 0 0p\n");
}

TEST_F(EventDatabaseHelperTest, HourlyPacingAndOccurrencesPerParameterText) {
    uint64_t t0 = start_ + 2 * 3600;
    Store(kIdQuota48, t0);
    // dailyCnt 1 leaves 47, so one event per period is free; the next must wait (day left)/47.
    LogCapture log;
    EXPECT_EQ(Store(kIdQuota48, t0 + 10), "event happen too sequence, drop it by punish");
    EXPECT_TRUE(log.Contains(ANDROID_LOG_INFO,
                             "DetectDropByTime event 901000001 over hour cnt drop it, hourCnt=2 halfCnt=1, maxCnt=48"));
    EXPECT_EQ(Stat("storage.events.dropped.punished"), 1u);
    EXPECT_EQ(Rows(kTblEventDaily, kIdQuota48, "daily_cnt,over_cnt,hour_cnt,last_happen_time"), "1/1/1/" + kS(t0));
    uint64_t spaced = t0 + (start_ + kDay - t0) / 47 + 1;
    EXPECT_EQ(Store(kIdQuota48, spaced), "");
    EXPECT_EQ(Rows(kTblEventDaily, kIdQuota48, "daily_cnt,hour_cnt,last_happen_time"), "2/2/" + kS(spaced));
    // After a quiet spell the period moves by one hour per event, so both of these open one.
    EXPECT_EQ(Store(kIdQuota48, t0 + 5 * 3600), "");
    EXPECT_EQ(Store(kIdQuota48, t0 + 5 * 3600 + 1), "");
    EXPECT_EQ(Rows(kTblEventDaily, kIdQuota48, "daily_cnt,hour_cnt,next_expire_time"), "4/1/" + kS(t0 + 10800));
    EXPECT_EQ(Rows(kTblEventInfo, kIdQuota48, "occured_cnt"), "4");

    // Occurrences of another id are counted per parameter text, one row each for the day.
    Texts params = {"'; drop table event_info; --", "100%", "\xff\xfe bad utf8"};
    uint64_t t = start_ + 100;
    std::string expected;
    for (const auto& text : params) {  // each past the hour period, so pacing keeps them all
        EXPECT_EQ(Store(kIdOther, t += 4000, text), "");
        EXPECT_EQ(Store(kIdOther, t += 4000, text), "");
        expected += "2/1/0/0/" + kS(t) + ";";  // first_time follows the latest occurrence
    }
    EXPECT_EQ(Rows(kTblEventInfo, kIdOther, "occured_cnt,version_id,expire,visible,first_time") + ";", expected);
    EXPECT_EQ(Column(path_, "select param_list from event_info where event_id = 902000001"), params);
}

// One absurd time must neither move the counting day far ahead nor, once it did, keep it there.
TEST_F(EventDatabaseHelperTest, FutureHappenTimeIsTakenAsNowAndAFutureDayStartHeals) {
    LogCapture log;
    uint64_t before = Now();
    for (int i = 0; i < 3; i++)
        EXPECT_EQ(Store(kIdOther, 9999999999, "{}"), "");
    uint64_t after = Now();
    // Stored at the clock's time: the day that began 3 days ago ends, today's begins.
    Texts stored = Column(path_, "select occured_cnt||'/'||first_time from event_info where event_id = 902000001");
    ASSERT_EQ(stored.size(), 1u);
    uint64_t storedTime = std::stoull(stored[0].substr(2));
    EXPECT_EQ(stored[0].substr(0, 2), "3/");
    EXPECT_TRUE(storedTime >= before && storedTime <= after) << stored[0];
    EXPECT_EQ(helper_->GetDbStartTime(), Midnight(storedTime));
    EXPECT_EQ(Stat("storage.events.future_time"), 3u);
    EXPECT_EQ(log.Count(ANDROID_LOG_WARN,
                        "ProcessFaultEvent event 902000001 happen time 9999999999 is more than "
                        "86400 s ahead of the clock"),
              1u)
            << log.Dump();
    // A time within the margin is taken as it stands.
    uint64_t tomorrow = Midnight(storedTime) + kDay;
    EXPECT_EQ(Store(kIdQuota2, tomorrow), "");
    EXPECT_EQ(helper_->GetDbStartTime(), tomorrow);
    EXPECT_EQ(Rows(kTblEventInfo, kIdQuota2, "first_time"), kS(tomorrow));

    // A day start that an earlier daemon moved into the year 2286 is brought back at start-up.
    Restart();
    EXPECT_EQ(helper_->GetDbStartTime(), tomorrow);
    EventDatabase::getInstance()->Close();
    Column(path_, "update db_version set start_time = 9999936000");
    Restart();
    uint64_t today = Midnight(Now());
    EXPECT_EQ(helper_->GetDbStartTime(), today);
    EXPECT_EQ(Column(path_, "select start_time from db_version"), Texts{kS(today)});
    EXPECT_EQ(Stat("storage.day_start.healed"), 1u);
    // And the quotas count days again: two kept, a third dropped, then the next day resets them.
    Store(kIdQuota2, today + 10), Store(kIdQuota2, today + 4000);
    EXPECT_EQ(Store(kIdQuota2, today + 8000), "over daily quota");
    EXPECT_EQ(Store(kIdQuota2, today + kDay), "");
    EXPECT_EQ(helper_->GetDbStartTime(), today + kDay);
}

// Trimming under a cap below one day's data: the oldest rows by time go, whatever their ids, until the
// stored data fits; the bookkeeping tables stay.
TEST_F(EventDatabaseHelperTest, TrimReachesRecentRowsOldestFirst) {
    uint64_t now = Now();
    sp<EventDatabase> db = EventDatabase::getInstance();
    std::vector<uint64_t> times;
    for (uint64_t age : {90 * kDay, 61 * kDay})
        times.push_back(now - age);
    for (uint64_t i = 0; i < 120; i++)
        times.push_back(now - 3600 + i * 30);  // the last hour
    std::shuffle(times.begin(), times.end(), std::mt19937(7));
    for (uint64_t t : times) {
        ASSERT_TRUE(db->Insert(kTblEventInfo, {kColEventId, kColVersionId, kColFirstTime, kColParamList},
                               {"1", "1", kS(t), std::string(1500, 'e')}));
        helper_->SaveRawEvent(MakeEvent(4, 100000, t, std::string(1500, 'r')));
    }
    Store(kIdMany, start_ + 10);
    const std::string bookkeeping =
            "select (select count(*) from event_daily)||'/'||(select count(*) from db_version)||'/'||"
            "(select count(*) from version)||'/'||(select start_time from db_version)";
    Texts kept = Column(path_, bookkeeping);
    std::sort(times.begin(), times.end());

    int64_t live = LiveSize(path_);
    auto fileBefore = std::filesystem::file_size(path_);
    LogCapture log;
    helper_->AbridgeDbSize(static_cast<uint32_t>(live / 3));
    EXPECT_LT(LiveSize(path_), live / 3);
    EXPECT_LT(std::filesystem::file_size(path_), fileBefore / 2);  // room enough to give the space back
    for (const char* sql : {"select first_time from event_info where event_id = 1 order by first_time",
                            "select timestamp from raw_events order by timestamp"}) {
        Texts left = Column(path_, sql);
        ASSERT_GT(left.size(), 10u);
        ASSERT_LT(left.size(), times.size() / 2);
        Texts newest;
        for (size_t i = times.size() - left.size(); i < times.size(); i++)
            newest.push_back(kS(times[i]));
        EXPECT_EQ(left, newest) << sql;
    }
    EXPECT_EQ(Column(path_, bookkeeping), kept);
    uint64_t rows = Stat("storage.trim.rows");
    EXPECT_EQ(rows, 2 * times.size() + 1 -
                            std::stoull(Column(path_,
                                               "select (select count(*) from event_info) + "
                                               "(select count(*) from raw_events)")[0]));
    EXPECT_EQ(Stat("storage.trim.runs"), 1u);

    // A cap that nothing can meet takes every stored event, and only those, and says so.
    helper_->AbridgeDbSize(1);
    EXPECT_EQ(Column(path_, "select (select count(*) from event_info) + (select count(*) from raw_events)"),
              Texts{"0"});
    EXPECT_EQ(Column(path_, bookkeeping), kept);
    EXPECT_TRUE(log.Contains(ANDROID_LOG_WARN, "AbridgeDbSize no events left to trim")) << log.Dump();
    EXPECT_GT(Stat("storage.trim.rows"), rows);
}

// Runs `scenario` in a child process on a file system of its own, a tmpfs of `kib` KiB mounted at
// `folder` in a private mount namespace: its report, or "skip: " and why there is none.
std::string OnSmallFileSystem(const std::string& folder, int kib, const std::function<std::string()>& scenario) {
    base::unique_fd in, out;
    if (!base::Pipe(&in, &out))
        return "skip: no pipe";
    pid_t child = fork();
    if (child == 0) {
        in.reset();
        std::string report;
        if (unshare(CLONE_NEWNS) != 0 && unshare(CLONE_NEWUSER | CLONE_NEWNS) != 0)
            report = std::string("skip: no mount namespace: ") + strerror(errno);
        else if (mount(nullptr, "/", nullptr, MS_REC | MS_PRIVATE, nullptr) != 0 ||
                 mount("tmpfs", folder.c_str(), "tmpfs", 0, ("size=" + kS(kib) + "k").c_str()) != 0)
            report = std::string("skip: no tmpfs: ") + strerror(errno);
        else
            report = scenario();
        bool written = write(out.get(), report.data(), report.size()) == static_cast<ssize_t>(report.size());
        _exit(written ? 0 : 1);
    }
    out.reset();
    std::string report;
    base::ReadFdToString(in.get(), &report);
    int status = 0;
    waitpid(child, &status, 0);
    return WIFEXITED(status) && WEXITSTATUS(status) == 0 ? report : "child failed, status " + kS(status);
}

// A nearly full disk: room for the small journals of deletes and inserts, none for a vacuum's copy.
// Trimming must still reach today's rows, leave the file as it is, and make room for new events in
// the pages it freed. Runs before any thread exists, so that it may fork.
TEST(EventStoreFullDiskTest, TrimWorksAndFreedPagesAreReused) {
    TempDir work, config;
    WriteFile(config.File("event_quota.xml"), kQuotaDocument);
    std::string report = OnSmallFileSystem(work.path_, 2048, [&] {
        std::ostringstream out;
        {
            FakePluginContext context(work.path_, config.path_);
            sp<EventDatabaseHelper> helper = new EventDatabaseHelper();
            helper->Init(&context, "event.db", "OS3");
            const std::string path = work.File("event.db");
            // Pages still in the write-ahead log count: they go into the file at the next checkpoint.
            auto size = [&] {
                return Column(path, "select page_count * page_size from pragma_page_count, pragma_page_size")[0];
            };
            auto store = [&](int n, const std::string& tag) {
                for (int i = 0; i < n; i++)
                    helper->ProcessFaultEvent(
                            MakeEvent(2, kIdMany, Now() - 600 + i, tag + kS(i) + std::string(1800, 'x')));
            };
            store(150, "old");
            // Fills the disk up to its last 96 KiB.
            struct statvfs fs;
            statvfs(work.path_.c_str(), &fs);
            WriteFile(work.File("filler"), std::string(fs.f_bavail * fs.f_frsize - 96 * 1024, 'f'));
            out << "size_full " << size() << "\n";
            int64_t live = LiveSize(path);
            LogCapture log;
            helper->AbridgeDbSize(static_cast<uint32_t>(live / 2));
            out << "trimmed " << context.GetStats().Value("storage.trim.rows") << "\n";
            out << "under_cap " << (LiveSize(path) < live / 2) << "\n";
            out << "vacuum_tried " << log.Count(ANDROID_LOG_DEBUG, ":VACUUM") << "\n";
            out << "size_trimmed " << size() << "\n";
            store(60, "new");
            out << "new_stored " << Column(path, "select count(*) from event_info where param_list like 'new%'")[0]
                << "\n";
            out << "size_after " << size() << "\n";
            EventDatabase::getInstance()->Close();
        }
        return out.str();
    });
    if (report.rfind("skip: ", 0) == 0)
        GTEST_SKIP() << report;
    std::map<std::string, uint64_t> figures;
    std::istringstream lines(report);
    for (std::string name, value; lines >> name >> value;)
        figures[name] = std::stoull(value);
    EXPECT_GT(figures["trimmed"], 0u) << report;
    EXPECT_LT(figures["trimmed"], 150u) << report;
    EXPECT_EQ(figures["under_cap"], 1u) << report;
    EXPECT_EQ(figures["vacuum_tried"], 0u) << report;
    EXPECT_EQ(figures["new_stored"], 60u) << report;
    // The file neither shrank nor grew: the new events live in the pages the trim freed.
    EXPECT_EQ(figures["size_trimmed"], figures["size_full"]) << report;
    EXPECT_EQ(figures["size_after"], figures["size_full"]) << report;
}

}  // namespace android::Orvane
