#pragma once
// Polling with a deadline, for tests that watch another thread or process.
#include <chrono>
#include <functional>
#include <future>
#include <thread>

#include <gtest/gtest.h>

namespace pmtest {

// Calls `done` every few milliseconds until it returns true or `timeout`
// passes; returns its last result.
inline bool WaitFor(const std::function<bool()>& done, std::chrono::milliseconds timeout = std::chrono::seconds(10)) {
  const auto deadline = std::chrono::steady_clock::now() + timeout;
  while (std::chrono::steady_clock::now() < deadline) {
    if (done()) return true;
    std::this_thread::sleep_for(std::chrono::milliseconds(5));
  }
  return done();
}

// Runs `blocking` (a call that blocks) on another thread, gives it time to
// block, calls `wake` and returns what `blocking` returned. A wake that comes
// before the call blocks only makes it end sooner; a call that is not woken
// within 20 s fails the test (and is still waited for).
template <typename Blocking, typename Wake>
auto WokenBy(Blocking blocking, Wake wake) {
  auto result = std::async(std::launch::async, blocking);
  std::this_thread::sleep_for(std::chrono::milliseconds(20));
  wake();
  EXPECT_EQ(result.wait_for(std::chrono::seconds(20)), std::future_status::ready) << "not woken";
  return result.get();
}

}  // namespace pmtest
