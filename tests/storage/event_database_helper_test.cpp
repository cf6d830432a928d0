#include "storage/event_database_helper.h"

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
constexpr uint64_t kDay = 86400;
const auto kS = [](uint64_t value) { return std::to_string(value); };

class EventDatabaseHelperTest : public ::testing::Test {
protected:
    void SetUp() override {
        WriteFile(config_.File("event_quota.xml"),
                  "<?xml version=\"1.0\" encoding=\"utf-8\"?>\n<Quota>\n<OS3>\n  <Summary defDailyCnt=\"200\"/>\n"
                  "  <Domain name=\"fault\" eventMin=\"901000000\" eventMax=\"901999999\" dailyCnt=\"48\"/>\n"
                  "  <Event eventId=\"901000002\" dailyCnt=\"2\"/>\n</OS3>\n</Quota>\n");
        ASSERT_TRUE(helper_->Init(&context_, "event.db", "OS3"));
        start_ = helper_->GetDbStartTime();
    }
    void TearDown() override { EventDatabase::getInstance()->Close(); }
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
    EventDatabase::getInstance()->Close();
    helper_ = new EventDatabaseHelper();
    ASSERT_TRUE(helper_->Init(&context_, "event.db", "OS3"));
    EXPECT_EQ(helper_->GetDbStartTime(), static_cast<uint64_t>(TimeUtil::GetZeroTimestampSec(next)));
    EXPECT_EQ(Store(kIdQuota2, next + 4000), "");
    EXPECT_EQ(Store(kIdQuota2, next + 4001), "over daily quota");

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

TEST_F(EventDatabaseHelperTest, AbridgeRemovesOldestEventsAndShrinksTheFile) {
    uint64_t now = TimeUtil::GetTimestampSecond();
    sp<EventDatabase> db = EventDatabase::getInstance();
    const Texts columns = {kColEventId, kColVersionId, kColFirstTime, kColParamList};
    for (uint64_t age : {90 * kDay, 61 * kDay, 40 * kDay, 20 * kDay, 2 * kDay}) {
        for (int i = 0; i < 10; i++) {
            ASSERT_TRUE(db->Insert(kTblEventInfo, columns, {"1", "1", kS(now - age), std::string(4000, 'f')}));
            helper_->SaveRawEvent(MakeEvent(4, 100000, now - age, std::string(4000, 'f')));
        }
    }
    ASSERT_TRUE(db->Insert(kTblEventInfo, columns, {"2", "1", kS(now + kDay), "from the future"}));
    Store(kIdQuota48, now - 60);
    const std::string counts = "select (select count(*) from event_info)||','||(select count(*) from raw_events)";
    ASSERT_EQ(Column(path_, counts), Texts{"52,50"});
    LogCapture log;
    helper_->AbridgeDbSize(UINT32_MAX);  // a generous limit: one round removes what is older than 60 days
    EXPECT_EQ(log.Count(ANDROID_LOG_INFO, "AbridgeDbSize round "), 1u);
    EXPECT_EQ(Column(path_, counts), Texts{"32,30"});
    auto before = std::filesystem::file_size(path_);
    helper_->AbridgeDbSize(1);  // an unreachable limit: eight rounds, each halving the distance to now
    EXPECT_EQ(log.Count(ANDROID_LOG_INFO, "AbridgeDbSize round "), 9u);
    EXPECT_EQ(Column(path_, counts), Texts{"2,0"});  // the last minute's event and the one from the future
    EXPECT_LT(std::filesystem::file_size(path_), before / 2);
}

}  // namespace android::Orvane
