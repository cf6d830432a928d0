#include "plugins/process_sampler.h"

#include <dirent.h>
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cstring>
#include <memory>

#include <android-base/unique_fd.h>

#include "plugins/cmd_processor.h"
#include "plugins/perf_parser.h"

namespace android {
namespace Orvane {
namespace {

// A row of /proc/PID is far shorter; a longer file is not one.
constexpr size_t kMaxRowBytes = 4096;
// Names in events are cut to what the catalogue allows.
constexpr size_t kMaxNameBytes = 127;

const char* RowFile(PerfResource resource) {
    switch (resource) {
        case PerfResource::kCpu:
            return "/stat";
        case PerfResource::kMemory:
            return "/statm";
        case PerfResource::kIo:
            return "/io";
    }
    return "/stat";
}

// One read is how the kernel hands over a row; loop anyway for files that come in pieces.
bool ReadRow(const std::string& path, std::string& out) {
    android::base::unique_fd fd(open(path.c_str(), O_RDONLY | O_CLOEXEC));
    if (fd < 0) {
        return false;
    }
    char buffer[kMaxRowBytes];
    size_t size = 0;
    for (;;) {
        ssize_t got = TEMP_FAILURE_RETRY(read(fd.get(), buffer + size, sizeof(buffer) - size));
        if (got < 0) {
            return false;
        }
        if (got == 0) {
            break;
        }
        size += static_cast<size_t>(got);
        if (size == sizeof(buffer)) {
            return false;
        }
    }
    out.assign(buffer, size);
    return true;
}

bool IsPid(const char* name) {
    if (*name == '\0' || strlen(name) > 9) {
        return false;
    }
    for (const char* c = name; *c != '\0'; ++c) {
        if (*c < '0' || *c > '9') {
            return false;
        }
    }
    return true;
}

// Process names are chosen by the processes themselves: only printable ASCII goes into events.
std::string CleanName(const std::string& raw) {
    std::string name = raw.substr(0, kMaxNameBytes);
    for (char& c : name) {
        if (c < 0x20 || c > 0x7e) {
            c = '?';
        }
    }
    return name;
}

// Equal values keep a stable order (lower pid first), so that a list never depends on how
// /proc happened to be listed.
bool HigherFirst(const ProcessValue& a, const ProcessValue& b) {
    return a.value != b.value ? a.value > b.value : a.pid < b.pid;
}

}  // namespace

ProcessSampler::ProcessSampler(std::string procDir)
    : procDir_(std::move(procDir)),
      ticksPerSecond_(static_cast<uint64_t>(std::max(1L, sysconf(_SC_CLK_TCK)))),
      pageKb_(static_cast<uint64_t>(std::max(1024L, sysconf(_SC_PAGESIZE))) / 1024) {}

const char* ProcessSampler::ResourceName(PerfResource resource) {
    switch (resource) {
        case PerfResource::kCpu:
            return "cpu";
        case PerfResource::kMemory:
            return "memory";
        case PerfResource::kIo:
            return "io";
    }
    return "cpu";
}

bool ProcessSampler::ResourceFromName(const std::string& name, PerfResource& resource) {
    for (PerfResource candidate : {PerfResource::kCpu, PerfResource::kMemory, PerfResource::kIo}) {
        if (name == ResourceName(candidate)) {
            resource = candidate;
            return true;
        }
    }
    return false;
}

const char* ProcessSampler::MeasureName(PerfResource resource) {
    switch (resource) {
        case PerfResource::kCpu:
            return "cpu_ms";
        case PerfResource::kMemory:
            return "rss_kb";
        case PerfResource::kIo:
            return "io_bytes";
    }
    return "cpu_ms";
}

std::vector<ProcessValue> ProcessSampler::Sample(PerfResource resource) const {
    std::vector<ProcessValue> values;
    std::unique_ptr<DIR, int (*)(DIR*)> dir(opendir(procDir_.c_str()), closedir);
    if (dir == nullptr) {
        return values;
    }
    std::string row;
    std::string comm;
    while (struct dirent* entry = readdir(dir.get())) {
        if (!IsPid(entry->d_name) || !ReadRow(procDir_ + entry->d_name + RowFile(resource), row)) {
            continue;  // not a process, or one that has just ended
        }
        ProcessValue value;
        value.pid = atoi(entry->d_name);
        bool parsed = false;
        switch (resource) {
            case PerfResource::kCpu:
                parsed = PerfParser::ParseStat(row, value.value, comm);
                break;
            case PerfResource::kMemory:
                parsed = PerfParser::ParseStatm(row, value.value);
                break;
            case PerfResource::kIo:
                parsed = PerfParser::ParseIo(row, value.value);
                break;
        }
        if (parsed) {
            values.push_back(value);
        }
    }
    std::sort(values.begin(), values.end(), [](const ProcessValue& a, const ProcessValue& b) { return a.pid < b.pid; });
    return values;
}

std::vector<TopProcess> ProcessSampler::Top(PerfResource resource, const std::vector<ProcessValue>& before,
                                            const std::vector<ProcessValue>& after, size_t n) const {
    std::vector<ProcessValue> ranked;
    if (MeasuresGrowth(resource)) {
        // Both samples are in pid order: walk them together. A counter that went down belongs
        // to a new process that took a freed pid, and its growth is unknown.
        auto old = before.begin();
        for (const ProcessValue& now : after) {
            while (old != before.end() && old->pid < now.pid) {
                ++old;
            }
            if (old != before.end() && old->pid == now.pid && now.value > old->value) {
                ranked.push_back({now.pid, now.value - old->value});
            }
        }
    } else {
        std::copy_if(after.begin(), after.end(), std::back_inserter(ranked),
                     [](const ProcessValue& v) { return v.value > 0; });
    }
    std::sort(ranked.begin(), ranked.end(), HigherFirst);
    std::vector<TopProcess> top;
    for (const ProcessValue& candidate : ranked) {
        if (top.size() >= n) {
            break;
        }
        TopProcess process;
        if (Describe(candidate.pid, process)) {
            process.value = ToUnit(resource, candidate.value);
            top.push_back(process);
        }
    }
    return top;
}

uint64_t ProcessSampler::ToUnit(PerfResource resource, uint64_t raw) const {
    switch (resource) {
        case PerfResource::kCpu:
            return raw > UINT64_MAX / 1000 ? UINT64_MAX : raw * 1000 / ticksPerSecond_;
        case PerfResource::kMemory:
            return raw > UINT64_MAX / pageKb_ ? UINT64_MAX : raw * pageKb_;
        case PerfResource::kIo:
            return raw;
    }
    return raw;
}

bool ProcessSampler::Describe(int pid, TopProcess& out) const {
    std::string folder = procDir_ + std::to_string(pid);
    struct stat st;
    if (stat(folder.c_str(), &st) != 0) {
        return false;
    }
    out.pid = pid;
    out.uid = st.st_uid;
    // The command line's first argument is the name a developer knows (an app's package, a
    // daemon's path); kernel threads have none and go by their command name.
    std::string name = CmdProcessor::GetProcNameByPid(pid).c_str();
    std::string row;
    uint64_t ticks = 0;
    if (name.empty() && ReadRow(folder + "/stat", row) && PerfParser::ParseStat(row, ticks, name)) {
        name = "[" + name + "]";
    }
    out.name = CleanName(name);
    return true;
}

}  // namespace Orvane
}  // namespace android
