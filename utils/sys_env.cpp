#include "utils/sys_env.h"

#include "utils/orvane_log.h"
#include "utils/string_util.h"

#if defined(__ANDROID__)
#include <android-base/properties.h>
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

// An empty or unset property reads as the default, as property_get gives it.
std::string SysEnv::GetSysProperity(const std::string& key, const std::string& defaultValue) {
    return android::base::GetProperty(key, defaultValue);
}

bool SysEnv::SetSysProperity(const std::string& key, const std::string& value) {
    if (!CheckProperty(key, value)) {
        return false;
    }
    if (!android::base::SetProperty(key, value)) {
        OLOGE("%s property_set %s failed", key.c_str());
        return false;
    }
    return true;
}

#endif  // __ANDROID__

}  // namespace Orvane
}  // namespace android
