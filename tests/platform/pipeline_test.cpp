#include "platform/pipeline.h"

#include <gtest/gtest.h>

#include <atomic>
#include <string>
#include <thread>
#include <vector>

#include "platform/plugin_platform.h"
#include "tests/platform/platform_test_util.h"

namespace android {
namespace Orvane {
namespace {

class StepPlugin : public Plugin {
public:
    StepPlugin(const std::string& name, Journal& journal, EVENT_RET result = 0, bool accepts = true)
        : journal_(journal), result_(result), accepts_(accepts) {
        SetName(name);
    }
    EVENT_RET OnEvent(sp<Event>& event) override {
        if (gate_ != nullptr) {
            started_ = true;
            gate_->Wait();
        }
        event->SetValue("seen_by", event->GetValue("seen_by") + GetName() + ",");
        journal_.Add(GetName());
        return result_;
    }
    bool CanProcessEvent(sp<Event> event) override {
        (void)event;
        return accepts_;
    }
    // Makes OnEvent wait at the gate, so that a test can act while this step runs.
    void HoldAt(Gate* gate) { gate_ = gate; }
    bool Started() const { return started_; }

private:
    Journal& journal_;
    const EVENT_RET result_;
    const bool accepts_;
    Gate* gate_ = nullptr;
    std::atomic<bool> started_{false};
};

// A listener: only reads the event, as listeners on other loops must.
class WatchPlugin : public Plugin {
public:
    WatchPlugin(const std::string& name, Journal& journal) : journal_(journal) { SetName(name); }
    EVENT_RET OnEvent(sp<Event>& event) override {
        (void)event;
        journal_.Add(GetName());
        return 0;
    }

private:
    Journal& journal_;
};

class TestSource : public EventSource {};

sp<Event> NewEvent(uint32_t id) {
    sp<Event> event = new Event("pipeline_test");
    event->eventId = id;
    return event;
}

sp<EventLoop> NewLoop(const std::string& name) {
    sp<EventLoop> loop = new EventLoop(name);
    loop->StartLoop();
    return loop;
}

TEST(PipelineTest, FirstAcceptingPipelineTakesTheEvent) {
    LogCapture capture;
    Journal journal;
    sp<TestSource> source = new TestSource();
    source->SetName("TestSource");
    sp<Pipeline> empty = new Pipeline("empty", {});
    sp<Pipeline> refusing = new Pipeline("refusing", {new StepPlugin("R", journal, 0, false)});
    sp<Pipeline> first = new Pipeline("first", {new StepPlugin("F1", journal), new StepPlugin("F2", journal)});
    sp<Pipeline> second = new Pipeline("second", {new StepPlugin("S", journal)});
    source->AddPipeline("missing", nullptr);
    source->AddPipeline("empty", empty);
    source->AddPipeline("refusing", refusing);
    source->AddPipeline("first", first);
    source->AddPipeline("second", second);
    EXPECT_TRUE(capture.Contains(ANDROID_LOG_WARN, "AddPipeline missing pipeline nullptr, not add to TestSource."));
    EXPECT_TRUE(capture.Contains(ANDROID_LOG_DEBUG, "AddPipeline EventSource TestSource add pipeline first."));

    EXPECT_FALSE(source->PublishPipelineEvent(nullptr));
    sp<Event> event = NewEvent(7);
    EXPECT_TRUE(source->PublishPipelineEvent(event));
    // No plugin has a loop: the whole pipeline ran on this thread before Publish returned.
    EXPECT_EQ(journal.Entries(), std::vector<std::string>({"F1", "F2"}));
    EXPECT_EQ(event->GetValue("seen_by"), "F1,F2,");
    EXPECT_TRUE(capture.Contains(ANDROID_LOG_DEBUG, "CanProcessEvent no plugin processor in this pipeline"));

    sp<TestSource> picky = new TestSource();
    picky->AddPipeline("empty", empty);
    picky->AddPipeline("refusing", refusing);
    EXPECT_FALSE(picky->PublishPipelineEvent(NewEvent(8)));
    EXPECT_EQ(journal.Entries().size(), 2u);
}

TEST(PipelineTest, ResultsStopThePipelineAndDecideOnListeners) {
    struct Case {
        std::vector<EVENT_RET> results;
        std::vector<std::string> expected;  // the steps that run, then "L" when listeners are told
    };
    const std::vector<Case> cases = {
            {{0, 0, 0}, {"P0", "P1", "P2", "L"}},
            {{0, 7, 0}, {"P0", "P1", "P2", "L"}},  // unknown results count as 0
            {{0, 1, 0}, {"P0", "P1"}},             // consumed in the middle: no listeners
            {{0, -1, 0}, {"P0", "P1"}},            // failed in the middle: no listeners
            {{0, 0, 1}, {"P0", "P1", "P2", "L"}},  // consumed at the end: listeners still told
            {{0, 0, -1}, {"P0", "P1", "P2"}},      // failed at the end: no listeners
            {{-1}, {"P0"}},
            {{1}, {"P0", "L"}},
    };
    for (const auto& c : cases) {
        Journal journal;
        std::vector<sp<Plugin>> plugins;
        for (size_t i = 0; i < c.results.size(); i++) {
            plugins.push_back(new StepPlugin("P" + std::to_string(i), journal, c.results[i]));
        }
        sp<Pipeline> pipeline = new Pipeline("results", plugins);
        sp<Plugin> listener = new WatchPlugin("L", journal);
        pipeline->RegisterPluginListener(listener);
        pipeline->RegisterPluginListener(listener);
        pipeline->RegisterPluginListener(nullptr);
        EXPECT_EQ(pipeline->GetListeners().size(), 1u);
        pipeline->ProcessPipeline(NewEvent(1), 0);
        EXPECT_EQ(journal.Entries(), c.expected) << "results " << ::testing::PrintToString(c.results);
    }
}

TEST(PipelineTest, StepIndexBeyondThePluginsIsRefused) {
    LogCapture capture;
    Journal journal;
    sp<Pipeline> pipeline = new Pipeline("short", {new StepPlugin("A", journal), nullptr});
    EXPECT_TRUE(capture.Contains(ANDROID_LOG_WARN, "ConstructPipeline pipeline short, plugin 1, nullptr"));
    ASSERT_EQ(pipeline->GetPlugins().size(), 1u);
    pipeline->ProcessPipeline(NewEvent(1), 1);
    EXPECT_TRUE(capture.Contains(ANDROID_LOG_ERROR, "ProcessPipeline index over plugins size"));
    EXPECT_TRUE(journal.Entries().empty());
}

TEST(PipelineTest, SameLoopStepsRunInOneTask) {
    Journal journal;
    sp<EventLoop> loop = NewLoop("same_loop");
    sp<StepPlugin> a = new StepPlugin("A", journal);
    sp<StepPlugin> b = new StepPlugin("B", journal);
    sp<StepPlugin> c = new StepPlugin("C", journal);
    for (const auto& plugin : {a, b, c}) {
        plugin->SetLooper(loop);
    }
    Gate gate;
    a->HoldAt(&gate);
    sp<Pipeline> pipeline = new Pipeline("same", {a, b, c});
    pipeline->ProcessPipeline(NewEvent(2), 0);
    ASSERT_TRUE(WaitUntil([&] { return a->Started(); }));
    // Queued while A runs: a later step posted as a task of its own would run after it.
    loop->AddTask([&journal] { journal.Add("T"); }, 0, false);
    gate.Open();
    ASSERT_TRUE(journal.WaitForSize(4));
    EXPECT_EQ(journal.Entries(), std::vector<std::string>({"A", "B", "C", "T"}));
    std::thread::id loopThread = ThreadOfLoop(loop);
    EXPECT_EQ(journal.ThreadOf("B"), loopThread);
    EXPECT_EQ(journal.ThreadOf("C"), loopThread);
}

TEST(PipelineTest, EachStepRunsOnItsOwnLoopAndListenersOnTheirs) {
    Journal journal;
    sp<EventLoop> loops[] = {NewLoop("step_one"), NewLoop("step_two"), NewLoop("step_three")};
    sp<EventLoop> listenerLoop = NewLoop("listen_loop");
    std::vector<sp<Plugin>> plugins;
    for (int i = 0; i < 3; i++) {
        sp<Plugin> plugin = new StepPlugin("S" + std::to_string(i), journal);
        plugin->SetLooper(loops[i]);
        plugins.push_back(plugin);
    }
    sp<Pipeline> pipeline = new Pipeline("spread", plugins);
    sp<Plugin> onLoop = new WatchPlugin("LoopListener", journal);
    onLoop->SetLooper(listenerLoop);
    sp<Plugin> direct = new WatchPlugin("DirectListener", journal);
    pipeline->RegisterPluginListener(onLoop);
    pipeline->RegisterPluginListener(direct);

    sp<Event> event = NewEvent(3);
    pipeline->ProcessPipeline(event, 0);
    ASSERT_TRUE(journal.WaitForSize(5));
    std::vector<std::string> entries = journal.Entries();
    EXPECT_EQ(std::vector<std::string>(entries.begin(), entries.begin() + 3),
              std::vector<std::string>({"S0", "S1", "S2"}));
    for (int i = 0; i < 3; i++) {
        EXPECT_EQ(journal.ThreadOf("S" + std::to_string(i)), ThreadOfLoop(loops[i])) << i;
    }
    EXPECT_EQ(journal.ThreadOf("LoopListener"), ThreadOfLoop(listenerLoop));
    // A listener without a loop runs right after the last step, on that step's thread.
    EXPECT_EQ(journal.ThreadOf("DirectListener"), ThreadOfLoop(loops[2]));
    EXPECT_EQ(event->GetValue("seen_by"), "S0,S1,S2,");
}

TEST(PipelineTest, PluginKeepsItsFirstContextAndItsLoop) {
    PluginPlatform first;
    PluginPlatform second;
    Journal journal;
    sp<Plugin> plugin = new StepPlugin("P", journal);
    EXPECT_EQ(plugin->GetPluginContext(), nullptr);
    plugin->SetPluginContext(&first);
    plugin->SetPluginContext(&second);
    EXPECT_EQ(plugin->GetPluginContext(), &first);

    sp<EventLoop> loop = NewLoop("keep_loop");
    plugin->SetLooper(loop);
    plugin->SetLooper(nullptr);
    EXPECT_EQ(plugin->GetLooper(), loop);
    plugin->SetVersion("P-1.0");
    EXPECT_EQ(plugin->GetVersion(), "P-1.0");

    // Readers on other threads see either loop, whole, while it is replaced; the caller's
    // references are gone, so only the plugin keeps the replaced loops alive.
    std::atomic<bool> stop{false};
    std::thread reader([&] {
        while (!stop) {
            std::string name = plugin->GetLooper()->GetName();
            EXPECT_TRUE(name == "keep_loop" || name.rfind("swap_loop", 0) == 0) << name;
        }
    });
    loop = nullptr;
    for (int i = 0; i < 20; i++) {
        plugin->SetLooper(new EventLoop("swap_loop" + std::to_string(i)));
    }
    stop = true;
    reader.join();
    EXPECT_EQ(plugin->GetLooper()->GetName(), "swap_loop19");
}

}  // namespace
}  // namespace Orvane
}  // namespace android
