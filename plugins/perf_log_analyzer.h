#ifndef ORVANE_PLUGINS_PERF_LOG_ANALYZER_H
#define ORVANE_PLUGINS_PERF_LOG_ANALYZER_H

#include <cstdint>
#include <map>
#include <memory>
#include <string>
#include <vector>

#include <utils/Mutex.h>

#include "config/perf_config_xml_parser.h"
#include "platform/plugin.h"
#include "plugins/perf_parser.h"
#include "plugins/process_sampler.h"
#include "plugins/psi_monitor.h"

namespace android {
namespace Orvane {

// Turns sustained CPU, memory or I/O pressure into fault events. At load it arms the kernel's
// pressure stall triggers that "perf_config.xml" asks for and waits for them on a thread of its
// own (PsiMonitor); a calm system costs nothing. When a trigger fires it reads the resource's
// pressure figures and ranks the processes by the resource's measure (ProcessSampler), and
// inserts a fault event (909001001 cpu, 909001002 memory, 909001003 io) whose "param_list" holds
// both into "dftFaultEvent". The resource's cool-down bounds how often that happens. Where the
// kernel has no pressure files or refuses the triggers it logs one warning and stays idle.
// A configuration update (event 104) rereads the document and re-arms when it changed.
//
// Threads: the configuration, the sampling and the events run on the plugin's loop (the shared
// work loop when it has none), never on a pipeline's; the CPU sample's second reading is a task
// due a second later, so the loop is never blocked. The watcher thread only posts to that loop.
// `monitorLock_` serialises arming with unloading; `mutex_` guards what Dump prints.
class PerfLogAnalyzer : public Plugin, public EventListener {
public:
    static constexpr uint32_t kCpuEventId = 909001001;
    static constexpr uint32_t kMemoryEventId = 909001002;
    static constexpr uint32_t kIoEventId = 909001003;
    static constexpr const char* kPipeline = "dftFaultEvent";

    PerfLogAnalyzer() : PerfLogAnalyzer("/proc/pressure/", "/proc/") {}
    // Other folders than the kernel's, for tests and benchmarks.
    PerfLogAnalyzer(const std::string& pressureDir, const std::string& procDir);
    ~PerfLogAnalyzer() override;

    void OnLoad() override;
    // Disarms the triggers; nothing is reported afterwards.
    void OnUnload() override;
    // The triggers, the last pressure figures and the events sent, per resource.
    void Dump(int fd, const std::vector<std::string>& args) override;
    // The configuration update (event 104).
    void OnUnorderedEvent(sp<Event> event) override;

    // One report, from the trigger's fire to its second sample.
    struct Report {
        PerfResource resource = PerfResource::kCpu;
        std::string trigger;
        Pressure pressure;
        std::vector<ProcessValue> before;
        int64_t beforeNs = 0;  // when `before` was read
        int64_t sampleMs = 0;  // how long the growth was measured over
    };
    // The fault event of a report and its busiest processes.
    static sp<Event> BuildEvent(const Report& report, const std::vector<TopProcess>& top);

private:
    // What the dump shows of one resource.
    struct ResourceStatus {
        std::vector<std::string> triggers;  // each "<text> armed" or "<text> refused"
        uint32_t coolDownSec = 0;
        uint32_t topCount = 0;
        Pressure last;  // of the last event
    };
    sp<EventLoop> WorkLoop();
    void PostToLoop(std::function<void(PerfLogAnalyzer&)> work);
    // Rereads the document and, when it changed, re-arms the triggers.
    void Configure();
    void OnFire(const std::string& resource, const std::string& trigger);
    void StartReport(const std::string& resource, const std::string& trigger);
    void FinishReport(const std::shared_ptr<Report>& report);
    const PerfResourceConfig* FindSettings(const std::string& resource) const;
    bool ReadPressure(PerfResource resource, Pressure& out);
    std::string StatName(const char* what, const std::string& resource) const;

    const std::string pressureDir_;
    const ProcessSampler sampler_;
    PerfConfigDocument config_;  // the loop's

    Mutex monitorLock_;
    PsiMonitor monitor_ GUARDED_BY(monitorLock_);
    bool unloaded_ GUARDED_BY(monitorLock_) = false;

    mutable Mutex mutex_;
    std::string state_ GUARDED_BY(mutex_);
    std::map<std::string, ResourceStatus> status_ GUARDED_BY(mutex_);
};

}  // namespace Orvane
}  // namespace android

#endif  // ORVANE_PLUGINS_PERF_LOG_ANALYZER_H
