#ifndef ORVANE_PLUGINS_PROCESS_SAMPLER_H
#define ORVANE_PLUGINS_PROCESS_SAMPLER_H

#include <sys/types.h>

#include <cstdint>
#include <string>
#include <vector>

namespace android {
namespace Orvane {

// The resources whose pressure the kernel reports, each with the measure that ranks processes
// by their share in it.
enum class PerfResource { kCpu, kMemory, kIo };

// One process and the raw figure of a measure: CPU clock ticks, resident pages or storage bytes.
struct ProcessValue {
    int pid = 0;
    uint64_t value = 0;
};

// A process of an event's list, its value in the unit of the resource's measure.
struct TopProcess {
    int pid = 0;
    uid_t uid = 0;
    std::string name;
    uint64_t value = 0;
};

// Reads the per-process figures of /proc that rank processes for a resource:
//   cpu     CPU time used during the sample, from /proc/PID/stat, in milliseconds;
//   memory  resident memory at the end of the sample, from /proc/PID/statm, in kB;
//   io      bytes read from and written to storage during the sample, from /proc/PID/io
//           (readable only for processes the daemon may trace; the others are left out).
// Processes that end while they are read, or whose rows do not parse, are left out.
// Stateless apart from its folder; any thread.
class ProcessSampler {
public:
    explicit ProcessSampler(std::string procDir = "/proc/");

    static const char* ResourceName(PerfResource resource);
    static bool ResourceFromName(const std::string& name, PerfResource& resource);
    // The name of the measure in an event: "cpu_ms", "rss_kb" or "io_bytes".
    static const char* MeasureName(PerfResource resource);
    // Cpu and io rank by the growth over the sample; memory by the level at its end.
    static bool MeasuresGrowth(PerfResource resource) { return resource != PerfResource::kMemory; }

    // The raw figure of every readable process now, in pid order.
    std::vector<ProcessValue> Sample(PerfResource resource) const;
    // The n processes with the highest values, highest first (equal values: lower pid first),
    // with their uid and name. For a growth measure the value is what grew between the two
    // samples; otherwise `before` is not used. Processes without a share (value 0) and those
    // that ended since are left out.
    std::vector<TopProcess> Top(PerfResource resource, const std::vector<ProcessValue>& before,
                                const std::vector<ProcessValue>& after, size_t n) const;

private:
    uint64_t ToUnit(PerfResource resource, uint64_t raw) const;
    // Uid and name of a process; false when it has ended.
    bool Describe(int pid, TopProcess& out) const;

    const std::string procDir_;
    const uint64_t ticksPerSecond_;
    const uint64_t pageKb_;
};

}  // namespace Orvane
}  // namespace android

#endif  // ORVANE_PLUGINS_PROCESS_SAMPLER_H
