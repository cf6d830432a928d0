#include "plugins/param_filter.h"

#include <cerrno>
#include <cmath>
#include <cstdlib>
#include <cstring>
#include <limits>

namespace android {
namespace Orvane {

const std::array<const char*, PrivacyCounters::kReasonCount> PrivacyCounters::kNames = {
        "privacy.dropped.event_level",
        "privacy.dropped.filter_list",
        "privacy.dropped.unknown_event",
        "privacy.dropped.bad_param_list",
        "privacy.stripped.unknown_event",
        "privacy.stripped.bad_param_list",
        "privacy.removed.unknown_name",
        "privacy.removed.level",
        "privacy.replaced.level",
        "privacy.removed.type",
        "privacy.replaced.type",
        "privacy.removed.identifier",
        "privacy.replaced.identifier",
        "privacy.removed.too_deep",
        "privacy.removed.unknown_class",
        "privacy.cut.string",
        "privacy.cut.array",
        "privacy.encrypted"};

namespace {

constexpr char kEmptyObject[] = "{}";

// The drop reasons an event carries in "dropReason", from the counter's name.
std::string DropReason(PrivacyCounters::Reason reason) {
    return std::string("privacy.") + (PrivacyCounters::kNames[reason] + strlen("privacy.dropped."));
}

// True when the text's brackets nest at most `limit` deep and it holds no comment. Strings are
// skipped the way JsonCpp reads them, so the count is never below the depth JsonCpp would reach:
// JsonCpp recurses once per level and past its stack limit throws (aborts, on a device without
// exceptions). Comments are refused because JsonCpp skips them even in strict mode, and a text
// the rules leave untouched is stored as it came: a comment would carry anything past them.
bool IsPlainWithin(const std::string& text, size_t limit) {
    size_t depth = 0;
    bool inString = false;
    for (size_t i = 0; i < text.size(); ++i) {
        char c = text[i];
        if (inString) {
            if (c == '\\') {
                ++i;
            } else if (c == '"') {
                inString = false;
            }
        } else if (c == '"') {
            inString = true;
        } else if (c == '{' || c == '[') {
            if (++depth > limit) {
                return false;
            }
        } else if ((c == '}' || c == ']') && depth > 0) {
            --depth;
        } else if (c == '/') {
            return false;
        }
    }
    return true;
}

// Well-formed UTF-8: no stray continuation bytes, overlong forms, surrogates or code points
// above U+10FFFF.
bool IsValidUtf8(const char* begin, const char* end) {
    const unsigned char* p = reinterpret_cast<const unsigned char*>(begin);
    const unsigned char* stop = reinterpret_cast<const unsigned char*>(end);
    while (p < stop) {
        unsigned char c = *p;
        if (c < 0x80) {
            ++p;
            continue;
        }
        size_t extra;
        unsigned char low = 0x80, high = 0xBF;  // allowed range of the second byte
        if (c >= 0xC2 && c <= 0xDF) {
            extra = 1;
        } else if (c >= 0xE0 && c <= 0xEF) {
            extra = 2;
            low = c == 0xE0 ? 0xA0 : 0x80;
            high = c == 0xED ? 0x9F : 0xBF;
        } else if (c >= 0xF0 && c <= 0xF4) {
            extra = 3;
            low = c == 0xF0 ? 0x90 : 0x80;
            high = c == 0xF4 ? 0x8F : 0xBF;
        } else {
            return false;
        }
        if (static_cast<size_t>(stop - p) <= extra || p[1] < low || p[1] > high) {
            return false;
        }
        for (size_t i = 2; i <= extra; ++i) {
            if ((p[i] & 0xC0) != 0x80) {
                return false;
            }
        }
        p += extra + 1;
    }
    return true;
}

// Whole text as an integer within [min, max].
bool ParseInteger(const std::string& text, int64_t min, int64_t max, int64_t& out) {
    if (text.empty()) {
        return false;
    }
    char* end = nullptr;
    errno = 0;
    long long value = strtoll(text.c_str(), &end, 10);
    if (errno != 0 || *end != '\0' || value < min || value > max) {
        return false;
    }
    out = value;
    return true;
}

// The catalogue's default as a value of the parameter's type; false when there is none or it
// does not read as that type. Arrays and classes have none.
bool DefaultValue(const EventParamInfoCfg& param, Json::Value& out) {
    if (param.defVal.empty() || param.arrLen > 0) {
        return false;
    }
    int64_t integer = 0;
    switch (param.type) {
        case PARAM_TYPE_BOOL:
            if (param.defVal != "true" && param.defVal != "false") {
                return false;
            }
            out = param.defVal == "true";
            return true;
        case PARAM_TYPE_SHORT:
            if (!ParseInteger(param.defVal, INT16_MIN, INT16_MAX, integer)) {
                return false;
            }
            out = static_cast<Json::Int>(integer);
            return true;
        case PARAM_TYPE_INT:
            if (!ParseInteger(param.defVal, INT32_MIN, INT32_MAX, integer)) {
                return false;
            }
            out = static_cast<Json::Int>(integer);
            return true;
        case PARAM_TYPE_LONG:
            if (!ParseInteger(param.defVal, INT64_MIN, INT64_MAX, integer)) {
                return false;
            }
            out = static_cast<Json::Int64>(integer);
            return true;
        case PARAM_TYPE_FLOAT: {
            char* end = nullptr;
            double real = strtod(param.defVal.c_str(), &end);
            if (*end != '\0' || !std::isfinite(real)) {
                return false;
            }
            out = real;
            return true;
        }
        case PARAM_TYPE_CLASS:
            return false;
        default:  // strings, and parameters whose type the catalogue does not name
            out = param.defVal;
            return true;
    }
}

const EventParamInfoCfg* FindParam(const EventInfoConfig& entry, const char* name, const char* nameEnd) {
    size_t size = static_cast<size_t>(nameEnd - name);
    for (const EventParamInfoCfg& param : entry.params) {
        if (param.name.size() == size && memcmp(param.name.data(), name, size) == 0) {
            return &param;
        }
    }
    return nullptr;
}

}  // namespace

PrivacyCounters::PrivacyCounters(DaemonStats& stats) {
    for (size_t i = 0; i < kReasonCount; ++i) {
        counters_[i] = &stats.Get(kNames[i]);
    }
}

ParamFilter::ParamFilter(PrivacyCounters& counters, ClassLookup lookup)
    : counters_(counters), lookup_(std::move(lookup)) {
    // Strict: no trailing text and no repeated names, since the stored text would keep a first
    // occurrence that only the last one was checked for. (Comments, which JsonCpp skips even so,
    // never get here: IsPlainWithin refuses them.)
    Json::CharReaderBuilder readerBuilder;
    Json::CharReaderBuilder::strictMode(&readerBuilder.settings_);
    reader_.reset(readerBuilder.newCharReader());
    Json::StreamWriterBuilder writerBuilder;
    writerBuilder["indentation"] = "";
    writerBuilder["commentStyle"] = "None";
    writerBuilder["emitUTF8"] = true;  // every string left is valid UTF-8; keep it readable
    writerBuilder["precision"] = 15;   // every decimal of up to 15 digits comes back as written
    writer_.reset(writerBuilder.newStreamWriter());
}

void ParamFilter::Count(PrivacyCounters::Reason reason) {
    counters_.Add(reason);
    changed_ = true;
}

ParamFilter::Verdict ParamFilter::Apply(const PrivacyPolicy& policy, bool consented, const EventInfoConfig* entry,
                                        std::string& params, std::string& dropReason) {
    policy_ = &policy;
    consented_ = consented;
    maxLevel_ = policy.MaxLevel(consented);
    changed_ = false;
    auto drop = [&](PrivacyCounters::Reason reason) {
        counters_.Add(reason);
        dropReason = DropReason(reason);
        return Verdict::kDropped;
    };
    if (entry != nullptr && entry->privacyLevel > maxLevel_ && !policy.keepsEventsAboveLevel) {
        return drop(PrivacyCounters::kDroppedEventLevel);
    }
    if (entry == nullptr && policy.unchecked == UncheckedAction::kDrop) {
        return drop(PrivacyCounters::kDroppedUnknownEvent);
    }
    if (params.empty()) {
        return Verdict::kUntouched;  // nothing to check
    }
    Json::Value root;
    bool isObject = ParseObject(params, root);
    if (isObject && IsFilteredProcess(policy, root)) {
        return drop(PrivacyCounters::kDroppedFilterList);
    }
    if (entry == nullptr || !isObject) {
        if (policy.unchecked == UncheckedAction::kKeep || (isObject && root.empty())) {
            return Verdict::kUntouched;
        }
        if (policy.unchecked == UncheckedAction::kDrop) {
            return drop(PrivacyCounters::kDroppedBadParamList);
        }
        counters_.Add(entry == nullptr ? PrivacyCounters::kStrippedUnknownEvent
                                       : PrivacyCounters::kStrippedBadParamList);
        params = kEmptyObject;
        return Verdict::kRewritten;
    }
    FilterObject(*entry, root, 1);
    if (!changed_) {
        return Verdict::kUntouched;
    }
    written_.str("");
    writer_->write(root, &written_);
    params = written_.str();
    return Verdict::kRewritten;
}

bool ParamFilter::ParseObject(const std::string& text, Json::Value& root) {
    size_t first = text.find_first_not_of(" \t\r\n");
    if (first == std::string::npos || text[first] != '{' || !IsPlainWithin(text, kMaxNesting)) {
        return false;
    }
    return reader_->parse(text.data(), text.data() + text.size(), &root, nullptr) && root.isObject();
}

bool ParamFilter::IsFilteredProcess(const PrivacyPolicy& policy, const Json::Value& root) const {
    for (const std::string& name : policy.filterParams) {
        const Json::Value* value = root.find(name.data(), name.data() + name.size());
        if (value != nullptr && value->isString() && policy.IsFiltered(value->asString())) {
            return true;
        }
    }
    return false;
}

void ParamFilter::FilterObject(const EventInfoConfig& entry, Json::Value& object, int depth) {
    std::vector<std::string> removed;
    for (auto it = object.begin(); it != object.end(); ++it) {
        const char* nameEnd = nullptr;
        const char* name = it.memberName(&nameEnd);
        if (!FilterMember(FindParam(entry, name, nameEnd), *it, depth)) {
            removed.emplace_back(name, nameEnd);
        }
    }
    for (const std::string& name : removed) {
        // By range: the string overload stops at a NUL inside the name and would remove another.
        object.removeMember(name.data(), name.data() + name.size(), nullptr);
    }
}

bool ParamFilter::FilterMember(const EventParamInfoCfg* param, Json::Value& value, int depth) {
    if (param == nullptr) {
        Count(PrivacyCounters::kRemovedUnknownName);
        return false;
    }
    bool identifier = policy_->IsIdentifier(*param);
    if (identifier && (!consented_ || policy_->cipher == nullptr)) {
        return Withhold(*param, value, PrivacyCounters::kRemovedIdentifier, PrivacyCounters::kReplacedIdentifier);
    }
    if (!identifier && param->privacyLevel > maxLevel_) {
        return Withhold(*param, value, PrivacyCounters::kRemovedLevel, PrivacyCounters::kReplacedLevel);
    }
    if (param->arrLen > 0) {
        if (!FilterArray(*param, value, depth)) {
            return false;
        }
    } else {
        switch (CheckValue(*param, value, depth)) {
            case Check::kOk:
                break;
            case Check::kWrongType:
                return Withhold(*param, value, PrivacyCounters::kRemovedType, PrivacyCounters::kReplacedType);
            case Check::kTooDeep:
                Count(PrivacyCounters::kRemovedTooDeep);
                return false;
            case Check::kUnknownClass:
                Count(PrivacyCounters::kRemovedUnknownClass);
                return false;
        }
    }
    if (identifier && !Seal(value)) {
        Count(PrivacyCounters::kRemovedIdentifier);
        return false;
    }
    return true;
}

bool ParamFilter::FilterArray(const EventParamInfoCfg& param, Json::Value& value, int depth) {
    if (!value.isArray()) {
        return Withhold(param, value, PrivacyCounters::kRemovedType, PrivacyCounters::kReplacedType);
    }
    if (value.size() > param.arrLen) {
        value.resize(param.arrLen);
        Count(PrivacyCounters::kCutArray);
    }
    std::vector<Json::ArrayIndex> refused;
    for (Json::ArrayIndex i = 0; i < value.size(); ++i) {
        Check check = CheckValue(param, value[i], depth);
        if (check != Check::kOk) {
            refused.push_back(i);
            Count(check == Check::kTooDeep        ? PrivacyCounters::kRemovedTooDeep
                  : check == Check::kUnknownClass ? PrivacyCounters::kRemovedUnknownClass
                                                  : PrivacyCounters::kRemovedType);
        }
    }
    if (!refused.empty()) {  // rebuilt in one pass: removing one by one would be quadratic
        Json::Value kept(Json::arrayValue);
        size_t next = 0;
        for (Json::ArrayIndex i = 0; i < value.size(); ++i) {
            if (next < refused.size() && refused[next] == i) {
                ++next;
            } else {
                kept.append(std::move(value[i]));
            }
        }
        value.swap(kept);
    }
    return true;
}

ParamFilter::Check ParamFilter::CheckValue(const EventParamInfoCfg& param, Json::Value& value, int depth) {
    switch (param.type) {
        case PARAM_TYPE_BOOL:
            return value.isBool() ? Check::kOk : Check::kWrongType;
        case PARAM_TYPE_SHORT:
            return value.isInt() && value.asInt() >= INT16_MIN && value.asInt() <= INT16_MAX ? Check::kOk
                                                                                             : Check::kWrongType;
        case PARAM_TYPE_INT:
            return value.isInt() ? Check::kOk : Check::kWrongType;
        case PARAM_TYPE_LONG:
            return value.isInt64() ? Check::kOk : Check::kWrongType;
        case PARAM_TYPE_FLOAT:
            return value.isDouble() ? Check::kOk : Check::kWrongType;
        case PARAM_TYPE_CLASS: {
            if (!value.isObject()) {
                return Check::kWrongType;
            }
            if (depth >= kMaxObjectDepth) {
                return Check::kTooDeep;
            }
            sp<EventInfoConfig> nested = lookup_ ? lookup_(param.classID) : nullptr;
            if (nested == nullptr) {
                return Check::kUnknownClass;
            }
            FilterObject(*nested, value, depth + 1);
            return Check::kOk;
        }
        case PARAM_TYPE_STRING:
            if (!value.isString()) {
                return Check::kWrongType;
            }
            break;
        default:  // a type the catalogue does not name: any single value
            if (value.isNull() || value.isArray() || value.isObject()) {
                return Check::kWrongType;
            }
            if (!value.isString()) {
                return Check::kOk;
            }
            break;
    }
    const char* begin = nullptr;
    const char* end = nullptr;
    value.getString(&begin, &end);
    if (!IsValidUtf8(begin, end)) {
        return Check::kWrongType;
    }
    size_t size = static_cast<size_t>(end - begin);
    if (param.len > 0 && size > param.len) {
        size_t cut = param.len;
        while (cut > 0 && (static_cast<unsigned char>(begin[cut]) & 0xC0) == 0x80) {
            --cut;  // back to the first byte of the character that does not fit whole
        }
        value = Json::Value(begin, begin + cut);
        Count(PrivacyCounters::kCutString);
    }
    return Check::kOk;
}

bool ParamFilter::Withhold(const EventParamInfoCfg& param, Json::Value& value, PrivacyCounters::Reason removed,
                           PrivacyCounters::Reason replaced) {
    Json::Value replacement;
    if (!DefaultValue(param, replacement)) {
        Count(removed);
        return false;
    }
    if (value != replacement) {  // a value that is its default reveals nothing
        value.swap(replacement);
        Count(replaced);
    }
    return true;
}

bool ParamFilter::Seal(Json::Value& value) {
    auto sealOne = [this](Json::Value& one) {
        written_.str("");
        if (!one.isString()) {
            writer_->write(one, &written_);
        }
        std::string sealed = policy_->cipher->Seal(one.isString() ? one.asString() : written_.str());
        if (sealed.empty()) {
            return false;
        }
        one = Json::Value(sealed);
        return true;
    };
    if (value.isArray()) {
        for (Json::Value& element : value) {
            if (!sealOne(element)) {
                return false;
            }
        }
    } else if (!sealOne(value)) {
        return false;
    }
    Count(PrivacyCounters::kEncrypted);
    return true;
}

}  // namespace Orvane
}  // namespace android
