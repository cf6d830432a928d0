#include "plugins/perf_parser.h"

#include <string_view>

namespace android {
namespace Orvane {
namespace {

// Fields of /proc/PID/stat after the command name: state is the first, utime the 12th and
// stime the 13th (fields 14 and 15 of the whole line).
constexpr size_t kUtimeField = 11;
constexpr size_t kStimeField = 12;
// The kernel prints the averages with two decimals; more integer digits than this are not a
// percentage any more.
constexpr size_t kMaxAvgIntegerDigits = 6;

// The next field of `text` up to `separator`, moving `text` behind it.
std::string_view NextField(std::string_view& text, char separator) {
    size_t end = text.find(separator);
    std::string_view field = text.substr(0, end);
    text.remove_prefix(end == std::string_view::npos ? text.size() : end + 1);
    return field;
}

// Decimal digits only, no sign, no blanks, no overflow.
bool ParseDecimal(std::string_view text, uint64_t& out) {
    if (text.empty()) {
        return false;
    }
    uint64_t value = 0;
    for (char c : text) {
        if (c < '0' || c > '9') {
            return false;
        }
        uint64_t digit = static_cast<uint64_t>(c - '0');
        if (value > (UINT64_MAX - digit) / 10) {
            return false;
        }
        value = value * 10 + digit;
    }
    out = value;
    return true;
}

// "12.34": digits, a point, digits, as the kernel prints an average.
bool ParseAverage(std::string_view text, double& out) {
    size_t point = text.find('.');
    if (point == std::string_view::npos || point == 0 || point > kMaxAvgIntegerDigits || point + 1 == text.size() ||
        text.size() - point - 1 > 2) {
        return false;
    }
    uint64_t whole = 0;
    uint64_t fraction = 0;
    std::string_view fractionText = text.substr(point + 1);
    if (!ParseDecimal(text.substr(0, point), whole) || !ParseDecimal(fractionText, fraction)) {
        return false;
    }
    out = static_cast<double>(whole) + static_cast<double>(fraction) / (fractionText.size() == 1 ? 10.0 : 100.0);
    return true;
}

// "key=value" with the expected key.
bool KeyValue(std::string_view field, std::string_view key, std::string_view& value) {
    if (field.size() <= key.size() || field.substr(0, key.size()) != key || field[key.size()] != '=') {
        return false;
    }
    value = field.substr(key.size() + 1);
    return true;
}

// "avg10=0.00 avg60=0.00 avg300=0.00 total=0" and whatever a later kernel appends.
bool ParsePressureFields(std::string_view fields, PressureLine& out) {
    std::string_view value;
    PressureLine line;
    if (!KeyValue(NextField(fields, ' '), "avg10", value) || !ParseAverage(value, line.avg10) ||
        !KeyValue(NextField(fields, ' '), "avg60", value) || !ParseAverage(value, line.avg60) ||
        !KeyValue(NextField(fields, ' '), "avg300", value) || !ParseAverage(value, line.avg300) ||
        !KeyValue(NextField(fields, ' '), "total", value) || !ParseDecimal(value, line.totalUs)) {
        return false;
    }
    line.present = true;
    out = line;
    return true;
}

}  // namespace

bool PerfParser::ParsePressure(const std::string& text, Pressure& out) {
    Pressure parsed;
    std::string_view rest(text);
    while (!rest.empty()) {
        std::string_view line = NextField(rest, '\n');
        std::string_view kind = NextField(line, ' ');
        PressureLine* target = kind == "some" ? &parsed.some : kind == "full" ? &parsed.full : nullptr;
        // The first line of a kind counts; a second one is not the kernel's.
        if (target != nullptr && !target->present && !ParsePressureFields(line, *target)) {
            return false;
        }
    }
    if (!parsed.some.present) {
        return false;
    }
    out = parsed;
    return true;
}

std::string PerfParser::TriggerText(bool full, uint32_t stallUs, uint32_t windowUs) {
    return std::string(full ? "full " : "some ") + std::to_string(stallUs) + " " + std::to_string(windowUs);
}

bool PerfParser::ParseStat(const std::string& text, uint64_t& cpuTicks, std::string& comm) {
    // The name is whatever lies between the first "(" and the last ")": a program may call
    // itself "a) (b".
    size_t open = text.find('(');
    size_t close = text.rfind(')');
    if (open == std::string::npos || close == std::string::npos || close < open || close + 1 >= text.size() ||
        text[close + 1] != ' ') {
        return false;
    }
    std::string_view fields = std::string_view(text).substr(close + 2);
    uint64_t utime = 0;
    uint64_t stime = 0;
    for (size_t i = 0; i <= kStimeField; ++i) {
        if (fields.empty()) {
            return false;
        }
        std::string_view field = NextField(fields, ' ');
        if ((i == kUtimeField && !ParseDecimal(field, utime)) || (i == kStimeField && !ParseDecimal(field, stime))) {
            return false;
        }
    }
    if (utime > UINT64_MAX - stime) {
        return false;
    }
    cpuTicks = utime + stime;
    comm = text.substr(open + 1, close - open - 1);
    return true;
}

bool PerfParser::ParseStatm(const std::string& text, uint64_t& residentPages) {
    std::string_view fields(text);
    uint64_t size = 0;
    if (!ParseDecimal(NextField(fields, ' '), size)) {  // total program size, as a check of the row
        return false;
    }
    std::string_view resident = NextField(fields, ' ');
    return ParseDecimal(resident.substr(0, resident.find('\n')), residentPages);
}

bool PerfParser::ParseIo(const std::string& text, uint64_t& bytes) {
    bool haveRead = false;
    bool haveWrite = false;
    uint64_t readBytes = 0;
    uint64_t writeBytes = 0;
    std::string_view rest(text);
    while (!rest.empty()) {
        std::string_view line = NextField(rest, '\n');
        std::string_view key = NextField(line, ':');
        if (!line.empty() && line[0] == ' ') {
            line.remove_prefix(1);
        }
        if (key == "read_bytes" && !haveRead) {
            haveRead = ParseDecimal(line, readBytes);
            if (!haveRead) {
                return false;
            }
        } else if (key == "write_bytes" && !haveWrite) {
            haveWrite = ParseDecimal(line, writeBytes);
            if (!haveWrite) {
                return false;
            }
        }
    }
    if (!haveRead || !haveWrite || readBytes > UINT64_MAX - writeBytes) {
        return false;
    }
    bytes = readBytes + writeBytes;
    return true;
}

}  // namespace Orvane
}  // namespace android
