#ifndef ORVANE_TESTS_COMMON_FAKE_PLUGIN_CONTEXT_H
#define ORVANE_TESTS_COMMON_FAKE_PLUGIN_CONTEXT_H

#include <map>

#include <utils/Mutex.h>

#include "platform/event_loop.h"
#include "platform/plugin_context.h"

namespace android::Orvane {

// A platform stand-in: fixed folders and device nodes, properties in a map, a real shared work
// loop, and a record of the events inserted into pipelines. Any thread may call it.
class FakePluginContext : public PluginContext {
public:
    FakePluginContext(const std::string& workDir, const std::string& configDir,
                      std::map<std::string, std::string> devices = {})
        : workDir_(workDir),
          configDir_(configDir),
          devices_(std::move(devices)),
          sharedLoop_(new EventLoop("plat_shared")) {
        sharedLoop_->StartLoop();
    }
    ~FakePluginContext() override { sharedLoop_->StopLoop(); }
    std::vector<std::pair<std::string, sp<Event>>> Inserted() {
        Mutex::Autolock lock(mutex_);
        return inserted_;
    }

    bool IsReady() override { return true; }
    std::string GetWorkDir() override { return workDir_; }
    std::string GetConfigDir() override { return configDir_; }
    std::string GetCloudConfigDir() override { return configDir_; }
    sp<EventLoop> GetSharedWorkLoop() override { return sharedLoop_; }
    sp<EventLoop> GetLooperByName(const std::string&) override { return sharedLoop_; }
    std::string GetSysProperity(const std::string& key, const std::string& defaultValue) override {
        Mutex::Autolock lock(mutex_);
        return properties_.count(key) != 0 ? properties_[key] : defaultValue;
    }
    bool SetSysProperity(const std::string& key, const std::string& value) override {
        Mutex::Autolock lock(mutex_);
        properties_[key] = value;
        return true;
    }
    std::string GetDevicePath(const std::string& name, const std::string& defaultPath) override {
        auto found = devices_.find(name);
        return found == devices_.end() ? defaultPath : found->second;
    }
    bool PostUnorderedEvent(sp<Event>) override { return true; }
    void RegisterUnorderedEventListener(sp<EventListener>) override {}
    bool PostSyncEventToTarget(const std::string&, sp<Event>) override { return false; }
    bool PostAsyncEventToTarget(const std::string&, sp<Event>) override { return false; }
    bool InsertEventToPipeline(const std::string& pipelineName, sp<Event> event) override {
        Mutex::Autolock lock(mutex_);
        inserted_.emplace_back(pipelineName, event);
        return true;
    }
    bool RegisterPipelineListener(const std::string&, sp<Plugin>) override { return false; }
    void SetCloudConfigFolder(const std::string&) override {}
    DaemonStats& GetStats() override { return stats_; }

    const std::string workDir_, configDir_;
    const std::map<std::string, std::string> devices_;
    sp<EventLoop> sharedLoop_;
    Mutex mutex_;
    std::map<std::string, std::string> properties_ GUARDED_BY(mutex_);
    std::vector<std::pair<std::string, sp<Event>>> inserted_ GUARDED_BY(mutex_);
    DaemonStats stats_;
};

}  // namespace android::Orvane

#endif  // ORVANE_TESTS_COMMON_FAKE_PLUGIN_CONTEXT_H
