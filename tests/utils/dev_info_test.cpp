#include "utils/dev_info.h"

#include <cstdlib>

#include <gtest/gtest.h>

#include "utils/sys_env.h"

namespace android::Orvane {

// No ORVANE_PROPERTY_FILE: the properties live in this process, which checks that mode too.
const int kNoFile = unsetenv("ORVANE_PROPERTY_FILE");

TEST(DevInfoTest, DefaultsSerialReadOnceAndBadActivateTimes) {
    EXPECT_EQ("unknown normal", DevInfo::GetQuorVersion() + " " + DevInfo::GetRunMode());
    EXPECT_EQ(0, DevInfo::GetBuildType());
    // The serial number is read once for the life of the process.
    ASSERT_TRUE(SysEnv::SetSysProperity("ro.serialno", "SN-FIRST"));
    EXPECT_EQ("SN-FIRST", DevInfo::GetSerinalNo());
    ASSERT_TRUE(SysEnv::SetSysProperity("ro.serialno", "SN-SECOND"));
    EXPECT_EQ("SN-FIRST", DevInfo::GetSerinalNo());

    // Only plain decimal seconds that fit count.
    ASSERT_TRUE(DevInfo::SetActivateTime(1700000000));
    EXPECT_EQ(1700000000u, DevInfo::GetActivateTime());
    for (const char* bad : {"abc", "12x", "-5", " 7", "99999999999999999999999"}) {
        ASSERT_TRUE(SysEnv::SetSysProperity("persist.sys.orvane.activate_time", bad));
        EXPECT_EQ(0u, DevInfo::GetActivateTime()) << bad;
    }
}

}  // namespace android::Orvane
