#include "taskndisource/loop_environment.h"

#include <cstdlib>

namespace TaskNDISource {

LoopEnvironment DefaultLoopEnvironment() {
  LoopEnvironment env;
  env.clock = pm::MakeSteadyClock();
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
