#include "plugins/file_monitor.h"

#include <errno.h>
#include <fcntl.h>
#include <sys/epoll.h>
#include <unistd.h>

#include "utils/orvane_log.h"

namespace android {

using android::base::unique_fd;

namespace {
constexpr int kEpollSizeHint = 64;
}  // namespace

unique_fd FileMonitor::OpenNode(const std::string& path) {
    int fd;
    do {
        fd = open(path.c_str(), O_RDONLY | O_CLOEXEC);
    } while (fd < 0 && errno == EINTR);
    return unique_fd(fd);
}

unique_fd FileMonitor::openExceptionLogFd(const std::string& path) {
    unique_fd fd = OpenNode(path);
    if (!fd.ok()) {
        OLOGE("%s No kernel exception log monitor support (errno=%d)", errno);
    }
    return fd;
}

unique_fd FileMonitor::registerExceptionLogMonitor(unique_fd& fd) {
    unique_fd epfd(epoll_create(kEpollSizeHint));
    if (!epfd.ok()) {
        OLOGE("%s epoll_create failed (errno=%d)", errno);
        fd.reset();
        return epfd;
    }
    // EPOLLWAKEUP keeps the device awake while a record is pending; without the capability
    // for it the kernel quietly ignores the flag.
    struct epoll_event watch = {};
    watch.events = EPOLLPRI | EPOLLWAKEUP;
    watch.data.fd = fd.get();
    if (epoll_ctl(epfd.get(), EPOLL_CTL_ADD, fd.get(), &watch) < 0) {
        OLOGE("%s epoll_ctl for exception log monitor failed; errno=%d", errno);
        fd.reset();
        return unique_fd();
    }
    return epfd;
}

void FileMonitor::unregisterExceptionLogMonitor(int epfd, int fd) {
    if (epfd != -1 && fd != -1) {
        epoll_ctl(epfd, EPOLL_CTL_DEL, fd, nullptr);
    }
}

void FileMonitor::destoryExceptionLogFd(unique_fd& fd) {
    fd.reset();
}

}  // namespace android
