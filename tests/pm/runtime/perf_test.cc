// Performance accumulators: slow-run logging, its limit, and the registry.
#include <gtest/gtest.h>

#include <tuple>

#include "pm/runtime/perf.h"
#include "support/log_capture.h"

namespace {

using pm::PerformanceLog;

constexpr std::int64_t kMs = 1000 * 1000;

// A run longer than the threshold (exclusive) is logged at once, in
// milliseconds, with the microseconds under 5 ms.
TEST(PerformanceLog, SlowRunsAreLoggedInTheMillisecondOrMicrosecondForm) {
  struct Row {
    std::int64_t thresholdMicros, nanos;
    const char* line;  // null: not logged
  };
  const Row rows[] = {{20000, 25 * kMs, "run 25 ms\n"},
                      {20000, 19 * kMs, nullptr},
                      {20000, 20 * kMs, nullptr},
                      {20000, 20 * kMs + 1, "run 20 ms\n"},
                      {1000, 1234567, "run 1 ms (1234 micros)\n"}};
  for (const Row& row : rows) {
    SCOPED_TRACE(row.nanos);
    pmtest::LogCapture capture;
    PerformanceLog log("run", row.thresholdMicros);
    log.Record(row.nanos);
    EXPECT_EQ(capture.Lines(), row.line ? std::vector<std::string>{row.line} : std::vector<std::string>{});
  }
}

TEST(PerformanceLog, FiftyFirstSlowRunStopsImmediateLogging) {
  pmtest::LogCapture capture;
  PerformanceLog log("busy", 1);
  for (int i = 0; i < 60; ++i) log.Record(10 * kMs + i);
  const auto lines = capture.Lines();
  ASSERT_EQ(lines.size(), 51u);
  EXPECT_EQ(lines[49], "busy 10 ms\n");
  EXPECT_EQ(lines[50],
            "busy Immediate performance logging stopped: too many entries (50).  Summary will still be "
            "accurate\n");
  EXPECT_EQ(log.Count(), 60);
  EXPECT_EQ(log.Total(), 600 * kMs + 59 * 60 / 2);
  EXPECT_EQ(log.Maximum(), 10 * kMs + 59);
  EXPECT_EQ(log.ImmediateCount(), 60);
}

TEST(PerformanceLog, DestroyedAccumulatorLeavesADetachedCopyInTheRegistry) {
  {
    PerformanceLog log("gone-soon-7f3a", 1000000);
    log.Record(3);
    log.Record(4);
  }
  int copies = 0;
  for (const auto& entry : PerformanceLog::Registry()) {
    if (entry.name != "gone-soon-7f3a") continue;
    ++copies;
    EXPECT_TRUE(entry.detached);
    EXPECT_EQ(std::make_tuple(entry.count, entry.total, entry.maximum), std::make_tuple(2, 7, 4));
  }
  EXPECT_EQ(copies, 1);
}

TEST(PerformanceScope, StoppingTwiceRecordsOnce) {
  PerformanceLog log("scope", 1000000);
  {
    pm::PerformanceScope scope(log);
    EXPECT_GE(scope.Stop(), 0);
    EXPECT_EQ(scope.Stop(), 0);
  }
  EXPECT_EQ(log.Count(), 1);
  { pm::PerformanceScope scope(log); }
  EXPECT_EQ(log.Count(), 2);
}

}  // namespace
