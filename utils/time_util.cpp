#include "utils/time_util.h"

#include <stdlib.h>
#include <sys/time.h>
#include <time.h>

#include <string>

namespace android {
namespace Orvane {
namespace TimeUtil {
namespace {

constexpr int64_t kKnownDayNs = 60LL * 1000000000;

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
    // Asked at every stored event, while mktime may look at the zone file at each call (glibc
    // does, without TZ): the day found last is kept per thread, for one zone setting and at most
    // a minute, so that a change of the zone file or of its property still reaches it.
    struct KnownDay {
        int64_t start = 0;
        int64_t end = 0;
        int64_t foundNs = 0;
        bool zoneSet = false;  // an unset TZ (the zone file) and an empty one (UTC) differ
        std::string zone;
    };
    thread_local KnownDay known;
    const char* zone = getenv("TZ");
    int64_t now = GetNanoSecondSinceSystemStart();
    if (seconds >= known.start && seconds < known.end && now - known.foundNs < kKnownDayNs &&
        known.zoneSet == (zone != nullptr) && (zone == nullptr || known.zone == zone)) {
        return known.start;
    }
    time_t midnight;
    if (!LocalMidnight(static_cast<time_t>(seconds), midnight) || midnight <= 0) {
        return ((seconds + 28800) / 86400) * 86400 - 28800;
    }
    // Any time 26 hours after a midnight lies in the next day, however long daylight saving
    // makes this one.
    time_t next;
    if (midnight <= seconds && LocalMidnight(midnight + 26 * 3600, next) && next > seconds) {
        known = {midnight, next, now, zone != nullptr, zone != nullptr ? zone : ""};
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
