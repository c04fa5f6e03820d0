// Performance accumulators: slow-run logging and its limit, and scopes.
#include <gtest/gtest.h>

#include "pm/runtime/perf.h"
#include "support/log_capture.h"

namespace {

constexpr std::int64_t kMs = 1000 * 1000;

// A run longer than the threshold (exclusive) is logged at once, in
// milliseconds, with the microseconds under 5 ms.
TEST(PerformanceLog, SlowRunsAreLoggedInTheMillisecondOrMicrosecondForm) {
  const struct {
    std::int64_t thresholdMicros, nanos;
    const char* line;  // null: not logged
  } rows[] = {{20000, 25 * kMs, "run 25 ms\n"},
                      {20000, 19 * kMs, nullptr},
                      {20000, 20 * kMs, nullptr},
                      {20000, 20 * kMs + 1, "run 20 ms\n"},
                      {1000, 1234567, "run 1 ms (1234 micros)\n"}};
  for (const auto& row : rows) {
    SCOPED_TRACE(row.nanos);
    pmtest::LogCapture capture;
    pm::PerformanceLog log("run", row.thresholdMicros);
    log.Record(row.nanos);
    EXPECT_EQ(capture.Lines(), row.line ? std::vector<std::string>{row.line} : std::vector<std::string>{});
  }
}

TEST(PerformanceLog, FiftyFirstSlowRunStopsImmediateLogging) {
  pmtest::LogCapture capture;
  pm::PerformanceLog log("busy", 1);
  for (int i = 0; i < 60; ++i) log.Record(10 * kMs + i);
  ASSERT_EQ(capture.Lines().size(), 51u);
  EXPECT_EQ(capture.Count("Immediate performance logging stopped"), 1);
}

TEST(PerformanceScope, StoppingTwiceRecordsOnce) {
  pm::PerformanceLog log("scope", 1000000);
  {
    pm::PerformanceScope scope(log);
    scope.Stop();
    EXPECT_EQ(scope.Stop(), 0);
  }
  EXPECT_EQ(log.Count(), 1);
}

}  // namespace
