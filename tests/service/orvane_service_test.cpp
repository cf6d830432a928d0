#include "service/orvane_service.h"

#include <string.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <unistd.h>

#include <atomic>
#include <filesystem>
#include <string>
#include <thread>
#include <vector>

#include <android-base/file.h>
#include <android-base/unique_fd.h>
#include <gtest/gtest.h>
#include <utils/Mutex.h>

#include "host/service/host_binder_server.h"
#include "platform/plugin_factory.h"
#include "service/orvane_native_service.h"
#include "tests/common/log_capture.h"
#include "utils/dev_info.h"
#include "utils/file_util.h"
#include "utils/sys_env.h"

namespace android::Orvane {
namespace {

constexpr uid_t kSystemUid = 1000;

// What the stand-in plugins and listener received, from their loops.
Mutex gMutex;
std::vector<sp<Event>> gEvents GUARDED_BY(gMutex);
std::atomic<int> gPackResult{0};

void Keep(const sp<Event>& event) {
    Mutex::Autolock lock(gMutex);
    gEvents.push_back(event);
}

std::vector<sp<Event>> EventsOf(uint32_t eventId) {
    Mutex::Autolock lock(gMutex);
    std::vector<sp<Event>> found;
    std::copy_if(gEvents.begin(), gEvents.end(), std::back_inserter(found),
                 [&](const sp<Event>& e) { return e->eventId == eventId; });
    return found;
}

// The log processor stand-in answers the pack request (101) with gPackResult.
template <bool kLogProcessor>
class StandIn : public Plugin {
public:
    void OnLoad() override {
        std::string name = kLogProcessor ? "EventLogProcessor" : "EventStorageManager";
        SetName(name);
        SetVersion(name + "-1.0");
    }
    EVENT_RET OnEvent(sp<Event>& event) override {
        if (kLogProcessor && event->eventId == 101)
            event->SetValue("EVENT_SERVICE_UPLOAD_RET", gPackResult.load());
        Keep(event);
        return 0;
    }
    void Dump(int fd, const std::vector<std::string>& args) override {
        for (const auto& arg : args)
            dprintf(fd, "[%s]", arg.c_str());
    }
};

class ConfigListener : public EventListener {
public:
    ConfigListener() : EventListener("ConfigListener") { AddListenerInfo(1, 104); }
    void OnUnorderedEvent(sp<Event> event) override { Keep(event); }
};

// Registered before the archives' own plugins (this object comes first in the link), so these
// names resolve to the stand-ins; SetUp checks that.
PluginFactory::Register<StandIn<true>> gLogProcessorRegistration("EventLogProcessor");
PluginFactory::Register<StandIn<false>> gStorageRegistration("EventStorageManager");

const char* const kFullConfig =
        "plugins:2\nEventLogProcessor[thread:svc_log_loop]:0 static\nEventStorageManager[]:0 static\n"
        "pipelines:1\nsvc_pipeline: EventLogProcessor EventStorageManager\n";

class OrvaneServiceTest : public testing::Test {
protected:
    // The host property store is chosen once per process, so all tests share one file.
    static std::string PropertyFile() { return "/tmp/orvane_service_props." + std::to_string(getpid()); }
    static void SetUpTestSuite() { setenv("ORVANE_PROPERTY_FILE", PropertyFile().c_str(), 1); }
    static void TearDownTestSuite() {
        unlink(PropertyFile().c_str());
        unlink((PropertyFile() + ".lock").c_str());  // the store's lock beside it
    }
    void SetUp() override {
        ASSERT_NE(dynamic_cast<StandIn<true>*>(PluginFactory::CreatePlugin("EventLogProcessor").get()), nullptr);
        chmod(root_.path, 0755);  // reachable for the unprivileged orvanectl
        Mutex::Autolock lock(gMutex);
        gEvents.clear();
    }
    void TearDown() override {
        if (server_ != nullptr)
            server_->Stop();
        delete platform_;
    }

