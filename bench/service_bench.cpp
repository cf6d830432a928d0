// Round trips of service calls over the host socket, against a running platform.

#include <fcntl.h>
#include <unistd.h>

#include <cstdlib>
#include <string>
#include <vector>

#include <android-base/unique_fd.h>
#include <android/log.h>
#include <benchmark/benchmark.h>

#include "host/service/host_binder_server.h"
#include "platform/plugin_factory.h"
#include "platform/plugin_platform.h"
#include "service/orvane_native_service.h"
#include "utils/file_util.h"

namespace android {
namespace Orvane {
namespace {

// Takes the upload switch events on its own loop, as the log processor would.
class BenchLogProcessor : public Plugin {
public:
    void OnLoad() override {
        SetName("EventLogProcessor");
        SetVersion("EventLogProcessor-1.0");
    }
};
PluginFactory::Register<BenchLogProcessor> gRegistration("EventLogProcessor");

// One platform and one served socket for the whole run.
struct Fixture {
    std::string root;
    PluginPlatform platform;
    sp<HostBinderServer> server;

    Fixture() {
        char pattern[] = "/tmp/service_benchXXXXXX";
        root = mkdtemp(pattern);
        setenv("ORVANE_PROPERTY_FILE", (root + "/properties").c_str(), 1);
        std::string configDir = root + "/etc/";
        FileUtil::CreateDirectory(configDir, 0775);
        FileUtil::SaveStringToFile(configDir + "plugin_config",
                                   "plugins:1\nEventLogProcessor[thread:bench_log_loop]:0 static\n"
                                   "pipelines:1\nbench_pipeline: EventLogProcessor\n",
                                   true);
        std::vector<std::string> args = {"orvane",        "-configDir",   configDir,       "-workDir",
                                         root + "/work/", "-cloudCfgDir", root + "/cloud/"};
        std::vector<char*> argv;
        for (auto& arg : args) {
            argv.push_back(&arg[0]);
        }
        platform.ParseArgs(static_cast<int>(argv.size()), argv.data());
        platform.StartPlatform();
        server = new HostBinderServer(platform.GetStats());
        server->AddService(SocketPath(), new OrvaneNativeService(new OrvaneService(&platform), false));
        server->StartThreadPool(4);
    }
    ~Fixture() {
        server->Stop();
        uint64_t freed = 0;
        FileUtil::DeleteDirectoryOrFile(root, freed, true);
    }
    std::string SocketPath() const { return root + "/work/orvane.sock"; }
};

Fixture& GetFixture() {
    static Fixture fixture;
    return fixture;
}

void BM_NotifyUploadSwitch(benchmark::State& state) {
    __android_log_set_minimum_priority(ANDROID_LOG_WARN);  // the info line per call is not the subject
    HostBinderClient client;
    if (!client.Connect(GetFixture().SocketPath())) {
        state.SkipWithError("no service socket");
        return;
    }
    Parcel data;
    data.writeInterfaceToken(IOrvaneNativeService::descriptor());
    data.writeBool(true);
    Parcel reply;
    for (auto _ : state) {
        if (client.Transact(IOrvaneNativeService::TRANSACTION_notifyUploadSwitch, data, &reply) != OK) {
            state.SkipWithError("transaction failed");
            return;
        }
    }
}
BENCHMARK(BM_NotifyUploadSwitch)->Repetitions(5)->ReportAggregatesOnly(true)->UseRealTime();

void BM_DumpSummary(benchmark::State& state) {
    __android_log_set_minimum_priority(ANDROID_LOG_WARN);
    HostBinderClient client;
    android::base::unique_fd readEnd, writeEnd;
    if (!client.Connect(GetFixture().SocketPath()) || !android::base::Pipe(&readEnd, &writeEnd)) {
        state.SkipWithError("no service socket");
        return;
    }
    Parcel data;
    data.writeFileDescriptor(writeEnd);
    data.writeInt32(0);
    Parcel reply;
    char text[4096];
    for (auto _ : state) {
        if (client.Transact(IBinder::DUMP_TRANSACTION, data, &reply) != OK || read(readEnd, text, sizeof(text)) <= 0) {
            state.SkipWithError("dump failed");
            break;
        }
    }
}
BENCHMARK(BM_DumpSummary)->Repetitions(5)->ReportAggregatesOnly(true)->UseRealTime();

}  // namespace
}  // namespace Orvane
}  // namespace android

BENCHMARK_MAIN();
