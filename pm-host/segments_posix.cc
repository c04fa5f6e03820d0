// POSIX named shared memory: the host's side of SharedCpuMemoryPosix.
#include <dirent.h>
#include <fcntl.h>
#include <sys/mman.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <vector>

#include "pm-host/segments.h"
#include "pm/runtime/log.h"
#include "pm/runtime/syscall.h"

namespace pmhost {

std::string SegmentSystemName(const std::string& name) { return "/" + name; }

void SegmentMapping::Reset() {
  if (data_ != nullptr) ::munmap(const_cast<std::uint8_t*>(data_), size_);
  data_ = nullptr;
  size_ = 0;
}

SegmentMapping SegmentMapping::Open(const std::string& name, std::uint64_t size) {
  SegmentMapping mapping;
  if (size == 0) {
    pm::Log(pm::LogType::Normal, "", "SegmentMapping::Open: '%s' with size 0\n", name.c_str());
    return mapping;
  }
  const int fd = pm::RetryEintr([&] { return ::shm_open(name.c_str(), O_RDONLY | O_CLOEXEC, 0); });
  if (fd < 0) {
    pm::Log(pm::LogType::Normal, "", "SegmentMapping::Open: cannot open '%s': %s\n", name.c_str(),
            pm::ErrnoText(errno).c_str());
    return mapping;
  }
  struct stat info {};
  if (::fstat(fd, &info) != 0) {
    pm::Log(pm::LogType::Normal, "", "SegmentMapping::Open: cannot stat '%s': %s\n", name.c_str(),
            pm::ErrnoText(errno).c_str());
    ::close(fd);
    return mapping;
  }
  // Reading past the end of the file would raise SIGBUS: a segment smaller
  // than the record says is refused.
  if (info.st_size < 0 || static_cast<std::uint64_t>(info.st_size) < size) {
    pm::Log(pm::LogType::Normal, "", "SegmentMapping::Open: '%s' has %lld bytes, the record says %llu\n",
            name.c_str(), static_cast<long long>(info.st_size), static_cast<unsigned long long>(size));
    ::close(fd);
    return mapping;
  }
  void* data = ::mmap(nullptr, size, PROT_READ, MAP_SHARED, fd, 0);
  const int err = errno;
  ::close(fd);
  if (data == MAP_FAILED) {
    pm::Log(pm::LogType::Normal, "", "SegmentMapping::Open: cannot map '%s': %s\n", name.c_str(),
            pm::ErrnoText(err).c_str());
    return mapping;
  }
  mapping.data_ = static_cast<const std::uint8_t*>(data);
  mapping.size_ = size;
  return mapping;
}

namespace {

// The names in `directory` that are memoryBase followed by digits.
std::vector<std::string> SegmentNames(const std::string& memoryBase, const std::string& directory) {
  std::vector<std::string> names;
  if (!ValidMemoryBase(memoryBase)) return names;
  DIR* dir = ::opendir(directory.c_str());
  if (dir == nullptr) return names;
  while (const dirent* entry = ::readdir(dir)) {
    const std::string name = entry->d_name;
    if (name.size() <= memoryBase.size() || name.compare(0, memoryBase.size(), memoryBase) != 0) continue;
    bool digits = true;
    for (std::size_t i = memoryBase.size(); i < name.size(); ++i) digits = digits && name[i] >= '0' && name[i] <= '9';
    if (digits) names.push_back(name);
  }
  ::closedir(dir);
  return names;
}

}  // namespace

int CountSegments(const std::string& memoryBase, const std::string& directory) {
  return static_cast<int>(SegmentNames(memoryBase, directory).size());
}

int RemoveSegments(const std::string& memoryBase, const std::string& directory) {
  int removed = 0;
  for (const std::string& name : SegmentNames(memoryBase, directory)) {
    if (::shm_unlink(("/" + name).c_str()) == 0) {
      ++removed;
    } else if (errno != ENOENT) {
      pm::Log(pm::LogType::Normal, "", "RemoveSegments: cannot remove '%s': %s\n", name.c_str(),
              pm::ErrnoText(errno).c_str());
    }
  }
  return removed;
}

}  // namespace pmhost
