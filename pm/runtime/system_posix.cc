#include <dlfcn.h>
#include <unistd.h>

#include <cstring>

#include "pm/runtime/syscall.h"
#include "pm/runtime/system.h"

namespace pm {

void* FindProgramExport(const char* name) { return ::dlsym(RTLD_DEFAULT, name); }

void WriteDefaultLogLine(const char* line) {
  // One write, so lines from several threads do not mix.
  [[maybe_unused]] ssize_t written = ::write(STDERR_FILENO, line, std::strlen(line));
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

std::string SystemErrorText(int code) { return ErrnoText(code); }

int CurrentProcessId() { return static_cast<int>(::getpid()); }

std::string HostName() {
  char host[256] = {};
  if (::gethostname(host, sizeof host - 1) != 0 || host[0] == '\0') return "localhost";
  return host;
}

}  // namespace pm
