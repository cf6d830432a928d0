#ifndef ORVANE_UTILS_ORVANE_LOG_H
#define ORVANE_UTILS_ORVANE_LOG_H

#include <time.h>

#include <atomic>
#include <cinttypes>
#include <cstdint>

#include <android/log.h>

// Every line of the daemon goes to the system log under one tag, and its format begins with
// "%s", filled with the name of the operation that logs. The plain macros fill it with the
// enclosing function's name; OLOG_AS names the operation explicitly where that differs.
#define ORVANE_LOG_TAG "orvane"

#define OLOG_AS(prio, op, fmt, ...) __android_log_print(prio, ORVANE_LOG_TAG, fmt, op, ##__VA_ARGS__)

#define OLOGD(fmt, ...) OLOG_AS(ANDROID_LOG_DEBUG, __func__, fmt, ##__VA_ARGS__)
#define OLOGI(fmt, ...) OLOG_AS(ANDROID_LOG_INFO, __func__, fmt, ##__VA_ARGS__)
#define OLOGW(fmt, ...) OLOG_AS(ANDROID_LOG_WARN, __func__, fmt, ##__VA_ARGS__)
#define OLOGE(fmt, ...) OLOG_AS(ANDROID_LOG_ERROR, __func__, fmt, ##__VA_ARGS__)

namespace android {
namespace Orvane {

// Collapses the repeats of one log line. A failure that outside input can repeat (one line per
// record, per event, per statement, per request) would otherwise flood the log: the first line of
// a call site goes out exactly as written, further lines of that site within the window are only
// counted, and the first line after the window is preceded by one line with that count.
// Lock-free; any thread.
class LogRepeatGate {
public:
    static constexpr int64_t kDefaultWindowMs = 10000;

    explicit LogRepeatGate(int64_t windowMs = kDefaultWindowMs) : windowMs_(windowMs) {}

    // True when this line is to be written; `collapsed` then holds how many lines of this site
    // were left out since the last one written.
    bool Pass(uint64_t& collapsed) {
        int64_t now = NowMs();
        int64_t end = windowEndMs_.load(std::memory_order_relaxed);
        if (now < end || !windowEndMs_.compare_exchange_strong(end, now + windowMs_, std::memory_order_relaxed)) {
            collapsed_.fetch_add(1, std::memory_order_relaxed);
            return false;
        }
        collapsed = collapsed_.exchange(0, std::memory_order_relaxed);
        return true;
    }
    int64_t WindowSeconds() const { return windowMs_ / 1000; }

private:
    static int64_t NowMs() {
        struct timespec ts;
        clock_gettime(CLOCK_MONOTONIC, &ts);
        return static_cast<int64_t>(ts.tv_sec) * 1000 + ts.tv_nsec / 1000000;
    }

    const int64_t windowMs_;
    std::atomic<int64_t> windowEndMs_{INT64_MIN};
    std::atomic<uint64_t> collapsed_{0};
};

}  // namespace Orvane
}  // namespace android

// OLOG_AS for a line that outside input can repeat: collapsed per call site (LogRepeatGate).
#define OLOG_LIMITED_AS(prio, op, fmt, ...)                                                              \
    do {                                                                                                 \
        static ::android::Orvane::LogRepeatGate orvaneLogGate;                                           \
        uint64_t orvaneCollapsed = 0;                                                                    \
        if (orvaneLogGate.Pass(orvaneCollapsed)) {                                                       \
            if (orvaneCollapsed != 0) {                                                                  \
                __android_log_print(prio, ORVANE_LOG_TAG,                                                \
                                    "%s collapsed %" PRIu64 " lines like the next in %" PRId64 " s", op, \
                                    orvaneCollapsed, orvaneLogGate.WindowSeconds());                     \
            }                                                                                            \
            OLOG_AS(prio, op, fmt, ##__VA_ARGS__);                                                       \
        }                                                                                                \
    } while (0)

#define OLOGI_LIMITED(fmt, ...) OLOG_LIMITED_AS(ANDROID_LOG_INFO, __func__, fmt, ##__VA_ARGS__)
#define OLOGW_LIMITED(fmt, ...) OLOG_LIMITED_AS(ANDROID_LOG_WARN, __func__, fmt, ##__VA_ARGS__)
#define OLOGE_LIMITED(fmt, ...) OLOG_LIMITED_AS(ANDROID_LOG_ERROR, __func__, fmt, ##__VA_ARGS__)

#endif  // ORVANE_UTILS_ORVANE_LOG_H
