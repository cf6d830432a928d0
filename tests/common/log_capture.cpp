#include "tests/common/log_capture.h"

#include <utils/Mutex.h>

namespace android::Orvane {
namespace {

Mutex gMutex;
std::vector<LogLine> gLines GUARDED_BY(gMutex);
bool gActive GUARDED_BY(gMutex) = false;

void Record(int priority, const char* tag, const char* message) {
    Mutex::Autolock lock(gMutex);
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
        Mutex::Autolock lock(gMutex);
        gLines.clear();
        gActive = true;
    }
    __android_log_set_minimum_priority(ANDROID_LOG_VERBOSE);
    __android_log_set_logger(CaptureLogger);
}

LogCapture::~LogCapture() {
    __android_log_set_logger(DEFAULT_LOGGER);
    Mutex::Autolock lock(gMutex);
    gActive = false;
    gLines.clear();
}

std::vector<LogLine> LogCapture::Lines() const {
    Mutex::Autolock lock(gMutex);
    return gLines;
}

size_t LogCapture::Count(int priority, const std::string& text) const {
    Mutex::Autolock lock(gMutex);
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
    Mutex::Autolock lock(gMutex);
    gLines.clear();
}

std::string LogCapture::Dump() const {
    Mutex::Autolock lock(gMutex);
    std::string out;
    for (const auto& line : gLines) {
        out += std::to_string(line.priority) + " " + line.tag + ": " + line.message + "\n";
    }
    return out;
}

}  // namespace android::Orvane
