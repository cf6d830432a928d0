#include "plugins/file_monitor.h"

#include <errno.h>
#include <fcntl.h>
#include <sys/epoll.h>
#include <unistd.h>

#include "utils/orvane_log.h"

namespace android {

namespace {
constexpr int kEpollSizeHint = 64;
}  // namespace

int FileMonitor::openExceptionLogFd(const std::string& path) {
    int fd;
    do {
        fd = open(path.c_str(), O_RDONLY | O_CLOEXEC);
    } while (fd < 0 && errno == EINTR);
    if (fd < 0) {
        OLOGE("%s No kernel exception log monitor support (errno=%d)", errno);
        return -1;
    }
    return fd;
}

int FileMonitor::registerExceptionLogMonitor(int fd) {
    int epfd = epoll_create(kEpollSizeHint);
    if (epfd < 0) {
        OLOGE("%s epoll_create failed (errno=%d)", errno);
        close(fd);
        return -1;
    }
    // EPOLLWAKEUP keeps the device awake while a record is pending; without the capability
    // for it the kernel quietly ignores the flag.
    struct epoll_event watch = {};
    watch.events = EPOLLPRI | EPOLLWAKEUP;
    watch.data.fd = fd;
    if (epoll_ctl(epfd, EPOLL_CTL_ADD, fd, &watch) < 0) {
        OLOGE("%s epoll_ctl for exception log monitor failed; errno=%d", errno);
        close(fd);
        close(epfd);
        return -1;
    }
    return epfd;
}

void FileMonitor::unregisterExceptionLogMonitor(int epfd, int fd) {
    if (epfd != -1 && fd != -1) {
        epoll_ctl(epfd, EPOLL_CTL_DEL, fd, nullptr);
    }
}

void FileMonitor::destoryExceptionLogFd(int fd) {
    if (fd != -1) {
        close(fd);
    }
}

}  // namespace android
