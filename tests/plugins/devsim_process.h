#ifndef ORVANE_TESTS_PLUGINS_DEVSIM_PROCESS_H
#define ORVANE_TESTS_PLUGINS_DEVSIM_PROCESS_H

#include <fcntl.h>
#include <signal.h>
#include <stdlib.h>
#include <sys/prctl.h>
#include <sys/wait.h>
#include <unistd.h>

#include <string>

#include "tests/common/log_capture.h"

namespace android::Orvane {

// orvane-devsim serving a fresh folder, for as long as the object lives.
class DevSim {
public:
    // False with the emulator's own one-line reason when FUSE cannot be mounted (in a fresh
    // folder unless one is given).
    bool Start(std::string* failure, const char* mountAt = nullptr) {
        char folderTemplate[] = "/tmp/orvane-devsim-test-XXXXXX";
        int errPipe[2];
        if ((mountAt == nullptr && mkdtemp(folderTemplate) == nullptr) || pipe2(errPipe, O_CLOEXEC) != 0) {
            *failure = "cannot create a mount folder or a pipe";
            return false;
        }
        folder_ = mountAt != nullptr ? mountAt : folderTemplate;
        std::string program = std::string(ORVANE_BINARY_DIR) + "/orvane-devsim";
        pid_ = fork();
        if (pid_ == 0) {
            prctl(PR_SET_PDEATHSIG, SIGTERM);  // a crashed test leaves no mount behind
            dup2(errPipe[1], STDERR_FILENO);
            execl(program.c_str(), program.c_str(), folder_.c_str(), static_cast<char*>(nullptr));
            _exit(127);
        }
        close(errPipe[1]);
        auto mounted = [this] { return access(Path("qxev").c_str(), F_OK) == 0; };
        WaitUntil([&] { return mounted() || waitpid(pid_, nullptr, WNOHANG) == pid_; });
        bool ok = mounted();
        if (!ok) {
            char reason[512] = {};
            fcntl(errPipe[0], F_SETFL, O_NONBLOCK);
            ssize_t length = read(errPipe[0], reason, sizeof(reason) - 1);
            *failure = length > 0 ? std::string(reason, length) : "orvane-devsim did not start: " + program;
            Stop();
        }
        close(errPipe[0]);
        return ok;
    }
    ~DevSim() { Stop(); }

    std::string Path(const std::string& node) const { return folder_ + "/" + node; }

    // One write, one record, as a driver queues it.
    bool Inject(const std::string& node, const std::string& record) const {
        int fd = open(Path(node).c_str(), O_WRONLY | O_CLOEXEC);
        bool written = fd >= 0 && write(fd, record.data(), record.size()) == static_cast<ssize_t>(record.size());
        close(fd);
        return written;
    }

    // Unmounts; readers still blocked on a node then see their read fail.
    void Stop() {
        if (pid_ > 0) {
            kill(pid_, SIGTERM);
            waitpid(pid_, nullptr, 0);
            pid_ = -1;
        }
        if (!folder_.empty()) {
            rmdir(folder_.c_str());
            folder_.clear();
        }
    }

private:
    std::string folder_;
    pid_t pid_ = -1;
};

}  // namespace android::Orvane

#endif  // ORVANE_TESTS_PLUGINS_DEVSIM_PROCESS_H
