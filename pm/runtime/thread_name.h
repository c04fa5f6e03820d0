#pragma once
// Thread names for debuggers and `ps -L`: pthread_setname_np on Linux, which
// allows 15 bytes (longer names are cut at a character boundary);
// SetThreadDescription on Windows (resolved in kernel32 at run time; names
// are silently not set where it is missing). Names must be valid UTF-8:
// otherwise std::range_error propagates, as from Utf8ToUtf16.
#include <string>

namespace pm {

void SetThreadName(const std::string& name);
void ClearThreadName();

// The calling thread's current name (for tests and diagnostics).
std::string CurrentThreadName();

}  // namespace pm
