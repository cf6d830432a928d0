#ifndef ORVANE_UTILS_FILE_PATTERN_H
#define ORVANE_UTILS_FILE_PATTERN_H

#include <regex.h>

#include <memory>
#include <string>

namespace android {
namespace Orvane {

// A regular expression over file names, always matched against the whole name. The syntax is
// POSIX extended with the shorthand classes \d \D \s \S \w \W outside brackets, so that the pack
// patterns ("EventId_\S+_\d{14}_\d{9}.zip") and the patterns of the log rules read alike.
//
// Expressions come from documents pushed from the cloud, so compiling never aborts and never
// costs without bound: an expression longer than kMaxLength, with a back-reference, with a
// repetition right after another ("a+*"), or whose repetition counts ({m,n}, and 2 for each "+")
// multiply to more than kMaxRepetition is refused, with the reason.
//
// Threads: immutable once compiled; any thread may match.
class FilePattern {
public:
    static constexpr size_t kMaxLength = 256;
    static constexpr unsigned long kMaxRepetition = 1000;

    // Null with `error` set when the expression is refused.
    static std::unique_ptr<FilePattern> Compile(const std::string& expression, std::string* error);
    ~FilePattern();
    FilePattern(const FilePattern&) = delete;
    FilePattern& operator=(const FilePattern&) = delete;

    bool Matches(const char* name) const;
    const std::string& Expression() const { return expression_; }

private:
    explicit FilePattern(const std::string& expression) : expression_(expression) {}

    const std::string expression_;
    regex_t regex_ = {};
    bool compiled_ = false;
};

}  // namespace Orvane
}  // namespace android

#endif  // ORVANE_UTILS_FILE_PATTERN_H
