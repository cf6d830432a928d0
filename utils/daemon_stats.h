#ifndef ORVANE_UTILS_DAEMON_STATS_H
#define ORVANE_UTILS_DAEMON_STATS_H

#include <atomic>
#include <cstdint>
#include <map>
#include <memory>
#include <string>

#include <utils/Mutex.h>

namespace android {
namespace Orvane {

// The daemon's statistics about itself: named counters and high-water marks that every component
// reports to, printed by "orvanectl dump stats". Names are dotted paths, the component first:
// "source.EventRadiator.read", "pipeline.dftFaultEvent.refused", "loop.storage_loop.backlog_high".
// The platform owns the daemon's instance (PluginContext::GetStats); tests build their own.
//
// Threads: any thread may report or read. Counters are found, and created at 0, under `mutex_`;
// a Counter found once is a stable atomic for the life of the object, so hot paths keep the
// reference and count without the lock.
class DaemonStats {
public:
    using Counter = std::atomic<uint64_t>;

    Counter& Get(const std::string& name);
    void Add(const std::string& name, uint64_t delta = 1) { Get(name).fetch_add(delta, std::memory_order_relaxed); }
    // Raises the high-water mark `name` to value when value is higher.
    void RaiseTo(const std::string& name, uint64_t value) { RaiseTo(Get(name), value); }
    static void RaiseTo(Counter& mark, uint64_t value);
    // 0 for a name nothing reported yet.
    uint64_t Value(const std::string& name) const;
    // Every counter as a "name value" line, in name order.
    std::string Format() const;

private:
    mutable Mutex mutex_;
    // Counters live on the heap so that their addresses stay put whatever the map does.
    std::map<std::string, std::unique_ptr<Counter>> counters_ GUARDED_BY(mutex_);
};

}  // namespace Orvane
}  // namespace android

#endif  // ORVANE_UTILS_DAEMON_STATS_H
