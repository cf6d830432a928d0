#include "plugins/event_log_processor.h"

#include <dirent.h>
#include <fcntl.h>
#include <limits.h>
#include <stdio.h>
#include <stdlib.h>
#include <sys/resource.h>
#include <sys/stat.h>
#include <unistd.h>
#include <unzip.h>

#include <algorithm>
#include <cctype>
#include <cerrno>
#include <cinttypes>
#include <cstring>
#include <set>
#include <unordered_map>
#include <utility>

#include <android-base/unique_fd.h>
#include <utils/Mutex.h>

#include "config/event_quota_xml_parser.h"
#include "platform/plugin_context.h"
#include "platform/plugin_factory.h"
#include "plugins/cmd_processor.h"
#include "plugins/event_info_pack.h"
#include "utils/dev_info.h"
#include "utils/file_util.h"
#include "utils/orvane_log.h"
#include "utils/time_util.h"
#include "utils/zip_pack.h"

namespace android {
namespace Orvane {

ORVANE_REGISTER_PLUGIN(EventLogProcessor);

namespace {

constexpr uint32_t kPackLogId = 101;
constexpr uint32_t kUploadSwitchId = 103;
constexpr uint32_t kConfigUpdateId = 104;
constexpr uint32_t kIdsPerDomain = 1000000;
constexpr int32_t kCollectionPriority = 50;
// Android's background priority: packing never competes with the pipeline's loops.
constexpr int kWorkerNice = 10;
constexpr mode_t kFolderMode = 0775;
constexpr mode_t kPackMode = 0775;
constexpr uint64_t kMonthSeconds = 2592000;
constexpr uint64_t kYearSeconds = 31536000;
constexpr size_t kPackSecondsKept = 256;

constexpr char kKeyLogZipName[] = "EVENT_LOG_ZIP_NAME";
constexpr char kUeOff[] = "ue_off";
constexpr char kUploading[] = "uploading";

std::string Domain(uint32_t id) {
    return std::to_string(id / kIdsPerDomain);
}

// The id of a pack, read from the last 13 characters of its name ("%9d.zip"); 0 when unreadable.
uint32_t PackId(const std::string& path) {
    int id = 0;
    if (path.size() < 13 || sscanf(path.c_str() + path.size() - 13, "%9d.zip", &id) != 1 || id < 0) {
        return 0;
    }
    return static_cast<uint32_t>(id);
}

// The packs of one domain: "EventId_\S+_\d{14}_" + domain + "\d{6}.zip".
std::string DomainPackPattern(const std::string& domain) {
    return "EventId_\\S+_\\d{14}_" + domain + "\\d{6}.zip";
}

std::string BaseName(const std::string& path) {
    size_t slash = path.rfind('/');
    return slash == std::string::npos ? path : path.substr(slash + 1);
}

// A field of a pack name: "/" and ":" (and blanks, which would end the name's "\S+") become "_".
std::string NameField(std::string text) {
    for (char& c : text) {
        if (c == '/' || c == ':' || isspace(static_cast<unsigned char>(c))) {
            c = '_';
        }
    }
    return text;
}

// The kernel's name of the file behind fd, without the leading "/"; `fallback` likewise when
// the kernel has none.
std::string EntryNameOf(int fd, const std::string& fallback) {
    char name[PATH_MAX];
    ssize_t size = readlink(("/proc/self/fd/" + std::to_string(fd)).c_str(), name, sizeof(name) - 1);
    std::string path = size > 0 && name[0] == '/' ? std::string(name, static_cast<size_t>(size)) : fallback;
    size_t start = path.find_first_not_of('/');
    return start == std::string::npos ? path : path.substr(start);
}

// Lowers the calling worker to background priority, once per thread.
void LowerWorkerPriority() {
    static thread_local bool lowered = false;
    if (!lowered) {
        setpriority(PRIO_PROCESS, static_cast<id_t>(gettid()), kWorkerNice);
        lowered = true;
    }
}

// A private copy of what a collection reads and writes of its event.
sp<Event> Snapshot(const sp<Event>& event) {
    sp<Event> copy = new Event(event->sender);
    copy->eventType = event->eventType;
    copy->eventId = event->eventId;
    copy->happenTime = event->happenTime;
    copy->timestamp = event->timestamp;
    copy->params = event->params;
    copy->extraParams = event->extraParams;
    return copy;
}

// True when the archive at path can be read back and holds `entries` entries: its central
// directory, written last, made it to the file.
bool IsCompleteZip(const std::string& path, uint64_t entries) {
    unzFile zip = unzOpen(path.c_str());
    if (zip == nullptr) {
        return false;
    }
    unz_global_info info = {};
    bool complete = unzGetGlobalInfo(zip, &info) == UNZ_OK && info.number_entry == entries;
    unzClose(zip);
    return complete;
}

bool SyncFile(const std::string& path) {
    android::base::unique_fd fd(open(path.c_str(), O_RDONLY | O_CLOEXEC));
    return fd >= 0 && fsync(fd.get()) == 0;
}

// Listings by pattern: scandir's filter and comparison take no argument of ours, so the pattern,
// the folder and the modification times the filter saw are module-wide, and one lock makes the
// listings take turns.
Mutex gListingMutex;
const FilePattern* gListingPattern GUARDED_BY(gListingMutex) = nullptr;
std::string gListingDir GUARDED_BY(gListingMutex);
std::unordered_map<std::string, int64_t> gListingTimes GUARDED_BY(gListingMutex);

// Runs inside scandir, under gListingMutex. Entries that vanish before they are looked at are
// left out.
int FilterFileByPattern(const struct dirent* entry) REQUIRES(gListingMutex) {
    if (strcmp(entry->d_name, ".") == 0 || strcmp(entry->d_name, "..") == 0 ||
        !gListingPattern->Matches(entry->d_name)) {
        return 0;
    }
    struct stat st;
    if (stat((gListingDir + entry->d_name).c_str(), &st) != 0) {
        return 0;
    }
    gListingTimes[entry->d_name] = static_cast<int64_t>(st.st_mtim.tv_sec) * 1000000000 + st.st_mtim.tv_nsec;
    return 1;
}

// Oldest modification first; equal times by name, so that a listing is the same every time.
int SortFileByMkTime(const struct dirent** a, const struct dirent** b) REQUIRES(gListingMutex) {
    int64_t timeA = gListingTimes[(*a)->d_name];
    int64_t timeB = gListingTimes[(*b)->d_name];
    if (timeA != timeB) {
        return timeA < timeB ? -1 : 1;
    }
    return strcmp((*a)->d_name, (*b)->d_name);
}

// Commands take turns in the whole process (see the class comment).
Mutex gCommandMutex;

}  // namespace

// The plugin's statistics, kept once so that every count is one atomic add.
struct EventLogProcessor::Counters {
    explicit Counters(DaemonStats& stats)
        : packMade(stats.Get("logproc.pack.made")),
          packFailed(stats.Get("logproc.pack.failed")),
          queueOverflow(stats.Get("logproc.queue.overflow")),
          spaceCut(stats.Get("logproc.space.cut")),
          spaceLeftOut(stats.Get("logproc.space.left_out")),
          sourceMissing(stats.Get("logproc.source.missing")),
          folderTrimmed(stats.Get("logproc.folder.trimmed")),
          handoverPacks(stats.Get("logproc.handover.packs")),
          handoverEventInfo(stats.Get("logproc.handover.eventinfo")) {}

