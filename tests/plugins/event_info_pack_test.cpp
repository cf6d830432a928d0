// EventInfoPack on its own: the step marks subscribed events, the listener call writes their
// records, files rotate, hand-overs are noticed, old files go, and a full disk costs no line.

#include "plugins/event_info_pack.h"

#include <signal.h>
#include <sys/resource.h>
#include <sys/stat.h>

#include <android-base/file.h>
#include <android-base/strings.h>
#include <gtest/gtest.h>
#include <json/json.h>

#include "tests/common/envelope_opener.h"
#include "tests/common/fake_plugin_context.h"
#include "tests/common/log_capture.h"
#include "tests/common/test_data.h"
#include "tests/storage/storage_test_util.h"
#include "utils/dev_info.h"
#include "utils/sys_env.h"
#include "utils/time_util.h"

namespace android::Orvane {
namespace {

constexpr char kSerial[] = "ZX1G22TEST0042";

class EventInfoPackTest : public ::testing::Test {
protected:
    void SetUp() override {
        const std::string etc = TestDataDir() + "/etc/";
        ASSERT_TRUE(FileUtil::CreateDirectory(configDir_, 0775));
        ASSERT_TRUE(FileUtil::CreateDirectory(workDir_, 0775));
        for (const char* name : {"privacy_policy.xml", "privacy_server_key.pem"}) {
            WriteFile(configDir_ + name, ReadFile(etc + name));
        }
        SysEnv::SetSysProperity("ro.serialno", kSerial);
        DevInfo::SetUploadSwitch(1);
    }

    void WriteRules(const std::string& subscriptions) {
        WriteFile(configDir_ + "event_upload.xml", "<EventUpload>" + subscriptions + "</EventUpload>");
    }

    sp<EventInfoPack> Load() {
        sp<EventInfoPack> pack = new EventInfoPack();
        pack->SetPluginContext(&context_);
        pack->OnLoad();
        return pack;
    }

    // The event's two calls: as a pipeline step, then (after `later` played the later plugins)
    // as a listener.
    static sp<Event> Pass(const sp<EventInfoPack>& pack, uint32_t id, const std::string& params,
                          const std::function<void(Event&)>& later = nullptr) {
        sp<Event> event = MakeEvent(2, id, 1700000000, params);
        EXPECT_EQ(pack->OnEvent(event), 0);
        if (later) {
            later(*event);
        }
        EXPECT_EQ(pack->OnEvent(event), 0);
        return event;
    }

    std::vector<Json::Value> Records(const std::string& name) {
        std::vector<Json::Value> records;
        std::string text = ReadFile(workDir_ + name);
        EXPECT_TRUE(text.empty() || text.back() == '\n') << name;
        for (const std::string& line : base::Split(text, "\n")) {
            if (line.empty()) {
                continue;
            }
            Json::Value record;
            EXPECT_TRUE(Json::Reader().parse(line, record)) << line;
            records.push_back(record);
        }
        return records;
    }

    std::vector<std::string> EventInfoFiles() {
        std::vector<std::string> names;
        std::unique_ptr<DIR, int (*)(DIR*)> dir(opendir(workDir_.c_str()), closedir);
        while (struct dirent* entry = readdir(dir.get())) {
            if (base::StartsWith(entry->d_name, "eventinfo")) {
                names.push_back(entry->d_name);
            }
        }
        std::sort(names.begin(), names.end());
        return names;
    }

    void Age(const std::string& name, int days) {
        struct timespec times[2];
        times[0].tv_sec = times[1].tv_sec = static_cast<time_t>(TimeUtil::GetTimestampSecond()) - days * 86400 - 60;
        times[0].tv_nsec = times[1].tv_nsec = 0;
        ASSERT_EQ(utimensat(AT_FDCWD, (workDir_ + name).c_str(), times, 0), 0) << name;
    }

