#ifndef ORVANE_PLUGINS_RUN_LOG_MANAGER_H
#define ORVANE_PLUGINS_RUN_LOG_MANAGER_H

#include <cstdint>
#include <string>
#include <vector>

#include <json/json.h>
#include <utils/Mutex.h>

#include "platform/plugin.h"
#include "utils/thread_checker.h"

namespace android {
namespace Orvane {

// Reports how much the system log's rate filter suppressed, and which processes caused it.
// When the log filter is configured (the properties "persist.sys.log_filter_flag",
// "persist.sys.log_time_gap_sec" and "persist.sys.log_max_line" are all set), each run reads the
// statistics of "logcat -S" and inserts the busiest processes, at most 100, as fault event
// 908002001 into "dftFaultEvent". The first run comes 180 s after load, each further one the
// quota document's "LogStatic" minutes (480 when it says nothing) after the last. The command
// gets 30 s to finish its output; then it is killed with everything it started, so a hanging
// log daemon costs the plugin's loop 30 s per run (35 s for one that even SIGKILL cannot end at
// once) and never the loop itself.
// "orvanectl dump plugin RunLogManager run" makes a run now; the period then counts from it.
//
// Threads: the runs happen on the plugin's own loop only (ThreadChecker); Dump comes from a
// binder thread and only reads the schedule under `mutex_`, or posts a run.
class RunLogManager : public Plugin {
public:
    static constexpr uint32_t kEventId = 908002001;
    static constexpr const char* kPipeline = "dftFaultEvent";

    // How long things take; tests shorten them.
    struct Timing {
        // How many times faster than real time the first delay and the periods pass.
        unsigned long speedUp = 1;
        int commandSeconds = 30;  // for "logcat -S" to end its output
    };

    RunLogManager() : RunLogManager(Timing()) {}
    explicit RunLogManager(const Timing& timing) : timing_(timing) {}

    void OnLoad() override;
    // With "run", queues a run now; otherwise prints the schedule, the last run's outcome and the
    // counters.
    void Dump(int fd, const std::vector<std::string>& args) override;

    // One run of the statistics; schedules the next.
    void LogFilterStatics();
    // Fills report["Detail"] from "logcat -S"; true when the statistics' header was found.
    bool GetLogFilterDetail(Json::Value& report);

private:
    // Posts a run after delaySeconds; a periodic run is dropped when a later one was scheduled
    // meanwhile, so that a run on request does not start a second chain of runs.
    void PostRun(unsigned long delaySeconds, bool periodic);
    // The delay until the next run, from the quota document in force.
    unsigned long NextDelaySeconds();
    void SetOutcome(const std::string& outcome);

    const Timing timing_;
    // The period: seconds before the first run, minutes afterwards. The loop's thread only.
    uint32_t period_ = 180;
    ThreadChecker loopThread_;
    Mutex mutex_;
    uint64_t scheduled_ GUARDED_BY(mutex_) = 0;      // the periodic run that is due
    int64_t nextRunNs_ GUARDED_BY(mutex_) = 0;       // when it is due, on the monotonic clock
    uint32_t periodMinutes_ GUARDED_BY(mutex_) = 0;  // 0 until the first run read it
    std::string outcome_ GUARDED_BY(mutex_) = "no run yet";
};

}  // namespace Orvane
}  // namespace android

#endif  // ORVANE_PLUGINS_RUN_LOG_MANAGER_H
