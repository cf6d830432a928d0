// The daemon as a process on emulated device nodes: kernel records end up in event.db, a
// missing node stops only its own source, and a restart keeps what was stored.
#include <gtest/gtest.h>
#include <sqlite3.h>

#include <dirent.h>
#include <fcntl.h>
#include <signal.h>
#include <stdlib.h>
#include <sys/prctl.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <fstream>
#include <sstream>

#include "tests/common/log_capture.h"
#include "tests/plugins/devsim_process.h"

namespace android::Orvane {
namespace {

// event_info rows of an id: "first_time|occured_cnt|param_list" each, by row id.
std::string StoredRows(const std::string& dbPath, uint32_t eventId) {
    sqlite3* db = nullptr;
    std::string rows;
    std::string sql = "select first_time || '|' || occured_cnt || '|' || param_list from event_info where event_id = " +
                      std::to_string(eventId) + " order by id;";
    if (sqlite3_open_v2(dbPath.c_str(), &db, SQLITE_OPEN_READONLY, nullptr) == SQLITE_OK) {
        sqlite3_exec(db, sql.c_str(), [](void* out, int, char** values, char**) {
            *static_cast<std::string*>(out) += std::string(values[0] != nullptr ? values[0] : "NULL") + "\n";
            return 0;
        }, &rows, nullptr);
    }
    sqlite3_close(db);
    return rows;
}

// How often the part occurs in the file.
size_t CountIn(const std::string& path, const std::string& part) {
    std::stringstream stream;
    stream << std::ifstream(path).rdbuf();
    std::string text = stream.str();
    size_t count = 0;
    for (size_t at = text.find(part); at != std::string::npos; at = text.find(part, at + 1)) {
        ++count;
    }
    return count;
}

class EventSourceChainTest : public ::testing::Test {
protected:
    void SetUp() override {
        if (access((std::string(ORVANE_BINARY_DIR) + "/orvane").c_str(), X_OK) != 0) {
            GTEST_SKIP() << "the daemon is not built in " << ORVANE_BINARY_DIR;
        }
        std::string failure;
        if (!devsim.Start(&failure)) {
            GTEST_SKIP() << "device emulator unavailable: " << failure;
        }
        char folderTemplate[] = "/tmp/orvane-chain-XXXXXX";
        ASSERT_NE(nullptr, mkdtemp(folderTemplate));
        folder = folderTemplate;
        std::ofstream(folder + "/properties") << "ro.quor.build.region=CN\n";
    }
    void TearDown() override {
        StopDaemon();
        if (!folder.empty()) {
            system(("rm -rf " + folder).c_str());
        }
    }

    // Starts the daemon with the shipped configuration; true once it holds `nodes` open.
    bool StartDaemon(const std::string& devList, const std::vector<std::string>& nodes) {
        logPath = folder + "/orvane." + std::to_string(++starts) + ".log";
        std::string program = std::string(ORVANE_BINARY_DIR) + "/orvane";
        std::string configDir = std::string(ORVANE_SOURCE_DIR) + "/etc", workDir = folder + "/work";
        std::string cloudDir = folder + "/cloud", properties = folder + "/properties";
        daemon = fork();
        if (daemon == 0) {
            prctl(PR_SET_PDEATHSIG, SIGKILL);
            int log = open(logPath.c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0644);
            dup2(log, STDOUT_FILENO);
            dup2(log, STDERR_FILENO);
            setenv("ORVANE_PROPERTY_FILE", properties.c_str(), 1);
            execl(program.c_str(), program.c_str(), "-configDir", configDir.c_str(), "-workDir", workDir.c_str(),
                  "-cloudCfgDir", cloudDir.c_str(), "-devList", devList.c_str(), static_cast<char*>(nullptr));
            _exit(127);
        }
        return WaitUntil([&] {
            std::string fdDir = "/proc/" + std::to_string(daemon) + "/fd/", open;
            DIR* dir = opendir(fdDir.c_str());
            for (dirent* entry; dir != nullptr && (entry = readdir(dir)) != nullptr;) {
                char target[512];
                ssize_t length = readlink((fdDir + entry->d_name).c_str(), target, sizeof(target));
                open += std::string(target, length > 0 ? length : 0) + "\n";
            }
            if (dir != nullptr) {
                closedir(dir);
            }
            return std::all_of(nodes.begin(), nodes.end(), [&](const std::string& node) { return open.find(node) != std::string::npos; });
        });
    }

    void StopDaemon() {
        if (daemon > 0) {
            kill(daemon, SIGTERM);
            waitpid(daemon, nullptr, 0);
            daemon = -1;
        }
    }

    // The daemon's writes take no busy time-out, so progress is read from a copy.
    bool WaitStored(uint32_t eventId, const std::string& expectedRows) {
        std::string copy = folder + "/snapshot.db";
        return WaitUntil([&] {
            return system(("cp " + folder + "/work/event.db " + copy + " 2>/dev/null").c_str()) == 0 && StoredRows(copy, eventId) == expectedRows;
        }, std::chrono::seconds(20));
    }

    DevSim devsim;
    std::string folder, logPath;
    pid_t daemon = -1;
    int starts = 0;
};

TEST_F(EventSourceChainTest, RecordsAreStoredAndSurviveARestart) {
    std::string qxev = devsim.Path("qxev");
    ASSERT_TRUE(StartDaemon("qxev=" + qxev + ",qx_exception_log=" + folder + "/no_such_node", {qxev}));

    ASSERT_TRUE(devsim.Inject("qxev", "EventId 905001001 -t 1700000000 -paraList {\"device\": \"sda\", \"errno\": 5}"));
    ASSERT_TRUE(devsim.Inject("qxev", "EventId 0 -t 1700000000 -paraList {}"));
    ASSERT_TRUE(devsim.Inject("qxev", std::string("\x01\xff garbage", 10)));
    ASSERT_TRUE(devsim.Inject("qxev", "EventId 905001001 -t 1700000100 -paraList {\"device\": \"sda\", \"errno\": 5}"));
    const std::string firstDay = "1700000100|2|{\"device\": \"sda\", \"errno\": 5}\n";
    ASSERT_TRUE(WaitStored(905001001, firstDay)) << StoredRows(folder + "/snapshot.db", 905001001);
    StopDaemon();
    EXPECT_EQ(firstDay, StoredRows(folder + "/work/event.db", 905001001));

    EXPECT_EQ(1u, CountIn(logPath, "openExceptionLogFd No kernel exception log monitor support (errno=2)"));
    EXPECT_EQ(2u, CountIn(logPath, "ParseEvent event invalid"));

    // A second start on the same work folder adds to what is stored.
    std::string relay = devsim.Path("qx_exception_log");
    ASSERT_TRUE(StartDaemon("qxev=" + qxev + ",qx_exception_log=" + relay, {qxev, relay}));
    ASSERT_TRUE(devsim.Inject("qx_exception_log", "kernel BUG at mm/slub.c:420\n"));
    ASSERT_TRUE(devsim.Inject("qxev", "EventId 905001001 -t 1700000200 -paraList {\"device\": \"sda\", \"errno\": 5}"));
    const std::string secondStart = "1700000200|3|{\"device\": \"sda\", \"errno\": 5}\n";
    ASSERT_TRUE(WaitStored(905001001, secondStart)) << StoredRows(folder + "/snapshot.db", 905001001);
    StopDaemon();
    EXPECT_EQ(secondStart, StoredRows(folder + "/work/event.db", 905001001));
    EXPECT_EQ(0u, CountIn(logPath, "No kernel exception log monitor support"));
}

}  // namespace
}  // namespace android::Orvane
