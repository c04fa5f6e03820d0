#pragma once
// What Linux tells about a process in /proc/PID/stat: its command name,
// state, parent and CPU time. The one reader of that file for every program
// here (liveness checks and CPU figures through pm/runtime/system.h, finding a
// child by name). Linux only.
#include <sys/types.h>

#include <string>
#include <vector>

namespace pm {

struct ProcStat {
  std::string command;  // field 2 without its parentheses (may hold blanks and ')')
  char state = 0;       // 'R', 'S', ... 'Z' zombie, 'X' dead
  pid_t parent = 0;
  unsigned long long userTicks = 0;    // field 14
  unsigned long long systemTicks = 0;  // field 15
};

// False when the process is gone or its line does not parse.
bool ReadProcStat(pid_t pid, ProcStat* out);

// The children of `parent` (zombies too) whose command name is `command`.
std::vector<pid_t> ChildrenNamed(pid_t parent, const std::string& command);

}  // namespace pm
