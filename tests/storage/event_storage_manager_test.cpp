#include "storage/event_storage_manager.h"

#include <gtest/gtest.h>

#include <fstream>
#include <future>
#include <sstream>

#include "platform/plugin_factory.h"
#include "storage/event_table.h"
#include "tests/common/log_capture.h"
#include "tests/storage/fake_plugin_context.h"
#include "tests/storage/storage_test_util.h"
#include "utils/dev_info.h"

namespace android {
namespace Orvane {
namespace {

std::string ReadFile(const std::string& path) {
    std::ifstream in(path, std::ios::binary);
    std::stringstream content;
    content << in.rdbuf();
    return content.str();
}

class EventStorageManagerTest : public ::testing::Test {
protected:
    void SetUp() override {
        std::ofstream(config_.File("event_quota.xml"))
            << "<?xml version=\"1.0\" encoding=\"utf-8\"?>\n<Quota>\n<" << DevInfo::GetQuorVersion() << ">\n"
            << "  <Domain name=\"fault\" eventMin=\"901000000\" eventMax=\"901999999\" dailyCnt=\"48\"/>\n"
            << "</" << DevInfo::GetQuorVersion() << ">\n</Quota>\n";
        context_ = new FakePluginContext(work_.Path(), config_.Path());
    }
    void TearDown() override {
        plugin_.clear();
        EventDatabase::getInstance()->Close();
        delete context_;
    }

    // Creates the plugin as the platform does and loads it on a loop of its own.
    void Load(bool withLoop = true) {
        sp<Plugin> plugin = PluginFactory::CreatePlugin("EventStorageManager");
        ASSERT_NE(plugin, nullptr);
        plugin_ = static_cast<EventStorageManager*>(plugin.get());
        plugin_->SetName("configured");
        plugin_->SetPluginContext(context_);
        if (withLoop) {
            sp<EventLoop> loop = new EventLoop("storage_loop");
            loop->StartLoop();
            plugin_->SetLooper(loop);
        }
        plugin_->OnLoad();
    }
    // Hands the event to the plugin on its loop, as a pipeline does, and returns its result.
    EVENT_RET Deliver(uint32_t type, uint32_t id, uint64_t happenTime = 0) {
        sp<Event> event = new Event("test");
        event->eventType = type;
        event->eventId = id;
        event->happenTime = happenTime;
        last_ = event;
        std::promise<EVENT_RET> result;
        plugin_->GetLooper()->AddTask([&] { result.set_value(plugin_->OnEvent(event)); });
        return result.get_future().get();
    }
    std::string DumpOf(const std::vector<std::string>& args) {
        std::string path = work_.File("dump.txt");
        FILE* file = fopen(path.c_str(), "w+");
        plugin_->Dump(fileno(file), args);
        fclose(file);
        return ReadFile(path);
    }
    size_t Rows(const std::string& table) {
        std::promise<size_t> count;
        plugin_->GetLooper()->AddTask([&] {
            EventQuery query;
            count.set_value(EventDatabase::getInstance()->Query(table, query.Select({COL_ID}), -1).size());
        });
        return count.get_future().get();
    }

