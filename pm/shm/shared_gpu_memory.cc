#include "pm/shm/shared_gpu_memory.h"

namespace pm {

std::shared_ptr<SharedGpuMemoryManager> GetSharedGpuMemoryManager() {
  // No creator: the task has no manager of its own to put in an empty entry.
  const std::shared_ptr<Context::SingletonBase> entry = FindSingleton(kSharedGpuMemoryManagerKey, nullptr);
  return std::dynamic_pointer_cast<SharedGpuMemoryManager>(entry);
}

}  // namespace pm
