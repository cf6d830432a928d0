#include "plugins/perf_parser.h"

#include <gtest/gtest.h>

namespace android::Orvane {
namespace {

// Copied from /proc/pressure/* of a 6.18 kernel under load.
const char kCpuPressure[] =
        "some avg10=40.41 avg60=15.27 avg300=14.09 total=121055647\n"
        "full avg10=0.00 avg60=0.00 avg300=0.00 total=0\n";
const char kIoPressure[] =
        "some avg10=5.93 avg60=6.22 avg300=4.38 total=48901422\n"
        "full avg10=3.38 avg60=4.59 avg300=3.36 total=39433260\n";
// Copied from /proc/PID/stat of a daemon, a kernel thread and a program that calls itself
// "we) ird (x" (whose CPU times were raised from 0 to tell them apart), statm and io of a shell.
const char kDaemonStat[] =
        "16411 (orvane) S 16399 16396 17962 0 -1 4194304 85546 0 1 0 819 2835 0 0 20 0 10 0 537183 727060480 87400 "
        "18446744073709551615 94698297651200 94698298054465 140731893620256 0 0 0 65536 6 0 0 0 0 17 0 0 0 0 0 0 "
        "94698298174104 94698298191040 94699260977152 140731893623068 140731893623320 140731893623320 "
        "140731893624794 0\n";
const char kKernelThreadStat[] =
        "77 (kdamond.0) I 2 0 0 0 -1 2129984 0 0 0 0 0 1339 0 0 20 0 1 0 130 0 0 18446744073709551615 0 0 0 0 0 0 0 "
        "2147483647 0 1 0 0 17 0 0 0 0 0 0 0 0 0 0 0 0 0 0\n";
const char kOddNameStat[] =
        "17480 (we) ird (x) S 17468 17468 27584 0 -1 4194304 132 0 0 0 7 3 0 0 20 0 1 0 541490 2990080 415 "
        "18446744073709551615 94721593303040 94721593320969 140728210471168 0 0 0 0 6 0 1 0 0 17 1 0 0 0 0 0 "
        "94721593335056 94721593336320 94722259398656 140728210475650 140728210475669 140728210475669 "
        "140728210477032 0\n";
const char kShellStatm[] = "1152 544 413 193 0 171 0\n";
const char kShellIo[] =
        "rchar: 424755\nwchar: 698\nsyscr: 1235\nsyscw: 11\nread_bytes: 212992\nwrite_bytes: 8192\n"
        "cancelled_write_bytes: 0\n";

// What the kernel writes, down to the formats of older and newer kernels; anything else is
// refused as a whole and leaves the output untouched.
TEST(PerfParserTest, PressureFilesOfEveryKernelAndNothingElse) {
    Pressure cpu;
    ASSERT_TRUE(PerfParser::ParsePressure(kCpuPressure, cpu));
    EXPECT_DOUBLE_EQ(40.41, cpu.some.avg10);
    EXPECT_DOUBLE_EQ(14.09, cpu.some.avg300);
    EXPECT_EQ(121055647u, cpu.some.totalUs);
    EXPECT_TRUE(cpu.full.present);
    Pressure io;
    ASSERT_TRUE(PerfParser::ParsePressure(kIoPressure, io));
    EXPECT_DOUBLE_EQ(3.38, io.full.avg10);
    EXPECT_EQ(39433260u, io.full.totalUs);

    // Before 5.13 cpu has no "full" line; a later kernel may add lines and fields.
    Pressure old;
    ASSERT_TRUE(PerfParser::ParsePressure("some avg10=1.50 avg60=0.30 avg300=0.06 total=912", old));
    EXPECT_FALSE(old.full.present);
    EXPECT_DOUBLE_EQ(1.5, old.some.avg10);
    Pressure later;
    ASSERT_TRUE(PerfParser::ParsePressure(
            "some avg10=0.00 avg60=0.00 avg300=0.00 total=7 peak=3\nirq avg10=1.00 avg60=0.00 avg300=0.00 total=1\n"
            "full avg10=100.00 avg60=0.00 avg300=0.00 total=18446744073709551615\n",
            later));
    EXPECT_EQ(7u, later.some.totalUs);
    EXPECT_DOUBLE_EQ(100.0, later.full.avg10);
    EXPECT_EQ(UINT64_MAX, later.full.totalUs);

    const std::string refused[] = {
            "",
            "full avg10=0.00 avg60=0.00 avg300=0.00 total=0\n",                     // no "some"
            "some avg10=0.00 avg60=0.00 avg300=0.00\n",                             // no total
            "some avg60=0.00 avg10=0.00 avg300=0.00 total=0\n",                     // order changed
            "some avg10=-1.00 avg60=0.00 avg300=0.00 total=0\n",                    // negative
            "some avg10=nan avg60=0.00 avg300=0.00 total=0\n",                      // not a number
            "some avg10=1e3 avg60=0.00 avg300=0.00 total=0\n",                      // not the kernel's notation
            "some avg10=1.234 avg60=0.00 avg300=0.00 total=0\n",                    // three decimals
            "some avg10=5. avg60=0.00 avg300=0.00 total=0\n",                       // no fraction
            "some avg10=1234567.00 avg60=0.00 avg300=0.00 total=0\n",               // not a share of time
            "some avg10=0.00 avg60=0.00 avg300=0.00 total=18446744073709551616\n",  // overflows
            "some avg10=0.00  avg60=0.00 avg300=0.00 total=0\n",                    // two blanks
            "some avg10=0.00 avg60=0.00 avg300=0.00 total=0\nfull avg10=x avg60=0.00 avg300=0.00 total=0\n",
            std::string("some avg10=0.00 avg60=0.00 avg300=0.00 total=1\0 2", 47),
            "\x01\xff garbage\n",
    };
    for (const std::string& text : refused) {
        Pressure untouched;
        untouched.some.totalUs = 99;
        EXPECT_FALSE(PerfParser::ParsePressure(text, untouched)) << text;
        EXPECT_EQ(99u, untouched.some.totalUs) << text;
    }
    // A second line of one kind is not the kernel's: the first counts.
    Pressure twice;
    ASSERT_TRUE(PerfParser::ParsePressure(
            "some avg10=1.00 avg60=0.00 avg300=0.00 total=1\nsome avg10=2.00 avg60=0.00 avg300=0.00 total=2\n", twice));
    EXPECT_EQ(1u, twice.some.totalUs);

    EXPECT_EQ("some 150000 2000000", PerfParser::TriggerText(false, 150000, 2000000));
    EXPECT_EQ("full 4294967295 10000000", PerfParser::TriggerText(true, UINT32_MAX, 10000000));
}

TEST(PerfParserTest, ProcRowsOfRealProcessesAndDamagedOnes) {
    uint64_t ticks = 0;
    std::string comm;
    ASSERT_TRUE(PerfParser::ParseStat(kDaemonStat, ticks, comm));
    EXPECT_EQ("orvane", comm);
    EXPECT_EQ(819u + 2835u, ticks);
    ASSERT_TRUE(PerfParser::ParseStat(kKernelThreadStat, ticks, comm));
    EXPECT_EQ("kdamond.0", comm);
    EXPECT_EQ(1339u, ticks);
    // The name is cut at the last ")", so a name that imitates the row does not shift the fields.
    ASSERT_TRUE(PerfParser::ParseStat(kOddNameStat, ticks, comm));
    EXPECT_EQ("we) ird (x", comm);
    EXPECT_EQ(10u, ticks);
    // Rows cut short right after stime, the 15th field, still hold everything needed.
    ASSERT_TRUE(PerfParser::ParseStat("1 (a) S 0 0 0 0 -1 0 0 0 0 0 5 6", ticks, comm));
    EXPECT_EQ(11u, ticks);

    const std::string badStats[] = {
            "",
            "1 (a S 0 0 0 0 -1 0 0 0 0 0 5 6 0",                      // no ")"
            "1 (a)S 0 0 0 0 -1 0 0 0 0 0 5 6 0",                      // no blank after the name
            "1 (a)",                                                  // nothing after it
            "1 (a) S 0 0 0 0 -1 0 0 0 0 0 5",                         // no stime
            "1 (a) S 0 0 0 0 -1 0 0 0 0 0 x 6 0",                     // utime not a number
            "1 (a) S 0 0 0 0 -1 0 0 0 0 0 -5 6 0",                    // negative
            "1 (a) S 0 0 0 0 -1 0 0 0 0 0 18446744073709551615 1 0",  // the sum overflows
    };
    for (const std::string& row : badStats) {
        uint64_t untouched = 42;
        EXPECT_FALSE(PerfParser::ParseStat(row, untouched, comm)) << row;
        EXPECT_EQ(42u, untouched) << row;
    }

    uint64_t pages = 0;
    ASSERT_TRUE(PerfParser::ParseStatm(kShellStatm, pages));
    EXPECT_EQ(544u, pages);
    ASSERT_TRUE(PerfParser::ParseStatm("0 0 0 0 0 0 0\n", pages));  // a kernel thread
    EXPECT_EQ(0u, pages);
    ASSERT_TRUE(PerfParser::ParseStatm("10 7\n", pages));
    EXPECT_EQ(7u, pages);
    for (const char* row :
         {"", "1152", "1152 x 413", "x 544 413", "1152  544", "1152 -5 1", "1152 99999999999999999999 0"}) {
        pages = 42;
        EXPECT_FALSE(PerfParser::ParseStatm(row, pages)) << row;
        EXPECT_EQ(42u, pages) << row;
    }

    uint64_t bytes = 0;
    ASSERT_TRUE(PerfParser::ParseIo(kShellIo, bytes));
    EXPECT_EQ(212992u + 8192u, bytes);
    const std::string badIo[] = {
            "",
            "rchar: 424755\nwchar: 698\n",  // no storage figures
            "read_bytes: 212992\n",         // no write_bytes
            "read_bytes: 1\nwrite_bytes: x\n",
            "read_bytes: 18446744073709551615\nwrite_bytes: 1\n",  // the sum overflows
    };
    for (const std::string& row : badIo) {
        bytes = 42;
        EXPECT_FALSE(PerfParser::ParseIo(row, bytes)) << row;
        EXPECT_EQ(42u, bytes) << row;
    }
}

}  // namespace
}  // namespace android::Orvane
