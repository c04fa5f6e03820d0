#include "pm/runtime/proc_stat.h"

#include <dirent.h>
#include <fcntl.h>
#include <unistd.h>

#include <cstdio>
#include <cstdlib>

#include "pm/runtime/syscall.h"

namespace pm {

bool ReadProcStat(pid_t pid, ProcStat* out) {
  if (pid <= 0) return false;
  const std::string path = "/proc/" + std::to_string(pid) + "/stat";
  const int fd = RetryEintr([&] { return ::open(path.c_str(), O_RDONLY | O_CLOEXEC); });
  if (fd < 0) return false;
  char buffer[1024];  // the line is a few hundred bytes; fields past 15 are not needed
  const ssize_t n = RetryEintr([&] { return ::read(fd, buffer, sizeof buffer - 1); });
  ::close(fd);
  if (n <= 0) return false;
  const std::string text(buffer, static_cast<std::size_t>(n));
  // "PID (COMM) STATE PPID ...": the name may hold blanks and parentheses,
  // so the fields after it are counted from the last ')'.
  const std::size_t open = text.find('(');
  const std::size_t close = text.rfind(')');
  if (open == std::string::npos || close == std::string::npos || close < open) return false;
  ProcStat stat;
  stat.command = text.substr(open + 1, close - open - 1);
  long parent = 0;
  // Fields 3..15: state, ppid, then 9 skipped, utime, stime.
  if (std::sscanf(text.c_str() + close + 1, " %c %ld %*s %*s %*s %*s %*s %*s %*s %*s %*s %llu %llu", &stat.state,
                  &parent, &stat.userTicks, &stat.systemTicks) < 2) {
    return false;
  }
  stat.parent = static_cast<pid_t>(parent);
  *out = std::move(stat);
  return true;
}

std::vector<pid_t> ChildrenNamed(pid_t parent, const std::string& command) {
  std::vector<pid_t> found;
  DIR* proc = ::opendir("/proc");
  if (proc == nullptr) return found;
  while (const dirent* entry = ::readdir(proc)) {
    const pid_t pid = static_cast<pid_t>(std::atoi(entry->d_name));
    ProcStat stat;
    if (pid > 0 && ReadProcStat(pid, &stat) && stat.parent == parent && stat.command == command) {
      found.push_back(pid);
    }
  }
  ::closedir(proc);
  return found;
}

}  // namespace pm
