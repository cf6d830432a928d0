#include "plugins/event_radiator.h"

#include <gtest/gtest.h>

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cstdint>
#include <string>

#include "platform/plugin_factory.h"
#include "tests/common/log_capture.h"
#include "tests/plugins/event_source_test_util.h"

namespace android {
namespace Orvane {
namespace {

const char* const kInvalid = "ParseEvent event invalid";

struct ParsedRecord {
    uint32_t id;
    uint64_t happenTime;
    std::string paramList;
};

class EventRadiatorTest : public ::testing::Test {
protected:
    void SetUp() override {
        radiator = new EventRadiator();
        recorder = AttachRecorder(radiator);
    }

    void Parse(std::string record) { radiator->ParseEvent(&record[0]); }

    void ExpectEvents(const std::vector<ParsedRecord>& expected) {
        std::vector<sp<Event>> events = recorder->Events();
        ASSERT_EQ(expected.size(), events.size());
        for (size_t i = 0; i < expected.size(); ++i) {
            SCOPED_TRACE(i);
            EXPECT_EQ("EventRadiator", events[i]->sender);
            EXPECT_EQ(expected[i].id, events[i]->eventId);
            EXPECT_EQ(expected[i].happenTime, events[i]->happenTime);
            EXPECT_EQ(expected[i].paramList, events[i]->GetValue("param_list"));
            EXPECT_GT(events[i]->timestamp, 0u);
        }
    }

    sp<EventRadiator> radiator;
    sp<RecordingPlugin> recorder;
};

TEST_F(EventRadiatorTest, RegisteredAndNamedOnLoad) {
    sp<Plugin> plugin = PluginFactory::CreatePlugin("EventRadiator");
    ASSERT_NE(nullptr, plugin);
    ASSERT_NE(nullptr, dynamic_cast<EventRadiator*>(plugin.get()));
    plugin->SetName("configured");
    plugin->OnLoad();
    EXPECT_EQ("EventRadiator", plugin->GetName());
    EXPECT_EQ("EventRadiator-1.0", plugin->GetVersion());
}

TEST_F(EventRadiatorTest, ParameterTextIsCutFromTheRecord) {
    Parse("EventId 901001001 -t 1690000000000 -paraList {a:1}");
    // Blanks and the trailing line feed belong to the parameter text.
    Parse("EventId 901001002 -t 7 -paraList {a: 1, b: 2}\n");
    // The first token "5" also occurs in the id "15", so the value starts there.
    Parse("EventId 15 -t 7 -paraList 5");
    // Two records in one read are one record: the second rides in the first one's parameters.
    Parse("EventId 901001003 -t 8 -paraList {x:1}EventId 901001004 -t 9 -paraList {y:2}");
    // A time beyond 64 bits saturates rather than wrapping around.
    Parse("EventId 3 -t 99999999999999999999999 -paraList {}");
    ExpectEvents({{901001001u, 1690000000000ull, "{a:1}"},
                  {901001002u, 7, "{a: 1, b: 2}\n"},
                  {15, 7, "5 -t 7 -paraList 5"},
                  {901001003u, 8, "{x:1}EventId 901001004 -t 9 -paraList {y:2}"},
                  {3, UINT64_MAX, "{}"}});
}

TEST_F(EventRadiatorTest, InvalidRecordsAreDroppedWithOneLineEach) {
    LogCapture logs;
    const std::vector<std::string> invalid = {
        "EventId 0 -t 5 -paraList {}",
        "EventId -7 -t 5 -paraList {}",
        "no keywords at all",
        "EventId 5 -t 7",                 // no parameter text
        "EventId 5 -t 7 -paraList ",      // keyword without text
        "EventId x -t 7 -paraList {}",
        "eventid 5 -t 7 -paraList {}",    // keywords are case-sensitive
        std::string("\x01\xff\xfe binary\x7f", 12),
        "",
    };
    for (const std::string& record : invalid) {
        Parse(record);
    }
    EXPECT_EQ(0u, recorder->Count());
    EXPECT_EQ(invalid.size(), logs.Count(ANDROID_LOG_INFO, kInvalid)) << logs.Dump();
}

TEST_F(EventRadiatorTest, MissingDeviceEndsTheSourceWithOneLine) {
    LogCapture logs;
    DeviceContext context{{"qxev", "/nonexistent/qxev"}};
    radiator->SetPluginContext(&context);
    radiator->StartEventSource();  // returns instead of blocking
    EXPECT_EQ(1u, logs.Count(ANDROID_LOG_ERROR, "StartEventSource open log exception failed")) << logs.Dump();
}

// A FIFO written in packet mode stands in for the device: one write, one read.
class RadiatorFifoTest : public EventRadiatorTest {
protected:
    void SetUp() override {
        EventRadiatorTest::SetUp();
        char folderTemplate[] = "/tmp/orvane-radiator-XXXXXX";
        ASSERT_NE(nullptr, mkdtemp(folderTemplate));
        folder = folderTemplate;
        path = folder + "/qxev";
        ASSERT_EQ(0, mkfifo(path.c_str(), 0600));
    }
    void TearDown() override {
        unlink(path.c_str());
        rmdir(folder.c_str());
    }

