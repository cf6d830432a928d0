#include "plugins/command_pipe.h"

#include <fcntl.h>
#include <poll.h>
#include <signal.h>
#include <spawn.h>
#include <sys/wait.h>
#include <time.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstdint>

#include "utils/orvane_log.h"

extern char** environ;

namespace android {
namespace Orvane {

bool CommandPipe::Start(const std::vector<std::string>& argv) {
    Close();
    if (argv.empty()) {
        errno = EINVAL;
        return false;
    }
    int ends[2];
    if (pipe2(ends, O_CLOEXEC) != 0) {
        return false;
    }
    android::base::unique_fd readEnd(ends[0]);
    android::base::unique_fd writeEnd(ends[1]);

    std::vector<char*> args;
    for (const std::string& arg : argv) {
        args.push_back(const_cast<char*>(arg.c_str()));
    }
    args.push_back(nullptr);

    posix_spawn_file_actions_t actions;
    posix_spawnattr_t attributes;
    posix_spawn_file_actions_init(&actions);
    posix_spawnattr_init(&attributes);
    // The duplicate on standard output loses close-on-exec; nothing else of ours reaches the program.
    posix_spawn_file_actions_adddup2(&actions, writeEnd.get(), STDOUT_FILENO);
    sigset_t noSignals;
    sigemptyset(&noSignals);
    posix_spawnattr_setsigmask(&attributes, &noSignals);
    posix_spawnattr_setpgroup(&attributes, 0);
    posix_spawnattr_setflags(&attributes, POSIX_SPAWN_SETSIGMASK | POSIX_SPAWN_SETPGROUP);
    pid_t pid = -1;
    int result = posix_spawnp(&pid, args[0], &actions, &attributes, args.data(), environ);
    posix_spawnattr_destroy(&attributes);
    posix_spawn_file_actions_destroy(&actions);
    if (result != 0) {
        errno = result;
        return false;
    }
    pid_ = pid;
    output_ = std::move(readEnd);
    return true;
}

ssize_t CommandPipe::Read(char* buffer, size_t size, Clock::time_point deadline) {
    if (output_ < 0) {
        errno = EBADF;
        return -1;
    }
    while (true) {
        // Checked before every read, or a command that never stops writing would never time out.
        auto left = std::chrono::duration_cast<std::chrono::milliseconds>(deadline - Clock::now()).count();
        struct pollfd ready = {output_.get(), POLLIN, 0};
        int polled = left > 0 ? poll(&ready, 1, static_cast<int>(std::min<decltype(left)>(left, INT32_MAX))) : 0;
        if (polled < 0 && errno == EINTR) {
            continue;
        }
        if (polled < 0) {
            return -1;
        }
        if (polled == 0) {
            errno = ETIMEDOUT;
            return -1;
        }
        ssize_t got = read(output_.get(), buffer, size);
        if (got >= 0 || errno != EINTR) {
            return got;
        }
    }
}

bool CommandPipe::Close() {
    output_.reset();
    if (pid_ <= 0) {
        return true;
    }
    // Killed before the leader is reaped: until then the group's id cannot be handed to another.
    kill(-pid_, SIGKILL);
    // SIGKILL ends a program at once unless it sleeps uninterruptibly in the kernel; for such a
    // one the reader waits a bounded time and then leaves a zombie behind rather than its thread.
    const Clock::time_point giveUp = Clock::now() + kReapWait;
    bool reaped = false;
    while (true) {
        pid_t got = waitpid(pid_, nullptr, WNOHANG);
        if (got == pid_ || (got < 0 && errno != EINTR)) {
            reaped = true;
            break;
        }
        if (Clock::now() >= giveUp) {
            OLOGW("%s pid %d did not end on SIGKILL, left unreaped", pid_);
            break;
        }
        const struct timespec pause = {0, 10 * 1000 * 1000};
        nanosleep(&pause, nullptr);
    }
    pid_ = -1;
    return reaped;
}

}  // namespace Orvane
}  // namespace android
