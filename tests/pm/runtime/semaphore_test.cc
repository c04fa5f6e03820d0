// pm::Semaphore: no lost signals, and deadlines. (A signal from another
// thread waking the one waiter is what every server and queue producer start
// waits on.)
#include <gtest/gtest.h>

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

}  // namespace
