#pragma once
// Counting semaphore: a mutex, a condition variable and a signed 32-bit count
// starting at 0. A Signal given while nobody waits is kept and ends the next
// wait at once. Safe to use from any thread; created shared and handed to the
// threads that use it.

#include <condition_variable>
#include <cstdint>
#include <mutex>

namespace pm {

class Semaphore {
 public:
  Semaphore() = default;
  Semaphore(const Semaphore&) = delete;
  Semaphore& operator=(const Semaphore&) = delete;

  // Adds one and wakes one waiter.
  void Signal();
  // Waits until the count is at least 1, then takes one.
  void Wait();
  // Waits until the count is at least 1 or the steady clock (SteadyNowNs)
  // reaches deadlineNs (INT64_MAX: no time limit). Returns true and takes one
  // when the count allowed it.
  bool WaitUntil(std::int64_t deadlineNs);

 private:
  std::mutex mutex_;              // guards count_
  std::condition_variable cv_;
  std::int32_t count_ = 0;
};

}  // namespace pm
