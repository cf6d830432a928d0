#ifndef ORVANE_SERVICE_ORVANE_SERVICE_H
#define ORVANE_SERVICE_ORVANE_SERVICE_H

#include <chrono>
#include <string>
#include <vector>

#include <utils/RefBase.h>

#include "platform/plugin_platform.h"

namespace android {
namespace Orvane {

// The platform side of the binder service: turns each command of the companion application
// into an event for the plugin that handles it, and answers dumps.
// Threads: StartService runs on the main thread and returns only when the service cannot be
// published; the other operations run on binder threads, several at once. They only create
// events and post them through the platform, whose loops serialise the work, so the object keeps
// no state besides the platform, which outlives it.
class OrvaneService : public RefBase {
public:
    // A dump's text beyond this is cut, so that no dump holds more memory.
    static constexpr size_t kMaxDumpBytes = 2 * 1024 * 1024;
    // How long a dump's caller gets, in all, to take the text.
    static constexpr std::chrono::seconds kDumpDeliveryBound{5};

    explicit OrvaneService(PluginPlatform* platform);

    // Publishes the service "orvane" and serves it on the calling thread for good. False, with an
    // error line that says why, when the service cannot be published.
    bool StartService();

    // The log processor's result for the pack request; 0 when it could not take the event.
    int NotifyPackLog();
    void SetRunMode(const std::string& name, const std::string& file);
    void NotifyUploadSwitch(bool on);
    void NotifyConfigUpdate(const std::string& folder);
    void NotifyUserActivated();

    // No arguments: the summary; "plugin NAME [ARGS...]": that plugin's own dump; "stats": the
    // daemon's statistics; anything else: a usage line. The text is made in memory, which never
    // blocks a plugin's loop, then handed to the caller's descriptor within kDumpDeliveryBound.
    void Dump(int fd, const std::vector<std::string>& args);
    void DumpPluginSummaryInfo(int fd);
    void DumpPluginInfo(int fd, const std::string& name, const std::vector<std::string>& args);

    DaemonStats& GetStats() { return platform_->GetStats(); }

private:
    // Writes the dump asked for by args to fd.
    void WriteDump(int fd, const std::vector<std::string>& args);

    // An event of the service with the given id, or empty (with an info line) when none could
    // be created; `op` names the caller in that line.
    sp<Event> CreateEvent(const char* op, uint32_t eventId);

    PluginPlatform* const platform_;
};

}  // namespace Orvane
}  // namespace android

#endif  // ORVANE_SERVICE_ORVANE_SERVICE_H
