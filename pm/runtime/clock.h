#pragma once
// The steady clock in nanoseconds, the time base of deadlines and timers.
#include <chrono>
#include <cstdint>

namespace pm {

inline std::int64_t SteadyNowNs() {
  return std::chrono::duration_cast<std::chrono::nanoseconds>(
             std::chrono::steady_clock::now().time_since_epoch())
      .count();
}

}  // namespace pm
