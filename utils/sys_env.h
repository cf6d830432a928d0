#ifndef ORVANE_UTILS_SYS_ENV_H
#define ORVANE_UTILS_SYS_ENV_H

#include <string>

namespace android {
namespace Orvane {

// System properties. On a device they are the property service's. On a host they live in a
// text file of key=value lines named by the environment variable ORVANE_PROPERTY_FILE, shared
// with other processes (orvanectl, tests): reads see their writes, writes replace the file
// atomically under an advisory lock. Without that variable they live in this process only
// (host/utils/sys_env_host.cpp). Safe to call from any thread.
class SysEnv {
public:
    // Longest value the property service stores (PROP_VALUE_MAX less its terminating NUL).
    static constexpr size_t kMaxValueLength = 91;

    static std::string GetSysProperity(const std::string& key, const std::string& defaultValue);
    // False, with an error line, for an invalid key, a value over the limit, or a failed write.
    static bool SetSysProperity(const std::string& key, const std::string& value);

    // The checks both backends make before a write; CheckProperty logs the reason of a refusal.
    static bool IsValidKey(const std::string& key);
    static bool CheckProperty(const std::string& key, const std::string& value);
};

}  // namespace Orvane
}  // namespace android

#endif  // ORVANE_UTILS_SYS_ENV_H
