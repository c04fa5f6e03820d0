// pm::Semaphore: no lost signals, deadlines, one waiter per signal.
#include <gtest/gtest.h>

#include <atomic>
#include <thread>

#include "pm/runtime/clock.h"
#include "pm/runtime/semaphore.h"

namespace {

constexpr std::int64_t kMs = 1000000;

TEST(Semaphore, KeepsASignalGivenBeforeTheWaitAndTimesOutAtTheDeadline) {
  pm::Semaphore s;
  s.Signal();
  EXPECT_TRUE(s.WaitUntil(pm::SteadyNowNs()));  // deadline already passed, count allows it
  const std::int64_t start = pm::SteadyNowNs();
  EXPECT_FALSE(s.WaitUntil(start + 30 * kMs));
  EXPECT_GE(pm::SteadyNowNs() - start, 30 * kMs);
}

// One waiter blocks for ever, the other with a deadline far away: each signal
// from this thread ends exactly one of their waits.
TEST(Semaphore, EachSignalFromAnotherThreadEndsExactlyOneWait) {
  pm::Semaphore s;
  std::atomic<int> woken{0};
  std::thread a([&] {
    s.Wait();
    ++woken;
  });
  std::thread b([&] {
    EXPECT_TRUE(s.WaitUntil(pm::SteadyNowNs() + 60000 * kMs));
    ++woken;
  });
  s.Signal();
  while (woken.load() < 1) std::this_thread::yield();
  std::this_thread::sleep_for(std::chrono::milliseconds(20));
  EXPECT_EQ(woken.load(), 1);
  s.Signal();
  a.join();
  b.join();
  EXPECT_EQ(woken.load(), 2);
}

}  // namespace
