#ifndef ORVANE_PLUGINS_COMMAND_PIPE_H
#define ORVANE_PLUGINS_COMMAND_PIPE_H

#include <sys/types.h>

#include <chrono>
#include <string>
#include <vector>

#include <android-base/unique_fd.h>

namespace android {
namespace Orvane {

// A program's standard output on a pipe, read with a deadline. The program runs in a process
// group of its own, so that Close stops it together with whatever it started. popen offers
// neither: its reader waits as long as the command pleases, and pclose waits for the command to
// end, so a command that hangs would hold its reader's thread for good.
//
// Threads: one object belongs to one thread. The pipe is close-on-exec, so commands that other
// threads start meanwhile do not inherit it.
class CommandPipe {
public:
    using Clock = std::chrono::steady_clock;
    static constexpr std::chrono::seconds kReapWait{5};

    CommandPipe() = default;
    ~CommandPipe() { Close(); }
    CommandPipe(const CommandPipe&) = delete;
    CommandPipe& operator=(const CommandPipe&) = delete;

    // Starts argv[0], found on PATH, with no signal blocked (the daemon blocks SIGCHLD) and its
    // standard output on the pipe. False, with errno set, when it cannot be started.
    bool Start(const std::vector<std::string>& argv);
    // Bytes read (> 0), 0 at the end of the output, or -1 at the deadline (errno ETIMEDOUT) or on
    // an error.
    ssize_t Read(char* buffer, size_t size, Clock::time_point deadline);
    // Closes the pipe, kills what is left of the process group and reaps the program. Whatever
    // still runs once its output has ended or been given up is of no use to the reader. True
    // when nothing runs any more; false, with one warning, when the program did not end within
    // kReapWait of SIGKILL and was left unreaped.
    bool Close();

private:
    android::base::unique_fd output_;
    pid_t pid_ = -1;
};

}  // namespace Orvane
}  // namespace android

#endif  // ORVANE_PLUGINS_COMMAND_PIPE_H
