#pragma once
// The clock for tests: time stands still until the test moves it. A wait on
// the clock (pm::Clock::WaitUntil) ends when the test moves the clock to its
// deadline or the clock is signalled; sleeps take no time and are counted.
// Used by the dispatcher's expiry, the media clock, the receiver loop and
// discovery in their tests, and by the dispatcher's fuzz target.
#include <chrono>
#include <condition_variable>
#include <cstdint>
#include <mutex>

#include "pm/runtime/clock.h"

namespace pmtest {

class ManualClock final : public pm::Clock {
 public:
  explicit ManualClock(std::int64_t startNs = 1'000'000'000'000) : now_(startNs) {}

  std::int64_t NowNs() override { return Locked(now_); }
  void Signal() override {
    std::lock_guard<std::mutex> guard(mutex_);
    ++signals_;
    changed_.notify_all();
  }
  bool WaitUntil(std::int64_t deadlineNs) override {
    std::unique_lock<std::mutex> lock(mutex_);
    if (signals_ < 1 && now_ < deadlineNs) {
      ++waitsBegun_;
      waiting_ = true;
      deadline_ = deadlineNs;
      changed_.notify_all();
      changed_.wait(lock, [&] { return signals_ >= 1 || now_ >= deadlineNs; });
      waiting_ = false;
    }
    if (signals_ < 1) return false;
    --signals_;
    return true;
  }
  void Sleep(std::int64_t) override {
    std::lock_guard<std::mutex> guard(mutex_);
    ++sleeps_;
  }

  // Moves the clock forward and wakes a wait whose deadline has come.
  void Advance(std::int64_t nanos) {
    std::lock_guard<std::mutex> guard(mutex_);
    now_ += nanos;
    changed_.notify_all();
  }
  void AdvanceMs(std::int64_t ms) { Advance(ms * 1'000'000); }

  // Waits (real time, at most 10 s) until the waiter has begun its n-th wait
  // that actually blocks and is in it; returns the wait's length in ms from
  // now, or -1 when that did not happen.
  std::int64_t AwaitWait(int n) {
    std::unique_lock<std::mutex> lock(mutex_);
    if (!changed_.wait_for(lock, std::chrono::seconds(10), [&] { return waitsBegun_ >= n && waiting_; })) return -1;
    return (deadline_ - now_) / 1'000'000;
  }
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
