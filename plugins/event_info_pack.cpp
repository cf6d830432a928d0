#include "plugins/event_info_pack.h"

#include <dirent.h>
#include <errno.h>
#include <fcntl.h>
#include <stdio.h>
#include <string.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cinttypes>

#include <android-base/file.h>
#include <android-base/unique_fd.h>
#include <json/json.h>

#include "config/privacy_policy.h"
#include "platform/plugin_context.h"
#include "platform/plugin_factory.h"
#include "utils/dev_info.h"
#include "utils/file_pattern.h"
#include "utils/orvane_log.h"
#include "utils/string_util.h"
#include "utils/time_util.h"

namespace android {
namespace Orvane {

ORVANE_REGISTER_PLUGIN(EventInfoPack);

namespace {

// Set (as an extra value) by the pipeline step, so the listener call knows it is the second one.
constexpr char kKeyMarked[] = "EventInfoPack.marked";
// "zipLogName" of a subscribed event that no one packed logs for and gave no reason.
constexpr char kNoPack[] = "NO_LOG_PACK";
constexpr mode_t kFileMode = 0660;
constexpr uint32_t kDomainDivisor = 1000000;

// The "eventinfo" files of the work folder: name to its domain.
std::map<std::string, uint32_t> ListFiles(const std::string& workDir) {
    static const std::unique_ptr<FilePattern> kNames = FilePattern::Compile(EventInfoPack::kFilePattern, nullptr);
    std::map<std::string, uint32_t> files;
    std::unique_ptr<DIR, int (*)(DIR*)> dir(opendir(workDir.c_str()), closedir);
    if (dir == nullptr) {
        return files;
    }
    while (struct dirent* entry = readdir(dir.get())) {
        if (kNames->Matches(entry->d_name)) {
            files[entry->d_name] =
                    static_cast<uint32_t>(strtoul(entry->d_name + strlen(EventInfoPack::kFilePrefix), nullptr, 10));
        }
    }
    return files;
}

// 0 when the file is missing or not a plain file.
ino_t PlainFileInode(const std::string& path, struct stat& st) {
    return lstat(path.c_str(), &st) == 0 && S_ISREG(st.st_mode) ? st.st_ino : 0;
}

}  // namespace

void EventInfoPack::OnLoad() {
    SetVersion("EventInfoPack-1.0");
    SetName("EventInfoPack");
    context_ = GetPluginContext();
    if (context_ == nullptr) {
        OLOGE("%s no plugin context: no records are written");
        return;
    }
    workDir_ = context_->GetWorkDir();
    DaemonStats& stats = context_->GetStats();
    subscribed_ = &stats.Get("eventinfo.subscribed");
    writeFailed_ = &stats.Get("eventinfo.write_failed");
    serialWithheld_ = &stats.Get("eventinfo.serial_withheld");
    expired_ = &stats.Get("eventinfo.expired_files");
    discarded_ = &stats.Get("eventinfo.discarded_files");
    if (!context_->RegisterPipelineListener(kFaultPipeline, this)) {
        OLOGE("%s no pipeline %s: no records are written", kFaultPipeline);
    }
    {
        Mutex::Autolock lock(mutex_);
        AdoptFiles();
    }
    // The clean-up lists and deletes files: it belongs on the plugin's own loop, not on start-up.
    sp<EventLoop> loop = GetLooper() != nullptr ? GetLooper() : context_->GetSharedWorkLoop();
    wp<EventInfoPack> weak = this;
    auto cleanUp = [weak]() {
        sp<EventInfoPack> self = weak.promote();
        if (self != nullptr) {
            self->CleanUp();
        }
    };
    loop->AddTask(cleanUp);
    loop->AddTask(cleanUp, kCleanUpPeriodSec, true);
}

std::shared_ptr<const UploadRules> EventInfoPack::Rules() {
    return EventUploadXmlParser::getInstance()->GetRules(context_->GetCloudConfigDir(), context_->GetConfigDir(),
                                                         &context_->GetStats());
}

EVENT_RET EventInfoPack::OnEvent(sp<Event>& event) {
    if (event == nullptr || context_ == nullptr) {
        return 0;
    }
    if (event->GetValue(kKeyMarked, true).empty()) {
        MarkSubscribed(*event);
    } else if (event->GetValue(kKeySubscribe) == "1" && event->GetValue(kKeyDropReason).empty()) {
        Record(*event);
    }
    return 0;
}

void EventInfoPack::MarkSubscribed(Event& event) {
    event.SetValue(kKeyMarked, "1", true);
    const UploadRules::Subscription* subscription = Rules()->FindSubscription(event.eventId);
    if (subscription == nullptr) {
        return;
    }
    event.SetValue(kKeySubscribe, "1");
    event.SetValue(kKeyExpire, std::to_string(subscription->expireDays));
    event.SetValue(kKeyVisible, subscription->visible ? "1" : "0");
    subscribed_->fetch_add(1, std::memory_order_relaxed);
}

std::string EventInfoPack::BuildRecord(const Event& event) {
    Json::Value record(Json::objectValue);
    record["eventId"] = event.eventId;
    record["happenTime"] = static_cast<Json::UInt64>(event.happenTime);
    // Privacy compliance left an object (or, under "keep", a text it could not check: kept as text).
    std::string params = event.GetValue(kKeyParamList);
    Json::Value paramList;
    std::string error;
    std::unique_ptr<Json::CharReader> reader(Json::CharReaderBuilder().newCharReader());
    if (params.empty() || !reader->parse(params.data(), params.data() + params.size(), &paramList, &error)) {
        paramList = params;
    }
    record["param_list"] = paramList;
    std::string zip = event.GetValue(kKeyZipLogName);
    if (zip.empty()) {
        zip = event.GetValue(kKeyNoCatchLog);
    }
    record["zipLogName"] = zip.empty() ? kNoPack : zip;
    record["expire"] = StringUtil::ConvertUInt(event.GetValue(kKeyExpire));
    record["visible"] = event.GetValue(kKeyVisible) == "1" ? 1 : 0;
    record["quorVersion"] = DevInfo::GetQuorVersion();
    record["buildType"] = DevInfo::GetBuildType();
    // The serial number leaves the phone only sealed for the upload server, and only with consent,
    // like every identifier.
    std::shared_ptr<const PrivacyPolicy> policy = PrivacyPolicyParser::getInstance()->GetPolicy(*context_);
    std::string sealed;
    if (policy->cipher != nullptr && DevInfo::GetUploadSwitch() == "on") {
        sealed = policy->cipher->Seal(DevInfo::GetSerinalNo());
    }
    if (sealed.empty()) {
        serialWithheld_->fetch_add(1, std::memory_order_relaxed);
    }
    record["serialNo"] = sealed;
    Json::StreamWriterBuilder builder;
    builder["indentation"] = "";
    builder["emitUTF8"] = true;
    return Json::writeString(builder, record) + "\n";
}

void EventInfoPack::Record(const Event& event) {
    std::string line = BuildRecord(event);
    Mutex::Autolock lock(mutex_);
    NoticeHandOver();
    uint32_t domain = event.eventId / kDomainDivisor;
    if (!Append(domain, line)) {
        writeFailed_->fetch_add(1, std::memory_order_relaxed);
        return;
    }
    GetDomain(domain).written->fetch_add(1, std::memory_order_relaxed);
}

bool EventInfoPack::Append(uint32_t domain, const std::string& line) {
    std::string path = workDir_ + kFilePrefix + std::to_string(domain);
    android::base::unique_fd fd(open(path.c_str(), O_WRONLY | O_APPEND | O_CREAT | O_CLOEXEC | O_NOFOLLOW, kFileMode));
    struct stat st;
    if (fd < 0 || fstat(fd.get(), &st) != 0 || !S_ISREG(st.st_mode)) {
        OLOGE_LIMITED("%s cannot open %s: %s", path.c_str(), strerror(errno));
        return false;
    }
    Domain& state = GetDomain(domain);
    auto known = state.files.find(path);
    if (known != state.files.end() && known->second != st.st_ino) {
        state.handedOver->fetch_add(1, std::memory_order_relaxed);  // moved away since the last look
    }
    state.files[path] = st.st_ino;
    // One write per line, then the data to the disk: a kill leaves whole lines only. A write that
    // fails half-way (a full disk) is cut off again so the earlier lines stay as they were.
    if (!android::base::WriteFully(fd, line.data(), line.size()) || fsync(fd.get()) != 0) {
        int error = errno;
        if (ftruncate(fd.get(), st.st_size) != 0 || fsync(fd.get()) != 0) {
            OLOGE_LIMITED("%s %s may end in a cut line: %s", path.c_str(), strerror(errno));
        }
        OLOGE_LIMITED("%s append to %s failed: %s", path.c_str(), strerror(error));
        return false;
    }
    if (st.st_size + static_cast<off_t>(line.size()) >= kRotateSize) {
        Rotate(state, path);
    }
    return true;
}

void EventInfoPack::Rotate(Domain& domain, const std::string& path) {
    std::vector<std::pair<int64_t, std::string>> closed;  // modification time, path
    for (const auto& [file, inode] : domain.files) {
        struct stat st;
        if (file != path && PlainFileInode(file, st) == inode) {
            closed.emplace_back(static_cast<int64_t>(st.st_mtim.tv_sec) * 1000000000 + st.st_mtim.tv_nsec, file);
        }
    }
    std::sort(closed.begin(), closed.end());
    for (size_t i = 0; i + kMaxClosedFiles <= closed.size(); ++i) {
        OLOGW("%s %zu closed files of %s waiting for upload: the oldest, %s, is deleted", closed.size(), path.c_str(),
              closed[i].second.c_str());
        FileUtil::DeleteFile(closed[i].second);
        Forget(closed[i].second);
        discarded_->fetch_add(1, std::memory_order_relaxed);
    }
    std::string target = path + ".0";
    struct stat st;
    while (lstat(target.c_str(), &st) == 0) {
        target += ".0";
    }
    if (rename(path.c_str(), target.c_str()) != 0) {
        OLOGE_LIMITED("%s cannot close %s as %s: %s", path.c_str(), target.c_str(), strerror(errno));
        return;
    }
    domain.files[target] = domain.files[path];
    domain.files.erase(path);
}

EventInfoPack::Domain& EventInfoPack::GetDomain(uint32_t domain) {
    Domain& state = domains_[domain];
    if (state.written == nullptr) {
        std::string prefix = "eventinfo." + std::to_string(domain);
        state.written = &context_->GetStats().Get(prefix + ".written");
        state.handedOver = &context_->GetStats().Get(prefix + ".handed_over");
    }
    return state;
}

void EventInfoPack::AdoptFiles() {
    for (const auto& [name, domain] : ListFiles(workDir_)) {
        std::string path = workDir_ + name;
        android::base::unique_fd fd(open(path.c_str(), O_RDWR | O_CLOEXEC | O_NOFOLLOW));
        struct stat st;
        if (fd < 0 || fstat(fd.get(), &st) != 0 || !S_ISREG(st.st_mode)) {
            continue;
        }
        GetDomain(domain).files[path] = st.st_ino;
        // Appends are synced line by line; a tail without its newline (or of zeros, where the size
        // reached the disk before the data) is a power cut's leftover.
        std::string text;
        if (st.st_size > 0 && base::ReadFdToString(fd.get(), &text) && !text.empty() && text.back() != '\n') {
            size_t end = text.rfind('\n');
            off_t keep = end == std::string::npos ? 0 : static_cast<off_t>(end + 1);
            OLOGW("%s %s ends in an unfinished line, cut to %jd bytes", path.c_str(), static_cast<intmax_t>(keep));
            if (ftruncate(fd.get(), keep) != 0) {
                OLOGE("%s cannot cut %s: %s", path.c_str(), strerror(errno));
            }
        }
    }
}

void EventInfoPack::NoticeHandOver() {
    for (auto& [number, domain] : domains_) {
        for (auto it = domain.files.begin(); it != domain.files.end();) {
            struct stat st;
            if (PlainFileInode(it->first, st) == it->second) {
                ++it;
                continue;
            }
            domain.handedOver->fetch_add(1, std::memory_order_relaxed);
            it = domain.files.erase(it);
        }
    }
}

void EventInfoPack::Forget(const std::string& path) {
    for (auto& [number, domain] : domains_) {
        domain.files.erase(path);
    }
}

uint32_t EventInfoPack::KeepDays(const UploadRules& rules) const {
    uint32_t days = kMinKeepDays;
    for (const UploadRules::Subscription& subscription : rules.subscriptions) {
        days = std::max(days, subscription.expireDays);
    }
    return days;
}

void EventInfoPack::CleanUp() {
    if (context_ == nullptr) {
        return;
    }
    uint32_t days = KeepDays(*Rules());
    int64_t oldest = static_cast<int64_t>(TimeUtil::GetTimestampSecond()) - static_cast<int64_t>(days) * 86400;
    Mutex::Autolock lock(mutex_);
    NoticeHandOver();
    for (const auto& [name, domain] : ListFiles(workDir_)) {
        std::string path = workDir_ + name;
        struct stat st;
        if (PlainFileInode(path, st) == 0 || st.st_mtime >= oldest) {
            continue;
        }
        OLOGI("%s %s not handed over in %u days, deleted", path.c_str(), days);
        FileUtil::DeleteFile(path);
        Forget(path);
        expired_->fetch_add(1, std::memory_order_relaxed);
    }
}

void EventInfoPack::Dump(int fd, const std::vector<std::string>&) {
    if (context_ == nullptr) {
        dprintf(fd, "%s not loaded\n", GetName().c_str());
        return;
    }
    std::shared_ptr<const UploadRules> rules = Rules();
    dprintf(fd, "%s\nsubscriptions of %s: %zu\n", GetVersion().c_str(), rules->source.c_str(),
            rules->subscriptions.size());
    for (const UploadRules::Subscription& s : rules->subscriptions) {
        dprintf(fd, "  %u..%u expire %u days, %s\n", s.eventMin, s.eventMax, s.expireDays,
                s.visible ? "visible" : "not visible");
    }
    dprintf(fd, "files kept up to %u days\n", KeepDays(*rules));
    Mutex::Autolock lock(mutex_);
    NoticeHandOver();
    for (const auto& [number, domain] : domains_) {
        dprintf(fd, "domain %u: records written %" PRIu64 ", files handed over %" PRIu64 ", files waiting %zu\n",
                number, domain.written->load(), domain.handedOver->load(), domain.files.size());
    }
}

}  // namespace Orvane
}  // namespace android
