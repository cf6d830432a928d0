#ifndef ORVANE_PLUGINS_CMD_PROCESSOR_H
#define ORVANE_PLUGINS_CMD_PROCESSOR_H

#include <sys/types.h>

#include <string>

namespace android {
namespace Orvane {

// Runs external commands and looks at processes. Stateless; every operation may be called
// from any thread.
//
// Children are reaped through SIGCHLD: WaitPidWithTimeout blocks it in the calling thread and
// waits for it there with sigtimedwait. The signal is process-directed, so the daemon blocks it
// in main before any thread starts; otherwise a thread that does not block it would receive and
// discard it, and the waiter would sit out its whole time-out. Two threads waiting at once may
// take each other's signal: the loser ends early with "got pid 0 instead" and kills its command.
class CmdProcessor {
public:
    // The command line of the process from "/proc/<pid>/cmdline"; empty when it cannot be read.
    // Arguments stay separated by NUL bytes, so as a C string it is the program name.
    static std::string GetProcNameByPid(int pid);

    // Waits at most timeoutSeconds for the child pid to end. False on time-out (errno is then
    // ETIMEDOUT) or when another child's end was seen. status may be null.
    static bool WaitPidWithTimeout(pid_t pid, int timeoutSeconds, int* status);

    // Runs command (split at single blanks, no shell) with its standard output on fd, killing
    // it with SIGTERM, then SIGKILL, when it overruns. False only for an empty command or a
    // failed fork: a command that fails, overruns or cannot start still gives true.
    static bool WriteCommandResultToFileWithTimeout(int fd, const std::string& command, int timeoutSeconds);

    // Runs command through the shell; result gets the first line of its output (with its line
    // feed) or keeps its old value when there was none.
    static bool GetCommandResult(const std::string& command, std::string& result);
};

}  // namespace Orvane
}  // namespace android

#endif  // ORVANE_PLUGINS_CMD_PROCESSOR_H
