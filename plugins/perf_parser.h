#ifndef ORVANE_PLUGINS_PERF_PARSER_H
#define ORVANE_PLUGINS_PERF_PARSER_H

#include <cstdint>
#include <string>

namespace android {
namespace Orvane {

// One line of a kernel pressure file: the share of time, in percent, in which some (or all)
// tasks stalled on the resource, averaged over 10, 60 and 300 seconds, and the total stall time
// in microseconds since boot.
struct PressureLine {
    bool present = false;
    double avg10 = 0;
    double avg60 = 0;
    double avg300 = 0;
    uint64_t totalUs = 0;
};

// The text of /proc/pressure/<resource>. Kernels before 5.13 have no "full" line for cpu.
struct Pressure {
    PressureLine some;
    PressureLine full;
};

// Parsers of the kernel's text for the performance monitor. Pure functions of their input, any
// thread; they accept what the kernel writes and refuse everything else, whatever the bytes.
namespace PerfParser {

// False unless the text has a well-formed "some" line. Lines of other kinds and fields after
// "total" are ignored, so that additions of later kernels do not break the reading.
bool ParsePressure(const std::string& text, Pressure& out);
// What arms a trigger when written to a pressure file: "some 150000 2000000".
std::string TriggerText(bool full, uint32_t stallUs, uint32_t windowUs);

// /proc/PID/stat: the CPU time used so far (user plus system, in clock ticks) and the command
// name, which may itself hold blanks and parentheses.
bool ParseStat(const std::string& text, uint64_t& cpuTicks, std::string& comm);
// /proc/PID/statm: the resident set in pages.
bool ParseStatm(const std::string& text, uint64_t& residentPages);
// /proc/PID/io: bytes the process made the storage read and write (read_bytes + write_bytes).
bool ParseIo(const std::string& text, uint64_t& bytes);

}  // namespace PerfParser
}  // namespace Orvane
}  // namespace android

#endif  // ORVANE_PLUGINS_PERF_PARSER_H
