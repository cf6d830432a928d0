// The shipped configuration (plugins, catalogue, quotas, privacy policy and test server key),
// started by the real platform with a test event source in front of its fault pipeline: what
// reaches "event.db" is only what the catalogue and the policy allow.

#include <android-base/file.h>
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
#include "utils/time_util.h"

namespace android::Orvane {
namespace {

// Publishes what the test hands it and, as a listener of the pipeline, counts what it finished.
class PrivacyTestSource : public EventSource {
public:
    void OnLoad() override { SetName("PrivacyTestSource"); }
    void StartEventSource() override { running_ = this; }
    EVENT_RET OnEvent(sp<Event>&) override {
        finished_++;
        return 0;
    }
    static inline std::atomic<PrivacyTestSource*> running_{nullptr};
    static inline std::atomic<int> finished_{0};
};
ORVANE_REGISTER_PLUGIN(PrivacyTestSource);

TEST(PrivacyPlatformTest, OnlyWhatThePolicyAllowsIsStored) {
    TempDir root;
    const std::string etc = TestDataDir() + "/etc/";
    for (const char* name : {"event.xml", "event_quota.xml", "privacy_policy.xml", "privacy_server_key.pem"}) {
        WriteFile(root.File(name), ReadFile(etc + name));
    }
    WriteFile(root.File("plugin_config"),
              ReadFile(etc + "plugin_config") +
                      "\nplugins:1\nPrivacyTestSource[thread:source_loop]:0 static\npipelinetriggers:1\n"
                      "PrivacyTestSource: dftFaultEvent\n");
    std::string configDir = root.path_, workDir = root.File("work"), cloudDir = root.File("cloud");
    const char* argv[] = {"orvane",       "-configDir",     configDir.c_str(), "-workDir", workDir.c_str(),
                          "-cloudCfgDir", cloudDir.c_str(), "-region",         "CN"};
    auto platform = std::make_unique<PluginPlatform>();
    ASSERT_EQ(platform->ParseArgs(9, const_cast<char**>(argv)), 0);
    DevInfo::SetUploadSwitch(1);
    ASSERT_TRUE(platform->StartPlatform());
    ASSERT_TRUE(WaitUntil([] { return PrivacyTestSource::running_ != nullptr; }));
    platform->RegisterPipelineListener("dftFaultEvent", PrivacyTestSource::running_.load());

    uint64_t day = static_cast<uint64_t>(TimeUtil::GetZeroTimestampSec(TimeUtil::GetTimestampSecond()));
    auto publish = [&](uint32_t id, const std::string& params, uint64_t at = 60) {
        PrivacyTestSource::running_.load()->PublishPipelineEvent(MakeEvent(2, id, day + at, params));
    };
    const std::string longReason(300, 'r');
    for (int i = 0; i < 4; ++i) {  // the fourth goes over the daily quota of 3: storage's own report follows
        publish(901001001, R"({"reason":")" + longReason + R"(","uptime":5120,"user":"alice"})", 60 + 4000 * i);
    }
    publish(902001002, R"({"pkg":"com.android.providers.contacts","anrReason":"timeout"})");
    publish(905002001, R"({"device":"ufs0","lifeUsed":"30%","serial":"UFS-0042"})");
    publish(903000001, R"({"anything":"at all"})");
    publish(905001001, R"({"device":"sda","errno":5,"sector":123456})");
    DaemonStats& stats = platform->GetStats();
    ASSERT_TRUE(WaitUntil(
            [&] { return PrivacyTestSource::finished_ == 8 && stats.Value("privacy.dropped.filter_list") == 1; }));
    DevInfo::SetUploadSwitch(0);  // without consent, an L3 event is not kept at all
    publish(902001001, R"({"pkg":"com.example","exception":"NPE"})");
    ASSERT_TRUE(WaitUntil([&] { return stats.Value("privacy.dropped.event_level") == 1; }));

    Texts rows =
            Column(root.File("work/event.db"), "select event_id||' '||param_list from event_info order by event_id");
    ASSERT_EQ(rows.size(), 5u) << ::testing::PrintToString(rows);
    EXPECT_EQ(rows[0], "901001001 {\"reason\":\"" + longReason.substr(0, 128) + "\",\"uptime\":5120}");
    EXPECT_EQ(rows[1], "903000001 {}");
    EXPECT_EQ(rows[2], R"(905001001 {"device":"sda","errno":5,"sector":123456})");
    EXPECT_EQ(rows[4], R"(908001001 {"EventId":901001001,"DailyCnt":3,"MaxCnt":3})");
    Json::Value sealed;
    ASSERT_TRUE(Json::Reader().parse(rows[3].substr(10), sealed)) << rows[3];
    EXPECT_EQ(rows[3].rfind(R"(905002001 {"device":"ufs0","lifeUsed":0,"serial":")", 0), 0u) << rows[3];
    std::string serial;
    EnvelopeOpener server(ReadFile(TestDataDir() + "/tests/common/privacy_test_server_private_key.pem"));
    ASSERT_TRUE(server.Open(sealed["serial"].asString(), serial));
    EXPECT_EQ(serial, "UFS-0042");
    EXPECT_EQ(stats.Value("privacy.encrypted"), 1u);
    EXPECT_EQ(stats.Value("privacy.stripped.unknown_event"), 1u);

    PrivacyTestSource::running_ = nullptr;
    platform.reset();
    EventDatabase::getInstance()->Close();
}

}  // namespace
}  // namespace android::Orvane
