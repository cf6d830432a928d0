#include "storage/event_storage_manager.h"

#include <future>

#include <gtest/gtest.h>

#include "platform/plugin_factory.h"
#include "tests/common/fake_plugin_context.h"
#include "tests/common/log_capture.h"
#include "tests/storage/storage_test_util.h"
#include "utils/dev_info.h"

namespace android::Orvane {

class EventStorageManagerTest : public ::testing::Test {
protected:
    // Creates the plugin as the platform does, on a loop of its own.
    void SetUp() override {
        plugin_ = static_cast<EventStorageManager*>(PluginFactory::CreatePlugin("EventStorageManager").get());
        ASSERT_NE(plugin_, nullptr);
        plugin_->SetPluginContext(&context_);
        plugin_->SetLooper(new EventLoop("storage_loop"));
        plugin_->GetLooper()->StartLoop();
    }
    // The loop stops before the database closes, so that no queued check runs against a closed file.
    void TearDown() override { plugin_->GetLooper()->StopLoop(), EventDatabase::getInstance()->Close(); }
    // Hands the event to the plugin on its loop, as a pipeline does: its result, and its raw row id after a '/'.
    std::string Deliver(uint32_t type, uint32_t id, uint64_t happenTime, const std::string& params = "p") {
        sp<Event> event = MakeEvent(type, id, happenTime, params);
        std::promise<EVENT_RET> result;
        plugin_->GetLooper()->AddTask([&] { result.set_value(plugin_->OnEvent(event)); });
        std::string ret = std::to_string(result.get_future().get()), rawId = event->GetValue("rawEventDbID");
        return ret + (rawId.empty() ? "" : "/" + rawId);
    }
    std::string Dump(const Texts& args) {
        return DumpOf([&](int fd) { plugin_->Dump(fd, args); });
    }
    // The helper belongs to the plugin's loop, so it is read there.
    uint64_t DbStartTime() {
        std::promise<uint64_t> start;
        plugin_->GetLooper()->AddTask([&] { start.set_value(plugin_->GetHelper()->GetDbStartTime()); });
        return start.get_future().get();
    }

