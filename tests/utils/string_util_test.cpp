#include "utils/string_util.h"

#include <gtest/gtest.h>

namespace android::Orvane {
using namespace StringUtil;

TEST(StringUtilTest, TrimSplitPrefixAndEscapeBoundaries) {
    EXPECT_EQ("a,b", TrimStr(",,a,b,,", ','));
    EXPECT_EQ("", TrimStr(",,,", ','));
    EXPECT_EQ(std::string("ab\0c", 4), TrimStr(std::string("\0\0ab\0c\0", 7), '\0'));
    // Line-reading split: empty pieces inside, none after a trailing delimiter.
    EXPECT_EQ((std::vector<std::string>{"", "a", "", ""}), SplitStr(",a,,,", ','));
    EXPECT_EQ((std::vector<std::string>{""}), SplitStr(",", ','));
    EXPECT_TRUE(SplitStr("", ',').empty());
    EXPECT_TRUE(!StartsWith("abc", "abcd") && !EndsWith("bc", "abc") && EndsWith("abc", "") && StartsWith("", ""));
    // Quotes are doubled in place, so the text can stand in a quoted SQL literal.
    std::string text = "'it's'";
    EXPECT_EQ(&text, &EscapeSqliteChar(text));
    EXPECT_EQ("''it''s''", text);
}

TEST(StringUtilTest, NumberConversionEdges) {
    struct {
        const char* in;
        int32_t i;
        uint32_t u;
    } cases[] = {
            {"", 0, 0u},
            {"abc", 0, 0u},
            {"12abc", 12, 12u},
            {"  -42", -42, 0u},
            {"+7", 7, 7u},
            {"0", 0, 0u},
            {"2147483647", 2147483647, 2147483647u},
            {"-2147483648", INT32_MIN, 0u},
            // Beyond 32 bits: ConvertInt reports overflow, ConvertUInt cuts (not clamps) the 64-bit value.
            {"2147483648", -1, 2147483648u},
            {"-2147483649", -1, 0u},
            {"4294967295", -1, 4294967295u},
            {"4294967297", -1, 1u},
            {"9223372036854775807", -1, 4294967295u},
            {"9223372036854775808", -1, 0u},
            {"-99999999999999999999", -1, 0u},
    };
    for (const auto& c : cases) {
        SCOPED_TRACE(c.in);
        EXPECT_EQ(c.i, ConvertInt(c.in));
        EXPECT_EQ(c.u, ConvertUInt(c.in));
    }
}

}  // namespace android::Orvane
