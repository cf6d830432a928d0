#ifndef ORVANE_TESTS_PLUGINS_DEVSIM_PROCESS_H
#define ORVANE_TESTS_PLUGINS_DEVSIM_PROCESS_H

#include <fcntl.h>
#include <signal.h>
#include <stdlib.h>
#include <sys/prctl.h>
#include <sys/wait.h>
#include <unistd.h>

#include <string>

#include <android-base/file.h>
#include <android-base/unique_fd.h>

#include "tests/common/log_capture.h"

namespace android::Orvane {

// orvane-devsim serving a folder of its own, for as long as the object lives. Stopping and
// starting it again makes the nodes vanish and come back at the same paths.
class DevSim {
public:
    // False with the emulator's own one-line reason when FUSE cannot be mounted (in the object's
    // folder unless one is given; its node paths are known before it is started).
    bool Start(std::string* failure, const char* mountAt = nullptr) {
        using android::base::unique_fd;
        int errPipe[2];
        if (pipe2(errPipe, O_CLOEXEC) != 0) {
            *failure = "cannot create a pipe";
            return false;
        }
        unique_fd errRead(errPipe[0]), errWrite(errPipe[1]);
        if (mountAt != nullptr) {
            mount_ = mountAt;
        }
        std::string program = std::string(ORVANE_BINARY_DIR) + "/orvane-devsim";
        pid_ = fork();
        if (pid_ == 0) {
            prctl(PR_SET_PDEATHSIG, SIGTERM);  // a crashed test leaves no mount behind
            dup2(errWrite.get(), STDERR_FILENO);
            execl(program.c_str(), program.c_str(), mount_.c_str(), static_cast<char*>(nullptr));
            _exit(127);
        }
        errWrite.reset();
        auto mounted = [this] { return access(Path("qxev").c_str(), F_OK) == 0; };
        WaitUntil([&] { return mounted() || waitpid(pid_, nullptr, WNOHANG) == pid_; });
        bool ok = mounted();
        if (!ok) {
            char reason[512] = {};
            fcntl(errRead.get(), F_SETFL, O_NONBLOCK);
            ssize_t length = read(errRead.get(), reason, sizeof(reason) - 1);
            *failure = length > 0 ? std::string(reason, length) : "orvane-devsim did not start: " + program;
            Stop();
        }
        return ok;
    }
    ~DevSim() { Stop(); }

    std::string Path(const std::string& node) const { return mount_ + "/" + node; }

    // One write, one record, as a driver queues it.
    bool Inject(const std::string& node, const std::string& record) const {
        android::base::unique_fd fd(open(Path(node).c_str(), O_WRONLY | O_CLOEXEC));
        return fd.ok() && write(fd.get(), record.data(), record.size()) == static_cast<ssize_t>(record.size());
    }

    // Unmounts; readers still blocked on a node then see their read fail.
    void Stop() {
        if (pid_ > 0) {
            kill(pid_, SIGTERM);
            waitpid(pid_, nullptr, 0);
            pid_ = -1;
        }
    }

private:
    TemporaryDir folder_;
    std::string mount_ = folder_.path;
    pid_t pid_ = -1;
};

}  // namespace android::Orvane

#endif  // ORVANE_TESTS_PLUGINS_DEVSIM_PROCESS_H
