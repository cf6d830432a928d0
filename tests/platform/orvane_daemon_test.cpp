// Runs the daemon binary as a process: start-up from the command line, one instance per work
// folder, and a restart after the running one was killed.
#include <fcntl.h>
#include <gtest/gtest.h>
#include <signal.h>
#include <stdlib.h>
#include <sys/wait.h>
#include <unistd.h>

#include <fstream>
#include <sstream>
#include <string>
#include <vector>

#include "tests/common/log_capture.h"

namespace android {
namespace Orvane {
namespace {

const std::string kBinary = ORVANE_BINARY_DIR "/orvane";

class Daemon {
public:
    // Starts the binary with `args`, its standard error going to `logPath`.
    Daemon(const std::vector<std::string>& args, const std::string& logPath) : logPath_(logPath) {
        // Everything the child needs is prepared before the fork: it only redirects and execs.
        std::vector<char*> argv;
        argv.push_back(const_cast<char*>(kBinary.c_str()));
        for (const auto& arg : args) {
            argv.push_back(const_cast<char*>(arg.c_str()));
        }
        argv.push_back(nullptr);
        int fd = open(logPath.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0644);
        pid_ = fork();
        if (pid_ == 0) {
            dup2(fd, STDERR_FILENO);
            execv(kBinary.c_str(), argv.data());
            _exit(127);
        }
        close(fd);
    }
    ~Daemon() {
        if (pid_ > 0 && !exited_) {
            kill(pid_, SIGKILL);
            waitpid(pid_, nullptr, 0);
        }
    }

    pid_t Pid() const { return pid_; }
    std::string Log() const {
        std::ifstream file(logPath_);
        std::stringstream content;
        content << file.rdbuf();
        return content.str();
    }
    bool WaitForLog(const std::string& text) {
        return WaitUntil([&] { return Log().find(text) != std::string::npos; }, std::chrono::seconds(30));
    }
    bool Running() {
        if (exited_) {
            return false;
        }
        int status = 0;
        if (waitpid(pid_, &status, WNOHANG) == pid_) {
            exited_ = true;
            status_ = status;
        }
        return !exited_;
    }
    // The exit status, or -1 when it did not end within the bound or ended by a signal.
    int WaitExit() {
        WaitUntil([&] { return !Running(); }, std::chrono::seconds(30));
        return exited_ && WIFEXITED(status_) ? WEXITSTATUS(status_) : -1;
    }
    void Kill() {
        kill(pid_, SIGKILL);
        waitpid(pid_, &status_, 0);
        exited_ = true;
    }

private:
    std::string logPath_;
    pid_t pid_ = -1;
    bool exited_ = false;
    int status_ = 0;
};

class OrvaneDaemonTest : public testing::Test {
protected:
    void SetUp() override {
        ASSERT_EQ(access(kBinary.c_str(), X_OK), 0) << kBinary << " is not built";
        char pattern[] = "/tmp/orvane_daemon_test_XXXXXX";
        ASSERT_NE(mkdtemp(pattern), nullptr);
        root_ = pattern;
        ASSERT_EQ(system(("mkdir -p " + root_ + "/etc").c_str()), 0);
        std::ofstream(root_ + "/etc/plugin_config") << "plugins:1\nNoSuchPlugin[thread:test_loop]:0 static\n";
        args_ = {"-configDir",   root_ + "/etc",   "-workDir", root_ + "/work",
                 "-cloudCfgDir", root_ + "/cloud", "-region",  "CN"};
    }
    void TearDown() override { system(("rm -rf " + root_).c_str()); }

    std::string PidMarker() {
        std::string pid;
        std::ifstream(root_ + "/work/orvane.pid") >> pid;
        return pid;
    }

    std::string root_;
    std::vector<std::string> args_;
};

// The last line of start-up for the test configuration.
constexpr const char* kStarted = "LoadPlugin plugin NoSuchPlugin not constructed";

TEST_F(OrvaneDaemonTest, StartsAndRunsAloneUntilKilled) {
    Daemon first(args_, root_ + "/first.log");
    ASSERT_TRUE(first.WaitForLog(kStarted)) << first.Log();
    std::string log = first.Log();
    EXPECT_NE(log.find("GetLooperByName create event looper name qx_unorder"), std::string::npos) << log;
    EXPECT_NE(log.find("Parse prase config ok"), std::string::npos) << log;
    EXPECT_NE(log.find("LoadPlugins Start to create plugin NoSuchPlugin delay:0"), std::string::npos) << log;
    EXPECT_EQ(PidMarker(), std::to_string(first.Pid()));

    Daemon second(args_, root_ + "/second.log");
    EXPECT_EQ(second.WaitExit(), 255);
    EXPECT_NE(second.Log().find("IsExist orvane already running, pid " + std::to_string(first.Pid())),
              std::string::npos)
            << second.Log();
    EXPECT_NE(second.Log().find("main start platform failed"), std::string::npos) << second.Log();
    EXPECT_TRUE(first.Running());
    EXPECT_EQ(PidMarker(), std::to_string(first.Pid()));

    // Killed without any chance to clean up: the stale marker must not block the next start.
    first.Kill();
    Daemon third(args_, root_ + "/third.log");
    ASSERT_TRUE(third.WaitForLog(kStarted)) << third.Log();
    EXPECT_TRUE(third.Running());
    EXPECT_EQ(PidMarker(), std::to_string(third.Pid()));
    for (const Daemon* daemon : {&first, &second, &third}) {
        EXPECT_EQ(daemon->Log().find("ThreadSanitizer"), std::string::npos) << daemon->Log();
    }
}

TEST_F(OrvaneDaemonTest, UnknownOptionEndsWithFailure) {
    std::vector<std::string> args = args_;
    args.insert(args.begin(), {"-verbose", "yes"});
    Daemon daemon(args, root_ + "/bad.log");
    EXPECT_EQ(daemon.WaitExit(), 255);
    EXPECT_NE(daemon.Log().find("ParseArgs unsupport args 1 -verbose"), std::string::npos) << daemon.Log();
    EXPECT_NE(daemon.Log().find("main parse args failed"), std::string::npos) << daemon.Log();
}

}  // namespace
}  // namespace Orvane
}  // namespace android
