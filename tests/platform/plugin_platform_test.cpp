#include "platform/plugin_platform.h"

#include <stdlib.h>
#include <sys/stat.h>
#include <unistd.h>

#include <fstream>

#include <android-base/file.h>

#include "platform/plugin_factory.h"
#include "tests/platform/platform_test_util.h"
#include "utils/file_util.h"
#include "utils/sys_env.h"

namespace android::Orvane {

// What the test plugins did, shared with the tests (the factory builds the plugins itself).
Journal gPlugins;

// Records its load and every event; listens for unordered events of type 1, id 0 from its load on.
class PlatTestProcessor : public Plugin, public EventListener {
public:
    void OnLoad() override {
        gPlugins.Add("OnLoad:" + GetName());
        AddListenerInfo(1, 0);
        GetPluginContext()->RegisterUnorderedEventListener(this);
    }
    EVENT_RET OnEvent(sp<Event>& event) override {
        gPlugins.Add(GetName() + ":" + std::to_string(event->eventId));
        return 0;
    }
    void OnUnorderedEvent(sp<Event> event) override { gPlugins.Add("Unordered:" + event->sender); }
};
ORVANE_REGISTER_PLUGIN(PlatTestProcessor);
class PlatTestDelayed : public PlatTestProcessor {};
ORVANE_REGISTER_PLUGIN(PlatTestDelayed);

// Publishes an event as soon as it is started.
class PlatTestSource : public EventSource {
    void OnLoad() override { gPlugins.Add("OnLoad:" + GetName()); }
    void StartEventSource() override {
        gPlugins.Add("Start:" + GetName());
        PublishPipelineEvent(new Event(GetName()));
    }
};
ORVANE_REGISTER_PLUGIN(PlatTestSource);
class PlatTestLateSource : public PlatTestSource {};
ORVANE_REGISTER_PLUGIN(PlatTestLateSource);

// Holds the start-up's loading pass until the delayed source has been loaded on the work loop.
class PlatTestBlocker : public Plugin {
    void OnLoad() override {
        WaitUntil([] { return !gPlugins.Find("OnLoad:PlatTestLateSource").what.empty(); });
    }
};
ORVANE_REGISTER_PLUGIN(PlatTestBlocker);

// A source whose start is a blocking read loop, here until the test opens its gate.
Gate gReadLoopEnd;
class PlatTestReadLoop : public EventSource {
    void StartEventSource() override {
        gPlugins.Add("Start:" + GetName());
        gReadLoopEnd.Wait();
    }
};
ORVANE_REGISTER_PLUGIN(PlatTestReadLoop);

// Posts the event it gets synchronously to a plugin on its own loop and to one on another loop.
class PlatTestCaller : public Plugin {
    EVENT_RET OnEvent(sp<Event>& event) override {
        PluginContext* context = GetPluginContext();
        gPlugins.Add("same loop:" + std::to_string(context->PostSyncEventToTarget("PlatTestCallee", event)));
        gPlugins.Add("other loop:" + std::to_string(context->PostSyncEventToTarget("PlatTestProcessor", event)));
        return 0;
    }
};
ORVANE_REGISTER_PLUGIN(PlatTestCaller);
class PlatTestCallee : public PlatTestProcessor {};
ORVANE_REGISTER_PLUGIN(PlatTestCallee);

class PluginPlatformTest : public testing::Test {
protected:
    // The properties this test sets live in this process only, never in a shared store.
    static void SetUpTestSuite() { unsetenv("ORVANE_PROPERTY_FILE"); }
    void SetUp() override {
        ASSERT_TRUE(FileUtil::CreateDirectory(etc_, 0775) && FileUtil::CreateDirectory(cloud_, 0775));
    }

    static void Write(const std::string& path, const std::string& content) { std::ofstream(path) << content; }
    std::unique_ptr<PluginPlatform> NewPlatform(std::vector<std::string> args = {}) {
        args.insert(args.begin(), {"orvane", "-configDir", etc_, "-workDir", root_ + "/work", "-cloudCfgDir", cloud_});
        std::vector<char*> argv;
        for (auto& arg : args)
            argv.push_back(&arg[0]);
        auto platform = std::make_unique<PluginPlatform>();
        EXPECT_EQ(platform->ParseArgs(static_cast<int>(argv.size()), argv.data()), 0);
        return platform;
    }

    // Waits for every entry due on the loop to have run; false when it does not come to it.
    static bool Drained(const sp<EventLoop>& loop) {
        auto done = std::make_shared<std::atomic<bool>>(false);
        loop->AddTask([done] { *done = true; });
        return WaitUntil([&] { return done->load(); });
    }
    static size_t Count(const std::string& what) {
        auto entries = gPlugins.Entries();
        return std::count(entries.begin(), entries.end(), what);
    }

