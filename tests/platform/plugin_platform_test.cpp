#include "platform/plugin_platform.h"

#include <gtest/gtest.h>
#include <stdlib.h>
#include <unistd.h>

#include <chrono>
#include <fstream>
#include <memory>
#include <string>
#include <thread>
#include <vector>

#include "platform/plugin_factory.h"
#include "tests/platform/platform_test_util.h"
#include "utils/sys_env.h"

namespace android {
namespace Orvane {
namespace {

// What the test plugins did, shared with the tests (the factory builds the plugins itself).
Journal& Plugins() {
    static Journal journal;
    return journal;
}

// Records its load and every event; fails events with id 13.
class PlatTestProcessor : public Plugin {
public:
    void OnLoad() override { Plugins().Add("OnLoad:" + GetName()); }
    EVENT_RET OnEvent(sp<Event>& event) override {
        Plugins().Add(GetName() + ":" + std::to_string(event->eventId));
        return event->eventId == 13 ? -1 : 0;
    }
};
ORVANE_REGISTER_PLUGIN(PlatTestProcessor);

class PlatTestSink : public PlatTestProcessor {};
ORVANE_REGISTER_PLUGIN(PlatTestSink);

class PlatTestDelayed : public PlatTestProcessor {};
ORVANE_REGISTER_PLUGIN(PlatTestDelayed);

// Publishes event 1 as soon as it is started.
class PlatTestSource : public EventSource {
public:
    void OnLoad() override { Plugins().Add("OnLoad:" + GetName()); }
    void StartEventSource() override {
        Plugins().Add("Start:" + GetName());
        sp<Event> event = new Event(GetName());
        event->eventId = 1;
        PublishPipelineEvent(event);
    }
};
ORVANE_REGISTER_PLUGIN(PlatTestSource);

// Listens for the ready event from its load on; has no loop of its own.
class PlatTestListener : public Plugin, public EventListener {
public:
    PlatTestListener() : EventListener("PlatTestListener") {}
    void OnLoad() override {
        Plugins().Add("OnLoad:" + GetName());
        AddListenerInfo(1, 0);
        GetPluginContext()->RegisterUnorderedEventListener(this);
    }
    void OnUnorderedEvent(sp<Event> event) override {
        Plugins().Add("Unordered:" + event->sender + ":" + std::to_string(event->eventType) + ":" +
                      std::to_string(event->eventId));
    }
    EVENT_RET OnEvent(sp<Event>& event) override {
        Plugins().Add("Listener:" + std::to_string(event->eventId));
        return 0;
    }
};
ORVANE_REGISTER_PLUGIN(PlatTestListener);

class PlatTestRefuser : public Plugin {
public:
    bool PreToLoad() override { return false; }
    void OnLoad() override { Plugins().Add("OnLoad:" + GetName()); }
};
ORVANE_REGISTER_PLUGIN(PlatTestRefuser);

class PlatTestDynamic : public Plugin {
public:
    PlatTestDynamic() { Plugins().Add("Constructed:PlatTestDynamic"); }
};
ORVANE_REGISTER_PLUGIN(PlatTestDynamic);

class PluginPlatformTest : public testing::Test {
protected:
    // The properties this test sets live in this process only, never in a shared store.
    static void SetUpTestSuite() { unsetenv("ORVANE_PROPERTY_FILE"); }

    void SetUp() override {
        char pattern[] = "/tmp/plugin_platform_test_XXXXXX";
        ASSERT_NE(mkdtemp(pattern), nullptr);
        root_ = pattern;
        configDir_ = root_ + "/etc/";
        cloudDir_ = root_ + "/cloud/";
        workDir_ = root_ + "/work/";
        ASSERT_EQ(system(("mkdir -p " + configDir_).c_str()), 0);
        Plugins().Clear();
        SysEnv::SetSysProperity("ro.quor.build.region", "");
        SysEnv::SetSysProperity("ro.quor.build.type", "0");
    }
    void TearDown() override {
        SysEnv::SetSysProperity("ro.quor.build.region", "");
        SysEnv::SetSysProperity("ro.quor.build.type", "0");
        system(("rm -rf " + root_).c_str());
    }

