#include "plugins/cmd_processor.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <signal.h>
#include <sys/stat.h>
#include <unistd.h>

#include <atomic>
#include <chrono>
#include <cstdlib>
#include <string>
#include <thread>
#include <vector>

#include "tests/common/log_capture.h"
#include "utils/file_util.h"

namespace android {
namespace Orvane {
namespace {

using Clock = std::chrono::steady_clock;

class CmdProcessorTest : public testing::Test {
protected:
    void SetUp() override {
        char pattern[] = "/tmp/cmd_processor_testXXXXXX";
        ASSERT_NE(mkdtemp(pattern), nullptr);
        dir_ = pattern;
    }
    void TearDown() override {
        uint64_t freed = 0;
        FileUtil::DeleteDirectoryOrFile(dir_, freed, true);
    }

    std::string WriteScript(const std::string& name, const std::string& body) {
        std::string path = dir_ + "/" + name;
        EXPECT_TRUE(FileUtil::SaveStringToFile(path, "#!/bin/sh\n" + body + "\n", true));
        chmod(path.c_str(), 0755);
        return path;
    }

    // Runs the command with its output into a file and returns what it wrote.
    std::string Run(const std::string& command, int timeoutSeconds, bool* ok = nullptr) {
        std::string out = dir_ + "/out.txt";
        int fd = open(out.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0644);
        EXPECT_GE(fd, 0);
        bool result = CmdProcessor::WriteCommandResultToFileWithTimeout(fd, command, timeoutSeconds);
        close(fd);
        if (ok != nullptr) {
            *ok = result;
        }
        std::string content;
        FileUtil::LoadStringFromFile(out, content);
        return content;
    }

