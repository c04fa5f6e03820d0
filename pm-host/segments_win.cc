// Named file mappings: the host's side of SharedCpuMemoryWin.
#include <windows.h>

#include "pm-host/segments.h"
#include "pm/runtime/log.h"
#include "pm/runtime/system.h"

namespace pmhost {

std::string SegmentSystemName(const std::string& name) { return name; }

void SegmentMapping::Reset() {
  if (data_ != nullptr) ::UnmapViewOfFile(data_);
  data_ = nullptr;
  size_ = 0;
}

SegmentMapping SegmentMapping::Open(const std::string& name, std::uint64_t size) {
  SegmentMapping mapping;
  if (size == 0 || size > SIZE_MAX) {
    pm::Log(pm::LogType::Normal, "", "SegmentMapping::Open: '%s' with size %llu\n", name.c_str(),
            static_cast<unsigned long long>(size));
    return mapping;
  }
  HANDLE file = ::OpenFileMappingA(FILE_MAP_READ, FALSE, name.c_str());
  if (file == nullptr) {
    pm::Log(pm::LogType::Normal, "", "SegmentMapping::Open: cannot open '%s': %s\n", name.c_str(),
            pm::SystemErrorText(static_cast<int>(::GetLastError())).c_str());
    return mapping;
  }
  // A view larger than the mapping fails here (reading past its end is
  // refused, never a fault later). The view keeps the mapping alive.
  const void* data = ::MapViewOfFile(file, FILE_MAP_READ, 0, 0, static_cast<SIZE_T>(size));
  const DWORD error = ::GetLastError();
  ::CloseHandle(file);
  if (data == nullptr) {
    pm::Log(pm::LogType::Normal, "", "SegmentMapping::Open: cannot map %llu bytes of '%s': %s\n",
            static_cast<unsigned long long>(size), name.c_str(), pm::SystemErrorText(static_cast<int>(error)).c_str());
    return mapping;
  }
  mapping.data_ = static_cast<const std::uint8_t*>(data);
  mapping.size_ = size;
  return mapping;
}

// The system removes a mapping when its last handle closes, also when the
// runner crashed: nothing is ever left behind to count or remove.
int CountSegments(const std::string&, const std::string&) { return 0; }
int RemoveSegments(const std::string&, const std::string&) { return 0; }

}  // namespace pmhost
