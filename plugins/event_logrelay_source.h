#ifndef ORVANE_PLUGINS_EVENT_LOGRELAY_SOURCE_H
#define ORVANE_PLUGINS_EVENT_LOGRELAY_SOURCE_H

#include <memory>
#include <string>

#include <android-base/unique_fd.h>
#include <utils/Mutex.h>

#include "plugins/device_source.h"
#include "plugins/file_monitor.h"

namespace android {
namespace Orvane {

// The event source of the kernel's exception log node "qx_exception_log": waits for priority
// data with epoll and publishes each record, unparsed, as event 902902 with the value
// "save_param_list". A record longer than a read arrives as several events, one per read: each
// is a piece of text of the driver's and none can choose its id or time.
// Threads: StartEventSource and threadLoop run on the thread the platform gives the source;
// OnUnload runs on the unloading thread and requests the stop. `monitorLock_` guards the
// monitor, the descriptors and `looping_` between the two; while `looping_` only the loop
// replaces the descriptors (when it reopens the node), so it keeps their numbers at hand.
class EventLogrelaySource : public DeviceSource {
public:
    EventLogrelaySource() : DeviceSource("EventLogrelaySource") {}

    void OnLoad() override;
    void OnUnload() override;
    // Opens and registers the node, then stays in threadLoop; returns at once when either fails.
    void StartEventSource() override;
    // Returns 0 once it sees the stop request.
    int threadLoop();
    void ParseEvent(const std::string& record);

private:
    // After the node failed with `error`: opens and registers it again, and hands the loop the
    // new descriptors; false when a stop came first.
    bool ReopenDevice(int error, int& epfd, int& fd);
    // Closes the descriptors and drops the monitor.
    void ReleaseDevice() REQUIRES(monitorLock_);

    std::string path_;  // the node's path, set before the loop starts
    Mutex monitorLock_;
    std::unique_ptr<android::FileMonitor> monitor_ GUARDED_BY(monitorLock_);
    android::base::unique_fd epollFd_ GUARDED_BY(monitorLock_);
    android::base::unique_fd deviceFd_ GUARDED_BY(monitorLock_);
    bool looping_ GUARDED_BY(monitorLock_) = false;  // threadLoop is running and owns the device
};

}  // namespace Orvane
}  // namespace android

#endif  // ORVANE_PLUGINS_EVENT_LOGRELAY_SOURCE_H
