#include "plugins/event_log_processor.h"

#include <signal.h>
#include <sys/resource.h>
#include <sys/stat.h>
#include <unzip.h>

#include <future>
#include <random>

#include <android-base/file.h>
#include <gtest/gtest.h>

#include "config/event_quota_xml_parser.h"
#include "platform/plugin_factory.h"
#include "tests/common/fake_plugin_context.h"
#include "tests/common/log_capture.h"
#include "utils/dev_info.h"
#include "utils/sys_env.h"
#include "utils/time_util.h"

namespace android::Orvane {
namespace {

// The daemon blocks SIGCHLD in every thread before any starts, so the command runner alone
// collects its children; the test process does the same before gtest starts a thread.
const bool kChildSignalBlocked = [] {
    sigset_t childSignal;
    sigemptyset(&childSignal);
    sigaddset(&childSignal, SIGCHLD);
    return pthread_sigmask(SIG_BLOCK, &childSignal, nullptr) == 0;
}();

// Each test works in a domain of its own: the quota bookkeeping is one per process.
constexpr char kQuota[] = R"(<EventQuota><unknown>
  <Summary defLogCnt="1000" UploadExpireYear="1" Level1Month="3" Level1Max="10" Level2Month="6" Level2Max="8"
           Level3Month="9" Level3Max="5"/>
  <Domain name="a" eventMin="901000000" eventMax="901999999" maxLogCnt="1000" logSpace="1000"/>
  <Domain name="b" eventMin="903000000" eventMax="903999999" maxLogCnt="1000" logSpace="4"/>
  <Domain name="c" eventMin="904000000" eventMax="904999999" maxLogCnt="10">
    <SubDomain name="c" eventMin="904001000" eventMax="904001999" maxLogCnt="4"/>
  </Domain>
  <Domain name="d" eventMin="905000000" eventMax="905999999" maxLogCnt="1000" logSpace="100000"/>
</unknown></EventQuota>)";

using Entries = std::map<std::string, std::string>;

// Every entry of a zip archive with its content; empty when the archive cannot be read.
Entries ReadZip(const std::string& path) {
    Entries entries;
    unzFile zip = unzOpen(path.c_str());
    if (zip == nullptr) {
        return entries;
    }
    for (int status = unzGoToFirstFile(zip); status == UNZ_OK; status = unzGoToNextFile(zip)) {
        char name[512];
        unz_file_info info;
        unzGetCurrentFileInfo(zip, &info, name, sizeof(name), nullptr, 0, nullptr, 0);
        std::string content(info.uncompressed_size, '\0');
        unzOpenCurrentFile(zip);
        int read = content.empty() ? 0 : unzReadCurrentFile(zip, content.data(), content.size());
        unzCloseCurrentFile(zip);
        entries[name] = content.substr(0, read > 0 ? static_cast<size_t>(read) : 0);
    }
    unzClose(zip);
    return entries;
}

std::string Read(const std::string& path) {
    std::string content;
    base::ReadFileToString(path, &content);
    return content;
}

class EventLogProcessorTest : public ::testing::Test {
protected:
    void SetUp() override {
        ASSERT_TRUE(kChildSignalBlocked);
        for (const char* folder : {"/etc", "/work", "/logs", "/logs/dyn", "/private"}) {
            ASSERT_EQ(mkdir((root_ + folder).c_str(), 0775), 0);
        }
        Write("/etc/privacy_policy.xml",
              "<PrivacyPolicy><Levels switchOn=\"1\" switchOff=\"1\"/><LogPaths><Allow prefix=\"" + root_ +
                      "/logs/\"/><Allow prefix=\"" + root_ + "/work/\"/></LogPaths></PrivacyPolicy>");
        Write("/etc/event_quota.xml", kQuota);
        context_.SetSysProperity("ro.build.fingerprint", "quor/phone:13/TP1A:user/release-keys");
        context_.SetSysProperity("ro.quor.build.region", "CN");
        SysEnv::SetSysProperity("persist.sys.orvane.upload_switch", "1");
        DevInfo::SetActivateTime(TimeUtil::GetTimestampSecond() - 10 * 86400);
    }
    void TearDown() override {
        if (plugin_ != nullptr) {
            plugin_->GetLooper()->StopLoop();
        }
    }
    void Write(const std::string& file, const std::string& content) {
        ASSERT_TRUE(base::WriteStringToFile(content, root_ + file)) << file;
    }
    void Rules(const std::string& body) { Write("/etc/event_upload.xml", "<EventUpload>" + body + "</EventUpload>"); }
    // Creates and loads the plugin as the platform does, on a loop of its own.
    void Load() {
        plugin_ = static_cast<EventLogProcessor*>(PluginFactory::CreatePlugin("EventLogProcessor").get());
        ASSERT_NE(plugin_, nullptr);
        plugin_->SetPluginContext(&context_);
        plugin_->SetLooper(new EventLoop("logproc_loop"));
        plugin_->GetLooper()->StartLoop();
        plugin_->OnLoad();
    }
    static sp<Event> Fault(uint32_t id, uint32_t type = 2) {
        sp<Event> event = new Event("test");
        event->eventType = type;
        event->eventId = id;
        event->happenTime = TimeUtil::GetTimestampSecond();
        return event;
    }
    // Hands events to the plugin in one go on its loop, as the pipeline does; their results.
    std::vector<EVENT_RET> Deliver(std::vector<sp<Event>> events) {
        std::promise<std::vector<EVENT_RET>> results;
        plugin_->GetLooper()->AddTask([&] {
            std::vector<EVENT_RET> rets;
            for (sp<Event>& event : events) {
                rets.push_back(plugin_->OnEvent(event));
            }
            results.set_value(rets);
        });
        return results.get_future().get();
    }
    EVENT_RET Deliver(sp<Event> event) { return Deliver(std::vector<sp<Event>>{event}).at(0); }
    std::vector<std::string> Packs(const std::string& folder, const std::string& id = "\\d{9}") {
        return EventLogProcessor::GetFileInDirByPattern(root_ + "/work/" + folder,
                                                        "EventId_\\S+_\\d{14}_" + id + "\\.zip", -1);
    }
    bool WaitPacks(const std::string& folder, size_t count) {
        return WaitUntil([&] { return Packs(folder).size() >= count; }, std::chrono::seconds(30));
    }
    uint64_t Stat(const char* name) { return context_.GetStats().Value(name); }

