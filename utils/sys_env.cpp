#include "utils/sys_env.h"

#include "utils/orvane_log.h"
#include "utils/string_util.h"

#if defined(__ANDROID__)
#include <cutils/properties.h>
#endif

namespace android {
namespace Orvane {

bool SysEnv::IsValidKey(const std::string& key) {
    return !key.empty() && key.find_first_of(std::string("=# \t\r\n\0", 8)) == std::string::npos;
}

bool SysEnv::CheckProperty(const std::string& key, const std::string& value) {
    if (!IsValidKey(key)) {
        OLOG_AS(ANDROID_LOG_ERROR, "SetSysProperity", "%s invalid property key \"%s\"", key.c_str());
        return false;
    }
    if (value.size() > SysEnv::kMaxValueLength) {
        OLOG_AS(ANDROID_LOG_ERROR, "SetSysProperity", "%s value of %s is %zu bytes, at most %zu allowed", key.c_str(),
                value.size(), SysEnv::kMaxValueLength);
        return false;
    }
    if (value.find_first_of(std::string("\r\n\0", 3)) != std::string::npos) {
        OLOG_AS(ANDROID_LOG_ERROR, "SetSysProperity", "%s value of %s holds a line break or NUL", key.c_str());
        return false;
    }
    return true;
}

#if defined(__ANDROID__)

std::string SysEnv::GetSysProperity(const std::string& key, const std::string& defaultValue) {
    char value[PROPERTY_VALUE_MAX] = {0};
    property_get(key.c_str(), value, defaultValue.c_str());
    return value;
}

bool SysEnv::SetSysProperity(const std::string& key, const std::string& value) {
    if (!CheckProperty(key, value)) {
        return false;
    }
    int ret = property_set(key.c_str(), value.c_str());
    if (ret != 0) {
        OLOGE("%s property_set %s failed, ret=%d", key.c_str(), ret);
        return false;
    }
    return true;
}

#endif  // __ANDROID__

}  // namespace Orvane
}  // namespace android
