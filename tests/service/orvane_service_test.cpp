#include "service/orvane_service.h"

#include <grp.h>
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <mutex>
#include <string>
#include <thread>
#include <vector>

#include "platform/plugin_factory.h"
#include "service/host_binder_server.h"
#include "service/orvane_native_service.h"
#include "tests/common/log_capture.h"
#include "utils/dev_info.h"
#include "utils/file_util.h"
#include "utils/sys_env.h"

namespace android::Orvane {
namespace {

constexpr uid_t kSystemUid = 1000;

// What the stand-in plugins and listener received, from their loops.
std::mutex gMutex;
std::vector<sp<Event>> gEvents;
int gPackResult = 0;

void SetPackResult(int result) {
    std::lock_guard<std::mutex> lock(gMutex);
    gPackResult = result;
}

std::vector<sp<Event>> EventsOf(uint32_t eventId) {
    std::lock_guard<std::mutex> lock(gMutex);
    std::vector<sp<Event>> found;
    for (const auto& event : gEvents) {
        if (event->eventId == eventId) {
            found.push_back(event);
        }
    }
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
        std::lock_guard<std::mutex> lock(gMutex);
        if (kLogProcessor && event->eventId == 101) {
            event->SetValue("EVENT_SERVICE_UPLOAD_RET", gPackResult);
        }
        gEvents.push_back(event);
        return 0;
    }
    void Dump(int fd, const std::vector<std::string>& args) override {
        std::string joined;
        for (const auto& arg : args) {
            joined += "[" + arg + "]";
        }
        dprintf(fd, "log processor dump %s\n", joined.c_str());
    }
};

class ConfigListener : public EventListener {
public:
    ConfigListener() : EventListener("ConfigListener") { AddListenerInfo(1, 104); }
    void OnUnorderedEvent(sp<Event> event) override {
        std::lock_guard<std::mutex> lock(gMutex);
        gEvents.push_back(event);
    }
};

// Registered before the archives' own plugins (this object comes first in the link), so these
// names resolve to the stand-ins; SetUp checks that.
PluginFactory::Register<StandIn<true>> gLogProcessorRegistration("EventLogProcessor");
PluginFactory::Register<StandIn<false>> gStorageRegistration("EventStorageManager");

const char* const kFullConfig =
    "plugins:2\n"
    "EventLogProcessor[thread:svc_log_loop]:0 static\n"
    "EventStorageManager[]:0 static\n"
    "pipelines:1\n"
    "svc_pipeline: EventLogProcessor EventStorageManager\n";

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
        char pattern[] = "/tmp/orvane_service_testXXXXXX";
        ASSERT_NE(mkdtemp(pattern), nullptr);
        root_ = pattern;
        chmod(root_.c_str(), 0755);  // reachable for the unprivileged orvanectl
        workDir_ = root_ + "/work/";
        std::lock_guard<std::mutex> lock(gMutex);
        gEvents.clear();
    }
    void TearDown() override {
        if (server_ != nullptr) {
            server_->Stop();
        }
        delete platform_;
        uint64_t freed = 0;
        FileUtil::DeleteDirectoryOrFile(root_, freed, true);
    }

    // Starts the platform, and a server unless checkCaller is negative.
    void Start(const char* config, int checkCaller) {
        std::string configDir = root_ + "/etc/";
        ASSERT_TRUE(FileUtil::CreateDirectory(configDir, 0775));
        ASSERT_TRUE(FileUtil::SaveStringToFile(configDir + "plugin_config", config, true));
        std::string cloudDir = root_ + "/cloud/";
        const char* argv[] = {"orvane", "-configDir", configDir.c_str(), "-workDir", workDir_.c_str(), "-cloudCfgDir", cloudDir.c_str()};
        platform_ = new PluginPlatform();
        ASSERT_EQ(platform_->ParseArgs(7, const_cast<char**>(argv)), 0);
        ASSERT_TRUE(platform_->StartPlatform());
        platform_->RegisterUnorderedEventListener(new ConfigListener());
        chmod(workDir_.c_str(), 0755);
        if (checkCaller < 0) {
            return;
        }
        server_ = new HostBinderServer(HostBinderServer::Options());
        ASSERT_TRUE(server_->AddService(SocketPath(), new OrvaneNativeService(new OrvaneService(platform_), checkCaller != 0)));
        ASSERT_EQ(chown(SocketPath().c_str(), -1, kSystemUid), 0);
        server_->StartThreadPool(4);
    }

    std::string SocketPath() const { return workDir_ + "orvane.sock"; }

    // Runs orvanectl in a forked child that drops to the uid (group 1000, which the socket
    // admits) under the process name argv0; expects a clean exit and returns the output.
    std::string Ctl(std::vector<std::string> args, uid_t uid = 0, std::string argv0 = "com.quor.orvaneservice") {
        args.insert(args.begin(), {argv0, "--workdir", workDir_});
        std::vector<char*> argv;
        for (auto& arg : args) {
            argv.push_back(&arg[0]);
        }
        argv.push_back(nullptr);
        int pipeFds[2];
        EXPECT_EQ(pipe(pipeFds), 0);
        pid_t child = fork();
        if (child == 0) {
            dup2(pipeFds[1], STDOUT_FILENO);
            dup2(pipeFds[1], STDERR_FILENO);
            if (setgroups(0, nullptr) != 0 || setgid(kSystemUid) != 0 || setuid(uid) != 0) {
                _exit(120);
            }
            execv((std::string(ORVANE_BINARY_DIR) + "/orvanectl").c_str(), argv.data());
            _exit(121);
        }
        close(pipeFds[1]);
        std::string output;
        char buffer[4096];
        for (ssize_t n; (n = read(pipeFds[0], buffer, sizeof(buffer))) > 0;) {
            output.append(buffer, n);
        }
        close(pipeFds[0]);
        int status = 0;
        waitpid(child, &status, 0);
        EXPECT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 0) << output;
        return output;
    }

    std::string root_, workDir_;
    PluginPlatform* platform_ = nullptr;
    sp<HostBinderServer> server_;
};

