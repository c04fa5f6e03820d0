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

}  // namespace pm
