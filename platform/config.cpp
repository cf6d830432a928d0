#include "platform/config.h"

#include <sys/stat.h>

#include <algorithm>
#include <fstream>
#include <regex>

#include "utils/orvane_log.h"
#include "utils/string_util.h"

namespace android {
namespace Orvane {
namespace {

// A real configuration is a few hundred bytes; the cap keeps a parse of garbage short.
constexpr off_t kMaxFileSize = 1024 * 1024;

const std::regex& HeaderExpression() {
    static const std::regex kExpression("(plugins|pipelines|pipelinetriggers)\\s*:\\s*(\\d+)");
    return kExpression;
}

const std::regex& PluginExpression() {
    static const std::regex kExpression("([^\\[]+)\\[([^\\[:]*):?([^:]*)\\]\\s*:(\\d+)\\s+(dynamic|static)");
    return kExpression;
}

const std::regex& PipelineExpression() {
    static const std::regex kExpression("(\\S+)\\s*:(.+)");
    return kExpression;
}

// Digits only, as the expressions guarantee; false when the number does not fit.
bool ParseDecimal(const std::string& digits, int32_t& out) {
    int64_t value = 0;
    for (char c : digits) {
        value = value * 10 + (c - '0');
        if (value > INT32_MAX) {
            return false;
        }
    }
    out = static_cast<int32_t>(value);
    return true;
}

bool SearchLine(const std::string& line, const std::regex& expression, std::smatch& match) {
    return line.size() <= Config::kMaxLineLength && std::regex_search(line, match, expression);
}

// The names of a blank-separated list, runs of blanks counting as one separator.
std::vector<std::string> SplitNames(const std::string& text) {
    std::vector<std::string> names = StringUtil::SplitStr(text, ' ');
    names.erase(std::remove(names.begin(), names.end(), std::string()), names.end());
    return names;
}

}  // namespace

bool Config::Parse() {
    struct stat st = {};
    std::ifstream file;
    if (stat(path_.c_str(), &st) == 0 && S_ISREG(st.st_mode)) {
        file.open(path_);
    }
    if (!file.is_open()) {
        OLOGE("%s fail to open config file. %s", path_.c_str());
        return false;
    }
    if (st.st_size > kMaxFileSize) {
        OLOGE("%s config file %s too large: %lld bytes, at most %lld", path_.c_str(),
              static_cast<long long>(st.st_size), static_cast<long long>(kMaxFileSize));
        return false;
    }

    std::string section;
    int32_t remaining = 0;
    std::string raw;
    while (std::getline(file, raw)) {
        // Files edited elsewhere may end their lines with CR LF.
        if (!raw.empty() && raw.back() == '\r') {
            raw.pop_back();
        }
        std::string line = StringUtil::TrimStr(raw, ' ');
        if (line.empty()) {
            continue;
        }
        if (remaining == 0) {
            std::smatch match;
            if (!SearchLine(line, HeaderExpression(), match) || !ParseDecimal(match[2], remaining)) {
                OLOGE("%s match field failed");
                return false;
            }
            section = match[1];
            OLOGI("%s find field:%s %d", section.c_str(), remaining);
            continue;
        }
        bool accepted = section == "plugins"     ? ParsePlugin(line)
                        : section == "pipelines" ? ParsePipeline(line)
                                                 : ParsePipelineTrigger(line);
        if (!accepted) {
            return false;
        }
        remaining--;
    }
    if (remaining > 0) {
        OLOGW("%s section %s of %s lacks its last %d lines", section.c_str(), path_.c_str(), remaining);
    }
    OLOGI("%s prase config ok");
    return true;
}

bool Config::ParsePlugin(const std::string& line) {
    std::smatch match;
    PluginInfo info;
    if (!SearchLine(line, PluginExpression(), match) || !ParseDecimal(match[4], info.delay)) {
        OLOGW("%s no match plugin expression found");
        return false;
    }
    info.name = StringUtil::TrimStr(match[1], ' ');
    info.threadType = match[2];
    info.threadName = match[3];
    info.isStatic = match[5] == "static";
    if (!info.threadType.empty() && info.threadType != "thread") {
        OLOGW("%s plugin %s thread type %s invalid", info.name.c_str(), info.threadType.c_str());
        return false;
    }
    if (info.threadType.empty() != info.threadName.empty()) {
        OLOGW("%s plugin %s thread type %s or name %s invalid", info.name.c_str(), info.threadType.c_str(),
              info.threadName.c_str());
        return false;
    }
    if (FindPlugin(info.name) != nullptr) {
        OLOGW("%s redefine plugin %s", info.name.c_str());
        return false;
    }
    pluginIndex_[info.name] = pluginInfoList_.size();
    pluginInfoList_.push_back(std::move(info));
    return true;
}

bool Config::ParsePipeline(const std::string& line) {
    std::smatch match;
    if (!SearchLine(line, PipelineExpression(), match)) {
        OLOGW("%s Fail to match pipeline expression");
        return false;
    }
    PipelineInfo info;
    info.name = match[1];
    info.plugins = SplitNames(match[2]);
    for (const auto& plugin : info.plugins) {
        if (FindPlugin(plugin) == nullptr) {
            OLOGW("%s pipeline %s include undefine plugin %s", info.name.c_str(), plugin.c_str());
            return false;
        }
    }
    pipelineNames_.insert(info.name);
    pipelineInfoList_.push_back(std::move(info));
    return true;
}

bool Config::ParsePipelineTrigger(const std::string& line) {
    std::smatch match;
    if (!SearchLine(line, PipelineExpression(), match)) {
        OLOGW("%s Fail to match pipeline trigger expression");
        return false;
    }
    std::string source = match[1];
    PluginInfo* plugin = FindPlugin(source);
    if (plugin == nullptr) {
        OLOGE("%s %s not define in plugins", source.c_str());
        return false;
    }
    std::vector<std::string> pipelines = SplitNames(match[2]);
    for (const auto& pipeline : pipelines) {
        if (!HasPipeline(pipeline)) {
            OLOGW("%s pipelinetriggers %s include undefine pipeline %s", source.c_str(), pipeline.c_str());
            return false;
        }
    }
    plugin->isEventSource = true;
    plugin->pipelines = std::move(pipelines);
    OLOGD("%s %s is an event source", source.c_str());
    return true;
}

Config::PluginInfo* Config::FindPlugin(const std::string& name) {
    auto it = pluginIndex_.find(name);
    return it == pluginIndex_.end() ? nullptr : &pluginInfoList_[it->second];
}

bool Config::HasPipeline(const std::string& name) const {
    return pipelineNames_.count(name) > 0;
}

}  // namespace Orvane
}  // namespace android
