#include "support/manual_clock.h"

#include <chrono>

namespace pmtest {

ManualClock::ManualClock(std::int64_t startNs) : now_(startNs) {}

std::int64_t ManualClock::NowNs() { return Locked(now_); }

void ManualClock::Signal() {
  std::lock_guard<std::mutex> guard(mutex_);
  ++signals_;
  changed_.notify_all();
}

bool ManualClock::WaitUntil(std::int64_t deadlineNs) {
  std::unique_lock<std::mutex> lock(mutex_);
  if (signals_ < 1 && now_ < deadlineNs) {
    ++waitsBegun_;
    waiting_ = true;
    deadline_ = deadlineNs;
    changed_.notify_all();
    changed_.wait(lock, [&] { return signals_ >= 1 || now_ >= deadlineNs; });
    waiting_ = false;
  }
  if (signals_ >= 1) {
    --signals_;
    return true;
  }
  return false;
}

void ManualClock::Sleep(std::int64_t) {
  std::lock_guard<std::mutex> guard(mutex_);
  ++sleeps_;
}

void ManualClock::Advance(std::int64_t nanos) {
  std::lock_guard<std::mutex> guard(mutex_);
  now_ += nanos;
  changed_.notify_all();
}

std::int64_t ManualClock::AwaitWait(int n) {
  std::unique_lock<std::mutex> lock(mutex_);
  if (!changed_.wait_for(lock, std::chrono::seconds(10), [&] { return waitsBegun_ >= n && waiting_; })) return -1;
  return (deadline_ - now_) / 1'000'000;
}

}  // namespace pmtest
