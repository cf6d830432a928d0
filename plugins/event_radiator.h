#ifndef ORVANE_PLUGINS_EVENT_RADIATOR_H
#define ORVANE_PLUGINS_EVENT_RADIATOR_H

#include <atomic>

#include "platform/plugin.h"

namespace android {
namespace Orvane {

// The event source of the kernel's event device "qxev": one text record per read,
// "EventId %d -t %lu -paraList %s", each published as an event into the source's pipelines.
// Threads: StartEventSource runs the blocking read loop (and ParseEvent) on the thread the
// platform gives the source; OnUnload, on the unloading thread, only raises `stopping`, which
// the loop reads between bursts of records.
class EventRadiator : public EventSource {
public:
    void OnLoad() override;
    void OnUnload() override;
    // Returns only when the device cannot be opened or the loop sees `stopping` after a failed
    // select or read.
    void StartEventSource() override;
    // Parses one NUL-terminated record and publishes its event; an invalid record is dropped.
    void ParseEvent(char* record);

private:
    std::atomic<bool> stopping_{false};
};

}  // namespace Orvane
}  // namespace android

#endif  // ORVANE_PLUGINS_EVENT_RADIATOR_H
