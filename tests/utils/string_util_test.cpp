#include "utils/string_util.h"

#include <gtest/gtest.h>

#include <string>
#include <vector>

namespace android {
namespace Orvane {
namespace {

using StringUtil::ConvertInt;
using StringUtil::ConvertUInt;

TEST(StringUtilTest, TrimRemovesOnlyTheGivenCharacterAtBothEnds) {
    EXPECT_EQ("a,b", StringUtil::TrimStr(",,a,b,,", ','));
    EXPECT_EQ("", StringUtil::TrimStr(",,,", ','));
    EXPECT_EQ("", StringUtil::TrimStr("", ','));
    EXPECT_EQ(" a/b ", StringUtil::TrimStr("// a/b //", '/'));
    EXPECT_EQ("x", StringUtil::TrimStr("x", ' '));
    std::string withNuls("\0\0ab\0c\0", 7);
    EXPECT_EQ(std::string("ab\0c", 4), StringUtil::TrimStr(withNuls, '\0'));
}

TEST(StringUtilTest, SplitFollowsLineReadingRules) {
    EXPECT_EQ((std::vector<std::string>{"a", "", "b"}), StringUtil::SplitStr("a,,b,", ','));
    EXPECT_TRUE(StringUtil::SplitStr("", ',').empty());
    EXPECT_EQ((std::vector<std::string>{""}), StringUtil::SplitStr(",", ','));
    EXPECT_EQ((std::vector<std::string>{"", "a", "", ""}), StringUtil::SplitStr(",a,,,", ','));
    EXPECT_EQ((std::vector<std::string>{"no delimiter"}), StringUtil::SplitStr("no delimiter", ','));
}

TEST(StringUtilTest, ConvertIntEdges) {
    EXPECT_EQ(0, ConvertInt(""));
    EXPECT_EQ(12, ConvertInt("12abc"));
    EXPECT_EQ(0, ConvertInt("abc"));
    EXPECT_EQ(-42, ConvertInt("  -42"));
    EXPECT_EQ(7, ConvertInt("+7"));
    EXPECT_EQ(2147483647, ConvertInt("2147483647"));
    EXPECT_EQ(-2147483647 - 1, ConvertInt("-2147483648"));
    // Anything that does not fit the 32-bit result is an overflow, whatever the width of long.
    EXPECT_EQ(-1, ConvertInt("2147483648"));
    EXPECT_EQ(-1, ConvertInt("-2147483649"));
    EXPECT_EQ(-1, ConvertInt("12345678901234567890"));
    EXPECT_EQ(-1, ConvertInt("-99999999999999999999"));
}

TEST(StringUtilTest, ConvertUIntEdges) {
    EXPECT_EQ(0u, ConvertUInt(""));
    EXPECT_EQ(0u, ConvertUInt("-5"));
    EXPECT_EQ(0u, ConvertUInt("0"));
    EXPECT_EQ(0u, ConvertUInt("junk"));
    EXPECT_EQ(1u, ConvertUInt("1"));
    EXPECT_EQ(12u, ConvertUInt(" 12abc"));
    EXPECT_EQ(4294967295u, ConvertUInt("4294967295"));
    // Values above 32 bits are cut, not clamped.
    EXPECT_EQ(0u, ConvertUInt("4294967296"));
    EXPECT_EQ(1u, ConvertUInt("4294967297"));
    EXPECT_EQ(4294967295u, ConvertUInt("9223372036854775807"));
    EXPECT_EQ(0u, ConvertUInt("9223372036854775808"));  // overflows the 64-bit conversion
}

TEST(StringUtilTest, PrefixAndSuffix) {
    EXPECT_TRUE(StringUtil::StartsWith("abc", ""));
    EXPECT_TRUE(StringUtil::StartsWith("abc", "abc"));
    EXPECT_TRUE(StringUtil::StartsWith("abc", "ab"));
    EXPECT_FALSE(StringUtil::StartsWith("abc", "abcd"));
    EXPECT_FALSE(StringUtil::StartsWith("abc", "b"));
    EXPECT_TRUE(StringUtil::StartsWith("", ""));
    EXPECT_TRUE(StringUtil::EndsWith("abc", ""));
    EXPECT_TRUE(StringUtil::EndsWith("abc", "bc"));
    EXPECT_FALSE(StringUtil::EndsWith("bc", "abc"));
    EXPECT_FALSE(StringUtil::EndsWith("abc", "ab"));
}

TEST(StringUtilTest, ReplaceResumesBehindTheReplacement) {
    EXPECT_EQ("aaaaaa", StringUtil::ReplaceStr("aaa", "a", "aa"));
    EXPECT_EQ("bb", StringUtil::ReplaceStr("aaaa", "aa", "b"));
    EXPECT_EQ("bba", StringUtil::ReplaceStr("aaaaa", "aa", "b"));
    EXPECT_EQ("x-y-z", StringUtil::ReplaceStr("x, y, z", ", ", "-"));
    EXPECT_EQ("xyz", StringUtil::ReplaceStr("x,y,z,", ",", ""));
    EXPECT_EQ("unchanged", StringUtil::ReplaceStr("unchanged", "", "boom"));
    EXPECT_EQ("", StringUtil::ReplaceStr("", "a", "b"));
    EXPECT_EQ("abc", StringUtil::ReplaceStr("abc", "abcd", "x"));
}

TEST(StringUtilTest, EscapeDoublesEveryQuoteInPlace) {
    std::string text = "it's";
    std::string& result = StringUtil::EscapeSqliteChar(text);
    EXPECT_EQ(&text, &result);
    EXPECT_EQ("it''s", text);
    std::string quotes = "''";
    EXPECT_EQ("''''", StringUtil::EscapeSqliteChar(quotes));
    std::string plain = "no quotes";
    EXPECT_EQ("no quotes", StringUtil::EscapeSqliteChar(plain));
    std::string edges = "'a'";
    EXPECT_EQ("''a''", StringUtil::EscapeSqliteChar(edges));
}

}  // namespace
}  // namespace Orvane
}  // namespace android
