#include "taskndisource/loop_clock.h"

#include <cstdlib>

#include "pm/runtime/clock.h"
#include "pm/runtime/semaphore.h"

namespace TaskNDISource {
namespace {

class SteadyLoopClock final : public LoopClock {
 public:
  std::int64_t NowNs() override { return pm::SteadyNowNs(); }
  void Signal() override { semaphore_.Signal(); }
  bool WaitUntil(std::int64_t deadlineNs) override { return semaphore_.WaitUntil(deadlineNs); }

 private:
  pm::Semaphore semaphore_;
};

}  // namespace

std::shared_ptr<LoopClock> MakeSteadyLoopClock() { return std::make_shared<SteadyLoopClock>(); }

LoopEnvironment DefaultLoopEnvironment() {
  LoopEnvironment env;
  env.clock = MakeSteadyLoopClock();
  env.stopTimeout = std::chrono::milliseconds(5000);
  env.exitProcess = [] { std::_Exit(1); };
  return env;
}

LoopEnvironment CompleteLoopEnvironment(LoopEnvironment env) {
  if (env.clock && env.exitProcess) return env;
  LoopEnvironment defaults = DefaultLoopEnvironment();
  if (!env.clock) env.clock = defaults.clock;
  if (!env.exitProcess) env.exitProcess = defaults.exitProcess;
  return env;
}

}  // namespace TaskNDISource
