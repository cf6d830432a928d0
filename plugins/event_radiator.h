#ifndef ORVANE_PLUGINS_EVENT_RADIATOR_H
#define ORVANE_PLUGINS_EVENT_RADIATOR_H

#include <array>
#include <mutex>
#include <string>

#include <android-base/unique_fd.h>

#include "plugins/device_source.h"

namespace android {
namespace Orvane {

// The event source of the kernel's event device "qxev": one text record per read,
// "EventId %d -t %lu -paraList %s", each published as an event into the source's pipelines.
// A record is at most 4096 bytes. Reads ask for one byte more, so that a longer record shows
// itself by filling that byte: it is rejected whole, and its later pieces are dropped up to the
// first read that does not fill the buffer, so that no piece can pass for a record of its own.
// A record that a number of its form cannot hold (an id beyond 32 bits, a negative time, a time
// beyond a signed 64-bit count) is rejected rather than wrapped. Each rejection is counted under
// "source.EventRadiator.rejected.<reason>" (format, id, time, too_long).
// Threads: StartEventSource runs the blocking read loop (and ParseEvent) on the thread the
// platform gives the source; OnUnload, on the unloading thread, requests the stop, which the
// loop sees between bursts of records.
class EventRadiator : public DeviceSource {
public:
    EventRadiator() : DeviceSource("EventRadiator") {}

    void OnLoad() override;
    // Returns only when the device cannot be opened at start or the loop sees the stop request.
    void StartEventSource() override;
    // Parses one NUL-terminated record and publishes its event; an invalid record is dropped.
    void ParseEvent(char* record);

private:
    enum class Rejection { kFormat, kId, kTime, kTooLong, kCount };

    void ReadRecords(const std::string& path, android::base::unique_fd fd);
    void Reject(Rejection reason);

    std::once_flag rejectedOnce_;
    std::array<DaemonStats::Counter*, static_cast<size_t>(Rejection::kCount)> rejected_ = {};
};

}  // namespace Orvane
}  // namespace android

#endif  // ORVANE_PLUGINS_EVENT_RADIATOR_H
