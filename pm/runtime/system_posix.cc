#include <dlfcn.h>
#include <signal.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>

#include "pm/runtime/proc_stat.h"
#include "pm/runtime/syscall.h"
#include "pm/runtime/system.h"

namespace pm {

void* FindProgramExport(const char* name) { return ::dlsym(RTLD_DEFAULT, name); }

void WriteDefaultLogLine(const char* line) { WriteToStderr(line); }

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

bool ProcessAlive(int pid) {
  if (pid <= 0) return false;
  if (::kill(pid, 0) != 0 && errno == ESRCH) return false;
  // A killed child that its parent has not reaped yet still answers kill().
  ProcStat stat;
  return !(ReadProcStat(pid, &stat) && (stat.state == 'Z' || stat.state == 'X'));
}

double ProcessCpuSeconds(int pid) {
  ProcStat stat;
  const long ticks = ::sysconf(_SC_CLK_TCK);
  if (!ReadProcStat(pid, &stat) || ticks <= 0) return 0;
  return static_cast<double>(stat.userTicks + stat.systemTicks) / static_cast<double>(ticks);
}

std::string HostName() {
  char host[256] = {};
  if (::gethostname(host, sizeof host - 1) != 0 || host[0] == '\0') return "localhost";
  return host;
}

}  // namespace pm
