#pragma once
// GPU segments and the process-wide manager that makes them.
//
// The task has no manager of its own: whatever provides GPU memory shared with
// the host registers a SharedGpuMemoryManager in the context registry under
// "SharedGpuMemoryManager" before a queue starts. Without one every segment
// is a CPU segment.

#include <memory>

#include "pm/runtime/context.h"
#include "pm/shm/formats.h"
#include "pm/shm/shared_memory.h"

namespace pm {

// A segment in GPU memory shared with the host; its descriptor type is
// kGpuMemoryType. Slots 0 to 5 are SharedMemory's.
class SharedGpuMemory : public SharedMemory {
 public:
  SharedGpuMemory() { descriptor.type = kGpuMemoryType; }
  ~SharedGpuMemory() override = default;

  // Slots 6 and 7 belong to the provider (how it shares the memory with the
  // host); they keep Format in slot 8 and do nothing by default.
  virtual void ProviderReserved6() {}
  virtual void ProviderReserved7() {}
  // Slot 8: the format the segment was made for; the queue compares it when
  // it reuses segments.
  virtual VideoFormat Format() const = 0;
};

class SharedGpuMemoryManager : public Context::SingletonBase {
 public:
  // Slot 0 is the destructor.
  ~SharedGpuMemoryManager() override = default;
  // Slot 1: a new GPU segment for `format`, or empty when none can be made.
  // The caller gives it its id and first hold. Which thread calls this: a
  // source's frame thread, without the queue's lock held.
  virtual std::shared_ptr<SharedMemory> Allocate(const VideoFormat& format) = 0;
};

inline constexpr const char* kSharedGpuMemoryManagerKey = "SharedGpuMemoryManager";

// The registered manager, or empty: when nothing is registered under the key
// (an empty entry is left in the registry) or the registered singleton is of
// another type. Holds the registry lock for the lookup.
std::shared_ptr<SharedGpuMemoryManager> GetSharedGpuMemoryManager();

}  // namespace pm
