#pragma once
// Polling with a deadline, for tests that watch another thread or process.
#include <chrono>
#include <functional>

namespace pmtest {

// Calls `done` every few milliseconds until it returns true or `timeout`
// passes; returns its last result.
bool WaitFor(const std::function<bool()>& done,
             std::chrono::milliseconds timeout = std::chrono::seconds(10));

}  // namespace pmtest
