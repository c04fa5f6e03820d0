#include "pm/runtime/syscall.h"

#include <unistd.h>

#include <cstring>

namespace pm {

std::string ErrnoText(int err) {
  char buffer[128];
  const char* text = ::strerror_r(err, buffer, sizeof buffer);  // GNU form
  return std::string(text) + " (errno " + std::to_string(err) + ")";
}

void WriteToStderr(const char* text) {
  std::size_t length = std::strlen(text);
  while (length > 0) {
    const ssize_t n = RetryEintr([&] { return ::write(STDERR_FILENO, text, length); });
    if (n <= 0) return;
    text += n;
    length -= static_cast<std::size_t>(n);
  }
}

}  // namespace pm
