#pragma once
// One helper for system calls: retries EINTR, and a uniform errno text for
// log lines.
#include <cerrno>
#include <string>

namespace pm {

// Calls f() again while it fails with -1 and errno EINTR; returns its result.
template <class F>
auto RetryEintr(F&& f) -> decltype(f()) {
  for (;;) {
    auto r = f();
    if (!(r == -1 && errno == EINTR)) return r;
  }
}

// "<strerror> (errno N)".
std::string ErrnoText(int err);

// Writes the whole text to standard error: one write() when the pipe takes
// it (so lines from several threads do not mix), the rest after a short
// write, EINTR retried; gives up silently when stderr is gone.
void WriteToStderr(const char* text);

}  // namespace pm
