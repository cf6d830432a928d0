#include "plugins/event_logrelay_source.h"

#include <errno.h>
#include <string.h>
#include <sys/epoll.h>
#include <unistd.h>

#include "platform/pipeline.h"
#include "platform/plugin_context.h"
#include "platform/plugin_factory.h"
#include "utils/orvane_log.h"

namespace android {
namespace Orvane {

ORVANE_REGISTER_PLUGIN(EventLogrelaySource);

namespace {
const char* const kDeviceName = "qx_exception_log";
constexpr uint32_t kExceptionEventId = 902902;
constexpr int kMaxEvents = 64;
// The driver's records are read in pieces of at most this many bytes, each its own event.
constexpr size_t kMaxRead = 1023;
// Pause after a failed wait or read: a node that vanished reports an error at once, and the
// loop must not spin on it.
constexpr useconds_t kIdlePauseUs = 100 * 1000;
}  // namespace

EventLogrelaySource::~EventLogrelaySource() {
    // The epoll instance outlives OnUnload because the loop may still be waiting on it.
    if (epollFd_ != -1) {
        close(epollFd_);
    }
}

void EventLogrelaySource::OnLoad() {
    OLOGD("%s Load logrelay source ");
    SetVersion("EventLogrelaySource-1.0");
    SetName("EventLogrelaySource");
}

void EventLogrelaySource::OnUnload() {
    stopping_ = true;
    std::lock_guard<std::mutex> guard(monitorLock_);
    if (monitor_ == nullptr) {
        return;
    }
    monitor_->unregisterExceptionLogMonitor(epollFd_, deviceFd_);
    // A loop still running owns the descriptor until it returns: closing it under the loop's
    // feet would let the next file opened take its number and be read instead.
    if (!looping_) {
        ReleaseDevice();
    }
}

void EventLogrelaySource::ReleaseDevice() {
    monitor_->destoryExceptionLogFd(deviceFd_);
    deviceFd_ = -1;
    monitor_.reset();
}

void EventLogrelaySource::StartEventSource() {
    OLOGD("%s Logrelay start init");
    PluginContext* context = GetPluginContext();
    std::string path = context != nullptr ? context->GetDevicePath(kDeviceName, android::FileMonitor::kExceptionLogPath)
                                          : android::FileMonitor::kExceptionLogPath;
    {
        std::lock_guard<std::mutex> guard(monitorLock_);
        monitor_ = std::make_unique<android::FileMonitor>();
        int fd = monitor_->openExceptionLogFd(path);
        if (fd < 0) {
            return;
        }
        int epfd = monitor_->registerExceptionLogMonitor(fd);
        if (epfd < 0) {
            return;
        }
        deviceFd_ = fd;
        epollFd_ = epfd;
        looping_ = true;
    }
    threadLoop();
    // The loop returns only once unloading has begun.
    std::lock_guard<std::mutex> guard(monitorLock_);
    looping_ = false;
    ReleaseDevice();
}

int EventLogrelaySource::threadLoop() {
    OLOGD("%s LogRelay start loop");
    struct epoll_event events[kMaxEvents];
    char buffer[kMaxRead];
    for (;;) {
        if (epoll_wait(epollFd_, events, kMaxEvents, -1) < 0) {
            int error = errno;
            if (error != EINTR) {
                OLOGE("%s epoll_wait: %s", strerror(error));
            }
            if (stopping_) {
                return 0;
            }
            if (error != EINTR) {
                usleep(kIdlePauseUs);
            }
            continue;
        }
        ssize_t length = read(deviceFd_, buffer, kMaxRead);
        if (length < 1) {
            if (stopping_) {
                return 0;
            }
            usleep(kIdlePauseUs);
            continue;
        }
        ParseEvent(std::string(buffer, static_cast<size_t>(length)));
        if (stopping_) {
            return 0;
        }
    }
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
