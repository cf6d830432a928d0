// orvanectl: sends the companion application's commands to the daemon over its host socket,
// and reads or writes the host's system properties.

#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <cstring>
#include <string>
#include <vector>

#include "host/service/host_binder_server.h"
#include "service/IOrvaneNativeService.h"
#include "utils/sys_env.h"

using namespace android;
using namespace android::Orvane;

namespace {

const char* const kUsage =
        "usage: orvanectl [--workdir DIR] COMMAND [ARGS...]\n"
        "\n"
        "Commands to the daemon (its socket is DIR/orvane.sock, DIR defaults to /data/quorlog/orvane/):\n"
        "  pack-log               hand the log packs over for upload; prints how many files\n"
        "  run-mode NAME FILE     set the run mode\n"
        "  upload-switch on|off   switch uploads on or off\n"
        "  config-update FOLDER   announce new cloud configuration in FOLDER\n"
        "  user-activated         announce that the user has activated the device\n"
        "  dump [ARGS...]         print the daemon's dump (\"stats\" for its own statistics,\n"
        "                         \"plugin NAME [ARGS...]\" for one plugin)\n"
        "Host system properties (the file named by ORVANE_PROPERTY_FILE):\n"
        "  getprop KEY            print the value\n"
        "  setprop KEY VALUE      set the value\n"
        "Options:\n"
        "  --workdir DIR          the daemon's work folder\n"
        "  --help                 this text\n"
        "Exit status: 0 when the daemon answered OK, 1 otherwise, 2 for a bad command line.\n";

int Fail(const std::string& message) {
    fprintf(stderr, "orvanectl: %s\n", message.c_str());
    return 1;
}

int BadUsage(const std::string& message) {
    fprintf(stderr, "orvanectl: %s (see --help)\n", message.c_str());
    return 2;
}

// Sends one transaction and checks the transport status and, for the service's own codes,
// the service status at the head of the reply.
int Call(const std::string& workDir, uint32_t code, const Parcel& data, Parcel* reply) {
    std::string socketPath = workDir + (workDir.empty() || workDir.back() != '/' ? "/" : "") + "orvane.sock";
    HostBinderClient client;
    if (!client.Connect(socketPath)) {
        return Fail("cannot connect to " + socketPath + ": " + strerror(errno));
    }
    status_t status = client.Transact(code, data, reply);
    if (status != OK) {
        return Fail("transaction " + std::to_string(code) + " failed with status " + std::to_string(status));
    }
    if (code == IBinder::DUMP_TRANSACTION) {
        return 0;
    }
    binder::Status result;
    if (result.readFromParcel(*reply) != OK) {
        return Fail("malformed reply");
    }
    if (!result.isOk()) {
        return Fail("service error " + std::to_string(result.exceptionCode()) + " (" +
                    std::to_string(result.serviceSpecificErrorCode()) + "): " + result.exceptionMessage().string());
    }
    return 0;
}

}  // namespace

int main(int argc, char** argv) {
    std::string workDir = "/data/quorlog/orvane/";
    std::vector<std::string> args(argv + 1, argv + argc);
    size_t next = 0;
    while (next < args.size() && args[next].rfind("--", 0) == 0) {
        if (args[next] == "--help") {
            fputs(kUsage, stdout);
            return 0;
        }
        if (args[next] == "--workdir" && next + 1 < args.size()) {
            workDir = args[next + 1];
            next += 2;
            continue;
        }
        return BadUsage("unknown option " + args[next]);
    }
    if (next == args.size()) {
        return BadUsage("no command");
    }
    const std::string command = args[next];
    const std::vector<std::string> params(args.begin() + next + 1, args.end());
    auto needs = [&](size_t count) { return params.size() == count; };

    Parcel data;
    Parcel reply;
    if (command == "getprop" && needs(1)) {
        printf("%s\n", SysEnv::GetSysProperity(params[0], "").c_str());
        return 0;
    }
    if (command == "setprop" && needs(2)) {
        return SysEnv::SetSysProperity(params[0], params[1]) ? 0 : Fail("cannot set " + params[0]);
    }
    if (command == "dump") {
        fflush(stdout);
        data.writeFileDescriptor(STDOUT_FILENO);
        data.writeInt32(static_cast<int32_t>(params.size()));
        for (const auto& param : params) {
            data.writeString16(String16(param.c_str()));
        }
        return Call(workDir, IBinder::DUMP_TRANSACTION, data, &reply);
    }

    data.writeInterfaceToken(IOrvaneNativeService::descriptor());
    uint32_t code = 0;
    if (command == "pack-log" && needs(0)) {
        code = IOrvaneNativeService::TRANSACTION_notifyPackLog;
    } else if (command == "run-mode" && needs(2)) {
        code = IOrvaneNativeService::TRANSACTION_setRunMode;
        data.writeString16(String16(params[0].c_str()));
        data.writeString16(String16(params[1].c_str()));
    } else if (command == "upload-switch" && needs(1) && (params[0] == "on" || params[0] == "off")) {
        code = IOrvaneNativeService::TRANSACTION_notifyUploadSwitch;
        data.writeBool(params[0] == "on");
    } else if (command == "config-update" && needs(1)) {
        code = IOrvaneNativeService::TRANSACTION_notifyConfigUpdate;
        data.writeString16(String16(params[0].c_str()));
    } else if (command == "user-activated" && needs(0)) {
        code = IOrvaneNativeService::TRANSACTION_notifyUserActivated;
    } else {
        return BadUsage("bad command or arguments: " + command);
    }
    int ret = Call(workDir, code, data, &reply);
    if (ret == 0 && code == IOrvaneNativeService::TRANSACTION_notifyPackLog) {
        // The daemon answers how many packs and "eventinfo" files it hands over, -1 when this
        // device may not upload now (switch, factory build, region, sampling or age).
        int32_t result = reply.readInt32();
        if (result < 0) {
            printf("%d: uploading is not allowed on this device now, nothing handed over\n", result);
        } else {
            printf("%d file(s) handed over for upload\n", result);
        }
    }
    return ret;
}
