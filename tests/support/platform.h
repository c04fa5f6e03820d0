#pragma once
// What the tests expect of the system they run on, where Linux and Windows
// (under Wine) differ by design.
namespace pmtest {

#if defined(_WIN32)
// A library every process has, and a function in it.
inline constexpr const char* kSystemLibrary = "kernel32.dll";
inline constexpr const char* kSystemFunction = "lstrlenA";
inline constexpr const char* kMissingLibrary = "no-such-library.dll";
// SetThreadDescription keeps whole names.
inline constexpr bool kThreadNamesCutTo15Bytes = false;
#else
inline constexpr const char* kSystemLibrary = "libc.so.6";
inline constexpr const char* kSystemFunction = "strlen";
inline constexpr const char* kMissingLibrary = "libno-such-library.so";
// pthread_setname_np takes 15 bytes.
inline constexpr bool kThreadNamesCutTo15Bytes = true;
#endif

}  // namespace pmtest
