// The GPU memory manager lookup in the context's registry. (A registered
// manager making the segments of a queue is tested with the queue.)
#include "pm/shm/shared_gpu_memory.h"

#include <gtest/gtest.h>

#include "fake_gpu.h"

namespace {

class OtherSingleton : public pm::Context::SingletonBase {};

// Nothing registered gives no manager and leaves an empty entry; a singleton
// of another type under the key is no manager either.
TEST(GpuManagerLookup, FindsOnlyAManagerRegisteredUnderItsKey) {
  const auto manager = std::make_shared<pmtest::FakeGpuManager>();
  const std::shared_ptr<pm::Context::SingletonBase> cases[] = {nullptr, std::make_shared<OtherSingleton>(), manager};
  pm::Context* context = pm::GetContext();
  for (const auto& registered : cases) {
    {
      std::lock_guard<std::mutex> guard(context->registryLock);
      context->registry.erase("SharedGpuMemoryManager");
      if (registered) context->registry["SharedGpuMemoryManager"] = registered;
    }
    const std::shared_ptr<pm::SharedGpuMemoryManager> found = pm::GetSharedGpuMemoryManager();
    EXPECT_EQ(found, registered == manager ? manager : nullptr);
    std::lock_guard<std::mutex> guard(context->registryLock);
    EXPECT_EQ(context->registry.count("SharedGpuMemoryManager"), 1u);
    context->registry.erase("SharedGpuMemoryManager");
  }
}

}  // namespace