    TempDir root_;
    const std::string configDir_ = root_.File("config/");
    const std::string workDir_ = root_.File("work/");
    FakePluginContext context_{workDir_, configDir_};
};

TEST_F(EventInfoPackTest, SubscribedEventsLeaveSealedRecordsInRotatingFiles) {
    WriteRules(R"(<Subscribe eventId="901001001" expire="90" visible="true"/>
                  <Subscribe eventMin="905000000" eventMax="905999999" expire="10" visible="false"/>)");
    sp<EventInfoPack> pack = Load();
    DaemonStats& stats = context_.GetStats();

    sp<Event> plain = Pass(pack, 902001001, R"({"pkg":"a"})");
    EXPECT_EQ(plain->GetValue("subscribe"), "");
    EXPECT_EQ(plain->GetValue("expire"), "");
    const std::string pack901 = "/data/quorlog/orvane/901/uploading/EventId_x_1_20260101000000_901001001.zip";
    sp<Event> crash = Pass(pack, 901001001, R"({"reason":"wlan","load":0.125,"uptime":5120})", [&](Event& event) {
        EXPECT_EQ(event.GetValue("subscribe"), "1");
        EXPECT_EQ(event.GetValue("expire"), "90");
        EXPECT_EQ(event.GetValue("visible"), "1");
        event.SetValue("zipLogName", pack901);
    });
    Pass(pack, 905001001, "not json", [](Event& event) { event.SetValue("noCatchLog", "WAIT_LOG_CATCH"); });
    Pass(pack, 901001001, "{}", [](Event& event) { event.SetValue("dropReason", "over daily quota"); });
    DevInfo::SetUploadSwitch(0);  // without consent the serial number is withheld
    Pass(pack, 905002001, "{}");
    DevInfo::SetUploadSwitch(1);

    EXPECT_EQ(EventInfoFiles(), (std::vector<std::string>{"eventinfo.901", "eventinfo.905"}));
    std::vector<Json::Value> records = Records("eventinfo.901");
    ASSERT_EQ(records.size(), 1u);
    const Json::Value& record = records[0];
    EXPECT_EQ(record["eventId"].asUInt(), 901001001u);
    EXPECT_EQ(record["happenTime"].asUInt64(), 1700000000u);
    EXPECT_EQ(record["param_list"]["reason"].asString(), "wlan");
    EXPECT_EQ(record["param_list"]["load"].asDouble(), 0.125);
    EXPECT_EQ(record["zipLogName"].asString(), pack901);
    EXPECT_EQ(record["expire"].asUInt(), 90u);
    EXPECT_EQ(record["visible"].asInt(), 1);
    EXPECT_EQ(record["quorVersion"].asString(), DevInfo::GetQuorVersion());
    EXPECT_EQ(record["buildType"].asInt(), DevInfo::GetBuildType());
    EXPECT_EQ(ReadFile(workDir_ + "eventinfo.901").find(kSerial), std::string::npos);
    std::string serial;
    EnvelopeOpener server(ReadFile(TestDataDir() + "/tests/common/privacy_test_server_private_key.pem"));
    ASSERT_TRUE(server.Open(record["serialNo"].asString(), serial));
    EXPECT_EQ(serial, kSerial);

    records = Records("eventinfo.905");
    ASSERT_EQ(records.size(), 2u);
    EXPECT_EQ(records[0]["param_list"].asString(), "not json");
    EXPECT_EQ(records[0]["zipLogName"].asString(), "WAIT_LOG_CATCH");
    EXPECT_EQ(records[0]["expire"].asUInt(), 10u);
    EXPECT_EQ(records[0]["visible"].asInt(), 0);
    EXPECT_EQ(records[1]["zipLogName"].asString(), "NO_LOG_PACK");
    EXPECT_EQ(records[1]["serialNo"].asString(), "");
    EXPECT_EQ(stats.Value("eventinfo.serial_withheld"), 1u);
    EXPECT_EQ(stats.Value("eventinfo.subscribed"), 4u);

    // About 1 KiB a record: three files' worth gives two closed files, each at 64 KiB or a line more.
    const std::string big = R"({"reason":")" + std::string(1000, 'r') + R"("})";
    for (int i = 0; i < 150; ++i) {
        Pass(pack, 901001001, big);
    }
    EXPECT_EQ(EventInfoFiles(),
              (std::vector<std::string>{"eventinfo.901", "eventinfo.901.0", "eventinfo.901.0.0", "eventinfo.905"}));
    size_t lines = 0;
    for (const char* name : {"eventinfo.901", "eventinfo.901.0", "eventinfo.901.0.0"}) {
        lines += Records(name).size();
    }
    EXPECT_EQ(lines, 151u);
    for (const char* name : {"eventinfo.901.0", "eventinfo.901.0.0"}) {
        int64_t size = FileUtil::GetFileSize(workDir_ + name);
        EXPECT_GE(size, EventInfoPack::kRotateSize) << name;
        EXPECT_LT(size, EventInfoPack::kRotateSize + 1200) << name;
    }
    EXPECT_LT(FileUtil::GetFileSize(workDir_ + "eventinfo.901"), EventInfoPack::kRotateSize);
    EXPECT_EQ(stats.Value("eventinfo.901.written"), 151u);
    EXPECT_EQ(stats.Value("eventinfo.905.written"), 2u);

    // The longest expiry (90 days) keeps files: one 89 days old stays, one 91 days old goes.
    Age("eventinfo.901.0", 89);
    Age("eventinfo.905", 91);
    LogCapture log;
    pack->CleanUp();
    EXPECT_TRUE(log.Contains(ANDROID_LOG_INFO, "eventinfo.905 not handed over in 90 days, deleted"));
    EXPECT_EQ(EventInfoFiles(), (std::vector<std::string>{"eventinfo.901", "eventinfo.901.0", "eventinfo.901.0.0"}));
    EXPECT_EQ(stats.Value("eventinfo.expired_files"), 1u);
    EXPECT_EQ(stats.Value("eventinfo.905.handed_over"), 0u);
}

TEST_F(EventInfoPackTest, HandOverRestartAndFullDisk) {
    WriteRules(R"(<Subscribe eventMin="901000000" eventMax="902999999" expire="10" visible="true"/>)");
    sp<EventInfoPack> pack = Load();
    DaemonStats& stats = context_.GetStats();
    Pass(pack, 901001001, "{}");
    Pass(pack, 902001001, "{}");

    // "pack-log" moves the files away; the next look counts them, and the next record starts anew.
    ASSERT_TRUE(FileUtil::CreateDirectory(workDir_ + "uploading", 0775));
    ASSERT_TRUE(FileUtil::MoveFile(workDir_ + "eventinfo.901", workDir_ + "uploading/eventinfo.901"));
    std::string dump = DumpOf([&](int fd) { pack->Dump(fd, {}); });
    EXPECT_NE(dump.find("901000000..902999999 expire 10 days, visible"), std::string::npos) << dump;
    EXPECT_NE(dump.find("files kept up to 30 days"), std::string::npos) << dump;
    EXPECT_NE(dump.find("domain 901: records written 1, files handed over 1, files waiting 0"), std::string::npos)
            << dump;
    EXPECT_NE(dump.find("domain 902: records written 1, files handed over 0, files waiting 1"), std::string::npos)
            << dump;
    Pass(pack, 901001001, "{}");
    EXPECT_EQ(Records("eventinfo.901").size(), 1u);
    // Moved between two records without anyone looking: the new file's inode tells.
    ASSERT_TRUE(FileUtil::MoveFile(workDir_ + "eventinfo.901", workDir_ + "uploading/eventinfo.901.x"));
    Pass(pack, 901001001, "{}");
    EXPECT_EQ(stats.Value("eventinfo.901.handed_over"), 2u);

    // What a power cut leaves, an unfinished line or zeros where the size got to the disk before
    // the data, is cut at the next load; the files are known again.
    const std::string whole = ReadFile(workDir_ + "eventinfo.902");
    for (const std::string& tail : {std::string(R"({"eventId":9020)"), std::string(3, '\0')}) {
        WriteFile(workDir_ + "eventinfo.902", whole + tail);
        pack.clear();
        pack = Load();
        EXPECT_EQ(ReadFile(workDir_ + "eventinfo.902"), whole);
    }
    Pass(pack, 902001001, "{}");
    EXPECT_EQ(Records("eventinfo.902").size(), 2u);
    ASSERT_TRUE(FileUtil::MoveFile(workDir_ + "eventinfo.902", workDir_ + "uploading/eventinfo.902"));
    dump = DumpOf([&](int fd) { pack->Dump(fd, {}); });
    EXPECT_NE(dump.find("domain 902: records written 2, files handed over 1, files waiting 0"), std::string::npos)
            << dump;

    // A full disk: the record that does not fit leaves the earlier lines as they were.
    Pass(pack, 901001001, "{}");
    const std::string before = ReadFile(workDir_ + "eventinfo.901");
    signal(SIGXFSZ, SIG_IGN);
    struct rlimit saved;
    ASSERT_EQ(getrlimit(RLIMIT_FSIZE, &saved), 0);
    struct rlimit tight = saved;
    tight.rlim_cur = before.size() + 20;  // room for a piece of a line only
    ASSERT_EQ(setrlimit(RLIMIT_FSIZE, &tight), 0);
    Pass(pack, 901001001, R"({"reason":"no room"})");
    ASSERT_EQ(setrlimit(RLIMIT_FSIZE, &saved), 0);
    EXPECT_EQ(ReadFile(workDir_ + "eventinfo.901"), before);
    EXPECT_EQ(stats.Value("eventinfo.write_failed"), 1u);
    Pass(pack, 901001001, "{}");
    EXPECT_EQ(Records("eventinfo.901").size(), 3u);

    // No subscription says more than 10 days: files are kept 30.
    Age("eventinfo.901", 29);
    ASSERT_TRUE(FileUtil::SaveStringToFile(workDir_ + "eventinfo.909.0", "{}\n", true));
    Age("eventinfo.909.0", 31);
    pack->CleanUp();
    EXPECT_TRUE(FileUtil::FileExists(workDir_ + "eventinfo.901"));
    EXPECT_FALSE(FileUtil::FileExists(workDir_ + "eventinfo.909.0"));
}

}  // namespace
}  // namespace android::Orvane
