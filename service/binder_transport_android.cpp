#include "service/binder_transport.h"

#include <binder/IPCThreadState.h>
#include <binder/IServiceManager.h>
#include <binder/ProcessState.h>

#include "utils/orvane_log.h"

namespace android {
namespace Orvane {
namespace BinderTransport {

void StartThreadPool(size_t maxThreads, DaemonStats&) {
    sp<ProcessState> process = ProcessState::self();
    process->setThreadPoolMaxThreadCount(maxThreads);
    process->startThreadPool();
    process->giveThreadPoolName();
}

bool AddService(const std::string& name, const sp<BBinder>& service, const std::string&) {
    status_t ret = defaultServiceManager()->addService(String16(name.c_str()), service);
    if (ret != OK) {
        OLOGE("%s add service %s failed, ret=%d", name.c_str(), ret);
        return false;
    }
    return true;
}

void JoinThreadPool() {
    IPCThreadState::self()->joinThreadPool();
}

}  // namespace BinderTransport
}  // namespace Orvane
}  // namespace android
