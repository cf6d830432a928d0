#ifndef ORVANE_CONFIG_EVENT_UPLOAD_XML_PARSER_H
#define ORVANE_CONFIG_EVENT_UPLOAD_XML_PARSER_H

#include <sys/types.h>

#include <chrono>
#include <cstdint>
#include <memory>
#include <string>
#include <vector>

#include <utils/Mutex.h>
#include <utils/RefBase.h>

#include "platform/plugin_context.h"
#include "utils/daemon_stats.h"
#include "utils/file_pattern.h"
#include "utils/file_util.h"

namespace android {
namespace Orvane {

// One source of logs of a rule set: a file, the newest files of a folder that match a pattern,
// or the output of a command. The rules hand out copies, so each collection fills `collected`
// of its own.
struct LogCollectInfo {
    enum class Kind { kStatic, kDynamic, kCommand };

    static constexpr uint32_t kMaxCount = 1000;
    static constexpr uint32_t kDefaultTimeoutSec = 10;
    static constexpr uint32_t kMaxTimeoutSec = 300;

    // A file taken by one collection, with its identity when it was taken.
    struct CollectedFile {
        std::string path;
        dev_t device = 0;
        ino_t inode = 0;
    };

    Kind kind = Kind::kStatic;
    std::string path;                            // kStatic: the file; kDynamic: the folder
    std::shared_ptr<const FilePattern> pattern;  // kDynamic: file names, whole-name match
    uint32_t count = 1;                          // kDynamic: how many of the newest matches
    uint32_t maxAgeSec = 0;                      // kDynamic: oldest modification age taken; 0 any
    std::string command;                         // kCommand: words separated by single blanks
    uint32_t timeoutSec = kDefaultTimeoutSec;    // kCommand
    std::string fileName;                        // kCommand: the output's name inside the pack
    bool deleteLog = false;                      // kStatic, kDynamic: delete the files once packed
    std::vector<CollectedFile> collected;

    bool IsDeleteLog() const { return deleteLog && kind != Kind::kCommand; }
    // Deletes the collected files that are still the very files collected: a path that names
    // another file by now, or a link, is left alone.
    void DeleteLogFile() const;
};

// One version of the log collection rules "event_upload.xml" (etc/README.md describes the
// vocabulary): rule sets for one event id or an id range, in document order, and the
// subscriptions of events whose records go to the companion app. Never changed once read, so any
// thread may query it.
struct UploadRules {
    struct RuleSet {
        uint32_t eventMin = 0;
        uint32_t eventMax = 0;
        std::vector<LogCollectInfo> logs;
    };

    // The rule set of the smallest range that holds id (the first in the document among equal
    // ones); null when none does. A rule set without logs means "no logs" for its range.
    const RuleSet* Find(uint32_t id) const;

    // Events of one id or id range that leave a record in an "eventinfo" file: how many days the
    // companion app keeps it, and whether it shows it to the user.
    struct Subscription {
        static constexpr uint32_t kMaxExpireDays = 3650;

        uint32_t eventMin = 0;
        uint32_t eventMax = 0;
        uint32_t expireDays = 0;
        bool visible = false;
    };

    // The subscription of the smallest range that holds id (the first in the document among
    // equal ones); null when none does.
    const Subscription* FindSubscription(uint32_t id) const;

    std::string source;  // the document it was read from
    std::vector<RuleSet> ruleSets;
    std::vector<Subscription> subscriptions;
    size_t rejected = 0;  // elements left out for a bad value
};

// Reads the log collection rules and keeps the version in force, for log collection (which
// sources an event's pack gets) and storage (whether an event has log rules at all).
//
// The document is chosen by ConfigDocument::Choose (cloud copy first) and read again when the
// chosen file's stamp changed; the files are looked at no more than once per kRecheck (at once
// when the folders differ from the last call, as after a configuration update). A missing
// or unreadable document means no rules: every event then gets "NO_LOG_CONFIG".
//
// Threads: any thread; `mutex_` guards the rules in force and what they were read from, and is
// held while a changed document is read (before the document lock of XmlParser).
class EventUploadXmlParser : public RefBase {
public:
    static constexpr char kFileName[] = "event_upload.xml";
    static constexpr std::chrono::milliseconds kRecheck{1000};

    static sp<EventUploadXmlParser> getInstance();
    // A parser of its own, for tests that need a fresh history.
    EventUploadXmlParser() = default;

    // Copies of the log sources of the rule set that applies to id; empty when none applies.
    std::vector<LogCollectInfo> GetEventLogCollectInfo(PluginContext& context, uint32_t id);
    bool HasLogRules(PluginContext& context, uint32_t id);
    // The rules in force; never null (empty rules without a document).
    std::shared_ptr<const UploadRules> GetRules(const std::string& cloudDir, const std::string& configDir,
                                                DaemonStats* stats);

    // One document read on its own. Elements with a bad value are left out with a warning line
    // and counted in `rejected` (and in "config.event_upload.rejected" when stats are given).
    static std::shared_ptr<const UploadRules> ReadRules(const std::string& path, DaemonStats* stats);

private:
    Mutex mutex_;
    std::shared_ptr<const UploadRules> current_ GUARDED_BY(mutex_);
    std::string loadedPath_ GUARDED_BY(mutex_);
    FileStamp loadedStamp_ GUARDED_BY(mutex_);
    // When, and in which folders, the files were last looked at.
    std::chrono::steady_clock::time_point checkedAt_ GUARDED_BY(mutex_);
    std::string checkedFolders_ GUARDED_BY(mutex_);
};

}  // namespace Orvane
}  // namespace android

#endif  // ORVANE_CONFIG_EVENT_UPLOAD_XML_PARSER_H
