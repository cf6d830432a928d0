#include "service/caller_writer.h"

#include <limits.h>
#include <poll.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>

namespace android {
namespace Orvane {
namespace CallerWriter {
namespace {

using Clock = std::chrono::steady_clock;

// False when the deadline passed, or the descriptor reports an error or a reader that is gone.
bool WaitForRoom(int fd, Clock::time_point deadline) {
    while (true) {
        auto left = std::chrono::duration_cast<std::chrono::milliseconds>(deadline - Clock::now());
        if (left.count() <= 0) {
            return false;
        }
        struct pollfd out = {fd, POLLOUT, 0};
        int ready = poll(&out, 1, static_cast<int>(left.count()));
        if (ready < 0 && errno == EINTR) {
            continue;
        }
        return ready == 1 && (out.revents & (POLLERR | POLLHUP | POLLNVAL)) == 0;
    }
}

}  // namespace

bool Write(int fd, const char* bytes, size_t length, Clock::time_point deadline) {
    struct stat st = {};
    if (fstat(fd, &st) != 0) {
        return false;
    }
    const bool isSocket = S_ISSOCK(st.st_mode);
    while (length > 0) {
        if (!isSocket && !WaitForRoom(fd, deadline)) {
            return false;
        }
        ssize_t n = isSocket ? send(fd, bytes, length, MSG_DONTWAIT | MSG_NOSIGNAL)
                             : write(fd, bytes, std::min<size_t>(length, PIPE_BUF));
        if (n > 0) {
            bytes += n;
            length -= static_cast<size_t>(n);
            continue;
        }
        if (n < 0 && errno == EINTR) {
            continue;
        }
        if (n == 0 || (errno != EAGAIN && errno != EWOULDBLOCK) || (isSocket && !WaitForRoom(fd, deadline))) {
            return false;
        }
    }
    return true;
}

}  // namespace CallerWriter
}  // namespace Orvane
}  // namespace android
