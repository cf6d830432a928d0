#include "plugins/perf_log_analyzer.h"

#include <dirent.h>
#include <fcntl.h>
#include <signal.h>
#include <stdio.h>
#include <sys/prctl.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <filesystem>

#include <android-base/file.h>
#include <android-base/unique_fd.h>
#include <gtest/gtest.h>
#include <json/json.h>

#include "config/event_xml_parser.h"
#include "platform/plugin_factory.h"
#include "tests/common/fake_plugin_context.h"
#include "tests/common/log_capture.h"
#include "tests/common/test_data.h"
#include "tests/common/write_document.h"
#include "utils/json_util.h"

namespace android::Orvane {
namespace {

using Clock = std::chrono::steady_clock;

// Whether a thread of this process carries the name.
bool HasThread(const std::string& name) {
    std::unique_ptr<DIR, int (*)(DIR*)> tasks(opendir("/proc/self/task"), closedir);
    while (struct dirent* task = readdir(tasks.get())) {
        std::string comm;
        if (android::base::ReadFileToString(std::string("/proc/self/task/") + task->d_name + "/comm", &comm) &&
            comm == name + "\n") {
            return true;
        }
    }
    return false;
}

std::string DumpOf(const sp<Plugin>& plugin) {
    TemporaryFile out;
    plugin->Dump(out.fd, {});
    std::string text;
    android::base::ReadFileToString(out.path, &text);
    return text;
}

// Empty when this machine lets this process arm a pressure trigger, else why not.
std::string WhyNoTriggers() {
    android::base::unique_fd fd(open("/proc/pressure/cpu", O_RDWR | O_CLOEXEC));
    const char trigger[] = "some 1000000 2000000";
    if (fd < 0 || write(fd.get(), trigger, sizeof(trigger)) < 0) {
        return std::string("cannot arm \"") + trigger + "\" on /proc/pressure/cpu: " + strerror(errno);
    }
    return "";
}

// A plugin on a loop of its own, as the platform loads it.
sp<PerfLogAnalyzer> Load(PluginContext& context, const std::string& pressureDir) {
    sp<PerfLogAnalyzer> plugin = new PerfLogAnalyzer(pressureDir, "/proc/");
    plugin->SetPluginContext(&context);
    sp<EventLoop> loop = new EventLoop("perf_loop");
    loop->StartLoop();
    plugin->SetLooper(loop);
    plugin->OnLoad();
    return plugin;
}

const std::string kPressureTool = std::string(ORVANE_BINARY_DIR) + "/orvane-pressure";

// orvane-pressure creating CPU pressure for as long as the object lives.
class CpuPressure {
public:
    CpuPressure() {
        pid_ = fork();
        if (pid_ == 0) {
            prctl(PR_SET_PDEATHSIG, SIGKILL);
            int null = open("/dev/null", O_WRONLY);
            dup2(null, STDOUT_FILENO);
            execl(kPressureTool.c_str(), kPressureTool.c_str(), "cpu", "120", static_cast<char*>(nullptr));
            _exit(127);
        }
    }
    ~CpuPressure() {
        kill(pid_, SIGKILL);
        waitpid(pid_, nullptr, 0);
    }

private:
    pid_t pid_;
};

// Where no trigger can be armed (no pressure files, or files that refuse the trigger) the
// plugin says so once and stays idle: no thread, nothing reported. So it does without a
// configuration, or with one that holds nothing valid.
TEST(PerfLogAnalyzerTest, IdleWithOneWarningWhereNothingCanBeWatched) {
    TemporaryDir work, config, pressure;
    FakePluginContext context(work.path, std::string(config.path) + "/");
    LogCapture capture;

    sp<Plugin> fromFactory = PluginFactory::CreatePlugin("PerfLogAnalyzer");
    ASSERT_NE(nullptr, fromFactory);
    fromFactory->SetPluginContext(&context);
    fromFactory->OnLoad();
    EXPECT_EQ("PerfLogAnalyzer-1.0", fromFactory->GetVersion());
    ASSERT_TRUE(capture.WaitFor(ANDROID_LOG_WARN, "no perf_config.xml in")) << capture.Dump();
    EXPECT_EQ("PerfLogAnalyzer-1.0: idle, no perf_config.xml\n", DumpOf(fromFactory));

    // An old kernel has no pressure files; one that refuses writes is stood in for by a file
    // that cannot be opened for writing.
    ASSERT_TRUE(WriteDocument(R"(<PerfConfig>
        <Resource name="cpu" someStallUs="1000000" windowUs="2000000"/>
        <Resource name="memory" someStallUs="300000" fullStallUs="100000" windowUs="2000000" coolDownSec="60"/>
        <Resource name="io" someStallUs="600000" windowUs="2000000" topCount="2"/>
    </PerfConfig>)",
                              std::string(config.path) + "/perf_config.xml"));
    ASSERT_EQ(0, mkdir((std::string(pressure.path) + "/cpu").c_str(), 0755));
    sp<PerfLogAnalyzer> plugin = Load(context, std::string(pressure.path) + "/");
    ASSERT_TRUE(capture.WaitFor(ANDROID_LOG_WARN, "pressure stall triggers unavailable")) << capture.Dump();
    EXPECT_EQ(1u, capture.Count(ANDROID_LOG_WARN, "pressure stall triggers unavailable"));
    EXPECT_TRUE(capture.Contains(ANDROID_LOG_WARN, "/memory \"some 300000 2000000\": No such file or directory"));
    EXPECT_EQ(4u, context.GetStats().Value("perf.trigger_refused"));
    EXPECT_FALSE(HasThread("perf_psi"));
    std::string dump = DumpOf(plugin);
    EXPECT_NE(std::string::npos, dump.find("idle, pressure stall triggers unavailable")) << dump;
    EXPECT_NE(std::string::npos,
              dump.find("memory: triggers some 300000 2000000 refused, full 100000 2000000 refused; cool-down 60 s; "
                        "top 5; fired 0; events sent 0\nmemory: last pressure none yet\n"))
            << dump;
    EXPECT_NE(std::string::npos, dump.find("io: triggers some 600000 2000000 refused; cool-down 600 s; top 2")) << dump;

