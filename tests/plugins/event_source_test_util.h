#ifndef ORVANE_TESTS_PLUGINS_EVENT_SOURCE_TEST_UTIL_H
#define ORVANE_TESTS_PLUGINS_EVENT_SOURCE_TEST_UTIL_H

// Helpers for the tests of the kernel event sources: a plugin that records what reaches it,
// a context that points the sources at test nodes and a runner for a source's blocking loop.

#include <pthread.h>
#include <signal.h>

#include <atomic>
#include <chrono>
#include <initializer_list>
#include <map>
#include <mutex>
#include <string>
#include <thread>
#include <vector>

#include "platform/pipeline.h"
#include "platform/plugin.h"
#include "platform/plugin_context.h"
#include "tests/common/log_capture.h"
#include "tests/plugins/devsim_process.h"

namespace android {
namespace Orvane {

// The first step of the test pipeline: keeps every event, in arrival order.
class RecordingPlugin : public Plugin {
public:
    EVENT_RET OnEvent(sp<Event>& event) override {
        std::lock_guard<std::mutex> guard(lock);
        events.push_back(event);
        return 0;
    }
    std::vector<sp<Event>> Events() const {
        std::lock_guard<std::mutex> guard(lock);
        return events;
    }
    size_t Count() const {
        std::lock_guard<std::mutex> guard(lock);
        return events.size();
    }

private:
    mutable std::mutex lock;
    std::vector<sp<Event>> events;
};

// Connects a source to a pipeline holding only `recorder`.
inline sp<RecordingPlugin> AttachRecorder(const sp<EventSource>& source) {
    sp<RecordingPlugin> recorder = new RecordingPlugin();
    source->AddPipeline("dftFaultEvent", new Pipeline("dftFaultEvent", {recorder}));
    return recorder;
}

// A platform that knows nothing but where the device nodes are.
class DeviceContext : public PluginContext {
public:
    DeviceContext(std::initializer_list<std::pair<const std::string, std::string>> devices) : devices(devices) {}
    std::string GetDevicePath(const std::string& name, const std::string& defaultPath) override {
        auto found = devices.find(name);
        return found == devices.end() ? defaultPath : found->second;
    }
    bool IsReady() override { return true; }
    std::string GetWorkDir() override { return "/tmp/"; }
    std::string GetConfigDir() override { return "/tmp/"; }
    std::string GetCloudConfigDir() override { return "/tmp/"; }
    sp<EventLoop> GetSharedWorkLoop() override { return nullptr; }
    sp<EventLoop> GetLooperByName(const std::string&) override { return nullptr; }
    std::string GetSysProperity(const std::string&, const std::string& defaultValue) override {
        return defaultValue;
    }
    bool SetSysProperity(const std::string&, const std::string&) override { return false; }
    bool PostUnorderedEvent(sp<Event>) override { return false; }
    void RegisterUnorderedEventListener(sp<EventListener>) override {}
    bool PostSyncEventToTarget(const std::string&, sp<Event>) override { return false; }
    bool PostAsyncEventToTarget(const std::string&, sp<Event>) override { return false; }
    bool InsertEventToPipeline(const std::string&, sp<Event>) override { return false; }
    bool RegisterPipelineListener(const std::string&, sp<Plugin>) override { return false; }
    void SetCloudConfigFolder(const std::string&) override {}

private:
    const std::map<std::string, std::string> devices;
};

// Runs a source's StartEventSource on a thread of its own, as the platform does. The sources
// block in select, read or epoll_wait and look at their stop flag only when such a call fails,
// so stopping interrupts the thread with a signal until it has returned.
class SourceRunner {
public:
    explicit SourceRunner(sp<EventSource> source) : source(source) {
        struct sigaction action = {};
        action.sa_handler = [](int) {};  // no SA_RESTART: blocking calls fail with EINTR
        sigaction(SIGUSR1, &action, nullptr);
        thread = std::thread([this] {
            this->source->StartEventSource();
            finished = true;
        });
    }
    ~SourceRunner() { Stop(); }

    bool Finished() const { return finished; }
    bool WaitFinished() { return WaitUntil([this] { return Finished(); }); }

    // Unloads the source and knocks it out of its blocking call; true when it returned.
    bool Stop() {
        if (!thread.joinable()) {
            return finished;
        }
        source->OnUnload();
        auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(10);
        while (!finished && std::chrono::steady_clock::now() < deadline) {
            pthread_kill(thread.native_handle(), SIGUSR1);
            WaitUntil([this] { return Finished(); }, std::chrono::milliseconds(20));
        }
        if (!finished) {
            thread.detach();  // still blocked: leaking it beats hanging the test binary
            return false;
        }
        thread.join();
        return true;
    }

private:
    sp<EventSource> source;
    std::atomic<bool> finished{false};
    std::thread thread;
};

}  // namespace Orvane
}  // namespace android

#endif  // ORVANE_TESTS_PLUGINS_EVENT_SOURCE_TEST_UTIL_H
