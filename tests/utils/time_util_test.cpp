#include "utils/time_util.h"

#include <time.h>

#include <cstdlib>

#include <gtest/gtest.h>

namespace android::Orvane {

// Switches the process's local zone for one test (tests run with TZ unset or restored by hand).
void SetZone(const char* zone) {
    setenv("TZ", zone, 1);
    tzset();
}

constexpr int64_t kSample = 1709622489;  // 2024-03-05 07:08:09 UTC

TEST(TimeUtilTest, MidnightsInSeveralZonesAndClockUnits) {
    // POSIX TZ strings name the offset west; `east` is seconds east of UTC.
    struct {
        const char* tz;
        int64_t east;
    } zones[] = {
            {"UTC0", 0}, {"CST-8", 8 * 3600}, {"EST5", -5 * 3600}, {"<+1345>-13:45", 49500}, {"<-11>11", -11 * 3600}};
    for (const auto& z : zones) {
        SetZone(z.tz);
        for (int64_t t : {kSample, int64_t{86400} * 20000 + 1, int64_t{86400} * 20000 - 1}) {
            SCOPED_TRACE(std::string(z.tz) + " at " + std::to_string(t));
            int64_t expected = t - ((t + z.east) % 86400);
            EXPECT_EQ(expected, TimeUtil::GetZeroTimestampSec(t));
            EXPECT_EQ(expected, TimeUtil::GetZeroTimestampSec(expected));
        }
    }
    EXPECT_EQ(-7, TimeUtil::GetZeroTimestampSec(-7));
    // Midnight of a switch day was still in the old offset: 2024-03-31 and 2024-10-27 at noon.
    SetZone("CET-1CEST,M3.5.0,M10.5.0/3");
    EXPECT_EQ(1711839600, TimeUtil::GetZeroTimestampSec(1711879200));
    EXPECT_EQ(1729980000, TimeUtil::GetZeroTimestampSec(1730026800));

    // The clocks agree on their units.
    const uint64_t us = TimeUtil::GetTimestampUS(), s = TimeUtil::GetTimestampSecond();
    EXPECT_TRUE(us > 1600000000ull * 1000000 && s >= us / 1000000 && s <= us / 1000000 + 5) << us << " " << s;
}

// Midnights asked for in a row, as storage asks at every event: every half hour over four days
// around the switch to summer time, with the zone changed between any two questions.
TEST(TimeUtilTest, MidnightsInARowFollowTheDayAndTheZone) {
    auto reference = [](int64_t seconds) {
        time_t t = static_cast<time_t>(seconds);
        struct tm local;
        localtime_r(&t, &local);
        local.tm_hour = local.tm_min = local.tm_sec = 0;
        local.tm_isdst = -1;
        return static_cast<int64_t>(mktime(&local));
    };
    constexpr int64_t kFrom = 1711670400;  // 2024-03-29 00:00 UTC
    for (int64_t t = kFrom; t < kFrom + 4 * 86400; t += 1800) {
        for (const char* zone : {"CET-1CEST,M3.5.0,M10.5.0/3", "<+0530>-5:30", "CET-1CEST,M3.5.0,M10.5.0/3"}) {
            SetZone(zone);
            ASSERT_EQ(reference(t), TimeUtil::GetZeroTimestampSec(t)) << zone << " at " << t;
        }
    }
    unsetenv("TZ");
    tzset();
}

}  // namespace android::Orvane
