// The shipped plugins and pipeline with subscriptions of their own, started by the real platform:
// subscribed events carry their expiry and visibility into "event.db", leave one record each in
// "eventinfo.<domain>", and "pack-log" hands the files over to "uploading".

#include <android-base/file.h>
#include <android-base/strings.h>
#include <gtest/gtest.h>
#include <json/json.h>

#include "platform/plugin_factory.h"
#include "platform/plugin_platform.h"
#include "storage/event_database.h"
#include "tests/common/envelope_opener.h"
#include "tests/common/log_capture.h"
#include "tests/common/test_data.h"
#include "tests/storage/storage_test_util.h"
#include "utils/dev_info.h"
#include "utils/file_util.h"
#include "utils/sys_env.h"
#include "utils/time_util.h"

namespace android::Orvane {
namespace {

class EventInfoTestSource : public EventSource {
public:
    void OnLoad() override { SetName("EventInfoTestSource"); }
    void StartEventSource() override { running_ = this; }
    static inline std::atomic<EventInfoTestSource*> running_{nullptr};
};
ORVANE_REGISTER_PLUGIN(EventInfoTestSource);

TEST(EventInfoPlatformTest, SubscribedEventsAreStoredRecordedAndHandedOver) {
    TempDir root;
    const std::string etc = TestDataDir() + "/etc/";
    for (const char* name : {"event.xml", "event_quota.xml", "privacy_policy.xml", "privacy_server_key.pem"}) {
        WriteFile(root.File(name), ReadFile(etc + name));
    }
    // No log rules: every event gets "NO_LOG_CONFIG" instead of a pack, which the record names.
    WriteFile(root.File("event_upload.xml"), R"(<EventUpload>
  <Subscribe eventMin="901000000" eventMax="901999999" expire="30" visible="false"/>
  <Subscribe eventId="901001001" expire="90" visible="true"/>
  <Subscribe eventMin="905000000" eventMax="905999999" expire="60" visible="false"/>
</EventUpload>)");
    WriteFile(root.File("plugin_config"),
              ReadFile(etc + "plugin_config") +
                      "\nplugins:1\nEventInfoTestSource[thread:source_loop]:0 static\npipelinetriggers:1\n"
                      "EventInfoTestSource: dftFaultEvent\n");
    std::string configDir = root.path_, workDir = root.File("work/"), cloudDir = root.File("cloud");
    const char* argv[] = {"orvane",       "-configDir",     configDir.c_str(), "-workDir", workDir.c_str(),
                          "-cloudCfgDir", cloudDir.c_str(), "-region",         "CN"};
    SysEnv::SetSysProperity("ro.serialno", "PLATFORM0SERIAL");
    SysEnv::SetSysProperity("ro.quor.build.region", "CN");
    DevInfo::SetActivateTime(TimeUtil::GetTimestampSecond());
    DevInfo::SetUploadSwitch(1);
    // Before the loops start: mktime's time zone set-up takes a lock of libc's that ThreadSanitizer
    // does not see.
    uint64_t day = static_cast<uint64_t>(TimeUtil::GetZeroTimestampSec(TimeUtil::GetTimestampSecond()));
    auto platform = std::make_unique<PluginPlatform>();
    ASSERT_EQ(platform->ParseArgs(9, const_cast<char**>(argv)), 0);
    ASSERT_TRUE(platform->StartPlatform());
    ASSERT_TRUE(WaitUntil([] { return EventInfoTestSource::running_ != nullptr; }));

    auto publish = [&](uint32_t id, const std::string& params, uint64_t at) {
        EventInfoTestSource::running_.load()->PublishPipelineEvent(MakeEvent(2, id, day + at, params));
    };
    for (int i = 0; i < 4; ++i) {  // the daily quota is 3: the fourth is dropped and leaves no record
        publish(901001001, R"({"reason":"wlan firmware crash","uptime":5120,"user":"alice"})", 60 + 4000 * i);
    }
    publish(901001002, R"({"task":"kworker/2:1","blockedSec":120})", 100);
    publish(905001001, R"({"device":"sda","errno":5,"sector":123456})", 200);
    publish(903000001, R"({"anything":"at all"})", 300);
    DaemonStats& stats = platform->GetStats();
    ASSERT_TRUE(WaitUntil([&] {
        return stats.Value("eventinfo.901.written") == 4 && stats.Value("eventinfo.905.written") == 1 &&
               stats.Value("storage.events.dropped.over_daily_quota") == 1;
    }));

    Texts rows = Column(workDir + "event.db",
                        "select event_id||' '||expire||' '||visible from event_info where event_id != 908001001 "
                        "order by event_id");
    EXPECT_EQ(rows, (Texts{"901001001 90 1", "901001002 30 0", "903000001 0 0", "905001001 60 0"}));

    std::vector<Json::Value> records;
    for (const std::string& line : base::Split(ReadFile(workDir + "eventinfo.901"), "\n")) {
        if (!line.empty()) {
            records.emplace_back();
            ASSERT_TRUE(Json::Reader().parse(line, records.back())) << line;
        }
    }
    ASSERT_EQ(records.size(), 4u);
    EXPECT_EQ(records[0]["eventId"].asUInt(), 901001001u);
    // What privacy compliance left: "user" is not in the catalogue entry.
    EXPECT_FALSE(records[0]["param_list"].isMember("user"));
    EXPECT_EQ(records[0]["param_list"]["reason"].asString(), "wlan firmware crash");
    EXPECT_EQ(records[0]["zipLogName"].asString(), "NO_LOG_CONFIG");
    EXPECT_EQ(records[0]["expire"].asUInt(), 90u);
    std::string serial;
    EnvelopeOpener server(ReadFile(TestDataDir() + "/tests/common/privacy_test_server_private_key.pem"));
    ASSERT_TRUE(server.Open(records[3]["serialNo"].asString(), serial));
    EXPECT_EQ(serial, "PLATFORM0SERIAL");

    // "pack-log" as the service sends it.
    sp<Event> packLog = new Event("test");
    packLog->eventType = 1;
    packLog->eventId = 101;
    ASSERT_TRUE(platform->PostSyncEventToTarget("EventLogProcessor", packLog));
    EXPECT_GE(packLog->GetIntValue("EVENT_SERVICE_UPLOAD_RET"), 0);
    ASSERT_TRUE(WaitUntil([&] { return FileUtil::FileExists(workDir + "uploading/eventinfo.905"); }));
    EXPECT_TRUE(FileUtil::FileExists(workDir + "uploading/eventinfo.901"));
    EXPECT_FALSE(FileUtil::FileExists(workDir + "eventinfo.901"));
    std::string dump = DumpOf([&](int fd) { platform->GetPlugins()["EventInfoPack"]->Dump(fd, {}); });
    EXPECT_NE(dump.find("domain 901: records written 4, files handed over 1, files waiting 0"), std::string::npos)
            << dump;
    EXPECT_EQ(stats.Value("eventinfo.905.handed_over"), 1u);

    EventInfoTestSource::running_ = nullptr;
    platform.reset();
    EventDatabase::getInstance()->Close();
}

}  // namespace
}  // namespace android::Orvane