    // The writer end; O_DIRECT is refused at open and must be set afterwards.
    int OpenWriter() {
        int fd = open(path.c_str(), O_WRONLY | O_CLOEXEC);
        if (fd >= 0) {
            fcntl(fd, F_SETFL, fcntl(fd, F_GETFL) | O_DIRECT);
        }
        return fd;
    }

    std::string folder;
    std::string path;
};

TEST_F(RadiatorFifoTest, ReadLoopPublishesEveryRecordInOrderAndStops) {
    LogCapture logs;
    DeviceContext context{{"qxev", path}};
    radiator->SetPluginContext(&context);
    SourceRunner runner(radiator);
    int writer = OpenWriter();  // blocks until the source has opened its end
    ASSERT_GE(writer, 0);
    const std::vector<std::string> records = {
        "EventId 901001001 -t 100 -paraList {\"a\":1}",
        "EventId 0 -t 100 -paraList {}",
        "EventId 901001002 -t 101 -paraList {\"b\": 2, \"c\": 3}",
    };
    for (const std::string& record : records) {
        ASSERT_EQ(static_cast<ssize_t>(record.size()), write(writer, record.data(), record.size()));
    }
    ASSERT_TRUE(WaitUntil([&] { return recorder->Count() == 2 && logs.Contains(ANDROID_LOG_INFO, kInvalid); }))
        << logs.Dump();
    ExpectEvents({{901001001u, 100, "{\"a\":1}"}, {901001002u, 101, "{\"b\": 2, \"c\": 3}"}});
    EXPECT_FALSE(runner.Finished());
    EXPECT_TRUE(runner.Stop());
    close(writer);
}

class RadiatorDevSimTest : public EventRadiatorTest {
protected:
    void SetUp() override {
        EventRadiatorTest::SetUp();
        std::string failure;
        if (!devsim.Start(&failure)) {
            GTEST_SKIP() << "device emulator unavailable: " << failure;
        }
        context.reset(new DeviceContext{{"qxev", devsim.Path("qxev")}});
        radiator->SetPluginContext(context.get());
    }

    DevSim devsim;
    std::unique_ptr<DeviceContext> context;
};

TEST_F(RadiatorDevSimTest, LongRecordsArriveInPiecesAndBurstsKeepTheirOrder) {
    LogCapture logs;
    SourceRunner runner(radiator);
    const std::string prefix = "EventId 901001005 -t 55 -paraList ";
    // 5000 bytes: the first read takes 4096 of them and is a record of its own; the remaining
    // 904 bytes have no keywords and are dropped as invalid.
    std::string longRecord = prefix + std::string(5000 - prefix.size(), 'p');
    ASSERT_TRUE(devsim.Inject("qxev", longRecord));
    // Exactly 4096 bytes: no room left for a NUL in the read, yet the record stays whole.
    std::string fullRecord = prefix + std::string(4096 - prefix.size(), 'q');
    ASSERT_TRUE(devsim.Inject("qxev", fullRecord));
    constexpr uint32_t kBurst = 500;
    for (uint32_t id = 1; id <= kBurst; ++id) {
        ASSERT_TRUE(devsim.Inject("qxev", "EventId " + std::to_string(id) + " -t " + std::to_string(id) +
                                              " -paraList {\"n\":" + std::to_string(id) + "}"));
    }
    ASSERT_TRUE(WaitUntil([&] { return recorder->Count() == kBurst + 2; })) << recorder->Count();
    std::vector<sp<Event>> events = recorder->Events();
    EXPECT_EQ(std::string(4096 - prefix.size(), 'p'), events[0]->GetValue("param_list"));
    EXPECT_EQ(std::string(4096 - prefix.size(), 'q'), events[1]->GetValue("param_list"));
    for (uint32_t id = 1; id <= kBurst; ++id) {
        ASSERT_EQ(id, events[id + 1]->eventId);
        ASSERT_EQ("{\"n\":" + std::to_string(id) + "}", events[id + 1]->GetValue("param_list"));
    }
    EXPECT_EQ(1u, logs.Count(ANDROID_LOG_INFO, kInvalid)) << logs.Dump();
    EXPECT_TRUE(runner.Stop());
}

TEST_F(RadiatorDevSimTest, DeviceVanishingUnderTheReaderLetsItStop) {
    SourceRunner runner(radiator);
    ASSERT_TRUE(devsim.Inject("qxev", "EventId 9 -t 1 -paraList {}"));
    ASSERT_TRUE(WaitUntil([&] { return recorder->Count() == 1; }));
    radiator->OnUnload();
    devsim.Stop();  // the blocked read fails, the loop sees the stop flag
    EXPECT_TRUE(runner.WaitFinished());
}

}  // namespace
}  // namespace Orvane
}  // namespace android
