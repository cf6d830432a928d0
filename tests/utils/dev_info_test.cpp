#include "utils/dev_info.h"

#include <gtest/gtest.h>

#include <cstdlib>

#include "tests/common/log_capture.h"
#include "utils/sys_env.h"

namespace android::Orvane {

// No ORVANE_PROPERTY_FILE: the properties live in this process, which checks that mode too.
const int kNoFile = unsetenv("ORVANE_PROPERTY_FILE");

TEST(DevInfoTest, DefaultsAndTheSerialReadOnce) {
    EXPECT_EQ("unknown", DevInfo::GetQuorVersion());
    EXPECT_EQ("off", DevInfo::GetUploadSwitch());
    EXPECT_EQ("normal", DevInfo::GetRunMode());
    EXPECT_EQ(0, DevInfo::GetBuildType());

    // The serial number is read once for the life of the process.
    ASSERT_TRUE(SysEnv::SetSysProperity("ro.serialno", "SN-FIRST"));
    EXPECT_EQ("SN-FIRST", DevInfo::GetSerinalNo());
    ASSERT_TRUE(SysEnv::SetSysProperity("ro.serialno", "SN-SECOND"));
    EXPECT_EQ("SN-FIRST", DevInfo::GetSerinalNo());
}

TEST(DevInfoTest, UploadSwitchAndActivateTimeRejectBadValues) {
    const char* names[] = {"off", "on", "closed"};
    for (int v : {1, 2, 0}) {
        ASSERT_TRUE(DevInfo::SetUploadSwitch(v));
        EXPECT_EQ(names[v], DevInfo::GetUploadSwitch());
    }
    // Stored as a number: a name reads as off.
    ASSERT_TRUE(SysEnv::SetSysProperity("persist.sys.orvane.upload_switch", "on"));
    EXPECT_EQ("off", DevInfo::GetUploadSwitch());
    LogCapture logs;
    EXPECT_FALSE(DevInfo::SetUploadSwitch(3) || DevInfo::SetUploadSwitch(-1));
    EXPECT_EQ(2u, logs.Count(ANDROID_LOG_ERROR, "SetUploadSwitch invalid upload switch")) << logs.Dump();
    EXPECT_EQ("on", SysEnv::GetSysProperity("persist.sys.orvane.upload_switch", ""));

    ASSERT_TRUE(DevInfo::SetActivateTime(1700000000));
    EXPECT_EQ(1700000000u, DevInfo::GetActivateTime());
    for (const char* bad : {"abc", "12x", "-5", " 7", "99999999999999999999999"}) {
        ASSERT_TRUE(SysEnv::SetSysProperity("persist.sys.orvane.activate_time", bad));
        EXPECT_EQ(0u, DevInfo::GetActivateTime()) << bad;
    }
}

}  // namespace android::Orvane
