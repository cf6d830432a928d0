#ifndef ORVANE_UTILS_DEV_INFO_H
#define ORVANE_UTILS_DEV_INFO_H

#include <cstdint>
#include <string>

namespace android {
namespace Orvane {

// Device information kept in system properties. Safe to call from any thread.
class DevInfo {
public:
    // OS-skin version, "unknown" when the build does not say.
    static std::string GetQuorVersion();
    // Serial number, read once and cached for the life of the process.
    static std::string GetSerinalNo();
    // "on", "closed" or "off".
    static std::string GetUploadSwitch();
    // 0 off, 1 on, 2 closed.
    static bool SetUploadSwitch(int value);
    // Seconds since the epoch; 0 when unset or not a number.
    static uint64_t GetActivateTime();
    static bool SetActivateTime(uint64_t seconds);
    static std::string GetRunMode();
    static bool SetRunMode(const std::string& name, const std::string& file);
    // 0 and 1 are the two domestic build types; any other value is an export build.
    static int GetBuildType();
};

}  // namespace Orvane
}  // namespace android

#endif  // ORVANE_UTILS_DEV_INFO_H
