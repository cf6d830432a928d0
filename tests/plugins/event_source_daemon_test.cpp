// The daemon as a process on emulated device nodes, as a hostile writer meets it: a record longer
// than the device's reads must not turn its tail into an event of the writer's choosing, and a
// node that vanishes and comes back must be read again.
#include <fstream>

#include <android-base/file.h>
#include <gtest/gtest.h>

#include "tests/common/log_capture.h"
#include "tests/plugins/daemon_process.h"
#include "tests/plugins/devsim_process.h"

namespace android::Orvane {
namespace {

class EventSourceDaemonTest : public ::testing::Test {
protected:
    void SetUp() override {
        std::string failure;
        if (!DaemonProcess::Built() || !devsim_.Start(&failure))
            GTEST_SKIP() << "the daemon or the device emulator is unavailable: " << failure;
        std::ofstream(folder_ + "/properties") << "ro.quor.build.region=CN\n";
        ASSERT_TRUE(daemon_.Start("qxev=" + devsim_.Path("qxev") +
                                  ",qx_exception_log=" + devsim_.Path("qx_exception_log")));
    }

    size_t LogCount(const std::string& text) {
        std::string log = daemon_.Log();
        size_t count = 0;
        for (size_t at = log.find(text); at != std::string::npos; at = log.find(text, at + 1))
            ++count;
        return count;
    }

    // "first_time|occured_cnt" of the event_info rows of an id.
    std::string Stored(uint32_t eventId) {
        return daemon_.Snapshot("select first_time || '|' || occured_cnt from event_info where event_id = " +
                                std::to_string(eventId) + " order by id;");
    }

    TemporaryDir sandbox_;
    const std::string folder_ = sandbox_.path;
    DevSim devsim_;
    DaemonProcess daemon_{folder_};
};

TEST_F(EventSourceDaemonTest, ForgedTailsAreNotStoredAndAVanishedNodeIsReadAgain) {
    const std::string prefix = "EventId 905001001 -t 1700000000 -paraList ";
    const std::string forged = "EventId 902001001 -t 1700000000 -paraList {\"forged\": 1}";
    for (size_t cut : {4096, 4097})
        ASSERT_TRUE(devsim_.Inject("qxev", prefix + std::string(cut - prefix.size(), 'p') + forged));
    // Events are stored in the order of their records: once the last one is there, all are.
    ASSERT_TRUE(devsim_.Inject("qxev", prefix + "{}"));
    ASSERT_TRUE(devsim_.Inject("qxev", "EventId 901001002 -t 1700000000 -paraList {}"));
    ASSERT_TRUE(WaitUntil([&] { return Stored(901001002) == "1700000000|1\n"; }, std::chrono::seconds(20)));
    EXPECT_EQ("1700000000|1\n", Stored(905001001));
    EXPECT_EQ("", Stored(902001001));

    devsim_.Stop();
    ASSERT_TRUE(WaitUntil([&] { return LogCount("/qxev lost") == 1; })) << LogCount("/qxev lost");
    std::string failure;
    ASSERT_TRUE(devsim_.Start(&failure)) << failure;
    for (int n = 1; n <= 3; ++n)
        ASSERT_TRUE(devsim_.Inject("qxev",
                                   "EventId 905001001 -t " + std::to_string(1700000000 + n * 1000) + " -paraList {}"));
    ASSERT_TRUE(WaitUntil([&] { return Stored(905001001) == "1700003000|4\n"; }, std::chrono::seconds(20)))
            << Stored(905001001);
    EXPECT_EQ(1u, LogCount("/qxev lost"));
    EXPECT_EQ(1u, LogCount("/qxev reopened"));
}

}  // namespace
}  // namespace android::Orvane
