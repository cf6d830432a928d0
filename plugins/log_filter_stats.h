#ifndef ORVANE_PLUGINS_LOG_FILTER_STATS_H
#define ORVANE_PLUGINS_LOG_FILTER_STATS_H

#include <cstddef>
#include <cstdint>
#include <string>
#include <string_view>
#include <vector>

namespace android {
namespace Orvane {

// One process row of the log daemon's filter statistics: "%d/%d %s %d %d %d %d".
struct LogFilterRow {
    int32_t pid = 0;
    int32_t uid = 0;
    std::string processName;
    int32_t totalFilterLog = 0;
    int32_t totalFilterCnt = 0;
    int32_t maxFilterCnt = 0;
    int32_t maxHappenTime = 0;  // seconds since the epoch
};

// Reads the output of "logcat -S" piece by piece as it arrives. Lines hold at most 255 bytes
// besides their line feed; a longer line is no statistics line at all and is passed over whole,
// so that no part of it is taken for the header or a row. Every line up to and including the
// first that contains "Log Filter Top PIDs" is passed over; each later line in the row format
// becomes a row, any other is skipped; reading is done after 100 rows. Memory stays bounded
// whatever the output: one line and the rows.
//
// Threads: one object belongs to one reader.
class LogFilterStatsParser {
public:
    static constexpr size_t kMaxLineBytes = 255;
    static constexpr size_t kMaxRows = 100;
    static constexpr std::string_view kHeader = "Log Filter Top PIDs";

    // Scans one line as "%d/%d %s %d %d %d %d" would, up to its first NUL byte; text after the
    // seventh item is ignored. A number that does not fit 32 bits makes the line no row.
    static bool ParseRow(std::string_view line, LogFilterRow& row);

    LogFilterStatsParser() { line_.reserve(kMaxLineBytes); }

    // Takes the next piece of output; false once 100 rows are in and nothing more is wanted.
    bool Feed(std::string_view data);
    // The end of the output: a last line without a line feed still counts.
    void Finish();

    bool HeaderFound() const { return headerFound_; }
    bool Full() const { return rows_.size() >= kMaxRows; }
    const std::vector<LogFilterRow>& Rows() const { return rows_; }
    // Lines after the header that are not rows.
    uint64_t SkippedLines() const { return skippedLines_; }
    // Lines longer than 255 bytes, wherever they stand.
    uint64_t OverlongLines() const { return overlongLines_; }

private:
    void EndLine();

    std::string line_;  // the line being read, never longer than kMaxLineBytes
    bool overlong_ = false;
    bool headerFound_ = false;
    std::vector<LogFilterRow> rows_;
    uint64_t skippedLines_ = 0;
    uint64_t overlongLines_ = 0;
};

}  // namespace Orvane
}  // namespace android

#endif  // ORVANE_PLUGINS_LOG_FILTER_STATS_H
