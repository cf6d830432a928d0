#ifndef ORVANE_PLATFORM_PIPELINE_H
#define ORVANE_PLATFORM_PIPELINE_H

#include <atomic>
#include <cstdint>
#include <memory>
#include <set>
#include <string>
#include <vector>

#include <utils/Mutex.h>
#include <utils/RefBase.h>
#include <utils/StrongPointer.h>

#include "platform/event.h"
#include "platform/plugin.h"
#include "utils/daemon_stats.h"

namespace android {
namespace Orvane {

// An ordered list of plugins that an event passes, each step on the loop of its plugin, and the
// listener plugins told once the last one has handled it. The processors are fixed at
// construction. `listenersLock_` guards the listener set, which is replaced as a whole on each
// registration, so a step in flight keeps the set it started with. Always hold a pipeline
// through sp<Pipeline>: a step queued on a loop keeps its pipeline alive.
//
// The pipeline counts the events it holds: an event enters at step 0 (ProcessPipeline with
// index 0, from a source or InsertEventToPipeline) and leaves when a plugin returns -1, a middle
// plugin returns 1, or the last plugin has run and the listeners have been handed it. Sources
// read that backlog to stop taking more than the pipelines get through. With a context on its
// first plugin the pipeline also reports "pipeline.<name>.published", ".refused" and
// ".backlog_high" to the daemon's statistics.
class Pipeline : public virtual RefBase {
public:
    Pipeline(const std::string& name, const std::vector<sp<Plugin>>& plugins);

    // Only the first plugin decides; a pipeline without plugins accepts nothing.
    bool CanProcessEvent(sp<Event> event);
    // Runs step `index` on the right thread: directly when the plugin has no loop or shares it
    // with the previous step, else as a task on the plugin's loop.
    void ProcessPipeline(sp<Event> event, unsigned int index);
    // Runs step `index` here, then the next step or the listeners.
    void ProcessEvent(sp<Event> event, unsigned int index);
    // Events entered and not yet through; any thread.
    uint64_t Backlog() const { return backlog_.load(std::memory_order_relaxed); }
    // Counts an event that a source offered and the first plugin declined.
    void CountRefused();
    // A listener already present is not added again.
    void RegisterPluginListener(sp<Plugin> listener);
    // Forgets every listener: a source listening to its own pipeline holds it in a cycle that
    // only the platform's teardown can break.
    void ReleaseListeners();

    const std::string& GetName() const { return name_; }
    const std::vector<sp<Plugin>>& GetPlugins() const { return plugins_; }
    std::set<sp<Plugin>> GetListeners() const;

private:
    using ListenerSet = std::set<sp<Plugin>>;

    std::shared_ptr<const ListenerSet> CurrentListeners() const;
    void Leave() { backlog_.fetch_sub(1, std::memory_order_relaxed); }

    const std::string name_;
    const std::vector<sp<Plugin>> plugins_;
    std::atomic<uint64_t> backlog_{0};
    // The daemon's counters when the first plugin has a context, else null.
    DaemonStats::Counter* published_ = nullptr;
    DaemonStats::Counter* refused_ = nullptr;
    DaemonStats::Counter* backlogHigh_ = nullptr;
    mutable Mutex listenersLock_;
    std::shared_ptr<const ListenerSet> listeners_ GUARDED_BY(listenersLock_);
};

}  // namespace Orvane
}  // namespace android

#endif  // ORVANE_PLATFORM_PIPELINE_H
