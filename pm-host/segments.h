#pragma once
// The host's view of a queue's shared-memory segments: read-only mappings of
// memoryBase + id, cached per id, and the removal of segments that a crashed
// runner left behind. The system calls are one file per platform:
// segments_posix.cc (POSIX named shared memory "/" + memoryBase + id) and
// segments_win.cc (named file mappings memoryBase + id, which the system
// removes with their last handle, so nothing is ever left to remove).
//
// Threads: a SegmentCache is shared by the queue's reader thread (Map) and the
// dispatcher's receive thread (Forget on "::delete_memory"). A mapping handed
// out by Map stays valid for as long as the caller holds it, even when the id
// is forgotten or remapped meanwhile.
// Lock: lock_ guards mappings_ (alone; nothing is called with it held except
// the system calls that open and map).

#include <cstddef>
#include <cstdint>
#include <map>
#include <memory>
#include <mutex>
#include <string>

namespace pmhost {

// One read-only mapping of a named segment; move-only, unmapped on
// destruction.
class SegmentMapping {
 public:
  SegmentMapping() = default;
  ~SegmentMapping();
  SegmentMapping(SegmentMapping&& other) noexcept;
  SegmentMapping& operator=(SegmentMapping&& other) noexcept;
  SegmentMapping(const SegmentMapping&) = delete;
  SegmentMapping& operator=(const SegmentMapping&) = delete;

  // Maps `size` bytes of the segment whose system name is `name`
  // (SegmentSystemName). Empty on failure (logged): no such segment, or one
  // smaller than `size`.
  static SegmentMapping Open(const std::string& name, std::uint64_t size);

  const std::uint8_t* Data() const { return data_; }
  std::uint64_t Size() const { return size_; }
  explicit operator bool() const { return data_ != nullptr; }

 private:
  void Reset();
  const std::uint8_t* data_ = nullptr;
  std::uint64_t size_ = 0;
};

// True when `memoryBase` can name segments: 1..200 bytes, no '/', no '\',
// no NUL.
bool ValidMemoryBase(const std::string& memoryBase);

// The system's name of the segment `name` (memoryBase + id): "/" + name for
// POSIX shared memory, the name itself for a Windows file mapping.
std::string SegmentSystemName(const std::string& name);

class SegmentCache {
 public:
  explicit SegmentCache(std::string memoryBase) : memoryBase_(std::move(memoryBase)) {}

  // The mapping of segment `id` of `size` bytes: the cached one when its size
  // matches, else a new one (replacing the cached one). Null on failure
  // (logged once per call).
  std::shared_ptr<const SegmentMapping> Map(std::uint32_t id, std::uint64_t size);
  // Drops the cached mapping of `id` (holders keep theirs).
  void Forget(std::uint32_t id);
  void Clear();
  std::size_t Count() const;
  const std::string& MemoryBase() const { return memoryBase_; }

 private:
  const std::string memoryBase_;
  mutable std::mutex lock_;  // guards mappings_
  std::map<std::uint32_t, std::shared_ptr<const SegmentMapping>> mappings_;
};

// Removes every segment named memoryBase + decimal id from /dev/shm (what a
// runner that crashed leaves behind; nothing on Windows). Returns how many were removed. Does
// nothing for a memory base that cannot name segments. `directory` is for
// tests; segments are always removed with shm_unlink.
int RemoveSegments(const std::string& memoryBase, const std::string& directory = "/dev/shm");
// How many segments named memoryBase + decimal id exist.
int CountSegments(const std::string& memoryBase, const std::string& directory = "/dev/shm");

}  // namespace pmhost
