#include "platform/event.h"

#include "utils/orvane_log.h"
#include "utils/string_util.h"
#include "utils/time_util.h"

namespace android {
namespace Orvane {

Event::Event(const std::string& sender)
    : eventType(0),
      dispatchType(1),
      reservedShort(0),
      eventId(0),
      happenTime(0),
      reservedLong(0),
      timestamp(0),
      sender(sender),
      reservedFlag(false) {
    ResetTimestamp();
}

void Event::SetValue(const std::string& key, const std::string& value, bool extra) {
    if (key.empty()) {
        return;
    }
    Params(extra)[key] = value;
}

void Event::SetValue(const std::string& key, int value, bool extra) {
    SetValue(key, std::to_string(value), extra);
}

std::string Event::GetValue(const std::string& key, bool extra) const {
    const auto& map = Params(extra);
    auto it = map.find(key);
    return it == map.end() ? "" : it->second;
}

int Event::GetIntValue(const std::string& key, bool extra) const {
    const auto& map = Params(extra);
    auto it = map.find(key);
    return it == map.end() ? -1 : StringUtil::ConvertInt(it->second);
}

std::map<std::string, std::string> Event::GetKeyValuePairs(bool extra) const {
    return Params(extra);
}

void Event::ResetTimestamp() {
    timestamp = TimeUtil::GetTimestampUS();
}

SyncTask::SyncTask(std::string loopName, std::function<EVENT_RET()> work)
    : loopName_(std::move(loopName)), work_(std::move(work)) {}

SyncTask::~SyncTask() {
    if (!ran_) {
        OLOG_AS(ANDROID_LOG_ERROR, "AddEventWaitResult", "%s %s stopped before the event ran, reported as failed",
                loopName_.c_str());
        result_.set_value(-1);
    }
}

void SyncTask::operator()() {
    if (ran_) {
        return;
    }
    ran_ = true;
    result_.set_value(work_());
}

}  // namespace Orvane
}  // namespace android
