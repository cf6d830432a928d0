#include "plugins/log_filter_stats.h"

#include <limits>

namespace android {
namespace Orvane {
namespace {

// White space as scanf sees it in the C locale.
bool IsSpace(char c) {
    return c == ' ' || (c >= '\t' && c <= '\r');
}

bool IsDigit(char c) {
    return c >= '0' && c <= '9';
}

// scanf's conversions over a text, with a defined answer where scanf's is undefined (a number
// that does not fit).
class Scanner {
public:
    explicit Scanner(std::string_view text) : text_(text) {}

    // "%d": white space, an optional sign, digits.
    bool Int(int32_t& out) {
        SkipSpace();
        size_t at = pos_;
        bool negative = false;
        if (at < text_.size() && (text_[at] == '+' || text_[at] == '-')) {
            negative = text_[at] == '-';
            ++at;
        }
        const size_t firstDigit = at;
        // One past INT32_MAX is the magnitude of INT32_MIN; anything larger fits nowhere.
        const int64_t limit = int64_t{std::numeric_limits<int32_t>::max()} + 1;
        int64_t value = 0;
        for (; at < text_.size() && IsDigit(text_[at]); ++at) {
            value = value * 10 + (text_[at] - '0');
            if (value > limit) {
                return false;
            }
        }
        if (at == firstDigit || (!negative && value == limit)) {
            return false;
        }
        out = static_cast<int32_t>(negative ? -value : value);
        pos_ = at;
        return true;
    }

    // A literal character of the format, which scanf matches without skipping white space.
    bool Char(char c) {
        if (pos_ < text_.size() && text_[pos_] == c) {
            ++pos_;
            return true;
        }
        return false;
    }

    // "%s": white space, then everything up to the next white space.
    bool Word(std::string& out) {
        SkipSpace();
        size_t start = pos_;
        while (pos_ < text_.size() && !IsSpace(text_[pos_])) {
            ++pos_;
        }
        if (pos_ == start) {
            return false;
        }
        out.assign(text_.substr(start, pos_ - start));
        return true;
    }

private:
    void SkipSpace() {
        while (pos_ < text_.size() && IsSpace(text_[pos_])) {
            ++pos_;
        }
    }

    const std::string_view text_;
    size_t pos_ = 0;
};

// The line as a C string sees it.
std::string_view UpToNul(std::string_view line) {
    return line.substr(0, line.find('\0'));
}

}  // namespace

bool LogFilterStatsParser::ParseRow(std::string_view line, LogFilterRow& row) {
    Scanner scanner(UpToNul(line));
    LogFilterRow parsed;
    if (!scanner.Int(parsed.pid) || !scanner.Char('/') || !scanner.Int(parsed.uid) ||
        !scanner.Word(parsed.processName) || !scanner.Int(parsed.totalFilterLog) ||
        !scanner.Int(parsed.totalFilterCnt) || !scanner.Int(parsed.maxFilterCnt) ||
        !scanner.Int(parsed.maxHappenTime)) {
        return false;
    }
    row = std::move(parsed);
    return true;
}

bool LogFilterStatsParser::Feed(std::string_view data) {
    while (!data.empty() && !Full()) {
        size_t end = data.find('\n');
        std::string_view piece = data.substr(0, end);
        if (!overlong_) {
            if (line_.size() + piece.size() > kMaxLineBytes) {
                overlong_ = true;
                line_.clear();
            } else {
                line_.append(piece);
            }
        }
        if (end == std::string_view::npos) {
            break;
        }
        EndLine();
        data.remove_prefix(end + 1);
    }
    return !Full();
}

void LogFilterStatsParser::Finish() {
    if (!line_.empty() || overlong_) {
        EndLine();
    }
}

void LogFilterStatsParser::EndLine() {
    if (overlong_) {
        ++overlongLines_;
    } else if (!headerFound_) {
        headerFound_ = UpToNul(line_).find(kHeader) != std::string_view::npos;
    } else if (LogFilterRow row; ParseRow(line_, row)) {
        rows_.push_back(std::move(row));
    } else {
        ++skippedLines_;
    }
    line_.clear();
    overlong_ = false;
}

}  // namespace Orvane
}  // namespace android
