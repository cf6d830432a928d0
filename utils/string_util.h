#ifndef ORVANE_UTILS_STRING_UTIL_H
#define ORVANE_UTILS_STRING_UTIL_H

#include <cstdint>
#include <string>
#include <vector>

namespace android {
namespace Orvane {
namespace StringUtil {

// Removes the run of `c` at both ends.
std::string TrimStr(const std::string& str, char c);
// Line-reading split: empty pieces between delimiters, none after a trailing one.
std::vector<std::string> SplitStr(const std::string& str, char delimiter);
// Leading decimal digits (sign and white space accepted); 0 for none or empty, -1 on overflow.
int32_t ConvertInt(const std::string& str);
// Leading decimal digits as a 64-bit number; 0 below 1 or on overflow, else cut to 32 bits.
uint32_t ConvertUInt(const std::string& str);
bool StartsWith(const std::string& str, const std::string& prefix);
bool EndsWith(const std::string& str, const std::string& suffix);
// Replaces every occurrence, resuming behind each inserted replacement.
std::string ReplaceStr(const std::string& src, const std::string& pattern, const std::string& replacement);
// Doubles every single quote in place so the text can stand in a quoted SQL literal.
std::string& EscapeSqliteChar(std::string& str);

}  // namespace StringUtil
}  // namespace Orvane
}  // namespace android

#endif  // ORVANE_UTILS_STRING_UTIL_H
