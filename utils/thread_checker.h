#ifndef ORVANE_UTILS_THREAD_CHECKER_H
#define ORVANE_UTILS_THREAD_CHECKER_H

#include <sys/types.h>
#include <unistd.h>

#include <atomic>
#include <cstdlib>

#include "utils/orvane_log.h"

namespace android {
namespace Orvane {

// Checks at run time a contract that a comment would otherwise only state: the object is used
// by one thread at a time. It binds to the first thread that checks and aborts, with one fatal
// line, when another thread checks while it is bound; Detach hands the object over (for example
// when its owner closes it). Compiled into host builds (tests, benchmarks and the host daemon
// define ORVANE_THREAD_CHECKS) and out of device builds, where Check costs nothing.
class ThreadChecker {
public:
    void Check(const char* operation) {
#if defined(ORVANE_THREAD_CHECKS)
        // gettid is a system call, and Check runs at every statement of the storage loop.
        thread_local pid_t self = gettid();
        pid_t owner = 0;
        if (!owner_.compare_exchange_strong(owner, self) && owner != self) {
            OLOG_AS(ANDROID_LOG_FATAL, operation, "%s called on thread %d, owned by thread %d", self, owner);
            abort();
        }
#else
        (void)operation;
#endif
    }
    void Detach() {
        owner_.store(0);
    }

private:
    std::atomic<pid_t> owner_{0};
};

}  // namespace Orvane
}  // namespace android

#endif  // ORVANE_UTILS_THREAD_CHECKER_H
