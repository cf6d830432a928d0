#include "plugins/log_filter_stats.h"

#include <string>
#include <vector>

#include <gtest/gtest.h>

namespace android::Orvane {
namespace {

LogFilterStatsParser ParseWhole(const std::string& output) {
    LogFilterStatsParser parser;
    parser.Feed(output);
    parser.Finish();
    return parser;
}

std::string Rows(int count) {
    std::string rows;
    for (int i = 1; i <= count; ++i) {
        rows += std::to_string(i) + "/" + std::to_string(10000 + i) + " proc" + std::to_string(i) +
                " 10 5 2 1700000000\n";
    }
    return rows;
}

TEST(LogFilterStatsTest, RowsAreScannedAsTheRowFormatWould) {
    LogFilterRow row;
    ASSERT_TRUE(LogFilterStatsParser::ParseRow("  1234/1000 system_server 500 20 7 1700000000 extra words", row));
    EXPECT_EQ(1234, row.pid);
    EXPECT_EQ(1000, row.uid);
    EXPECT_EQ("system_server", row.processName);
    EXPECT_EQ(500, row.totalFilterLog);
    EXPECT_EQ(20, row.totalFilterCnt);
    EXPECT_EQ(7, row.maxFilterCnt);
    EXPECT_EQ(1700000000, row.maxHappenTime);
    ASSERT_TRUE(LogFilterStatsParser::ParseRow("-2147483648/+3\tname\t-1 0 0 0", row));
    EXPECT_EQ(INT32_MIN, row.pid);
    EXPECT_EQ(3, row.uid);

    // A blank before the slash, a missing item, a number that does not fit, text where a number
    // belongs, and a NUL byte that ends the line as a C string: no row, and the row given keeps
    // what it had.
    for (const std::string& bad :
         std::vector<std::string>{"1 /2 a 1 2 3 4", "1/2 a 1 2 3", "2147483648/1 a 1 2 3 4", "1/2 a 1 2 3 x",
                                  "1/2 a 1 2 99999999999 4", "", "/", std::string("1/2 a 1 2\0 3 4", 15)}) {
        EXPECT_FALSE(LogFilterStatsParser::ParseRow(bad, row)) << bad;
        EXPECT_EQ(INT32_MIN, row.pid) << bad;
    }
}

TEST(LogFilterStatsTest, OnlyRowsAfterTheHeaderCountAndAtMostAHundred) {
    // Rows before the header are not the filter's: the daemon prints other statistics first.
    LogFilterStatsParser parser = ParseWhole("1/1 early 1 1 1 1\nsize/num main\n== Log Filter Top PIDs ==\n" +
                                             std::string("not a row\n") + Rows(150));
    EXPECT_TRUE(parser.HeaderFound());
    ASSERT_EQ(100u, parser.Rows().size());
    EXPECT_EQ(1, parser.Rows().front().pid);
    EXPECT_EQ("proc100", parser.Rows().back().processName);
    EXPECT_EQ(1u, parser.SkippedLines());
    EXPECT_TRUE(parser.Full());

    LogFilterStatsParser headerOnly = ParseWhole("Log Filter Top PIDs\nPID/UID NAME\n\n");
    EXPECT_TRUE(headerOnly.HeaderFound());
    EXPECT_TRUE(headerOnly.Rows().empty());
    EXPECT_EQ(2u, headerOnly.SkippedLines());

    LogFilterStatsParser noHeader = ParseWhole(Rows(3));
    EXPECT_FALSE(noHeader.HeaderFound());
    EXPECT_TRUE(noHeader.Rows().empty());

    // The last line counts without its line feed.
    EXPECT_EQ(1u, ParseWhole("Log Filter Top PIDs\n5/5 last 1 2 3 4").Rows().size());
}

TEST(LogFilterStatsTest, OverlongLinesArePassedOverWholeWhateverThePieces) {
    // A 10,000-byte line that holds the header and a row text at its end: neither may be taken
    // from it, however the output arrives; the 255-byte line is still a line.
    const std::string longLine = std::string(10000 - 40, 'x') + " Log Filter Top PIDs 1/1 a 1 2 3 4";
    const std::string exact = "9/9 " + std::string(255 - 4 - 8, 'n') + " 1 2 3 4";
    ASSERT_EQ(255u, exact.size());
    const std::string output = longLine + "\nLog Filter Top PIDs\n" + longLine + "\n" + exact + "\n" +
                               std::string(256, 'y') + "\n" + "2/2 b 1 2 3 4\n";
    for (size_t piece : {size_t{1}, size_t{7}, size_t{255}, size_t{256}, size_t{4096}, output.size()}) {
        LogFilterStatsParser parser;
        for (size_t at = 0; at < output.size(); at += piece) {
            parser.Feed(std::string_view(output).substr(at, piece));
        }
        parser.Finish();
        ASSERT_TRUE(parser.HeaderFound()) << piece;
        ASSERT_EQ(2u, parser.Rows().size()) << piece;
        EXPECT_EQ(9, parser.Rows()[0].pid) << piece;
        EXPECT_EQ(2, parser.Rows()[1].pid) << piece;
        EXPECT_EQ(3u, parser.OverlongLines()) << piece;
    }
    // Binary output: NUL bytes and high bytes never make a row or the header.
    std::string binary;
    for (int i = 0; i < 5000; ++i) {
        binary.push_back(static_cast<char>((i * 131) & 0xff));
    }
    LogFilterStatsParser parser = ParseWhole(binary);
    EXPECT_FALSE(parser.HeaderFound());
    EXPECT_TRUE(parser.Rows().empty());
}

}  // namespace
}  // namespace android::Orvane
