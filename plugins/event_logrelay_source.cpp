#include "plugins/event_logrelay_source.h"

#include <errno.h>
#include <string.h>
#include <sys/epoll.h>
#include <unistd.h>

#include "platform/pipeline.h"
#include "platform/plugin_factory.h"
#include "utils/orvane_log.h"

namespace android {
namespace Orvane {

ORVANE_REGISTER_PLUGIN(EventLogrelaySource);

namespace {

using android::base::unique_fd;

const char* const kDeviceName = "qx_exception_log";
constexpr uint32_t kExceptionEventId = 902902;
constexpr int kMaxEvents = 64;
// The driver's records are read in pieces of at most this many bytes, each its own event.
constexpr size_t kMaxRead = 1023;
// Pause after a failed wait or read that did not lose the node, so that it is not spun on.
constexpr std::chrono::milliseconds kIdlePause{100};

}  // namespace

void EventLogrelaySource::OnLoad() {
    OLOGD("%s Load logrelay source ");
    SetVersion("EventLogrelaySource-1.0");
    SetName("EventLogrelaySource");
}

void EventLogrelaySource::OnUnload() {
    DeviceSource::OnUnload();
    Mutex::Autolock guard(monitorLock_);
    if (monitor_ == nullptr) {
        return;
    }
    monitor_->unregisterExceptionLogMonitor(epollFd_.get(), deviceFd_.get());
    // A loop still running owns the descriptors until it returns: closing them under the loop's
    // feet would let the next file opened take a number and be read instead.
    if (!looping_) {
        ReleaseDevice();
    }
}

void EventLogrelaySource::ReleaseDevice() {
    monitor_->destoryExceptionLogFd(deviceFd_);
    epollFd_.reset();
    monitor_.reset();
}

void EventLogrelaySource::StartEventSource() {
    OLOGD("%s Logrelay start init");
    // The node's absence at start means a kernel without the channel: nothing to wait for.
    path_ = DevicePath(kDeviceName, android::FileMonitor::kExceptionLogPath);
    {
        Mutex::Autolock guard(monitorLock_);
        monitor_ = std::make_unique<android::FileMonitor>();
        unique_fd fd = monitor_->openExceptionLogFd(path_);
        if (!fd.ok()) {
            return;
        }
        unique_fd epfd = monitor_->registerExceptionLogMonitor(fd);
        if (!epfd.ok()) {
            return;
        }
        deviceFd_ = std::move(fd);
        epollFd_ = std::move(epfd);
        looping_ = true;
    }
    threadLoop();
    // The loop returns only once unloading has begun.
    Mutex::Autolock guard(monitorLock_);
    looping_ = false;
    ReleaseDevice();
}

int EventLogrelaySource::threadLoop() {
    OLOGD("%s LogRelay start loop");
    struct epoll_event events[kMaxEvents];
    char buffer[kMaxRead];
    int epfd;
    int fd;
    {
        Mutex::Autolock guard(monitorLock_);
        epfd = epollFd_.get();
        fd = deviceFd_.get();
    }
    for (;;) {
        if (epoll_wait(epfd, events, kMaxEvents, -1) < 0) {
            int error = errno;
            if (error != EINTR) {
                OLOGE_LIMITED("%s epoll_wait: %s", strerror(error));
            }
            if (Stopping()) {
                return 0;
            }
            if (error != EINTR) {
                Pause(kIdlePause);
            }
            continue;
        }
        if (!WaitForRoom()) {
            return 0;
        }
        ssize_t length = read(fd, buffer, kMaxRead);
        int error = errno;
        if (length < 1) {
            if (Stopping()) {
                return 0;
            }
            if (length < 0 && IsLoss(error)) {
                if (!ReopenDevice(error, epfd, fd)) {
                    return 0;
                }
            } else {
                Pause(kIdlePause);
            }
            continue;
        }
        CountRead();
        ParseEvent(std::string(buffer, static_cast<size_t>(length)));
        if (Stopping()) {
            return 0;
        }
    }
}

bool EventLogrelaySource::ReopenDevice(int error, int& epfd, int& fd) {
    unique_fd epoll;
    unique_fd device = Reopen(path_, error, [this, &epoll] {
        unique_fd node = android::FileMonitor::OpenNode(path_);
        if (node.ok()) {
            Mutex::Autolock guard(monitorLock_);
            epoll = monitor_->registerExceptionLogMonitor(node);
        }
        return node;
    });
    if (!device.ok()) {
        return false;
    }
    Mutex::Autolock guard(monitorLock_);
    epfd = epoll.get();
    fd = device.get();
    epollFd_ = std::move(epoll);
    deviceFd_ = std::move(device);
    return true;
}

void EventLogrelaySource::ParseEvent(const std::string& record) {
    sp<Event> event = new (std::nothrow) Event("EventLogrelaySource");
    if (event == nullptr) {
        OLOGE("%s Event Build Failed");
        return;
    }
    event->eventId = kExceptionEventId;
    event->SetValue("save_param_list", record);
    PublishPipelineEvent(event);
}

}  // namespace Orvane
}  // namespace android
