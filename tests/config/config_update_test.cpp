// A configuration pushed with "config-update" takes effect on the next event: the real platform,
// storage plugin and service in one process, with a test event source in front of the fault
// pipeline that also listens to what the pipeline finished.

#include <memory>
#include <mutex>

#include <android-base/file.h>
#include <gtest/gtest.h>

#include "platform/plugin_factory.h"
#include "platform/plugin_platform.h"
#include "service/orvane_service.h"
#include "storage/event_database.h"
#include "tests/common/log_capture.h"
#include "utils/dev_info.h"
#include "utils/file_util.h"
#include "utils/time_util.h"

namespace android::Orvane {

class ConfigUpdateSource : public EventSource {
public:
    void OnLoad() override { SetName("ConfigUpdateSource"); }
    void StartEventSource() override { running_ = this; }
    // As the pipeline's listener: every event the storage plugin finished, dropped or not.
    EVENT_RET OnEvent(sp<Event>& event) override {
        std::lock_guard<std::mutex> lock(mutex_);
        finished_.push_back(event);
        return 0;
    }
    std::vector<sp<Event>> Finished(uint32_t id) {
        std::lock_guard<std::mutex> lock(mutex_);
        std::vector<sp<Event>> found;
        for (const sp<Event>& event : finished_)
            if (event->eventId == id)
                found.push_back(event);
        return found;
    }
    static inline std::atomic<ConfigUpdateSource*> running_{nullptr};

private:
    std::mutex mutex_;
    std::vector<sp<Event>> finished_;
};
ORVANE_REGISTER_PLUGIN(ConfigUpdateSource);

namespace {

constexpr uint32_t kIdA = 901001001, kIdB = 901001002;

class ConfigUpdateTest : public testing::Test {
protected:
    void SetUp() override {
        Write(system_, "plugin_config",
              "plugins:2\nEventStorageManager[thread:storage_loop]:0 static\n"
              "ConfigUpdateSource[thread:source_loop]:0 static\npipelines:1\ndftFaultEvent: EventStorageManager\n"
              "pipelinetriggers:1\nConfigUpdateSource: dftFaultEvent\n");
        Write(system_, "event_quota.xml",
              Quota("<Event eventId=\"901001001\" dailyCnt=\"2\"/>"
                    "<Event eventId=\"901001002\" dailyCnt=\"1\"/>"));
        std::string work = Dir(root_) + "work", cloud = Dir(root_) + "cloud";
        const char* argv[] = {"orvane",       "-configDir",  system_.path, "-workDir", work.c_str(),
                              "-cloudCfgDir", cloud.c_str(), "-region",    "CN"};
        ASSERT_EQ(platform_->ParseArgs(9, const_cast<char**>(argv)), 0);
        ASSERT_TRUE(platform_->StartPlatform());
        ASSERT_TRUE(WaitUntil([] { return ConfigUpdateSource::running_ != nullptr; }));
        platform_->RegisterPipelineListener("dftFaultEvent", ConfigUpdateSource::running_.load());
    }
    void TearDown() override {
        ConfigUpdateSource::running_ = nullptr;
        platform_.reset();
        EventDatabase::getInstance()->Close();
    }

    static std::string Dir(const TemporaryDir& dir) { return std::string(dir.path) + "/"; }
    static void Write(const TemporaryDir& dir, const std::string& name, const std::string& content) {
        ASSERT_TRUE(FileUtil::SaveStringToFile(Dir(dir) + name, content, true));
    }
    // A quota document whose section for the running version holds the given elements.
    static std::string Quota(const std::string& elements) {
        const std::string os = DevInfo::GetQuorVersion();
        return "<EventQuota><" + os +
               "><Domain name=\"d\" eventMin=\"901000000\" eventMax=\"901999999\" "
               "dailyCnt=\"1000000\"/>" +
               elements + "</" + os + "></EventQuota>";
    }

    // Publishes `count` events of id, each in an hour period of its own so that only the daily
    // quota decides, waits until the pipeline finished them and returns how many were kept.
    size_t Kept(uint32_t id, int count) {
        ConfigUpdateSource* source = ConfigUpdateSource::running_.load();
        size_t before = source->Finished(id).size();
        for (int i = 0; i < count; ++i, ++published_) {
            sp<Event> event = new Event("test");
            event->eventType = 2, event->eventId = id, event->happenTime = day_ + 60 + 4000 * published_;
            source->PublishPipelineEvent(event);
        }
        EXPECT_TRUE(WaitUntil([&] { return source->Finished(id).size() == before + count; }));
        std::vector<sp<Event>> finished = source->Finished(id);
        size_t kept = 0;
        for (size_t i = before; i < finished.size(); ++i)
            kept += finished[i]->GetValue("dropReason").empty();
        return kept;
    }

    TemporaryDir root_, system_, pushed_, broken_;
    std::unique_ptr<PluginPlatform> platform_ = std::make_unique<PluginPlatform>();
    sp<OrvaneService> service_ = new OrvaneService(platform_.get());
    uint64_t day_ = static_cast<uint64_t>(TimeUtil::GetZeroTimestampSec(TimeUtil::GetTimestampSecond()));
    int published_ = 0;
};

TEST_F(ConfigUpdateTest, PushedQuotaCountsFromTheNextEventAndABrokenOneIsPassedOver) {
    LogCapture log;
    EXPECT_EQ(Kept(kIdA, 3), 2u);  // the system copy: 2 a day

    Write(pushed_, "event_quota.xml",
          Quota("<Event eventId=\"901001001\" dailyCnt=\"5\"/>"
                "<Event eventId=\"901001002\" dailyCnt=\"5\"/>"));
    service_->NotifyConfigUpdate(pushed_.path);
    EXPECT_EQ(Kept(kIdA, 3), 2u);  // 5 a day now (drops count too): the 4th and 5th are kept

    // A pushed copy cut short: what it holds before the break must not count either.
    std::string broken = Quota("<Event eventId=\"901001002\" dailyCnt=\"9\"/>");
    Write(broken_, "event_quota.xml", broken.substr(0, broken.find("</")));
    service_->NotifyConfigUpdate(broken_.path);
    EXPECT_EQ(Kept(kIdB, 3), 1u);  // the system copy again: 1 a day
    EXPECT_EQ(log.Count(ANDROID_LOG_WARN, "does not parse"), 1u) << log.Dump();
    EXPECT_EQ(platform_->GetStats().Value("config.cloud_rejected.event_quota.xml"), 1u);

    // Pushing the good folder again brings its quota back without a restart.
    service_->NotifyConfigUpdate(pushed_.path);
    EXPECT_EQ(Kept(kIdB, 1), 1u);  // the 4th of the day, kept under 5 a day
}

}  // namespace
}  // namespace android::Orvane
