#include "utils/json_util.h"

#include <memory>

#include "utils/orvane_log.h"

namespace android {
namespace Orvane {
namespace JsonUtil {

bool ConvertStrToJson(const std::string& text, Json::Value& out) {
    Json::CharReaderBuilder builder;
    std::unique_ptr<Json::CharReader> reader(builder.newCharReader());
    std::string errors;
    bool parsed = reader->parse(text.data(), text.data() + text.size(), &out, &errors);
    if (!errors.empty()) {
        OLOGE_LIMITED("%s json convert failed %s", errors.c_str());
    }
    return parsed && errors.empty();
}

bool ConvertMapToJson(const std::map<std::string, std::string>& map, Json::Value& out) {
    if (map.empty()) {
        return false;
    }
    // Members can only be set on an object (or a null value, which becomes one); jsoncpp would
    // throw for anything else.
    if (!out.isNull() && !out.isObject()) {
        OLOGE("%s output is not a json object");
        return false;
    }
    for (const auto& kv : map) {
        out[kv.first] = kv.second;
    }
    return true;
}

std::string ConvertJsonToStr(const Json::Value& value) {
    Json::StreamWriterBuilder builder;
    builder["commentStyle"] = "None";
    builder["indentation"] = "";
    builder["precision"] = 3;
    return Json::writeString(builder, value);
}

}  // namespace JsonUtil
}  // namespace Orvane
}  // namespace android
