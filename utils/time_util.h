#ifndef ORVANE_UTILS_TIME_UTIL_H
#define ORVANE_UTILS_TIME_UTIL_H

#include <cstdint>
#include <string>

namespace android {
namespace Orvane {
namespace TimeUtil {

// Wall clock in microseconds since the epoch; 0 when the clock cannot be read.
uint64_t GetTimestampUS();
// Wall clock in seconds since the epoch; 0 on failure.
uint64_t GetTimestampSecond();
// Monotonic clock since system start, for durations only.
int64_t GetNanoSecondSinceSystemStart();
// Today's local midnight in milliseconds (the current seconds, unmultiplied, if the local
// breakdown fails).
int64_t GetZeroTimestampMs();
// Local midnight of the day of `seconds`; values below 1 are returned unchanged.
int64_t GetZeroTimestampSec(int64_t seconds);
// Local time formatted into at most 19 characters; empty when it yields nothing or does not fit.
std::string GetTimeDateStr(int64_t seconds, const char* format);

}  // namespace TimeUtil
}  // namespace Orvane
}  // namespace android

#endif  // ORVANE_UTILS_TIME_UTIL_H