    std::string dir_;
};

TEST_F(CmdProcessorTest, OutputAndExitCodesOfFinishedCommands) {
    LogCapture log;
    bool ok = false;
    EXPECT_EQ(Run("echo hello  world", 10, &ok), "hello  world\n");  // two blanks: an empty word between
    EXPECT_TRUE(ok);
    EXPECT_FALSE(log.Contains(ANDROID_LOG_INFO, "failed"));

    EXPECT_EQ(Run("false", 10, &ok), "");
    EXPECT_TRUE(ok);
    EXPECT_TRUE(log.Contains(ANDROID_LOG_INFO, "WriteCommandResultToFileWithTimeout command 'false' failed: exit code 1"))
        << log.Dump();

    Run("/nonexistent/program --flag", 10, &ok);
    EXPECT_TRUE(ok);
#if !defined(__SANITIZE_THREAD__)  // ThreadSanitizer turns vfork into fork: the child's line stays there
    EXPECT_TRUE(log.Contains(ANDROID_LOG_INFO, "WriteCommandResultToFileWithTimeout execvp, start will not log"));
#endif
    EXPECT_TRUE(log.Contains(ANDROID_LOG_INFO, "command '/nonexistent/program --flag' failed: exit code 1"));

    std::string selfKill = WriteScript("self_kill.sh", "echo before\nkill -9 $$");
    EXPECT_EQ(Run(selfKill, 10, &ok), "before\n");
    EXPECT_TRUE(ok);
    EXPECT_TRUE(log.Contains(ANDROID_LOG_INFO, "command '" + selfKill + "' failed: killed by signal 9"));

    log.Clear();
    EXPECT_FALSE(CmdProcessor::WriteCommandResultToFileWithTimeout(1, "", 10));
    EXPECT_TRUE(log.Lines().empty());
}

TEST_F(CmdProcessorTest, OverrunIsTerminatedThenKilled) {
    LogCapture log;
    std::string slow = WriteScript("slow.sh", "echo started\nexec sleep 60");
    auto start = Clock::now();
    bool ok = false;
    EXPECT_EQ(Run(slow, 1, &ok), "started\n");
    EXPECT_TRUE(ok);
    EXPECT_LT(Clock::now() - start, std::chrono::seconds(30));
    EXPECT_TRUE(log.Contains(ANDROID_LOG_INFO, "WriteCommandResultToFileWithTimeout command '" + slow + "' timed out, (killing pid"))
        << log.Dump();
    EXPECT_FALSE(log.Contains(ANDROID_LOG_INFO, "even with SIGKILL"));

    // An ignored SIGTERM survives exec, so the sleep itself shrugs it off and needs SIGKILL.
    log.Clear();
    std::string stubborn = WriteScript("stubborn.sh", "trap '' TERM\nexec sleep 60");
    start = Clock::now();
    Run(stubborn, 1, &ok);
    auto elapsed = Clock::now() - start;
    EXPECT_TRUE(ok);
    EXPECT_GE(elapsed, std::chrono::seconds(5));  // the SIGTERM grace period was spent
    EXPECT_LT(elapsed, std::chrono::seconds(30));
    EXPECT_TRUE(log.Contains(ANDROID_LOG_INFO, "timed out"));
    EXPECT_FALSE(log.Contains(ANDROID_LOG_INFO, "even with SIGKILL"));
}

// The daemon's situation: SIGCHLD blocked in every thread, several threads running, children
// reaped elsewhere (pclose) leaving their signal pending.
TEST_F(CmdProcessorTest, ReapsAtOnceWithSigchldBlockedInEveryThread) {
    sigset_t childSignal;
    sigset_t oldMask;
    sigemptyset(&childSignal);
    sigaddset(&childSignal, SIGCHLD);
    ASSERT_EQ(pthread_sigmask(SIG_BLOCK, &childSignal, &oldMask), 0);

    std::atomic<bool> stop{false};
    std::vector<std::thread> busy;
    for (int i = 0; i < 3; ++i) {
        busy.emplace_back([&stop] {
            while (!stop) {
                std::this_thread::yield();
            }
        });
    }

    LogCapture log;
    std::string line;
    ASSERT_TRUE(CmdProcessor::GetCommandResult("echo pending", line));  // leaves a SIGCHLD pending

    auto start = Clock::now();
    EXPECT_EQ(Run("true", 30), "");
    EXPECT_LT(Clock::now() - start, std::chrono::seconds(15));

    // A command that outlives the first poll must not be mistaken for a stale signal's child.
    std::string sleeper = WriteScript("sleeper.sh", "sleep 0.3\necho done");
    EXPECT_EQ(Run(sleeper, 30), "done\n");

    // The command starts with nothing blocked.
    std::string mask = Run("grep SigBlk /proc/self/status", 30);
    EXPECT_NE(mask.find("SigBlk:\t0000000000000000"), std::string::npos) << mask;

    EXPECT_FALSE(log.Contains(ANDROID_LOG_INFO, "timed out")) << log.Dump();
    EXPECT_FALSE(log.Contains(ANDROID_LOG_INFO, "instead")) << log.Dump();
    EXPECT_FALSE(log.Contains(ANDROID_LOG_INFO, "Error")) << log.Dump();

    stop = true;
    for (auto& thread : busy) {
        thread.join();
    }
    pthread_sigmask(SIG_SETMASK, &oldMask, nullptr);
}

TEST_F(CmdProcessorTest, WaitPidWithTimeoutTimesOutWithEtimedout) {
    pid_t child = fork();
    ASSERT_GE(child, 0);
    if (child == 0) {
        pause();
        _exit(0);
    }
    errno = 0;
    EXPECT_FALSE(CmdProcessor::WaitPidWithTimeout(child, 1, nullptr));
    EXPECT_EQ(errno, ETIMEDOUT);
    kill(child, SIGKILL);
    int status = 0;
    EXPECT_TRUE(CmdProcessor::WaitPidWithTimeout(child, 10, &status));
    EXPECT_TRUE(WIFSIGNALED(status));
    EXPECT_EQ(WTERMSIG(status), SIGKILL);
}

TEST_F(CmdProcessorTest, FirstLineOfShellOutput) {
    std::string result = "previous";
    EXPECT_TRUE(CmdProcessor::GetCommandResult("printf 'one\\ntwo\\nthree\\n'", result));
    EXPECT_EQ(result, "one\n");
    EXPECT_TRUE(CmdProcessor::GetCommandResult("printf 'no line end'", result));
    EXPECT_EQ(result, "no line end");
    EXPECT_TRUE(CmdProcessor::GetCommandResult("true", result));
    EXPECT_EQ(result, "no line end");  // no output keeps the old value
    std::string longLine(600, 'x');
    EXPECT_TRUE(CmdProcessor::GetCommandResult("printf '" + longLine + "'", result));
    EXPECT_EQ(result, std::string(511, 'x'));
    EXPECT_FALSE(CmdProcessor::GetCommandResult("", result));
}

TEST_F(CmdProcessorTest, ProcessNameByPid) {
    std::string name = CmdProcessor::GetProcNameByPid(getpid());
    EXPECT_EQ(std::string(name.c_str()), std::string(program_invocation_name));

    pid_t child = fork();
    ASSERT_GE(child, 0);
    if (child == 0) {
        execlp("sleep", "sleep", "30", static_cast<char*>(nullptr));
        _exit(1);
    }
    ASSERT_TRUE(WaitUntil([&] { return CmdProcessor::GetProcNameByPid(child) == std::string("sleep\0" "30", 8); }))
        << CmdProcessor::GetProcNameByPid(child);
    kill(child, SIGKILL);
    EXPECT_TRUE(CmdProcessor::WaitPidWithTimeout(child, 10, nullptr));
    EXPECT_EQ(CmdProcessor::GetProcNameByPid(child), "");  // reaped: gone
    EXPECT_EQ(CmdProcessor::GetProcNameByPid(-5), "");
}

}  // namespace
}  // namespace Orvane
}  // namespace android
