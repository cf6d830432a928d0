// Runs the daemon binary as processes: one instance per work folder, and a restart after the
// running one was killed.
#include <signal.h>
#include <spawn.h>
#include <sys/wait.h>
#include <unistd.h>

#include <fstream>

#include <android-base/file.h>
#include <gtest/gtest.h>

#include "tests/common/log_capture.h"
#include "utils/file_util.h"

extern char** environ;

namespace android::Orvane {

class OrvaneDaemonTest : public testing::Test {
protected:
    void SetUp() override {
        ASSERT_EQ(access(ORVANE_BINARY_DIR "/orvane", X_OK), 0) << "the daemon is not built";
        ASSERT_EQ(mkdir((root_ + "/etc").c_str(), 0755), 0);
        std::ofstream(root_ + "/etc/plugin_config") << "plugins:1\nNoSuchPlugin[thread:test_loop]:0 static\n";
    }
    void TearDown() override {
        for (pid_t pid : started_) {
            if (waitpid(pid, nullptr, WNOHANG) == 0 && kill(pid, SIGKILL) == 0)
                waitpid(pid, nullptr, 0);  // still ours
        }
    }

    // Starts the daemon on the test folders, its standard error going to `<name>.log`.
    pid_t Start(const std::string& name) {
        const std::string command = "cd " + root_ + " && exec " ORVANE_BINARY_DIR "/orvane -configDir $PWD/etc " +
                                    "-workDir $PWD/work -cloudCfgDir $PWD/cloud -region CN 2>" + name + ".log";
        const char* argv[] = {"sh", "-c", command.c_str(), nullptr};
        pid_t pid = -1;
        EXPECT_EQ(posix_spawn(&pid, "/bin/sh", nullptr, nullptr, const_cast<char**>(argv), environ), 0);
        return started_.emplace_back(pid);
    }
    std::string Log(const std::string& name) {
        std::string text;
        FileUtil::LoadStringFromFile(root_ + "/" + name + ".log", text);
        return text;
    }
    bool WaitForLog(const std::string& name, const std::string& text) {
        return WaitUntil([&] { return Log(name).find(text) != std::string::npos; }, std::chrono::seconds(30));
    }
    // The exit status, or -1 when it did not end within 30 s or ended by a signal.
    int WaitExit(pid_t pid) {
        int status = 0;
        bool ended = WaitUntil([&] { return waitpid(pid, &status, WNOHANG) == pid; }, std::chrono::seconds(30));
        return ended && WIFEXITED(status) ? WEXITSTATUS(status) : -1;
    }

    TemporaryDir tmp_;
    const std::string root_ = tmp_.path;
    std::vector<pid_t> started_;
};

// The last line of start-up for the test configuration.
constexpr const char* kStarted = "LoadPlugin plugin NoSuchPlugin not constructed";

TEST_F(OrvaneDaemonTest, RunsAloneUntilKilledThenRestarts) {
    pid_t first = Start("first");
    ASSERT_TRUE(WaitForLog("first", kStarted)) << Log("first");
    EXPECT_EQ(WaitExit(Start("second")), 255);
    EXPECT_TRUE(WaitForLog("second", "IsExist orvane already running, pid " + std::to_string(first))) << Log("second");
    EXPECT_EQ(waitpid(first, nullptr, WNOHANG), 0) << "the first one must still run";

    // Killed without any chance to clean up: the stale marker must not block the next start.
    kill(first, SIGKILL);
    EXPECT_EQ(WaitExit(first), -1);
    Start("third");
    ASSERT_TRUE(WaitForLog("third", kStarted)) << Log("third");
}

}  // namespace android::Orvane
