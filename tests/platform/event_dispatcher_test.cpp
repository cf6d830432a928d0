#include "platform/event_dispatcher.h"

#include "tests/platform/platform_test_util.h"

namespace android::Orvane {

class RecordingListener : public EventListener {
public:
    RecordingListener(const std::string& name, Journal& log) : EventListener(name), log_(log) {}
    void OnUnorderedEvent(sp<Event> event) override { log_.Add(GetListenerName() + ":" + std::to_string(event->eventId)); }

private:
    Journal& log_;
};

TEST(EventDispatcherTest, DeliversByTypeAndInclusiveIdRangeInRegistrationOrderOnItsLoop) {
    Journal log;
    sp<EventLoop> loop = new EventLoop("unorder_test");
    loop->StartLoop();
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
            {1, 0, 1},                                   // the ready event: both, in registration order
            {2, 899999999, 1}, {2, 900000000, 1},        // just below the range, its first id
            {2, 999999999, 1}, {2, 1000000000, 1},       // its last id, just above
            {1, 900000000, 1}, {1, 101, 1}, {1, 106, 1},  // right id, wrong type; a range of the other
            {2, 950000000, 0},                           // not for the unordered listeners at all
            {99, 1, 1},                                  // the last one: once it arrived, all before it did
    };
    for (const auto& post : posts) {
        sp<Event> event = new Event("dispatcher_test");
        event->eventType = post.type;
        event->eventId = post.id;
        event->dispatchType = post.dispatchType;
        loop->AddEvent(dispatcher, event, 0, false);
    }
    ASSERT_TRUE(log.WaitFor("control:1"));
    EXPECT_EQ(log.Entries(), std::vector<std::string>({"faults:0", "control:0", "faults:900000000",
                                                       "faults:999999999", "control:101", "control:1"}));
    EXPECT_EQ(log.Find("faults:900000000").thread, ThreadOfLoop(loop));
}

}  // namespace android::Orvane
