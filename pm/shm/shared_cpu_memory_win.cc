#include "pm/shm/shared_cpu_memory_win.h"

#include <windows.h>

#include <cstdint>

#include "pm/runtime/ids.h"
#include "pm/runtime/log.h"
#include "pm/shm/segment_log.h"

namespace pm {

std::shared_ptr<SharedCpuMemory> NewCpuSegment() { return SharedCpuMemoryWin::New(); }

SharedCpuMemoryWin::~SharedCpuMemoryWin() {
  Unmap();
  name_.clear();
}

bool SharedCpuMemoryWin::Create(const std::optional<std::string>& name, std::uint64_t size) {
  Unmap();
  descriptor.size = size;
  name_ = name ? *name : NewUuidString() + kPrivateSegmentSuffix;
  // An existing mapping of this name is opened instead (error 183 is then
  // the system's note, not a failure).
  mapping_ = ::CreateFileMappingA(INVALID_HANDLE_VALUE, nullptr, PAGE_READWRITE, static_cast<DWORD>(size >> 32),
                                  static_cast<DWORD>(size & 0xFFFFFFFFu), name_.c_str());
  if (mapping_ == nullptr) {
    Log(LogType::Normal, "", segment_log::kCreateFailed, name_.c_str(), static_cast<int>(::GetLastError()));
    Unmap();
    return false;
  }
  return MapFile();
}

bool SharedCpuMemoryWin::Open(const std::string& name, std::uint64_t size) {
  Unmap();
  name_ = name;
  descriptor.size = size;
  mapping_ = ::OpenFileMappingA(FILE_MAP_ALL_ACCESS, FALSE, name_.c_str());
  if (mapping_ == nullptr) {
    Log(LogType::Normal, "", segment_log::kOpenFailed, name_.c_str(), static_cast<int>(::GetLastError()));
    Unmap();
    return false;
  }
  return MapFile();
}

bool SharedCpuMemoryWin::MapFile() {
  const std::uint64_t size = descriptor.size;
  void* view = size > SIZE_MAX ? nullptr : ::MapViewOfFile(mapping_, FILE_MAP_ALL_ACCESS, 0, 0, static_cast<SIZE_T>(size));
  if (view == nullptr) {
    Log(LogType::Normal, "", segment_log::kMapFailed, static_cast<int>(::GetLastError()));
    Unmap();
    return false;
  }
  view_ = static_cast<std::uint8_t*>(view);
  return true;
}

void SharedCpuMemoryWin::Unmap() {
  if (view_ != nullptr) {
    ::UnmapViewOfFile(view_);
    view_ = nullptr;
  }
  if (mapping_ != nullptr) {
    ::CloseHandle(mapping_);
    mapping_ = nullptr;
  }
  descriptor.size = 0;
}

}  // namespace pm
