#include "plugins/event_logrelay_source.h"

#include <gtest/gtest.h>

#include "platform/plugin_factory.h"
#include "plugins/event_radiator.h"
#include "tests/plugins/event_source_test_util.h"

namespace android::Orvane {
namespace {

TEST(EventLogrelaySourceTest, RecordsAreForwardedUnchanged) {
    sp<Plugin> plugin = PluginFactory::CreatePlugin("EventLogrelaySource");
    sp<EventLogrelaySource> relay = dynamic_cast<EventLogrelaySource*>(plugin.get());
    ASSERT_NE(nullptr, relay);
    sp<RecordingPlugin> recorder = AttachRecorder(relay);
    const std::string records[] = {"kernel panic in module x\n", std::string("bin\0ary\xff\x01", 9), " padded  "};
    for (const std::string& record : records) {
        relay->ParseEvent(record);
    }
    std::vector<sp<Event>> events = recorder->Events();
    ASSERT_EQ(3u, events.size());
    for (size_t i = 0; i < events.size(); ++i) {
        EXPECT_EQ(902902u, events[i]->eventId);
        EXPECT_EQ("EventLogrelaySource", events[i]->sender);
        EXPECT_EQ(records[i], events[i]->GetValue("save_param_list"));
    }
}

TEST(EventLogrelaySourceTest, MissingOrUnpollableNodeEndsOnlyThisSourceWithOneLine) {
    LogCapture logs;
    PacketFifo fifo;
    // A regular file cannot be watched by epoll, like a node whose driver has no poll support.
    TemporaryFile plainFile;
    std::string plain = plainFile.path;
    FakePluginContext missing{"/tmp/", "/tmp/", {{"qxev", fifo.path}, {"qx_exception_log", fifo.path + ".absent"}}};
    FakePluginContext unpollable{"/tmp/", "/tmp/", {{"qx_exception_log", plain}}};
    // The kernel event source keeps running beside the relay sources that gave up.
    sp<EventRadiator> radiator = new EventRadiator();
    radiator->SetPluginContext(&missing);
    sp<RecordingPlugin> radiated = AttachRecorder(radiator);
    SourceRunner radiatorRunner(radiator);
    for (FakePluginContext* context : {&missing, &unpollable}) {
        sp<EventLogrelaySource> relay = new EventLogrelaySource();
        relay->SetPluginContext(context);
        SourceRunner relayRunner(relay);
        EXPECT_TRUE(WaitUntil([&] { return relayRunner.Finished(); }));
    }
    EXPECT_EQ(1u, logs.Count(ANDROID_LOG_ERROR, "openExceptionLogFd No kernel exception log monitor support (errno=2)"))
            << logs.Dump();
    EXPECT_EQ(1u, logs.Count(ANDROID_LOG_ERROR,
                             "registerExceptionLogMonitor epoll_ctl for exception log monitor failed; errno=1"));
    ASSERT_TRUE(fifo.Write("EventId 901001001 -t 5 -paraList {}"));
    EXPECT_TRUE(WaitUntil([&] { return radiated->Count() == 1; }));
    EXPECT_TRUE(radiatorRunner.Stop());
}

TEST(EventLogrelaySourceTest, PriorityRecordsBecomeEventsInPiecesOf1023BytesAcrossALostNode) {
    DevSim devsim;
    std::string failure;
    if (!devsim.Start(&failure)) {
        GTEST_SKIP() << "device emulator unavailable: " << failure;
    }
    LogCapture logs;
    sp<EventLogrelaySource> relay = new EventLogrelaySource();
    FakePluginContext context{"/tmp/", "/tmp/", {{"qx_exception_log", devsim.Path("qx_exception_log")}}};
    sp<RecordingPlugin> recorder = AttachRecorder(relay, &context);
    relay->SetPluginContext(&context);
    SourceRunner runner(relay);
    ASSERT_TRUE(logs.WaitFor(ANDROID_LOG_DEBUG, "threadLoop LogRelay start loop"));
    std::string large;
    while (large.size() < 2000) {
        large += std::to_string(large.size() % 10);
    }
    ASSERT_TRUE(devsim.Inject("qx_exception_log", large));
    ASSERT_TRUE(devsim.Inject("qx_exception_log", "oops at 0xdead\n"));
    ASSERT_TRUE(WaitUntil([&] { return recorder->Count() == 3; })) << recorder->Count();
    std::vector<sp<Event>> events = recorder->Events();
    EXPECT_EQ(large.substr(0, 1023), events[0]->GetValue("save_param_list"));
    EXPECT_EQ(large.substr(1023), events[1]->GetValue("save_param_list"));
    EXPECT_EQ("oops at 0xdead\n", events[2]->GetValue("save_param_list"));
    EXPECT_FALSE(logs.Contains(ANDROID_LOG_ERROR, "epoll_wait")) << logs.Dump();
    // The node vanishes and comes back: the source reopens it, one line each way, and goes on.
    devsim.Stop();
    ASSERT_TRUE(WaitUntil([&] { return context.stats_.Value("source.EventLogrelaySource.lost") == 1; }));
    ASSERT_TRUE(devsim.Start(&failure)) << failure;
    ASSERT_TRUE(devsim.Inject("qx_exception_log", "after the node came back"));
    ASSERT_TRUE(WaitUntil([&] { return recorder->Count() == 4; }, std::chrono::seconds(20))) << recorder->Count();
    EXPECT_EQ("after the node came back", recorder->Events().back()->GetValue("save_param_list"));
    EXPECT_EQ(1u, context.stats_.Value("source.EventLogrelaySource.reopened"));
    EXPECT_EQ(1u, logs.Count(ANDROID_LOG_WARN, " lost")) << logs.Dump();
    EXPECT_FALSE(runner.Finished());
    EXPECT_TRUE(runner.Stop());
}

}  // namespace
}  // namespace android::Orvane
