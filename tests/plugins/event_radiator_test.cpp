#include "plugins/event_radiator.h"

#include <sys/resource.h>

#include <cstdint>
#include <future>

#include <gtest/gtest.h>

#include "platform/plugin_factory.h"
#include "tests/plugins/event_source_test_util.h"

namespace android::Orvane {
namespace {

const char* const kInvalid = "ParseEvent event invalid";

struct Expected {
    uint32_t id;
    uint64_t happenTime;
    std::string paramList;
};

void ExpectEvents(const std::vector<sp<Event>>& events, const std::vector<Expected>& expected) {
    ASSERT_EQ(expected.size(), events.size());
    for (size_t i = 0; i < expected.size(); ++i) {
        SCOPED_TRACE(i);
        EXPECT_EQ("EventRadiator", events[i]->sender);
        EXPECT_EQ(expected[i].id, events[i]->eventId);
        EXPECT_EQ(expected[i].happenTime, events[i]->happenTime);
        EXPECT_EQ(expected[i].paramList, events[i]->GetValue("param_list"));
    }
}

uint64_t Rejected(FakePluginContext& context, const std::string& reason) {
    return context.stats_.Value("source.EventRadiator.rejected." + reason);
}

TEST(EventRadiatorTest, RecordsBecomeEventsAndBadOnesAreRejectedByReasonInOneLine) {
    sp<Plugin> plugin = PluginFactory::CreatePlugin("EventRadiator");
    sp<EventRadiator> radiator = dynamic_cast<EventRadiator*>(plugin.get());
    ASSERT_NE(nullptr, radiator);
    FakePluginContext context{"/tmp/", "/tmp/"};
    radiator->SetPluginContext(&context);
    sp<RecordingPlugin> recorder = AttachRecorder(radiator, &context);
    LogCapture logs;
    const std::string records[] = {
            "EventId 901001001 -t 1690000000000 -paraList {a:1}",
            "EventId 901001002 -t 7 -paraList {a: 1, b: 2}\n",  // blanks and line feed belong to the text
            "EventId 15 -t 7 -paraList 5",                      // the first token "5" occurs earlier, in the id "15"
            // Two records in one read are one record: the second rides in the first one's parameters.
            "EventId 901001003 -t 8 -paraList {x:1}EventId 901001004 -t 9 -paraList {y:2}",
            "EventId 2147483647 -t 9223372036854775807 -paraList {max}",  // the largest id and time
            "EventId\t+8 -t +9 -paraList x",                              // what the scan format admits
            // Rejected for their form:
            "no keywords at all",
            "EventId 5 -t 7",
            "EventId 5 -t 7 -paraList ",
            "EventId x -t 7 -paraList {}",
            "eventid 5 -t 7 -paraList {}",
            " EventId 5 -t 7 -paraList {}",  // the keyword starts the record
            std::string("\x01\xff\xfe binary\x7f", 12),
            "",
            // ... for their id: below 1, or beyond what the id holds instead of wrapping to another.
            "EventId 0 -t 5 -paraList {}",
            "EventId -7 -t 5 -paraList {}",
            "EventId 5195968298 -t 5 -paraList {}",
            "EventId 2147483648 -t 5 -paraList {}",
            "EventId 99999999999999999999999 -t 5 -paraList {}",
            // ... for their time: negative or beyond a signed 64-bit count, which storage cannot keep.
            "EventId 3 -t -1 -paraList {}",
            "EventId 3 -t 9223372036854775808 -paraList {}",
            "EventId 3 -t 18446744073709551616 -paraList {}",
            "EventId 3 -t 99999999999999999999999 -paraList {}",
    };
    for (std::string record : records) {
        radiator->ParseEvent(&record[0]);
    }
    ExpectEvents(recorder->Events(), {{901001001u, 1690000000000ull, "{a:1}"},
                                      {901001002u, 7, "{a: 1, b: 2}\n"},
                                      {15, 7, "5 -t 7 -paraList 5"},
                                      {901001003u, 8, "{x:1}EventId 901001004 -t 9 -paraList {y:2}"},
                                      {2147483647u, 9223372036854775807ull, "{max}"},
                                      {8, 9, "x"}});
    EXPECT_EQ(8u, Rejected(context, "format"));
    EXPECT_EQ(5u, Rejected(context, "id"));
    EXPECT_EQ(4u, Rejected(context, "time"));
    // The first line as it always was; the 16 after it within the window are only counted.
    EXPECT_EQ(1u, logs.Count(ANDROID_LOG_INFO, kInvalid)) << logs.Dump();
}

TEST(EventRadiatorTest, ReadLoopEndsOnAMissingDeviceKeepsOrderAndStops) {
    LogCapture logs;
    FakePluginContext missing{"/tmp/", "/tmp/", {{"qxev", "/nonexistent/qxev"}}};
    sp<EventRadiator> lost = new EventRadiator();
    lost->SetPluginContext(&missing);
    lost->StartEventSource();  // returns instead of blocking
    EXPECT_EQ(1u, logs.Count(ANDROID_LOG_ERROR, "StartEventSource open log exception failed")) << logs.Dump();
    PacketFifo fifo;
    struct rlimit files = {};
    getrlimit(RLIMIT_NOFILE, &files);
    files.rlim_cur = files.rlim_max;
    if (setrlimit(RLIMIT_NOFILE, &files) == 0 && files.rlim_cur > FD_SETSIZE + 16) {
        // With every descriptor select can watch taken, the node's is refused rather than overrun.
        std::vector<android::base::unique_fd> taken;
        while (taken.empty() || (taken.back().ok() && taken.back().get() < FD_SETSIZE))
            taken.emplace_back(dup(STDERR_FILENO));
        FakePluginContext crowded{"/tmp/", "/tmp/", {{"qxev", fifo.path}}};
        sp<EventRadiator> late = new EventRadiator();
        late->SetPluginContext(&crowded);
        late->StartEventSource();
        taken.clear();
        EXPECT_TRUE(logs.Contains(ANDROID_LOG_ERROR, "StartEventSource descriptor ")) << logs.Dump();
    }
    sp<EventRadiator> radiator = new EventRadiator();
    FakePluginContext context{"/tmp/", "/tmp/", {{"qxev", fifo.path}}};
    sp<RecordingPlugin> recorder = AttachRecorder(radiator, &context);
    radiator->SetPluginContext(&context);
    SourceRunner runner(radiator);
    const std::string prefix = "EventId 901001005 -t 55 -paraList ";
    const std::string q(4096 - prefix.size(), 'q');
    ASSERT_TRUE(fifo.Write("EventId 0 -t 100 -paraList {}"));
    ASSERT_TRUE(fifo.Write(prefix + q));  // exactly 4096: no room for a NUL, still whole
    std::vector<Expected> expected = {{901001005u, 55, q}};
    for (uint32_t id = 1; id <= 300; ++id) {
        std::string n = std::to_string(id), params = "{\"n\": " + n + "}";
        ASSERT_TRUE(fifo.Write("EventId " + n + " -t " + n + " -paraList " + params));
        expected.push_back({id, id, params});
    }
    ASSERT_TRUE(WaitUntil([&] { return recorder->Count() == expected.size(); })) << recorder->Count();
    ExpectEvents(recorder->Events(), expected);
    EXPECT_EQ(1u, Rejected(context, "id"));
    EXPECT_EQ(302u, context.stats_.Value("source.EventRadiator.read"));
    EXPECT_FALSE(runner.Finished());
    EXPECT_TRUE(runner.Stop());
}

// The first step of a pipeline held on its loop until the test lets it go.
struct GatedRecorder {
    GatedRecorder(const sp<EventSource>& source, FakePluginContext& context) : loop(new EventLoop("gated_loop")) {
        loop->StartLoop();
        loop->AddTask([this] { gate.wait(); }, 0, false);
        recorder = AttachRecorder(source, &context);
        recorder->SetLooper(loop);
    }
    ~GatedRecorder() {
        Open();
        loop->StopLoop();
    }
    void Open() {
        if (!opened.exchange(true))
            release.set_value();
    }

