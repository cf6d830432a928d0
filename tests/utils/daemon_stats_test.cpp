#include "utils/daemon_stats.h"

#include <algorithm>
#include <thread>
#include <vector>

#include <gtest/gtest.h>

#include "tests/common/log_capture.h"
#include "utils/orvane_log.h"

namespace android::Orvane {
namespace {

// Counters and marks stay exact when many threads report at once, references stay valid while
// new names are added, and the dump lists every name once, in name order.
TEST(DaemonStatsTest, ConcurrentReportsAreExactAndTheDumpIsSorted) {
    DaemonStats stats;
    DaemonStats::Counter& kept = stats.Get("source.A.read");
    std::vector<std::thread> threads;
    for (int t = 0; t < 4; ++t) {
        threads.emplace_back([&stats, &kept, t] {
            for (uint64_t i = 1; i <= 10000; ++i) {
                kept.fetch_add(1, std::memory_order_relaxed);
                stats.Add("drop.over daily quota");
                stats.RaiseTo("loop.L.backlog_high", i * 4 + t);
                stats.Add("new." + std::to_string(t * 10000 + i % 100));  // grows the map meanwhile
            }
        });
    }
    for (std::thread& thread : threads) {
        thread.join();
    }
    EXPECT_EQ(stats.Value("source.A.read"), 40000u);
    EXPECT_EQ(stats.Value("drop.over daily quota"), 40000u);
    EXPECT_EQ(stats.Value("loop.L.backlog_high"), 40003u);
    EXPECT_EQ(stats.Value("never.reported"), 0u);
    stats.RaiseTo("loop.L.backlog_high", 5);  // a lower value never lowers a mark
    EXPECT_EQ(stats.Value("loop.L.backlog_high"), 40003u);

    std::string text = stats.Format();
    EXPECT_EQ(text.find("drop.over daily quota 40000\n"), 0u) << text;
    EXPECT_LT(text.find("loop.L.backlog_high 40003\n"), text.find("source.A.read 40000\n"));
    EXPECT_EQ(std::count(text.begin(), text.end(), '\n'), 3 + 400);
}

// A repeated line goes out once per window; the next one after the window carries the count of
// what was left out in front of it.
TEST(LogRepeatGateTest, RepeatsWithinTheWindowCollapseIntoOneCountedLine) {
    LogRepeatGate gate(50);
    uint64_t collapsed = 99;
    ASSERT_TRUE(gate.Pass(collapsed));
    EXPECT_EQ(collapsed, 0u);
    int left = 0;
    while (!gate.Pass(collapsed)) {  // the window closes within a few milliseconds
        ++left;
        ASSERT_LT(left, 100000000) << "window never ended";
    }
    EXPECT_EQ(collapsed, static_cast<uint64_t>(left));

    LogCapture capture;
    for (int i = 0; i < 5; ++i) {
        OLOGE_LIMITED("%s record %d invalid", i);
    }
    EXPECT_EQ(capture.Count(ANDROID_LOG_ERROR, "record 0 invalid"), 1u) << capture.Dump();
    EXPECT_EQ(capture.Count(ANDROID_LOG_ERROR, "invalid"), 1u) << capture.Dump();
}

}  // namespace
}  // namespace android::Orvane
