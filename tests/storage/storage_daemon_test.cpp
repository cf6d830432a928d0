// The daemon as a process, fed through emulated device nodes, while another process reads its store.
#include <signal.h>
#include <sqlite3.h>
#include <unistd.h>

#include <atomic>
#include <cstdio>
#include <memory>
#include <thread>

#include <gtest/gtest.h>

#include "tests/common/log_capture.h"
#include "tests/plugins/daemon_process.h"
#include "tests/plugins/devsim_process.h"
#include "tests/storage/storage_test_util.h"
#include "utils/time_util.h"

namespace android::Orvane {
namespace {

class StorageDaemonTest : public ::testing::Test {
protected:
    void SetUp() override {
        std::string failure;
        if (!DaemonProcess::Built() || !devsim_.Start(&failure))
            GTEST_SKIP() << "the daemon or the device emulator is unavailable: " << failure;
        WriteFile(root_.File("properties"), "ro.quor.build.region=CN\n");
    }
    // The shipped configuration on the emulated kernel event node.
    void StartDaemon() {
        ASSERT_TRUE(daemon_.Start("qxev=" + devsim_.Path("qxev") + ",qx_exception_log=" + root_.File("no_node")));
    }
    void Record(uint32_t id, uint64_t happenTime, const std::string& params) {
        ASSERT_TRUE(devsim_.Inject("qxev", "EventId " + std::to_string(id) + " -t " + std::to_string(happenTime) +
                                                   " -paraList " + params));
    }
    // Waits until the daemon has stored `count` events that match `where`.
    bool WaitStored(const std::string& where, int count) {
        const std::string sql = "select count(*) from event_info where " + where;
        return WaitUntil(
                [&] {
                    return access(db_.c_str(), F_OK) == 0 &&
                           Column(db_, "select count(*) from sqlite_master where name = 'event_info'") == Texts{"1"} &&
                           Column(db_, sql) == Texts{std::to_string(count)};
                },
                std::chrono::seconds(30));
    }
    // A counter of the running daemon, read as an operator would (0 when it does not answer).
    uint64_t Counter(const std::string& name) {
        std::string command =
                ORVANE_BINARY_DIR "/orvanectl --workdir " + root_.File("work") + " dump stats 2>/dev/null";
        std::unique_ptr<FILE, int (*)(FILE*)> out(popen(command.c_str(), "r"), pclose);
        char line[256];
        char found[128];
        unsigned long long value = 0;
        while (out != nullptr && fgets(line, sizeof(line), out.get()) != nullptr)
            if (sscanf(line, "%127s %llu", found, &value) == 2 && name == found)
                return value;
        return 0;
    }

    DevSim devsim_;
    TempDir root_;
    std::string db_ = root_.File("work/event.db");
    DaemonProcess daemon_{root_.path_};
};

// Another process reading event.db for a while (a shell, a backup) delays the daemon's writes but
// costs no event.
TEST_F(StorageDaemonTest, ReaderHoldingATransactionCostsNoEvent) {
    uint64_t now = TimeUtil::GetTimestampSecond();
    StartDaemon();
    Record(903000001, now, "{\"warm\":1}");
    ASSERT_TRUE(WaitStored("event_id = 903000001", 1)) << daemon_.Log();
    sqlite3* reader = nullptr;
    ASSERT_EQ(sqlite3_open(db_.c_str(), &reader), SQLITE_OK);
    sqlite3_busy_timeout(reader, 20000);
    ASSERT_EQ(sqlite3_exec(reader, "BEGIN; select count(*) from event_info;", nullptr, nullptr, nullptr), SQLITE_OK);
    for (uint32_t i = 0; i < 20; i++)
        Record(903001000 + i, now, "{\"during\":" + std::to_string(i) + "}");
    // The read transaction stays open this long while the records arrive.
    std::this_thread::sleep_for(std::chrono::seconds(2));
    sqlite3_exec(reader, "COMMIT", nullptr, nullptr, nullptr);
    sqlite3_close(reader);
    EXPECT_TRUE(WaitStored("event_id between 903001000 and 903001019", 20)) << daemon_.Log();
}

// Killed while records pour in, the daemon keeps every event whose commit it reported, in a file
// that is intact.
TEST_F(StorageDaemonTest, KillUnderLoadKeepsEveryReportedCommit) {
    uint64_t now = TimeUtil::GetTimestampSecond();
    StartDaemon();
    std::atomic<bool> stop{false};
    std::atomic<uint32_t> sent{0};
    std::thread writer([&] {
        for (uint32_t i = 0; !stop && i < 200000; i++, sent++)
            devsim_.Inject("qxev", "EventId " + std::to_string(903200000 + i) + " -t " + std::to_string(now) +
                                           " -paraList {\"load\":" + std::to_string(i) + "}");
    });
    uint64_t committed = 0;
    EXPECT_TRUE(WaitUntil([&] { return (committed = Counter("storage.events.committed")) >= 2000; },
                          std::chrono::seconds(60)))
            << committed << " committed\n"
            << daemon_.Log();
    ASSERT_TRUE(daemon_.Stop(SIGKILL));
    // Without its reader the node holds the writer; gone, it lets it go.
    stop = true;
    devsim_.Stop();
    writer.join();
    EXPECT_LT(committed, sent.load()) << "the kill came after the load";
    EXPECT_EQ(Column(db_, "PRAGMA integrity_check"), Texts{"ok"});
    // Each record is an event of its own id, which gets its counter row whether it is stored or dropped.
    Texts stored = Column(db_, "select count(*) from event_daily where event_id between 903200000 and 903399999");
    ASSERT_EQ(stored.size(), 1u);
    EXPECT_GE(std::stoull(stored[0]), committed);
}

}  // namespace
}  // namespace android::Orvane