    sp<EventLoop> loop;
    std::promise<void> release;
    std::shared_future<void> gate = release.get_future().share();
    std::atomic<bool> opened{false};
    sp<RecordingPlugin> recorder;
};

TEST(EventRadiatorTest, ReadingPausesWhileThePipelinesAreFullAndLosesNothing) {
    PacketFifo fifo;
    FakePluginContext context{"/tmp/", "/tmp/", {{"qxev", fifo.path}}};
    sp<EventRadiator> radiator = new EventRadiator();
    radiator->SetPluginContext(&context);
    GatedRecorder gated(radiator, context);
    SourceRunner runner(radiator);
    constexpr uint32_t kRecords = 3000;
    std::thread writer([&] {
        for (uint32_t id = 1; id <= kRecords; ++id)
            ASSERT_TRUE(fifo.Write("EventId " + std::to_string(id) + " -t 1 -paraList {}"));
    });
    // The pipeline stands still: the source stops reading once it holds the high mark, and the
    // rest waits in the device.
    EXPECT_TRUE(WaitUntil([&] { return context.stats_.Value("source.EventRadiator.deferred") == 1; }));
    EXPECT_EQ(DeviceSource::kBacklogHigh, context.stats_.Value("pipeline.dftFaultEvent.published"));
    gated.Open();
    ASSERT_TRUE(WaitUntil([&] { return gated.recorder->Count() == kRecords; })) << gated.recorder->Count();
    writer.join();
    std::vector<sp<Event>> events = gated.recorder->Events();
    for (uint32_t i = 0; i < kRecords; ++i)
        ASSERT_EQ(i + 1, events[i]->eventId);
    EXPECT_EQ(DeviceSource::kBacklogHigh, context.stats_.Value("pipeline.dftFaultEvent.backlog_high"));
    EXPECT_EQ(kRecords, context.stats_.Value("pipeline.dftFaultEvent.published"));
    EXPECT_TRUE(runner.Stop());
}

// The emulated device hands over what a driver would: a record longer than a read in pieces.
TEST(EventRadiatorTest, OverLongRecordsAreDroppedWholeAndCannotForgeAnEvent) {
    DevSim devsim;
    std::string failure;
    if (!devsim.Start(&failure)) {
        GTEST_SKIP() << "device emulator unavailable: " << failure;
    }
    FakePluginContext context{"/tmp/", "/tmp/", {{"qxev", devsim.Path("qxev")}}};
    sp<EventRadiator> radiator = new EventRadiator();
    radiator->SetPluginContext(&context);
    sp<RecordingPlugin> recorder = AttachRecorder(radiator, &context);
    SourceRunner runner(radiator);
    const std::string prefix = "EventId 901001005 -t 55 -paraList ";
    const std::string forged = "EventId 901001009 -t 42 -paraList {\"forged\": 1}";
    // Tails that start where a read of the record would end, in the second and third piece.
    for (size_t cut : {4096, 4097, 8194}) {
        ASSERT_TRUE(devsim.Inject("qxev", prefix + std::string(cut - prefix.size(), 'p') + forged));
    }
    const std::string whole(4096 - prefix.size(), 'q');
    ASSERT_TRUE(devsim.Inject("qxev", prefix + whole));  // the longest record there is, still whole
    ASSERT_TRUE(devsim.Inject("qxev", "EventId 901001006 -t 56 -paraList {\"after\": 1}"));
    ASSERT_TRUE(WaitUntil([&] { return recorder->Count() == 2; })) << recorder->Count();
    ExpectEvents(recorder->Events(), {{901001005u, 55, whole}, {901001006u, 56, "{\"after\": 1}"}});
    EXPECT_EQ(3u, Rejected(context, "too_long"));
    EXPECT_TRUE(runner.Stop());
}

}  // namespace
}  // namespace android::Orvane
