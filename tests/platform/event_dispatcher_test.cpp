#include "platform/event_dispatcher.h"

#include "tests/platform/platform_test_util.h"

namespace android::Orvane {

struct RecordingListener : EventListener {
    RecordingListener(const std::string& name, Journal& log) : EventListener(name), log(log) {}
    void OnUnorderedEvent(sp<Event> event) override {
        log.Add(GetListenerName() + ":" + std::to_string(event->eventId));
    }
    Journal& log;
};

TEST(EventDispatcherTest, DeliversByTypeAndInclusiveIdRangeInRegistrationOrder) {
    Journal log;
    sp<EventDispatcher> dispatcher = new EventDispatcher();
    sp<RecordingListener> faults = new RecordingListener("faults", log);
    faults->AddListenerInfo(2, 900000000, 999999999);
    faults->AddListenerInfo(1, 0);
    sp<RecordingListener> control = new RecordingListener("control", log);
    control->AddListenerInfo(1, 101, 105);
    control->AddListenerInfo(1, 0, 0);
    control->AddListenerInfo(99, 1);
    dispatcher->AddListener(faults);
    dispatcher->AddListener(control);
    dispatcher->AddListener(faults);  // registered twice, called once

    struct {
        uint32_t type, id, dispatchType;
    } posts[] = {
            {1, 0, 1},                                           // the ready event: both, in registration order
            {2, 899999999, 1}, {2, 900000000, 1},                // just below the range, its first id
            {2, 999999999, 1}, {2, 1000000000, 1},               // its last id, just above
            {1, 900000000, 1}, {1, 101, 1},        {1, 106, 1},  // right id, wrong type; a range of the other
            {2, 950000000, 0},                                   // not for the unordered listeners at all
            {99, 1, 1},        {99, 2, 1},                       // a single id: that one only
    };
    for (const auto& post : posts) {
        sp<Event> event = new Event("dispatcher_test");
        event->eventType = post.type;
        event->eventId = post.id;
        event->dispatchType = post.dispatchType;
        EXPECT_EQ(dispatcher->OnEvent(event), 0);
    }
    EXPECT_EQ(log.Entries(), std::vector<std::string>({"faults:0", "control:0", "faults:900000000", "faults:999999999",
                                                       "control:101", "control:1"}));
}

}  // namespace android::Orvane
