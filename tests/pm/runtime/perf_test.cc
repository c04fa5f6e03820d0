// Performance accumulators: slow-run logging, its limit, and the registry.
#include <gtest/gtest.h>

#include <algorithm>

#include "pm/runtime/perf.h"
#include "support/log_capture.h"

namespace {

using pm::PerformanceLog;

constexpr std::int64_t kMs = 1000 * 1000;

TEST(PerformanceLog, SlowRunsUseTheMillisecondOrMicrosecondForm) {
  pmtest::LogCapture capture;
  PerformanceLog log("RpcRequest", 20000);
  log.Record(25 * kMs);
  log.Record(19 * kMs);  // counted, not slow
  PerformanceLog fast("fast", 1000);
  fast.Record(1234567);  // 1.2 ms: under 5000 micros -> micros form
  EXPECT_EQ(capture.Lines(), (std::vector<std::string>{"RpcRequest 25 ms\n", "fast 1 ms (1234 micros)\n"}));
  EXPECT_EQ(log.Count(), 2);
  EXPECT_EQ(log.Total(), 44 * kMs);
  EXPECT_EQ(log.Maximum(), 25 * kMs);
}

TEST(PerformanceLog, ThresholdIsExclusive) {
  pmtest::LogCapture capture;
  PerformanceLog log("edge", 20000);
  log.Record(20 * kMs);
  EXPECT_TRUE(capture.Lines().empty());
  log.Record(20 * kMs + 1);
  EXPECT_EQ(capture.Lines().size(), 1u);
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
  EXPECT_EQ(log.Maximum(), 10 * kMs + 59);
  EXPECT_EQ(log.ImmediateCount(), 60);
}

TEST(PerformanceLog, DestroyedAccumulatorLeavesADetachedCopyInTheRegistry) {
  {
    PerformanceLog log("gone-soon-7f3a", 1000000);
    log.Record(3);
    log.Record(4);
  }
  const auto entries = PerformanceLog::Registry();
  auto it = std::find_if(entries.begin(), entries.end(),
                         [](const auto& e) { return e.name == "gone-soon-7f3a"; });
  ASSERT_NE(it, entries.end());
  EXPECT_TRUE(it->detached);
  EXPECT_EQ(it->count, 2);
  EXPECT_EQ(it->total, 7);
  EXPECT_EQ(it->maximum, 4);
  EXPECT_EQ(std::count_if(entries.begin(), entries.end(),
                          [](const auto& e) { return e.name == "gone-soon-7f3a"; }),
            1);
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
