#pragma once
// Performance timing: named accumulators measured with scoped timers. Each
// slow run (longer than the threshold) is logged at once, up to 50 lines per
// accumulator; after that only the counters grow.
//
// Which thread calls this: any. Counters are atomics; the registry of
// accumulators has its own mutex, taken only at construction and destruction.

#include <atomic>
#include <cstdint>
#include <string>
#include <vector>

namespace pm {

class PerformanceLog {
 public:
  static constexpr std::int64_t kImmediateLimit = 50;

  PerformanceLog(const char* name, std::int64_t thresholdMicros);
  ~PerformanceLog();
  PerformanceLog(const PerformanceLog&) = delete;
  PerformanceLog& operator=(const PerformanceLog&) = delete;

  // Records one run of `nanos` nanoseconds (see the class comment).
  void Record(std::int64_t nanos);

  const std::string& Name() const { return name_; }
  std::int64_t ThresholdMicros() const { return threshold_; }
  bool Detached() const { return detached_; }
  std::int64_t Total() const { return total_.load(); }
  std::int64_t Count() const { return count_.load(); }
  std::int64_t ImmediateCount() const { return immediateCount_.load(); }
  std::int64_t Maximum() const { return maximum_.load(); }

  // A snapshot of the registry: name, count, total and maximum of every
  // accumulator ever made in this process, live or detached.
  struct Summary {
    std::string name;
    std::int64_t count, total, maximum;
    bool detached;
  };
  static std::vector<Summary> Registry();

 private:
  struct DetachTag {};
  PerformanceLog(const PerformanceLog& from, DetachTag);

  std::string name_;
  std::int64_t immediateLimit_ = kImmediateLimit;
  std::int64_t threshold_;
  bool detached_ = false;
  std::atomic<std::int64_t> total_{0};
  std::atomic<std::int64_t> count_{0};
  std::atomic<std::int64_t> immediateCount_{0};
  std::atomic<std::int64_t> maximum_{0};
};

class PerformanceScope {
 public:
  explicit PerformanceScope(PerformanceLog& log);
  ~PerformanceScope();
  PerformanceScope(const PerformanceScope&) = delete;
  PerformanceScope& operator=(const PerformanceScope&) = delete;

  // Records the elapsed time once and returns it; 0 when already stopped.
  std::int64_t Stop();

 private:
  PerformanceLog* log_;
  std::int64_t start_;
  bool active_ = true;
};

}  // namespace pm
