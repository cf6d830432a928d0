#ifndef ORVANE_PLUGINS_FILE_MONITOR_H
#define ORVANE_PLUGINS_FILE_MONITOR_H

#include <string>

namespace android {

// Opening, epoll registration and tear-down of the kernel's exception log node, which
// signals its records as priority data. Holds no state; callers own the descriptors.
class FileMonitor {
public:
    static constexpr const char* kExceptionLogPath = "/dev/qx_exception_log";

    // The node opened read-only and close-on-exec, or -1.
    int openExceptionLogFd(const std::string& path = kExceptionLogPath);
    // A new epoll descriptor watching fd for priority data, or -1 (fd is then closed).
    int registerExceptionLogMonitor(int fd);
    void unregisterExceptionLogMonitor(int epfd, int fd);
    void destoryExceptionLogFd(int fd);
};

}  // namespace android

#endif  // ORVANE_PLUGINS_FILE_MONITOR_H
