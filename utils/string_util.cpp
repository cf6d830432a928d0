#include "utils/string_util.h"

#include <algorithm>
#include <cerrno>
#include <cstdlib>

namespace android {
namespace Orvane {
namespace StringUtil {

std::string TrimStr(const std::string& str, char c) {
    size_t begin = str.find_first_not_of(c);
    if (begin == std::string::npos) {
        return "";
    }
    size_t end = str.find_last_not_of(c);
    return str.substr(begin, end - begin + 1);
}

std::vector<std::string> SplitStr(const std::string& str, char delimiter) {
    std::vector<std::string> pieces;
    // One counting pass saves the vector's regrowth, which dominates for many short pieces.
    pieces.reserve(std::count(str.begin(), str.end(), delimiter) + 1);
    size_t start = 0;
    while (start < str.size()) {
        size_t pos = str.find(delimiter, start);
        if (pos == std::string::npos) {
            pieces.emplace_back(str, start);
            break;
        }
        pieces.emplace_back(str, start, pos - start);
        start = pos + 1;
    }
    return pieces;
}

int32_t ConvertInt(const std::string& str) {
    if (str.empty()) {
        return 0;
    }
    errno = 0;
    long value = strtol(str.c_str(), nullptr, 10);
    if (errno == ERANGE || value > INT32_MAX || value < INT32_MIN) {
        return -1;
    }
    return static_cast<int32_t>(value);
}

uint32_t ConvertUInt(const std::string& str) {
    if (str.empty()) {
        return 0;
    }
    errno = 0;
    long long value = strtoll(str.c_str(), nullptr, 10);
    if (errno == ERANGE || value < 1) {
        return 0;
    }
    return static_cast<uint32_t>(value);
}

bool StartsWith(const std::string& str, const std::string& prefix) {
    return prefix.size() <= str.size() && str.compare(0, prefix.size(), prefix) == 0;
}

bool EndsWith(const std::string& str, const std::string& suffix) {
    return suffix.size() <= str.size() && str.compare(str.size() - suffix.size(), suffix.size(), suffix) == 0;
}

std::string ReplaceStr(const std::string& src, const std::string& pattern, const std::string& replacement) {
    if (pattern.empty()) {
        return src;
    }
    std::string out;
    out.reserve(src.size());
    size_t start = 0;
    for (size_t pos = src.find(pattern); pos != std::string::npos; pos = src.find(pattern, start)) {
        out.append(src, start, pos - start).append(replacement);
        start = pos + pattern.size();
    }
    out.append(src, start, std::string::npos);
    return out;
}

std::string& EscapeSqliteChar(std::string& str) {
    size_t quotes = 0;
    for (char c : str) {
        quotes += c == '\'';
    }
    if (quotes == 0) {
        return str;
    }
    std::string out;
    out.reserve(str.size() + quotes);
    for (char c : str) {
        out += c;
        if (c == '\'') {
            out += '\'';
        }
    }
    str.swap(out);
    return str;
}

}  // namespace StringUtil
}  // namespace Orvane
}  // namespace android
