#include "utils/file_pattern.h"

#include <gtest/gtest.h>

namespace android::Orvane {
namespace {

// Patterns match whole names, with the shorthand classes outside brackets only.
TEST(FilePatternTest, MatchesWholeNamesWithShorthands) {
    std::string error;
    auto pack = FilePattern::Compile("EventId_\\S+_\\d{14}_901\\d{6}.zip", &error);
    ASSERT_NE(pack, nullptr) << error;
    EXPECT_TRUE(pack->Matches("EventId_fp_sn_20260101000000_901001001.zip"));
    EXPECT_FALSE(pack->Matches("EventId_fp_sn_20260101000000_902001001.zip"));
    EXPECT_FALSE(pack->Matches("EventId_fp_sn_20260101000000_901001001.zip.part"));
    EXPECT_FALSE(pack->Matches("xEventId_fp_sn_20260101000000_901001001.zip"));
    EXPECT_FALSE(pack->Matches("EventId_f p_sn_20260101000000_901001001.zip"));
    auto bracket = FilePattern::Compile("[\\d]x|y", &error);
    ASSERT_NE(bracket, nullptr) << error;
    EXPECT_TRUE(bracket->Matches("dx"));
    EXPECT_TRUE(bracket->Matches("y"));
    EXPECT_FALSE(bracket->Matches("1x"));
}

// Expressions from pushed documents never cost without bound: stacked repetitions, whose
// compiled form doubles with each operator, and large repetition products are refused with a
// reason, as are back-references and broken syntax.
TEST(FilePatternTest, CostlyOrBrokenExpressionsAreRefused) {
    for (const char* refused :
         {"a++++++++++++++++", "\\S+*", "a{2}+", "a?*", "(a+)+(b+)+(c+)+(d+)+(e+)+(f+)+(g+)+(h+)+(i+)+(j+)+", "x{2000}",
          "(x{40}){40}", "(a*)\\1", "[abc", "a{3,2}", "", "abc\\"}) {
        std::string error;
        EXPECT_EQ(FilePattern::Compile(refused, &error), nullptr) << refused;
        EXPECT_FALSE(error.empty()) << refused;
    }
    std::string error;
    EXPECT_NE(FilePattern::Compile("tombstone_\\d{2}|anr_\\S+|(trace|log)_\\d+\\.txt", &error), nullptr) << error;
    EXPECT_EQ(FilePattern::Compile(std::string(FilePattern::kMaxLength + 1, 'a'), &error), nullptr);
}

}  // namespace
}  // namespace android::Orvane
