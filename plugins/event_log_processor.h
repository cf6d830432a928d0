#ifndef ORVANE_PLUGINS_EVENT_LOG_PROCESSOR_H
#define ORVANE_PLUGINS_EVENT_LOG_PROCESSOR_H

#include <sys/types.h>

#include <atomic>
#include <cstdint>
#include <map>
#include <memory>
#include <string>
#include <vector>

#include "config/event_upload_xml_parser.h"
#include "platform/event_thread_pool.h"
#include "platform/plugin.h"
#include "plugins/privacy_path_check.h"
#include "utils/daemon_stats.h"
#include "utils/file_pattern.h"
#include "utils/thread_checker.h"

namespace android {
namespace Orvane {

// Gathers the logs of a fault event into one zip pack, keeps the per-domain log folders within
// their quotas and, when the service asks for an upload, hands the finished packs and the
// "eventinfo" files over to the "uploading" folders.
//
// Folders under the work folder: <domain>/ holds the packs of an event domain (id / 1,000,000)
// made while the upload switch is "on", <domain>/ue_off/ those made while it is not, and
// <domain>/uploading/ the packs handed over; uploading/ holds the handed-over "eventinfo" files.
// A pack is named "EventId_<fingerprint>_<serial>_<yyyyMMddHHmmss>_<id>.zip"; a second pack of
// the same id named within the same second takes the next free second, so packs never overwrite
// each other and every name keeps the pattern "EventId_\S+_\d{14}_\d{9}.zip". A pack is written
// under a temporary name in its folder (".orvane_tmp_<name>.part", which no listing of packs
// matches), checked, flushed to disk and only then renamed into place: a full disk or a crash
// never leaves a half-written pack where the upload picks packs up.
//
// Sources come from the log rules of the event's id (EventUploadXmlParser): files, the newest
// files of a folder and command outputs (written into temporary files of the event's folder and
// removed after packing). Each one must pass the privacy path check (PrivacyPathCheck); the pack
// is made from the descriptor the check opened. The quota's logSpace caps the uncompressed
// source data of one pack in KiB: a file that does not fit contributes its newest part, files
// after the cap is used up are left out, each with a warning line and a count.
//
// Threads: OnEvent, the pack names and the folder trimming run on the plugin's loop (checked at
// run time); the hand-over runs there too, as a task. Collections run on the pool "proc_logger"
// (4 threads at background priority), each on a snapshot of its event, so that the pipeline's
// later readers never race with a worker. At most kMaxWaitingCollections collections wait for a
// worker; an event beyond that gets "zipLogName" = kQueueFullReason and no pack, and is counted.
// Commands run one at a time in the process: children are reaped through SIGCHLD, and two
// waiters at once would take each other's signal. Listings of a folder by pattern
// (GetFileInDirByPattern) pass the pattern to scandir's filter through module-wide state, so one
// lock serialises all listings. OnUnorderedEvent runs on "qx_unorder" and only touches the
// upload switch. The plugin must outlive its collections: its destructor stops the pool.
class EventLogProcessor : public Plugin, public EventListener {
public:
    static constexpr size_t kWorkerCount = 4;
    static constexpr size_t kMaxWaitingCollections = 32;
    static constexpr char kQueueFullReason[] = "LOG_QUEUE_FULL";
    static constexpr char kTempPrefix[] = ".orvane_tmp_";

    // One file to pack: the path judged at collection and opened again through the privacy check
    // when packing; `entryName` names it in the pack (empty: the file's resolved path).
    struct LogSource {
        std::string path;
        std::string entryName;
        LogCollectInfo* rule = nullptr;  // the rule that took it
        dev_t device = 0;
        ino_t inode = 0;
        bool leftOut = false;  // set when packing could not take it
    };

    EventLogProcessor();
    ~EventLogProcessor() override;

    void OnLoad() override;
    void OnUnload() override;
    EVENT_RET OnEvent(sp<Event>& event) override;
    void OnUnorderedEvent(sp<Event> event) override;
    void Dump(int fd, const std::vector<std::string>& args) override;

    // Upload admission.
    bool CanUpload();
    bool IsNotExpired();
    bool CanUploadRatio(uint32_t level);
    void ProcessCfgOrUeUpdate(sp<Event> event);

    // Collection, on the plugin's loop.
    bool CheckIfNeedProcessLog(sp<Event> event);
    void CheckAndClearLogFolder(sp<Event> event);
    std::string GetEventDirPath(sp<Event> event);
    std::string GetLogPackName(sp<Event> event);
    // Restores the log counts of the quota bookkeeping from the packs on disk.
    void InitRecordLogCnt();

    // Collection, on a worker.
    void ProcessEventLog(sp<Event> event);
    std::vector<LogSource> GetSrcLogFileList(sp<Event> event, std::vector<LogCollectInfo>& rules,
                                             std::vector<std::string>& tempFiles);
    void AddStaticLog(LogCollectInfo& rule, std::vector<LogSource>& sources);
    void AddDynamicLog(LogCollectInfo& rule, std::vector<LogSource>& sources);
    void AddCmdLog(const std::string& eventDir, LogCollectInfo& rule, std::vector<LogSource>& sources,
                   std::vector<std::string>& tempFiles);
    void DeleteTempFileInEventDir(const std::vector<std::string>& tempFiles);
    bool PackLogToZip(sp<Event> event, std::vector<LogSource>& files);

    // Hand-over. CheckAndProcessUploadEvent returns how many packs and "eventinfo" files are
    // handed over (queued on the plugin's loop when it has one).
    int CheckAndProcessUploadEvent();
    void ProcessUploadEvent();
    int ProcessUploadingLog();
    int ProcessUploadingEvent();

    // Paths of the entries of dir whose whole name matches, oldest modification first; with
    // limit >= 0 only the newest `limit` of them.
    static std::vector<std::string> GetFileInDirByPattern(const std::string& dir, const FilePattern& pattern,
                                                          int32_t limit);
    static std::vector<std::string> GetFileInDirByPattern(const std::string& dir, const std::string& pattern,
                                                          int32_t limit);
    // The packs of domain in dir, then those in dir/ue_off, each list oldest first.
    static void GetLogFiles(const std::string& dir, const std::string& domain, std::vector<std::string>& out);

    size_t GetWaitingCollections() const { return waiting_.load(); }

private:
    struct Counters;

    void QueueCollection(const sp<Event>& event);
    // Domain folders of the work folder whose names match `pattern`.
    std::vector<std::string> ListDomainFolders(const std::string& pattern);
    std::vector<std::string> ListEventInfoFiles();
    std::string GetDomainDir(uint32_t eventId);

    PluginContext* context_ = nullptr;
    std::string workDir_;
    std::string osVersion_;
    std::unique_ptr<Counters> counters_;
    std::unique_ptr<PrivacyPathCheck> pathCheck_;
    sp<EventThreadPool> pool_;
    std::atomic<size_t> waiting_{0};
    // Loop-owned: the last second used in a pack name, per event id.
    std::map<uint32_t, uint64_t> lastPackSecond_;
    ThreadChecker loopThread_;
};

}  // namespace Orvane
}  // namespace android

#endif  // ORVANE_PLUGINS_EVENT_LOG_PROCESSOR_H
