#pragma once
// A GPU memory manager that a runner could register in the context: it makes
// segments that hold no memory (size 1, nothing to lock) and counts them.
#include <cstdint>
#include <memory>
#include <utility>

#include "pm/shm/shared_gpu_memory.h"

namespace pmtest {

class FakeGpuSegment : public pm::SharedGpuMemory {
 public:
  explicit FakeGpuSegment(const pm::VideoFormat& f) : format_(f) { descriptor.size = 1; }
  std::uint64_t Size() const override { return descriptor.size; }
  std::pair<std::uint8_t*, std::int32_t> Lock() override { return {nullptr, 0}; }
  void Unlock() override {}
  bool IsLocked() const override { return false; }
  pm::VideoFormat Format() const override { return format_; }

 private:
  pm::VideoFormat format_;
};

class FakeGpuManager : public pm::SharedGpuMemoryManager {
 public:
  std::shared_ptr<pm::SharedMemory> Allocate(const pm::VideoFormat& format) override {
    ++made;
    return std::make_shared<FakeGpuSegment>(format);
  }
  int made = 0;
};

}  // namespace pmtest
