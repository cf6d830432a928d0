#include "platform/pipeline.h"

#include <atomic>

#include "tests/platform/platform_test_util.h"

namespace android::Orvane {

// Records its step and returns a fixed result; a gate, when set, holds it while it runs.
class StepPlugin : public Plugin {
public:
    StepPlugin(const std::string& name, Journal& journal, EVENT_RET result = 0, bool accepts = true)
        : journal_(journal), result_(result), accepts_(accepts) {
        SetName(name);
    }
    EVENT_RET OnEvent(sp<Event>&) override {
        if (gate != nullptr) {
            started = true;
            gate->Wait();
        }
        journal_.Add(GetName());
        return result_;
    }
    bool CanProcessEvent(sp<Event>) override { return accepts_; }

    Gate* gate = nullptr;
    std::atomic<bool> started{false};

private:
    Journal& journal_;
    const EVENT_RET result_;
    const bool accepts_;
};

TEST(PipelineTest, FirstAcceptingPipelineTakesTheEvent) {
    Journal journal;
    sp<EventSource> source = new EventSource();
    source->AddPipeline("missing", nullptr);
    source->AddPipeline("empty", new Pipeline("empty", {}));
    source->AddPipeline("refusing", new Pipeline("refusing", {new StepPlugin("R", journal, 0, false)}));
    EXPECT_FALSE(source->PublishPipelineEvent(new Event("test")));
    source->AddPipeline("first", new Pipeline("first", {new StepPlugin("F1", journal), nullptr,
                                                        new StepPlugin("F2", journal)}));
    source->AddPipeline("second", new Pipeline("second", {new StepPlugin("S", journal)}));
    // No plugin has a loop: the whole pipeline ran on this thread before Publish returned.
    EXPECT_TRUE(source->PublishPipelineEvent(new Event("test")));
    EXPECT_EQ(journal.Entries(), std::vector<std::string>({"F1", "F2"}));
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
        std::vector<sp<Plugin>> plugins;
        for (size_t i = 0; i < c.results.size(); i++) {
            plugins.push_back(new StepPlugin("P" + std::to_string(i), journal, c.results[i]));
        }
        sp<Pipeline> pipeline = new Pipeline("results", plugins);
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
    for (const auto& loop : loops) {
        loop->StartLoop();
    }
    for (int i = 0; i < 4; i++) {
        steps[i]->SetLooper(loops[i < 2 ? 0 : i - 1]);
    }
    sp<Pipeline> pipeline = new Pipeline("same", {steps[0], steps[1], steps[2]});
    pipeline->RegisterPluginListener(steps[3]);
    pipeline->RegisterPluginListener(new StepPlugin("DirectListener", journal));
    Gate gate;
    steps[0]->gate = &gate;
    pipeline->ProcessPipeline(new Event("test"), 0);
    ASSERT_TRUE(WaitUntil([&] { return steps[0]->started.load(); }));
    // Queued while A runs: B posted as a task of its own would run after it.
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
