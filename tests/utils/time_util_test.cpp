#include "utils/time_util.h"

#include <gtest/gtest.h>
#include <time.h>

#include <cstdlib>
#include <string>

namespace android {
namespace Orvane {
namespace {

// Switches the process's local zone for one test and restores it afterwards.
class ScopedTimeZone {
public:
    explicit ScopedTimeZone(const char* zone) {
        const char* old = getenv("TZ");
        hadOld_ = old != nullptr;
        old_ = hadOld_ ? old : "";
        Set(zone);
    }
    ~ScopedTimeZone() {
        if (hadOld_) {
            Set(old_.c_str());
        } else {
            unsetenv("TZ");
            tzset();
        }
    }
    void Set(const char* zone) {
        setenv("TZ", zone, 1);
        tzset();
    }

private:
    bool hadOld_;
    std::string old_;
};

// 2024-03-05 07:08:09 UTC.
constexpr int64_t kSample = 1709622489;

TEST(TimeUtilTest, DateStringsFitNineteenCharacters) {
    ScopedTimeZone zone("UTC0");
    EXPECT_EQ("2024-03-05 07:08:09", TimeUtil::GetTimeDateStr(kSample, "%Y-%m-%d %H:%M:%S"));
    EXPECT_EQ("20240305070809", TimeUtil::GetTimeDateStr(kSample, "%Y%m%d%H%M%S"));
    // 20 characters do not fit the 20-byte buffer with its terminator.
    EXPECT_EQ("", TimeUtil::GetTimeDateStr(kSample, "%Y-%m-%d %H:%M:%S!"));
    EXPECT_EQ("", TimeUtil::GetTimeDateStr(kSample, "%Y-%m-%d %H:%M:%S %Y"));
    EXPECT_EQ("", TimeUtil::GetTimeDateStr(kSample, ""));

    zone.Set("CST-8");
    EXPECT_EQ("2024-03-05 15:08:09", TimeUtil::GetTimeDateStr(kSample, "%Y-%m-%d %H:%M:%S"));
}

TEST(TimeUtilTest, MidnightInSeveralZones) {
    // Zones with a fixed offset (seconds east of UTC); POSIX TZ strings name the offset west.
    struct Zone {
        const char* tz;
        int64_t east;
    };
    const Zone zones[] = {{"UTC0", 0}, {"CST-8", 8 * 3600}, {"EST5", -5 * 3600}, {"<+1345>-13:45", 13 * 3600 + 45 * 60},
                          {"<-11>11", -11 * 3600}};
    const int64_t samples[] = {kSample, 86400 * 20000 + 1, 86400 * 20000 - 1, 1700000000};
    for (const Zone& z : zones) {
        ScopedTimeZone zone(z.tz);
        for (int64_t t : samples) {
            int64_t local = t + z.east;
            int64_t expected = t - (local % 86400);
            EXPECT_EQ(expected, TimeUtil::GetZeroTimestampSec(t)) << z.tz << " at " << t;
            EXPECT_EQ(expected, TimeUtil::GetZeroTimestampSec(expected)) << "midnight maps to itself in " << z.tz;
        }
    }
    EXPECT_EQ(0, TimeUtil::GetZeroTimestampSec(0));
    EXPECT_EQ(-7, TimeUtil::GetZeroTimestampSec(-7));
}

TEST(TimeUtilTest, MidnightOnDaylightSavingDays) {
    ScopedTimeZone zone("CET-1CEST,M3.5.0,M10.5.0/3");
    // Noon of 2024-03-31 (summer time since 02:00) is 10:00 UTC; midnight was still winter time,
    // 2024-03-30 23:00 UTC.
    EXPECT_EQ(1711839600, TimeUtil::GetZeroTimestampSec(1711879200));
    // Noon of 2024-10-27 (winter time since 03:00) is 11:00 UTC; midnight was summer time,
    // 2024-10-26 22:00 UTC.
    EXPECT_EQ(1729980000, TimeUtil::GetZeroTimestampSec(1730026800));
}

TEST(TimeUtilTest, TodaysMidnightInMilliseconds) {
    ScopedTimeZone zone("CST-8");
    int64_t before = TimeUtil::GetZeroTimestampSec(static_cast<int64_t>(TimeUtil::GetTimestampSecond()));
    int64_t ms = TimeUtil::GetZeroTimestampMs();
    int64_t after = TimeUtil::GetZeroTimestampSec(static_cast<int64_t>(TimeUtil::GetTimestampSecond()));
    EXPECT_TRUE(ms == before * 1000 || ms == after * 1000) << ms;
}

TEST(TimeUtilTest, ClocksAgree) {
    uint64_t us = TimeUtil::GetTimestampUS();
    uint64_t s = TimeUtil::GetTimestampSecond();
    EXPECT_GT(us, 1600000000ull * 1000000);
    EXPECT_GE(s, us / 1000000);
    EXPECT_LE(s, us / 1000000 + 5);
    int64_t a = TimeUtil::GetNanoSecondSinceSystemStart();
    int64_t b = TimeUtil::GetNanoSecondSinceSystemStart();
    EXPECT_GT(a, 0);
    EXPECT_GE(b, a);
}

}  // namespace
}  // namespace Orvane
}  // namespace android
