#ifndef ORVANE_PLATFORM_PLUGIN_H
#define ORVANE_PLATFORM_PLUGIN_H

#include <atomic>
#include <cstdint>
#include <mutex>
#include <string>
#include <vector>

#include <utils/Mutex.h>
#include <utils/RefBase.h>
#include <utils/StrongPointer.h>

#include "platform/event.h"
#include "platform/event_handler.h"
#include "platform/event_loop.h"

namespace android {
namespace Orvane {

class PluginContext;
class Pipeline;

// A functional component of the daemon. The platform sets its name, context and loop on the
// main thread (or, for a delayed plugin, on the shared work loop) before `OnLoad`; from then on
// name and context are only read; the loop may be read from any thread. Its events run on its
// loop, or on the caller's thread without one.
class Plugin : public EventHandler {
public:
    Plugin() = default;
    // Stops the plugin's loop, so a loop is best not shared with plugins that live on.
    ~Plugin() override;

    // False makes the platform drop the plugin right after construction.
    virtual bool PreToLoad() { return true; }
    virtual void OnLoad() {}
    virtual void OnUnload() {}
    virtual void Dump(int fd, const std::vector<std::string>& args) {
        (void)fd;
        (void)args;
    }

    const std::string& GetName() const { return name_; }
    const std::string& GetVersion() const { return version_; }
    void SetName(const std::string& name) { name_ = name; }
    void SetVersion(const std::string& version) { version_ = version; }
    PluginContext* GetPluginContext() const { return context_; }
    // Only the first call has effect: the context outlives every plugin and never changes.
    void SetPluginContext(PluginContext* context);
    // An empty loop is ignored and the old one stays.
    void SetLooper(sp<EventLoop> looper);
    sp<EventLoop> GetLooper() const;

private:
    friend class Pipeline;
    // The loop without taking a reference, for the pipelines' per-step checks: valid while this
    // plugin lives, since the plugin keeps every loop it was given.
    EventLoop* CurrentLooper() const { return looper_.load(); }

    std::string name_;
    std::string version_;
    // Pipelines read the loop on every step, from any thread, and a delayed plugin gets its loop
    // while others may already post to it. So `looper_` publishes the current loop without a
    // lock, and `loopers_` (guarded by `looperLock_`) keeps every loop ever set alive until the
    // plugin goes, so that a pointer just read is never freed under its reader.
    std::atomic<EventLoop*> looper_{nullptr};
    Mutex looperLock_;
    std::vector<sp<EventLoop>> loopers_ GUARDED_BY(looperLock_);
    PluginContext* context_ = nullptr;
    std::once_flag contextOnce_;
};

// A plugin that produces events and hands each to the first of its pipelines that accepts it.
// Pipelines are added on the main thread before `StartEventSource`; publishing may then happen
// from any thread (usually the source's own read loop).
class EventSource : public Plugin {
public:
    EventSource() = default;
    ~EventSource() override;

    virtual void StartEventSource() {}

    // An empty pipeline is refused with a warning line.
    void AddPipeline(const std::string& name, sp<Pipeline> pipeline);
    // False for an empty event or when no pipeline accepts it.
    bool PublishPipelineEvent(sp<Event> event);
    // Events in this source's pipelines that have not come through yet (Pipeline::Backlog).
    uint64_t Backlog() const;

private:
    std::vector<sp<Pipeline>> pipelines_;
};

// Receiver of events outside the pipelines: ordered events from its owner, and unordered ones
// from the platform's dispatcher, for every registration (event type and an inclusive id range)
// that matches. Registrations may be added from any thread; `infoLock_` guards them.
class EventListener : public virtual RefBase {
public:
    struct ListenerInfo {
        uint32_t eventType;
        uint32_t beginId;
        uint32_t endId;
    };

    explicit EventListener(const std::string& name = "") : listenerName_(name) {}
    ~EventListener() override {}

    virtual EVENT_RET OnOrderedEvent(sp<Event> event) {
        (void)event;
        return 0;
    }
    // Runs on the dispatcher's loop "qx_unorder".
    virtual void OnUnorderedEvent(sp<Event> event) { (void)event; }
    virtual std::string GetListenerName() { return listenerName_; }

    // Registers interest in events of `eventType` whose id lies in [beginId, endId].
    void AddListenerInfo(uint32_t eventType, uint32_t beginId, uint32_t endId);
    void AddListenerInfo(uint32_t eventType, uint32_t eventId) { AddListenerInfo(eventType, eventId, eventId); }
    std::vector<ListenerInfo> GetListenerInfo() const;
    bool IsInterested(const Event& event) const;

private:
    const std::string listenerName_;
    mutable Mutex infoLock_;
    std::vector<ListenerInfo> listenerInfo_ GUARDED_BY(infoLock_);
};

}  // namespace Orvane
}  // namespace android

#endif  // ORVANE_PLATFORM_PLUGIN_H