    DaemonStats::Counter& packMade;
    DaemonStats::Counter& packFailed;
    DaemonStats::Counter& queueOverflow;
    DaemonStats::Counter& spaceCut;
    DaemonStats::Counter& spaceLeftOut;
    DaemonStats::Counter& sourceMissing;
    DaemonStats::Counter& folderTrimmed;
    DaemonStats::Counter& handoverPacks;
    DaemonStats::Counter& handoverEventInfo;
};

EventLogProcessor::EventLogProcessor() : EventListener("EventLogProcessor") {}

EventLogProcessor::~EventLogProcessor() {
    // Running collections use this object: they finish before it goes.
    if (pool_ != nullptr) {
        pool_->Stop();
    }
}

void EventLogProcessor::OnLoad() {
    SetName("EventLogProcessor");
    SetVersion("EventLogProcessor-1.0");
    context_ = GetPluginContext();
    if (context_ == nullptr) {
        OLOGE("%s no plugin context: no log is collected");
        return;
    }
    workDir_ = context_->GetWorkDir();
    osVersion_ = DevInfo::GetQuorVersion();
    counters_ = std::make_unique<Counters>(context_->GetStats());
    pathCheck_ = std::make_unique<PrivacyPathCheck>(*context_);
    AddListenerInfo(kEventTypeControl, kConfigUpdateId, kConfigUpdateId);
    context_->RegisterUnorderedEventListener(this);
    pool_ = new EventThreadPool(kWorkerCount, "proc_logger");
    pool_->Start();
    InitRecordLogCnt();
}

void EventLogProcessor::OnUnload() {}

EVENT_RET EventLogProcessor::OnEvent(sp<Event>& event) {
    if (event == nullptr) {
        return -1;
    }
    uint32_t type = event->eventType;
    uint32_t id = event->eventId;
    OLOGD("%s EventLogProcessor event=%u,%d", id, static_cast<int>(type));
    if (type == kEventTypeRaw) {
        return 0;
    }
    if (type == kEventTypeControl) {
        if (id == kUploadSwitchId || id == kConfigUpdateId) {
            ProcessCfgOrUeUpdate(event);
        } else if (id == kPackLogId) {
            int result = -1;
            if (CanUpload()) {
                OLOGD("%s start log pack");
                result = CheckAndProcessUploadEvent();
            }
            OLOGD("%s log pack %d", result);
            event->SetValue(kKeyServiceUploadRet, result);
        }
        return 0;
    }
    if (!IsFaultEventId(id)) {
        return -1;
    }
    if (type != kEventTypeFault || context_ == nullptr) {
        return 0;
    }
    loopThread_.Check("OnEvent");
    if (!CheckIfNeedProcessLog(event)) {
        return 0;
    }
    CheckAndClearLogFolder(event);
    QueueCollection(event);
    return 0;
}

void EventLogProcessor::QueueCollection(const sp<Event>& event) {
    if (waiting_.load() >= kMaxWaitingCollections) {
        event->SetValue(kKeyZipLogName, kQueueFullReason);
        event->SetValue(kKeyLogZipName, "");
        counters_->queueOverflow.fetch_add(1, std::memory_order_relaxed);
        OLOGW_LIMITED("%s event %u: %zu collections wait for a worker, no pack", event->eventId,
                      kMaxWaitingCollections);
        return;
    }
    waiting_++;
    sp<Event> snapshot = Snapshot(event);
    bool queued = pool_->AddTask(
            [this, snapshot]() {
                waiting_--;
                LowerWorkerPriority();
                ProcessEventLog(snapshot);
            },
            "log_processor", 0, kCollectionPriority);
    if (!queued) {
        waiting_--;
    }
}

void EventLogProcessor::OnUnorderedEvent(sp<Event> event) {
    if (event != nullptr && event->eventType == kEventTypeControl && event->eventId == kConfigUpdateId) {
        ProcessCfgOrUeUpdate(event);
    }
}

bool EventLogProcessor::CheckIfNeedProcessLog(sp<Event> event) {
    std::string noCatchLog = event->GetValue(kKeyNoCatchLog);
    if (!noCatchLog.empty()) {
        if (noCatchLog != kNoLogConfig) {
            event->SetValue(kKeyZipLogName, noCatchLog);
            OLOGI_LIMITED("%s event %u: no logs caught, %s", event->eventId, noCatchLog.c_str());
        }
        return false;
    }
    if (!event->GetValue(kKeyDropReason).empty()) {
        return false;
    }
    std::string dir = GetEventDirPath(event);
    std::string name = GetLogPackName(event);
    if (dir.find(kUeOff) == std::string::npos) {
        event->SetValue(kKeyZipLogName, dir + "/" + kUploading + "/" + name);
    }
    event->SetValue(kKeyLogZipName, name);
    return true;
}

std::string EventLogProcessor::GetDomainDir(uint32_t eventId) {
    return workDir_ + Domain(eventId);
}

std::string EventLogProcessor::GetEventDirPath(sp<Event> event) {
    std::string dir = GetDomainDir(event->eventId);
    if (DevInfo::GetUploadSwitch() != "on") {
        dir += std::string("/") + kUeOff;
    }
    if (!FileUtil::IsDirectory(dir)) {
        FileUtil::CreateDirectory(dir, kFolderMode);
    }
    return dir;
}

std::string EventLogProcessor::GetLogPackName(sp<Event> event) {
    uint32_t id = event->eventId;
    std::string prefix = "EventId_" + NameField(context_->GetSysProperity("ro.build.fingerprint", "unknown")) + "_" +
                         NameField(DevInfo::GetSerinalNo()) + "_";
    char idText[16];
    snprintf(idText, sizeof(idText), "_%09u.zip", id);
    uint64_t now = TimeUtil::GetTimestampSecond();
    if (lastPackSecond_.size() > kPackSecondsKept) {
        for (auto it = lastPackSecond_.begin(); it != lastPackSecond_.end();) {
            it = it->second < now ? lastPackSecond_.erase(it) : std::next(it);
        }
    }
    // A second already used for this id, here or by a pack on disk (a restart within the
    // second), gives way to the next one.
    uint64_t& last = lastPackSecond_[id];
    uint64_t second = std::max(now, last + 1);
    std::string domainDir = GetDomainDir(id);
    std::string name;
    while (true) {
        name = prefix + TimeUtil::GetTimeDateStr(static_cast<int64_t>(second), "%Y%m%d%H%M%S") + idText;
        if (!FileUtil::FileExists(domainDir + "/" + name) &&
            !FileUtil::FileExists(domainDir + "/" + kUeOff + "/" + name) &&
            !FileUtil::FileExists(domainDir + "/" + kUploading + "/" + name)) {
            break;
        }
        ++second;
    }
    last = second;
    return name;
}

void EventLogProcessor::CheckAndClearLogFolder(sp<Event> event) {
    uint32_t id = event->eventId;
    std::string domain = Domain(id);
    std::string dir = workDir_ + domain;
    EventQuotaXmlParser::DomainQuota limitInfo;
    sp<EventQuotaXmlParser> quota = EventQuotaXmlParser::getInstance();
    if (!quota->CheckLogCntLimitAfterIncr(*context_, osVersion_, id, 0, &limitInfo)) {
        return;
    }
    std::vector<std::string> packs;
    GetLogFiles(dir, domain, packs);
    int32_t keep = static_cast<int32_t>(limitInfo.maxLogCnt / 2);
    int32_t considered = 0;
    int32_t deleted = 0;
    for (const std::string& pack : packs) {
        if (limitInfo.eventMin != 0) {
            uint32_t packId = PackId(pack);
            if (packId == 0 || packId < limitInfo.eventMin || packId > limitInfo.eventMax) {
                continue;
            }
        }
        if (++considered <= keep) {
            continue;
        }
        FileUtil::DeleteFile(pack);
        deleted++;
    }
    if (deleted > 0) {
        counters_->folderTrimmed.fetch_add(static_cast<uint64_t>(deleted), std::memory_order_relaxed);
        OLOGI("%s domain %s full, %d packs deleted, %d kept", domain.c_str(), deleted, keep);
        quota->CheckLogCntLimitAfterIncr(*context_, osVersion_, id, -deleted);
    }
}

void EventLogProcessor::InitRecordLogCnt() {
    sp<EventQuotaXmlParser> quota = EventQuotaXmlParser::getInstance();
    size_t restored = 0;
    for (const std::string& dir : ListDomainFolders("[89]\\d{2}")) {
        std::vector<std::string> packs;
        GetLogFiles(dir, BaseName(dir), packs);
        for (const std::string& pack : packs) {
            uint32_t id = PackId(pack);
            if (id != 0) {
                quota->CheckLogCntLimitAfterIncr(*context_, osVersion_, id, 1);
                restored++;
            }
        }
        // What a crash left behind: packs not finished, command outputs not removed.
        std::string stale = std::string("\\") + kTempPrefix + ".*";
        for (const std::string& folder : {dir, dir + "/" + kUeOff}) {
            for (const std::string& file : GetFileInDirByPattern(folder, stale, -1)) {
                FileUtil::DeleteFile(file);
            }
        }
    }
    OLOGI("%s %zu packs on disk counted", restored);
}

void EventLogProcessor::ProcessEventLog(sp<Event> event) {
    uint32_t id = event->eventId;
    OLOGD("%s ProcessEventLog ProcessEventLog eventid %d", static_cast<int>(id));
    std::vector<LogCollectInfo> rules = EventUploadXmlParser::getInstance()->GetEventLogCollectInfo(*context_, id);
    if (rules.empty()) {
        OLOGI("%s find xml log is null");
        return;
    }
    std::vector<std::string> tempFiles;
    std::vector<LogSource> sources = GetSrcLogFileList(event, rules, tempFiles);
    if (sources.empty()) {
        DeleteTempFileInEventDir(tempFiles);
        return;
    }
    bool ok = PackLogToZip(event, sources);
    for (const LogSource& source : sources) {
        if (!source.leftOut && source.rule != nullptr && source.rule->IsDeleteLog()) {
            source.rule->collected.push_back({source.path, source.device, source.inode});
        }
    }
    for (const LogCollectInfo& rule : rules) {
        if (rule.IsDeleteLog()) {
            rule.DeleteLogFile();
        }
    }
    DeleteTempFileInEventDir(tempFiles);
    if (ok) {
        EventQuotaXmlParser::getInstance()->CheckLogCntLimitAfterIncr(*context_, osVersion_, id, 1);
    }
    OLOGD("%s ProcessEventLog ProcessEventLog eventid over %d", static_cast<int>(id));
}

std::vector<EventLogProcessor::LogSource> EventLogProcessor::GetSrcLogFileList(sp<Event> event,
                                                                               std::vector<LogCollectInfo>& rules,
                                                                               std::vector<std::string>& tempFiles) {
    std::vector<LogSource> sources;
    std::string eventDir = GetEventDirPath(event);
    for (LogCollectInfo& rule : rules) {
        switch (rule.kind) {
            case LogCollectInfo::Kind::kStatic:
                AddStaticLog(rule, sources);
                break;
            case LogCollectInfo::Kind::kDynamic:
                AddDynamicLog(rule, sources);
                break;
            case LogCollectInfo::Kind::kCommand:
                AddCmdLog(eventDir, rule, sources, tempFiles);
                break;
        }
    }
    // A file reached by two rules (a link, "..", overlapping folders) is packed once.
    std::set<std::pair<dev_t, ino_t>> seen;
    sources.erase(std::remove_if(sources.begin(), sources.end(),
                                 [&seen](const LogSource& source) {
                                     return !seen.insert({source.device, source.inode}).second;
                                 }),
                  sources.end());
    return sources;
}

void EventLogProcessor::AddStaticLog(LogCollectInfo& rule, std::vector<LogSource>& sources) {
    struct stat st;
    if (stat(rule.path.c_str(), &st) != 0 || !S_ISREG(st.st_mode)) {
        counters_->sourceMissing.fetch_add(1, std::memory_order_relaxed);
        OLOGI_LIMITED("%s %s is missing or not a file, left out", rule.path.c_str());
        return;
    }
    if (pathCheck_->IsPrivacycompliance(rule.path)) {
        sources.push_back({rule.path, "", &rule, st.st_dev, st.st_ino});
    }
}

void EventLogProcessor::AddDynamicLog(LogCollectInfo& rule, std::vector<LogSource>& sources) {
    std::vector<std::string> files = GetFileInDirByPattern(rule.path, *rule.pattern, -1);
    uint64_t now = TimeUtil::GetTimestampSecond();
    uint32_t taken = 0;
    for (auto it = files.rbegin(); it != files.rend() && taken < rule.count; ++it) {
        struct stat st;
        if (stat(it->c_str(), &st) != 0 || !S_ISREG(st.st_mode)) {
            continue;  // vanished since the listing, or a folder
        }
        if (rule.maxAgeSec != 0 && now > static_cast<uint64_t>(st.st_mtime) &&
            now - static_cast<uint64_t>(st.st_mtime) > rule.maxAgeSec) {
            break;  // the rest are older still
        }
        if (pathCheck_->IsPrivacycompliance(*it)) {
            sources.push_back({*it, "", &rule, st.st_dev, st.st_ino});
            taken++;
        }
    }
}

void EventLogProcessor::AddCmdLog(const std::string& eventDir, LogCollectInfo& rule, std::vector<LogSource>& sources,
                                  std::vector<std::string>& tempFiles) {
    std::string path = eventDir + "/" + kTempPrefix + rule.fileName + ".XXXXXX";
    android::base::unique_fd fd(mkostemp(path.data(), O_CLOEXEC));
    if (fd < 0) {
        OLOGE("%s cannot create the output of '%s' in %s: %s", rule.command.c_str(), eventDir.c_str(), strerror(errno));
        return;
    }
    tempFiles.push_back(path);
    // Judged before the command runs: an output the policy would refuse is not worth running for.
    if (!pathCheck_->IsPrivacycompliance(path)) {
        return;
    }
    {
        Mutex::Autolock lock(gCommandMutex);
        CmdProcessor::WriteCommandResultToFileWithTimeout(fd.get(), rule.command, static_cast<int>(rule.timeoutSec));
    }
    struct stat st;
    if (fstat(fd.get(), &st) == 0) {
        sources.push_back({path, rule.fileName, &rule, st.st_dev, st.st_ino});
    }
}

void EventLogProcessor::DeleteTempFileInEventDir(const std::vector<std::string>& tempFiles) {
    for (const std::string& path : tempFiles) {
        FileUtil::DeleteFile(path);
    }
}

bool EventLogProcessor::PackLogToZip(sp<Event> event, std::vector<LogSource>& files) {
    uint32_t id = event->eventId;
    std::string dir = GetEventDirPath(event);
    std::string name = event->GetValue(kKeyLogZipName);
    std::string temporary = dir + "/" + kTempPrefix + name + ".part";
    ZipPack pack;
    if (name.empty() || !pack.CreateZip(temporary)) {
        OLOGI("%s create zip failed %u", id);
        counters_->packFailed.fetch_add(1, std::memory_order_relaxed);
        return false;
    }
    uint32_t spaceKiB = EventQuotaXmlParser::getInstance()->GetEventQuota(*context_, osVersion_, id).logSpace;
    uint64_t budget = static_cast<uint64_t>(spaceKiB) * 1024;
    uint64_t entries = 0;
    for (LogSource& source : files) {
        source.leftOut = true;
        if (!FileUtil::FileExists(source.path)) {
            counters_->sourceMissing.fetch_add(1, std::memory_order_relaxed);
            OLOGI_LIMITED("%s event %u: a source vanished before it was packed", id);
            continue;
        }
        android::base::unique_fd fd = pathCheck_->OpenCompliantFile(source.path);
        struct stat st;
        if (fd < 0 || fstat(fd.get(), &st) != 0) {
            continue;
        }
        // A source that never ends (a kernel message stream) gives what is there, then EAGAIN.
        fcntl(fd.get(), F_SETFL, fcntl(fd.get(), F_GETFL) | O_NONBLOCK);
        std::string entry = source.entryName.empty() ? EntryNameOf(fd.get(), source.path) : source.entryName;
        uint64_t size = static_cast<uint64_t>(st.st_size);
        if (budget == 0) {
            counters_->spaceLeftOut.fetch_add(1, std::memory_order_relaxed);
            OLOGW_LIMITED("%s event %u: %s left out, the pack's %u KiB are used up", id, entry.c_str(), spaceKiB);
            continue;
        }
        // Files of /proc and /sys report no size: they are read up to what is left.
        uint64_t grant = size == 0 ? budget : std::min(size, budget);
        if (size > budget) {
            lseek(fd.get(), static_cast<off_t>(size - budget), SEEK_SET);
            counters_->spaceCut.fetch_add(1, std::memory_order_relaxed);
            OLOGW_LIMITED("%s event %u: %s cut to its newest %" PRIu64 " of %" PRIu64 " bytes", id, entry.c_str(),
                          grant, size);
        }
        off_t before = lseek(fd.get(), 0, SEEK_CUR);
        pack.AddFileFromFd(fd.get(), entry, grant);
        off_t after = lseek(fd.get(), 0, SEEK_CUR);
        // What was read counts, not what was granted: an empty file costs nothing.
        budget -= std::min<uint64_t>(budget,
                                     before >= 0 && after >= before ? static_cast<uint64_t>(after - before) : grant);
        source.leftOut = false;
        entries++;
    }
    pack.Close();
    std::string placed = dir + "/" + name;
    if (!IsCompleteZip(temporary, entries) || !SyncFile(temporary) || !FileUtil::MoveFile(temporary, placed)) {
        OLOGE("%s pack of event %u could not be written completely, nothing is kept", id);
        unlink(temporary.c_str());
        counters_->packFailed.fetch_add(1, std::memory_order_relaxed);
        return false;
    }
    // "zipLogName" already names this pack (CheckIfNeedProcessLog, on the loop): the event is no
    // longer written here, as the pipeline's listeners read it while the worker packs.
    FileUtil::ChangeMode(placed, kPackMode);
    counters_->packMade.fetch_add(1, std::memory_order_relaxed);
    OLOGI("%s event %u: %s with %" PRIu64 " files", id, placed.c_str(), entries);
    return true;
}

bool EventLogProcessor::CanUpload() {
    std::string uploadSwitch = DevInfo::GetUploadSwitch();
    if (uploadSwitch != "on") {
        OLOGI("%s dev swtich %s", uploadSwitch.c_str());
        return false;
    }
    if (context_->GetSysProperity("ro.boot.factorybuild", "unknown") == "1") {
        OLOGI("%s factory mode, no upload");
        return false;
    }
    std::string region = context_->GetSysProperity("ro.quor.build.region", "");
    if (region != "CN" && region != "cn") {
        OLOGI("%s region not support upload");
        return false;
    }
    return IsNotExpired();
}

bool EventLogProcessor::IsNotExpired() {
    EventQuotaXmlParser::SummaryQuota summary =
            EventQuotaXmlParser::getInstance()->GetSummaryQuota(*context_, osVersion_);
    uint64_t activated = DevInfo::GetActivateTime();
    uint64_t now = TimeUtil::GetTimestampSecond();
    auto months = [](uint32_t count) { return static_cast<uint64_t>(count) * kMonthSeconds; };
    bool admitted;
    if (now <= activated + months(summary.level1Month)) {
        return true;
    } else if (now < activated + months(summary.level2Month)) {
        admitted = CanUploadRatio(summary.level1Max);
    } else if (now < activated + months(summary.level3Month)) {
        admitted = CanUploadRatio(summary.level2Max);
    } else if (now >= activated + static_cast<uint64_t>(summary.uploadExpireYear) * kYearSeconds) {
        OLOGW("%s upload expired, close upload active=%ld", static_cast<long>(activated));
        admitted = false;
    } else {
        admitted = CanUploadRatio(summary.level3Max);
    }
    if (!admitted) {
        DevInfo::SetUploadSwitch(2);
    }
    return admitted;
}

bool EventLogProcessor::CanUploadRatio(uint32_t level) {
    std::string serial = context_->GetSysProperity("ro.ril.oem.sno", "unknown");
    if (serial == "unknown") {
        serial = context_->GetSysProperity("ro.ril.oem.psno", "unknown");
    }
    if (serial == "unknown" || serial.empty()) {
        OLOGW("%s unknown curent state, close upload");
        return false;
    }
    int digit = (serial.back() - '0') % 10;
    // Only a digit selects a tenth of the devices; any other last character never passes.
    if (isdigit(static_cast<unsigned char>(serial.back())) && static_cast<uint32_t>(digit) < level) {
        return true;
    }
    OLOGW("%s last number larger raito %u, level=%u, close upload", static_cast<uint32_t>(digit), level);
    return false;
}

void EventLogProcessor::ProcessCfgOrUeUpdate(sp<Event> event) {
    int flag = event->GetIntValue(kKeyUeUpdate);
    if (event->eventId == kConfigUpdateId && DevInfo::GetUploadSwitch() == "off") {
        DevInfo::SetUploadSwitch(0);
        return;
    }
    if (event->eventId == kUploadSwitchId && flag == 0) {
        DevInfo::SetUploadSwitch(0);
        return;
    }
    DevInfo::SetUploadSwitch(IsNotExpired() ? 1 : 2);
}

int EventLogProcessor::CheckAndProcessUploadEvent() {
    sp<EventLoop> loop = GetLooper();
    if (loop == nullptr) {
        return ProcessUploadingLog() + ProcessUploadingEvent();
    }
    size_t pending = ListEventInfoFiles().size();
    for (const std::string& dir : ListDomainFolders("9\\d{2}")) {
        pending += GetFileInDirByPattern(dir, DomainPackPattern(BaseName(dir)), -1).size();
    }
    wp<EventLogProcessor> weak = this;
    loop->AddTask([weak]() {
        sp<EventLogProcessor> self = weak.promote();
        if (self != nullptr) {
            self->ProcessUploadEvent();
        }
    });
    return static_cast<int>(pending);
}

void EventLogProcessor::ProcessUploadEvent() {
    OLOGI("%s start process upload event");
    ProcessUploadingLog();
    ProcessUploadingEvent();
    OLOGI("%s end process upload event");
}

int EventLogProcessor::ProcessUploadingLog() {
    int moved = 0;
    sp<EventQuotaXmlParser> quota = EventQuotaXmlParser::getInstance();
    for (const std::string& dir : ListDomainFolders("9\\d{2}")) {
        std::string domain = BaseName(dir);
        std::vector<std::string> packs = GetFileInDirByPattern(dir, DomainPackPattern(domain), -1);
        if (packs.empty()) {
            OLOGD("%s event %s no zip", domain.c_str());
            continue;
        }
        std::string uploading = dir + "/" + kUploading;
        FileUtil::CreateDirectory(uploading, kFolderMode);
        for (const std::string& pack : packs) {
            quota->CheckLogCntLimitAfterIncr(*context_, osVersion_, PackId(pack), -1);
            std::string target = uploading + "/" + BaseName(pack);
            if (FileUtil::MoveFile(pack, target)) {
                FileUtil::ChangeMode(target, kPackMode);
                moved++;
            }
        }
    }
    counters_->handoverPacks.fetch_add(static_cast<uint64_t>(moved), std::memory_order_relaxed);
    return moved;
}

int EventLogProcessor::ProcessUploadingEvent() {
    std::vector<std::string> files = ListEventInfoFiles();
    if (files.empty()) {
        return 0;
    }
    std::string uploading = workDir_ + kUploading;
    if (!FileUtil::CreateDirectory(uploading, kFolderMode)) {
        OLOGI("%s failed create uploading folder");
        return 0;
    }
    int moved = 0;
    for (const std::string& file : files) {
        // A file the app has not taken yet is not replaced: the newcomer gets ".0" appended, which
        // keeps the name within the event-information pattern.
        std::string target = uploading + "/" + BaseName(file);
        while (FileUtil::FileExists(target)) {
            target += ".0";
        }
        if (FileUtil::MoveFile(file, target)) {
            FileUtil::ChangeMode(target, kPackMode);
            moved++;
        }
    }
    counters_->handoverEventInfo.fetch_add(static_cast<uint64_t>(moved), std::memory_order_relaxed);
    return moved;
}

std::vector<std::string> EventLogProcessor::ListDomainFolders(const std::string& pattern) {
    std::vector<std::string> folders = GetFileInDirByPattern(workDir_, pattern, -1);
    folders.erase(std::remove_if(folders.begin(), folders.end(),
                                 [](const std::string& path) { return !FileUtil::IsDirectory(path); }),
                  folders.end());
    return folders;
}

std::vector<std::string> EventLogProcessor::ListEventInfoFiles() {
    return GetFileInDirByPattern(workDir_, EventInfoPack::kFilePattern, -1);
}

std::vector<std::string> EventLogProcessor::GetFileInDirByPattern(const std::string& dir, const std::string& pattern,
                                                                  int32_t limit) {
    std::string error;
    std::unique_ptr<FilePattern> compiled = FilePattern::Compile(pattern, &error);
    if (compiled == nullptr) {
        OLOGE("%s pattern %s refused: %s", pattern.c_str(), error.c_str());
        return {};
    }
    return GetFileInDirByPattern(dir, *compiled, limit);
}

std::vector<std::string> EventLogProcessor::GetFileInDirByPattern(const std::string& dir, const FilePattern& pattern,
                                                                  int32_t limit) {
    std::string folder = dir.empty() || dir.back() == '/' ? dir : dir + "/";
    std::vector<std::string> paths;
    Mutex::Autolock lock(gListingMutex);
    gListingPattern = &pattern;
    gListingDir = folder;
    gListingTimes.clear();
    struct dirent** entries = nullptr;
    int count = scandir(folder.c_str(), &entries, FilterFileByPattern, SortFileByMkTime);
    gListingPattern = nullptr;
    gListingTimes.clear();
    if (count < 0) {
        return paths;
    }
    int first = limit >= 0 && count > limit ? count - limit : 0;
    for (int i = 0; i < count; ++i) {
        if (i >= first) {
            paths.push_back(folder + entries[i]->d_name);
        }
        free(entries[i]);
    }
    free(entries);
    return paths;
}

void EventLogProcessor::GetLogFiles(const std::string& dir, const std::string& domain, std::vector<std::string>& out) {
    std::string pattern = DomainPackPattern(domain);
    for (const std::string& folder : {dir, dir + "/" + kUeOff}) {
        std::vector<std::string> packs = GetFileInDirByPattern(folder, pattern, -1);
        out.insert(out.end(), packs.begin(), packs.end());
    }
}

void EventLogProcessor::Dump(int fd, const std::vector<std::string>& args) {
    (void)args;
    if (context_ == nullptr) {
        dprintf(fd, "not loaded\n");
        return;
    }
    std::shared_ptr<const UploadRules> rules = EventUploadXmlParser::getInstance()->GetRules(
            context_->GetCloudConfigDir(), context_->GetConfigDir(), &context_->GetStats());
    dprintf(fd, "upload switch: %s\n", DevInfo::GetUploadSwitch().c_str());
    dprintf(fd, "log rules: %s, %zu rule sets, %zu elements left out\n",
            rules->source.empty() ? "none" : rules->source.c_str(), rules->ruleSets.size(), rules->rejected);
    dprintf(fd, "collections waiting for a worker: %zu of at most %zu\n", waiting_.load(), kMaxWaitingCollections);
    DaemonStats& stats = context_->GetStats();
    for (const char* name : {"logproc.pack.made", "logproc.pack.failed", "logproc.queue.overflow", "logproc.space.cut",
                             "logproc.space.left_out", "logproc.source.missing", "logproc.folder.trimmed",
                             "logproc.handover.packs", "logproc.handover.eventinfo", "privacy.path.refused"}) {
        dprintf(fd, "%s %" PRIu64 "\n", name, stats.Value(name));
    }
}

}  // namespace Orvane
}  // namespace android
