#include "platform/event_dispatcher.h"

#include <algorithm>

#include "utils/orvane_log.h"

namespace android {
namespace Orvane {

void EventDispatcher::OnLoad() {
    SetName("EventDispatcher");
    SetVersion("EventDispatcher-1.0");
}

EVENT_RET EventDispatcher::OnEvent(sp<Event>& event) {
    if (event == nullptr) {
        OLOGW_LIMITED("%s event is null");
        return -1;
    }
    if (event->dispatchType != kDispatchType) {
        OLOGD("%s event %u of %s has dispatch type %u, not dispatched", event->eventId, event->sender.c_str(),
              event->dispatchType);
        return 0;
    }
    for (const auto& listener : GetListeners()) {
        if (listener->IsInterested(*event)) {
            listener->OnUnorderedEvent(event);
        }
    }
    return 0;
}

void EventDispatcher::AddListener(sp<EventListener> listener) {
    if (listener == nullptr) {
        OLOGW("%s listener is null");
        return;
    }
    {
        Mutex::Autolock lock(listenersLock_);
        if (std::find(listeners_.begin(), listeners_.end(), listener) != listeners_.end()) {
            return;
        }
        listeners_.push_back(listener);
    }
    OLOGD("%s listener %s added", listener->GetListenerName().c_str());
}

std::vector<sp<EventListener>> EventDispatcher::GetListeners() {
    Mutex::Autolock lock(listenersLock_);
    return listeners_;
}

}  // namespace Orvane
}  // namespace android
