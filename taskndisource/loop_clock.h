#pragma once
// The clock and wake-up signal of a worker loop (the receiver loop of a
// source, the scan loop of discovery), and what happens when such a loop does
// not end in time. Production uses the steady clock, a pm::Semaphore, a
// 5-second stop deadline and std::_Exit(1); tests hand in a clock they advance
// by hand and an exit hook that records instead of ending the process.
//
// Which thread calls this: NowNs and WaitUntil are called by the loop's own
// thread; Signal by the thread that stops the loop. All three must be safe to
// call concurrently.

#include <chrono>
#include <cstdint>
#include <functional>
#include <memory>

namespace TaskNDISource {

class LoopClock {
 public:
  virtual ~LoopClock() = default;
  // Now, in nanoseconds of the clock's own time base.
  virtual std::int64_t NowNs() = 0;
  // Adds one to the signal count and wakes one waiter. A signal given while
  // nobody waits is kept and ends the next wait at once.
  virtual void Signal() = 0;
  // Waits until the signal count is at least 1 or the clock reaches
  // deadlineNs. Returns true (and takes one signal) when signalled.
  virtual bool WaitUntil(std::int64_t deadlineNs) = 0;

  // Drops signals left over from an earlier run (a stop that found no loop
  // waiting), so that they cannot cut the first wait of the next run short.
  void ClearSignals() {
    while (WaitUntil(NowNs() - 1)) {
    }
  }
};

// The steady clock (pm::SteadyNowNs) with a pm::Semaphore as the signal.
std::shared_ptr<LoopClock> MakeSteadyLoopClock();

// Everything a worker loop needs from its surroundings.
struct LoopEnvironment {
  std::shared_ptr<LoopClock> clock;
  // How long Stop waits for the loop to end before giving up on the process.
  std::chrono::milliseconds stopTimeout{5000};
  // Called (after the log line) when the loop missed stopTimeout. Production
  // ends the process with status 1; a hook that returns makes Stop wait for
  // the loop without limit.
  std::function<void()> exitProcess;
};

// The steady clock, 5 seconds, std::_Exit(1).
LoopEnvironment DefaultLoopEnvironment();
// `environment` with a missing clock or exit hook taken from the defaults.
LoopEnvironment CompleteLoopEnvironment(LoopEnvironment environment);

}  // namespace TaskNDISource
