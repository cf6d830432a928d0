#include "service/orvane_service.h"

#include <fcntl.h>
#include <sys/mman.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstdio>
#include <cstring>
#include <new>

#include <android-base/unique_fd.h>

#include "config/config_document.h"
#include "service/binder_transport.h"
#include "service/caller_writer.h"
#include "service/orvane_native_service.h"
#include "utils/dev_info.h"
#include "utils/orvane_log.h"
#include "utils/time_util.h"

namespace android {
namespace Orvane {
namespace {

using android::base::unique_fd;

constexpr size_t kBinderThreads = 4;
// The dump text goes to the caller in pieces of this size.
constexpr size_t kDumpChunkBytes = 64 * 1024;
constexpr uint32_t kPackLogEventId = 101;
constexpr uint32_t kUploadSwitchEventId = 103;
constexpr uint32_t kConfigUpdateEventId = 104;
constexpr uint32_t kUserActivatedEventId = 105;
const char* const kLogProcessor = "EventLogProcessor";
const char* const kStorageManager = "EventStorageManager";

}  // namespace

OrvaneService::OrvaneService(PluginPlatform* platform) : platform_(platform) {}

bool OrvaneService::StartService() {
    BinderTransport::StartThreadPool(kBinderThreads, platform_->GetStats());
    bool checkCaller = platform_->GetSysProperity("persist.sys.orvane.safecheck", "1") != "0";
    sp<OrvaneNativeService> service = new OrvaneNativeService(this, checkCaller);
    if (!BinderTransport::AddService("orvane", service, platform_->GetWorkDir())) {
        return false;
    }
    BinderTransport::JoinThreadPool();
    return true;
}

sp<Event> OrvaneService::CreateEvent(const char* op, uint32_t eventId) {
    sp<Event> event = new (std::nothrow) Event("OrvaneService");
    if (event == nullptr) {
        OLOG_AS(ANDROID_LOG_INFO, op, "%s event is null");
        return nullptr;
    }
    event->eventId = eventId;
    event->eventType = kEventTypeControl;
    return event;
}

int OrvaneService::NotifyPackLog() {
    sp<Event> event = CreateEvent(__func__, kPackLogEventId);
    if (event == nullptr) {
        return -1;
    }
    if (!platform_->PostSyncEventToTarget(kLogProcessor, event)) {
        return 0;
    }
    return event->GetIntValue(kKeyServiceUploadRet);
}

void OrvaneService::SetRunMode(const std::string& name, const std::string& file) {
    DevInfo::SetRunMode(name, file);
}

void OrvaneService::NotifyUploadSwitch(bool on) {
    sp<Event> event = CreateEvent(__func__, kUploadSwitchEventId);
    if (event == nullptr) {
        return;
    }
    event->SetValue(kKeyUeUpdate, on ? 1 : 0);
    platform_->PostAsyncEventToTarget(kLogProcessor, event);
}

void OrvaneService::NotifyConfigUpdate(const std::string& folder) {
    platform_->SetCloudConfigFolder(folder);
    ConfigDocument::Forget();
    sp<Event> event = CreateEvent(__func__, kConfigUpdateEventId);
    if (event == nullptr) {
        return;
    }
    platform_->PostUnorderedEvent(event);
}

void OrvaneService::NotifyUserActivated() {
    sp<Event> event = CreateEvent(__func__, kUserActivatedEventId);
    if (event == nullptr) {
        return;
    }
    // Storage takes the activation time from the happen time.
    event->happenTime = TimeUtil::GetTimestampSecond();
    platform_->PostAsyncEventToTarget(kStorageManager, event);
}

void OrvaneService::Dump(int fd, const std::vector<std::string>& args) {
    DaemonStats& stats = platform_->GetStats();
    // Sized to the cap, then sealed against growing: a write past the cap fails instead of
    // taking more memory, and the file offset tells how much was written.
    unique_fd text(memfd_create("orvane_dump", MFD_CLOEXEC | MFD_ALLOW_SEALING));
    if (!text.ok() || ftruncate(text.get(), kMaxDumpBytes) != 0 ||
        fcntl(text.get(), F_ADD_SEALS, F_SEAL_GROW | F_SEAL_SHRINK) != 0) {
        OLOGE_LIMITED("%s no memory file for the dump: %s", strerror(errno));
        stats.Add("service.dump.write_failures");
        return;
    }
    WriteDump(text.get(), args);
    const off_t length = lseek(text.get(), 0, SEEK_CUR);
    const auto deadline = std::chrono::steady_clock::now() + kDumpDeliveryBound;
    bool delivered = true;
    std::vector<char> chunk(std::min<size_t>(length, kDumpChunkBytes));
    for (off_t done = 0; delivered && done < length;) {
        ssize_t n = pread(text.get(), chunk.data(), std::min<off_t>(chunk.size(), length - done), done);
        delivered = n > 0 && CallerWriter::Write(fd, chunk.data(), n, deadline);
        done += n;
    }
    if (static_cast<size_t>(length) >= kMaxDumpBytes) {
        stats.Add("service.dump.cut");
        std::string note = "\n[dump cut at " + std::to_string(kMaxDumpBytes) + " bytes]\n";
        delivered = delivered && CallerWriter::Write(fd, note.data(), note.size(), deadline);
    }
    if (!delivered) {
        stats.Add("service.dump.write_failures");
        OLOGW_LIMITED("%s the caller did not take all of the dump's %lld bytes", static_cast<long long>(length));
    }
}

void OrvaneService::WriteDump(int fd, const std::vector<std::string>& args) {
    if (args.empty()) {
        DumpPluginSummaryInfo(fd);
    } else if (args.size() >= 2 && args[0] == "plugin") {
        DumpPluginInfo(fd, args[1], std::vector<std::string>(args.begin() + 2, args.end()));
    } else if (args[0] == "stats") {
        std::string text = platform_->GetStats().Format();
        dprintf(fd, "%s", text.c_str());
    } else {
        dprintf(fd, "usage: dump [stats | plugin NAME [ARGS...]]\n");
    }
}

void OrvaneService::DumpPluginSummaryInfo(int fd) {
    std::map<std::string, sp<Plugin>> plugins = platform_->GetPlugins();
    dprintf(fd, "Load plugin %u:\n", static_cast<unsigned>(plugins.size()));
    for (const auto& entry : plugins) {
        const sp<Plugin>& plugin = entry.second;
        if (plugin == nullptr) {
            dprintf(fd, "PluginName:%s not Loaded\n", entry.first.c_str());
            continue;
        }
        sp<EventLoop> loop = plugin->GetLooper();
        dprintf(fd, "PluginName:%s Version:%s Thread:%s\n", entry.first.c_str(), plugin->GetVersion().c_str(),
                loop == nullptr ? "Null" : loop->GetName().c_str());
    }
    std::map<std::string, sp<Pipeline>> pipelines = platform_->GetPipelines();
    dprintf(fd, "Load pipeline %u:\n", static_cast<unsigned>(pipelines.size()));
    for (const auto& entry : pipelines) {
        dprintf(fd, "pipelineName:%s\n", entry.first.c_str());
    }
}

void OrvaneService::DumpPluginInfo(int fd, const std::string& name, const std::vector<std::string>& args) {
    std::map<std::string, sp<Plugin>> plugins = platform_->GetPlugins();
    auto it = plugins.find(name);
    if (it == plugins.end() || it->second == nullptr) {
        dprintf(fd, "plugin %s not exist", name.c_str());
        return;
    }
    it->second->Dump(fd, args);
}

}  // namespace Orvane
}  // namespace android
