// libFuzzer target: the output of "logcat -S" as the log daemon (or anything else named
// "logcat") may print it. The first byte picks where the output is cut into pieces; the rows must
// not depend on how the output arrives.
#include <cstddef>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <string_view>

#include "plugins/log_filter_stats.h"

using android::Orvane::LogFilterRow;
using android::Orvane::LogFilterStatsParser;

namespace {

bool SameRows(const LogFilterStatsParser& a, const LogFilterStatsParser& b) {
    if (a.Rows().size() != b.Rows().size() || a.HeaderFound() != b.HeaderFound()) {
        return false;
    }
    for (size_t i = 0; i < a.Rows().size(); ++i) {
        const LogFilterRow& x = a.Rows()[i];
        const LogFilterRow& y = b.Rows()[i];
        if (x.pid != y.pid || x.uid != y.uid || x.processName != y.processName || x.maxHappenTime != y.maxHappenTime ||
            x.totalFilterLog != y.totalFilterLog || x.totalFilterCnt != y.totalFilterCnt ||
            x.maxFilterCnt != y.maxFilterCnt) {
            return false;
        }
    }
    return true;
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    if (size == 0) {
        return 0;
    }
    const size_t pieceSize = data[0] + 1;
    std::string_view output(reinterpret_cast<const char*>(data + 1), size - 1);

    LogFilterStatsParser whole;
    whole.Feed(output);
    whole.Finish();

    LogFilterStatsParser pieces;
    for (size_t at = 0; at < output.size() && pieces.Feed(output.substr(at, pieceSize)); at += pieceSize) {
    }
    pieces.Finish();

    if (whole.Rows().size() > LogFilterStatsParser::kMaxRows || !SameRows(whole, pieces)) {
        fprintf(stderr, "rows depend on the pieces (%zu and %zu rows) or exceed the limit\n", whole.Rows().size(),
                pieces.Rows().size());
        abort();
    }
    for (const LogFilterRow& row : whole.Rows()) {
        if (row.processName.empty() || row.processName.size() > LogFilterStatsParser::kMaxLineBytes) {
            abort();
        }
    }
    LogFilterRow row;
    LogFilterStatsParser::ParseRow(output, row);
    return 0;
}
