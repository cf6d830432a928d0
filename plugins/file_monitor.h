#ifndef ORVANE_PLUGINS_FILE_MONITOR_H
#define ORVANE_PLUGINS_FILE_MONITOR_H

#include <string>

#include <android-base/unique_fd.h>

namespace android {

// Opening, epoll registration and tear-down of the kernel's exception log node, which
// signals its records as priority data. Holds no state; callers own the descriptors.
class FileMonitor {
public:
    static constexpr const char* kExceptionLogPath = "/dev/qx_exception_log";

    // The node opened read-only and close-on-exec; invalid, with one error line, when it
    // cannot be opened.
    android::base::unique_fd openExceptionLogFd(const std::string& path = kExceptionLogPath);
    // A new epoll descriptor watching fd for priority data; invalid when that cannot be set up,
    // and fd is then closed.
    android::base::unique_fd registerExceptionLogMonitor(android::base::unique_fd& fd);
    void unregisterExceptionLogMonitor(int epfd, int fd);
    void destoryExceptionLogFd(android::base::unique_fd& fd);

    // openExceptionLogFd without its line, for attempts to reopen a node that vanished.
    static android::base::unique_fd OpenNode(const std::string& path);
};

}  // namespace android

#endif  // ORVANE_PLUGINS_FILE_MONITOR_H
