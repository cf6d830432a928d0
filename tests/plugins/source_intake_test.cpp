// What a source's intake is bounded by: the events its pipelines hold, counted from step 0 until
// they leave, whichever way they leave.
#include <future>

#include <gtest/gtest.h>

#include "tests/plugins/event_source_test_util.h"

namespace android::Orvane {
namespace {

// A step whose result depends on the event: id % 4 == 0 fails at the first step, 1 is consumed
// at the middle one, 2 passes every step, 3 is consumed by the last one.
struct SteeringPlugin : Plugin {
    SteeringPlugin(size_t step, PluginContext* context, bool accepts = true) : step(step), accepts(accepts) {
        SetPluginContext(context);
    }
    EVENT_RET OnEvent(sp<Event>& event) override {
        uint32_t kind = event->eventId % 4;
        if ((kind == 0 && step == 0) || (kind == 1 && step == 1) || (kind == 3 && step == 2))
            return kind == 0 ? -1 : 1;
        return 0;
    }
    bool CanProcessEvent(sp<Event>) override { return accepts; }

    const size_t step;
    const bool accepts;
};

TEST(SourceIntakeTest, BacklogCountsEachEventUntilItLeavesWhicheverWayItLeaves) {
    FakePluginContext context{"/tmp/", "/tmp/"};
    sp<EventLoop> first = new EventLoop("first_loop"), second = new EventLoop("second_loop");
    first->StartLoop();
    second->StartLoop();
    std::promise<void> release;
    first->AddTask([gate = release.get_future().share()] { gate.wait(); }, 0, false);
    std::vector<sp<Plugin>> steps = {new SteeringPlugin(0, &context), new SteeringPlugin(1, &context),
                                     new SteeringPlugin(2, &context)};
    steps[0]->SetLooper(first);
    steps[1]->SetLooper(second);
    steps[2]->SetLooper(second);
    sp<Pipeline> counted = new Pipeline("counted", steps);
    sp<RecordingPlugin> listener = new RecordingPlugin();
    listener->SetLooper(second);
    counted->RegisterPluginListener(listener);

    sp<EventSource> source = new EventSource();
    source->AddPipeline("refusing", new Pipeline("refusing", {new SteeringPlugin(0, &context, false)}));
    source->AddPipeline("counted", counted);
    constexpr uint32_t kPublished = 40, kInserted = 8;
    for (uint32_t id = 0; id < kPublished + kInserted; ++id) {
        sp<Event> event = new Event("test");
        event->eventId = id;
        // Inserted events enter at step 0 as InsertEventToPipeline hands them over.
        id < kPublished ? (void)source->PublishPipelineEvent(event) : counted->ProcessPipeline(event, 0);
    }
    EXPECT_EQ(kPublished + kInserted, source->Backlog());
    EXPECT_EQ(kPublished + kInserted, context.stats_.Value("pipeline.counted.published"));
    EXPECT_EQ(kPublished, context.stats_.Value("pipeline.refusing.refused"));
    EXPECT_EQ(0u, context.stats_.Value("pipeline.counted.refused"));
    release.set_value();
    EXPECT_TRUE(WaitUntil([&] { return source->Backlog() == 0; })) << source->Backlog();
    // Those that passed the last step, consumed there or not, reach the listener.
    EXPECT_TRUE(WaitUntil([&] { return listener->Count() == (kPublished + kInserted) / 2; })) << listener->Count();
    for (const sp<Event>& event : listener->Events())
        EXPECT_GE(event->eventId % 4, 2u) << event->eventId;
    EXPECT_EQ(kPublished + kInserted, context.stats_.Value("pipeline.counted.backlog_high"));
    first->StopLoop();
    second->StopLoop();
}

}  // namespace
}  // namespace android::Orvane