    TemporaryDir tmp_;
    const std::string root_ = tmp_.path, etc_ = root_ + "/etc/", cloud_ = root_ + "/cloud/";
};

TEST_F(PluginPlatformTest, ParseArgsNormalisesFoldersAndRefusesUnknownOptions) {
    LogCapture capture;
    PluginPlatform platform;
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
                          "qxev=/tmp/qxev,broken,=/nothing,empty=",
                          "-region"};
    EXPECT_EQ(platform.ParseArgs(12, const_cast<char**>(args)), 0);
    EXPECT_EQ(platform.GetConfigDir() + platform.GetWorkDir() + platform.GetCloudConfigDir() + platform.GetConfigName(),
              "/etc/orvane//data/x//cloud/my_config");
    EXPECT_EQ(platform.GetDevicePath("qxev", "/dev/qxev") + platform.GetDevicePath("empty", "/dev/empty"),
              "/tmp/qxev/dev/empty");
    EXPECT_EQ(capture.Count(ANDROID_LOG_WARN, "ParseDevList ignore malformed device entry"), 3u);
    const char* bad[] = {"orvane", "-workDir", "/w", "-bogus", "x"};
    EXPECT_EQ(PluginPlatform().ParseArgs(5, const_cast<char**>(bad)), -1);
    EXPECT_TRUE(capture.Contains(ANDROID_LOG_ERROR, "ParseArgs unsupport args 3 -bogus"));
}

TEST_F(PluginPlatformTest, ConfigFileFollowsCloudCopiesRegionAndBuildType) {
    const std::string named = etc_ + "plugin_config", global = etc_ + "plugin_config_global";
    const std::string cloudNamed = cloud_ + "plugin_config", cloudGlobal = cloud_ + "plugin_config_global";
    Write(named, "plugins:0\n");
    auto cn = NewPlatform({"-region", "CN"});
    EXPECT_EQ(cn->GetPluginConfigPath(), named);
    // An empty cloud copy does not count; a non-empty one wins.
    Write(cloudNamed, "");
    EXPECT_EQ(cn->GetPluginConfigPath(), named);
    Write(cloudNamed, "plugins:0\n");
    EXPECT_EQ(cn->GetPluginConfigPath(), cloudNamed);
    // In the domestic region a global file alone changes nothing; elsewhere it is used, the
    // cloud's when it is not empty.
    Write(global, "plugins:0\n");
    EXPECT_EQ(cn->GetPluginConfigPath(), cloudNamed);
    auto eu = NewPlatform({"-region", "EU"});
    EXPECT_EQ(eu->GetPluginConfigPath(), global);
    Write(cloudGlobal, "plugins:0\n");
    EXPECT_EQ(eu->GetPluginConfigPath(), cloudGlobal);
    // Without a region on the command line the system property decides.
    auto unset = NewPlatform();
    SysEnv::SetSysProperity("ro.quor.build.region", "cn");
    EXPECT_EQ(unset->GetPluginConfigPath(), cloudNamed);
    SysEnv::SetSysProperity("ro.quor.build.region", "");
    EXPECT_EQ(unset->GetPluginConfigPath(), cloudGlobal);
    // Domestic region on an export build: the global file unless the folder marks compatibility.
    unlink(cloudNamed.c_str());
    SysEnv::SetSysProperity("ro.quor.build.type", "2");
    EXPECT_EQ(cn->GetPluginConfigPath(), cloudGlobal);
    Write(etc_ + "compatible", "");
    EXPECT_EQ(cn->GetPluginConfigPath(), named);
    SysEnv::SetSysProperity("ro.quor.build.type", "0");
}

TEST_F(PluginPlatformTest, StartsPluginsSourcesAndDelayedPlugins) {
    Write(etc_ + "plugin_config",
          "plugins:3\nPlatTestSource[thread:src_loop]:0 static\nPlatTestProcessor[thread:proc_loop]:0 static\n"
          "PlatTestDelayed[thread:late_loop]:1 static\n"
          "pipelines:1\nmain: PlatTestProcessor\npipelinetriggers:1\nPlatTestSource: main\n");
    auto platform = NewPlatform({"-region", "CN"});
    auto start = std::chrono::steady_clock::now();
    ASSERT_TRUE(platform->StartPlatform());

    // The source, loaded first, started on its loop only once every plugin was loaded; its
    // event went through the pipeline on the plugins' loop.
    ASSERT_TRUE(gPlugins.WaitFor("PlatTestProcessor:0"));
    Journal::Record started = gPlugins.Find("Start:PlatTestSource");
    EXPECT_EQ(started.thread, ThreadOfLoop(platform->GetLooperByName("src_loop")));
    EXPECT_GE(started.when, gPlugins.Find("OnLoad:PlatTestProcessor").when);
    EXPECT_EQ(gPlugins.Find("PlatTestProcessor:0").thread, ThreadOfLoop(platform->GetLooperByName("proc_loop")));
    // The ready event reached the listener registered during loading.
    EXPECT_TRUE(gPlugins.WaitFor("Unordered:platform"));

    // The delayed plugin is constructed on the work loop after its delay, bound and loaded.
    ASSERT_TRUE(gPlugins.WaitFor("OnLoad:PlatTestDelayed"));
    Journal::Record delayed = gPlugins.Find("OnLoad:PlatTestDelayed");
    EXPECT_GE(delayed.when - start, std::chrono::milliseconds(900));
    EXPECT_EQ(delayed.thread, ThreadOfLoop(platform->GetSharedWorkLoop()));
    EXPECT_EQ(platform->GetPlugins()["PlatTestDelayed"]->GetLooper()->GetName(), "late_loop");

    // Every loop the platform made reports to its statistics.
    for (const char* loop : {"plat_shared", "qx_unorder", "src_loop", "proc_loop"}) {
        EXPECT_GE(platform->GetStats().Value(std::string("loop.") + loop + ".backlog_high"), 1u) << loop;
    }
}

