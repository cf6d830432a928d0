#include "plugins/run_log_manager.h"

#include <signal.h>
#include <stdio.h>
#include <stdlib.h>
#include <sys/stat.h>
#include <time.h>

#include <atomic>
#include <string>
#include <vector>

#include <android-base/file.h>
#include <android-base/strings.h>
#include <gtest/gtest.h>
#include <json/json.h>

#include "platform/plugin_factory.h"
#include "tests/common/fake_plugin_context.h"
#include "tests/common/log_capture.h"
#include "utils/dev_info.h"
#include "utils/file_util.h"

namespace android::Orvane {
namespace {

constexpr char kFlag[] = "persist.sys.log_filter_flag";
constexpr char kGap[] = "persist.sys.log_time_gap_sec";
constexpr char kMaxLine[] = "persist.sys.log_max_line";

std::string Rows(int count) {
    std::string rows;
    for (int i = 1; i <= count; ++i) {
        rows += std::to_string(i) + "/" + std::to_string(10000 + i) + " proc" + std::to_string(i) + " " +
                std::to_string(100 + i) + " 20 7 1700000000\n";
    }
    return rows;
}

std::string Read(const std::string& path) {
    std::string text;
    android::base::ReadFileToString(path, &text);
    return text;
}

// Whether the process is gone or only waits to be reaped.
bool Ended(const std::string& pidText) {
    std::string stat;
    if (!android::base::ReadFileToString("/proc/" + android::base::Trim(pidText) + "/stat", &stat)) {
        return true;
    }
    size_t state = stat.rfind(") ");
    return state != std::string::npos && stat[state + 2] == 'Z';
}

// A stand-in "logcat" first on PATH, as the daemon finds it, and a configuration folder with a
// quota document; the plugin runs on a loop of its own.
class RunLogManagerTest : public testing::Test {
protected:
    void SetUp() override {
        oldPath_ = getenv("PATH");
        setenv("PATH", (std::string(bin_.path) + ":" + oldPath_).c_str(), 1);
        WriteQuota(60);
        loop_->StartLoop();
    }
    void TearDown() override {
        loop_->StopLoop();
        setenv("PATH", oldPath_.c_str(), 1);
    }

    // The stand-in's script; every call appends its arguments to the file "calls".
    void StandIn(const std::string& body) {
        const std::string path = std::string(bin_.path) + "/logcat";
        ASSERT_TRUE(FileUtil::SaveStringToFile(path + ".new",
                                               "#!/bin/sh\necho \"$@\" >> " + Calls() + "\n" + body + "\n", true));
        chmod((path + ".new").c_str(), 0755);
        ASSERT_EQ(0, rename((path + ".new").c_str(), path.c_str()));
    }
    std::string Calls() const { return std::string(bin_.path) + "/calls"; }
    std::string Dir() const { return bin_.path; }

    void WriteQuota(int logStatic) {
        const std::string path = std::string(config_.path) + "/event_quota.xml";
        ASSERT_TRUE(FileUtil::SaveStringToFile(
                path + ".new",
                "<EventQuota><" + DevInfo::GetQuorVersion() + "><Summary defDailyCnt=\"200\" LogStatic=\"" +
                        std::to_string(logStatic) + "\"/></" + DevInfo::GetQuorVersion() + "></EventQuota>\n",
                true));
        ASSERT_EQ(0, rename((path + ".new").c_str(), path.c_str()));
    }

    void Configure() {
        context_.SetSysProperity(kFlag, "1");
        context_.SetSysProperity(kGap, "5");
        context_.SetSysProperity(kMaxLine, "200");
    }

    sp<RunLogManager> Load(RunLogManager::Timing timing = {}) {
        sp<RunLogManager> plugin = new RunLogManager(timing);
        plugin->SetPluginContext(&context_);
        plugin->SetLooper(loop_);
        plugin->OnLoad();
        return plugin;
    }

    std::string Dump(const sp<RunLogManager>& plugin, std::vector<std::string> args = {}) {
        TemporaryFile out;
        plugin->Dump(out.fd, args);
        return Read(out.path);
    }

    // One run on request, waited for to its end.
    void RunNow(const sp<RunLogManager>& plugin) {
        ASSERT_EQ("run queued\n", Dump(plugin, {"run"}));
        std::atomic<bool> done{false};
        loop_->AddTask([&done] { done = true; });
        ASSERT_TRUE(WaitUntil([&done] { return done.load(); }, std::chrono::seconds(60)));
    }

    uint64_t Stat(const std::string& name) { return context_.GetStats().Value(name); }

