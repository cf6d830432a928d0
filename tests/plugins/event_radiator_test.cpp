#include "plugins/event_radiator.h"

#include <sys/resource.h>

#include <cstdint>

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

TEST(EventRadiatorTest, RecordsBecomeEventsAndBadOnesAreDroppedWithOneLineEach) {
    sp<Plugin> plugin = PluginFactory::CreatePlugin("EventRadiator");
    sp<EventRadiator> radiator = dynamic_cast<EventRadiator*>(plugin.get());
    ASSERT_NE(nullptr, radiator);
    sp<RecordingPlugin> recorder = AttachRecorder(radiator);
    LogCapture logs;
    const std::string records[] = {
            "EventId 901001001 -t 1690000000000 -paraList {a:1}",
            "EventId 901001002 -t 7 -paraList {a: 1, b: 2}\n",  // blanks and line feed belong to the text
            "EventId 15 -t 7 -paraList 5",                      // the first token "5" occurs earlier, in the id "15"
            // Two records in one read are one record: the second rides in the first one's parameters.
            "EventId 901001003 -t 8 -paraList {x:1}EventId 901001004 -t 9 -paraList {y:2}",
            "EventId 3 -t 99999999999999999999999 -paraList {}",  // saturates rather than wrapping
            // Invalid, one line each:
            "EventId 0 -t 5 -paraList {}",
            "EventId -7 -t 5 -paraList {}",
            "no keywords at all",
            "EventId 5 -t 7",
            "EventId 5 -t 7 -paraList ",
            "EventId x -t 7 -paraList {}",
            "eventid 5 -t 7 -paraList {}",
            std::string("\x01\xff\xfe binary\x7f", 12),
            "",
    };
    for (std::string record : records) {
        radiator->ParseEvent(&record[0]);
    }
    ExpectEvents(recorder->Events(), {{901001001u, 1690000000000ull, "{a:1}"},
                                      {901001002u, 7, "{a: 1, b: 2}\n"},
                                      {15, 7, "5 -t 7 -paraList 5"},
                                      {901001003u, 8, "{x:1}EventId 901001004 -t 9 -paraList {y:2}"},
                                      {3, UINT64_MAX, "{}"}});
    EXPECT_EQ(9u, logs.Count(ANDROID_LOG_INFO, kInvalid)) << logs.Dump();
}

TEST(EventRadiatorTest, ReadLoopEndsOnAMissingDeviceSplitsAt4096BytesKeepsOrderAndStops) {
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
        std::vector<int> taken;
        for (int fd = 0; fd >= 0 && fd < FD_SETSIZE;)
            taken.push_back(fd = dup(STDERR_FILENO));
        FakePluginContext crowded{"/tmp/", "/tmp/", {{"qxev", fifo.path}}};
        sp<EventRadiator> late = new EventRadiator();
        late->SetPluginContext(&crowded);
        late->StartEventSource();
        for (int fd : taken)
            close(fd);
        EXPECT_TRUE(logs.Contains(ANDROID_LOG_ERROR, "StartEventSource descriptor ")) << logs.Dump();
    }
    sp<EventRadiator> radiator = new EventRadiator();
    sp<RecordingPlugin> recorder = AttachRecorder(radiator);
    FakePluginContext context{"/tmp/", "/tmp/", {{"qxev", fifo.path}}};
    radiator->SetPluginContext(&context);
    SourceRunner runner(radiator);
    const std::string prefix = "EventId 901001005 -t 55 -paraList ";
    const std::string p(4096 - prefix.size(), 'p'), q(4096 - prefix.size(), 'q');
    // 5000 bytes: the first read takes 4096 of them; the other 904 have no keywords: invalid.
    ASSERT_TRUE(fifo.Write(prefix + p + std::string(904, 'p')));
    ASSERT_TRUE(fifo.Write("EventId 0 -t 100 -paraList {}"));
    ASSERT_TRUE(fifo.Write(prefix + q));  // exactly 4096: no room for a NUL, still whole
    std::vector<Expected> expected = {{901001005u, 55, p}, {901001005u, 55, q}};
    for (uint32_t id = 1; id <= 300; ++id) {
        std::string n = std::to_string(id), params = "{\"n\": " + n + "}";
        ASSERT_TRUE(fifo.Write("EventId " + n + " -t " + n + " -paraList " + params));
        expected.push_back({id, id, params});
    }
    ASSERT_TRUE(WaitUntil([&] { return recorder->Count() == expected.size(); })) << recorder->Count();
    ExpectEvents(recorder->Events(), expected);
    EXPECT_EQ(2u, logs.Count(ANDROID_LOG_INFO, kInvalid)) << logs.Dump();
    EXPECT_FALSE(runner.Finished());
    EXPECT_TRUE(runner.Stop());
}

}  // namespace
}  // namespace android::Orvane
