#ifndef ORVANE_PLATFORM_PLUGIN_PLATFORM_H
#define ORVANE_PLATFORM_PLUGIN_PLATFORM_H

#include <atomic>
#include <future>
#include <map>
#include <memory>
#include <set>
#include <string>

#include <android-base/unique_fd.h>
#include <utils/Mutex.h>
#include <utils/StrongPointer.h>

#include "platform/config.h"
#include "platform/event.h"
#include "platform/event_dispatcher.h"
#include "platform/event_loop.h"
#include "platform/pipeline.h"
#include "platform/plugin.h"
#include "platform/plugin_context.h"

namespace android {
namespace Orvane {

// The daemon's core: reads the command line and the plugin configuration, creates the loops,
// constructs and loads the plugins, builds the pipelines, starts the event sources and
// announces that it is ready. It is the context of every plugin.
//
// Threads: ParseArgs and StartPlatform run on the main thread before anything else uses the
// platform; the folders and options they set, the shared work loop and the dispatcher are
// read-only afterwards, except the cloud configuration folder. `mutex_` guards that folder and
// the plugin, pipeline and loop tables (delayed plugins are added later on the shared work
// loop); callers get copies of the pointers and call plugins outside the lock. Every loop that
// the platform creates reports to its statistics.
class PluginPlatform : public PluginContext {
public:
    // The daemon's one platform, created on first use and never destroyed.
    static PluginPlatform& GetInstance();

    // Tests and benchmarks build platforms of their own; destruction stops every loop.
    PluginPlatform();
    ~PluginPlatform() override;
    PluginPlatform(const PluginPlatform&) = delete;
    PluginPlatform& operator=(const PluginPlatform&) = delete;

    // 0, or -1 with an error line for an unknown option.
    int ParseArgs(int argc, char** argv);
    // False when another daemon holds the work folder; configuration errors do not stop it.
    bool StartPlatform();

    // Start-up steps, in the order StartPlatform runs them.
    std::string GetPluginConfigPath();
    void LoadPlugins(const Config& config);
    void ConstructPlugin(const Config::PluginInfo& info);
    void LoadPlugin(const Config::PluginInfo& info);
    // Runs on the shared work loop once the plugin's delay has passed.
    void LoadDelayedPlugin(const Config::PluginInfo& info);
    void ConstructPipeline(const Config::PipelineInfo& info);
    // Starts the source on its loop, else on `fallback`, else on the calling thread.
    void StartEventSource(sp<EventSource> source, sp<EventLoop> fallback = nullptr);
    void NotifyPlatformReady();

    // PluginContext.
    bool IsReady() override { return isReady_.load(); }
    std::string GetWorkDir() override { return workDir_; }
    std::string GetConfigDir() override { return configDir_; }
    std::string GetCloudConfigDir() override;
    sp<EventLoop> GetSharedWorkLoop() override { return workLoop_; }
    sp<EventLoop> GetLooperByName(const std::string& name) override;
    std::string GetSysProperity(const std::string& key, const std::string& defaultValue) override;
    bool SetSysProperity(const std::string& key, const std::string& value) override;
    std::string GetDevicePath(const std::string& name, const std::string& defaultPath) override;
    bool PostUnorderedEvent(sp<Event> event) override;
    void RegisterUnorderedEventListener(sp<EventListener> listener) override;
    bool PostSyncEventToTarget(const std::string& pluginName, sp<Event> event) override;
    bool PostAsyncEventToTarget(const std::string& pluginName, sp<Event> event) override;
    bool InsertEventToPipeline(const std::string& pipelineName, sp<Event> event) override;
    bool RegisterPipelineListener(const std::string& pipelineName, sp<Plugin> listener) override;
    void SetCloudConfigFolder(const std::string& folder) override;
    DaemonStats& GetStats() override { return *stats_; }

    // Read access for dumps: copies, safe at any time.
    std::map<std::string, sp<Plugin>> GetPlugins();
    std::map<std::string, sp<Pipeline>> GetPipelines();
    std::map<std::string, sp<EventLoop>> GetLoops();
    const std::string& GetConfigName() const { return configName_; }
    const std::string& GetDevList() const { return devList_; }
    const std::string& GetRegion() const { return region_; }

private:
    void ForceCreateDirs();
    // True when another daemon holds the process marker; otherwise this one takes it for life.
    bool IsExist();
    void StartDispatchQueue();
    // True when the configuration folder marks its named file as fit for every build.
    bool CheckCompatible();
    void ParseDevList();
    sp<Plugin> FindPlugin(const std::string& name);
    sp<Pipeline> FindPipeline(const std::string& name);
    // True for the first caller only: a plugin is loaded once, by the start-up or by its delay.
    bool ClaimLoad(const std::string& name);

    std::atomic<bool> isReady_{false};
    // Shared with the loops, which may outlive the platform in a plugin's hands.
    const std::shared_ptr<DaemonStats> stats_ = std::make_shared<DaemonStats>();
    std::string configDir_ = "/system/etc/orvane/";
    std::string workDir_ = "/data/quorlog/orvane/";
    std::string configName_ = "plugin_config";
    std::string devList_;
    std::string region_;
    std::map<std::string, std::string> devicePaths_;

    Mutex mutex_;
    std::string cloudConfigDir_ GUARDED_BY(mutex_) = "/data/quorlog/orvane/config/";
    std::map<std::string, sp<Plugin>> plugins_ GUARDED_BY(mutex_);
    std::map<std::string, sp<Pipeline>> pipelines_ GUARDED_BY(mutex_);
    std::map<std::string, sp<EventLoop>> loops_ GUARDED_BY(mutex_);
    std::set<std::string> loadedPlugins_ GUARDED_BY(mutex_);
    sp<EventLoop> workLoop_;
    sp<EventDispatcher> dispatcher_;
    // Ready once every start-up plugin is loaded. Event sources wait for it on their loops
    // before they start, so that no event reaches a plugin not yet bound to its loop and loaded.
    // Set by LoadPlugins on the main thread.
    std::shared_future<void> sourcesMayStart_;
    // Holds the exclusive lock on "orvane.pid" for the platform's life.
    android::base::unique_fd pidFd_;
};

// Reaches the running platform from code that has no context pointer. Safe from any thread.
class PlatCtxGbl {
public:
    static void NewInstance(PluginPlatform* platform);
    // Empty before start-up has begun.
    static PluginPlatform* GetInstance();
    // Clears the instance if it is `platform` (a platform built by a test going away).
    static void ReleaseInstance(PluginPlatform* platform);
    static std::string GetSysProperity(const std::string& key, const std::string& defaultValue);
    static bool SetSysProperity(const std::string& key, const std::string& value);
};

}  // namespace Orvane
}  // namespace android

#endif  // ORVANE_PLATFORM_PLUGIN_PLATFORM_H
