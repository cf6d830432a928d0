#include "plugins/cmd_processor.h"

#include <signal.h>
#include <stdio.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <thread>

#include <android-base/file.h>
#include <gtest/gtest.h>

#include "tests/common/log_capture.h"
#include "utils/file_util.h"

namespace android::Orvane {
namespace {

using Clock = std::chrono::steady_clock;
using std::chrono::seconds;

class CmdProcessorTest : public testing::Test {
protected:
    std::string WriteScript(const std::string& body) {
        EXPECT_TRUE(FileUtil::SaveStringToFile(script_, "#!/bin/sh\n" + body + "\n", true));
        chmod(script_.c_str(), 0755);
        return script_;
    }

    // Runs the command with its output into a file and returns what it wrote.
    static std::string Run(const std::string& command, int timeoutSeconds) {
        TemporaryFile out;
        EXPECT_TRUE(CmdProcessor::WriteCommandResultToFileWithTimeout(out.fd, command, timeoutSeconds));
        std::string content(4096, '\0');
        content.resize(std::max<ssize_t>(0, pread(out.fd, &content[0], content.size(), 0)));
        return content;
    }

    TemporaryDir folder_;
    const std::string script_ = std::string(folder_.path) + "/command.sh";
};

TEST_F(CmdProcessorTest, OutputAndExitCodesOfFinishedCommands) {
    std::string selfKill = WriteScript("echo before\nkill -9 $$");
    struct {
        std::string command, output, logged;
    } cases[] = {
            {"echo hello  world", "hello  world\n", ""},  // two blanks: an empty word between
            {"false", "", "command 'false' failed: exit code 1"},
            {selfKill, "before\n", "command '" + selfKill + "' failed: killed by signal 9"},
            {"/nonexistent/program --flag", "", "command '/nonexistent/program --flag' failed: exit code 1"},
    };
    LogCapture log;
    for (const auto& c : cases) {
        SCOPED_TRACE(c.command);
        log.Clear();
        EXPECT_EQ(c.output, Run(c.command, 10));
        EXPECT_EQ(c.logged.empty() ? 0u : 1u, log.Count(ANDROID_LOG_INFO, "failed")) << log.Dump();
        EXPECT_TRUE(c.logged.empty() || log.Contains(ANDROID_LOG_INFO, "ToFileWithTimeout " + c.logged));
    }
#if !defined(__SANITIZE_THREAD__)  // ThreadSanitizer turns vfork into fork: the child's line stays there
    EXPECT_TRUE(log.Contains(ANDROID_LOG_INFO, "WriteCommandResultToFileWithTimeout execvp, start will not log"));
#endif
    log.Clear();
    EXPECT_FALSE(CmdProcessor::WriteCommandResultToFileWithTimeout(1, "", 10));
    EXPECT_TRUE(log.Lines().empty());
}

TEST_F(CmdProcessorTest, OverrunIsTerminatedThenKilled) {
    // An ignored SIGTERM survives exec: that sleep shrugs it off and needs SIGKILL after the grace.
    struct {
        std::string body;
        seconds atLeast;
    } cases[] = {{"echo started\nexec sleep 60", seconds(0)},
                 {"echo started\ntrap '' TERM\nexec sleep 60", seconds(5)}};
    for (const auto& c : cases) {
        SCOPED_TRACE(c.body);
        LogCapture log;
        std::string script = WriteScript(c.body);
        auto start = Clock::now();
        EXPECT_EQ("started\n", Run(script, 1));
        EXPECT_GE(Clock::now() - start, c.atLeast);
        EXPECT_LT(Clock::now() - start, seconds(30));
        EXPECT_TRUE(
                log.Contains(ANDROID_LOG_INFO, "ToFileWithTimeout command '" + script + "' timed out, (killing pid"));
        EXPECT_FALSE(log.Contains(ANDROID_LOG_INFO, "even with SIGKILL"));
    }
}

// The daemon's situation: SIGCHLD blocked in every thread, several threads running, children
// reaped elsewhere (pclose) leaving their signal pending.
TEST_F(CmdProcessorTest, ReapsAtOnceWithSigchldBlockedInEveryThread) {
    sigset_t childSignal, oldMask;
    sigemptyset(&childSignal);
    sigaddset(&childSignal, SIGCHLD);
    ASSERT_EQ(pthread_sigmask(SIG_BLOCK, &childSignal, &oldMask), 0);
    std::atomic<bool> stop{false};
    std::vector<std::thread> busy(3);
    for (auto& thread : busy)
        thread = std::thread([&stop] {
            while (!stop)
                std::this_thread::yield();
        });
    LogCapture log;
    std::string line;
    ASSERT_TRUE(CmdProcessor::GetCommandResult("echo pending", line));  // leaves a SIGCHLD pending
    auto start = Clock::now();
    EXPECT_EQ(Run("true", 30), "");
    EXPECT_LT(Clock::now() - start, seconds(15));
    // A command that outlives the first poll must not be mistaken for a stale signal's child.
    EXPECT_EQ(Run(WriteScript("sleep 0.3\necho done"), 30), "done\n");
    // The command starts with nothing blocked.
    std::string mask = Run("grep SigBlk /proc/self/status", 30);
    EXPECT_NE(mask.find("SigBlk:\t0000000000000000"), std::string::npos) << mask;
    for (const char* bad : {"timed out", "instead", "Error"})
        EXPECT_FALSE(log.Contains(ANDROID_LOG_INFO, bad)) << bad;
    stop = true;
    for (auto& thread : busy)
        thread.join();
    pthread_sigmask(SIG_SETMASK, &oldMask, nullptr);
}

TEST_F(CmdProcessorTest, WaitPidTimesOutWithEtimedoutAndProcessNameIsItsCmdline) {
    pid_t child = fork();
    if (child == 0)
        _exit(execlp("sleep", "sleep", "30", static_cast<char*>(nullptr)));
    ASSERT_GT(child, 0);
    errno = 0;
    EXPECT_FALSE(CmdProcessor::WaitPidWithTimeout(child, 1, nullptr));
    EXPECT_EQ(errno, ETIMEDOUT);
    EXPECT_EQ(CmdProcessor::GetProcNameByPid(child), std::string("sleep\0"
                                                                 "30",
                                                                 8));
    kill(child, SIGKILL);
    int status = 0;
    EXPECT_TRUE(CmdProcessor::WaitPidWithTimeout(child, 10, &status));
    EXPECT_TRUE(WIFSIGNALED(status) && WTERMSIG(status) == SIGKILL);
    EXPECT_EQ(CmdProcessor::GetProcNameByPid(child), "");  // reaped: gone
    EXPECT_EQ(CmdProcessor::GetProcNameByPid(-5), "");
}

TEST_F(CmdProcessorTest, FirstLineOfShellOutput) {
    std::string result = "previous";
    const std::pair<std::string, std::string> cases[] = {
            {"printf 'one\\ntwo\\nthree\\n'", "one\n"},
            {"printf 'no line end'", "no line end"},
            {"true", "no line end"},  // no output keeps the old value
            {"printf '" + std::string(600, 'x') + "'", std::string(511, 'x')},
    };
    for (const auto& c : cases) {
        EXPECT_TRUE(CmdProcessor::GetCommandResult(c.first, result));
        EXPECT_EQ(c.second, result) << c.first;
    }
    EXPECT_FALSE(CmdProcessor::GetCommandResult("", result));
}

}  // namespace
}  // namespace android::Orvane
