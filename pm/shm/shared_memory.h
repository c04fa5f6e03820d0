#pragma once
// Shared-memory segments through which frames reach the host.
//
// A segment is written by a source and read by the host; the two coordinate
// through the queue's token protocol, not through anything here. Declaration
// order is the virtual slot order; keep it.
//
// Threads: `inUse` and `lockCount` are atomic and may be touched from any
// thread; everything else on a segment belongs to the thread that creates,
// maps or destroys it.

#include <atomic>
#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <utility>

namespace pm {

// Segment kinds as four-character tags ('CPU.' is the bytes 2E 55 50 43 in
// memory, 'GPU.' 2E 55 50 47).
inline constexpr std::uint32_t kCpuMemoryType = 0x4350552E;
inline constexpr std::uint32_t kGpuMemoryType = 0x4750552E;

#pragma pack(push, 1)
// 24 bytes, little-endian, copied byte for byte into every queue record.
struct BufferDescriptor {
  std::uint32_t type = 0;      // kCpuMemoryType or kGpuMemoryType
  std::uint64_t reserved = 0;  // 0 for CPU segments; GPU segments: the provider's
  std::uint64_t size = 0;      // bytes as created or opened; 0 when unmapped
  std::uint32_t stride = 0;    // line stride the segment was laid out for; 1 without lines; 0 unset
};
#pragma pack(pop)
static_assert(sizeof(BufferDescriptor) == 24);

class SharedMemory {
 public:
  SharedMemory() = default;
  SharedMemory(const SharedMemory&) = delete;
  SharedMemory& operator=(const SharedMemory&) = delete;

  // Slot 0: the descriptor's size.
  virtual std::uint64_t Size() const = 0;
  // Slot 1: (data, stride before the call); see SharedCpuMemory.
  virtual std::pair<std::uint8_t*, std::int32_t> Lock() = 0;
  // Slot 2.
  virtual void Unlock() = 0;
  // Slot 3.
  virtual bool IsLocked() const = 0;
  // Slot 4: a shared owner of this segment whose last release calls `release`
  // with the segment instead of destroying it. An empty `release` makes an
  // owner that releases nothing.
  virtual std::shared_ptr<SharedMemory> MakeShared(std::function<void(SharedMemory*)> release);
  // Slot 5.
  virtual ~SharedMemory() = default;

  std::atomic<std::int32_t> inUse{0};  // outstanding holds; below 1 means free
  std::uint32_t id = 0;                // buffer id in its queue, also the record token
  BufferDescriptor descriptor;         // all zero until a subclass sets it
};

// Segments in CPU memory, mapped into this process.
class SharedCpuMemory : public SharedMemory {
 public:
  SharedCpuMemory() { descriptor.type = kCpuMemoryType; }

  // Slot 0 stays pure.
  // Slot 1: adds one to lockCount and returns Data() with the stride as it was
  // before the call; when Data() is present and the stride was 0 it becomes 1.
  std::pair<std::uint8_t*, std::int32_t> Lock() override;
  // Slot 2: one Lock fewer (an Unlock without a Lock is ignored).
  void Unlock() override;
  // Slot 3: a Lock without its Unlock is outstanding.
  bool IsLocked() const override;
  // Slot 5.
  ~SharedCpuMemory() override = default;

  // Slot 6: creates (or opens, when the name exists) the segment named `name`
  // of `size` bytes and maps it. Without a name the segment gets a private
  // unique one. Releases whatever the object held first.
  virtual bool Create(const std::optional<std::string>& name, std::uint64_t size) = 0;
  // Slot 7: maps the existing segment `name` of at least `size` bytes.
  virtual bool Open(const std::string& name, std::uint64_t size) = 0;
  // Slot 8: the segment's name as given (or made up) at Create/Open.
  virtual std::string GetName() const = 0;
  // Slot 9: kept for the layout; file-mapped segments do nothing here.
  virtual void Reserved() = 0;
  // Slot 10: the mapped bytes, null when unmapped.
  virtual std::uint8_t* Data() const = 0;

  std::atomic<std::uint32_t> lockCount{0};  // Lock calls without their Unlock
};

// A new, unmapped CPU segment of this platform's kind: SharedCpuMemoryPosix
// (POSIX named shared memory) or SharedCpuMemoryWin (a named file mapping in
// the paging file), made shared in one allocation with its counts.
std::shared_ptr<SharedCpuMemory> NewCpuSegment();

// The suffix of the names Create makes up when it gets none.
inline constexpr const char* kPrivateSegmentSuffix = ".net.quillfront.pm";

}  // namespace pm