    // Starts the platform, and a server unless checkCaller is negative.
    void Start(const char* config, int checkCaller) {
        std::string configDir = Root() + "/etc/", cloudDir = Root() + "/cloud/";
        ASSERT_TRUE(FileUtil::CreateDirectory(configDir, 0775));
        ASSERT_TRUE(FileUtil::SaveStringToFile(configDir + "plugin_config", config, true));
        const char* argv[] = {"orvane",         "-configDir",   configDir.c_str(), "-workDir",
                              workDir_.c_str(), "-cloudCfgDir", cloudDir.c_str()};
        platform_ = new PluginPlatform();
        ASSERT_EQ(platform_->ParseArgs(7, const_cast<char**>(argv)), 0);
        ASSERT_TRUE(platform_->StartPlatform());
        platform_->RegisterUnorderedEventListener(new ConfigListener());
        chmod(workDir_.c_str(), 0755);
        if (checkCaller < 0)
            return;
        server_ = new HostBinderServer(platform_->GetStats());
        ASSERT_TRUE(server_->AddService(SocketPath(),
                                        new OrvaneNativeService(new OrvaneService(platform_), checkCaller != 0)));
        ASSERT_EQ(chown(SocketPath().c_str(), -1, kSystemUid), 0);
        server_->StartThreadPool(4);
    }

    std::string SocketPath() const { return workDir_ + "orvane.sock"; }

    // Runs orvanectl as the uid with group 1000 (which the socket admits) under the process name
    // argv0; expects a clean exit and returns the output.
    std::string Ctl(const std::vector<std::string>& args, uid_t uid = kSystemUid,
                    const std::string& argv0 = "com.quor.orvaneservice") {
        std::string command = "setpriv --reuid=" + std::to_string(uid) +
                              " --regid=1000 --clear-groups bash -c 'exec -a \"$0\" \"$@\"' " + argv0 +
                              " " ORVANE_BINARY_DIR "/orvanectl --workdir " + workDir_;
        for (const std::string& arg : args)
            command += " '" + arg + "'";
        FILE* pipe = popen((command + " 2>&1").c_str(), "r");
        char buffer[4096];  // far more than any answer
        std::string output(buffer, fread(buffer, 1, sizeof(buffer), pipe));
        EXPECT_EQ(pclose(pipe), 0) << output;
        return output;
    }

    std::string Root() const { return root_.path; }
    uint64_t Counted(const char* name) const { return platform_->GetStats().Value(name); }

