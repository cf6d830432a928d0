#include "utils/dev_info.h"

#include <gtest/gtest.h>

#include <cstdlib>

#include "tests/common/log_capture.h"
#include "utils/sys_env.h"

namespace android {
namespace Orvane {
namespace {

// No ORVANE_PROPERTY_FILE here: the properties live in this process, which also checks that
// mode of the store.
class DevInfoTest : public testing::Test {
protected:
    static void SetUpTestSuite() { unsetenv("ORVANE_PROPERTY_FILE"); }
    static void Set(const std::string& key, const std::string& value) {
        ASSERT_TRUE(SysEnv::SetSysProperity(key, value)) << key;
    }
};

TEST_F(DevInfoTest, DefaultsWhenNothingIsSet) {
    EXPECT_EQ("unknown", DevInfo::GetQuorVersion());
    EXPECT_EQ("off", DevInfo::GetUploadSwitch());
    EXPECT_EQ(0u, DevInfo::GetActivateTime());
    EXPECT_EQ("normal", DevInfo::GetRunMode());
    EXPECT_EQ(0, DevInfo::GetBuildType());
}

TEST_F(DevInfoTest, UploadSwitchNamesAndRange) {
    ASSERT_TRUE(DevInfo::SetUploadSwitch(1));
    EXPECT_EQ("on", DevInfo::GetUploadSwitch());
    ASSERT_TRUE(DevInfo::SetUploadSwitch(2));
    EXPECT_EQ("closed", DevInfo::GetUploadSwitch());
    ASSERT_TRUE(DevInfo::SetUploadSwitch(0));
    EXPECT_EQ("off", DevInfo::GetUploadSwitch());
    Set("persist.sys.orvane.upload_switch", "on");
    EXPECT_EQ("off", DevInfo::GetUploadSwitch());

    LogCapture logs;
    EXPECT_FALSE(DevInfo::SetUploadSwitch(3));
    EXPECT_FALSE(DevInfo::SetUploadSwitch(-1));
    EXPECT_EQ(2u, logs.Count(ANDROID_LOG_ERROR, "SetUploadSwitch invalid upload switch")) << logs.Dump();
    EXPECT_EQ("on", SysEnv::GetSysProperity("persist.sys.orvane.upload_switch", ""));
}

TEST_F(DevInfoTest, ActivateTimeIsWholeSecondsOrZero) {
    ASSERT_TRUE(DevInfo::SetActivateTime(1700000000));
    EXPECT_EQ(1700000000u, DevInfo::GetActivateTime());
    for (const char* bad : {"abc", "12x", "-5", " 7", "99999999999999999999999"}) {
        Set("persist.sys.orvane.activate_time", bad);
        EXPECT_EQ(0u, DevInfo::GetActivateTime()) << bad;
    }
}

TEST_F(DevInfoTest, RunModeBuildTypeVersionAndSerial) {
    ASSERT_TRUE(DevInfo::SetRunMode("debug", "/data/quorlog/orvane/mode.cfg"));
    EXPECT_EQ("debug", DevInfo::GetRunMode());
    EXPECT_EQ("/data/quorlog/orvane/mode.cfg", SysEnv::GetSysProperity("persist.sys.orvane.run_mode_file", ""));

    Set("ro.quor.build.type", "2");
    EXPECT_EQ(2, DevInfo::GetBuildType());
    Set("ro.quor.build.version", "QuorOS 5.1");
    EXPECT_EQ("QuorOS 5.1", DevInfo::GetQuorVersion());

    // The serial number is read once for the life of the process.
    Set("ro.serialno", "SN-FIRST");
    EXPECT_EQ("SN-FIRST", DevInfo::GetSerinalNo());
    Set("ro.serialno", "SN-SECOND");
    EXPECT_EQ("SN-FIRST", DevInfo::GetSerinalNo());
}

}  // namespace
}  // namespace Orvane
}  // namespace android
