#pragma once
// Looks at a CPU segment from outside the code under test, through the
// system: the file in /dev/shm (POSIX), the named file mapping (Windows).
#include <cstdint>
#include <string>

#if defined(_WIN32)
#include <windows.h>
#else
#include <sys/stat.h>
#endif

namespace pmtest {

// The bytes the system holds for the segment `name` (on Windows whole pages,
// as the mapping's view reports them); 0 when there is no such segment.
inline std::uint64_t SegmentBytes(const std::string& name) {
#if defined(_WIN32)
  HANDLE mapping = ::OpenFileMappingA(FILE_MAP_READ, FALSE, name.c_str());
  if (mapping == nullptr) return 0;
  void* view = ::MapViewOfFile(mapping, FILE_MAP_READ, 0, 0, 0);
  MEMORY_BASIC_INFORMATION info{};
  const std::uint64_t bytes = view != nullptr && ::VirtualQuery(view, &info, sizeof info) != 0 ? info.RegionSize : 0;
  if (view != nullptr) ::UnmapViewOfFile(view);
  ::CloseHandle(mapping);
  return bytes;
#else
  struct stat st {};
  if (::stat(("/dev/shm/" + name).c_str(), &st) != 0) return 0;
  return static_cast<std::uint64_t>(st.st_size);
#endif
}

inline bool SegmentExists(const std::string& name) {
#if defined(_WIN32)
  return SegmentBytes(name) > 0;
#else
  struct stat st {};
  return ::stat(("/dev/shm/" + name).c_str(), &st) == 0;
#endif
}

}  // namespace pmtest
