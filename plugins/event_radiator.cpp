#include "plugins/event_radiator.h"

#include <ctype.h>
#include <fcntl.h>
#include <string.h>
#include <sys/select.h>
#include <unistd.h>

#include <cstdint>
#include <string_view>

#include "platform/pipeline.h"
#include "platform/plugin_factory.h"
#include "utils/orvane_log.h"

namespace android {
namespace Orvane {

ORVANE_REGISTER_PLUGIN(EventRadiator);

namespace {

using android::base::unique_fd;

const char* const kDeviceName = "qxev";
const char* const kDevicePath = "/dev/qxev";
// The longest record the device hands over. Reads ask for one byte more: a read that fills it
// holds a piece of a longer record. The buffer keeps one more byte for the terminating NUL.
constexpr size_t kMaxRecord = 4096;
constexpr size_t kReadSize = kMaxRecord + 1;
// Pause after a turn that got nothing, so that a device failing at once is not spun on.
constexpr std::chrono::milliseconds kIdlePause{100};
const char* const kRejectionNames[] = {"format", "id", "time", "too_long"};

// The node opened for the read loop, or an invalid descriptor. Descriptor 0 is refused,
// deliberately strict: getting it means standard input had been closed, which a healthy daemon
// never does. One beyond select's fixed set is refused too, as FD_SET would write past the set.
// At start-up each refusal has its line; reopening attempts are silent.
unique_fd OpenNode(const std::string& path, bool report) {
    unique_fd fd(open(path.c_str(), O_RDWR));
    if (fd.get() <= 0) {
        if (report) {
            OLOG_AS(ANDROID_LOG_ERROR, "StartEventSource", "%s open log exception failed");
        }
        return unique_fd();
    }
    if (fd.get() >= FD_SETSIZE) {
        if (report) {
            OLOG_AS(ANDROID_LOG_ERROR, "StartEventSource", "%s descriptor %d beyond select's reach", fd.get());
        }
        return unique_fd();
    }
    return fd;
}

struct Number {
    bool negative = false;
    bool overflow = false;  // beyond 64 bits
    uint64_t value = 0;
};

// Reads a record as sscanf reads it with "EventId %d -t %lu -paraList %s": blanks optional
// between the items, optional signs, the parameter text's first blank-free token. The numbers
// are kept whole, so that the caller can refuse what their fields cannot hold instead of
// letting the conversion wrap or saturate it.
class RecordScanner {
public:
    explicit RecordScanner(const char* record) : at_(record) {}

    bool Scan(Number& id, Number& time, std::string_view& firstToken) {
        return Keyword("EventId", false) && Read(id) && Keyword("-t") && Read(time) && Keyword("-paraList") &&
               Token(firstToken);
    }

private:
    void SkipBlanks() {
        while (isspace(static_cast<unsigned char>(*at_))) {
            ++at_;
        }
    }
    // The record's first keyword stands at its very start; the others may follow blanks.
    bool Keyword(const char* word, bool afterBlanks = true) {
        if (afterBlanks) {
            SkipBlanks();
        }
        size_t length = strlen(word);
        if (strncmp(at_, word, length) != 0) {
            return false;
        }
        at_ += length;
        return true;
    }
    bool Read(Number& number) {
        SkipBlanks();
        if (*at_ == '+' || *at_ == '-') {
            number.negative = *at_++ == '-';
        }
        if (!isdigit(static_cast<unsigned char>(*at_))) {
            return false;
        }
        for (; isdigit(static_cast<unsigned char>(*at_)); ++at_) {
            uint64_t digit = static_cast<uint64_t>(*at_ - '0');
            number.overflow = number.overflow || number.value > (UINT64_MAX - digit) / 10;
            number.value = number.value * 10 + digit;
        }
        return true;
    }
    bool Token(std::string_view& token) {
        SkipBlanks();
        const char* start = at_;
        while (*at_ != '\0' && !isspace(static_cast<unsigned char>(*at_))) {
            ++at_;
        }
        token = std::string_view(start, static_cast<size_t>(at_ - start));
        return !token.empty();
    }

    const char* at_;
};

}  // namespace

void EventRadiator::OnLoad() {
    SetVersion("EventRadiator-1.0");
    SetName("EventRadiator");
}

void EventRadiator::StartEventSource() {
    // The node's absence at start means a kernel without the driver: nothing to wait for.
    std::string path = DevicePath(kDeviceName, kDevicePath);
    unique_fd fd = OpenNode(path, true);
    if (fd.ok()) {
        ReadRecords(path, std::move(fd));
    }
}

void EventRadiator::ReadRecords(const std::string& path, unique_fd fd) {
    char buffer[kReadSize + 1];
    // The reads under way belong to a record longer than kMaxRecord, already rejected.
    bool inLongRecord = false;
    while (!Stopping()) {
        fd_set readable;
        FD_ZERO(&readable);
        FD_SET(fd.get(), &readable);
        ssize_t length = -1;
        if (select(fd.get() + 1, &readable, nullptr, nullptr, nullptr) >= 1 && FD_ISSET(fd.get(), &readable)) {
            // One read is one record, or one piece of an over-long one; read while the device has more.
            while (WaitForRoom() && (length = read(fd.get(), buffer, kReadSize)) > 0) {
                CountRead();
                buffer[length] = '\0';
                if (static_cast<size_t>(length) == kReadSize) {
                    if (!inLongRecord) {
                        Reject(Rejection::kTooLong);
                    }
                    inLongRecord = true;
                } else if (inLongRecord) {
                    inLongRecord = false;  // its last piece
                } else {
                    ParseEvent(buffer);
                }
            }
        }
        int error = errno;
        if (Stopping()) {
            break;
        }
        if (length < 0 && IsLoss(error)) {
            fd = Reopen(path, error, [&path] { return OpenNode(path, false); });
            inLongRecord = false;
        } else {
            Pause(kIdlePause);
        }
    }
}

void EventRadiator::ParseEvent(char* record) {
    Number id;
    Number time;
    std::string_view firstToken;
    if (!RecordScanner(record).Scan(id, time, firstToken)) {
        Reject(Rejection::kFormat);
        return;
    }
    if (id.negative || id.overflow || id.value < 1 || id.value > INT32_MAX) {
        Reject(Rejection::kId);
        return;
    }
    if (time.negative || time.overflow || time.value > INT64_MAX) {
        Reject(Rejection::kTime);
        return;
    }
    sp<Event> event = new Event("EventRadiator");
    event->ResetTimestamp();
    event->eventType = kEventTypeFault;  // log collection acts on fault events
    event->eventId = static_cast<uint32_t>(id.value);
    event->happenTime = time.value;
    // The value is cut from the record rather than taken from the token, so blanks inside the
    // parameter text survive. The search starts at the record's beginning: a token that also
    // appears earlier (say "5" in a record of id 5) makes the value start there.
    std::string text(record);
    event->SetValue(kKeyParamList, text.substr(text.find(firstToken)));
    PublishPipelineEvent(event);
}

void EventRadiator::Reject(Rejection reason) {
    std::call_once(rejectedOnce_, [this] {
        for (size_t i = 0; i < rejected_.size(); ++i) {
            rejected_[i] = &Stats().Get("source." + name_ + ".rejected." + kRejectionNames[i]);
        }
    });
    rejected_[static_cast<size_t>(reason)]->fetch_add(1, std::memory_order_relaxed);
    OLOG_LIMITED_AS(ANDROID_LOG_INFO, "ParseEvent", "%s event invalid");
}

}  // namespace Orvane
}  // namespace android
