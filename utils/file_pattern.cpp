#include "utils/file_pattern.h"

#include <ctype.h>

namespace android {
namespace Orvane {
namespace {

// The bracket expressions that stand for the shorthand classes; empty for any other letter.
const char* ShorthandClass(char letter) {
    switch (letter) {
        case 'd':
            return "[0-9]";
        case 'D':
            return "[^0-9]";
        case 's':
            return "[[:space:]]";
        case 'S':
            return "[^[:space:]]";
        case 'w':
            return "[[:alnum:]_]";
        case 'W':
            return "[^[:alnum:]_]";
        default:
            return "";
    }
}

// Copies the bracket expression that starts at expression[i] ("[") to out and moves i onto its
// closing "]"; false when it is not closed. Inside brackets every character is literal except the
// classes "[:name:]", "[.x.]" and "[=x=]", and a "]" right after "[" or "[^".
bool CopyBracket(const std::string& expression, size_t& i, std::string& out) {
    size_t start = i;
    out += expression[i++];
    if (i < expression.size() && expression[i] == '^') {
        out += expression[i++];
    }
    if (i < expression.size() && expression[i] == ']') {
        out += expression[i++];
    }
    while (i < expression.size()) {
        char c = expression[i];
        if (c == ']') {
            out += c;
            return true;
        }
        if (c == '[' && i + 1 < expression.size() &&
            (expression[i + 1] == ':' || expression[i + 1] == '.' || expression[i + 1] == '=')) {
            std::string close = std::string(1, expression[i + 1]) + "]";
            size_t end = expression.find(close, i + 2);
            if (end == std::string::npos) {
                return false;
            }
            out.append(expression, i, end + 2 - i);
            i = end + 2;
            continue;
        }
        out += c;
        ++i;
    }
    i = start;
    return false;
}

// Reads "{m}", "{m,}" or "{m,n}" at expression[i] and moves i onto its "}"; the bound that
// costs (n, or m without n), or -1 when the text is not such a repetition.
long ReadRepetition(const std::string& expression, size_t& i) {
    size_t pos = i + 1;
    auto number = [&](long& value) {
        size_t begin = pos;
        value = 0;
        while (pos < expression.size() && isdigit(static_cast<unsigned char>(expression[pos])) && pos - begin < 6) {
            value = value * 10 + (expression[pos++] - '0');
        }
        return pos > begin;
    };
    long low = 0;
    long high = -1;
    if (!number(low)) {
        return -1;
    }
    if (pos < expression.size() && expression[pos] == ',') {
        ++pos;
        if (pos < expression.size() && expression[pos] != '}' && (!number(high) || high < low)) {
            return -1;
        }
    }
    if (pos >= expression.size() || expression[pos] != '}') {
        return -1;
    }
    i = pos;
    return high >= 0 ? high : low;
}

}  // namespace

std::unique_ptr<FilePattern> FilePattern::Compile(const std::string& expression, std::string* error) {
    auto refuse = [error](const std::string& why) {
        if (error != nullptr) {
            *error = why;
        }
        return nullptr;
    };
    if (expression.empty() || expression.size() > kMaxLength || expression.find('\0') != std::string::npos) {
        return refuse("an expression needs 1 to " + std::to_string(kMaxLength) + " characters");
    }
    std::string translated = "^(";
    // The regex compiler copies the operand of "+" and of "{m,n}" (a+ is aa*), so the compiled
    // form grows with the product of the counts, a "+" counting twice; an operator right after
    // another is refused outright.
    unsigned long cost = 1;
    bool afterRepetition = false;
    auto addCost = [&cost](unsigned long factor) {
        cost *= factor;
        return cost <= kMaxRepetition;
    };
    for (size_t i = 0; i < expression.size(); ++i) {
        char c = expression[i];
        bool repetition = c == '*' || c == '+' || c == '?' || c == '{';
        if (repetition && afterRepetition) {
            return refuse("a repetition cannot follow another repetition");
        }
        afterRepetition = repetition;
        if (c == '+' && !addCost(2)) {
            return refuse("repetitions multiply to more than " + std::to_string(kMaxRepetition));
        }
        if (c == '\\') {
            if (++i == expression.size()) {
                return refuse("the expression ends in a backslash");
            }
            char next = expression[i];
            if (isdigit(static_cast<unsigned char>(next))) {
                return refuse("back-references are not supported");
            }
            const char* shorthand = ShorthandClass(next);
            translated += shorthand[0] != '\0' ? std::string(shorthand) : std::string{'\\', next};
        } else if (c == '[') {
            if (!CopyBracket(expression, i, translated)) {
                return refuse("a bracket expression is not closed");
            }
        } else if (c == '{') {
            size_t start = i;
            long bound = ReadRepetition(expression, i);
            if (bound < 0) {
                return refuse("a repetition must read {m}, {m,} or {m,n}");
            }
            if (!addCost(static_cast<unsigned long>(bound > 1 ? bound : 1))) {
                return refuse("repetitions multiply to more than " + std::to_string(kMaxRepetition));
            }
            translated.append(expression, start, i + 1 - start);
        } else {
            translated += c;
        }
    }
    translated += ")$";
    std::unique_ptr<FilePattern> pattern(new FilePattern(expression));
    int result = regcomp(&pattern->regex_, translated.c_str(), REG_EXTENDED | REG_NOSUB);
    if (result != 0) {
        char message[128];
        regerror(result, &pattern->regex_, message, sizeof(message));
        return refuse(message);
    }
    pattern->compiled_ = true;
    return pattern;
}

FilePattern::~FilePattern() {
    if (compiled_) {
        regfree(&regex_);
    }
}

bool FilePattern::Matches(const char* name) const {
    return regexec(&regex_, name, 0, nullptr, 0) == 0;
}

}  // namespace Orvane
}  // namespace android
