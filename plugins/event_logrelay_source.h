#ifndef ORVANE_PLUGINS_EVENT_LOGRELAY_SOURCE_H
#define ORVANE_PLUGINS_EVENT_LOGRELAY_SOURCE_H

#include <atomic>
#include <memory>
#include <mutex>
#include <string>

#include "platform/plugin.h"
#include "plugins/file_monitor.h"

namespace android {
namespace Orvane {

// The event source of the kernel's exception log node "qx_exception_log": waits for priority
// data with epoll and publishes each record, unparsed, as event 902902 with the value
// "save_param_list".
// Threads: StartEventSource and threadLoop run on the thread the platform gives the source;
// OnUnload runs on the unloading thread and raises `stopping`. `monitorLock` guards the monitor,
// the descriptors and `looping` between the two; the loop itself reads the descriptors without
// it, since nobody changes them while it runs.
class EventLogrelaySource : public EventSource {
public:
    ~EventLogrelaySource() override;

    void OnLoad() override;
    void OnUnload() override;
    // Opens and registers the node, then stays in threadLoop; returns at once when either fails.
    void StartEventSource() override;
    // Returns 0 once it sees `stopping`.
    int threadLoop();
    void ParseEvent(const std::string& record);

private:
    // Closes the device and drops the monitor; called with monitorLock held.
    void ReleaseDevice();

    std::atomic<bool> stopping_{false};
    std::mutex monitorLock_;
    std::unique_ptr<android::FileMonitor> monitor_;
    int epollFd_ = -1;
    int deviceFd_ = -1;
    bool looping_ = false;  // threadLoop is running and owns the device
};

}  // namespace Orvane
}  // namespace android

#endif  // ORVANE_PLUGINS_EVENT_LOGRELAY_SOURCE_H
