#include "platform/pipeline.h"

#include "tests/platform/platform_test_util.h"

namespace android::Orvane {

// Records its step and returns a fixed result.
struct StepPlugin : Plugin {
    StepPlugin(const std::string& name, Journal& journal, EVENT_RET result = 0, bool accepts = true)
        : journal(journal), result(result), accepts(accepts) {
        SetName(name);
    }
    EVENT_RET OnEvent(sp<Event>&) override {
        journal.Add(GetName());
        return result;
    }
    bool CanProcessEvent(sp<Event>) override { return accepts; }

    Journal& journal;
    const EVENT_RET result;
    const bool accepts;
};

TEST(PipelineTest, FirstAcceptingPipelineTakesTheEvent) {
    Journal log;
    sp<EventSource> source = new EventSource();
    source->AddPipeline("missing", nullptr);
    source->AddPipeline("empty", new Pipeline("empty", {}));
    source->AddPipeline("refusing", new Pipeline("refusing", {new StepPlugin("R", log, 0, false)}));
    EXPECT_FALSE(source->PublishPipelineEvent(new Event("test")));
    source->AddPipeline("1st", new Pipeline("1st", {new StepPlugin("F1", log), nullptr, new StepPlugin("F2", log)}));
    source->AddPipeline("second", new Pipeline("second", {new StepPlugin("S", log)}));
    // No plugin has a loop: the whole pipeline ran on this thread before Publish returned.
    EXPECT_TRUE(source->PublishPipelineEvent(new Event("test")));
    EXPECT_EQ(log.Entries(), std::vector<std::string>({"F1", "F2"}));
}

TEST(PipelineTest, ResultsStopThePipelineAndDecideOnListeners) {
    struct Case {
        std::vector<EVENT_RET> results;
        std::vector<std::string> expected;  // the steps that run, then "L" when listeners are told
    } cases[] = {
            {{0, 0, 0}, {"P0", "P1", "P2", "L"}},
            {{0, 7, 0}, {"P0", "P1", "P2", "L"}},  // unknown results count as 0
            {{0, 1, 0}, {"P0", "P1"}},             // consumed in the middle: no listeners
            {{0, -1, 0}, {"P0", "P1"}},            // failed in the middle: no listeners
            {{0, 0, 1}, {"P0", "P1", "P2", "L"}},  // consumed at the end: listeners still told
            {{0, 0, -1}, {"P0", "P1", "P2"}},      // failed at the end: no listeners
    };
    for (const auto& c : cases) {
        Journal journal;
        sp<Pipeline> pipeline = new Pipeline(
                "results", {new StepPlugin("P0", journal, c.results[0]), new StepPlugin("P1", journal, c.results[1]),
                            new StepPlugin("P2", journal, c.results[2])});
        sp<Plugin> listener = new StepPlugin("L", journal);
        pipeline->RegisterPluginListener(listener);
        pipeline->RegisterPluginListener(listener);  // told once
        pipeline->ProcessPipeline(new Event("test"), 0);
        EXPECT_EQ(journal.Entries(), c.expected) << ::testing::PrintToString(c.results);
    }
}

TEST(PipelineTest, SameLoopStepsRunInOneTaskOtherStepsAndListenersOnTheirLoops) {
    Journal journal;
    sp<EventLoop> loops[] = {new EventLoop("same_loop"), new EventLoop("next_loop"), new EventLoop("listen_loop")};
    sp<StepPlugin> steps[] = {new StepPlugin("A", journal), new StepPlugin("B", journal), new StepPlugin("C", journal),
                              new StepPlugin("LoopListener", journal)};
    for (const auto& loop : loops)
        loop->StartLoop();
    for (int i = 0; i < 4; i++)
        steps[i]->SetLooper(loops[i < 2 ? 0 : i - 1]);
    sp<Pipeline> pipeline = new Pipeline("same", {steps[0], steps[1], steps[2]});
    pipeline->RegisterPluginListener(steps[3]);
    pipeline->RegisterPluginListener(new StepPlugin("DirectListener", journal));
    Gate gate;
    loops[0]->AddTask([&gate] { gate.Wait(); }, 0, false);
    pipeline->ProcessPipeline(new Event("test"), 0);
    // Queued right behind A: B posted as a task of its own would run after it.
    loops[0]->AddTask([&journal] { journal.Add("T"); }, 0, false);
    gate.Open();
    ASSERT_TRUE(journal.WaitForSize(6));
    EXPECT_EQ(journal.Entries()[1], "B");
    // A listener without a loop runs right after the last step, on that step's thread.
    const std::pair<const char*, int> where[] = {{"B", 0}, {"C", 1}, {"LoopListener", 2}, {"DirectListener", 1}};
    for (const auto& [step, loop] : where) {
        EXPECT_EQ(journal.Find(step).thread, ThreadOfLoop(loops[loop])) << step;
    }
}

}  // namespace android::Orvane
