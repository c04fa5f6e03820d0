#include "pm/shm/shared_cpu_memory_posix.h"

#include <fcntl.h>
#include <sys/mman.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstdint>
#include <limits>

#include "pm/runtime/ids.h"
#include "pm/runtime/log.h"
#include "pm/runtime/syscall.h"
#include "pm/shm/segment_log.h"

namespace pm {
namespace {

using segment_log::kCreateFailed;
using segment_log::kMapFailed;
using segment_log::kOpenFailed;

constexpr std::uint64_t kMaxSize = static_cast<std::uint64_t>(std::numeric_limits<off_t>::max());

}  // namespace

std::shared_ptr<SharedCpuMemory> NewCpuSegment() { return SharedCpuMemoryPosix::New(); }

SharedCpuMemoryPosix::~SharedCpuMemoryPosix() {
  Unmap();
  name_.clear();
}

bool SharedCpuMemoryPosix::Create(const std::optional<std::string>& name, std::uint64_t size) {
  Unmap();
  descriptor.size = size;
  name_ = name ? *name : NewUuidString() + kPrivateNameSuffix;
  const std::string systemName = SystemName();

  if (size > kMaxSize) {
    Log(LogType::Normal, "", kCreateFailed, name_.c_str(), EFBIG);
    Unmap();
    return false;
  }

  // Exclusive first, so that this object knows whether the name is its own.
  fd_ = RetryEintr([&] { return ::shm_open(systemName.c_str(), O_CREAT | O_EXCL | O_RDWR, 0600); });
  if (fd_ >= 0) {
    ownsName_ = true;
  } else if (errno == EEXIST) {
    // The name exists: open it instead. Should it vanish in between, the
    // exclusive create is tried once more.
    fd_ = RetryEintr([&] { return ::shm_open(systemName.c_str(), O_RDWR, 0600); });
    if (fd_ < 0 && errno == ENOENT) {
      fd_ = RetryEintr([&] { return ::shm_open(systemName.c_str(), O_CREAT | O_EXCL | O_RDWR, 0600); });
      ownsName_ = fd_ >= 0;
    }
  }
  if (fd_ < 0) {
    Log(LogType::Normal, "", kCreateFailed, name_.c_str(), errno);
    Unmap();
    return false;
  }

  // Grows a smaller object to `size` and reserves its pages; never shrinks.
  if (size > 0) {
    int err;
    do {
      err = ::posix_fallocate(fd_, 0, static_cast<off_t>(size));
    } while (err == EINTR);
    if (err != 0) {
      Log(LogType::Normal, "", kCreateFailed, name_.c_str(), err);
      Unmap();
      return false;
    }
  }
  return MapFile();
}

bool SharedCpuMemoryPosix::Open(const std::string& name, std::uint64_t size) {
  Unmap();
  name_ = name;
  descriptor.size = size;
  const std::string systemName = SystemName();
  fd_ = RetryEintr([&] { return ::shm_open(systemName.c_str(), O_RDWR, 0600); });
  if (fd_ < 0) {
    Log(LogType::Normal, "", kOpenFailed, name_.c_str(), errno);
    Unmap();
    return false;
  }
  return MapFile();
}

bool SharedCpuMemoryPosix::MapFile() {
  const std::uint64_t size = descriptor.size;
  int err = 0;
  struct stat info {};
  if (::fstat(fd_, &info) != 0) {
    err = errno;
  } else if (size > kMaxSize || static_cast<std::uint64_t>(info.st_size) < size) {
    // Bytes past the end of the object would fault on first touch.
    err = EINVAL;
  } else {
    void* view = ::mmap(nullptr, static_cast<std::size_t>(size), PROT_READ | PROT_WRITE, MAP_SHARED, fd_, 0);
    if (view == MAP_FAILED) {
      err = errno;
    } else {
      view_ = static_cast<std::uint8_t*>(view);
      mappedBytes_ = static_cast<std::size_t>(size);
    }
  }
  if (err != 0) {
    Log(LogType::Normal, "", kMapFailed, err);
    Unmap();
    return false;
  }
  // The mapping keeps the memory; the descriptor is not needed any more.
  ::close(fd_);
  fd_ = -1;
  return true;
}

void SharedCpuMemoryPosix::Unmap() {
  if (view_ != nullptr) {
    ::munmap(view_, mappedBytes_);
    view_ = nullptr;
    mappedBytes_ = 0;
  }
  if (fd_ >= 0) {
    ::close(fd_);
    fd_ = -1;
  }
  if (ownsName_) {
    ::shm_unlink(SystemName().c_str());
    ownsName_ = false;
  }
  descriptor.size = 0;
}

}  // namespace pm
