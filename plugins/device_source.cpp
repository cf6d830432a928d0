#include "plugins/device_source.h"

#include <string.h>

#include <algorithm>
#include <cinttypes>

#include "platform/pipeline.h"
#include "platform/plugin_context.h"
#include "utils/orvane_log.h"

namespace android {
namespace Orvane {
namespace {

using android::base::unique_fd;

// How often a held-back reader looks at the backlog again; short against the time the pipelines
// need to work down from the high to the low mark.
constexpr std::chrono::milliseconds kBacklogPoll{5};

}  // namespace

DeviceSource::DeviceSource(const char* name) : name_(name) {}

void DeviceSource::OnUnload() {
    Mutex::Autolock lock(stopLock_);
    stopping_ = true;
    stopRequested_.broadcast();
}

bool DeviceSource::Stopping() const {
    Mutex::Autolock lock(stopLock_);
    return stopping_;
}

bool DeviceSource::Pause(std::chrono::milliseconds span) {
    Mutex::Autolock lock(stopLock_);
    if (!stopping_) {
        stopRequested_.waitRelative(stopLock_, std::chrono::nanoseconds(span).count());
    }
    return !stopping_;
}

bool DeviceSource::WaitForRoom() {
    uint64_t backlog = Backlog();
    if (backlog >= kBacklogHigh) {
        Counted().deferred->fetch_add(1, std::memory_order_relaxed);
        OLOG_LIMITED_AS(ANDROID_LOG_WARN, "StartEventSource", "%s %s holds back: %" PRIu64 " events in its pipelines",
                        name_.c_str(), backlog);
        while (Backlog() > kBacklogLow) {
            if (!Pause(kBacklogPoll)) {
                return false;
            }
        }
    }
    return !Stopping();
}

void DeviceSource::CountRead() {
    Counted().read->fetch_add(1, std::memory_order_relaxed);
    retryDelay_ = kFirstRetryDelay;
}

unique_fd DeviceSource::Reopen(const std::string& path, int error, const std::function<unique_fd()>& open) {
    Counted().lost->fetch_add(1, std::memory_order_relaxed);
    OLOG_AS(ANDROID_LOG_WARN, "StartEventSource", "%s %s lost (%s), reopening", path.c_str(), strerror(error));
    for (int attempt = 1; Pause(retryDelay_); ++attempt) {
        retryDelay_ = std::min(retryDelay_ * 2, kMaxRetryDelay);
        unique_fd fd = open();
        if (fd.ok()) {
            Counted().reopened->fetch_add(1, std::memory_order_relaxed);
            OLOG_AS(ANDROID_LOG_INFO, "StartEventSource", "%s %s reopened after %d attempts", path.c_str(), attempt);
            return fd;
        }
    }
    return unique_fd();
}

std::string DeviceSource::DevicePath(const char* node, const char* defaultPath) const {
    PluginContext* context = GetPluginContext();
    return context != nullptr ? context->GetDevicePath(node, defaultPath) : defaultPath;
}

DaemonStats& DeviceSource::Stats() {
    PluginContext* context = GetPluginContext();
    return context != nullptr ? context->GetStats() : ownStats_;
}

const DeviceSource::Counters& DeviceSource::Counted() {
    std::call_once(countersOnce_, [this] {
        DaemonStats& stats = Stats();
        std::string prefix = "source." + name_ + ".";
        counters_ = {&stats.Get(prefix + "read"), &stats.Get(prefix + "deferred"), &stats.Get(prefix + "lost"),
                     &stats.Get(prefix + "reopened")};
    });
    return counters_;
}

}  // namespace Orvane
}  // namespace android
