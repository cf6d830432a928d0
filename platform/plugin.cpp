#include "platform/plugin.h"

#include "platform/pipeline.h"
#include "utils/orvane_log.h"

namespace android {
namespace Orvane {

Plugin::~Plugin() {
    sp<EventLoop> looper = GetLooper();
    if (looper != nullptr) {
        looper->StopLoop();
    }
}

void Plugin::SetPluginContext(PluginContext* context) {
    std::call_once(contextOnce_, [this, context] { context_ = context; });
}

void Plugin::SetLooper(sp<EventLoop> looper) {
    if (looper == nullptr) {
        return;
    }
    Mutex::Autolock lock(looperLock_);
    if (looper.get() != looper_.load()) {
        loopers_.push_back(looper);
        looper_.store(looper.get());
    }
}

sp<EventLoop> Plugin::GetLooper() const {
    return sp<EventLoop>(looper_.load());
}

EventSource::~EventSource() {}

void EventSource::AddPipeline(const std::string& name, sp<Pipeline> pipeline) {
    if (pipeline == nullptr) {
        OLOGW("%s %s pipeline nullptr, not add to %s.", name.c_str(), GetName().c_str());
        return;
    }
    OLOGD("%s EventSource %s add pipeline %s.", GetName().c_str(), pipeline->GetName().c_str());
    pipelines_.push_back(pipeline);
}

bool EventSource::PublishPipelineEvent(sp<Event> event) {
    if (event == nullptr) {
        return false;
    }
    for (const auto& pipeline : pipelines_) {
        if (pipeline->CanProcessEvent(event)) {
            pipeline->ProcessPipeline(event, 0);
            return true;
        }
        pipeline->CountRefused();
    }
    return false;
}

uint64_t EventSource::Backlog() const {
    uint64_t backlog = 0;
    for (const auto& pipeline : pipelines_) {
        backlog += pipeline->Backlog();
    }
    return backlog;
}

void EventListener::AddListenerInfo(uint32_t eventType, uint32_t beginId, uint32_t endId) {
    Mutex::Autolock lock(infoLock_);
    listenerInfo_.push_back({eventType, beginId, endId});
}

std::vector<EventListener::ListenerInfo> EventListener::GetListenerInfo() const {
    Mutex::Autolock lock(infoLock_);
    return listenerInfo_;
}

bool EventListener::IsInterested(const Event& event) const {
    Mutex::Autolock lock(infoLock_);
    for (const auto& info : listenerInfo_) {
        if (info.eventType == event.eventType && info.beginId <= event.eventId && event.eventId <= info.endId) {
            return true;
        }
    }
    return false;
}

}  // namespace Orvane
}  // namespace android
