#include "service/binder_transport.h"

#if !defined(__ANDROID__)

#include "host/service/host_binder_server.h"
#include "utils/orvane_log.h"

namespace android {
namespace Orvane {
namespace BinderTransport {
namespace {

// The daemon's one server, made by StartThreadPool. Never destroyed: its threads serve until the
// process ends.
HostBinderServer* gServer = nullptr;

}  // namespace

void StartThreadPool(size_t maxThreads, DaemonStats& stats) {
    if (gServer == nullptr) {
        gServer = new HostBinderServer(stats);
    }
    gServer->StartThreadPool(maxThreads);
}

bool AddService(const std::string& name, const sp<BBinder>& service, const std::string& workDir) {
    if (gServer == nullptr) {
        OLOGE("%s no thread pool to serve %s", name.c_str());
        return false;
    }
    return gServer->AddService(workDir + name + ".sock", service);
}

void JoinThreadPool() {
    if (gServer != nullptr) {
        gServer->JoinThreadPool();
    }
}

}  // namespace BinderTransport
}  // namespace Orvane
}  // namespace android

#endif  // !__ANDROID__
