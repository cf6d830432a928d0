#include "utils/dev_info.h"

#include <cerrno>
#include <cstdlib>

#include "utils/orvane_log.h"
#include "utils/string_util.h"
#include "utils/sys_env.h"

namespace android {
namespace Orvane {
namespace {

constexpr const char* kUploadSwitchKey = "persist.sys.orvane.upload_switch";
constexpr const char* kActivateTimeKey = "persist.sys.orvane.activate_time";
constexpr const char* kRunModeKey = "persist.sys.orvane.run_mode";
constexpr const char* kRunModeFileKey = "persist.sys.orvane.run_mode_file";

}  // namespace

std::string DevInfo::GetQuorVersion() {
    return SysEnv::GetSysProperity("ro.quor.build.version", "unknown");
}

std::string DevInfo::GetSerinalNo() {
    static const std::string kSerial = SysEnv::GetSysProperity("ro.serialno", "unknown");
    return kSerial;
}

std::string DevInfo::GetUploadSwitch() {
    std::string value = SysEnv::GetSysProperity(kUploadSwitchKey, "0");
    if (value == "1") {
        return "on";
    }
    return value == "2" ? "closed" : "off";
}

bool DevInfo::SetUploadSwitch(int value) {
    if (value < 0 || value > 2) {
        OLOGE_LIMITED("%s invalid upload switch %d", value);
        return false;
    }
    return SysEnv::SetSysProperity(kUploadSwitchKey, std::to_string(value));
}

uint64_t DevInfo::GetActivateTime() {
    std::string value = SysEnv::GetSysProperity(kActivateTimeKey, "");
    if (value.empty() || value.find_first_not_of("0123456789") != std::string::npos) {
        return 0;
    }
    errno = 0;
    unsigned long long seconds = strtoull(value.c_str(), nullptr, 10);
    return errno == ERANGE ? 0 : seconds;
}

bool DevInfo::SetActivateTime(uint64_t seconds) {
    return SysEnv::SetSysProperity(kActivateTimeKey, std::to_string(seconds));
}

std::string DevInfo::GetRunMode() {
    return SysEnv::GetSysProperity(kRunModeKey, "normal");
}

bool DevInfo::SetRunMode(const std::string& name, const std::string& file) {
    return SysEnv::SetSysProperity(kRunModeKey, name) && SysEnv::SetSysProperity(kRunModeFileKey, file);
}

int DevInfo::GetBuildType() {
    return StringUtil::ConvertInt(SysEnv::GetSysProperity("ro.quor.build.type", "0"));
}

}  // namespace Orvane
}  // namespace android
