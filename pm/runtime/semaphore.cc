#include "pm/runtime/semaphore.h"

#include <chrono>

#include "pm/runtime/clock.h"

namespace pm {

void Semaphore::Signal() {
  std::lock_guard<std::mutex> guard(mutex_);
  ++count_;
  cv_.notify_one();
}

void Semaphore::Wait() {
  std::unique_lock<std::mutex> lock(mutex_);
  cv_.wait(lock, [this] { return count_ >= 1; });
  --count_;
}

bool Semaphore::WaitUntil(std::int64_t deadlineNs) {
  std::unique_lock<std::mutex> lock(mutex_);
  if (deadlineNs == INT64_MAX) {
    cv_.wait(lock, [this] { return count_ >= 1; });
  }
  // An absolute time point on the steady clock (the time base of SteadyNowNs),
  // so that far deadlines cannot overflow a relative wait.
  const std::chrono::steady_clock::time_point deadline{std::chrono::nanoseconds(deadlineNs)};
  while (count_ < 1 && SteadyNowNs() < deadlineNs) cv_.wait_until(lock, deadline);
  if (count_ >= 1) {
    --count_;
    return true;
  }
  return false;
}

}  // namespace pm
