#include "plugins/psi_monitor.h"

#include <fcntl.h>
#include <poll.h>
#include <pthread.h>
#include <sys/eventfd.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <climits>
#include <cstring>

#include "utils/orvane_log.h"
#include "utils/time_util.h"

namespace android {
namespace Orvane {
namespace {

constexpr int64_t kNsPerMs = 1000000;
constexpr int64_t kNsPerSecond = 1000000000;
// Without CAP_SYS_RESOURCE, kernels from 6.5 on take only windows in whole multiples of 2 s
// (and older ones no trigger at all).
constexpr uint32_t kUnprivilegedWindowUs = 2000000;

}  // namespace

PsiMonitor::PsiMonitor(std::string pressureDir) : pressureDir_(std::move(pressureDir)) {}

PsiMonitor::~PsiMonitor() {
    Stop();
}

std::vector<std::string> PsiMonitor::Arm(const std::vector<PsiTriggerSpec>& specs) {
    armed_.clear();
    coolUntilNs_.clear();
    std::vector<std::string> failures;
    for (const PsiTriggerSpec& spec : specs) {
        std::string path = pressureDir_ + spec.resource;
        android::base::unique_fd fd(open(path.c_str(), O_RDWR | O_NONBLOCK | O_CLOEXEC));
        // The kernel makes the last byte of a write the end of the text, so the NUL is written too.
        if (fd < 0 || write(fd.get(), spec.text.c_str(), spec.text.size() + 1) < 0) {
            int error = errno;
            std::string failure = path + " \"" + spec.text + "\": " + strerror(error);
            if (error == EINVAL && spec.windowUs % kUnprivilegedWindowUs != 0) {
                failure += " (without CAP_SYS_RESOURCE the window must be a multiple of 2 s)";
            }
            failures.push_back(failure);
            continue;
        }
        armed_.push_back({spec, std::move(fd), false});
        coolUntilNs_.push_back(0);
        failures.emplace_back();
    }
    return failures;
}

void PsiMonitor::Start(FireCallback callback, DaemonStats& stats) {
    if (watcher_.joinable() || armed_.empty()) {
        return;
    }
    wakeFd_.reset(eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK));
    if (wakeFd_ < 0) {
        OLOGE("%s eventfd failed: %s, pressure not watched", strerror(errno));
        return;
    }
    callback_ = std::move(callback);
    stats_ = &stats;
    watcher_ = std::thread([this] { Watch(); });
}

void PsiMonitor::Stop() {
    if (watcher_.joinable()) {
        uint64_t one = 1;
        if (write(wakeFd_.get(), &one, sizeof(one)) != sizeof(one)) {
            OLOGE("%s cannot wake the watcher: %s", strerror(errno));
        }
        watcher_.join();
    }
    armed_.clear();
    coolUntilNs_.clear();
    wakeFd_.reset();
    callback_ = nullptr;
}

void PsiMonitor::Drain(const std::string& resource) {
    for (Armed& armed : armed_) {
        if (armed.spec.resource != resource || armed.lost) {
            continue;
        }
        struct pollfd one = {armed.fd.get(), POLLPRI, 0};
        poll(&one, 1, 0);  // polling is what clears a kept event
    }
}

void PsiMonitor::Watch() {
    pthread_setname_np(pthread_self(), "perf_psi");
    std::vector<struct pollfd> fds;
    std::vector<size_t> owners;  // the armed trigger of each entry after the wake descriptor
    for (;;) {
        int64_t now = TimeUtil::GetNanoSecondSinceSystemStart();
        int64_t timeoutMs = -1;
        fds.assign(1, {wakeFd_.get(), POLLIN, 0});
        owners.clear();
        for (size_t i = 0; i < armed_.size(); ++i) {
            if (armed_[i].lost) {
                continue;
            }
            int64_t until = coolUntilNs_[i];
            if (until != 0 && until <= now) {
                // Cooled down: forget what fired meanwhile; lasting pressure fires again within
                // one window.
                for (size_t j = 0; j < armed_.size(); ++j) {
                    if (armed_[j].spec.resource == armed_[i].spec.resource) {
                        coolUntilNs_[j] = 0;
                    }
                }
                Drain(armed_[i].spec.resource);
                until = 0;
            }
            if (until != 0) {
                int64_t leftMs = (until - now + kNsPerMs - 1) / kNsPerMs;
                timeoutMs = timeoutMs < 0 ? leftMs : std::min(timeoutMs, leftMs);
                continue;
            }
            fds.push_back({armed_[i].fd.get(), POLLPRI, 0});
            owners.push_back(i);
        }
        int ready = poll(fds.data(), fds.size(), static_cast<int>(std::min<int64_t>(timeoutMs, INT_MAX)));
        if (ready < 0) {
            if (errno == EINTR) {
                continue;
            }
            OLOGE("%s poll failed: %s, pressure no longer watched", strerror(errno));
            return;
        }
        if (fds[0].revents != 0) {
            return;  // Stop
        }
        now = TimeUtil::GetNanoSecondSinceSystemStart();
        for (size_t k = 1; k < fds.size(); ++k) {
            Armed& armed = armed_[owners[k - 1]];
            if ((fds[k].revents & (POLLERR | POLLHUP | POLLNVAL)) != 0) {
                armed.lost = true;
                stats_->Add("perf.trigger_lost." + armed.spec.resource);
                OLOGW("%s trigger \"%s\" of %s lost (events 0x%x), no longer watched", armed.spec.text.c_str(),
                      armed.spec.resource.c_str(), fds[k].revents);
                continue;
            }
            // Two triggers of one resource (some and full) firing together make one report.
            if ((fds[k].revents & POLLPRI) == 0 || coolUntilNs_[owners[k - 1]] != 0) {
                continue;
            }
            int64_t until = now + static_cast<int64_t>(armed.spec.coolDownSec) * kNsPerSecond;
            for (size_t j = 0; j < armed_.size(); ++j) {
                if (armed_[j].spec.resource == armed.spec.resource) {
                    coolUntilNs_[j] = until;
                }
            }
            callback_(armed.spec.resource, armed.spec.text);
        }
    }
}

}  // namespace Orvane
}  // namespace android
