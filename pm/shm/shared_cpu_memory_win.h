#pragma once
// A CPU segment backed by a named file mapping in the system paging file.
//
// System name: the segment's name as given (memoryBase + id for the queue's
// segments; the host opens the same name). Create uses CreateFileMappingA
// on the paging file, read-write, with the size split into its high and low
// 32 bits; Open uses OpenFileMappingA for full access. Either maps the whole
// size from offset 0.
//
// Lifetime of the name: the system removes the mapping when the last handle
// to it in any process closes, so a mapping the host still holds stays
// valid after this object lets go, and nothing is left behind when every
// process has ended (there is no unlink).
//
// Create on a name that already exists opens that mapping instead (the
// system's behaviour). Unlike POSIX shared memory a mapping cannot grow:
// when the existing one is smaller than `size`, mapping the view fails
// (error 5) and Create fails with the MapFile line. A size of 0 or a name
// with a backslash fails in CreateFileMappingA (errors 87 and 3).
//
// Handles: the mapping handle is kept for the life of the view (closing it
// early would let the name vanish while the host has not opened it yet).
#include <memory>
#include <optional>
#include <string>

#include "pm/shm/shared_memory.h"

namespace pm {

class SharedCpuMemoryWin final : public SharedCpuMemory {
 public:
  SharedCpuMemoryWin() = default;
  ~SharedCpuMemoryWin() override;

  // Objects are made shared, in one allocation with their counts.
  static std::shared_ptr<SharedCpuMemoryWin> New() { return std::make_shared<SharedCpuMemoryWin>(); }

  std::uint64_t Size() const override { return descriptor.size; }
  bool Create(const std::optional<std::string>& name, std::uint64_t size) override;
  bool Open(const std::string& name, std::uint64_t size) override;
  std::string GetName() const override { return name_; }
  void Reserved() override {}
  std::uint8_t* Data() const override { return view_; }

 private:
  bool MapFile();
  void Unmap();

  std::string name_;
  void* mapping_ = nullptr;        // the file mapping's handle, null when closed
  std::uint8_t* view_ = nullptr;   // the mapped view, null when unmapped
};

}  // namespace pm