// Each transaction goes from orvanectl through the host socket to its target in the platform.
TEST_F(OrvaneServiceTest, EachCommandReachesItsTarget) {
    Start(kFullConfig, 0);
    SetPackResult(7);
    EXPECT_EQ(Ctl({"pack-log"}), "7\n");
    EXPECT_EQ(EventsOf(101).size(), 1u);

    Ctl({"run-mode", "factory", "/data/m\xc3\xa9ode.cfg"});
    EXPECT_EQ(DevInfo::GetRunMode(), "factory");
    EXPECT_EQ(SysEnv::GetSysProperity("persist.sys.orvane.run_mode_file", ""), "/data/m\xc3\xa9ode.cfg");

    Ctl({"upload-switch", "on"});
    Ctl({"upload-switch", "off"});
    ASSERT_TRUE(WaitUntil([] { return EventsOf(103).size() == 2; }));
    EXPECT_EQ(EventsOf(103)[0]->GetValue("EVENT_UE_UPDATE"), "1");  // one loop keeps their order
    EXPECT_EQ(EventsOf(103)[1]->GetValue("EVENT_UE_UPDATE"), "0");

    std::string cloud = root_ + "/pushed";
    Ctl({"config-update", cloud});
    EXPECT_EQ(platform_->GetCloudConfigDir(), cloud + "/");
    ASSERT_TRUE(WaitUntil([] { return EventsOf(104).size() == 1; }));

    Ctl({"user-activated"});
    ASSERT_TRUE(WaitUntil([] { return EventsOf(105).size() == 1; }));
}

TEST_F(OrvaneServiceTest, PackLogWithoutLogProcessorAnswersZero) {
    Start("plugins:1\nEventStorageManager[thread:svc_storage_loop]:0 static\n", 0);
    EXPECT_EQ(Ctl({"pack-log"}), "0\n");
}

TEST_F(OrvaneServiceTest, CallerCheckAdmitsOnlyTheCompanionButNotDumps) {
    Start(kFullConfig, 1);
    LogCapture log;
    // Dumps are not checked; they go to the caller's descriptor, orvanectl's standard output.
    EXPECT_EQ(Ctl({"dump"}),
              "Load plugin 2:\n"
              "PluginName:EventLogProcessor Version:EventLogProcessor-1.0 Thread:svc_log_loop\n"
              "PluginName:EventStorageManager Version:EventStorageManager-1.0 Thread:Null\n"
              "Load pipeline 1:\n"
              "pipelineName:svc_pipeline\n");
    EXPECT_EQ(Ctl({"dump", "plugin", "EventLogProcessor", "-v", "x y"}), "log processor dump [-v][x y]\n");
    EXPECT_EQ(Ctl({"dump", "plugin", "NoSuchPlugin"}), "plugin NoSuchPlugin not exist");

    // Refused callers get an OK reply, but nothing is done.
    for (uid_t uid : {0, 2000}) {
        Ctl({"upload-switch", "on"}, uid);
        EXPECT_TRUE(log.Contains(ANDROID_LOG_INFO, "CanProcess not suport calling_uid " + std::to_string(uid)));
    }
    // The system uid under another process name is refused too.
    Ctl({"user-activated"}, kSystemUid, "other.process");
    EXPECT_TRUE(log.Contains(ANDROID_LOG_INFO, "CanProcess not suport process")) << log.Dump();
    EXPECT_FALSE(log.Contains(ANDROID_LOG_INFO, "notify update switch start"));

    // The companion: uid 1000 in "com.quor.orvaneservice".
    Ctl({"upload-switch", "on"}, kSystemUid);
    EXPECT_TRUE(WaitUntil([] { return EventsOf(103).size() == 1; }));
    EXPECT_TRUE(EventsOf(105).empty());
}

// StartService publishes "orvane.sock" (mode 0660) in the work folder and reads the check
// switch from the property; it never returns, so it runs on a thread left to the process.
TEST_F(OrvaneServiceTest, StartServiceServesWithCheckSwitchedOff) {
    ASSERT_TRUE(SysEnv::SetSysProperity("persist.sys.orvane.safecheck", "0"));
    Start(kFullConfig, -1);
    static PluginPlatform* servedPlatform = platform_;  // outlives the test, like the thread
    platform_ = nullptr;
    std::thread([] { sp<OrvaneService>(new OrvaneService(servedPlatform))->StartService(); }).detach();
    ASSERT_TRUE(WaitUntil([this] { return FileUtil::FileExists(SocketPath()); }));
    struct stat info = {};
    ASSERT_EQ(stat(SocketPath().c_str(), &info), 0);
    EXPECT_EQ(info.st_mode & 0777, 0660u);
    Ctl({"user-activated"});  // root passes with the check off
    EXPECT_TRUE(WaitUntil([] { return EventsOf(105).size() == 1; }));
    SysEnv::SetSysProperity("persist.sys.orvane.safecheck", "1");
}

}  // namespace
}  // namespace android::Orvane
