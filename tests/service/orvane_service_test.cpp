#include "service/orvane_service.h"

#include <fcntl.h>
#include <grp.h>
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <condition_variable>
#include <cstdlib>
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
#include "utils/time_util.h"

namespace android {
namespace Orvane {
namespace {

constexpr uid_t kSystemUid = 1000;
constexpr uid_t kShellUid = 2000;

// What the stand-in plugins and listener received, from their loops.
struct Received {
    std::mutex mutex;
    std::vector<sp<Event>> events;
    int packResult = 0;

    void Add(const sp<Event>& event) {
        std::lock_guard<std::mutex> lock(mutex);
        events.push_back(event);
    }
    sp<Event> Find(uint32_t eventId) {
        std::lock_guard<std::mutex> lock(mutex);
        for (const auto& event : events) {
            if (event->eventId == eventId) {
                return event;
            }
        }
        return nullptr;
    }
    size_t Count(uint32_t eventId) {
        std::lock_guard<std::mutex> lock(mutex);
        size_t count = 0;
        for (const auto& event : events) {
            count += event->eventId == eventId ? 1 : 0;
        }
        return count;
    }
    void Reset(int result) {
        std::lock_guard<std::mutex> lock(mutex);
        events.clear();
        packResult = result;
    }
};
Received gReceived;

// Stands in for the log processor: answers the pack request with a chosen result.
class StandInLogProcessor : public Plugin {
public:
    void OnLoad() override {
        SetName("EventLogProcessor");
        SetVersion("EventLogProcessor-1.0");
    }
    EVENT_RET OnEvent(sp<Event>& event) override {
        if (event->eventId == 101) {
            std::lock_guard<std::mutex> lock(gReceived.mutex);
            event->SetValue("EVENT_SERVICE_UPLOAD_RET", gReceived.packResult);
        }
        gReceived.Add(event);
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

class StandInStorageManager : public Plugin {
public:
    void OnLoad() override {
        SetName("EventStorageManager");
        SetVersion("EventStorageManager-1.0");
    }
    EVENT_RET OnEvent(sp<Event>& event) override {
        gReceived.Add(event);
        return 0;
    }
};

class ConfigListener : public EventListener {
public:
    ConfigListener() : EventListener("ConfigListener") { AddListenerInfo(1, 104); }
    void OnUnorderedEvent(sp<Event> event) override { gReceived.Add(event); }
};

// Registered before the archives' own plugins (this object comes first in the link), so these
// names resolve to the stand-ins; SetUp checks that.
PluginFactory::Register<StandInLogProcessor> gLogProcessorRegistration("EventLogProcessor");
PluginFactory::Register<StandInStorageManager> gStorageRegistration("EventStorageManager");

const char* const kFullConfig =
    "plugins:2\n"
    "EventLogProcessor[thread:svc_log_loop]:0 static\n"
    "EventStorageManager[]:0 static\n"
    "pipelines:1\n"
    "svc_pipeline: EventLogProcessor EventStorageManager\n";

const char* const kStorageOnlyConfig =
    "plugins:1\n"
    "EventStorageManager[thread:svc_storage_loop]:0 static\n";

std::string ReadAll(int fd) {
    std::string text;
    char buffer[4096];
    ssize_t n;
    while ((n = read(fd, buffer, sizeof(buffer))) > 0) {
        text.append(buffer, n);
    }
    return text;
}

// Runs orvanectl in a child as the given uid (and group 1000, which the socket admits), under
// the process name the caller check looks for. Returns the exit status and the output.
int RunOrvanectl(uid_t uid, const std::vector<std::string>& args, std::string* output) {
    std::string tool = std::string(ORVANE_BINARY_DIR) + "/orvanectl";
    int pipeFds[2];
    if (pipe(pipeFds) != 0) {
        return -1;
    }
    std::vector<std::string> argvStrings = {"com.quor.orvaneservice"};
    argvStrings.insert(argvStrings.end(), args.begin(), args.end());
    std::vector<char*> argv;
    for (auto& arg : argvStrings) {
        argv.push_back(&arg[0]);
    }
    argv.push_back(nullptr);
    pid_t child = fork();
    if (child == 0) {
        dup2(pipeFds[1], STDOUT_FILENO);
        dup2(pipeFds[1], STDERR_FILENO);
        close(pipeFds[0]);
        if (setgroups(0, nullptr) != 0 || setgid(kSystemUid) != 0 || setuid(uid) != 0) {
            _exit(120);
        }
        execv(tool.c_str(), argv.data());
        _exit(121);
    }
    close(pipeFds[1]);
    std::string text = ReadAll(pipeFds[0]);
    close(pipeFds[0]);
    int status = 0;
    waitpid(child, &status, 0);
    if (output != nullptr) {
        *output = text;
    }
    return WIFEXITED(status) ? WEXITSTATUS(status) : -1;
}

// The host property store is chosen once per process, so all tests share one file.
class PropertyFileEnvironment : public testing::Environment {
public:
    void SetUp() override {
        char pattern[] = "/tmp/orvane_service_propsXXXXXX";
        ASSERT_NE(mkdtemp(pattern), nullptr);
        dir_ = pattern;
        setenv("ORVANE_PROPERTY_FILE", (dir_ + "/properties").c_str(), 1);
    }
    void TearDown() override {
        uint64_t freed = 0;
        FileUtil::DeleteDirectoryOrFile(dir_, freed, true);
    }

private:
    std::string dir_;
};
testing::Environment* const gPropertyEnvironment = testing::AddGlobalTestEnvironment(new PropertyFileEnvironment());

class OrvaneServiceTest : public testing::Test {
protected:
    void SetUp() override {
        ASSERT_NE(dynamic_cast<StandInLogProcessor*>(PluginFactory::CreatePlugin("EventLogProcessor").get()), nullptr);
        char pattern[] = "/tmp/orvane_service_testXXXXXX";
        ASSERT_NE(mkdtemp(pattern), nullptr);
        root_ = pattern;
        chmod(root_.c_str(), 0755);  // reachable for the unprivileged orvanectl
        workDir_ = root_ + "/work/";
        gReceived.Reset(0);
    }

    void TearDown() override {
        if (server_ != nullptr) {
            server_->Stop();
        }
        delete platform_;
        uint64_t freed = 0;
        FileUtil::DeleteDirectoryOrFile(root_, freed, true);
    }

    void StartPlatform(const char* config) {
        std::string configDir = root_ + "/etc/";
        ASSERT_TRUE(FileUtil::CreateDirectory(configDir, 0775));
        ASSERT_TRUE(FileUtil::SaveStringToFile(configDir + "plugin_config", config, true));
        std::string cloudDir = root_ + "/cloud/";
        std::vector<std::string> args = {"orvane", "-configDir", configDir, "-workDir", workDir_, "-cloudCfgDir", cloudDir};
        std::vector<char*> argv;
        for (auto& arg : args) {
            argv.push_back(&arg[0]);
        }
        platform_ = new PluginPlatform();
        ASSERT_EQ(platform_->ParseArgs(static_cast<int>(argv.size()), argv.data()), 0);
        ASSERT_TRUE(platform_->StartPlatform());
        listener_ = new ConfigListener();
        platform_->RegisterUnorderedEventListener(listener_);
        chmod(workDir_.c_str(), 0755);
    }

    void StartServer(bool checkCaller) {
        HostBinderServer::Options options;
        server_ = new HostBinderServer(options);
        service_ = new OrvaneService(platform_);
        ASSERT_TRUE(server_->AddService(SocketPath(), new OrvaneNativeService(service_, checkCaller)));
        ASSERT_EQ(chown(SocketPath().c_str(), -1, kSystemUid), 0);
        server_->StartThreadPool(4);
    }

    std::string SocketPath() const { return workDir_ + "orvane.sock"; }

    // One call through the socket; the service status is read from the reply.
    status_t Call(uint32_t code, const Parcel& data, Parcel* reply, binder::Status* status = nullptr) {
        HostBinderClient client;
        EXPECT_TRUE(client.Connect(SocketPath()));
        status_t ret = client.Transact(code, data, reply);
        if (ret == OK && status != nullptr) {
            EXPECT_EQ(status->readFromParcel(*reply), OK);
        }
        return ret;
    }

    Parcel& Request() {
        request_.setDataSize(0);
        request_.setDataPosition(0);
        request_.writeInterfaceToken(IOrvaneNativeService::descriptor());
        return request_;
    }

    std::string Dump(const std::vector<std::string>& args) {
        int pipeFds[2];
        EXPECT_EQ(pipe(pipeFds), 0);
        Parcel data;
        data.writeFileDescriptor(pipeFds[1]);
        data.writeInt32(static_cast<int32_t>(args.size()));
        for (const auto& arg : args) {
            data.writeString16(String16(arg.c_str()));
        }
        Parcel reply;
        EXPECT_EQ(Call(IBinder::DUMP_TRANSACTION, data, &reply), OK);
        close(pipeFds[1]);
        std::string text = ReadAll(pipeFds[0]);
        close(pipeFds[0]);
        return text;
    }

    std::string root_;
    std::string workDir_;
    PluginPlatform* platform_ = nullptr;
    sp<ConfigListener> listener_;
    sp<OrvaneService> service_;
    sp<HostBinderServer> server_;
    Parcel request_;
};

TEST_F(OrvaneServiceTest, EachCommandReachesItsTarget) {
    StartPlatform(kFullConfig);
    StartServer(false);
    LogCapture log;
    gReceived.Reset(7);

    Parcel reply;
    binder::Status status;
    ASSERT_EQ(Call(IOrvaneNativeService::TRANSACTION_notifyPackLog, Request(), &reply, &status), OK);
    EXPECT_TRUE(status.isOk());
    EXPECT_EQ(reply.readInt32(), 7);
    sp<Event> pack = gReceived.Find(101);
    ASSERT_NE(pack, nullptr);
    EXPECT_EQ(pack->eventType, 1u);
    EXPECT_EQ(pack->sender, "OrvaneService");
    EXPECT_TRUE(log.Contains(ANDROID_LOG_INFO, "notifyPackLog notify pack log start"));

    Request().writeString16(String16("factory"));
    request_.writeString16(String16(u"/data/m\u00e9ode.cfg"));
    ASSERT_EQ(Call(IOrvaneNativeService::TRANSACTION_setRunMode, request_, &reply, &status), OK);
    EXPECT_TRUE(status.isOk());
    EXPECT_EQ(DevInfo::GetRunMode(), "factory");
    EXPECT_EQ(SysEnv::GetSysProperity("persist.sys.orvane.run_mode_file", ""), "/data/m\xc3\xa9ode.cfg");
    EXPECT_TRUE(log.Contains(ANDROID_LOG_INFO, "setRunMode set run mode name=factory, file=/data/m\xc3\xa9ode.cfg"));

    Request().writeBool(true);
    ASSERT_EQ(Call(IOrvaneNativeService::TRANSACTION_notifyUploadSwitch, request_, &reply, &status), OK);
    Request().writeBool(false);
    ASSERT_EQ(Call(IOrvaneNativeService::TRANSACTION_notifyUploadSwitch, request_, &reply, &status), OK);
    ASSERT_TRUE(WaitUntil([] { return gReceived.Count(103) == 2; }));
    {
        std::lock_guard<std::mutex> lock(gReceived.mutex);
        std::vector<std::string> values;
        for (const auto& event : gReceived.events) {
            if (event->eventId == 103) {
                values.push_back(event->GetValue("EVENT_UE_UPDATE"));
            }
        }
        EXPECT_EQ(values, (std::vector<std::string>{"1", "0"}));  // one loop keeps their order
    }
    EXPECT_TRUE(log.Contains(ANDROID_LOG_INFO, "notifyUploadSwitch notify update switch start 1"));
    EXPECT_TRUE(log.Contains(ANDROID_LOG_INFO, "notifyUploadSwitch notify update switch start 0"));

    std::string cloud = root_ + "/pushed";
    Request().writeString16(String16(cloud.c_str()));
    ASSERT_EQ(Call(IOrvaneNativeService::TRANSACTION_notifyConfigUpdate, request_, &reply, &status), OK);
    EXPECT_EQ(platform_->GetCloudConfigDir(), cloud + "/");
    ASSERT_TRUE(WaitUntil([] { return gReceived.Count(104) == 1; }));
    EXPECT_EQ(gReceived.Find(104)->eventType, 1u);
    EXPECT_TRUE(log.Contains(ANDROID_LOG_INFO, "notifyConfigUpdate notify config update start " + cloud));

    uint64_t before = TimeUtil::GetTimestampSecond();
    ASSERT_EQ(Call(IOrvaneNativeService::TRANSACTION_notifyUserActivated, Request(), &reply, &status), OK);
    ASSERT_TRUE(WaitUntil([] { return gReceived.Count(105) == 1; }));
    sp<Event> activated = gReceived.Find(105);
    EXPECT_GE(activated->happenTime, before);
    EXPECT_LE(activated->happenTime, TimeUtil::GetTimestampSecond());
    EXPECT_EQ(activated->sender, "OrvaneService");
    EXPECT_TRUE(log.Contains(ANDROID_LOG_INFO, "notifyUserActivated notify user activate"));
}

TEST_F(OrvaneServiceTest, PackLogWithoutLogProcessorAnswersZero) {
    StartPlatform(kStorageOnlyConfig);
    StartServer(false);
    Parcel reply;
    binder::Status status;
    ASSERT_EQ(Call(IOrvaneNativeService::TRANSACTION_notifyPackLog, Request(), &reply, &status), OK);
    EXPECT_TRUE(status.isOk());
    EXPECT_EQ(reply.readInt32(), 0);
    EXPECT_EQ(reply.dataAvail(), 0u);

    // The upload switch has no receiver either: still an OK reply.
    Request().writeBool(true);
    ASSERT_EQ(Call(IOrvaneNativeService::TRANSACTION_notifyUploadSwitch, request_, &reply, &status), OK);
    EXPECT_TRUE(status.isOk());
}

TEST_F(OrvaneServiceTest, DumpWritesToTheCallersDescriptor) {
    StartPlatform(kFullConfig);
    StartServer(true);  // dumps are not subject to the caller check
    EXPECT_EQ(Dump({}),
              "Load plugin 2:\n"
              "PluginName:EventLogProcessor Version:EventLogProcessor-1.0 Thread:svc_log_loop\n"
              "PluginName:EventStorageManager Version:EventStorageManager-1.0 Thread:Null\n"
              "Load pipeline 1:\n"
              "pipelineName:svc_pipeline\n");
    EXPECT_EQ(Dump({"plugin", "EventLogProcessor", "-v", "x y"}), "log processor dump [-v][x y]\n");
    EXPECT_EQ(Dump({"plugin", "EventLogProcessor"}), "log processor dump \n");
    EXPECT_EQ(Dump({"plugin", "NoSuchPlugin"}), "plugin NoSuchPlugin not exist");
    std::string usage = Dump({"plugin"});
    EXPECT_EQ(usage.find("log processor dump"), std::string::npos);
    EXPECT_NE(usage.find("usage"), std::string::npos);
    EXPECT_EQ(Dump({"bogus", "args"}), usage);

    // orvanectl passes its own standard output.
    std::string output;
    EXPECT_EQ(RunOrvanectl(0, {"--workdir", workDir_, "dump", "plugin", "EventLogProcessor", "a"}, &output), 0);
    EXPECT_EQ(output, "log processor dump [a]\n");
}

TEST_F(OrvaneServiceTest, CallerCheckRefusesAllButTheCompanion) {
    StartPlatform(kFullConfig);
    StartServer(true);
    LogCapture log;

    // This process runs as root, not as the system user.
    Parcel reply;
    binder::Status status;
    Request().writeBool(true);
    ASSERT_EQ(Call(IOrvaneNativeService::TRANSACTION_notifyUploadSwitch, request_, &reply, &status), OK);
    EXPECT_TRUE(status.isOk());
    EXPECT_TRUE(log.Contains(ANDROID_LOG_INFO, "CanProcess not suport calling_uid " + std::to_string(getuid())));
    EXPECT_FALSE(log.Contains(ANDROID_LOG_INFO, "notify update switch start"));

    if (getuid() != 0) {
        GTEST_SKIP() << "dropping to other uids needs root";
    }
    std::string output;
    log.Clear();
    EXPECT_EQ(RunOrvanectl(kShellUid, {"--workdir", workDir_, "upload-switch", "on"}, &output), 0) << output;
    EXPECT_TRUE(log.Contains(ANDROID_LOG_INFO, "CanProcess not suport calling_uid 2000")) << log.Dump();

    // The system uid under another process name is refused too.
    log.Clear();
    std::string tool = std::string(ORVANE_BINARY_DIR) + "/orvanectl";
    pid_t child = fork();
    if (child == 0) {
        if (setgid(kSystemUid) != 0 || setuid(kSystemUid) != 0) {
            _exit(120);
        }
        int devNull = open("/dev/null", O_WRONLY);
        dup2(devNull, STDOUT_FILENO);
        execl(tool.c_str(), "other.process", "--workdir", workDir_.c_str(), "user-activated", static_cast<char*>(nullptr));
        _exit(121);
    }
    int childStatus = 0;
    waitpid(child, &childStatus, 0);
    EXPECT_EQ(WEXITSTATUS(childStatus), 0);
    EXPECT_TRUE(log.Contains(ANDROID_LOG_INFO, "CanProcess not suport process")) << log.Dump();
    EXPECT_EQ(gReceived.Count(105), 0u);

    // The companion: uid 1000 in "com.quor.orvaneservice".
    log.Clear();
    EXPECT_EQ(RunOrvanectl(kSystemUid, {"--workdir", workDir_, "upload-switch", "on"}, &output), 0) << output;
    EXPECT_TRUE(log.Contains(ANDROID_LOG_INFO, "notifyUploadSwitch notify update switch start 1")) << log.Dump();
    EXPECT_FALSE(log.Contains(ANDROID_LOG_INFO, "not suport"));
    EXPECT_TRUE(WaitUntil([] { return gReceived.Count(103) == 1; }));
}

// StartService publishes "orvane.sock" (mode 0660) in the work folder and reads the check
// switch from the property; it never returns, so it runs on a thread left to the process.
TEST_F(OrvaneServiceTest, StartServiceServesWithCheckSwitchedOff) {
    ASSERT_TRUE(SysEnv::SetSysProperity("persist.sys.orvane.safecheck", "0"));
    StartPlatform(kFullConfig);
    // Outlives the test, like the serving thread; kept in a global so it is not a leak.
    static PluginPlatform* servedPlatform = nullptr;
    servedPlatform = platform_;
    platform_ = nullptr;
    std::thread([platform = servedPlatform] {
        sp<OrvaneService> service = new OrvaneService(platform);
        service->StartService();
    }).detach();
    ASSERT_TRUE(WaitUntil([this] { return FileUtil::FileExists(SocketPath()); }));
    struct stat info = {};
    ASSERT_EQ(stat(SocketPath().c_str(), &info), 0);
    EXPECT_TRUE(S_ISSOCK(info.st_mode));
    EXPECT_EQ(info.st_mode & 0777, 0660u);

    LogCapture log;
    Parcel reply;
    binder::Status status;
    ASSERT_EQ(Call(IOrvaneNativeService::TRANSACTION_notifyUserActivated, Request(), &reply, &status), OK);
    EXPECT_TRUE(status.isOk());
    EXPECT_TRUE(WaitUntil([] { return gReceived.Count(105) == 1; }));
    EXPECT_FALSE(log.Contains(ANDROID_LOG_INFO, "not suport"));
    SysEnv::SetSysProperity("persist.sys.orvane.safecheck", "1");
}

TEST(OrvaneNativeServiceTest, MissingServiceIsAServiceSpecificError) {
    sp<OrvaneNativeService> native = new OrvaneNativeService(nullptr, false);
    const uint32_t codes[] = {IOrvaneNativeService::TRANSACTION_notifyPackLog, IOrvaneNativeService::TRANSACTION_setRunMode,
                              IOrvaneNativeService::TRANSACTION_notifyUploadSwitch,
                              IOrvaneNativeService::TRANSACTION_notifyConfigUpdate,
                              IOrvaneNativeService::TRANSACTION_notifyUserActivated};
    const char* const methods[] = {"notifyPackLog", "setRunMode", "notifyUploadSwitch", "notifyConfigUpdate",
                                   "notifyUserActivated"};
    for (size_t i = 0; i < 5; ++i) {
        Parcel data;
        data.writeInterfaceToken(IOrvaneNativeService::descriptor());
        data.writeString16(String16("a"));  // enough arguments for every method
        data.writeString16(String16("b"));
        Parcel reply;
        ASSERT_EQ(native->transact(codes[i], data, &reply), OK);
        binder::Status status;
        ASSERT_EQ(status.readFromParcel(reply), OK);
        EXPECT_EQ(status.exceptionCode(), binder::Status::EX_SERVICE_SPECIFIC);
        EXPECT_EQ(status.serviceSpecificErrorCode(), 1);
        std::string message = status.exceptionMessage().string();
        EXPECT_EQ(message.rfind(std::string(methods[i]) + ":", 0), 0u) << message;
        EXPECT_NE(message.find(": service is null"), std::string::npos) << message;
        EXPECT_EQ(reply.dataAvail(), 0u);  // no result after an error
    }
}

}  // namespace
}  // namespace Orvane
}  // namespace android
