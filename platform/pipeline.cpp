#include "platform/pipeline.h"

#include "platform/plugin_context.h"
#include "utils/orvane_log.h"
#include "utils/trace.h"

namespace android {
namespace Orvane {
namespace {

std::vector<sp<Plugin>> WithoutEmpty(const std::string& name, const std::vector<sp<Plugin>>& plugins) {
    std::vector<sp<Plugin>> kept;
    for (size_t i = 0; i < plugins.size(); i++) {
        if (plugins[i] == nullptr) {
            OLOG_AS(ANDROID_LOG_WARN, "ConstructPipeline", "%s pipeline %s, plugin %d, nullptr", name.c_str(),
                    static_cast<int>(i));
            continue;
        }
        kept.push_back(plugins[i]);
    }
    return kept;
}

}  // namespace

Pipeline::Pipeline(const std::string& name, const std::vector<sp<Plugin>>& plugins)
    : name_(name), plugins_(WithoutEmpty(name, plugins)), listeners_(std::make_shared<const ListenerSet>()) {
    PluginContext* context = plugins_.empty() ? nullptr : plugins_.front()->GetPluginContext();
    if (context != nullptr) {
        DaemonStats& stats = context->GetStats();
        published_ = &stats.Get("pipeline." + name_ + ".published");
        refused_ = &stats.Get("pipeline." + name_ + ".refused");
        backlogHigh_ = &stats.Get("pipeline." + name_ + ".backlog_high");
    }
}

void Pipeline::CountRefused() {
    if (refused_ != nullptr) {
        refused_->fetch_add(1, std::memory_order_relaxed);
    }
}

bool Pipeline::CanProcessEvent(sp<Event> event) {
    if (plugins_.empty()) {
        OLOGD("%s no plugin processor in this pipeline");
        return false;
    }
    return plugins_.front()->CanProcessEvent(event);
}

void Pipeline::ProcessPipeline(sp<Event> event, unsigned int index) {
    if (index >= plugins_.size()) {
        OLOGE("%s index over plugins size");
        return;
    }
    if (index == 0) {
        uint64_t backlog = backlog_.fetch_add(1, std::memory_order_relaxed) + 1;
        if (published_ != nullptr) {
            published_->fetch_add(1, std::memory_order_relaxed);
            DaemonStats::RaiseTo(*backlogHigh_, backlog);
        }
    }
    // Plain pointers suffice: this pipeline holds its plugins, and each keeps its loops alive.
    EventLoop* looper = plugins_[index]->CurrentLooper();
    if (looper == nullptr) {
        ProcessEvent(std::move(event), index);
        return;
    }
    if (index > 0) {
        EventLoop* previous = plugins_[index - 1]->CurrentLooper();
        // The previous step ran on a loop of this name, so this thread already is that loop.
        if (previous != nullptr && (previous == looper || previous->GetName() == looper->GetName())) {
            ProcessEvent(std::move(event), index);
            return;
        }
    }
    sp<Pipeline> self(this);
    looper->AddTask([self, event = std::move(event), index] { self->ProcessEvent(event, index); }, 0, false);
}

void Pipeline::ProcessEvent(sp<Event> event, unsigned int index) {
    if (index >= plugins_.size()) {
        OLOGE("%s index over plugins size");
        return;
    }
    const sp<Plugin>& plugin = plugins_[index];
    EVENT_RET ret;
    {
        std::string traceName;
        if (ScopedTrace::IsTraceEnabled()) {
            traceName = "OnEvent " + plugin->GetName() + " " +
                        (event == nullptr ? std::string("null") : std::to_string(event->eventId));
        }
        ScopedTrace trace(traceName);
        ret = plugin->OnEvent(event);
    }
    if (ret == -1) {
        Leave();
        return;
    }
    if (index + 1 == plugins_.size()) {
        std::shared_ptr<const ListenerSet> listeners = CurrentListeners();
        for (const auto& listener : *listeners) {
            sp<EventLoop> looper = listener->GetLooper();
            if (looper != nullptr) {
                looper->AddEvent(listener, event, 0, false);
            } else {
                listener->OnEvent(event);
            }
        }
        Leave();
        return;
    }
    if (ret == 1) {
        Leave();
        return;
    }
    ProcessPipeline(std::move(event), index + 1);
}

void Pipeline::RegisterPluginListener(sp<Plugin> listener) {
    if (listener == nullptr) {
        return;
    }
    Mutex::Autolock lock(listenersLock_);
    if (listeners_->count(listener) > 0) {
        return;
    }
    auto updated = std::make_shared<ListenerSet>(*listeners_);
    updated->insert(listener);
    listeners_ = std::move(updated);
}

void Pipeline::ReleaseListeners() {
    Mutex::Autolock lock(listenersLock_);
    listeners_ = std::make_shared<const ListenerSet>();
}

std::set<sp<Plugin>> Pipeline::GetListeners() const {
    return *CurrentListeners();
}

std::shared_ptr<const Pipeline::ListenerSet> Pipeline::CurrentListeners() const {
    Mutex::Autolock lock(listenersLock_);
    return listeners_;
}

}  // namespace Orvane
}  // namespace android