    // The reports the plugin inserted, as JSON.
    std::vector<Json::Value> Reports() {
        std::vector<Json::Value> reports;
        for (const auto& [pipeline, event] : context_.Inserted()) {
            EXPECT_EQ("dftFaultEvent", pipeline);
            EXPECT_EQ("LogFilter", event->sender);
            EXPECT_EQ(908002001u, event->eventId);
            Json::Value report;
            std::string errors;
            std::string text = event->GetValue("param_list");
            std::unique_ptr<Json::CharReader> reader(Json::CharReaderBuilder().newCharReader());
            EXPECT_TRUE(reader->parse(text.data(), text.data() + text.size(), &report, &errors)) << text;
            reports.push_back(report);
        }
        return reports;
    }

    TemporaryDir bin_;
    TemporaryDir config_;
    TemporaryDir work_;
    std::string oldPath_;
    FakePluginContext context_{work_.path, std::string(config_.path) + "/"};
    sp<EventLoop> loop_ = new EventLoop("runlog_loop");
};

TEST_F(RunLogManagerTest, IsMadeByTheFactoryAndNeedsALoop) {
    sp<Plugin> made = PluginFactory::CreatePlugin("RunLogManager");
    ASSERT_NE(nullptr, made);
    LogCapture log;
    made->SetPluginContext(&context_);
    made->OnLoad();
    EXPECT_EQ("RunLogManager", made->GetName());
    EXPECT_EQ("RunLogManager-1.0", made->GetVersion());
    EXPECT_TRUE(log.Contains(ANDROID_LOG_ERROR, "OnLoad run log manager looper not set"));
    EXPECT_EQ("not loaded, no run\n", Dump(static_cast<RunLogManager*>(made.get()), {"run"}));
}

TEST_F(RunLogManagerTest, ReportsAtMostAHundredProcessesInLocalTime) {
    setenv("TZ", "CET-1", 1);  // one hour east of UTC, no summer time
    tzset();
    StandIn("[ \"$1\" = -S ] || exit 1\necho 'size/num main 1Mb/2000'\necho 'Log Filter Top PIDs:'\ncat <<'EOF'\n" +
            Rows(150) + "EOF");
    Configure();
    sp<RunLogManager> plugin = Load();
    RunNow(plugin);
    unsetenv("TZ");
    tzset();

    EXPECT_EQ("-S\n", Read(Calls()));
    std::vector<Json::Value> reports = Reports();
    ASSERT_EQ(1u, reports.size());
    const Json::Value& report = reports[0];
    EXPECT_EQ(5, report["FilterSecond"].asInt());
    EXPECT_EQ(200, report["FilterLine"].asInt());
    ASSERT_EQ(100u, report["Detail"].size());
    const Json::Value& first = report["Detail"][0];
    EXPECT_EQ(1, first["PID"].asInt());
    EXPECT_EQ(10001, first["UID"].asInt());
    EXPECT_EQ("proc1", first["ProcessName"].asString());
    EXPECT_EQ(101, first["TotalFilterLog"].asInt());
    EXPECT_EQ(20, first["TotalFilterCnt"].asInt());
    EXPECT_EQ(7, first["MaxFilterCnt"].asInt());
    EXPECT_EQ("2023-11-14 23:13:20", first["MaxHappenTime"].asString());
    EXPECT_EQ("proc100", report["Detail"][99]["ProcessName"].asString());
    EXPECT_EQ(1u, Stat("runlog.sent"));
    EXPECT_EQ(100u, Stat("runlog.rows"));
    EXPECT_NE(std::string::npos, Dump(plugin).find("last run: sent 100 processes")) << Dump(plugin);
}

TEST_F(RunLogManagerTest, NothingIsSentWithoutConfigurationOrRows) {
    StandIn("echo 'Log Filter Top PIDs'\necho '1/2 a 1 2 3 4'");
    sp<RunLogManager> plugin = Load();

    // Each property unset, or set to no number, in turn: the log daemon is not even asked.
    for (const char* missing : {kFlag, kGap, kMaxLine}) {
        for (const char* value : {"-1", "off"}) {
            Configure();
            context_.SetSysProperity(missing, value);
            RunNow(plugin);
        }
    }
    EXPECT_EQ("", Read(Calls()));
    EXPECT_EQ(6u, Stat("runlog.unconfigured"));

    // A header without rows, and rows without the header.
    Configure();
    StandIn("echo 'Log Filter Top PIDs'\necho 'PID/UID NAME TOTAL'\necho");
    RunNow(plugin);
    StandIn("echo '1/2 a 1 2 3 4'");
    RunNow(plugin);
    EXPECT_EQ(1u, Stat("runlog.no_header"));
    EXPECT_TRUE(context_.Inserted().empty());
    EXPECT_EQ(8u, Stat("runlog.runs"));

    // No "logcat" on PATH at all.
    LogCapture log;
    setenv("PATH", work_.path, 1);
    RunNow(plugin);
    EXPECT_TRUE(log.Contains(ANDROID_LOG_WARN, "GetLogFilterDetail open logcat failed")) << log.Dump();
    EXPECT_EQ(1u, Stat("runlog.start_failed"));
    EXPECT_TRUE(context_.Inserted().empty());
}

TEST_F(RunLogManagerTest, HostileOutputCostsBoundedTimeAndMemory) {
    Configure();
    sp<RunLogManager> plugin = Load({1, 1});
    const std::string row = "Log Filter Top PIDs\n7/7 seven 1 2 3 4\n";
    // Empty, binary, endless without line feeds, endless lines, 10,000-byte lines around a row,
    // and output that ends while the command goes on: only the real row ever counts.
    StandIn("true");
    RunNow(plugin);
    StandIn("head -c 200000 /dev/urandom");
    RunNow(plugin);
    StandIn("cat /dev/zero");
    RunNow(plugin);
    StandIn("yes 'not a row'");
    RunNow(plugin);
    EXPECT_EQ(2u, Stat("runlog.output_cut") + Stat("runlog.timed_out"));
    EXPECT_TRUE(context_.Inserted().empty());

    StandIn("long=$(head -c 10000 /dev/zero | tr '\\0' 'x')\necho \"$long Log Filter Top PIDs\"\nprintf '" + row +
            "'\necho \"1/1 $long 1 2 3 4\"");
    RunNow(plugin);
    StandIn("printf '" + row + "'\nexec >&-\nsleep 1000");
    RunNow(plugin);
    std::vector<Json::Value> reports = Reports();
    ASSERT_EQ(2u, reports.size());
    for (const Json::Value& report : reports) {
        ASSERT_EQ(1u, report["Detail"].size());
        EXPECT_EQ("seven", report["Detail"][0]["ProcessName"].asString());
    }
    EXPECT_GE(Stat("runlog.overlong_lines"), 2u);
}

TEST_F(RunLogManagerTest, AHangingCommandIsKilledWithItsChildrenAndTheLoopGoesOn) {
    Configure();
    sp<RunLogManager> plugin = Load({1, 1});
    LogCapture log;
    // Rows arrive, then nothing and no end: the rows read before the deadline still count.
    StandIn("echo $$ > " + Dir() + "/pid\nsleep 1000 &\necho $! > " + Dir() +
            "/child\necho 'Log Filter Top PIDs'\necho '3/3 slow 1 2 3 4'\nwait");
    RunNow(plugin);
    EXPECT_EQ(1u, Stat("runlog.timed_out"));
    EXPECT_TRUE(log.Contains(ANDROID_LOG_WARN, "logcat -S did not end its output within 1 s, killed"));
    EXPECT_TRUE(WaitUntil([&] { return Ended(Read(Dir() + "/pid")) && Ended(Read(Dir() + "/child")); }));
    ASSERT_EQ(1u, Reports().size());
    EXPECT_EQ("slow", Reports()[0]["Detail"][0]["ProcessName"].asString());

    // The loop is free for the next run.
    StandIn("printf 'Log Filter Top PIDs\\n4/4 next 1 2 3 4\\n'");
    RunNow(plugin);
    EXPECT_EQ(2u, Reports().size());
}

TEST_F(RunLogManagerTest, RunsOnTheLoopEveryQuotaPeriodReadAnewEachRun) {
    // An hour lasts a second: the first run comes at once (180 s / 3600), the next after the
    // quota's 60 minutes, i.e. every second.
    StandIn("date +%s.%N >> " + Dir() + "/times\nprintf 'Log Filter Top PIDs\\n1/1 a 1 2 3 4\\n'");
    Configure();
    context_.SetSysProperity(kMaxLine, "-1");
    sp<RunLogManager> plugin = Load({3600, 30});
    // Unconfigured runs send nothing and are re-posted all the same.
    ASSERT_TRUE(WaitUntil([&] { return Stat("runlog.runs") >= 2; }));
    EXPECT_TRUE(context_.Inserted().empty());
    EXPECT_NE(std::string::npos, Dump(plugin).find("period 60 min")) << Dump(plugin);

    Configure();
    ASSERT_TRUE(WaitUntil([&] { return context_.Inserted().size() >= 3; }));
    std::vector<std::string> times = android::base::Split(android::base::Trim(Read(Dir() + "/times")), "\n");
    ASSERT_GE(times.size(), 3u);
    for (size_t i = 1; i < times.size(); ++i) {
        EXPECT_GE(std::stod(times[i]) - std::stod(times[i - 1]), 0.9) << Read(Dir() + "/times");
    }

    // LogStatic 0 stands for 480 minutes: 8 s at this speed, taken up from the next run on.
    WriteQuota(0);
    const uint64_t runs = Stat("runlog.runs");
    ASSERT_TRUE(WaitUntil([&] { return Dump(plugin).find("period 480 min") != std::string::npos; }));
    EXPECT_LE(Stat("runlog.runs"), runs + 2);
    std::string dump = Dump(plugin);
    size_t next = dump.find("next run in ");
    ASSERT_NE(std::string::npos, next) << dump;
    EXPECT_GE(std::stoi(dump.substr(next + 12)), 6) << dump;
}

}  // namespace
}  // namespace android::Orvane
