// libFuzzer target: the text of a kernel pressure file (/proc/pressure/cpu, memory, io). What
// parses must be the kernel's format: printed back the way the kernel prints it, it parses to
// the same figures.
#include <cstddef>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <string>

#include "plugins/perf_parser.h"

using android::Orvane::Pressure;
using android::Orvane::PressureLine;
using android::Orvane::PerfParser::ParsePressure;

namespace {

void Print(std::string& out, const char* kind, const PressureLine& line) {
    char text[128];
    snprintf(text, sizeof(text), "%s avg10=%.2f avg60=%.2f avg300=%.2f total=%llu\n", kind, line.avg10, line.avg60,
             line.avg300, static_cast<unsigned long long>(line.totalUs));
    out += text;
}

bool Same(const PressureLine& a, const PressureLine& b) {
    return a.present == b.present && a.avg10 == b.avg10 && a.avg60 == b.avg60 && a.avg300 == b.avg300 &&
           a.totalUs == b.totalUs;
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    Pressure first;
    if (!ParsePressure(std::string(reinterpret_cast<const char*>(data), size), first)) {
        return 0;
    }
    std::string printed;
    Print(printed, "some", first.some);
    if (first.full.present) {
        Print(printed, "full", first.full);
    }
    Pressure again;
    if (!ParsePressure(printed, again) || !Same(first.some, again.some) || !Same(first.full, again.full)) {
        fprintf(stderr, "pressure figures changed when printed back:\n%s", printed.c_str());
        abort();
    }
    return 0;
}
