#include "config/event_xml_parser.h"

#include <cstring>

#include "utils/orvane_log.h"
#include "utils/string_util.h"
#include "utils/time_util.h"

namespace android {
namespace Orvane {

namespace {

constexpr char kEventEndTag[] = "</Event>";
constexpr char kParamTag[] = "<Param";

struct LevelName {
    const char* name;
    const char* digit;
    uint32_t level;
};

constexpr LevelName kFaultLevels[] = {
        {"INFORMATIVE", "1", 1}, {"GENERAL", "2", 2}, {"IMPORTANT", "3", 3}, {"CRITICAL", "4", 4}};
constexpr LevelName kPrivacyLevels[] = {{"L1", "1", 1}, {"L2", "2", 2}, {"L3", "3", 3}, {"L4", "4", 4}};

template <size_t N>
uint32_t FindLevel(const LevelName (&table)[N], const std::string& text, uint32_t otherwise) {
    for (const LevelName& entry : table) {
        if (text == entry.name || text == entry.digit) {
            return entry.level;
        }
    }
    return otherwise;
}

bool IsBlank(char c) {
    return c == ' ' || c == '\t' || c == '\n' || c == '\v' || c == '\f' || c == '\r';
}

bool IsLineEnd(char c) {
    return c == '\n' || c == '\r';
}

// The closing quote of a value starting at valueStart: the first quote after at least one
// character, on the same line; null when there is none.
const char* FindValueEnd(const char* valueStart, const char* end) {
    if (valueStart >= end || IsLineEnd(*valueStart)) {
        return nullptr;
    }
    for (const char* c = valueStart + 1; c < end; ++c) {
        if (*c == '"') {
            return c;
        }
        if (IsLineEnd(*c)) {
            return nullptr;
        }
    }
    return nullptr;
}

// Offset of needle in [from, text end), or npos.
size_t Find(const std::string& text, size_t from, const char* needle, size_t needleLen) {
    if (from >= text.size()) {
        return std::string::npos;
    }
    const void* hit = memmem(text.data() + from, text.size() - from, needle, needleLen);
    return hit == nullptr ? std::string::npos : static_cast<const char*>(hit) - text.data();
}

}  // namespace

uint32_t EventUtil::GetFaultLevel(const std::string& level) {
    return FindLevel(kFaultLevels, level, 0);
}

uint32_t EventUtil::GetPrivacyLevel(const std::string& level) {
    return FindLevel(kPrivacyLevels, level, 5);
}

sp<EventXmlParser> EventXmlParser::getInstance() {
    static sp<EventXmlParser> instance(new EventXmlParser());
    return instance;
}

uint32_t EventXmlParser::GetParamType(const std::string& type) {
    static const std::map<std::string, uint32_t> kTypes = {{"string", PARAM_TYPE_STRING}, {"bool", PARAM_TYPE_BOOL},
                                                           {"short", PARAM_TYPE_SHORT},   {"int", PARAM_TYPE_INT},
                                                           {"float", PARAM_TYPE_FLOAT},   {"long", PARAM_TYPE_LONG},
                                                           {"class", PARAM_TYPE_CLASS}};
    auto it = kTypes.find(type);
    return it != kTypes.end() ? it->second : PARAM_TYPE_UNKNOWN;
}

// Equivalent to searching repeatedly with the pattern, without its backtracking: the greedy name
// is the whole non-blank run up to its last '="' whose value closes, and a run in which no value
// closes can be skipped whole, since a later start inside it has no other '="' to try.
std::map<std::string, std::string> EventXmlParser::ExtractAttributes(const std::string& tag) {
    std::map<std::string, std::string> attributes;
    const char* text = tag.data();
    const char* end = text + tag.size();
    size_t pos = 0;
    while (pos < tag.size()) {
        while (pos < tag.size() && IsBlank(text[pos])) {
            ++pos;
        }
        size_t runStart = pos;
        while (pos < tag.size() && !IsBlank(text[pos])) {
            ++pos;
        }
        // Tried from the run's last '="' backwards; at most two are ever tried, because the
        // second one's value closes at the first one's quote at the latest. That keeps the scan
        // linear.
        for (size_t eq = pos; eq > runStart + 2;) {
            --eq;
            if (text[eq - 1] != '=' || text[eq] != '"') {
                continue;
            }
            const char* quote = FindValueEnd(text + eq + 1, end);
            if (quote != nullptr) {
                attributes[std::string(text + runStart, text + eq - 1)] = std::string(text + eq + 1, quote);
                pos = quote + 1 - text;
                break;
            }
        }
    }
    return attributes;
}

sp<EventInfoConfig> EventXmlParser::GetEventInfoConfig(const DocumentFolders& folders, uint32_t id) {
    Mutex::Autolock lock(lookupMutex_);
    DocumentChoice choice = ConfigDocument::Choose(folders, GetFileName());
    if (!choice.SameVersion(cachedDocument_)) {
        cache_.clear();
        cachedDocument_ = choice;
    }
    auto cached = cache_.find(id);
    if (cached != cache_.end()) {
        return cached->second;
    }
    building_ = new EventInfoConfig(id);
    found_ = false;
    wantedId_ = id;
    uint64_t start = TimeUtil::GetTimestampUS();
    int32_t ret = GetFileName() == "event.zip" ? ParserZipXmlFile(choice.path, "event.xml")
                                               : ParserXmlFile(choice.path, false);
    sp<EventInfoConfig> entry = building_;
    if (ret != 0) {
        // Every lookup of a missing or unreadable catalogue meets this.
        OLOGW_LIMITED("%s upload failed, %s, %s", choice.directory.c_str(), "event.xml");
        folders.Count("read_failed", GetFileName());
        building_.clear();
        return nullptr;
    }
    if (!found_) {
        building_.clear();
        return nullptr;
    }
    entry->cost = static_cast<uint32_t>(TimeUtil::GetTimestampUS() - start);
    SaveEventInfo(id);
    building_.clear();
    return entry;
}

bool EventXmlParser::IsMatch(const std::string& name) {
    if (name != "Event") {
        return false;
    }
    SetStart();
    return true;
}

bool EventXmlParser::OnProcess(const std::string& text) {
    if (building_ == nullptr) {
        return true;  // read outside a lookup: nothing is wanted
    }
    const std::string key = "<Event id=\"" + std::to_string(wantedId_) + "\"";
    size_t start = Find(text, 0, key.data(), key.size());
    if (start == std::string::npos) {
        return false;
    }
    size_t tagEnd = text.find('>', start);
    if (tagEnd == std::string::npos) {
        return false;  // the next call joins this block with the next one
    }
    // A self-closing entry has no end tag; otherwise the element runs to its end tag.
    size_t elementEnd = text[tagEnd - 1] == '/' ? tagEnd : Find(text, tagEnd, kEventEndTag, strlen(kEventEndTag));
    if (elementEnd == std::string::npos) {
        return false;
    }
    InitEventInfoConfig(ExtractAttributes(text.substr(start, tagEnd - start)));
    for (size_t param = Find(text, tagEnd, kParamTag, strlen(kParamTag)); param < elementEnd;
         param = Find(text, param + 1, kParamTag, strlen(kParamTag))) {
        size_t paramEnd = text.find('>', param);
        AddEventParamInfoCfg(ExtractAttributes(text.substr(param, paramEnd - param)));
    }
    return true;
}

// Archive documents are read element by element; the entry whose id is the wanted one is taken
// and the reading stops at its end.
void EventXmlParser::OnStartElement(const std::string& name, const std::map<std::string, std::string>& attributes) {
    if (building_ == nullptr) {
        return;
    }
    if (name == "Event") {
        if (!found_ && StringUtil::ConvertUInt(GetAttribute(attributes, "id")) == wantedId_) {
            InitEventInfoConfig(attributes);
        }
    } else if (name == "Param" && found_ && !IsFinish()) {
        AddEventParamInfoCfg(attributes);
    }
}

void EventXmlParser::OnEndElement(const std::string& name) {
    if (name == "Event" && found_) {
        SetFinish();
    }
}

void EventXmlParser::InitEventInfoConfig(const std::map<std::string, std::string>& attributes) {
    found_ = true;
    building_->faultLevel = EventUtil::GetFaultLevel(GetAttribute(attributes, "FaultLevel"));
    std::string faultType = GetAttribute(attributes, "FaultType");
    building_->faultType = faultType == "FAULT"     ? FAULT_TYPE_FAULT
                           : faultType == "STATICS" ? FAULT_TYPE_STATICS
                                                    : FAULT_TYPE_NONE;
    building_->privacyLevel = EventUtil::GetPrivacyLevel(GetAttribute(attributes, "PrivacyLevel"));
    std::string extend = GetAttribute(attributes, "Extend");
    if (extend.empty()) {
        return;
    }
    const std::pair<const char*, int32_t EventInfoConfig::*> markers[] = {
            {"E:", &EventInfoConfig::extendE}, {"S:", &EventInfoConfig::extendS}, {"V:", &EventInfoConfig::extendV}};
    for (const std::string& item : StringUtil::SplitStr(extend, '|')) {
        for (const auto& [marker, field] : markers) {
            size_t at = item.find(marker);
            if (at != std::string::npos) {
                building_.get()->*field = StringUtil::ConvertInt(item.substr(at + 2));
            }
        }
    }
}

void EventXmlParser::AddEventParamInfoCfg(const std::map<std::string, std::string>& attributes) {
    EventParamInfoCfg param;
    param.id = StringUtil::ConvertUInt(GetAttribute(attributes, "id"));
    param.len = StringUtil::ConvertUInt(GetAttribute(attributes, "len"));
    param.arrLen = StringUtil::ConvertUInt(GetAttribute(attributes, "arrLen"));
    param.classID = StringUtil::ConvertUInt(GetAttribute(attributes, "classID"));
    param.name = GetAttribute(attributes, "name");
    param.type = GetParamType(GetAttribute(attributes, "type"));
    param.privacyLevel = EventUtil::GetPrivacyLevel(GetAttribute(attributes, "PrivacyLevel"));
    param.defVal = GetAttribute(attributes, "defVal");
    building_->params.push_back(std::move(param));
}

// Evicts the cheapest entry to find again: the smallest non-zero lookup cost in id order, where
// a minimum of 0 is always replaced by the next entry.
void EventXmlParser::SaveEventInfo(uint32_t id) {
    if (cache_.size() >= kCacheSize) {
        auto victim = cache_.begin();
        for (auto it = std::next(cache_.begin()); it != cache_.end(); ++it) {
            uint32_t minCost = victim->second->cost;
            if (minCost == 0 || (it->second->cost != 0 && it->second->cost < minCost)) {
                victim = it;
            }
        }
        cache_.erase(victim);
    }
    cache_[id] = building_;
}

}  // namespace Orvane
}  // namespace android