    TempDir work_;
    std::string path_ = work_.File("event.db");
    FakePluginContext context_{work_.path_, work_.path_};
    sp<EventStorageManager> plugin_;
};

TEST_F(EventStorageManagerTest, RoutesByCategoryAndId) {
    plugin_->OnLoad();
    uint64_t now = DbStartTime() + 10;
    // Categories other than raw (4) and control (1) store fault ids, and only those; others end the pipeline.
    const std::pair<uint32_t, uint32_t> events[] = {{2, 888888889}, {2, 799999999}, {2, 899999999}, {2, 900000000},
                                                    {3, 800000000}, {0, 888888888}, {2, 999999999}, {4, 99999},
                                                    {4, 100000},    {4, 199999},    {4, 200000},    {4, 901000001},
                                                    {1, 105},       {1, 104}};
    std::string results;
    for (const auto& [type, id] : events)
        results += Deliver(type, id, now + id % 7) + " ";
    EXPECT_EQ(results, "-1 -1 -1 0 0 0 0 0 0/1 0/2 0 0 0 0 ");
    EXPECT_EQ(Column(path_, "select event_id from event_info order by id"),
              (Texts{"900000000", "800000000", "888888888", "999999999"}));
    EXPECT_EQ(Column(path_, "select activate_time from db_version"), Texts{std::to_string(now + 105 % 7)});
}

TEST_F(EventStorageManagerTest, SmallSizeLimitAbridgesEveryCheckTime) {
    context_.SetSysProperity("orvane.store.checksize", "1");
    context_.SetSysProperity("orvane.store.checktime", "1");
    plugin_->OnLoad();
    // Once at load, then again a check time later, each re-reading the properties.
    ASSERT_TRUE(WaitUntil([&] { return context_.GetStats().Value("storage.trim.runs") >= 2; }));
}

TEST_F(EventStorageManagerTest, DumpCommands) {
    plugin_->OnLoad();
    for (uint32_t i = 0; i < 25; i++)
        Deliver(2, 901000000 + i, 100, "row" + std::to_string(i));
    const Texts update = {"update", "event_info", "param_list", "x'; drop table version; --", "id", "4"};
    EXPECT_EQ(Dump(update), "not support cmd\n");  // updates only where the safety check is off
    context_.SetSysProperity("persist.sys.orvane.safecheck", "0");
    const std::pair<Texts, std::string> cases[] = {
            {{"query", "version", "1"}, "id | version\n1 | " + DevInfo::GetQuorVersion() + "\n"},
            {{"query", "sqlite_master"}, "unknown table sqlite_master\n"},
            {update, "update ok\n"},
            {{"update", "event_info", "visible", "1; drop table version", "id", "3"},
             "invalid value 1; drop table version\n"},
            {{"update", "event_info", "visible", "1", "id = 1 or 1", "1"}, "unknown column id = 1 or 1\n"},
            {{"update", "event_info"}, "usage: update <table> <column> <value> <whereColumn> <whereValue>\n"},
            {{"quota", "abc"}, "EventId abc invalid\n"},
            {{"drop"},
             "usage: query <table> [limit] | update <table> <column> <value> <whereColumn> <whereValue> "
             "| quota <eventId>\n"},
    };
    for (const auto& [args, out] : cases)
        EXPECT_EQ(Dump(args), out);
    EXPECT_EQ(Column(path_, "select param_list from event_info where id = 4"), Texts{"x'; drop table version; --"});
    // The default of 20 rows, newest first, under the column names.
    std::string rows = Dump({"query", "event_info"});
    EXPECT_EQ(std::count(rows.begin(), rows.end(), '\n'), 21);
    EXPECT_EQ(rows.substr(0, rows.find('\n', rows.find('\n') + 1) + 1),
              "id | event_id | trace_id | pspan_id | span_id | version_id | occured_cnt | first_time | param_list | "
              "expire | visible\n25 | 901000024 |  |  |  | 1 | 1 | 100 | row24 | 0 | 0\n");
}

// Events queued behind each other share a transaction, at most EventDatabase::kMaxBatchEvents of
// them; a lone event is committed before the loop turns to anything else. Every event is stored.
TEST_F(EventStorageManagerTest, BacklogSharesCommitsAndALoneEventCommitsAtOnce) {
    plugin_->OnLoad();
    uint64_t now = DbStartTime() + 10;
    auto stat = [&](const char* name) { return context_.GetStats().Value(name); };
    uint64_t commitsBefore = stat("storage.db.commits");
    const uint32_t backlog = 2 * EventDatabase::kMaxBatchEvents + 100;
    std::promise<void> release;
    std::shared_future<void> released = release.get_future().share();
    plugin_->GetLooper()->AddTask([released] { released.wait(); });
    for (uint32_t i = 0; i < backlog; i++) {
        sp<Event> event = MakeEvent(2, 901000000 + i, now, "queued");
        plugin_->GetLooper()->AddTask([this, event]() mutable { plugin_->OnEvent(event); });
    }
    release.set_value();
    ASSERT_TRUE(WaitUntil([&] { return stat("storage.events.committed") == backlog; }))
            << stat("storage.events.committed");
    // Three full batches at most, and the commit queued behind the backlog.
    uint64_t commits = stat("storage.db.commits") - commitsBefore;
    EXPECT_GE(commits, 3u);
    EXPECT_LE(commits, 4u);
    EXPECT_EQ(Column(path_, "select count(*) from event_info where param_list = 'queued'"),
              Texts{std::to_string(backlog)});

    // The commit of a lone event is the next entry of the loop: a task queued after it sees it on disk.
    Deliver(2, 902000001, now, "alone");
    std::promise<Texts> seen;
    plugin_->GetLooper()->AddTask(
            [&] { seen.set_value(Column(path_, "select count(*) from event_info where param_list = 'alone'")); });
    EXPECT_EQ(seen.get_future().get(), Texts{"1"});
    EXPECT_EQ(stat("storage.events.committed"), backlog + 1);
}

}  // namespace android::Orvane
