#include "plugins/event_radiator.h"

#include <fcntl.h>
#include <stdio.h>
#include <string.h>
#include <sys/select.h>
#include <unistd.h>

#include <string>

#include "platform/pipeline.h"
#include "platform/plugin_context.h"
#include "platform/plugin_factory.h"
#include "utils/orvane_log.h"

namespace android {
namespace Orvane {

ORVANE_REGISTER_PLUGIN(EventRadiator);

namespace {
const char* const kDeviceName = "qxev";
const char* const kDevicePath = "/dev/qxev";
// The largest record the device hands over in one read; buffers keep one more byte so that
// every record is NUL-terminated.
constexpr size_t kMaxRecord = 4096;
// Pause after a turn that got nothing: a device that vanished keeps failing at once, and the
// loop must not spin on it.
constexpr useconds_t kIdlePauseUs = 100 * 1000;
}  // namespace

void EventRadiator::OnLoad() {
    SetVersion("EventRadiator-1.0");
    SetName("EventRadiator");
}

void EventRadiator::OnUnload() {
    stopping_ = true;
}

void EventRadiator::StartEventSource() {
    PluginContext* context = GetPluginContext();
    std::string path = context != nullptr ? context->GetDevicePath(kDeviceName, kDevicePath) : kDevicePath;
    int fd = open(path.c_str(), O_RDWR);
    // Descriptor 0 is refused too, deliberately strict: getting it means standard input had been
    // closed, which a healthy daemon never does.
    if (fd <= 0) {
        OLOGE("%s open log exception failed");
        if (fd == 0) {
            close(fd);
        }
        return;
    }
    // select cannot watch a descriptor beyond its fixed set; FD_SET would write past it.
    if (fd >= FD_SETSIZE) {
        OLOGE("%s descriptor %d beyond select's reach", fd);
        close(fd);
        return;
    }
    char buffer[kMaxRecord + 1] = {};
    while (!stopping_) {
        fd_set readable;
        FD_ZERO(&readable);
        FD_SET(fd, &readable);
        int ready = select(fd + 1, &readable, nullptr, nullptr, nullptr);
        if (ready < 1 || !FD_ISSET(fd, &readable) || read(fd, buffer, kMaxRecord) < 1) {
            usleep(kIdlePauseUs);
            continue;
        }
        // One read is one record; keep reading while the device has more.
        do {
            ParseEvent(buffer);
            memset(buffer, 0, sizeof(buffer));
        } while (read(fd, buffer, kMaxRecord) > 0);
    }
    close(fd);
}

void EventRadiator::ParseEvent(char* record) {
    int id = 0;
    unsigned long happenTime = 0;
    char firstToken[kMaxRecord + 1] = {};
    if (sscanf(record, "EventId %d -t %lu -paraList %4096s", &id, &happenTime, firstToken) < 3 || id < 1) {
        OLOGI("%s event invalid");
        return;
    }
    sp<Event> event = new Event("EventRadiator");
    event->ResetTimestamp();
    event->eventType = 2;  // a fault event, which log collection acts on
    event->eventId = static_cast<uint32_t>(id);
    event->happenTime = happenTime;
    // The value is cut from the record rather than taken from the token, so blanks inside the
    // parameter text survive. The search starts at the record's beginning: a token that also
    // appears earlier (say "5" in a record of id 5) makes the value start there.
    std::string text(record);
    event->SetValue(kKeyParamList, text.substr(text.find(firstToken)));
    PublishPipelineEvent(event);
}

}  // namespace Orvane
}  // namespace android
