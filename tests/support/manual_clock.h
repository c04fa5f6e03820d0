#pragma once
// The clock for tests: time stands still until the test moves it. A wait on
// the clock (pm::Clock::WaitUntil) ends when the test moves the clock to its
// deadline or the clock is signalled; sleeps take no time and are counted.
// Used by the dispatcher's expiry, the media clock, the receiver loop and
// discovery in their tests, and by the dispatcher's fuzz target.
#include <condition_variable>
#include <cstdint>
#include <mutex>

#include "pm/runtime/clock.h"

namespace pmtest {

class ManualClock final : public pm::Clock {
 public:
  explicit ManualClock(std::int64_t startNs = 1'000'000'000'000);

  std::int64_t NowNs() override;
  void Signal() override;
  bool WaitUntil(std::int64_t deadlineNs) override;
  void Sleep(std::int64_t nanos) override;

  // Moves the clock forward and wakes a wait whose deadline has come.
  void Advance(std::int64_t nanos);
  void AdvanceMs(std::int64_t ms) { Advance(ms * 1'000'000); }

  // Waits (real time, at most 10 s) until the waiter has begun its n-th wait
  // that actually blocks and is in it; returns the wait's length in ms from
  // now, or -1 when that did not happen.
  std::int64_t AwaitWait(int n);
  // Waits that blocked so far, and the deadline of the last one.
  int WaitsBegun() { return Locked(waitsBegun_); }
  std::int64_t LastWaitDeadline() { return Locked(deadline_); }
  // Sleep calls so far.
  int Sleeps() { return Locked(sleeps_); }

 private:
  template <typename T>
  T Locked(const T& value) {
    std::lock_guard<std::mutex> guard(mutex_);
    return value;
  }

  std::mutex mutex_;  // guards everything below
  std::condition_variable changed_;
  std::int64_t now_;
  std::int32_t signals_ = 0;
  int waitsBegun_ = 0;
  bool waiting_ = false;
  std::int64_t deadline_ = 0;
  int sleeps_ = 0;
};

}  // namespace pmtest
