// The daemon as a process on emulated device nodes: kernel records end up in event.db, a
// missing node stops only its own source, and a restart keeps what was stored.
#include <fstream>

#include <android-base/file.h>
#include <gtest/gtest.h>

#include "tests/common/log_capture.h"
#include "tests/plugins/daemon_process.h"
#include "tests/plugins/devsim_process.h"

namespace android::Orvane {
namespace {

class EventSourceChainTest : public ::testing::Test {
protected:
    void SetUp() override {
        std::string failure;
        if (!DaemonProcess::Built() || !devsim_.Start(&failure))
            GTEST_SKIP() << "the daemon or the device emulator is unavailable: " << failure;
        std::ofstream(folder_ + "/properties") << "ro.quor.build.region=CN\n";
    }

    // event_info rows of an id, "first_time|occured_cnt|param_list" each by row id.
    std::string Stored(uint32_t eventId) {
        return daemon_.Snapshot("select first_time || '|' || occured_cnt || '|' || param_list from event_info " +
                                ("where event_id = " + std::to_string(eventId)) + " order by id;");
    }

    DevSim devsim_;
    TemporaryDir root_;
    const std::string folder_ = root_.path;
    DaemonProcess daemon_{folder_};
};

// Bad records and a missing node are each source's own concern; here the shipped configuration
// must carry kernel records into event.db (a relay record on the way harming nothing), and a restart
// must count on from what is stored.
TEST_F(EventSourceChainTest, RecordsAreStoredAndSurviveARestart) {
    const std::string params = " -paraList {\"device\": \"sda\", \"errno\": 5}";
    const std::string stored = "|{\"device\": \"sda\", \"errno\": 5}\n";
    ASSERT_TRUE(daemon_.Start("qxev=" + devsim_.Path("qxev") + ",qx_exception_log=" + folder_ + "/no_such_node"));
    ASSERT_TRUE(devsim_.Inject("qxev", "EventId 905001001 -t 1700000000" + params));
    ASSERT_TRUE(devsim_.Inject("qxev", "EventId 905001001 -t 1700000100" + params));
    ASSERT_TRUE(WaitUntil([&] { return Stored(905001001) == "1700000100|2" + stored; }, std::chrono::seconds(20)))
            << Stored(905001001);
    EXPECT_TRUE(WaitUntil([this] {
        return daemon_.Log().find("openExceptionLogFd No kernel exception log monitor support (errno=2)") !=
               std::string::npos;
    })) << daemon_.Log();
    daemon_.Stop();

    ASSERT_TRUE(
            daemon_.Start("qxev=" + devsim_.Path("qxev") + ",qx_exception_log=" + devsim_.Path("qx_exception_log")));
    ASSERT_TRUE(devsim_.Inject("qx_exception_log", "kernel BUG at mm/slub.c:420\n"));
    ASSERT_TRUE(devsim_.Inject("qxev", "EventId 905001001 -t 1700000200" + params));
    ASSERT_TRUE(WaitUntil([&] { return Stored(905001001) == "1700000200|3" + stored; }, std::chrono::seconds(20)))
            << Stored(905001001);
    daemon_.Stop();
    EXPECT_EQ("1700000200|3" + stored, Stored(905001001));  // all on disk after a stop
}

}  // namespace
}  // namespace android::Orvane