    TempDir work_;
    TempDir config_;
    FakePluginContext* context_ = nullptr;
    sp<EventStorageManager> plugin_;
    sp<Event> last_;
};

TEST_F(EventStorageManagerTest, LoadsNamedAndChecksTheStoreAtOnce) {
    LogCapture log;
    Load();
    EXPECT_EQ(plugin_->GetName(), "EventStorageManager");
    EXPECT_EQ(plugin_->GetVersion(), "EventStorageManager-1.0");
    EXPECT_EQ(plugin_->GetHelper()->GetDbPath(), work_.File("event.db"));
    EXPECT_TRUE(log.WaitFor(ANDROID_LOG_DEBUG, "GetStoreProperity prop orvane.store.checktime use default value"));
    EXPECT_TRUE(log.Contains(ANDROID_LOG_DEBUG, "GetStoreProperity prop orvane.store.checksize use default value"));
    EXPECT_FALSE(log.Contains(ANDROID_LOG_INFO, "AbridgeDbSize"));
}

TEST_F(EventStorageManagerTest, WithoutLoopNoSizeCheckRuns) {
    LogCapture log;
    Load(false);
    EXPECT_TRUE(log.Contains(ANDROID_LOG_ERROR, "OnLoad storage manager looper not set"));
    EXPECT_FALSE(log.Contains(ANDROID_LOG_DEBUG, "GetStoreProperity"));
    // Events are still handled, on the caller's thread.
    sp<Event> event = new Event("test");
    event->eventType = 2;
    event->eventId = 901000001;
    event->happenTime = plugin_->GetHelper()->GetDbStartTime() + 1;
    EXPECT_EQ(plugin_->OnEvent(event), 0);
    EXPECT_EQ(DumpOf({"query", "event_daily", "5"}).find("901000001") != std::string::npos, true);
}

TEST_F(EventStorageManagerTest, RoutesByCategoryAndId) {
    Load();
    uint64_t now = plugin_->GetHelper()->GetDbStartTime() + 10;
    EXPECT_EQ(static_cast<uint32_t>(Deliver(2, 888888889, now)), 4294967295u);
    EXPECT_EQ(static_cast<uint32_t>(Deliver(2, 799999999, now)), 4294967295u);
    EXPECT_EQ(Deliver(2, 900000000, now), 0);
    EXPECT_EQ(Deliver(3, 800000000, now), 0);
    EXPECT_EQ(Deliver(0, 888888888, now), 0);
    EXPECT_EQ(Deliver(2, 999999999, now), 0);
    EXPECT_EQ(Rows(TBL_EVENT_INFO), 4u);

    EXPECT_EQ(Deliver(4, 200000, now), 0);
    EXPECT_EQ(last_->GetValue("rawEventDbID"), "");
    EXPECT_EQ(Deliver(4, 100000, now), 0);
    EXPECT_EQ(last_->GetValue("rawEventDbID"), "1");
    EXPECT_EQ(Deliver(4, 199999, now), 0);
    EXPECT_EQ(last_->GetValue("rawEventDbID"), "2");
    EXPECT_EQ(Deliver(4, 901000001, now), 0);  // a fault id as a raw event is not stored
    EXPECT_EQ(Rows(TBL_RAW_EVENTS), 2u);

    EXPECT_EQ(Deliver(1, 104, 1500000000), 0);
    EXPECT_EQ(Deliver(1, 105, 1600000000), 0);
    EXPECT_EQ(DevInfo::GetActivateTime(), 1600000000u);
    EXPECT_EQ(Rows(TBL_EVENT_INFO), 4u);
}

TEST_F(EventStorageManagerTest, StoreProperties) {
    Load(false);
    EXPECT_EQ(plugin_->GetStoreProperity("orvane.store.checktime", 86400), 86400u);
    for (const char* unusable : {"0", "abc", "-5"}) {
        context_->SetProperty("orvane.store.checktime", unusable);
        EXPECT_EQ(plugin_->GetStoreProperity("orvane.store.checktime", 86400), 86400u) << unusable;
    }
    context_->SetProperty("orvane.store.checktime", "5");
    EXPECT_EQ(plugin_->GetStoreProperity("orvane.store.checktime", 86400), 5u);
}

TEST_F(EventStorageManagerTest, SmallSizeLimitAbridgesEveryCheckTime) {
    context_->SetProperty("orvane.store.checksize", "1");
    context_->SetProperty("orvane.store.checktime", "1");
    LogCapture log;
    Load();
    // Once at load, then again a check time later, each re-reading the properties.
    ASSERT_TRUE(WaitUntil([&] { return log.Count(ANDROID_LOG_INFO, "AbridgeDbSize round 1 ") >= 2; }))
        << log.Dump();
    // 0 means the default of 200 MiB, which this file is far below.
    context_->SetProperty("orvane.store.checksize", "0");
    size_t seen = log.Count(ANDROID_LOG_INFO, "AbridgeDbSize round 1 ");
    ASSERT_TRUE(WaitUntil([&] {
        return log.Count(ANDROID_LOG_DEBUG, "GetStoreProperity prop orvane.store.checksize use default value") >= 2;
    }));
    EXPECT_LE(log.Count(ANDROID_LOG_INFO, "AbridgeDbSize round 1 "), seen + 1);
}

TEST_F(EventStorageManagerTest, DumpCommands) {
    Load();
    uint64_t now = plugin_->GetHelper()->GetDbStartTime() + 10;
    Deliver(2, 901000001, now);
    EXPECT_EQ(DumpOf({}), "");
    EXPECT_EQ(DumpOf({"query", "version"}), "id | version\n1 | " + DevInfo::GetQuorVersion() + "\n");
    EXPECT_EQ(DumpOf({"update", "event_info", "visible", "1", "id", "1"}), "not support cmd\n");
    context_->SetProperty("persist.sys.orvane.safecheck", "1");
    EXPECT_EQ(DumpOf({"update", "event_info", "visible", "1", "id", "1"}), "not support cmd\n");
    context_->SetProperty("persist.sys.orvane.safecheck", "0");
    EXPECT_EQ(DumpOf({"update", "event_info", "visible", "1", "id", "1"}), "update ok\n");
    EXPECT_NE(DumpOf({"query", "event_info"}).find(" | 0 | 1\n"), std::string::npos);

    EXPECT_EQ(DumpOf({"quota", "901000001"}),
              "EventId 901000001 quota :\n    dailyCnt = 48\n    logCnt = 10    realLog = 0    logSpace = 300    "
              "sameLog = 0    inSub = 0\n    minEvent = 901000000    maxEvent = 901999999\n");
    EXPECT_EQ(DumpOf({"quota", "abc"}), "EventId abc invalid\n");
    EXPECT_EQ(DumpOf({"quota"}).rfind("usage:", 0), 0u);
    EXPECT_EQ(DumpOf({"drop"}).rfind("usage:", 0), 0u);
}

}  // namespace
}  // namespace Orvane
}  // namespace android
