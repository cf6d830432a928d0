#ifndef ORVANE_PLUGINS_PSI_MONITOR_H
#define ORVANE_PLUGINS_PSI_MONITOR_H

#include <cstdint>
#include <functional>
#include <string>
#include <thread>
#include <vector>

#include <android-base/unique_fd.h>

#include "utils/daemon_stats.h"

namespace android {
namespace Orvane {

// One trigger to arm: "some 150000 2000000" written to the pressure file of a resource.
struct PsiTriggerSpec {
    std::string resource;  // "cpu", "memory" or "io", the file's name
    std::string text;
    uint32_t windowUs = 0;
    // After a trigger of this resource fired, its triggers are not watched for this long.
    uint32_t coolDownSec = 0;
};

// The kernel's pressure stall triggers and the thread that waits for them. A trigger lives as
// long as the descriptor it was written to stays open; the kernel then signals POLLPRI at most
// once per window while the stall stays over the threshold. The watcher thread sleeps in poll
// with no time-out while nothing happens, so a calm system costs nothing. After a resource
// fired, its descriptors leave the poll set until its cool-down is over, so lasting pressure
// wakes the thread once per cool-down, not once per window.
//
// Threads: Arm, Start and Stop belong to the owner (one thread at a time). While the watcher
// runs it alone touches the descriptors and the cool-downs; the fire callback runs on it and
// must only hand the work to another thread.
class PsiMonitor {
public:
    using FireCallback = std::function<void(const std::string& resource, const std::string& trigger)>;

    explicit PsiMonitor(std::string pressureDir = "/proc/pressure/");
    ~PsiMonitor();
    PsiMonitor(const PsiMonitor&) = delete;
    PsiMonitor& operator=(const PsiMonitor&) = delete;

    // Arms each trigger (the watcher must be stopped) and returns, for each, why it could not be
    // armed ("<file> \"<text>\": <error>"), or an empty string when it is armed.
    std::vector<std::string> Arm(const std::vector<PsiTriggerSpec>& specs);
    // Starts the watcher over the armed triggers; nothing to watch starts nothing. A trigger the
    // kernel reports an error on is no longer watched and counted in "perf.trigger_lost.<resource>".
    void Start(FireCallback callback, DaemonStats& stats);
    // Stops the watcher and disarms every trigger.
    void Stop();
    bool IsRunning() const { return watcher_.joinable(); }

private:
    struct Armed {
        PsiTriggerSpec spec;
        android::base::unique_fd fd;
        bool lost = false;  // the kernel reported an error on it
    };

    void Watch();
    // Clears events the kernel kept for descriptors that were out of the poll set.
    void Drain(const std::string& resource);

    const std::string pressureDir_;
    std::vector<Armed> armed_;
    // Monotonic nanoseconds until which each armed trigger's resource cools down; watcher only.
    std::vector<int64_t> coolUntilNs_;
    android::base::unique_fd wakeFd_;
    FireCallback callback_;
    DaemonStats* stats_ = nullptr;
    std::thread watcher_;
};

}  // namespace Orvane
}  // namespace android

#endif  // ORVANE_PLUGINS_PSI_MONITOR_H
