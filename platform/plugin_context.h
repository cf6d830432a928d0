#ifndef ORVANE_PLATFORM_PLUGIN_CONTEXT_H
#define ORVANE_PLATFORM_PLUGIN_CONTEXT_H

#include <string>

#include <utils/StrongPointer.h>

#include "platform/event.h"
#include "platform/event_loop.h"
#include "platform/plugin.h"
#include "utils/daemon_stats.h"

namespace android {
namespace Orvane {

// What the platform offers its plugins. Implemented by PluginPlatform, which outlives every
// plugin. Every operation may be called from any thread once start-up has begun.
class PluginContext {
public:
    virtual ~PluginContext() {}

    // True once every static plugin is loaded and the sources are started.
    virtual bool IsReady() = 0;
    // Folders, each with exactly one "/" before and after.
    virtual std::string GetWorkDir() = 0;
    virtual std::string GetConfigDir() = 0;
    virtual std::string GetCloudConfigDir() = 0;
    // The work loop "plat_shared", shared by the platform and any plugin with short tasks.
    virtual sp<EventLoop> GetSharedWorkLoop() = 0;
    // The loop of that name, created and started on first request; never removed.
    virtual sp<EventLoop> GetLooperByName(const std::string& name) = 0;
    virtual std::string GetSysProperity(const std::string& key, const std::string& defaultValue) = 0;
    virtual bool SetSysProperity(const std::string& key, const std::string& value) = 0;
    // The path of the device node named `name` ("qxev", "qx_exception_log"): the override of
    // the "-devList" option, else `defaultPath`.
    virtual std::string GetDevicePath(const std::string& name, const std::string& defaultPath) = 0;

    // Hands the event to every unordered listener registered for it, on the loop "qx_unorder".
    virtual bool PostUnorderedEvent(sp<Event> event) = 0;
    virtual void RegisterUnorderedEventListener(sp<EventListener> listener) = 0;
    // Runs the named plugin's OnEvent on its loop and waits; false for an unknown plugin or a
    // result of -1. Never call it from the target's own loop.
    virtual bool PostSyncEventToTarget(const std::string& pluginName, sp<Event> event) = 0;
    // Queues the event for the named plugin's OnEvent; false for an unknown plugin.
    virtual bool PostAsyncEventToTarget(const std::string& pluginName, sp<Event> event) = 0;
    // Starts the event at the first step of the named pipeline; false for an unknown pipeline.
    virtual bool InsertEventToPipeline(const std::string& pipelineName, sp<Event> event) = 0;
    // Adds a plugin to the listeners of the named pipeline; false for an unknown pipeline.
    virtual bool RegisterPipelineListener(const std::string& pipelineName, sp<Plugin> listener) = 0;
    // Where configuration pushed from the cloud is kept; normalised like "-cloudCfgDir".
    virtual void SetCloudConfigFolder(const std::string& folder) = 0;
    // The daemon's statistics about itself; lives as long as the context.
    virtual DaemonStats& GetStats() = 0;
};

}  // namespace Orvane
}  // namespace android

#endif  // ORVANE_PLATFORM_PLUGIN_CONTEXT_H
