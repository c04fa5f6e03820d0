#pragma once
// Thread names for debuggers and `ps -L`. Linux allows 15 bytes; longer names
// are cut there (at a character boundary). Names must be valid UTF-8:
// otherwise std::range_error propagates, as from Utf8ToUtf16.
#include <string>

namespace pm {

void SetThreadName(const std::string& name);
void ClearThreadName();

// The calling thread's current name (for tests and diagnostics).
std::string CurrentThreadName();

}  // namespace pm