    TemporaryDir root_;
    std::string workDir_ = Root() + "/work/";
    PluginPlatform* platform_ = nullptr;
    sp<HostBinderServer> server_;
};

// Each transaction goes from orvanectl through the host socket to its target in the platform, but
// only for the companion: uid 1000 in "com.quor.orvaneservice". Dumps are not checked; they go to
// the caller's descriptor, orvanectl's standard output.
TEST_F(OrvaneServiceTest, CommandsReachTheirTargetsOnlyFromTheCompanion) {
    Start(kFullConfig, 1);
    LogCapture log;
    EXPECT_EQ(Ctl({"dump"}, 0),
              "Load plugin 2:\nPluginName:EventLogProcessor Version:EventLogProcessor-1.0 Thread:svc_log_loop\n"
              "PluginName:EventStorageManager Version:EventStorageManager-1.0 Thread:Null\n"
              "Load pipeline 1:\npipelineName:svc_pipeline\n");
    EXPECT_EQ(Ctl({"dump", "plugin", "EventLogProcessor", "-v", "x y"}, 0), "[-v][x y]");
    EXPECT_EQ(Ctl({"dump", "plugin", "NoSuchPlugin"}, 0), "plugin NoSuchPlugin not exist");

    // Refused callers get an OK reply, but nothing is done.
    for (uid_t uid : {2000, 0})
        Ctl({"upload-switch", "on"}, uid);
    EXPECT_TRUE(log.Contains(ANDROID_LOG_INFO, "CanProcess not suport calling_uid 2000"));
    EXPECT_EQ(Counted("service.refused.uid"), 2u);
    Ctl({"user-activated"}, kSystemUid, "other.process");
    EXPECT_TRUE(log.Contains(ANDROID_LOG_INFO, "CanProcess not suport process")) << log.Dump();
    EXPECT_EQ(Counted("service.refused.process"), 1u);

    gPackResult = 7;
    EXPECT_EQ(Ctl({"pack-log"}), "7 file(s) handed over for upload\n");
    gPackResult = -1;
    EXPECT_EQ(Ctl({"pack-log"}), "-1: uploading is not allowed on this device now, nothing handed over\n");
    Ctl({"run-mode", "factory", "/data/m\xc3\xa9ode.cfg"});
    EXPECT_EQ(DevInfo::GetRunMode(), "factory");
    EXPECT_EQ(SysEnv::GetSysProperity("persist.sys.orvane.run_mode_file", ""), "/data/m\xc3\xa9ode.cfg");
    Ctl({"upload-switch", "on"});
    Ctl({"upload-switch", "off"});
    ASSERT_TRUE(WaitUntil([] { return EventsOf(103).size() == 2; }));  // none from the refused calls
    EXPECT_EQ(EventsOf(103)[0]->GetValue("EVENT_UE_UPDATE"), "1");     // one loop keeps their order
    EXPECT_EQ(EventsOf(103)[1]->GetValue("EVENT_UE_UPDATE"), "0");
    EXPECT_TRUE(EventsOf(105).empty());  // nor from the other process
    Ctl({"config-update", Root() + "/pushed"});
    EXPECT_EQ(platform_->GetCloudConfigDir(), Root() + "/pushed/");
    ASSERT_TRUE(WaitUntil([] { return EventsOf(104).size() == 1; }));
    Ctl({"user-activated"});
    ASSERT_TRUE(WaitUntil([] { return EventsOf(105).size() == 1; }));
}

// StartService publishes "orvane.sock" (mode 0660) in the work folder and reads the check
// switch from the property; it never returns, so it runs on a thread left to the process.
// Without a log processor a pack request answers 0.
TEST_F(OrvaneServiceTest, StartServiceServesWithCheckSwitchedOff) {
    ASSERT_TRUE(SysEnv::SetSysProperity("persist.sys.orvane.safecheck", "0"));
    Start("plugins:1\nEventStorageManager[thread:svc_storage_loop]:0 static\n", -1);
    static PluginPlatform* servedPlatform = platform_;  // outlives the test, like the thread
    platform_ = nullptr;
    std::thread([] { sp<OrvaneService>(new OrvaneService(servedPlatform))->StartService(); }).detach();
    // The socket's file appears at bind, before its mode is set and it listens: wait for a
    // connection to go through.
    ASSERT_TRUE(WaitUntil([this] {
        struct sockaddr_un addr = {};
        addr.sun_family = AF_UNIX;
        strncpy(addr.sun_path, SocketPath().c_str(), sizeof(addr.sun_path) - 1);
        android::base::unique_fd fd(socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0));
        return connect(fd.get(), reinterpret_cast<struct sockaddr*>(&addr), sizeof(addr)) == 0;
    }));
    EXPECT_EQ(std::filesystem::status(SocketPath()).permissions(), std::filesystem::perms(0660));
    Ctl({"user-activated"}, 0);  // root passes with the check off
    EXPECT_TRUE(WaitUntil([] { return EventsOf(105).size() == 1; }));
    EXPECT_EQ(Ctl({"pack-log"}, 0), "0 file(s) handed over for upload\n");
    SysEnv::SetSysProperity("persist.sys.orvane.safecheck", "1");
}

}  // namespace
}  // namespace android::Orvane
