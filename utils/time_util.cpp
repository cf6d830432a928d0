#include "utils/time_util.h"

#include <sys/time.h>
#include <time.h>

namespace android {
namespace Orvane {
namespace TimeUtil {
namespace {

// Local midnight of `seconds` through the reentrant conversions; false when either fails.
bool LocalMidnight(time_t seconds, time_t& midnight) {
    struct tm local;
    if (localtime_r(&seconds, &local) == nullptr) {
        return false;
    }
    local.tm_hour = 0;
    local.tm_min = 0;
    local.tm_sec = 0;
    // Midnight may lie on the other side of a daylight-saving change than `seconds`.
    local.tm_isdst = -1;
    midnight = mktime(&local);
    return midnight != static_cast<time_t>(-1);
}

}  // namespace

uint64_t GetTimestampUS() {
    struct timeval tv;
    if (gettimeofday(&tv, nullptr) != 0) {
        return 0;
    }
    return static_cast<uint64_t>(tv.tv_sec) * 1000000 + static_cast<uint64_t>(tv.tv_usec);
}

uint64_t GetTimestampSecond() {
    return GetTimestampUS() / 1000000;
}

int64_t GetNanoSecondSinceSystemStart() {
    struct timespec ts;
    clock_gettime(CLOCK_MONOTONIC, &ts);
    return static_cast<int64_t>(ts.tv_sec) * 1000000000 + ts.tv_nsec;
}

int64_t GetZeroTimestampMs() {
    time_t now = static_cast<time_t>(GetTimestampSecond());
    time_t midnight;
    if (!LocalMidnight(now, midnight)) {
        return now;
    }
    return static_cast<int64_t>(midnight) * 1000;
}

int64_t GetZeroTimestampSec(int64_t seconds) {
    if (seconds < 1) {
        return seconds;
    }
    time_t midnight;
    if (!LocalMidnight(static_cast<time_t>(seconds), midnight) || midnight <= 0) {
        return ((seconds + 28800) / 86400) * 86400 - 28800;
    }
    return midnight;
}

std::string GetTimeDateStr(int64_t seconds, const char* format) {
    time_t t = static_cast<time_t>(seconds);
    struct tm local;
    char buffer[20];
    if (format == nullptr || localtime_r(&t, &local) == nullptr) {
        return "";
    }
    size_t length = strftime(buffer, sizeof(buffer), format, &local);
    return std::string(buffer, length);
}

}  // namespace TimeUtil
}  // namespace Orvane
}  // namespace android
