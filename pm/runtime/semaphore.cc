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
  while (count_ < 1) {
    const std::int64_t now = SteadyNowNs();
    if (now >= deadlineNs) break;
    cv_.wait_for(lock, std::chrono::nanoseconds(deadlineNs - now));
  }
  if (count_ >= 1) {
    --count_;
    return true;
  }
  return false;
}

}  // namespace pm
