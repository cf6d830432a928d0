#ifndef ORVANE_PLATFORM_EVENT_DISPATCHER_H
#define ORVANE_PLATFORM_EVENT_DISPATCHER_H

#include <string>
#include <vector>

#include <utils/Mutex.h>
#include <utils/StrongPointer.h>

#include "platform/event.h"
#include "platform/plugin.h"

namespace android {
namespace Orvane {

// Delivers unordered events to the listeners registered for them. The platform binds it to the
// loop "qx_unorder" and queues every unordered event there; `OnEvent` then calls each matching
// listener's OnUnorderedEvent on that loop, in registration order. Listeners may register from
// any thread; `listenersLock_` guards the list, which is copied before the calls.
class EventDispatcher : public Plugin {
public:
    // Events whose dispatch type differs from this are not for the unordered listeners.
    static constexpr uint32_t kDispatchType = 1;

    void OnLoad() override;
    EVENT_RET OnEvent(sp<Event>& event) override;

    // A listener registered twice is kept once.
    void AddListener(sp<EventListener> listener);
    std::vector<sp<EventListener>> GetListeners();

private:
    Mutex listenersLock_;
    std::vector<sp<EventListener>> listeners_ GUARDED_BY(listenersLock_);
};

}  // namespace Orvane
}  // namespace android

#endif  // ORVANE_PLATFORM_EVENT_DISPATCHER_H
