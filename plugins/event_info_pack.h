#ifndef ORVANE_PLUGINS_EVENT_INFO_PACK_H
#define ORVANE_PLUGINS_EVENT_INFO_PACK_H

#include <sys/types.h>

#include <cstdint>
#include <map>
#include <memory>
#include <string>
#include <vector>

#include <utils/Mutex.h>

#include "config/event_upload_xml_parser.h"
#include "platform/plugin.h"
#include "utils/daemon_stats.h"

namespace android {
namespace Orvane {

// Event-information records of subscribed events, for the companion app.
//
// As a step of the fault pipeline (after privacy compliance, before storage) it marks each event
// that a subscription of "event_upload.xml" names: "subscribe" = "1", "expire" (days) and
// "visible" ("1" or "0"), which storage records. As a listener of the same pipeline it sees the
// event again once every plugin has run, and for a subscribed event that was not dropped appends
// one JSON line to work folder + "eventinfo." + domain. A file that reaches kRotateSize is closed
// by renaming it with ".0" appended (again while that name is taken); the log processor's
// "pack-log" moves every "eventinfo.9xx(.0)*" file into work folder + "uploading". Files never
// handed over are deleted once older than the longest "expire" of the subscriptions (at least
// kMinKeepDays), at load and once a day.
//
// Threads: OnEvent and the clean-up run on the plugin's loop; Dump runs on a binder thread.
// `mutex_` guards the files known per domain and is held while a record is appended, so the
// file operations of the two never interleave.
class EventInfoPack : public Plugin {
public:
    static constexpr char kFaultPipeline[] = "dftFaultEvent";
    static constexpr char kFilePrefix[] = "eventinfo.";
    // The names of the record files, open and closed, which "pack-log" hands over.
    static constexpr char kFilePattern[] = "eventinfo\\.9\\d{2}(\\.0)*";
    static constexpr off_t kRotateSize = 64 * 1024;
    static constexpr uint32_t kMinKeepDays = 30;
    static constexpr unsigned long kCleanUpPeriodSec = 24 * 60 * 60;
    // Closed files kept per domain: a phone that never uploads stops at this many (and their
    // names stay well within a file name's length).
    static constexpr size_t kMaxClosedFiles = 100;

    void OnLoad() override;
    EVENT_RET OnEvent(sp<Event>& event) override;
    void Dump(int fd, const std::vector<std::string>& args) override;

    // Deletes the files older than the keeping time; runs at load and once a day on the loop.
    void CleanUp();

private:
    struct Domain {
        DaemonStats::Counter* written = nullptr;
        DaemonStats::Counter* handedOver = nullptr;
        // Files of this domain in the work folder that this plugin wrote, by path, with the inode
        // they had: a path gone, or naming another file, was handed over.
        std::map<std::string, ino_t> files;
    };

    std::shared_ptr<const UploadRules> Rules();
    void MarkSubscribed(Event& event);
    void Record(const Event& event);
    std::string BuildRecord(const Event& event);
    uint32_t KeepDays(const UploadRules& rules) const;

    // Takes up the files left by an earlier run and cuts a line a crash left unfinished.
    void AdoptFiles() REQUIRES(mutex_);
    Domain& GetDomain(uint32_t domain) REQUIRES(mutex_);
    // Counts the known files that are gone from the work folder as handed over.
    void NoticeHandOver() REQUIRES(mutex_);
    bool Append(uint32_t domain, const std::string& line) REQUIRES(mutex_);
    void Rotate(Domain& domain, const std::string& path) REQUIRES(mutex_);
    void Forget(const std::string& path) REQUIRES(mutex_);

    PluginContext* context_ = nullptr;
    std::string workDir_;
    DaemonStats::Counter* subscribed_ = nullptr;
    DaemonStats::Counter* writeFailed_ = nullptr;
    DaemonStats::Counter* serialWithheld_ = nullptr;
    DaemonStats::Counter* expired_ = nullptr;
    DaemonStats::Counter* discarded_ = nullptr;

    Mutex mutex_;
    std::map<uint32_t, Domain> domains_ GUARDED_BY(mutex_);
};

}  // namespace Orvane
}  // namespace android

#endif  // ORVANE_PLUGINS_EVENT_INFO_PACK_H
