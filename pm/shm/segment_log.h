#pragma once
// The log lines of CPU segments. The texts keep the Windows class name on
// every platform: log readers and tooling match on them.
namespace pm::segment_log {

inline constexpr const char* kCreateFailed = "SharedCpuMemoryWin::Create : Could not create '%s' (%d).";
inline constexpr const char* kOpenFailed = "SharedCpuMemoryWin::Create : Could not open '%s' (%d).";
inline constexpr const char* kMapFailed = "SharedCpuMemoryWin::MapFile cannot map view of file (%d).\n";

}  // namespace pm::segment_log
