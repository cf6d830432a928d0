#include "tests/common/log_capture.h"

#include <mutex>

namespace android::Orvane {
namespace {

std::mutex gMutex;
std::vector<LogLine> gLines;
bool gActive = false;

void Record(int priority, const char* tag, const char* message) {
    std::lock_guard<std::mutex> lock(gMutex);
    if (gActive) {
        gLines.push_back({priority, tag ? tag : "", message ? message : ""});
    }
}

// liblog's logger hook changed shape between releases: the device's takes one message record,
// the host's (Debian's) takes the record and the text apart.
#if defined(__ANDROID__)
void CaptureLogger(const struct __android_log_message* message) {
    Record(message->priority, message->tag, message->message);
}
#define DEFAULT_LOGGER __android_log_logd_logger
#else
void CaptureLogger(const struct __android_logger_data* data, const char* message) {
    Record(data->priority, data->tag, message);
}
#define DEFAULT_LOGGER __android_log_stderr_logger
#endif

}  // namespace

LogCapture::LogCapture() {
    {
        std::lock_guard<std::mutex> lock(gMutex);
        gLines.clear();
        gActive = true;
    }
    __android_log_set_minimum_priority(ANDROID_LOG_VERBOSE);
    __android_log_set_logger(CaptureLogger);
}

LogCapture::~LogCapture() {
    __android_log_set_logger(DEFAULT_LOGGER);
    std::lock_guard<std::mutex> lock(gMutex);
    gActive = false;
    gLines.clear();
}

std::vector<LogLine> LogCapture::Lines() const {
    std::lock_guard<std::mutex> lock(gMutex);
    return gLines;
}

size_t LogCapture::Count(int priority, const std::string& text) const {
    std::lock_guard<std::mutex> lock(gMutex);
    size_t count = 0;
    for (const auto& line : gLines) {
        if (line.priority == priority && line.tag == "orvane" && line.message.find(text) != std::string::npos) {
            ++count;
        }
    }
    return count;
}

bool LogCapture::WaitFor(int priority, const std::string& text, std::chrono::milliseconds bound) const {
    return WaitUntil([&] { return Contains(priority, text); }, bound);
}

void LogCapture::Clear() {
    std::lock_guard<std::mutex> lock(gMutex);
    gLines.clear();
}

std::string LogCapture::Dump() const {
    std::lock_guard<std::mutex> lock(gMutex);
    std::string out;
    for (const auto& line : gLines) {
        out += std::to_string(line.priority) + " " + line.tag + ": " + line.message + "\n";
    }
    return out;
}

}  // namespace android::Orvane
