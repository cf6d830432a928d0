#include "platform/event_dispatcher.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <string>
#include <vector>

#include "tests/platform/platform_test_util.h"

namespace android {
namespace Orvane {
namespace {

class RecordingListener : public EventListener {
public:
    RecordingListener(const std::string& name, Journal& log) : EventListener(name), log_(log) {}
    void OnUnorderedEvent(sp<Event> event) override {
        log_.Add(GetListenerName() + ":" + std::to_string(event->eventId));
    }

private:
    Journal& log_;
};

class EventDispatcherTest : public testing::Test {
protected:
    void SetUp() override {
        loop_ = new EventLoop("unorder_test");
        loop_->StartLoop();
        dispatcher_ = new EventDispatcher();
        dispatcher_->SetLooper(loop_);
        dispatcher_->OnLoad();
    }

    void Post(uint32_t type, uint32_t id, uint32_t dispatchType = EventDispatcher::kDispatchType) {
        sp<Event> event = new Event("dispatcher_test");
        event->eventType = type;
        event->eventId = id;
        event->dispatchType = dispatchType;
        loop_->AddEvent(dispatcher_, event, 0, false);
    }

    // A marker event, new each time, that only `marker` listens to: once it arrived, everything
    // posted before it did.
    void Drain(Journal& log) {
        std::string expected = "marker:" + std::to_string(++drains_);
        Post(99, drains_);
        ASSERT_TRUE(WaitUntil([&] {
            auto entries = log.Entries();
            return std::find(entries.begin(), entries.end(), expected) != entries.end();
        }));
    }

    uint32_t drains_ = 0;

    sp<EventLoop> loop_;
    sp<EventDispatcher> dispatcher_;
};

TEST_F(EventDispatcherTest, DeliversByTypeAndInclusiveIdRangeInRegistrationOrder) {
    Journal log;
    sp<RecordingListener> faults = new RecordingListener("faults", log);
    faults->AddListenerInfo(2, 900000000, 999999999);
    faults->AddListenerInfo(1, 0);
    sp<RecordingListener> control = new RecordingListener("control", log);
    control->AddListenerInfo(1, 101, 105);
    control->AddListenerInfo(1, 0, 0);
    sp<RecordingListener> silent = new RecordingListener("silent", log);
    sp<RecordingListener> marker = new RecordingListener("marker", log);
    marker->AddListenerInfo(99, 1, 1000);

    dispatcher_->AddListener(faults);
    dispatcher_->AddListener(control);
    dispatcher_->AddListener(faults);  // registered twice, called once
    dispatcher_->AddListener(silent);
    dispatcher_->AddListener(marker);
    dispatcher_->AddListener(nullptr);
    EXPECT_EQ(dispatcher_->GetListeners().size(), 4u);
    EXPECT_EQ(faults->GetListenerInfo().size(), 2u);

    Post(1, 0);           // the ready event: both, in registration order
    Post(2, 899999999);   // just below the range
    Post(2, 900000000);   // first id
    Post(2, 999999999);   // last id
    Post(2, 1000000000);  // just above
    Post(1, 900000000);   // right id, wrong type
    Post(1, 101);
    Post(1, 106);
    Post(2, 950000000, 0);  // not for the unordered listeners at all
    Drain(log);

    EXPECT_EQ(log.Entries(), std::vector<std::string>({"faults:0", "control:0", "faults:900000000", "faults:999999999",
                                                       "control:101", "marker:1"}));
    std::thread::id loopThread = ThreadOfLoop(loop_);
    for (const auto& record : log.Records()) {
        EXPECT_EQ(record.thread, loopThread) << record.what;
    }
}

TEST_F(EventDispatcherTest, RegistrationsAddedWhileEventsFlowAreSafe) {
    Journal log;
    sp<RecordingListener> growing = new RecordingListener("growing", log);
    sp<RecordingListener> marker = new RecordingListener("marker", log);
    marker->AddListenerInfo(99, 1, 1000);
    dispatcher_->AddListener(growing);
    dispatcher_->AddListener(marker);

    std::thread poster([&] {
        for (uint32_t i = 0; i < 200; i++) {
            Post(5, i);
        }
    });
    for (uint32_t i = 0; i < 200; i++) {
        growing->AddListenerInfo(5, i);
        dispatcher_->AddListener(new RecordingListener("extra", log));
    }
    poster.join();
    Drain(log);
    // After the marker, every id is registered: a second round reaches "growing" for each.
    for (uint32_t i = 0; i < 200; i++) {
        Post(5, i);
    }
    Drain(log);
    size_t growingCalls = 0;
    for (const auto& entry : log.Entries()) {
        growingCalls += entry.rfind("growing:", 0) == 0;
    }
    EXPECT_GE(growingCalls, 200u);
    EXPECT_LE(growingCalls, 400u);
    EXPECT_EQ(dispatcher_->GetListeners().size(), 202u);
}

TEST_F(EventDispatcherTest, EmptyEventIsRefused) {
    LogCapture capture;
    sp<Event> empty;
    EXPECT_EQ(dispatcher_->OnEvent(empty), -1);
    EXPECT_TRUE(capture.Contains(ANDROID_LOG_WARN, "OnEvent event is null"));
    EXPECT_EQ(dispatcher_->GetName(), "EventDispatcher");
    EXPECT_EQ(dispatcher_->GetVersion(), "EventDispatcher-1.0");
}

}  // namespace
}  // namespace Orvane
}  // namespace android
