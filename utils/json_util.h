#ifndef ORVANE_UTILS_JSON_UTIL_H
#define ORVANE_UTILS_JSON_UTIL_H

#include <map>
#include <string>

#include <json/json.h>

namespace android {
namespace Orvane {
namespace JsonUtil {

// Stateless conversions; safe to call from any thread.
// True only when the text parses without any reported error (errors are logged).
bool ConvertStrToJson(const std::string& text, Json::Value& out);
// Sets out[key] = value for every pair. An empty map, or an `out` that is neither null nor an
// object, is a failure and leaves `out` untouched.
bool ConvertMapToJson(const std::map<std::string, std::string>& map, Json::Value& out);
// One line, no indentation, three significant digits for floating values.
std::string ConvertJsonToStr(const Json::Value& value);

}  // namespace JsonUtil
}  // namespace Orvane
}  // namespace android

#endif  // ORVANE_UTILS_JSON_UTIL_H
