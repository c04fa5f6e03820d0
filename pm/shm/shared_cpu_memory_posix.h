#pragma once
// A CPU segment backed by POSIX named shared memory (/dev/shm on Linux).
//
// System name: "/" followed by the segment's name (the host prepends the same
// slash to memoryBase + id). Created with shm_open(O_CREAT|O_RDWR, 0600),
// sized, and mapped shared read-write from offset 0.
//
// Ownership of the name: the object that created the name unlinks it when it
// releases the mapping (destruction, re-Create, a failed map). A mapping held
// by another process stays valid after the unlink; only the name goes.
//
// Create on a name that already exists opens that object instead (the object
// that created it keeps the duty to unlink it), grows it to `size` bytes when
// it is smaller, and never shrinks it: a reader mapping the larger size keeps
// all its bytes. The mapping and the descriptor's size are `size` bytes.
//
// Backing: Create reserves the segment's pages (posix_fallocate), so a full
// shared-memory filesystem is a failed Create with its log line, never a
// SIGBUS on the first write into the segment.
//
// Handles: the descriptor returned by shm_open is closed as soon as the
// mapping exists (the mapping does not need it), so thousands of segments do
// not use up the process's file descriptors. A failed Create or Open leaves no
// descriptor open, no mapping and size 0.
//
// The log lines keep the texts "SharedCpuMemoryWin::..." unchanged on every
// platform: log readers and tooling match on them.

#include <memory>
#include <optional>
#include <string>

#include "pm/shm/shared_memory.h"

namespace pm {

class SharedCpuMemoryPosix final : public SharedCpuMemory {
 public:
  SharedCpuMemoryPosix() = default;
  ~SharedCpuMemoryPosix() override;

  // Objects are made shared, in one allocation with their counts.
  static std::shared_ptr<SharedCpuMemoryPosix> New() { return std::make_shared<SharedCpuMemoryPosix>(); }

  std::uint64_t Size() const override { return descriptor.size; }
  bool Create(const std::optional<std::string>& name, std::uint64_t size) override;
  bool Open(const std::string& name, std::uint64_t size) override;
  std::string GetName() const override { return name_; }
  void Reserved() override {}
  std::uint8_t* Data() const override { return view_; }

  // The name as the system knows it: "/" + GetName().
  std::string SystemName() const { return "/" + name_; }
  // True while this object is responsible for unlinking its name.
  bool OwnsName() const { return ownsName_; }

  // The suffix of names made up when Create gets none.
  static constexpr const char* kPrivateNameSuffix = kPrivateSegmentSuffix;

 private:
  bool MapFile();
  void Unmap();

  std::string name_;
  int fd_ = -1;                  // open only between shm_open and mmap
  std::uint8_t* view_ = nullptr; // the mapping, null when unmapped
  std::size_t mappedBytes_ = 0;  // length given to mmap
  bool ownsName_ = false;        // this object created name_ and unlinks it
};

}  // namespace pm
