#ifndef ORVANE_SERVICE_BINDER_TRANSPORT_H
#define ORVANE_SERVICE_BINDER_TRANSPORT_H

#include <cstddef>
#include <string>

#include <utils/StrongPointer.h>

#include "service/IOrvaneNativeService.h"
#include "utils/daemon_stats.h"

namespace android {
namespace Orvane {

// Publishes a binder object and serves calls to it: libbinder and the service manager on a
// device, a Unix socket "<name>.sock" in the work folder on a host (see HostBinderServer).
// Called by the main thread only.
namespace BinderTransport {

// Starts the threads that serve calls: at most maxThreads, plus the thread that joins later.
// The host's transport counts the requests it rejects in stats.
void StartThreadPool(size_t maxThreads, DaemonStats& stats);
// False, with an error line, when the service cannot be published. workDir serves the host.
bool AddService(const std::string& name, const sp<BBinder>& service, const std::string& workDir);
// Serves calls on the calling thread; does not return in normal operation.
void JoinThreadPool();

}  // namespace BinderTransport
}  // namespace Orvane
}  // namespace android

#endif  // ORVANE_SERVICE_BINDER_TRANSPORT_H
