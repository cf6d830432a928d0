#ifndef ORVANE_PLUGINS_DEVICE_SOURCE_H
#define ORVANE_PLUGINS_DEVICE_SOURCE_H

#include <errno.h>

#include <chrono>
#include <cstdint>
#include <functional>
#include <mutex>
#include <string>

#include <android-base/unique_fd.h>
#include <utils/Condition.h>
#include <utils/Mutex.h>

#include "platform/plugin.h"
#include "utils/daemon_stats.h"

namespace android {
namespace Orvane {

// What the sources that read a kernel device node share: a stop request that ends their waits,
// an intake bounded by what their pipelines get through, and the reopening of a node that
// vanished. Counts into "source.<name>.read", ".deferred", ".lost" and ".reopened".
//
// Threads: the read loop (StartEventSource on the source's thread) calls the protected helpers;
// OnUnload runs on the unloading thread. `stopLock_` guards the stop request and lets a stop end
// a pause at once; a blocking read is left to the device, as it always was.
class DeviceSource : public EventSource {
public:
    // Reading stops while the source's pipelines hold this many events that have not come
    // through, and resumes once they are down to kBacklogLow; the device keeps what is not read.
    static constexpr uint64_t kBacklogHigh = 1024;
    static constexpr uint64_t kBacklogLow = 512;

    void OnUnload() override;

protected:
    // `name` is the plugin's class name, used for counters and log lines.
    explicit DeviceSource(const char* name);

    bool Stopping() const;
    // Sleeps for `span` unless a stop comes first; false once stopping.
    bool Pause(std::chrono::milliseconds span);
    // Returns at once while the pipelines have room; else holds the reader back (counted, one
    // collapsed line) until the backlog is down to the low mark. False once stopping.
    bool WaitForRoom();
    // A failed read or wait that no waiting cures: the node has to be opened again.
    static bool IsLoss(int error) { return error != EINTR && error != EAGAIN && error != EWOULDBLOCK; }
    // Called for each successful read.
    void CountRead();
    // After the node at `path` failed with `error`: one line, counted, then `open` is tried with
    // a growing pause until it gives a descriptor (one line, counted) or a stop comes (invalid).
    android::base::unique_fd Reopen(const std::string& path, int error,
                                    const std::function<android::base::unique_fd()>& open);
    // The configured path of the device node `node`, `defaultPath` without an override.
    std::string DevicePath(const char* node, const char* defaultPath) const;
    // The daemon's statistics, or the source's own without a context.
    DaemonStats& Stats();

    const std::string name_;

private:
    // A node that failed is tried again after 100 ms, then twice as long each time up to 5 s:
    // quick for a driver that reloads, cheap for one that is gone for good.
    static constexpr std::chrono::milliseconds kFirstRetryDelay{100};
    static constexpr std::chrono::milliseconds kMaxRetryDelay{5000};

    struct Counters {
        DaemonStats::Counter* read = nullptr;
        DaemonStats::Counter* deferred = nullptr;
        DaemonStats::Counter* lost = nullptr;
        DaemonStats::Counter* reopened = nullptr;
    };
    // Found once, on first use: the context is set before anything is counted.
    const Counters& Counted();

    mutable Mutex stopLock_;
    Condition stopRequested_;
    bool stopping_ GUARDED_BY(stopLock_) = false;
    std::once_flag countersOnce_;
    Counters counters_;
    DaemonStats ownStats_;
    // The read loop's: the pause before the next attempt to reopen, grown on each failure and
    // reset by a successful read.
    std::chrono::milliseconds retryDelay_ = kFirstRetryDelay;
};

}  // namespace Orvane
}  // namespace android

#endif  // ORVANE_PLUGINS_DEVICE_SOURCE_H
