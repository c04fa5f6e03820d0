#pragma once
// Time for everything that waits for deadlines: the steady clock in
// nanoseconds, and pm::Clock, the clock and wake-up signal of a thread that
// waits (the request dispatcher's expiry thread, the media clock of a source,
// the NDI receiver loop, discovery's scan loop). Production uses the steady
// clock (MakeSteadyClock); tests hand in a clock they move by hand, so that
// they drive time instead of sleeping.
//
// Which thread calls this: NowNs from any thread; WaitUntil by the one thread
// that waits on the clock; Signal and Sleep from any thread. All must be safe
// to call concurrently. A clock's signals wake its one waiting thread: give
// each waiting thread a clock of its own.

#include <chrono>
#include <cstdint>
#include <memory>

namespace pm {

inline std::int64_t SteadyNowNs() {
  return std::chrono::duration_cast<std::chrono::nanoseconds>(
             std::chrono::steady_clock::now().time_since_epoch())
      .count();
}

class Clock {
 public:
  // A deadline that never comes: WaitUntil then ends only on a signal.
  static constexpr std::int64_t kNoDeadline = INT64_MAX;

  virtual ~Clock() = default;
  // Now, in nanoseconds of the clock's own time base.
  virtual std::int64_t NowNs() = 0;
  // Adds one to the signal count and wakes the waiter. A signal given while
  // nobody waits is kept and ends the next wait at once.
  virtual void Signal() = 0;
  // Waits until the signal count is at least 1 or the clock reaches
  // deadlineNs. Returns true (and takes one signal) when signalled.
  virtual bool WaitUntil(std::int64_t deadlineNs) = 0;
  // Lets `nanos` pass without looking at signals (the dispatcher's grace
  // period before it closes its connection).
  virtual void Sleep(std::int64_t nanos) = 0;

  // Drops signals left over from an earlier run (a stop that found no loop
  // waiting), so that they cannot cut the first wait of the next run short.
  void ClearSignals() {
    while (WaitUntil(NowNs() - 1)) {
    }
  }
};

// The steady clock (SteadyNowNs) with a pm::Semaphore as the signal; a new
// one for every caller.
std::shared_ptr<Clock> MakeSteadyClock();

}  // namespace pm
