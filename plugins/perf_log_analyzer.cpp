#include "plugins/perf_log_analyzer.h"

#include <stdio.h>

#include <android-base/strings.h>
#include <json/json.h>

#include "platform/plugin_context.h"
#include "platform/plugin_factory.h"
#include "utils/json_util.h"
#include "utils/orvane_log.h"
#include "utils/time_util.h"

namespace android {
namespace Orvane {

ORVANE_REGISTER_PLUGIN(PerfLogAnalyzer);

namespace {

constexpr uint32_t kConfigUpdateEventId = 104;
// CPU time and I/O grow over this many seconds before processes are ranked.
constexpr unsigned long kSampleSeconds = 1;

uint32_t EventIdOf(PerfResource resource) {
    switch (resource) {
        case PerfResource::kCpu:
            return PerfLogAnalyzer::kCpuEventId;
        case PerfResource::kMemory:
            return PerfLogAnalyzer::kMemoryEventId;
        case PerfResource::kIo:
            return PerfLogAnalyzer::kIoEventId;
    }
    return PerfLogAnalyzer::kCpuEventId;
}

Json::Value PressureJson(const PressureLine& line) {
    Json::Value value(Json::objectValue);
    value["avg10"] = line.avg10;
    value["avg60"] = line.avg60;
    value["avg300"] = line.avg300;
    value["total"] = Json::UInt64(line.totalUs);
    return value;
}

std::string PressureText(const char* kind, const PressureLine& line) {
    if (!line.present) {
        return "";
    }
    char text[160];
    snprintf(text, sizeof(text), " %s avg10=%.2f avg60=%.2f avg300=%.2f total=%llu", kind, line.avg10, line.avg60,
             line.avg300, static_cast<unsigned long long>(line.totalUs));
    return text;
}

}  // namespace

PerfLogAnalyzer::PerfLogAnalyzer(const std::string& pressureDir, const std::string& procDir)
    : EventListener("PerfLogAnalyzer"), pressureDir_(pressureDir), sampler_(procDir), monitor_(pressureDir) {}

PerfLogAnalyzer::~PerfLogAnalyzer() {
    // The watcher calls into this object: it must end before the members do.
    Mutex::Autolock lock(monitorLock_);
    monitor_.Stop();
}

void PerfLogAnalyzer::OnLoad() {
    SetName("PerfLogAnalyzer");
    SetVersion("PerfLogAnalyzer-1.0");
    {
        Mutex::Autolock lock(mutex_);
        state_ = "loading";
    }
    PluginContext* context = GetPluginContext();
    if (context == nullptr) {
        OLOGE("%s no plugin context, performance not watched");
        return;
    }
    AddListenerInfo(kEventTypeControl, kConfigUpdateEventId);
    context->RegisterUnorderedEventListener(this);
    PostToLoop([](PerfLogAnalyzer& self) { self.Configure(); });
}

void PerfLogAnalyzer::OnUnload() {
    Mutex::Autolock lock(monitorLock_);
    unloaded_ = true;
    monitor_.Stop();
}

void PerfLogAnalyzer::OnUnorderedEvent(sp<Event> event) {
    if (event != nullptr && event->eventId == kConfigUpdateEventId) {
        PostToLoop([](PerfLogAnalyzer& self) { self.Configure(); });
    }
}

sp<EventLoop> PerfLogAnalyzer::WorkLoop() {
    sp<EventLoop> loop = GetLooper();
    PluginContext* context = GetPluginContext();
    return loop != nullptr || context == nullptr ? loop : context->GetSharedWorkLoop();
}

void PerfLogAnalyzer::PostToLoop(std::function<void(PerfLogAnalyzer&)> work) {
    sp<EventLoop> loop = WorkLoop();
    if (loop == nullptr) {
        OLOGE("%s no loop to run on");
        return;
    }
    // Weak, so that queued work never keeps an unloaded plugin alive.
    wp<PerfLogAnalyzer> weak = this;
    loop->AddTask([weak, work] {
        sp<PerfLogAnalyzer> self = weak.promote();
        if (self != nullptr) {
            work(*self);
        }
    });
}

void PerfLogAnalyzer::Configure() {
    PluginContext* context = GetPluginContext();
    if (!config_.Refresh(*context)) {
        return;
    }
    std::vector<PsiTriggerSpec> specs;
    std::map<std::string, ResourceStatus> status;
    for (const PerfResourceConfig& resource : config_.Resources()) {
        for (bool full : {false, true}) {
            uint32_t stallUs = full ? resource.fullStallUs : resource.someStallUs;
            if (stallUs != 0) {
                specs.push_back({resource.name, PerfParser::TriggerText(full, stallUs, resource.windowUs),
                                 resource.windowUs, resource.coolDownSec});
            }
        }
        status[resource.name].coolDownSec = resource.coolDownSec;
        status[resource.name].topCount = resource.topCount;
    }
    std::vector<std::string> results;
    {
        Mutex::Autolock lock(monitorLock_);
        if (unloaded_) {
            return;
        }
        monitor_.Stop();
        results = monitor_.Arm(specs);
        // The monitor is stopped before this object goes, so the raw pointer stays valid.
        monitor_.Start([this](const std::string& resource, const std::string& trigger) { OnFire(resource, trigger); },
                       context->GetStats());
    }
    size_t armed = 0;
    std::vector<std::string> failures;
    for (size_t i = 0; i < specs.size(); ++i) {
        bool refused = !results[i].empty();
        status[specs[i].resource].triggers.push_back(specs[i].text + (refused ? " refused" : " armed"));
        if (refused) {
            failures.push_back(results[i]);
        } else {
            ++armed;
        }
    }
    context->GetStats().Add("perf.trigger_refused", failures.size());

    std::string state;
    if (config_.Path().empty()) {
        state = "idle, no " + std::string(PerfConfigXmlParser::kFileName);
        OLOGW("%s no %s in %s or %s, performance not watched", PerfConfigXmlParser::kFileName,
              context->GetCloudConfigDir().c_str(), context->GetConfigDir().c_str());
    } else if (specs.empty()) {
        state = "idle, no valid resource in " + config_.Path();
        OLOGW("%s no valid resource in %s, performance not watched", config_.Path().c_str());
    } else if (armed == 0) {
        state = "idle, pressure stall triggers unavailable";
        OLOGW("%s pressure stall triggers unavailable, performance not watched: %s",
              android::base::Join(failures, "; ").c_str());
    } else {
        state = "watching " + std::to_string(armed) + " of " + std::to_string(specs.size()) + " triggers of " +
                config_.Path();
        if (!failures.empty()) {
            OLOGW("%s triggers refused, watching the others: %s", android::base::Join(failures, "; ").c_str());
        }
    }
    OLOGI("%s %s", state.c_str());
    Mutex::Autolock lock(mutex_);
    state_ = state;
    // The last figures of a resource that stays watched are kept.
    for (auto& entry : status) {
        auto old = status_.find(entry.first);
        if (old != status_.end()) {
            entry.second.last = old->second.last;
        }
    }
    status_ = std::move(status);
}

void PerfLogAnalyzer::OnFire(const std::string& resource, const std::string& trigger) {
    GetPluginContext()->GetStats().Add(StatName("fired", resource));
    PostToLoop([resource, trigger](PerfLogAnalyzer& self) { self.StartReport(resource, trigger); });
}

const PerfResourceConfig* PerfLogAnalyzer::FindSettings(const std::string& resource) const {
    for (const PerfResourceConfig& settings : config_.Resources()) {
        if (settings.name == resource) {
            return &settings;
        }
    }
    return nullptr;
}

void PerfLogAnalyzer::StartReport(const std::string& resource, const std::string& trigger) {
    {
        Mutex::Autolock lock(monitorLock_);
        if (unloaded_) {
            return;
        }
    }
    auto report = std::make_shared<Report>();
    if (FindSettings(resource) == nullptr || !ProcessSampler::ResourceFromName(resource, report->resource)) {
        return;  // a report that a new configuration overtook
    }
    report->trigger = trigger;
    ReadPressure(report->resource, report->pressure);
    if (!ProcessSampler::MeasuresGrowth(report->resource)) {
        FinishReport(report);
        return;
    }
    report->before = sampler_.Sample(report->resource);
    report->beforeNs = TimeUtil::GetNanoSecondSinceSystemStart();
    sp<EventLoop> loop = WorkLoop();
    wp<PerfLogAnalyzer> weak = this;
    loop->AddTask(
            [weak, report] {
                sp<PerfLogAnalyzer> self = weak.promote();
                if (self != nullptr) {
                    self->FinishReport(report);
                }
            },
            kSampleSeconds, false);
}

void PerfLogAnalyzer::FinishReport(const std::shared_ptr<Report>& report) {
    PluginContext* context = GetPluginContext();
    const char* name = ProcessSampler::ResourceName(report->resource);
    const PerfResourceConfig* settings = FindSettings(name);
    if (settings == nullptr) {
        return;
    }
    std::vector<ProcessValue> after = sampler_.Sample(report->resource);
    // The loop may run the second reading late: the event tells over how long the growth was.
    report->sampleMs = (TimeUtil::GetNanoSecondSinceSystemStart() - report->beforeNs) / 1000000;
    std::vector<TopProcess> top = sampler_.Top(report->resource, report->before, after, settings->topCount);
    sp<Event> event = BuildEvent(*report, top);
    if (!context->InsertEventToPipeline(kPipeline, event)) {
        OLOGW_LIMITED("%s pipeline %s refused the %s pressure event", kPipeline, name);
        context->GetStats().Add(StatName("refused", name));
        return;
    }
    context->GetStats().Add(StatName("sent", name));
    OLOGI("%s %s pressure event %u sent:%s%s", name, event->eventId,
          PressureText("some", report->pressure.some).c_str(), PressureText("full", report->pressure.full).c_str());
    Mutex::Autolock lock(mutex_);
    status_[name].last = report->pressure;
}

bool PerfLogAnalyzer::ReadPressure(PerfResource resource, Pressure& out) {
    std::string path = pressureDir_ + ProcessSampler::ResourceName(resource);
    std::string text;
    if (FileUtil::FileExists(path) && FileUtil::LoadStringFromFile(path, text) &&
        PerfParser::ParsePressure(text, out)) {
        return true;
    }
    // The event still goes out: the processes are evidence on their own.
    OLOGW_LIMITED("%s %s unreadable or not pressure figures, event sent without them", path.c_str());
    GetPluginContext()->GetStats().Add("perf.pressure_unreadable");
    return false;
}

sp<Event> PerfLogAnalyzer::BuildEvent(const Report& report, const std::vector<TopProcess>& top) {
    Json::Value root(Json::objectValue);
    root["resource"] = ProcessSampler::ResourceName(report.resource);
    root["trigger"] = report.trigger;
    if (report.pressure.some.present) {
        root["some"] = PressureJson(report.pressure.some);
    }
    if (report.pressure.full.present) {
        root["full"] = PressureJson(report.pressure.full);
    }
    root["measure"] = ProcessSampler::MeasureName(report.resource);
    if (ProcessSampler::MeasuresGrowth(report.resource)) {
        root["sampleMs"] = Json::Int64(report.sampleMs);
    }
    Json::Value list(Json::arrayValue);
    for (const TopProcess& process : top) {
        Json::Value entry(Json::objectValue);
        entry["pid"] = process.pid;
        entry["uid"] = Json::UInt(process.uid);
        entry["name"] = process.name;
        entry["value"] = Json::UInt64(process.value);
        list.append(entry);
    }
    root["top"] = list;
    sp<Event> event = new Event("PerfLogAnalyzer");
    event->eventType = kEventTypeFault;
    event->eventId = EventIdOf(report.resource);
    event->happenTime = TimeUtil::GetTimestampSecond();
    event->SetValue(kKeyParamList, JsonUtil::ConvertJsonToStr(root));
    return event;
}

std::string PerfLogAnalyzer::StatName(const char* what, const std::string& resource) const {
    return std::string("perf.") + what + "." + resource;
}

void PerfLogAnalyzer::Dump(int fd, const std::vector<std::string>& args) {
    (void)args;
    DaemonStats* stats = GetPluginContext() != nullptr ? &GetPluginContext()->GetStats() : nullptr;
    Mutex::Autolock lock(mutex_);
    dprintf(fd, "%s: %s\n", GetVersion().c_str(), state_.c_str());
    for (const auto& entry : status_) {
        const std::string& resource = entry.first;
        const ResourceStatus& status = entry.second;
        dprintf(fd, "%s: triggers %s; cool-down %u s; top %u; fired %llu; events sent %llu\n", resource.c_str(),
                android::base::Join(status.triggers, ", ").c_str(), status.coolDownSec, status.topCount,
                static_cast<unsigned long long>(stats != nullptr ? stats->Value(StatName("fired", resource)) : 0),
                static_cast<unsigned long long>(stats != nullptr ? stats->Value(StatName("sent", resource)) : 0));
        std::string last = PressureText("some", status.last.some) + PressureText("full", status.last.full);
        dprintf(fd, "%s: last pressure%s\n", resource.c_str(), last.empty() ? " none yet" : last.c_str());
    }
}

}  // namespace Orvane
}  // namespace android
