#include "plugins/cmd_processor.h"

#include <signal.h>
#include <sys/prctl.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <cstring>
#include <vector>

#include "utils/file_util.h"
#include "utils/orvane_log.h"
#include "utils/string_util.h"

namespace android {
namespace Orvane {
namespace {

constexpr int kKillWaitSeconds = 5;

// Takes a SIGCHLD left pending by a child that was reaped elsewhere (pclose, an earlier
// waiter that lost its race), so that it cannot be taken for the end of the child awaited now.
void DiscardPendingChildSignal(const sigset_t& childSignal) {
    const struct timespec noWait = {0, 0};
    while (sigtimedwait(&childSignal, nullptr, &noWait) == SIGCHLD) {
    }
}

}  // namespace

std::string CmdProcessor::GetProcNameByPid(int pid) {
    char path[256] = {0};
    snprintf(path, sizeof(path), "/proc/%d/cmdline", pid);
    std::string name;
    if (!FileUtil::LoadStringFromFile(path, name)) {
        return "";
    }
    size_t end = name.find_last_not_of(" \t\r\n");
    name.erase(end == std::string::npos ? 0 : end + 1);
    return name;
}

bool CmdProcessor::WaitPidWithTimeout(pid_t pid, int timeoutSeconds, int* status) {
    sigset_t childSignal;
    sigset_t oldMask;
    sigemptyset(&childSignal);
    sigaddset(&childSignal, SIGCHLD);
    if (sigprocmask(SIG_BLOCK, &childSignal, &oldMask) != 0) {
        OLOGI("%s sigprocmask failed: %s", strerror(errno));
        return false;
    }
    DiscardPendingChildSignal(childSignal);

    pid_t got = waitpid(pid, status, WNOHANG);
    if (got == pid) {
        sigprocmask(SIG_SETMASK, &oldMask, nullptr);
        return true;
    }
    if (got > 0) {
        OLOGI("%s Waiting for pid %d, got pid %d instead", pid, got);
        sigprocmask(SIG_SETMASK, &oldMask, nullptr);
        errno = 0;
        return false;
    }

    const struct timespec timeout = {timeoutSeconds, 0};
    int signal;
    do {
        signal = sigtimedwait(&childSignal, nullptr, &timeout);
    } while (signal == -1 && errno == EINTR);
    int waitErrno = errno;

    if (sigprocmask(SIG_SETMASK, &oldMask, nullptr) != 0) {
        OLOGI("%s sigprocmask failed: %s", strerror(errno));
    }
    if (signal == -1) {
        if (waitErrno == EAGAIN) {
            errno = ETIMEDOUT;
        } else {
            OLOGI("%s sigtimedwait failed: %s", strerror(waitErrno));
            errno = waitErrno;
        }
        return false;
    }

    got = waitpid(pid, status, WNOHANG);
    if (got == pid) {
        return true;
    }
    if (got == -1) {
        OLOGI("%s waitpid failed: %s", strerror(errno));
    } else {
        OLOGI("%s Waiting for pid %d, got pid %d instead", pid, got);
        errno = 0;
    }
    return false;
}

bool CmdProcessor::WriteCommandResultToFileWithTimeout(int fd, const std::string& command, int timeoutSeconds) {
    if (command.empty()) {
        return false;
    }
    // Everything the child needs is prepared here: a vfork child shares our memory and must
    // not allocate.
    std::vector<std::string> words = StringUtil::SplitStr(command, ' ');
    std::vector<char*> argv;
    for (auto& word : words) {
        argv.push_back(&word[0]);
    }
    argv.push_back(nullptr);
    sigset_t noSignals;
    sigemptyset(&noSignals);

    pid_t child = vfork();
    if (child < 0) {
        OLOGI("%s create vfork failed,%s", strerror(errno));
        return false;
    }
    if (child == 0) {
        // The daemon blocks SIGCHLD everywhere; the command must start with a clean mask.
        sigprocmask(SIG_SETMASK, &noSignals, nullptr);
        prctl(PR_SET_PDEATHSIG, SIGKILL);
        while (dup2(fd, STDOUT_FILENO) == -1 && errno == EINTR) {
        }
        execvp(argv[0], argv.data());
        OLOG_AS(ANDROID_LOG_INFO, "WriteCommandResultToFileWithTimeout", "%s execvp, start will not log");
        _exit(1);
    }

    int status = 0;
    if (!WaitPidWithTimeout(child, timeoutSeconds, &status)) {
        if (errno == ETIMEDOUT) {
            OLOGI("%s command '%s' timed out, (killing pid %d)", command.c_str(), child);
        } else {
            OLOGI("%s command '%s': Error, (killing pid %d)", command.c_str(), child);
        }
        kill(child, SIGTERM);
        if (WaitPidWithTimeout(child, kKillWaitSeconds, nullptr)) {
            return true;
        }
        kill(child, SIGKILL);
        if (WaitPidWithTimeout(child, kKillWaitSeconds, nullptr)) {
            return true;
        }
        OLOGI("%s could not kill command '%s' (pid %d) even with SIGKILL", command.c_str(), child);
        return true;
    }
    if (WIFSIGNALED(status)) {
        OLOGI("%s command '%s' failed: killed by signal %d", command.c_str(), WTERMSIG(status));
    } else if (WIFEXITED(status) && WEXITSTATUS(status) != 0) {
        OLOGI("%s command '%s' failed: exit code %d", command.c_str(), WEXITSTATUS(status));
    }
    return true;
}

bool CmdProcessor::GetCommandResult(const std::string& command, std::string& result) {
    if (command.empty()) {
        return false;
    }
    FILE* pipe = popen(command.c_str(), "r");
    if (pipe == nullptr) {
        return false;
    }
    char line[512] = {0};
    if (fgets(line, sizeof(line), pipe) != nullptr) {
        result = line;
    }
    pclose(pipe);
    return true;
}

}  // namespace Orvane
}  // namespace android
