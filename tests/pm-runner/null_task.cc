// A task module whose factory gives no task, as when its runtime is unusable.
#include "pm/runtime/log.h"
#include "pm/task/task.h"

extern "C" __attribute__((visibility("default"))) pm::TaskBase* pmTask_Factory() {
  pm::LogText("", "NullTask: runtime unusable\n");
  return nullptr;
}
