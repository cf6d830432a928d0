// The daemon as a process on emulated device nodes: kernel records end up in event.db, a
// missing node stops only its own source, and a restart keeps what was stored.
#include <signal.h>
#include <spawn.h>
#include <sqlite3.h>
#include <sys/wait.h>
#include <unistd.h>

#include <fstream>

#include <android-base/file.h>
#include <gtest/gtest.h>

#include "tests/common/log_capture.h"
#include "tests/plugins/devsim_process.h"
#include "utils/file_util.h"

extern char** environ;

namespace android::Orvane {
namespace {

class EventSourceChainTest : public ::testing::Test {
protected:
    void SetUp() override {
        std::string failure;
        if (access(ORVANE_BINARY_DIR "/orvane", X_OK) != 0 || !devsim_.Start(&failure))
            GTEST_SKIP() << "the daemon or the device emulator is unavailable: " << failure;
        std::ofstream(folder_ + "/properties") << "ro.quor.build.region=CN\n";
    }
    void TearDown() override { StopDaemon(); }

    // Starts the daemon with the shipped configuration. The nodes queue what is written before it reads.
    void StartDaemon(const std::string& devList) {
        std::string command = "ORVANE_PROPERTY_FILE=" + folder_ + "/properties exec setpriv --pdeathsig KILL " +
                              ORVANE_BINARY_DIR "/orvane -configDir " ORVANE_SOURCE_DIR "/etc -workDir " + folder_ +
                              "/work -cloudCfgDir " + folder_ + "/cloud -devList " + devList + " >" + folder_ +
                              "/orvane.log 2>&1";
        const char* argv[] = {"sh", "-c", command.c_str(), nullptr};
        ASSERT_EQ(posix_spawn(&daemon_, "/bin/sh", nullptr, nullptr, const_cast<char**>(argv), environ), 0);
    }

    void StopDaemon() {
        if (daemon_ > 0 && kill(daemon_, SIGTERM) == 0)
            waitpid(daemon_, nullptr, 0);
        daemon_ = -1;
    }

    std::string Log() {
        std::string text;
        FileUtil::LoadStringFromFile(folder_ + "/orvane.log", text);
        return text;
    }

    // event_info rows of an id, "first_time|occured_cnt|param_list" each by row id. They are read
    // from a copy, as the daemon's writes take no busy time-out.
    std::string Stored(uint32_t eventId) {
        std::string copy = folder_ + "/snapshot.db", rows;
        std::string sql = "select first_time || '|' || occured_cnt || '|' || param_list from event_info " +
                          ("where event_id = " + std::to_string(eventId)) + " order by id;";
        auto append = [](void* out, int, char** values, char**) {
            *static_cast<std::string*>(out) += std::string(values[0] != nullptr ? values[0] : "NULL") + "\n";
            return 0;
        };
        sqlite3* db = nullptr;
        // The write-ahead log holds the latest commits until they are checkpointed into the file.
        std::string work = folder_ + "/work/event.db";
        if (system(("cp " + work + " " + copy + " 2>/dev/null && rm -f " + copy + "-wal " + copy + "-shm && { cp " +
                    work + "-wal " + copy + "-wal 2>/dev/null; true; }")
                           .c_str()) == 0 &&
            sqlite3_open_v2(copy.c_str(), &db, SQLITE_OPEN_READONLY, nullptr) == SQLITE_OK)
            sqlite3_exec(db, sql.c_str(), append, &rows, nullptr);
        sqlite3_close(db);
        return rows;
    }

    DevSim devsim_;
    TemporaryDir root_;
    const std::string folder_ = root_.path;
    pid_t daemon_ = -1;
};

// Bad records and a missing node are each source's own concern; here the shipped configuration
// must carry kernel records into event.db (a relay record on the way harming nothing), and a restart
// must count on from what is stored.
TEST_F(EventSourceChainTest, RecordsAreStoredAndSurviveARestart) {
    const std::string params = " -paraList {\"device\": \"sda\", \"errno\": 5}";
    const std::string stored = "|{\"device\": \"sda\", \"errno\": 5}\n";
    StartDaemon("qxev=" + devsim_.Path("qxev") + ",qx_exception_log=" + folder_ + "/no_such_node");
    ASSERT_TRUE(devsim_.Inject("qxev", "EventId 905001001 -t 1700000000" + params));
    ASSERT_TRUE(devsim_.Inject("qxev", "EventId 905001001 -t 1700000100" + params));
    ASSERT_TRUE(WaitUntil([&] { return Stored(905001001) == "1700000100|2" + stored; }, std::chrono::seconds(20)))
            << Stored(905001001);
    EXPECT_TRUE(WaitUntil([this] {
        return Log().find("openExceptionLogFd No kernel exception log monitor support (errno=2)") != std::string::npos;
    })) << Log();
    StopDaemon();

    StartDaemon("qxev=" + devsim_.Path("qxev") + ",qx_exception_log=" + devsim_.Path("qx_exception_log"));
    ASSERT_TRUE(devsim_.Inject("qx_exception_log", "kernel BUG at mm/slub.c:420\n"));
    ASSERT_TRUE(devsim_.Inject("qxev", "EventId 905001001 -t 1700000200" + params));
    ASSERT_TRUE(WaitUntil([&] { return Stored(905001001) == "1700000200|3" + stored; }, std::chrono::seconds(20)))
            << Stored(905001001);
    StopDaemon();
    EXPECT_EQ("1700000200|3" + stored, Stored(905001001));  // all on disk after a stop
}

}  // namespace
}  // namespace android::Orvane
