#include "platform/plugin_platform.h"

#include <fcntl.h>
#include <sys/file.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>

#include "platform/plugin_factory.h"
#include "utils/dev_info.h"
#include "utils/file_util.h"
#include "utils/orvane_log.h"
#include "utils/string_util.h"
#include "utils/sys_env.h"
#include "utils/time_util.h"

namespace android {
namespace Orvane {
namespace {

constexpr const char* kPidFileName = "orvane.pid";
constexpr const char* kDefaultConfigName = "plugin_config";
constexpr const char* kGlobalConfigName = "plugin_config_global";
constexpr const char* kCompatibleMarker = "compatible";
constexpr const char* kRegionProperty = "ro.quor.build.region";
// The region that the configuration folder's named file is written for.
constexpr const char* kSupportedRegion = "CN";
constexpr mode_t kDirMode = 0775;
// The loop of a delayed event source configured without one. A configured loop name never holds
// a ':', so the loop is the source's alone.
constexpr const char* kOwnSourceLoopSuffix = ":source";

std::atomic<PluginPlatform*> g_platform{nullptr};

// A folder with exactly one "/" before and after.
std::string NormalizeDir(const std::string& value) {
    return "/" + StringUtil::TrimStr(value, '/') + "/";
}

bool IsUsableFile(const std::string& path) {
    return FileUtil::FileExists(path) && FileUtil::CheckFilePermission(path, R_OK) && FileUtil::GetFileSize(path) > 0;
}

// Build types 0 and 1 are the domestic ones.
bool IsDomesticBuild() {
    int type = DevInfo::GetBuildType();
    return type == 0 || type == 1;
}

}  // namespace

PluginPlatform& PluginPlatform::GetInstance() {
    // Never destroyed: loops and sources keep running until the process ends.
    static PluginPlatform* instance = new PluginPlatform();
    return *instance;
}

PluginPlatform::PluginPlatform() {
    std::promise<void> ready;
    ready.set_value();
    sourcesMayStart_ = ready.get_future().share();
}

PluginPlatform::~PluginPlatform() {
    PlatCtxGbl::ReleaseInstance(this);
    // Stop every thread first, so that no queued task or plugin runs against a half-destroyed
    // platform; the tables are released afterwards on this thread.
    if (workLoop_ != nullptr) {
        workLoop_->StopLoop();
    }
    for (const auto& loop : GetLoops()) {
        loop.second->StopLoop();
    }
    {
        Mutex::Autolock lock(mutex_);
        for (const auto& pipeline : pipelines_) {
            pipeline.second->ReleaseListeners();
        }
        pipelines_.clear();
        plugins_.clear();
        loops_.clear();
    }
    dispatcher_ = nullptr;
    workLoop_ = nullptr;
}

int PluginPlatform::ParseArgs(int argc, char** argv) {
    OLOGD("%s agc=%d", argc);
    for (int i = 1; i + 1 < argc; i += 2) {
        std::string option = argv[i];
        std::string value = argv[i + 1];
        if (option == "-configDir") {
            configDir_ = NormalizeDir(value);
        } else if (option == "-configName") {
            configName_ = StringUtil::TrimStr(value, ' ');
        } else if (option == "-workDir") {
            workDir_ = NormalizeDir(value);
        } else if (option == "-cloudCfgDir") {
            SetCloudConfigFolder(value);
        } else if (option == "-devList") {
            devList_ = value;
            ParseDevList();
        } else if (option == "-region") {
            region_ = value;
        } else {
            OLOGE("%s unsupport args %d %s", i, option.c_str());
            return -1;
        }
    }
    return 0;
}

void PluginPlatform::ParseDevList() {
    devicePaths_.clear();
    for (const auto& pair : StringUtil::SplitStr(devList_, ',')) {
        size_t equals = pair.find('=');
        if (equals == std::string::npos || equals == 0 || equals + 1 == pair.size()) {
            OLOGW("%s ignore malformed device entry \"%s\", expected name=path", pair.c_str());
            continue;
        }
        devicePaths_[pair.substr(0, equals)] = pair.substr(equals + 1);
    }
}

std::string PluginPlatform::GetDevicePath(const std::string& name, const std::string& defaultPath) {
    auto it = devicePaths_.find(name);
    return it == devicePaths_.end() ? defaultPath : it->second;
}

bool PluginPlatform::StartPlatform() {
    ForceCreateDirs();
    if (IsExist()) {
        return false;
    }
    StartDispatchQueue();
    DevInfo::GetSerinalNo();

    std::string path = GetPluginConfigPath();
    Config config(path);
    if (!config.Parse() && StringUtil::StartsWith(path, GetCloudConfigDir())) {
        std::string name = kDefaultConfigName;
        if (!IsDomesticBuild() && FileUtil::FileExists(configDir_ + kGlobalConfigName)) {
            name = kGlobalConfigName;
        }
        config = Config(configDir_ + name);
        if (!config.Parse()) {
            OLOGE("%s Fail to parse plugin config");
        }
    }
    LoadPlugins(config);

    isReady_ = true;
    NotifyPlatformReady();
    return true;
}

void PluginPlatform::ForceCreateDirs() {
    // CreateDirectory logs its failures; without a work folder IsExist then stops start-up.
    FileUtil::CreateDirectory(workDir_, kDirMode);
    FileUtil::CreateDirectory(GetCloudConfigDir(), kDirMode);
}

bool PluginPlatform::IsExist() {
    std::string path = workDir_ + kPidFileName;
    // Close-on-exec: children of the daemon must not keep the lock after it is gone. No links:
    // whoever could plant one would have the daemon truncate and rewrite the file it names.
    android::base::unique_fd fd(open(path.c_str(), O_RDWR | O_CREAT | O_CLOEXEC | O_NOFOLLOW, 0640));
    if (fd < 0) {
        OLOGE("%s open %s failed, err:%d, %s", path.c_str(), errno,
              errno == ELOOP ? "it is a symbolic link, not followed" : strerror(errno));
        return true;
    }
    struct stat st;
    if (fstat(fd, &st) != 0 || !S_ISREG(st.st_mode) || st.st_nlink != 1) {
        OLOGE("%s %s is not a regular file of one link, refused", path.c_str());
        return true;
    }
    // The kernel drops the lock with its holder, so a marker left by a killed daemon is free.
    if (flock(fd, LOCK_EX | LOCK_NB) != 0) {
        int err = errno;
        char holder[32] = {0};
        ssize_t size = pread(fd, holder, sizeof(holder) - 1, 0);
        holder[size > 0 ? size : 0] = '\0';
        OLOGE("%s orvane already running, pid %s holds %s, err:%d", StringUtil::TrimStr(holder, '\n').c_str(),
              path.c_str(), err);
        return true;
    }
    std::string pid = std::to_string(getpid()) + "\n";
    if (ftruncate(fd, 0) != 0 || pwrite(fd, pid.data(), pid.size(), 0) != static_cast<ssize_t>(pid.size())) {
        OLOGW("%s write pid to %s failed, err:%d, %s", path.c_str(), errno, strerror(errno));
    }
    pidFd_ = std::move(fd);
    return false;
}

void PluginPlatform::StartDispatchQueue() {
    dispatcher_ = new EventDispatcher();
    dispatcher_->SetPluginContext(this);
    dispatcher_->SetLooper(GetLooperByName("qx_unorder"));
    dispatcher_->OnLoad();
    if (workLoop_ == nullptr) {
        workLoop_ = new EventLoop("plat_shared", stats_);
        workLoop_->StartLoop();
    }
    PlatCtxGbl::NewInstance(this);
}

bool PluginPlatform::CheckCompatible() {
    return FileUtil::FileExists(configDir_ + kCompatibleMarker);
}

std::string PluginPlatform::GetPluginConfigPath() {
    std::string cloudDir = GetCloudConfigDir();
    std::string globalPath = configDir_ + kGlobalConfigName;
    if (IsUsableFile(cloudDir + kGlobalConfigName)) {
        globalPath = cloudDir + kGlobalConfigName;
    }
    std::string region = region_.empty() ? GetSysProperity(kRegionProperty, "") : region_;
    bool hasGlobal = FileUtil::FileExists(globalPath);
    if (region != "CN" && region != "cn" && hasGlobal) {
        return globalPath;
    }
    if (IsUsableFile(cloudDir + configName_)) {
        return cloudDir + configName_;
    }
    OLOGI("%s region:%s,support:%s", region.c_str(), kSupportedRegion);
    if (!IsDomesticBuild() && hasGlobal && !CheckCompatible()) {
        return globalPath;
    }
    return configDir_ + configName_;
}

void PluginPlatform::LoadPlugins(const Config& config) {
    // Sources started below wait for this until the last plugin is loaded.
    std::promise<void> loaded;
    sourcesMayStart_ = loaded.get_future().share();
    for (const auto& info : config.GetPluginInfoList()) {
        OLOGI("%s Start to create plugin %s delay:%d", info.name.c_str(), info.delay);
        if (info.delay < 1) {
            ConstructPlugin(info);
        } else if (workLoop_ == nullptr) {
            OLOGW("%s plugin %s not scheduled, platform not started", info.name.c_str());
        } else {
            workLoop_->AddTask([this, info] { LoadDelayedPlugin(info); }, info.delay, false);
        }
    }
    for (const auto& info : config.GetPipelineInfoList()) {
        OLOGI("%s Start to create pipeline %s", info.name.c_str());
        ConstructPipeline(info);
    }
    for (const auto& info : config.GetPluginInfoList()) {
        OLOGI("%s Start to Load plugin %s", info.name.c_str());
        LoadPlugin(info);
    }
    loaded.set_value();
}

void PluginPlatform::ConstructPlugin(const Config::PluginInfo& info) {
    if (info.name.empty()) {
        return;
    }
    if (!info.isStatic) {
        OLOGW("%s plugin %s not supported to load", info.name.c_str());
        return;
    }
    sp<Plugin> plugin = PluginFactory::CreatePlugin(info.name);
    if (plugin == nullptr) {
        OLOGW("%s plugin %s not loaded, not found in factory", info.name.c_str());
        return;
    }
    plugin->SetName(info.name);
    plugin->SetPluginContext(this);
    if (plugin->PreToLoad()) {
        Mutex::Autolock lock(mutex_);
        plugins_[info.name] = plugin;
    }
}

void PluginPlatform::LoadPlugin(const Config::PluginInfo& info) {
    sp<Plugin> plugin = FindPlugin(info.name);
    if (plugin == nullptr) {
        OLOGW("%s plugin %s not constructed", info.name.c_str());
        return;
    }
    // A delayed plugin whose delay ended before the start-up's pass came to it is met twice.
    if (!ClaimLoad(info.name)) {
        OLOGD("%s plugin %s already loaded", info.name.c_str());
        return;
    }
    if (info.threadType == "thread") {
        plugin->SetLooper(GetLooperByName(info.threadName));
    } else {
        OLOGW("%s %s loop %s not supported, use platform loop", info.name.c_str(), info.threadType.c_str());
    }

    uint64_t start = TimeUtil::GetTimestampUS();
    plugin->OnLoad();
    if (info.isEventSource) {
        sp<EventSource> source = dynamic_cast<EventSource*>(plugin.get());
        if (source == nullptr) {
            OLOGE("%s Fail to cast plugin to event source");
            return;
        }
        for (const auto& name : info.pipelines) {
            source->AddPipeline(name, FindPipeline(name));
        }
        sp<EventLoop> fallback;
        if (info.delay >= 1 && source->GetLooper() == nullptr) {
            // Its start is its blocking read loop: in place it would hold for good the thread
            // that loaded it, the shared work loop (every later delayed plugin and shared task)
            // or the main thread (the rest of start-up and the service).
            fallback = GetLooperByName(info.name + kOwnSourceLoopSuffix);
            OLOGW("%s delayed event source %s has no loop, given one of its own", info.name.c_str());
        }
        StartEventSource(source, fallback);
    }
    OLOGI("%s plugin %s isEventSource=%d, loadtime:%lu", info.name.c_str(), info.isEventSource ? 1 : 0,
          static_cast<unsigned long>(TimeUtil::GetTimestampUS() - start));
}

void PluginPlatform::LoadDelayedPlugin(const Config::PluginInfo& info) {
    ConstructPlugin(info);
    // Unlike a start-up plugin nothing else will load it, so it is loaded here.
    if (FindPlugin(info.name) != nullptr) {
        LoadPlugin(info);
    }
}

void PluginPlatform::ConstructPipeline(const Config::PipelineInfo& info) {
    std::vector<sp<Plugin>> plugins;
    for (const auto& name : info.plugins) {
        sp<Plugin> plugin = FindPlugin(name);
        if (plugin == nullptr) {
            OLOGW("%s not found plugin %s, skip adding to pipeline %s", name.c_str(), info.name.c_str());
            continue;
        }
        plugins.push_back(plugin);
    }
    sp<Pipeline> pipeline = new Pipeline(info.name, plugins);
    Mutex::Autolock lock(mutex_);
    pipelines_[info.name] = pipeline;
}

void PluginPlatform::StartEventSource(sp<EventSource> source, sp<EventLoop> fallback) {
    sp<EventLoop> looper = source->GetLooper();
    if (looper == nullptr) {
        looper = fallback;
    }
    if (looper != nullptr) {
        OLOGI("%s Start event source[%s] in thead[%s]", source->GetName().c_str(), looper->GetName().c_str());
        std::shared_future<void> mayStart = sourcesMayStart_;
        looper->AddTask(
                [source, mayStart] {
                    mayStart.wait();
                    source->StartEventSource();
                },
                0, false);
        return;
    }
    OLOGW("%s No work loop available, start event source[%s] in current thead", source->GetName().c_str());
    source->StartEventSource();
}

void PluginPlatform::NotifyPlatformReady() {
    sp<Event> event = new Event("platform");
    if (event == nullptr) {
        OLOGI("%s event is null");
        return;
    }
    event->eventId = 0;
    event->eventType = kEventTypeControl;
    PostUnorderedEvent(event);
}

std::string PluginPlatform::GetCloudConfigDir() {
    Mutex::Autolock lock(mutex_);
    return cloudConfigDir_;
}

void PluginPlatform::SetCloudConfigFolder(const std::string& folder) {
    Mutex::Autolock lock(mutex_);
    cloudConfigDir_ = NormalizeDir(folder);
}

sp<EventLoop> PluginPlatform::GetLooperByName(const std::string& name) {
    if (name.empty()) {
        OLOGW("%s a loop needs a name");
        return nullptr;
    }
    Mutex::Autolock lock(mutex_);
    auto it = loops_.find(name);
    if (it != loops_.end()) {
        return it->second;
    }
    sp<EventLoop> loop = new EventLoop(name, stats_);
    loop->StartLoop();
    OLOGI("%s create event looper name %s", name.c_str());
    loops_[name] = loop;
    return loop;
}

std::string PluginPlatform::GetSysProperity(const std::string& key, const std::string& defaultValue) {
    return SysEnv::GetSysProperity(key, defaultValue);
}

bool PluginPlatform::SetSysProperity(const std::string& key, const std::string& value) {
    return SysEnv::SetSysProperity(key, value);
}

bool PluginPlatform::PostUnorderedEvent(sp<Event> event) {
    sp<EventLoop> looper = dispatcher_ == nullptr ? nullptr : dispatcher_->GetLooper();
    if (looper == nullptr) {
        OLOGW_LIMITED("%s dispatcher not started, event dropped");
        return false;
    }
    return looper->AddEvent(dispatcher_, event, 0, false) != UINT64_MAX;
}

void PluginPlatform::RegisterUnorderedEventListener(sp<EventListener> listener) {
    if (dispatcher_ == nullptr) {
        OLOGW("%s dispatcher not started, listener not registered");
        return;
    }
    dispatcher_->AddListener(listener);
}

bool PluginPlatform::PostSyncEventToTarget(const std::string& pluginName, sp<Event> event) {
    sp<Plugin> plugin = FindPlugin(pluginName);
    if (plugin == nullptr || event == nullptr) {
        OLOGW_LIMITED("%s plugin %s not found or event is null", pluginName.c_str());
        return false;
    }
    sp<EventLoop> looper = plugin->GetLooper();
    if (looper != nullptr && looper->IsCurrentThread()) {
        OLOGE("%s plugin %s runs on %s, the caller's own loop, which would wait for itself for good: event %u refused",
              pluginName.c_str(), looper->GetName().c_str(), event->eventId);
        return false;
    }
    if (looper != nullptr) {
        return looper->AddEventWaitResult(plugin, event);
    }
    return plugin->OnEvent(event) != -1;
}

bool PluginPlatform::PostAsyncEventToTarget(const std::string& pluginName, sp<Event> event) {
    sp<Plugin> plugin = FindPlugin(pluginName);
    if (plugin == nullptr || event == nullptr) {
        OLOGW_LIMITED("%s plugin %s not found or event is null", pluginName.c_str());
        return false;
    }
    sp<EventLoop> looper = plugin->GetLooper();
    if (looper != nullptr) {
        return looper->AddEvent(plugin, event, 0, false) != UINT64_MAX;
    }
    plugin->OnEvent(event);
    return true;
}

bool PluginPlatform::InsertEventToPipeline(const std::string& pipelineName, sp<Event> event) {
    sp<Pipeline> pipeline = FindPipeline(pipelineName);
    if (pipeline == nullptr || event == nullptr) {
        OLOGW_LIMITED("%s pipeline %s not found or event is null", pipelineName.c_str());
        return false;
    }
    pipeline->ProcessPipeline(event, 0);
    return true;
}

bool PluginPlatform::RegisterPipelineListener(const std::string& pipelineName, sp<Plugin> listener) {
    sp<Pipeline> pipeline = FindPipeline(pipelineName);
    if (pipeline == nullptr || listener == nullptr) {
        OLOGW("%s pipeline %s not found or listener is null", pipelineName.c_str());
        return false;
    }
    pipeline->RegisterPluginListener(listener);
    return true;
}

std::map<std::string, sp<Plugin>> PluginPlatform::GetPlugins() {
    Mutex::Autolock lock(mutex_);
    return plugins_;
}

std::map<std::string, sp<Pipeline>> PluginPlatform::GetPipelines() {
    Mutex::Autolock lock(mutex_);
    return pipelines_;
}

std::map<std::string, sp<EventLoop>> PluginPlatform::GetLoops() {
    Mutex::Autolock lock(mutex_);
    return loops_;
}

sp<Plugin> PluginPlatform::FindPlugin(const std::string& name) {
    Mutex::Autolock lock(mutex_);
    auto it = plugins_.find(name);
    return it == plugins_.end() ? nullptr : it->second;
}

bool PluginPlatform::ClaimLoad(const std::string& name) {
    Mutex::Autolock lock(mutex_);
    return loadedPlugins_.insert(name).second;
}

sp<Pipeline> PluginPlatform::FindPipeline(const std::string& name) {
    Mutex::Autolock lock(mutex_);
    auto it = pipelines_.find(name);
    return it == pipelines_.end() ? nullptr : it->second;
}

void PlatCtxGbl::NewInstance(PluginPlatform* platform) {
    g_platform = platform;
}

PluginPlatform* PlatCtxGbl::GetInstance() {
    return g_platform;
}

void PlatCtxGbl::ReleaseInstance(PluginPlatform* platform) {
    g_platform.compare_exchange_strong(platform, nullptr);
}

std::string PlatCtxGbl::GetSysProperity(const std::string& key, const std::string& defaultValue) {
    return SysEnv::GetSysProperity(key, defaultValue);
}

bool PlatCtxGbl::SetSysProperity(const std::string& key, const std::string& value) {
    return SysEnv::SetSysProperity(key, value);
}

}  // namespace Orvane
}  // namespace android