TEST_F(PluginPlatformTest, DelayedPluginsLoadOnceAndALooplessDelayedSourceLeavesTheWorkLoopFree) {
    // The delayed source's delay ends while the blocker holds the last loading pass.
    Write(etc_ + "plugin_config",
          "plugins:4\nPlatTestBlocker[]:0 static\nPlatTestLateSource[thread:late_src_loop]:1 static\n"
          "PlatTestProcessor[thread:proc_loop]:0 static\nPlatTestReadLoop[]:1 static\n"
          "pipelines:1\nmain: PlatTestProcessor\npipelinetriggers:2\nPlatTestLateSource: main\n"
          "PlatTestReadLoop: main\n");
    LogCapture capture;
    auto platform = NewPlatform({"-region", "CN"});
    ASSERT_TRUE(platform->StartPlatform());
    ASSERT_TRUE(gPlugins.WaitFor("Start:PlatTestReadLoop"));
    // The read loop holds a thread of its own, not the work loop, which goes on running tasks.
    bool workLoopFree = Drained(platform->GetSharedWorkLoop());
    Journal::Record readLoop = gPlugins.Find("Start:PlatTestReadLoop");
    gReadLoopEnd.Open();
    ASSERT_TRUE(workLoopFree) << "the read loop blocks the shared work loop";
    EXPECT_NE(readLoop.thread, ThreadOfLoop(platform->GetSharedWorkLoop()));
    EXPECT_NE(readLoop.thread, std::this_thread::get_id());
    ASSERT_TRUE(Drained(platform->GetLooperByName("late_src_loop")));
    EXPECT_EQ(Count("OnLoad:PlatTestLateSource"), 1u) << capture.Dump();
    EXPECT_EQ(Count("Start:PlatTestLateSource"), 1u) << capture.Dump();
    EXPECT_EQ(Count("Start:PlatTestReadLoop"), 1u) << capture.Dump();
}

TEST_F(PluginPlatformTest, SyncPostToAPluginOnTheCallersOwnLoopIsRefused) {
    Write(etc_ + "plugin_config",
          "plugins:3\nPlatTestCaller[thread:same_loop]:0 static\nPlatTestCallee[thread:same_loop]:0 static\n"
          "PlatTestProcessor[thread:other_loop]:0 static\n");
    auto platform = NewPlatform({"-region", "CN"});
    ASSERT_TRUE(platform->StartPlatform());
    LogCapture capture;
    sp<Event> event = new Event("test");
    event->eventId = 77;
    ASSERT_TRUE(platform->PostAsyncEventToTarget("PlatTestCaller", event));
    if (!gPlugins.WaitFor("other loop:1")) {
        platform.release();  // its loop waits for itself for good: no teardown can stop it
        FAIL() << "a synchronous post to the caller's own loop hangs";
    }
    EXPECT_EQ(Count("same loop:0"), 1u);
    EXPECT_EQ(Count("PlatTestCallee:77"), 0u);
    EXPECT_EQ(Count("PlatTestProcessor:77"), 1u);
    EXPECT_EQ(capture.Count(ANDROID_LOG_ERROR, "PostSyncEventToTarget"), 1u) << capture.Dump();
}

TEST_F(PluginPlatformTest, LinksAtTheProcessMarkerAreRefused) {
    Write(etc_ + "plugin_config", "plugins:0\n");
    const std::string work = root_ + "/work/", victim = root_ + "/victim";
    ASSERT_EQ(mkdir(work.c_str(), 0775), 0);
    for (bool symbolic : {true, false}) {
        Write(victim, "precious\n");
        ASSERT_EQ(chmod(victim.c_str(), 0600), 0);
        unlink((work + "orvane.pid").c_str());
        ASSERT_EQ(symbolic ? symlink(victim.c_str(), (work + "orvane.pid").c_str())
                           : link(victim.c_str(), (work + "orvane.pid").c_str()),
                  0);
        LogCapture capture;
        EXPECT_FALSE(NewPlatform()->StartPlatform()) << symbolic;
        std::string content;
        ASSERT_TRUE(FileUtil::LoadStringFromFile(victim, content));
        struct stat st;
        ASSERT_EQ(stat(victim.c_str(), &st), 0);
        EXPECT_EQ(content, "precious\n") << symbolic;
        EXPECT_EQ(st.st_mode & 07777, 0600u) << symbolic;
        EXPECT_EQ(capture.Count(ANDROID_LOG_ERROR, "orvane.pid"), 1u) << capture.Dump();
    }
}

}  // namespace android::Orvane
