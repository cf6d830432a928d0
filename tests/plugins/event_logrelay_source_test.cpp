#include "plugins/event_logrelay_source.h"

#include <gtest/gtest.h>

#include <fcntl.h>
#include <stdlib.h>
#include <sys/stat.h>
#include <unistd.h>

#include <string>

#include "platform/plugin_factory.h"
#include "plugins/event_radiator.h"
#include "plugins/file_monitor.h"
#include "tests/common/log_capture.h"
#include "tests/plugins/event_source_test_util.h"

namespace android {
namespace Orvane {
namespace {

const char* const kNoSupport = "openExceptionLogFd No kernel exception log monitor support (errno=";

class EventLogrelaySourceTest : public ::testing::Test {
protected:
    void SetUp() override {
        relay = new EventLogrelaySource();
        recorder = AttachRecorder(relay);
    }

    sp<EventLogrelaySource> relay;
    sp<RecordingPlugin> recorder;
};

TEST_F(EventLogrelaySourceTest, RegisteredAndNamedOnLoad) {
    LogCapture logs;
    sp<Plugin> plugin = PluginFactory::CreatePlugin("EventLogrelaySource");
    ASSERT_NE(nullptr, plugin);
    ASSERT_NE(nullptr, dynamic_cast<EventLogrelaySource*>(plugin.get()));
    plugin->OnLoad();
    EXPECT_EQ("EventLogrelaySource", plugin->GetName());
    EXPECT_EQ("EventLogrelaySource-1.0", plugin->GetVersion());
    EXPECT_TRUE(logs.Contains(ANDROID_LOG_DEBUG, "OnLoad Load logrelay source ")) << logs.Dump();
    // Unloading a source that never started has nothing to tear down.
    plugin->OnUnload();
}

TEST_F(EventLogrelaySourceTest, RecordsAreForwardedUnchanged) {
    const std::string records[] = {
        "kernel panic in module x\n",
        std::string("bin\0ary\xff\x01", 9),
        " padded  ",
    };
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

TEST_F(EventLogrelaySourceTest, MissingNodeEndsOnlyThisSource) {
    LogCapture logs;
    char folderTemplate[] = "/tmp/orvane-relay-XXXXXX";
    ASSERT_NE(nullptr, mkdtemp(folderTemplate));
    std::string fifo = std::string(folderTemplate) + "/qxev";
    ASSERT_EQ(0, mkfifo(fifo.c_str(), 0600));
    DeviceContext context{{"qxev", fifo}, {"qx_exception_log", std::string(folderTemplate) + "/absent"}};

    // The kernel event source keeps running beside the relay source that gave up.
    sp<EventRadiator> radiator = new EventRadiator();
    radiator->SetPluginContext(&context);
    sp<RecordingPlugin> radiated = AttachRecorder(radiator);
    SourceRunner radiatorRunner(radiator);
    relay->SetPluginContext(&context);
    SourceRunner relayRunner(relay);
    EXPECT_TRUE(relayRunner.WaitFinished());
    EXPECT_EQ(1u, logs.Count(ANDROID_LOG_ERROR, std::string(kNoSupport) + "2)")) << logs.Dump();
    EXPECT_TRUE(logs.Contains(ANDROID_LOG_DEBUG, "StartEventSource Logrelay start init"));
    EXPECT_FALSE(logs.Contains(ANDROID_LOG_DEBUG, "LogRelay start loop"));

    int writer = open(fifo.c_str(), O_WRONLY | O_CLOEXEC);
    ASSERT_GE(writer, 0);
    fcntl(writer, F_SETFL, fcntl(writer, F_GETFL) | O_DIRECT);
    std::string record = "EventId 901001001 -t 5 -paraList {}";
    ASSERT_EQ(static_cast<ssize_t>(record.size()), write(writer, record.data(), record.size()));
    EXPECT_TRUE(WaitUntil([&] { return radiated->Count() == 1; }));
    EXPECT_TRUE(radiatorRunner.Stop());
    close(writer);
    unlink(fifo.c_str());
    rmdir(folderTemplate);
}

TEST_F(EventLogrelaySourceTest, NodeWithoutPollSupportIsRefused) {
    LogCapture logs;
    // A regular file cannot be watched by epoll, like a node whose driver has no poll support.
    char fileTemplate[] = "/tmp/orvane-relay-plain-XXXXXX";
    int plain = mkstemp(fileTemplate);
    ASSERT_GE(plain, 0);
    close(plain);
    DeviceContext context{{"qx_exception_log", fileTemplate}};
    relay->SetPluginContext(&context);
    relay->StartEventSource();  // returns at once
    EXPECT_EQ(1u, logs.Count(ANDROID_LOG_ERROR,
                             "registerExceptionLogMonitor epoll_ctl for exception log monitor failed; errno=1"))
        << logs.Dump();
    relay->OnUnload();
    unlink(fileTemplate);
}

class LogrelayDevSimTest : public EventLogrelaySourceTest {
protected:
    void SetUp() override {
        EventLogrelaySourceTest::SetUp();
        std::string failure;
        if (!devsim.Start(&failure)) {
            GTEST_SKIP() << "device emulator unavailable: " << failure;
        }
        context.reset(new DeviceContext{{"qx_exception_log", devsim.Path("qx_exception_log")}});
        relay->SetPluginContext(context.get());
    }

    DevSim devsim;
    std::unique_ptr<DeviceContext> context;
};

TEST_F(LogrelayDevSimTest, PriorityRecordsBecomeEventsInPiecesOf1023Bytes) {
    LogCapture logs;
    SourceRunner runner(relay);
    ASSERT_TRUE(logs.WaitFor(ANDROID_LOG_DEBUG, "threadLoop LogRelay start loop"));
    std::string large;
    for (int i = 0; large.size() < 2000; ++i) {
        large += std::to_string(i % 10);
    }
    large.resize(2000);
    ASSERT_TRUE(devsim.Inject("qx_exception_log", large));
    ASSERT_TRUE(devsim.Inject("qx_exception_log", "oops at 0xdead\n"));
    ASSERT_TRUE(WaitUntil([&] { return recorder->Count() == 3; })) << recorder->Count();
    std::vector<sp<Event>> events = recorder->Events();
    EXPECT_EQ(large.substr(0, 1023), events[0]->GetValue("save_param_list"));
    EXPECT_EQ(large.substr(1023), events[1]->GetValue("save_param_list"));
    EXPECT_EQ("oops at 0xdead\n", events[2]->GetValue("save_param_list"));
    for (const sp<Event>& event : events) {
        EXPECT_EQ(902902u, event->eventId);
    }
    EXPECT_TRUE(runner.Stop());
    EXPECT_FALSE(logs.Contains(ANDROID_LOG_ERROR, "epoll_wait")) << logs.Dump();
}

TEST_F(LogrelayDevSimTest, UnloadWhileWaitingEndsTheLoop) {
    SourceRunner runner(relay);
    ASSERT_TRUE(devsim.Inject("qx_exception_log", "first"));
    ASSERT_TRUE(WaitUntil([&] { return recorder->Count() == 1; }));
    EXPECT_FALSE(runner.Finished());
    EXPECT_TRUE(runner.Stop());
    // The node is closed: a record written now reaches nobody.
    ASSERT_TRUE(devsim.Inject("qx_exception_log", "second"));
    EXPECT_EQ(1u, recorder->Count());
}

TEST_F(LogrelayDevSimTest, VanishedNodeKeepsTheSourceUntilUnload) {
    SourceRunner runner(relay);
    ASSERT_TRUE(devsim.Inject("qx_exception_log", "before"));
    ASSERT_TRUE(WaitUntil([&] { return recorder->Count() == 1; }));
    devsim.Stop();
    // Failed waits and reads are ridden out; only the unload ends the source.
    EXPECT_FALSE(runner.Finished());
    EXPECT_TRUE(runner.Stop());
    EXPECT_EQ(1u, recorder->Count());
}

}  // namespace
}  // namespace Orvane
}  // namespace android