    static void WriteFile(const std::string& path, const std::string& content) {
        std::ofstream(path, std::ios::trunc) << content;
    }

    std::unique_ptr<PluginPlatform> NewPlatform(std::vector<std::string> extra = {}) {
        std::vector<std::string> args = {"orvane", "-configDir",   configDir_, "-workDir",
                                         workDir_, "-cloudCfgDir", cloudDir_};
        args.insert(args.end(), extra.begin(), extra.end());
        std::vector<char*> argv;
        for (auto& arg : args) {
            argv.push_back(&arg[0]);
        }
        auto platform = std::make_unique<PluginPlatform>();
        EXPECT_EQ(platform->ParseArgs(static_cast<int>(argv.size()), argv.data()), 0);
        return platform;
    }

    std::string root_;
    std::string configDir_;
    std::string cloudDir_;
    std::string workDir_;
};

TEST_F(PluginPlatformTest, ParseArgsNormalisesFoldersAndRefusesUnknownOptions) {
    LogCapture capture;
    {
        PluginPlatform platform;
        EXPECT_EQ(platform.GetWorkDir(), "/data/quorlog/orvane/");
        EXPECT_EQ(platform.GetConfigDir(), "/system/etc/orvane/");
        EXPECT_EQ(platform.GetCloudConfigDir(), "/data/quorlog/orvane/config/");
        EXPECT_EQ(platform.GetConfigName(), "plugin_config");
        const char* args[] = {"orvane",
                              "-configDir",
                              "etc/orvane",
                              "-workDir",
                              "///data/x///",
                              "-cloudCfgDir",
                              "/cloud",
                              "-configName",
                              "  my_config  ",
                              "-devList",
                              "qxev=/tmp/qxev,broken,=/nothing,qx_exception_log=/tmp/exc,empty=",
                              "-region",
                              "EU",
                              "-region"};
        EXPECT_EQ(platform.ParseArgs(14, const_cast<char**>(args)), 0);
        EXPECT_TRUE(capture.Contains(ANDROID_LOG_DEBUG, "ParseArgs agc=14"));
        EXPECT_EQ(platform.GetConfigDir(), "/etc/orvane/");
        EXPECT_EQ(platform.GetWorkDir(), "/data/x/");
        EXPECT_EQ(platform.GetCloudConfigDir(), "/cloud/");
        EXPECT_EQ(platform.GetConfigName(), "my_config");
        EXPECT_EQ(platform.GetRegion(), "EU");
        EXPECT_EQ(platform.GetDevList(), "qxev=/tmp/qxev,broken,=/nothing,qx_exception_log=/tmp/exc,empty=");
        EXPECT_EQ(platform.GetDevicePath("qxev", "/dev/qxev"), "/tmp/qxev");
        EXPECT_EQ(platform.GetDevicePath("qx_exception_log", "/dev/qx_exception_log"), "/tmp/exc");
        EXPECT_EQ(platform.GetDevicePath("other", "/dev/other"), "/dev/other");
        EXPECT_EQ(platform.GetDevicePath("empty", "/dev/empty"), "/dev/empty");
        EXPECT_EQ(capture.Count(ANDROID_LOG_WARN, "ParseDevList ignore malformed device entry"), 3u);

        platform.SetCloudConfigFolder("pushed/config");
        EXPECT_EQ(platform.GetCloudConfigDir(), "/pushed/config/");
    }
    {
        PluginPlatform platform;
        const char* args[] = {"orvane", "-workDir", "/w", "-bogus", "x"};
        EXPECT_EQ(platform.ParseArgs(5, const_cast<char**>(args)), -1);
        EXPECT_TRUE(capture.Contains(ANDROID_LOG_ERROR, "ParseArgs unsupport args 3 -bogus"));
    }
}

TEST_F(PluginPlatformTest, ConfigFileFollowsCloudCopiesRegionAndBuildType) {
    const std::string named = configDir_ + "plugin_config";
    const std::string global = configDir_ + "plugin_config_global";
    const std::string cloudNamed = cloudDir_ + "plugin_config";
    const std::string cloudGlobal = cloudDir_ + "plugin_config_global";
    ASSERT_EQ(system(("mkdir -p " + cloudDir_).c_str()), 0);
    WriteFile(named, "plugins:0\n");
    LogCapture capture;

    auto cn = NewPlatform({"-region", "CN"});
    EXPECT_EQ(cn->GetPluginConfigPath(), named);
    EXPECT_TRUE(capture.Contains(ANDROID_LOG_INFO, "GetPluginConfigPath region:CN,support:CN"));
    // An empty cloud copy does not count; a non-empty one wins.
    WriteFile(cloudNamed, "");
    EXPECT_EQ(cn->GetPluginConfigPath(), named);
    WriteFile(cloudNamed, "plugins:0\n");
    EXPECT_EQ(cn->GetPluginConfigPath(), cloudNamed);
    // In the domestic region a global file alone changes nothing.
    WriteFile(global, "plugins:0\n");
    EXPECT_EQ(cn->GetPluginConfigPath(), cloudNamed);

    // Elsewhere the global file is used, the cloud's when it is not empty.
    auto eu = NewPlatform({"-region", "EU"});
    EXPECT_EQ(eu->GetPluginConfigPath(), global);
    WriteFile(cloudGlobal, "");
    EXPECT_EQ(eu->GetPluginConfigPath(), global);
    WriteFile(cloudGlobal, "plugins:0\n");
    EXPECT_EQ(eu->GetPluginConfigPath(), cloudGlobal);
    unlink(global.c_str());
    unlink(cloudGlobal.c_str());
    EXPECT_EQ(eu->GetPluginConfigPath(), cloudNamed);

    // Without a region on the command line the system property decides.
    WriteFile(global, "plugins:0\n");
    auto unset = NewPlatform();
    SysEnv::SetSysProperity("ro.quor.build.region", "cn");
    EXPECT_EQ(unset->GetPluginConfigPath(), cloudNamed);
    SysEnv::SetSysProperity("ro.quor.build.region", "");
    EXPECT_EQ(unset->GetPluginConfigPath(), global);

    // Domestic region on an export build: the global file unless the folder marks compatibility.
    unlink(cloudNamed.c_str());
    EXPECT_EQ(cn->GetPluginConfigPath(), named);
    SysEnv::SetSysProperity("ro.quor.build.type", "2");
    EXPECT_EQ(cn->GetPluginConfigPath(), global);
    WriteFile(configDir_ + "compatible", "");
    EXPECT_EQ(cn->GetPluginConfigPath(), named);
    unlink((configDir_ + "compatible").c_str());
    SysEnv::SetSysProperity("ro.quor.build.type", "1");
    EXPECT_EQ(cn->GetPluginConfigPath(), named);
}

TEST_F(PluginPlatformTest, StartsPluginsPipelinesSourcesAndAnnouncesReadiness) {
    WriteFile(configDir_ + "plugin_config",
              "plugins:9\n"
              "PlatTestSource[thread:src_loop]:0 static\n"
              "PlatTestProcessor[thread:proc_loop]:0 static\n"
              "PlatTestSink[thread:proc_loop]:0 static\n"
              "PlatTestListener[]:0 static\n"
              "PlatTestRefuser[thread:refuse_loop]:0 static\n"
              "PlatTestUnknown[thread:unknown_loop]:0 static\n"
              "PlatTestDynamic[]:0 dynamic\n"
              "PlatTestDelayed[thread:late_loop]:1 static\n"
              "PlatTestDelayedDynamic[]:1 dynamic\n"
              "pipelines:2\n"
              "main: PlatTestProcessor PlatTestSink\n"
              "partial: PlatTestRefuser PlatTestSink\n"
              "pipelinetriggers:1\n"
              "PlatTestSource: main\n");
    LogCapture capture;
    auto platform = NewPlatform({"-region", "CN"});
    auto start = std::chrono::steady_clock::now();
    ASSERT_TRUE(platform->StartPlatform()) << capture.Dump();
    EXPECT_TRUE(platform->IsReady());

    auto plugins = platform->GetPlugins();
    EXPECT_EQ(plugins.size(), 4u);
    for (const char* name : {"PlatTestSource", "PlatTestProcessor", "PlatTestSink", "PlatTestListener"}) {
        ASSERT_EQ(plugins.count(name), 1u) << name;
        EXPECT_EQ(plugins[name]->GetName(), name);
        EXPECT_EQ(plugins[name]->GetPluginContext(), platform.get());
        EXPECT_EQ(Plugins().Count(std::string("OnLoad:") + name), 1u) << name;
    }
    // One loop per thread name, shared by the plugins that name it.
    EXPECT_EQ(plugins["PlatTestProcessor"]->GetLooper(), plugins["PlatTestSink"]->GetLooper());
    EXPECT_EQ(plugins["PlatTestProcessor"]->GetLooper(), platform->GetLooperByName("proc_loop"));
    EXPECT_EQ(plugins["PlatTestListener"]->GetLooper(), nullptr);
    EXPECT_EQ(capture.Count(ANDROID_LOG_INFO, "GetLooperByName create event looper name proc_loop"), 1u);
    EXPECT_EQ(platform->GetLoops().count("plat_shared"), 0u);
    EXPECT_NE(platform->GetSharedWorkLoop(), nullptr);
    EXPECT_EQ(platform->GetSharedWorkLoop()->GetName(), "plat_shared");
    EXPECT_NE(platform->GetLooperByName("plat_shared"), platform->GetSharedWorkLoop());

    // The source was started on its own loop and its event went through the pipeline there,
    // though the source is loaded first: sources start once every plugin is loaded.
    ASSERT_TRUE(Plugins().WaitFor("PlatTestSink:1"));
    Journal::Record loaded;
    ASSERT_TRUE(Plugins().Find("OnLoad:PlatTestListener", loaded));
    Journal::Record record;
    ASSERT_TRUE(Plugins().Find("Start:PlatTestSource", record));
    EXPECT_EQ(record.thread, ThreadOfLoop(platform->GetLooperByName("src_loop")));
    EXPECT_GE(record.when, loaded.when);
    ASSERT_TRUE(Plugins().Find("PlatTestProcessor:1", record));
    EXPECT_EQ(record.thread, ThreadOfLoop(platform->GetLooperByName("proc_loop")));
    EXPECT_TRUE(capture.Contains(ANDROID_LOG_INFO,
                                 "StartEventSource Start event source[PlatTestSource] in thead[src_loop]"));
    EXPECT_TRUE(capture.Contains(ANDROID_LOG_INFO, "LoadPlugin plugin PlatTestSource isEventSource=1, loadtime:"));
    EXPECT_TRUE(
            capture.Contains(ANDROID_LOG_WARN, "LoadPlugin PlatTestListener loop  not supported, use platform loop"));

    // The ready event reached the listener registered during loading.
    EXPECT_TRUE(Plugins().WaitFor("Unordered:platform:1:0"));

    // Refused, unknown and dynamic plugins are reported and left out.
    EXPECT_TRUE(capture.Contains(ANDROID_LOG_WARN,
                                 "ConstructPlugin plugin PlatTestUnknown not loaded, not found in factory"));
    EXPECT_TRUE(capture.Contains(ANDROID_LOG_WARN, "ConstructPlugin plugin PlatTestDynamic not supported to load"));
    EXPECT_TRUE(capture.Contains(ANDROID_LOG_WARN, "LoadPlugin plugin PlatTestRefuser not constructed"));
    EXPECT_TRUE(capture.Contains(ANDROID_LOG_WARN, "LoadPlugin plugin PlatTestDelayed not constructed"));
    EXPECT_TRUE(capture.Contains(
            ANDROID_LOG_WARN, "ConstructPipeline not found plugin PlatTestRefuser, skip adding to pipeline partial"));
    EXPECT_EQ(platform->GetPipelines()["partial"]->GetPlugins().size(), 1u);
    EXPECT_EQ(Plugins().Count("OnLoad:PlatTestRefuser"), 0u);
    EXPECT_TRUE(capture.Contains(ANDROID_LOG_INFO, "LoadPlugins Start to create plugin PlatTestDelayed delay:1"));

    // The delayed plugin is constructed on the work loop after its delay, bound and loaded.
    ASSERT_TRUE(Plugins().WaitFor("OnLoad:PlatTestDelayed"));
    ASSERT_TRUE(Plugins().Find("OnLoad:PlatTestDelayed", record));
    EXPECT_GE(record.when - start, std::chrono::milliseconds(900));
    EXPECT_EQ(record.thread, ThreadOfLoop(platform->GetSharedWorkLoop()));
    plugins = platform->GetPlugins();
    ASSERT_EQ(plugins.count("PlatTestDelayed"), 1u);
    EXPECT_EQ(plugins["PlatTestDelayed"]->GetLooper()->GetName(), "late_loop");
    EXPECT_TRUE(capture.WaitFor(ANDROID_LOG_WARN, "ConstructPlugin plugin PlatTestDelayedDynamic not supported"));
    EXPECT_EQ(Plugins().Count("Constructed:PlatTestDynamic"), 0u);
}

TEST_F(PluginPlatformTest, PostsEventsToPluginsPipelinesAndListeners) {
    WriteFile(configDir_ + "plugin_config",
              "plugins:3\n"
              "PlatTestProcessor[thread:proc_loop]:0 static\n"
              "PlatTestSink[]:0 static\n"
              "PlatTestListener[]:0 static\n"
              "pipelines:1\n"
              "main: PlatTestProcessor PlatTestSink\n");
    LogCapture capture;
    auto platform = NewPlatform({"-region", "CN"});
    ASSERT_TRUE(platform->StartPlatform());
    std::thread::id procThread = ThreadOfLoop(platform->GetLooperByName("proc_loop"));

    auto event = [](uint32_t id) {
        sp<Event> e = new Event("test");
        e->eventId = id;
        return e;
    };
    Journal::Record record;
    // Synchronous: done when the call returns, on the target's loop; -1 gives false.
    EXPECT_TRUE(platform->PostSyncEventToTarget("PlatTestProcessor", event(21)));
    ASSERT_TRUE(Plugins().Find("PlatTestProcessor:21", record));
    EXPECT_EQ(record.thread, procThread);
    EXPECT_FALSE(platform->PostSyncEventToTarget("PlatTestProcessor", event(13)));
    EXPECT_EQ(Plugins().Count("PlatTestProcessor:13"), 1u);
    // Without a loop the caller's thread runs it.
    EXPECT_TRUE(platform->PostSyncEventToTarget("PlatTestSink", event(22)));
    ASSERT_TRUE(Plugins().Find("PlatTestSink:22", record));
    EXPECT_EQ(record.thread, std::this_thread::get_id());
    EXPECT_FALSE(platform->PostSyncEventToTarget("NoSuchPlugin", event(23)));
    EXPECT_TRUE(capture.Contains(ANDROID_LOG_WARN, "PostSyncEventToTarget plugin NoSuchPlugin not found"));
    EXPECT_FALSE(platform->PostSyncEventToTarget("PlatTestProcessor", nullptr));

    EXPECT_TRUE(platform->PostAsyncEventToTarget("PlatTestProcessor", event(31)));
    EXPECT_TRUE(Plugins().WaitFor("PlatTestProcessor:31"));
    EXPECT_FALSE(platform->PostAsyncEventToTarget("NoSuchPlugin", event(32)));

    // Into a pipeline, with a listener added later.
    EXPECT_TRUE(platform->RegisterPipelineListener("main", platform->GetPlugins()["PlatTestListener"]));
    EXPECT_FALSE(platform->RegisterPipelineListener("nope", platform->GetPlugins()["PlatTestListener"]));
    EXPECT_TRUE(platform->InsertEventToPipeline("main", event(41)));
    EXPECT_TRUE(Plugins().WaitFor("Listener:41"));
    EXPECT_EQ(Plugins().Count("PlatTestSink:41"), 1u);
    EXPECT_FALSE(platform->InsertEventToPipeline("nope", event(42)));
    EXPECT_TRUE(capture.Contains(ANDROID_LOG_WARN, "InsertEventToPipeline pipeline nope not found"));

    // Unordered events reach listeners registered for their type and id.
    sp<Event> ready = event(0);
    ready->eventType = 1;
    ready->sender = "again";
    EXPECT_TRUE(platform->PostUnorderedEvent(ready));
    EXPECT_TRUE(Plugins().WaitFor("Unordered:again:1:0"));
    EXPECT_EQ(PlatCtxGbl::GetInstance(), platform.get());
    platform.reset();
    EXPECT_EQ(PlatCtxGbl::GetInstance(), nullptr);
}

TEST_F(PluginPlatformTest, SecondPlatformOnTheSameWorkFolderIsRefused) {
    WriteFile(configDir_ + "plugin_config", "plugins:0\n");
    LogCapture capture;
    auto first = NewPlatform();
    ASSERT_TRUE(first->StartPlatform());
    std::string marker;
    std::ifstream(workDir_ + "orvane.pid") >> marker;
    EXPECT_EQ(marker, std::to_string(getpid()));

    auto second = NewPlatform();
    EXPECT_FALSE(second->StartPlatform());
    EXPECT_FALSE(second->IsReady());
    EXPECT_TRUE(capture.Contains(ANDROID_LOG_ERROR, "IsExist orvane already running, pid " + std::to_string(getpid()) +
                                                            " holds " + workDir_ + "orvane.pid"));

    // The lock goes with its holder; the marker file stays and does not block the next one.
    first.reset();
    auto third = NewPlatform();
    EXPECT_TRUE(third->StartPlatform());

    // A work folder that cannot exist (its parent is a file) stops start-up too.
    WriteFile(root_ + "/plain_file", "x");
    workDir_ = root_ + "/plain_file/work/";
    auto homeless = NewPlatform();
    EXPECT_FALSE(homeless->StartPlatform());
    EXPECT_TRUE(capture.Contains(ANDROID_LOG_ERROR, "IsExist open " + workDir_ + "orvane.pid failed"));
}

TEST_F(PluginPlatformTest, BrokenCloudConfigFallsBackToTheSystemCopy) {
    ASSERT_EQ(system(("mkdir -p " + cloudDir_).c_str()), 0);
    WriteFile(cloudDir_ + "plugin_config", "plugins:1\nPlatTestSink[thread]:0 static\n");
    WriteFile(configDir_ + "plugin_config", "plugins:1\nPlatTestProcessor[]:0 static\n");
    WriteFile(configDir_ + "plugin_config_global", "plugins:1\nPlatTestSink[]:0 static\n");
    {
        LogCapture capture;
        auto platform = NewPlatform({"-region", "CN"});
        ASSERT_TRUE(platform->StartPlatform());
        auto plugins = platform->GetPlugins();
        EXPECT_EQ(plugins.size(), 1u);
        EXPECT_EQ(plugins.count("PlatTestProcessor"), 1u);
        EXPECT_TRUE(capture.Contains(ANDROID_LOG_WARN, "ParsePlugin plugin PlatTestSink thread type thread or name"));
    }
    {
        // Export builds fall back to the global copy; when that fails too, start-up goes on empty.
        SysEnv::SetSysProperity("ro.quor.build.type", "3");
        WriteFile(configDir_ + "plugin_config_global", "garbage\n");
        LogCapture capture;
        auto platform = NewPlatform({"-region", "CN"});
        ASSERT_TRUE(platform->StartPlatform());
        EXPECT_TRUE(platform->GetPlugins().empty());
        EXPECT_TRUE(capture.Contains(ANDROID_LOG_ERROR, "StartPlatform Fail to parse plugin config"));
        EXPECT_TRUE(platform->IsReady());
    }
}

}  // namespace
}  // namespace Orvane
}  // namespace android
