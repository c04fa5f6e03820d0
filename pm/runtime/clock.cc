#include "pm/runtime/clock.h"

#include <thread>

#include "pm/runtime/semaphore.h"

namespace pm {
namespace {

class SteadyClock final : public Clock {
 public:
  std::int64_t NowNs() override { return SteadyNowNs(); }
  void Signal() override { semaphore_.Signal(); }
  bool WaitUntil(std::int64_t deadlineNs) override { return semaphore_.WaitUntil(deadlineNs); }
  void Sleep(std::int64_t nanos) override { std::this_thread::sleep_for(std::chrono::nanoseconds(nanos)); }

 private:
  Semaphore semaphore_;
};

}  // namespace

std::shared_ptr<Clock> MakeSteadyClock() { return std::make_shared<SteadyClock>(); }

}  // namespace pm
