#ifndef ORVANE_PLATFORM_EVENT_HANDLER_H
#define ORVANE_PLATFORM_EVENT_HANDLER_H

#include <cstdint>
#include <string>

#include <utils/RefBase.h>
#include <utils/StrongPointer.h>

namespace android {
namespace Orvane {

class Event;

// A handler's result: 0 go on, 1 consumed (the pipeline stops after this handler), -1 failed
// (the pipeline stops, no listener is told). Any other value counts as 0.
typedef int32_t EVENT_RET;

// Receiver of events. A handler runs on the thread of the loop it is bound to, or on its
// caller's thread when it has none; handlers bound to one loop never run concurrently.
class EventHandler : public virtual RefBase {
public:
    virtual ~EventHandler() {}
    virtual EVENT_RET OnEvent(sp<Event>& event) {
        (void)event;
        return 0;
    }
    virtual bool CanProcessEvent(sp<Event> event) {
        (void)event;
        return true;
    }
    virtual std::string GetHandlerInfo() { return ""; }
};

}  // namespace Orvane
}  // namespace android

#endif  // ORVANE_PLATFORM_EVENT_HANDLER_H
