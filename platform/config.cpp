#include "platform/config.h"

#include <sys/stat.h>

#include <algorithm>
#include <cstring>
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

bool IsBlank(char c) {  // \s
    return c == ' ' || c == '\t' || c == '\n' || c == '\v' || c == '\f' || c == '\r';
}

bool IsDigit(char c) {
    return c >= '0' && c <= '9';
}

// The plugin and pipeline lines are matched by hand, exactly as searching them with their
// expressions would match (same leftmost match, same groups), because the expressions'
// backtracking takes seconds on a hostile line of 1 KiB, and every line of a pushed configuration
// would pay that at start-up. Both run in linear time per candidate start.

// "\s*(\d+)\s+(dynamic|static)" minus the blanks, from `from`: the digits and the word.
bool MatchDelayAndKind(const std::string& line, size_t from, std::string groups[5]) {
    size_t digitsEnd = from;
    while (digitsEnd < line.size() && IsDigit(line[digitsEnd])) {
        digitsEnd++;
    }
    size_t word = digitsEnd;
    while (word < line.size() && IsBlank(line[word])) {
        word++;
    }
    if (digitsEnd == from || word == digitsEnd) {
        return false;
    }
    for (const char* kind : {"dynamic", "static"}) {
        if (line.compare(word, strlen(kind), kind) == 0) {
            groups[3] = line.substr(from, digitsEnd - from);
            groups[4] = kind;
            return true;
        }
    }
    return false;
}

// "\[([^\[:]*):?([^:]*)\]\s*:..." at the '[' at `open`. Group 3 can hold no ':', and only blanks
// may stand between its ']' and the next ':', so for a group 3 starting at `from` that colon is
// the first one at or after `from`, and the ']' is the last non-blank before it.
bool MatchAfterBracket(const std::string& line, size_t open, std::string groups[5]) {
    auto closeBefore = [&line](size_t from, size_t colon) {  // the ']' before colon, or npos
        size_t end = colon;
        while (end > from && IsBlank(line[end - 1])) {
            end--;
        }
        return end > from && line[end - 1] == ']' ? end - 1 : std::string::npos;
    };
    size_t stop = std::min(line.find_first_of("[:", open + 1), line.size());  // group 2 ends by here
    if (stop < line.size() && line[stop] == ':') {
        // Longest group 2 with the optional ':' taken; else a shorter group 2 and an empty group 3
        // right before that ':'.
        size_t colon = line.find(':', stop + 1);
        size_t close = colon == std::string::npos ? colon : closeBefore(stop + 1, colon);
        if (close != std::string::npos && MatchDelayAndKind(line, colon + 1, groups)) {
            groups[1] = line.substr(open + 1, stop - open - 1);
            groups[2] = line.substr(stop + 1, close - stop - 1);
            return true;
        }
        close = closeBefore(open + 1, stop);
        if (close == std::string::npos || !MatchDelayAndKind(line, stop + 1, groups)) {
            return false;
        }
        groups[1] = line.substr(open + 1, close - open - 1);
        groups[2].clear();
        return true;
    }
    // No ':' in group 2's reach: group 3 starts at the '[' that ends group 2 (at the line's end
    // nothing is left for it).
    size_t colon = line.find(':', stop);
    size_t close = colon == std::string::npos ? colon : closeBefore(stop, colon);
    if (close == std::string::npos || !MatchDelayAndKind(line, colon + 1, groups)) {
        return false;
    }
    groups[1] = line.substr(open + 1, stop - open - 1);
    groups[2] = line.substr(stop, close - stop);
    return true;
}

// "([^\[]+)\[([^\[:]*):?([^:]*)\]\s*:(\d+)\s+(dynamic|static)": group 1 runs from the start of a
// '['-free stretch to the '[' that ends it, so each '[' is tried once.
bool MatchPluginLine(const std::string& line, std::string groups[5]) {
    size_t stretch = 0;
    for (size_t open = line.find('['); open != std::string::npos; stretch = open + 1, open = line.find('[', open + 1)) {
        if (open > stretch && MatchAfterBracket(line, open, groups)) {
            groups[0] = line.substr(stretch, open - stretch);
            return true;
        }
    }
    return false;
}

// "(\S+)\s*:(.+)": within a run of non-blanks, group 1 is the whole run when blanks and a ':'
// follow, else it ends at the run's last ':' that has text after it; a run that fails fails from
// every start inside it.
bool MatchPipelineLine(const std::string& line, std::string& name, std::string& rest) {
    auto hasRest = [&line](size_t from) {  // ".+" matches no line end
        return from < line.size() && line[from] != '\r' && line[from] != '\n';
    };
    for (size_t run = 0; run < line.size();) {
        if (IsBlank(line[run])) {
            run++;
            continue;
        }
        size_t runEnd = run;
        while (runEnd < line.size() && !IsBlank(line[runEnd])) {
            runEnd++;
        }
        size_t colon = runEnd;
        while (colon < line.size() && IsBlank(line[colon])) {
            colon++;
        }
        size_t nameEnd = runEnd;
        if (colon == line.size() || line[colon] != ':' || !hasRest(colon + 1)) {
            for (colon = runEnd - 1; colon > run && !(line[colon] == ':' && hasRest(colon + 1)); colon--) {
            }
            nameEnd = colon;
        }
        if (nameEnd > run) {
            size_t restEnd = std::min(line.find_first_of("\r\n", colon + 1), line.size());
            name = line.substr(run, nameEnd - run);
            rest = line.substr(colon + 1, restEnd - colon - 1);
            return true;
        }
        run = runEnd;
    }
    return false;
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
    std::string groups[5];  // name, thread type, thread name, delay, kind
    PluginInfo info;
    if (line.size() > kMaxLineLength || !MatchPluginLine(line, groups) || !ParseDecimal(groups[3], info.delay)) {
        OLOGW("%s no match plugin expression found");
        return false;
    }
    info.name = StringUtil::TrimStr(groups[0], ' ');
    info.threadType = groups[1];
    info.threadName = groups[2];
    info.isStatic = groups[4] == "static";
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
    PipelineInfo info;
    std::string plugins;
    if (line.size() > kMaxLineLength || !MatchPipelineLine(line, info.name, plugins)) {
        OLOGW("%s Fail to match pipeline expression");
        return false;
    }
    info.plugins = SplitNames(plugins);
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
    std::string source, pipelineNames;
    if (line.size() > kMaxLineLength || !MatchPipelineLine(line, source, pipelineNames)) {
        OLOGW("%s Fail to match pipeline trigger expression");
        return false;
    }
    PluginInfo* plugin = FindPlugin(source);
    if (plugin == nullptr) {
        OLOGE("%s %s not define in plugins", source.c_str());
        return false;
    }
    std::vector<std::string> pipelines = SplitNames(pipelineNames);
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
