#include "platform/event.h"

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

}  // namespace Orvane
}  // namespace android
