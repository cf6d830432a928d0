// libFuzzer target: rows of /proc/PID/stat, statm and io as a process can shape them (its name
// is its own choice) or a damaged file holds them. The first byte picks the parser.
#include <cstddef>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <string>

#include "plugins/perf_parser.h"

namespace PerfParser = android::Orvane::PerfParser;

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    if (size == 0) {
        return 0;
    }
    std::string row(reinterpret_cast<const char*>(data + 1), size - 1);
    uint64_t value = 0;
    switch (data[0] % 3) {
        case 0: {
            std::string comm;
            // The name lies inside the row, between its first "(" and its last ")".
            if (PerfParser::ParseStat(row, value, comm) && row.find("(" + comm + ")") == std::string::npos) {
                fprintf(stderr, "name \"%s\" is not in the row\n", comm.c_str());
                abort();
            }
            break;
        }
        case 1:
            PerfParser::ParseStatm(row, value);
            break;
        default:
            PerfParser::ParseIo(row, value);
            break;
    }
    return 0;
}
