#ifndef ORVANE_TESTS_COMMON_LOG_CAPTURE_H
#define ORVANE_TESTS_COMMON_LOG_CAPTURE_H

#include <chrono>
#include <string>
#include <vector>

#include <android/log.h>

namespace android::Orvane {

// One line that reached liblog while a LogCapture was alive.
struct LogLine {
    int priority;
    std::string tag;
    std::string message;
};

// Captures every log line of the process (all threads) from construction to destruction,
// at every priority down to verbose. Only one capture may be alive at a time.
class LogCapture {
public:
    LogCapture();
    ~LogCapture();
    LogCapture(const LogCapture&) = delete;
    LogCapture& operator=(const LogCapture&) = delete;

    std::vector<LogLine> Lines() const;
    // Lines under the tag "orvane" at the given priority whose message contains the text.
    size_t Count(int priority, const std::string& text) const;
    bool Contains(int priority, const std::string& text) const { return Count(priority, text) > 0; }
    // Waits until such a line has been logged; false when it did not come within the bound.
    bool WaitFor(int priority, const std::string& text,
                 std::chrono::milliseconds bound = std::chrono::seconds(10)) const;
    void Clear();
    // Everything captured, one line per entry, for failure messages.
    std::string Dump() const;
};

// Waits on a condition with a generous bound instead of sleeping blindly.
template <typename Predicate>
bool WaitUntil(Predicate done, std::chrono::milliseconds bound = std::chrono::seconds(10)) {
    auto deadline = std::chrono::steady_clock::now() + bound;
    while (!done()) {
        if (std::chrono::steady_clock::now() > deadline) {
            return false;
        }
        struct timespec pause = {0, 1000000};
        nanosleep(&pause, nullptr);
    }
    return true;
}

}  // namespace android::Orvane

#endif  // ORVANE_TESTS_COMMON_LOG_CAPTURE_H