    TemporaryDir dir_;
    std::string root_ = dir_.path;
    FakePluginContext context_{root_ + "/work/", root_ + "/etc/"};
    sp<EventLogProcessor> plugin_;
};

// Only fault ids in the two ranges pass; storage's verdict decides whether a pack is made.
TEST_F(EventLogProcessorTest, IdBoundsAndStorageVerdicts) {
    Rules("");
    Load();
    std::vector<sp<Event>> events;
    for (uint32_t id :
         {799999999u, 800000000u, 888888888u, 888888889u, 899999999u, 900000000u, 999999999u, 1000000000u}) {
        events.push_back(Fault(id));
        events.back()->SetValue(kKeyNoCatchLog, kNoLogConfig);
    }
    EXPECT_EQ(Deliver(events), (std::vector<EVENT_RET>{-1, 0, 0, -1, -1, 0, 0, -1}));
    for (const sp<Event>& event : events) {
        EXPECT_EQ(event->GetValue("zipLogName"), "") << event->eventId;
    }
    sp<Event> wait = Fault(901000001), dropped = Fault(901000001), other = Fault(901000001, 3), raw = Fault(1, 4);
    wait->SetValue(kKeyNoCatchLog, kWaitLogCatch);
    dropped->SetValue(kKeyDropReason, "over daily quota");
    EXPECT_EQ(Deliver({wait, dropped, other, raw}), (std::vector<EVENT_RET>{0, 0, 0, 0}));
    EXPECT_EQ(wait->GetValue("zipLogName"), "WAIT_LOG_CATCH");
    for (const sp<Event>& event : {wait, dropped, other}) {
        EXPECT_EQ(event->GetValue("EVENT_LOG_ZIP_NAME"), "") << "a collection was queued";
    }
    EXPECT_EQ(dropped->GetValue("zipLogName"), "");
    EXPECT_EQ(other->GetValue("zipLogName"), "");
}

// The pack holds exactly the sources of the rule that the privacy policy allows: files with
// blanks, the newest matches of a folder (deleted after packing as the rule asks), the output of
// a command under its own name; links and ".." out of the allowed folders are refused and
// counted, and nothing temporary stays behind.
TEST_F(EventLogProcessorTest, PackHoldsTheAllowedRuleSources) {
    std::string logs = root_ + "/logs/";
    Write("/logs/a.txt", "static log");
    Write("/logs/with space.txt", "blank in the name");
    Write("/private/secret.txt", "secret");
    ASSERT_EQ(symlink((root_ + "/private/secret.txt").c_str(), (logs + "link").c_str()), 0);
    time_t now = time(nullptr);
    for (int i = 1; i <= 5; i++) {
        std::string name = "/logs/dyn/trace_" + std::to_string(i) + ".txt";
        Write(name, "trace " + std::to_string(i));
        // trace_1 is two hours old, the others a few seconds apart.
        struct timespec times[2] = {{now - (i == 1 ? 7200 : 60 - i), 0}, {now - (i == 1 ? 7200 : 60 - i), 0}};
        ASSERT_EQ(utimensat(AT_FDCWD, (root_ + name).c_str(), times, 0), 0);
    }
    Write("/logs/dyn/other.txt", "not matched");
    Rules("<LogRule eventMin=\"901000000\" eventMax=\"901999999\"><Static path=\"/never\"/></LogRule>"
          "<LogRule eventId=\"901001001\">"
          "<Static path=\"" +
          logs + "a.txt\"/><Static path=\"" + logs +
          "with space.txt\"/>"
          "<Static path=\"" +
          logs + "../private/secret.txt\"/><Static path=\"" + logs +
          "link\"/>"
          "<Static path=\"" +
          logs +
          "missing.txt\"/>"
          "<Dynamic dir=\"" +
          logs +
          "dyn\" pattern=\"trace_\\d+\\.txt\" count=\"3\" maxAgeSec=\"3600\" delete=\"true\"/>"
          "<Command cmd=\"echo hello\" file=\"echo.txt\"/></LogRule>");
    Load();
    sp<Event> first = Fault(901001001);
    EXPECT_EQ(Deliver(first), 0);
    ASSERT_TRUE(WaitPacks("901", 1));
    std::vector<std::string> packs = Packs("901", "901001001");
    ASSERT_EQ(packs.size(), 1u);
    std::string name = first->GetValue("EVENT_LOG_ZIP_NAME");
    EXPECT_EQ(name.rfind("EventId_quor_phone_13_TP1A_user_release-keys_unknown_", 0), 0u) << name;
    EXPECT_EQ(first->GetValue("zipLogName"), root_ + "/work/901/uploading/" + name);
    std::string relative = logs.substr(1);
    Entries expected = {{relative + "a.txt", "static log"},        {relative + "with space.txt", "blank in the name"},
                        {relative + "dyn/trace_3.txt", "trace 3"}, {relative + "dyn/trace_4.txt", "trace 4"},
                        {relative + "dyn/trace_5.txt", "trace 5"}, {"echo.txt", "hello\n"}};
    for (const std::string& pack : packs) {
        EXPECT_EQ(ReadZip(pack), expected) << pack;
        struct stat st;
        ASSERT_EQ(stat(pack.c_str(), &st), 0);
        EXPECT_EQ(st.st_mode & 0777, 0775u);
    }
    // Once the collection ends the three files packed and the command's output are gone, the
    // rest of the folder not.
    EXPECT_TRUE(WaitUntil([&] {
        return !FileUtil::FileExists(logs + "dyn/trace_5.txt") &&
               EventLogProcessor::GetFileInDirByPattern(root_ + "/work/901", "\\..*", -1).empty();
    }));
    EXPECT_EQ(EventLogProcessor::GetFileInDirByPattern(logs + "dyn", ".*", -1),
              (std::vector<std::string>{logs + "dyn/trace_1.txt", logs + "dyn/trace_2.txt", logs + "dyn/other.txt"}));
    EXPECT_EQ(Stat("privacy.path.refused"), 2u);
    EXPECT_EQ(Read(root_ + "/private/secret.txt"), "secret");
}

// A folder of 1,000 matching files gives exactly the newest `count`, whatever the order of the
// names; files that do not match the whole pattern are never taken.
TEST_F(EventLogProcessorTest, NewestOfAThousandMatches) {
    time_t now = time(nullptr);
    for (int i = 0; i < 1000; i++) {
        std::string name = "/logs/dyn/log_" + std::to_string((i * 7919) % 1000) + ".txt";
        Write(name, std::to_string(i));
        struct timespec times[2] = {{now - 2000 + i, 0}, {now - 2000 + i, 0}};
        ASSERT_EQ(utimensat(AT_FDCWD, (root_ + name).c_str(), times, 0), 0);
    }
    Write("/logs/dyn/log_1.txt.old", "not matched");
    Rules("<LogRule eventId=\"901003001\"><Dynamic dir=\"" + root_ +
          "/logs/dyn\" pattern=\"log_\\d+\\.txt\" count=\"3\"/></LogRule>");
    Load();
    EXPECT_EQ(Deliver(Fault(901003001)), 0);
    ASSERT_TRUE(WaitPacks("901", 1));
    std::string dyn = root_.substr(1) + "/logs/dyn/log_";
    EXPECT_EQ(ReadZip(Packs("901").at(0)), (Entries{{dyn + std::to_string((997 * 7919) % 1000) + ".txt", "997"},
                                                    {dyn + std::to_string((998 * 7919) % 1000) + ".txt", "998"},
                                                    {dyn + std::to_string((999 * 7919) % 1000) + ".txt", "999"}}));
}

// logSpace caps a pack's uncompressed sources: a larger file gives its newest part, a file after
// the cap is left out, each with a warning and a count. With the switch off the pack lies in
// "ue_off" and no upload path is announced.
TEST_F(EventLogProcessorTest, SpaceCapAndSwitchOff) {
    SysEnv::SetSysProperity("persist.sys.orvane.upload_switch", "0");
    std::string big(3000, 'o');
    big += std::string(2000, 'n');  // the newest 4096 bytes: 2096 'o', then the 2000 'n'
    Write("/logs/big.txt", big);
    Write("/logs/small.txt", "small");
    Rules("<LogRule eventId=\"903000001\"><Static path=\"" + root_ + "/logs/big.txt\"/><Static path=\"" + root_ +
          "/logs/small.txt\"/></LogRule>");
    Load();
    LogCapture capture;
    sp<Event> event = Fault(903000001);
    EXPECT_EQ(Deliver(event), 0);
    ASSERT_TRUE(WaitPacks("903/ue_off", 1));
    EXPECT_EQ(event->GetValue("zipLogName"), "");
    EXPECT_EQ(Packs("903").size(), 0u);
    Entries entries = ReadZip(Packs("903/ue_off").at(0));
    ASSERT_EQ(entries.size(), 1u);
    EXPECT_EQ(entries.begin()->second, big.substr(big.size() - 4096));
    EXPECT_EQ(Stat("logproc.space.cut"), 1u);
    EXPECT_EQ(Stat("logproc.space.left_out"), 1u);
    EXPECT_TRUE(capture.Contains(ANDROID_LOG_WARN, "small.txt left out"));
}

// The serial's last digit against the level, the fallback serial, expiry after UploadExpireYear
// at the first upload request, and the switch changes of configuration and switch events.
TEST_F(EventLogProcessorTest, UploadAdmissionAndSwitch) {
    Rules("");
    Load();
    context_.SetSysProperity("ro.ril.oem.sno", "A12347");
    EXPECT_TRUE(plugin_->CanUploadRatio(8));
    EXPECT_FALSE(plugin_->CanUploadRatio(7));
    context_.SetSysProperity("ro.ril.oem.sno", "unknown");
    context_.SetSysProperity("ro.ril.oem.psno", "P0");
    EXPECT_TRUE(plugin_->CanUploadRatio(1));
    EXPECT_FALSE(plugin_->CanUploadRatio(0));
    context_.SetSysProperity("ro.ril.oem.psno", "P0Z");
    EXPECT_FALSE(plugin_->CanUploadRatio(10));
    context_.SetSysProperity("ro.ril.oem.psno", "unknown");
    EXPECT_FALSE(plugin_->CanUploadRatio(10));

    // Activated 100 days ago, between 3 and 6 months: Level1Max admits all ten tenths.
    context_.SetSysProperity("ro.ril.oem.sno", "S9");
    DevInfo::SetActivateTime(TimeUtil::GetTimestampSecond() - 100 * 86400);
    EXPECT_TRUE(plugin_->IsNotExpired());
    // Between 6 and 9 months Level2Max admits 8 tenths: a serial ending in 9 is left out.
    DevInfo::SetActivateTime(TimeUtil::GetTimestampSecond() - 200 * 86400);
    EXPECT_FALSE(plugin_->IsNotExpired());
    EXPECT_EQ(DevInfo::GetUploadSwitch(), "closed");

    SysEnv::SetSysProperity("persist.sys.orvane.upload_switch", "1");
    DevInfo::SetActivateTime(TimeUtil::GetTimestampSecond() - 2 * 365 * 86400);
    sp<Event> pack = Fault(101, 1);
    EXPECT_EQ(Deliver(pack), 0);
    EXPECT_EQ(pack->GetIntValue("EVENT_SERVICE_UPLOAD_RET"), -1);
    EXPECT_EQ(DevInfo::GetUploadSwitch(), "closed");

    DevInfo::SetActivateTime(TimeUtil::GetTimestampSecond());
    sp<Event> off = Fault(103, 1), on = Fault(103, 1);
    off->SetValue("EVENT_UE_UPDATE", 0);
    on->SetValue("EVENT_UE_UPDATE", 1);
    Deliver(off);
    EXPECT_EQ(DevInfo::GetUploadSwitch(), "off");
    plugin_->OnUnorderedEvent(Fault(104, 1));  // a configuration update leaves "off" alone
    EXPECT_EQ(DevInfo::GetUploadSwitch(), "off");
    Deliver(on);
    EXPECT_EQ(DevInfo::GetUploadSwitch(), "on");
    context_.SetSysProperity("ro.boot.factorybuild", "1");
    sp<Event> factory = Fault(101, 1);
    Deliver(factory);
    EXPECT_EQ(factory->GetIntValue("EVENT_SERVICE_UPLOAD_RET"), -1);
}

// Load counts the packs on disk (and removes what a crash left half done); a full sub-domain
// keeps the oldest half of its quota among the packs of its own range, in both folders, and
// leaves other packs of the domain alone.
TEST_F(EventLogProcessorTest, FullSubDomainKeepsHalfItsQuota) {
    Rules("");
    ASSERT_EQ(mkdir((root_ + "/work/904").c_str(), 0775), 0);
    ASSERT_EQ(mkdir((root_ + "/work/904/ue_off").c_str(), 0775), 0);
    time_t now = time(nullptr);
    auto pack = [&](const std::string& folder, uint32_t id, int age) {
        std::string path =
                root_ + "/work/904/" + folder + "EventId_fp_sn_20260101000000_" + std::to_string(id) + ".zip";
        Write(path.substr(root_.size()), "zip");
        struct timespec times[2] = {{now - age, 0}, {now - age, 0}};
        EXPECT_EQ(utimensat(AT_FDCWD, path.c_str(), times, 0), 0);
        return path;
    };
    std::string oldest = pack("ue_off/", 904001001, 50), older = pack("", 904001002, 40), old = pack("", 904001003, 30),
                young = pack("", 904001004, 20);
    std::string others[] = {pack("", 904002001, 60), pack("", 904002002, 10), pack("ue_off/", 904002003, 5)};
    Write("/work/904/.orvane_tmp_EventId_x.zip.part", "half written");
    Load();
    EventQuotaXmlParser::DomainQuota quota;
    EXPECT_TRUE(
            EventQuotaXmlParser::getInstance()->CheckLogCntLimitAfterIncr(context_, "unknown", 904001001, 0, &quota));
    EXPECT_EQ(quota.logCnt, 4);
    EXPECT_FALSE(FileUtil::FileExists(root_ + "/work/904/.orvane_tmp_EventId_x.zip.part"));

    EXPECT_EQ(Deliver(Fault(904001005)), 0);
    EXPECT_TRUE(FileUtil::FileExists(older));
    EXPECT_TRUE(FileUtil::FileExists(old));
    EXPECT_FALSE(FileUtil::FileExists(young));
    EXPECT_FALSE(FileUtil::FileExists(oldest));
    for (const std::string& other : others) {
        EXPECT_TRUE(FileUtil::FileExists(other)) << other;
    }
    EXPECT_FALSE(
            EventQuotaXmlParser::getInstance()->CheckLogCntLimitAfterIncr(context_, "unknown", 904001001, 0, &quota));
    EXPECT_EQ(quota.logCnt, 2);
    EXPECT_EQ(Stat("logproc.folder.trimmed"), 2u);
}

// "pack-log" moves the domains' packs (not those made while the switch was off) and the
// "eventinfo" files into the uploading folders, and answers how many it hands over.
TEST_F(EventLogProcessorTest, HandOverMovesPacksAndEventInfo) {
    Rules("");
    std::string work = root_ + "/work/";
    for (const char* folder : {"906", "906/ue_off", "907"}) {
        ASSERT_EQ(mkdir((work + folder).c_str(), 0775), 0);
    }
    for (const char* file :
         {"906/EventId_fp_sn_20260101000000_906000001.zip", "906/EventId_fp_sn_20260101000001_906000001.zip",
          "906/ue_off/EventId_fp_sn_20260101000000_906000002.zip", "907/EventId_fp_sn_20260101000000_906000003.zip",
          "eventinfo.906", "eventinfo.907.0", "eventinfo.1234", "906/notes.txt"}) {
        Write(std::string("/work/") + file, "x");
    }
    Load();
    sp<Event> request = Fault(101, 1);
    EXPECT_EQ(Deliver(request), 0);
    EXPECT_EQ(request->GetIntValue("EVENT_SERVICE_UPLOAD_RET"), 4);
    ASSERT_TRUE(WaitUntil([&] { return Stat("logproc.handover.eventinfo") == 2; }));
    EXPECT_EQ(Packs("906/uploading").size(), 2u);
    EXPECT_EQ(Packs("906").size(), 0u);
    EXPECT_EQ(Packs("906/ue_off").size(), 1u);
    EXPECT_EQ(Packs("907").size(), 1u);  // a pack of another domain's ids is not this domain's
    EXPECT_EQ(EventLogProcessor::GetFileInDirByPattern(work + "uploading", ".*", -1),
              (std::vector<std::string>{work + "uploading/eventinfo.906", work + "uploading/eventinfo.907.0"}));
    EXPECT_TRUE(FileUtil::FileExists(work + "eventinfo.1234"));
    struct stat st;
    ASSERT_EQ(stat((work + "uploading/eventinfo.906").c_str(), &st), 0);
    EXPECT_EQ(st.st_mode & 0777, 0775u);

    // The app has not taken eventinfo.906 yet: the next one is handed over beside it.
    Write("/work/eventinfo.906", "y");
    EXPECT_EQ(Deliver(Fault(101, 1)), 0);
    ASSERT_TRUE(WaitUntil([&] { return Stat("logproc.handover.eventinfo") == 3; }));
    EXPECT_EQ(Read(work + "uploading/eventinfo.906") + Read(work + "uploading/eventinfo.906.0"), "xy");
}

// A disk that fills while a pack is written (here: a file size limit of the process) leaves no
// pack and no half-written file behind; the failure is counted and the next pack is made.
TEST_F(EventLogProcessorTest, FullDiskLeavesNoHalfWrittenPack) {
    std::mt19937 random(7);
    std::string noise(512 << 10, '\0');
    for (char& c : noise) {
        c = static_cast<char>(random());
    }
    Write("/logs/noise.bin", noise);
    Rules("<LogRule eventId=\"901004001\"><Static path=\"" + root_ + "/logs/noise.bin\"/></LogRule>");
    Load();
    struct rlimit unlimited;
    ASSERT_EQ(getrlimit(RLIMIT_FSIZE, &unlimited), 0);
    struct rlimit small = unlimited;
    small.rlim_cur = 128 * 1024;
    signal(SIGXFSZ, SIG_IGN);
    ASSERT_EQ(setrlimit(RLIMIT_FSIZE, &small), 0);
    EXPECT_EQ(Deliver(Fault(901004001)), 0);
    bool failed = WaitUntil([&] { return Stat("logproc.pack.failed") == 1; }, std::chrono::seconds(30));
    ASSERT_EQ(setrlimit(RLIMIT_FSIZE, &unlimited), 0);
    ASSERT_TRUE(failed);
    EXPECT_TRUE(
            WaitUntil([&] { return EventLogProcessor::GetFileInDirByPattern(root_ + "/work/901", ".*", -1).empty(); }));
    EXPECT_EQ(Deliver(Fault(901004001)), 0);
    ASSERT_TRUE(WaitPacks("901", 1));
    EXPECT_TRUE(ReadZip(Packs("901").at(0)).begin()->second == noise);
}

// A command that overruns its time-out is killed and the pack is made from what exists.
TEST_F(EventLogProcessorTest, HangingCommandIsKilledAtItsTimeOut) {
    Rules("<LogRule eventId=\"901002001\"><Command cmd=\"sleep 60\" timeoutSec=\"1\" file=\"slow.txt\"/>"
          "<Command cmd=\"echo done\" file=\"after.txt\"/></LogRule>");
    Load();
    LogCapture capture;
    auto start = std::chrono::steady_clock::now();
    EXPECT_EQ(Deliver(Fault(901002001)), 0);
    ASSERT_TRUE(WaitPacks("901", 1));
    EXPECT_LT(std::chrono::steady_clock::now() - start, std::chrono::seconds(30));
    EXPECT_EQ(ReadZip(Packs("901").at(0)), (Entries{{"slow.txt", ""}, {"after.txt", "done\n"}})) << capture.Dump();
    EXPECT_TRUE(capture.Contains(ANDROID_LOG_INFO, "command 'sleep 60' timed out"));
}

// Collections waiting for a worker are bounded: an event beyond the bound gets a reason of its
// own instead of a pack and is counted; every other event gets its pack, under a name of its
// own although all have the same id and arrive within one second.
TEST_F(EventLogProcessorTest, WaitingCollectionsAreBounded) {
    Write("/logs/big.txt", std::string(8 << 20, 'b'));
    Rules("<LogRule eventId=\"905000001\"><Static path=\"" + root_ + "/logs/big.txt\"/></LogRule>");
    Load();
    std::vector<sp<Event>> events;
    for (int i = 0; i < 60; i++) {
        events.push_back(Fault(905000001));
    }
    Deliver(events);
    size_t refused = 0;
    for (const sp<Event>& event : events) {
        std::string reason = event->GetValue("zipLogName");
        if (reason == EventLogProcessor::kQueueFullReason) {
            refused++;
        } else {
            EXPECT_EQ(reason.rfind(root_ + "/work/905/uploading/EventId_", 0), 0u) << reason;
        }
    }
    EXPECT_GE(refused, 60 - EventLogProcessor::kMaxWaitingCollections - EventLogProcessor::kWorkerCount);
    EXPECT_EQ(Stat("logproc.queue.overflow"), refused);
    ASSERT_TRUE(WaitUntil([&] { return Stat("logproc.pack.made") == 60 - refused; }, std::chrono::seconds(60)));
    EXPECT_EQ(Packs("905").size(), 60 - refused);
}

}  // namespace
}  // namespace android::Orvane
