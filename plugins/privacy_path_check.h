#ifndef ORVANE_PLUGINS_PRIVACY_PATH_CHECK_H
#define ORVANE_PLUGINS_PRIVACY_PATH_CHECK_H

#include <sys/stat.h>

#include <string>

#include <android-base/unique_fd.h>

#include "platform/plugin_context.h"
#include "utils/daemon_stats.h"

namespace android {
namespace Orvane {

// The one place that decides which files log collection may put into a pack: a regular file
// with a single name that lies, once "..", symbolic links and relative parts are resolved,
// inside a folder the privacy policy allows and matches none of its forbidden patterns.
//
// A path judged and then opened could be swapped in between (a file replaced by a link into a
// forbidden folder), so collection opens with OpenCompliantFile, which opens the very file it
// judged, and packs from that descriptor (ZipPack::AddFileFromFd). The policy in force is asked on every call,
// so a changed document applies from the next file on. Refusals are counted as
// "privacy.path.refused".
//
// Threads: any thread; the checker holds no state of its own beyond the counter.
class PrivacyPathCheck {
public:
    explicit PrivacyPathCheck(PluginContext& context);

    bool IsPrivacycompliance(const std::string& path);
    // The file opened read-only, or an invalid descriptor when it is refused or cannot be opened.
    android::base::unique_fd OpenCompliantFile(const std::string& path);

private:
    // A handle to what the path names now, with the kernel's name of it and its status.
    bool Resolve(const std::string& path, android::base::unique_fd& handle, std::string& resolved, struct stat& st);
    bool Judge(const std::string& resolved, const struct stat& st);

    PluginContext& context_;
    DaemonStats::Counter& refused_;
};

}  // namespace Orvane
}  // namespace android

#endif  // ORVANE_PLUGINS_PRIVACY_PATH_CHECK_H
