#include "pm/shm/shared_memory.h"

namespace pm {

std::shared_ptr<SharedMemory> SharedMemory::MakeShared(std::function<void(SharedMemory*)> release) {
  return std::shared_ptr<SharedMemory>(this, [release = std::move(release)](SharedMemory* segment) {
    if (release) release(segment);
  });
}

std::pair<std::uint8_t*, std::int32_t> SharedCpuMemory::Lock() {
  lockCount.fetch_add(1);
  std::uint8_t* data = Data();
  const std::int32_t stride = static_cast<std::int32_t>(descriptor.stride);
  if (data != nullptr && descriptor.stride == 0) descriptor.stride = 1;
  return {data, stride};
}

void SharedCpuMemory::Unlock() {
  // Never below 0: a stray Unlock must not make the segment look locked for
  // good (a wrapped count would read as 4 billion outstanding mappings).
  std::uint32_t count = lockCount.load();
  while (count != 0 && !lockCount.compare_exchange_weak(count, count - 1)) {
  }
}

bool SharedCpuMemory::IsLocked() const { return lockCount.load() != 0; }

}  // namespace pm