    // An update that leaves nothing valid is reported as such.
    ASSERT_TRUE(WriteDocument(R"(<PerfConfig><Resource name="gpu"/></PerfConfig>)",
                              std::string(config.path) + "/perf_config.xml"));
    sp<Event> update = new Event("test");
    update->eventType = 1;
    update->eventId = 104;
    plugin->OnUnorderedEvent(update);
    ASSERT_TRUE(capture.WaitFor(ANDROID_LOG_WARN, "no valid resource in")) << capture.Dump();
    EXPECT_TRUE(WaitUntil([&] { return DumpOf(plugin).find("io:") == std::string::npos; }));
    EXPECT_TRUE(context.Inserted().empty());
}

// The real thing on this machine: CPU pressure fires the kernel's trigger, the plugin sends a
// fault event with the figures and the busiest processes, and lasting pressure fires it again
// only after the cool-down. An update re-arms; unloading ends the watcher.
TEST(PerfLogAnalyzerTest, RealTriggerBecomesFaultEventAndCoolsDown) {
    std::string why = WhyNoTriggers();
    if (!why.empty()) {
        GTEST_SKIP() << why;
    }
    if (access(kPressureTool.c_str(), X_OK) != 0) {
        GTEST_SKIP() << kPressureTool << " is not built here";
    }
    TemporaryDir work, config;
    FakePluginContext context(work.path, std::string(config.path) + "/");
    std::string document = std::string(config.path) + "/perf_config.xml";
    constexpr int kCoolDownSec = 6;
    ASSERT_TRUE(
            WriteDocument(R"(<PerfConfig><Resource name="cpu" someStallUs="100000" windowUs="2000000" coolDownSec=")" +
                                  std::to_string(kCoolDownSec) + R"(" topCount="3"/></PerfConfig>)",
                          document));
    LogCapture capture;
    sp<PerfLogAnalyzer> plugin = Load(context, "/proc/pressure/");
    ASSERT_TRUE(capture.WaitFor(ANDROID_LOG_INFO, "watching 1 of 1 triggers")) << capture.Dump();
    EXPECT_TRUE(HasThread("perf_psi"));

    CpuPressure pressure;
    DaemonStats& stats = context.GetStats();
    ASSERT_TRUE(WaitUntil([&] { return stats.Value("perf.fired.cpu") >= 1; }, std::chrono::seconds(60)));
    Clock::time_point first = Clock::now();
    ASSERT_TRUE(WaitUntil([&] { return stats.Value("perf.fired.cpu") >= 2; }, std::chrono::seconds(60)));
    // Without the cool-down lasting pressure fires once per 2 s window. The first fire may have
    // been seen late, hence the second of slack.
    EXPECT_GE(Clock::now() - first, std::chrono::seconds(kCoolDownSec - 1));
    ASSERT_TRUE(WaitUntil([&] { return !context.Inserted().empty(); }));

    auto inserted = context.Inserted().front();
    EXPECT_EQ("dftFaultEvent", inserted.first);
    const sp<Event>& event = inserted.second;
    EXPECT_EQ(909001001u, event->eventId);
    EXPECT_EQ(2u, event->eventType);
    EXPECT_EQ("PerfLogAnalyzer", event->sender);
    EXPECT_NEAR(static_cast<double>(time(nullptr)), static_cast<double>(event->happenTime), 60);
    Json::Value params;
    ASSERT_TRUE(JsonUtil::ConvertStrToJson(event->GetValue("param_list"), params)) << event->GetValue("param_list");
    EXPECT_EQ("cpu", params["resource"].asString());
    EXPECT_EQ("some 100000 2000000", params["trigger"].asString());
    EXPECT_GT(params["some"]["total"].asUInt64(), 0u);
    EXPECT_TRUE(params["some"]["avg10"].isDouble());
    EXPECT_EQ("cpu_ms", params["measure"].asString());
    EXPECT_GE(params["sampleMs"].asInt64(), 1000);
    const Json::Value& top = params["top"];
    ASSERT_TRUE(top.isArray());
    ASSERT_GE(top.size(), 1u);  // the spinners alone grow
    ASSERT_LE(top.size(), 3u);
    for (Json::ArrayIndex i = 0; i < top.size(); ++i) {
        EXPECT_GT(top[i]["pid"].asInt(), 0);
        EXPECT_TRUE(top[i]["uid"].isUInt());
        EXPECT_FALSE(top[i]["name"].asString().empty());
        EXPECT_GT(top[i]["value"].asUInt64(), 0u);
        if (i > 0) {
            EXPECT_GE(top[i - 1]["value"].asUInt64(), top[i]["value"].asUInt64());
        }
    }
    // Privacy and storage know the event by its catalogue entry: every value must be catalogued.
    std::string etc = TestDataDir() + "/etc/";
    auto catalogued = [&etc](uint32_t id, const Json::Value& object) {
        sp<EventInfoConfig> entry = EventXmlParser::getInstance()->GetEventInfoConfig(etc, id);
        ASSERT_NE(nullptr, entry) << id;
        for (const std::string& key : object.getMemberNames()) {
            EXPECT_TRUE(std::any_of(entry->params.begin(), entry->params.end(),
                                    [&key](const EventParamInfoCfg& param) { return param.name == key; }))
                    << key << " is not a parameter of " << id;
        }
    };
    catalogued(909001001, params);
    catalogued(909001100, params["some"]);
    catalogued(909001101, top[0]);

    std::string dump = DumpOf(plugin);
    EXPECT_NE(std::string::npos, dump.find("cpu: triggers some 100000 2000000 armed; cool-down 6 s; top 3; fired "))
            << dump;
    EXPECT_NE(std::string::npos, dump.find("cpu: last pressure some avg10=")) << dump;

    // A new version of the document re-arms at the configuration update.
    ASSERT_TRUE(WriteDocument(
            R"(<PerfConfig><Resource name="memory" fullStallUs="2000000" windowUs="2000000"/></PerfConfig>)",
            document));
    sp<Event> update = new Event("test");
    update->eventType = 1;
    update->eventId = 104;
    plugin->OnUnorderedEvent(update);
    ASSERT_TRUE(WaitUntil([&] {
        return DumpOf(plugin).find("memory: triggers full 2000000 2000000 armed") != std::string::npos;
    })) << DumpOf(plugin);
    EXPECT_EQ(std::string::npos, DumpOf(plugin).find("cpu:"));

    plugin->OnUnload();
    EXPECT_FALSE(HasThread("perf_psi"));
}

}  // namespace
}  // namespace android::Orvane
