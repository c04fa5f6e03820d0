#pragma once
// What a worker loop (the receiver loop of a source, the scan loop of
// discovery) needs from its surroundings: its clock and wake-up signal
// (pm::Clock), and what happens when the loop does not end in time.
// Production uses the steady clock, a 5-second stop deadline and
// std::_Exit(1); tests hand in a clock they advance by hand and an exit hook
// that records instead of ending the process.

#include <chrono>
#include <functional>
#include <memory>

#include "pm/runtime/clock.h"

namespace TaskNDISource {

struct LoopEnvironment {
  // The loop's own clock: its thread waits on it, Stop signals it.
  std::shared_ptr<pm::Clock> clock;
  // How long Stop waits for the loop to end before giving up on the process.
  std::chrono::milliseconds stopTimeout{5000};
  // Called (after the log line) when the loop missed stopTimeout. Production
  // ends the process with status 1; a hook that returns makes Stop wait for
  // the loop without limit.
  std::function<void()> exitProcess;
};

// A steady clock of its own, 5 seconds, std::_Exit(1).
LoopEnvironment DefaultLoopEnvironment();
// `environment` with a missing clock or exit hook taken from the defaults.
LoopEnvironment CompleteLoopEnvironment(LoopEnvironment environment);

}  // namespace TaskNDISource
