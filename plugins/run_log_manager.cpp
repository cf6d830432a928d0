#include "plugins/run_log_manager.h"

#include <stdio.h>

#include <algorithm>
#include <cctype>
#include <cerrno>
#include <cstring>
#include <new>

#include "config/event_quota_xml_parser.h"
#include "platform/plugin_context.h"
#include "platform/plugin_factory.h"
#include "plugins/command_pipe.h"
#include "plugins/log_filter_stats.h"
#include "utils/dev_info.h"
#include "utils/json_util.h"
#include "utils/orvane_log.h"
#include "utils/string_util.h"
#include "utils/time_util.h"

namespace android {
namespace Orvane {

ORVANE_REGISTER_PLUGIN(RunLogManager);

namespace {

constexpr uint32_t kDefaultPeriodMinutes = 480;
// A year. A longer period is cut to it, so that the loop's due time in nanoseconds cannot wrap
// around into a run at once.
constexpr uint32_t kMaxPeriodMinutes = 366 * 24 * 60;
// Real statistics are a few kilobytes; a command that writes without end is not read further
// than this, rather than until its deadline.
constexpr size_t kMaxOutputBytes = 1 << 20;
constexpr const char* kFlagKey = "persist.sys.log_filter_flag";
constexpr const char* kTimeGapKey = "persist.sys.log_time_gap_sec";
constexpr const char* kMaxLineKey = "persist.sys.log_max_line";

// The property's value as a number; -1 when unset or when it does not start with one, so that
// a property set to a word leaves the filter as unconfigured as an unset one.
int32_t ReadProperty(PluginContext& context, const char* key) {
    std::string text = context.GetSysProperity(key, "-1");
    size_t digit = text.find_first_not_of(" \t\n\v\f\r");
    if (digit != std::string::npos && (text[digit] == '+' || text[digit] == '-')) {
        ++digit;
    }
    if (digit >= text.size() || !isdigit(static_cast<unsigned char>(text[digit]))) {
        return -1;
    }
    return StringUtil::ConvertInt(text);
}

Json::Value DetailOf(const LogFilterRow& row) {
    Json::Value detail(Json::objectValue);
    detail["PID"] = row.pid;
    detail["UID"] = row.uid;
    detail["ProcessName"] = row.processName;
    detail["TotalFilterLog"] = row.totalFilterLog;
    detail["TotalFilterCnt"] = row.totalFilterCnt;
    detail["MaxFilterCnt"] = row.maxFilterCnt;
    detail["MaxHappenTime"] = TimeUtil::GetTimeDateStr(row.maxHappenTime, "%Y-%m-%d %H:%M:%S");
    return detail;
}

}  // namespace

void RunLogManager::OnLoad() {
    SetName("RunLogManager");
    SetVersion("RunLogManager-1.0");
    if (GetLooper() == nullptr) {
        OLOGE("%s run log manager looper not set");
        return;
    }
    if (GetPluginContext() == nullptr) {
        OLOGE("%s no plugin context, log filter statistics not reported");
        return;
    }
    PostRun(period_ / timing_.speedUp, true);
}

void RunLogManager::PostRun(unsigned long delaySeconds, bool periodic) {
    uint64_t run = 0;
    if (periodic) {
        Mutex::Autolock lock(mutex_);
        run = ++scheduled_;
        nextRunNs_ = TimeUtil::GetNanoSecondSinceSystemStart() + static_cast<int64_t>(delaySeconds) * 1000000000;
    }
    // Weak, so that a run queued for hours never keeps an unloaded plugin alive.
    wp<RunLogManager> weak = this;
    GetLooper()->AddTask(
            [weak, periodic, run] {
                sp<RunLogManager> self = weak.promote();
                if (self == nullptr) {
                    return;
                }
                if (periodic) {
                    Mutex::Autolock lock(self->mutex_);
                    if (run != self->scheduled_) {
                        return;
                    }
                }
                self->LogFilterStatics();
            },
            delaySeconds, false);
}

void RunLogManager::LogFilterStatics() {
    loopThread_.Check(__func__);
    PluginContext* context = GetPluginContext();
    DaemonStats& stats = context->GetStats();
    stats.Add("runlog.runs");
    int32_t flag = ReadProperty(*context, kFlagKey);
    int32_t gap = ReadProperty(*context, kTimeGapKey);
    int32_t lines = ReadProperty(*context, kMaxLineKey);
    if (flag == -1 || gap == -1 || lines == -1) {
        stats.Add("runlog.unconfigured");
        SetOutcome("log filter not configured");
    } else {
        Json::Value report(Json::objectValue);
        report["FilterSecond"] = gap;
        report["FilterLine"] = lines;
        if (GetLogFilterDetail(report) && report.isMember("Detail")) {
            sp<Event> event = new (std::nothrow) Event("LogFilter");
            if (event == nullptr) {
                OLOGI("%s event is null");
            } else {
                event->eventId = kEventId;
                // Storage counts fault events by type and by the day they happened in.
                event->eventType = kEventTypeFault;
                event->happenTime = TimeUtil::GetTimestampSecond();
                event->SetValue("param_list", JsonUtil::ConvertJsonToStr(report));
                if (context->InsertEventToPipeline(kPipeline, event)) {
                    stats.Add("runlog.sent");
                    SetOutcome("sent " + std::to_string(report["Detail"].size()) + " processes");
                } else {
                    OLOGW("%s pipeline %s refused the log filter statistics", kPipeline);
                    stats.Add("runlog.refused");
                    SetOutcome(std::string("refused by the pipeline ") + kPipeline);
                }
            }
        }
    }
    PostRun(NextDelaySeconds(), true);
}

bool RunLogManager::GetLogFilterDetail(Json::Value& report) {
    DaemonStats& stats = GetPluginContext()->GetStats();
    CommandPipe logcat;
    if (!logcat.Start({"logcat", "-S"})) {
        OLOGW_LIMITED("%s open logcat failed");
        stats.Add("runlog.start_failed");
        SetOutcome(std::string("logcat -S could not be started: ") + strerror(errno));
        return false;
    }
    LogFilterStatsParser parser;
    const auto deadline = CommandPipe::Clock::now() + std::chrono::seconds(timing_.commandSeconds);
    char buffer[4096];
    size_t total = 0;
    while (true) {
        ssize_t got = logcat.Read(buffer, sizeof(buffer), deadline);
        if (got == 0) {
            parser.Finish();
            break;
        }
        if (got < 0) {
            // The statistics read so far still count; a line cut off here does not.
            if (errno == ETIMEDOUT) {
                OLOGW_LIMITED("%s logcat -S did not end its output within %d s, killed", timing_.commandSeconds);
                stats.Add("runlog.timed_out");
            } else {
                OLOGW_LIMITED("%s reading the output of logcat -S failed: %s", strerror(errno));
            }
            break;
        }
        if (!parser.Feed(std::string_view(buffer, static_cast<size_t>(got)))) {
            break;
        }
        total += static_cast<size_t>(got);
        if (total >= kMaxOutputBytes) {
            OLOGW_LIMITED("%s logcat -S wrote more than %zu bytes, the rest is not read", kMaxOutputBytes);
            stats.Add("runlog.output_cut");
            break;
        }
    }
    if (!logcat.Close()) {
        stats.Add("runlog.unreaped");
    }

    stats.Add("runlog.rows", parser.Rows().size());
    stats.Add("runlog.skipped_lines", parser.SkippedLines());
    stats.Add("runlog.overlong_lines", parser.OverlongLines());
    for (const LogFilterRow& row : parser.Rows()) {
        report["Detail"].append(DetailOf(row));
    }
    if (!parser.HeaderFound()) {
        stats.Add("runlog.no_header");
        SetOutcome("no statistics header in the output of logcat -S");
    } else if (parser.Rows().empty()) {
        SetOutcome("no process rows after the statistics header");
    }
    return parser.HeaderFound();
}

unsigned long RunLogManager::NextDelaySeconds() {
    // The directory storage reads the quotas from: the parser keeps one document loaded, and
    // asking it for another would read it anew and reset storage's running log counts.
    EventQuotaXmlParser::SummaryQuota summary =
            EventQuotaXmlParser::getInstance()->GetSummaryQuota(*GetPluginContext(), DevInfo::GetQuorVersion());
    period_ = summary.logStatic == 0 ? kDefaultPeriodMinutes : std::min(summary.logStatic, kMaxPeriodMinutes);
    {
        Mutex::Autolock lock(mutex_);
        periodMinutes_ = period_;
    }
    return static_cast<unsigned long>(period_) * 60 / timing_.speedUp;
}

void RunLogManager::SetOutcome(const std::string& outcome) {
    Mutex::Autolock lock(mutex_);
    outcome_ = outcome;
}

void RunLogManager::Dump(int fd, const std::vector<std::string>& args) {
    if (!args.empty() && args[0] == "run") {
        if (GetLooper() == nullptr || GetPluginContext() == nullptr) {
            dprintf(fd, "not loaded, no run\n");
            return;
        }
        PostRun(0, false);
        dprintf(fd, "run queued\n");
        return;
    }
    PluginContext* context = GetPluginContext();
    auto counter = [context](const char* name) {
        return static_cast<unsigned long long>(context != nullptr ? context->GetStats().Value(name) : 0);
    };
    Mutex::Autolock lock(mutex_);
    std::string period = periodMinutes_ == 0 ? "first run after load" : std::to_string(periodMinutes_) + " min";
    std::string next = "none scheduled";
    if (nextRunNs_ != 0) {
        int64_t leftNs = std::max<int64_t>(nextRunNs_ - TimeUtil::GetNanoSecondSinceSystemStart(), 0);
        next = "in " + std::to_string(leftNs / 1000000000) + " s";
    }
    dprintf(fd, "%s: period %s; next run %s; last run: %s\n", GetVersion().c_str(), period.c_str(), next.c_str(),
            outcome_.c_str());
    dprintf(fd, "runs %llu, events sent %llu, rows %llu, skipped lines %llu, overlong lines %llu, time-outs %llu\n",
            counter("runlog.runs"), counter("runlog.sent"), counter("runlog.rows"), counter("runlog.skipped_lines"),
            counter("runlog.overlong_lines"), counter("runlog.timed_out"));
}

}  // namespace Orvane
}  // namespace android
