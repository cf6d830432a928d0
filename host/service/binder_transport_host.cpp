#include "service/binder_transport.h"

#if !defined(__ANDROID__)

#include "host/service/host_binder_server.h"

namespace android {
namespace Orvane {
namespace BinderTransport {
namespace {

// The daemon's one server. Never destroyed: its threads serve until the process ends.
HostBinderServer& Server() {
    static HostBinderServer* server = new HostBinderServer();
    return *server;
}

}  // namespace

void StartThreadPool(size_t maxThreads) {
    Server().StartThreadPool(maxThreads);
}

bool AddService(const std::string& name, const sp<BBinder>& service, const std::string& workDir) {
    return Server().AddService(workDir + name + ".sock", service);
}

void JoinThreadPool() {
    Server().JoinThreadPool();
}

}  // namespace BinderTransport
}  // namespace Orvane
}  // namespace android

#endif  // !__ANDROID__
