#pragma once
// Process-level services of the operating system that the runtime needs:
// the main program's exports, the default log output, process ids and what
// the system tells about a process. One implementation per platform
// (system_posix.cc, system_win.cc).
#include <string>

namespace pm {

// The address of `name` exported by the main program of this process, or
// null when it exports no such name (dlsym(RTLD_DEFAULT) on POSIX;
// GetModuleHandleW(nullptr) + GetProcAddress on Windows).
void* FindProgramExport(const char* name);

// The default log sink's output: the line to stderr as WriteToStderr writes
// it (POSIX), to the debugger with OutputDebugStringA (Windows).
void WriteDefaultLogLine(const char* line);

// Every byte of `text` to the process's standard error (the runner's and the
// host's log sinks): one write when the pipe takes it, so that lines from
// several threads do not mix, the rest after a short write; EINTR retried;
// gives up silently when stderr is gone.
void WriteToStderr(const char* text);

// The system's text for an error number of its own calls, with the number:
// ErrnoText (POSIX); FormatMessage of a GetLastError number (Windows).
std::string SystemErrorText(int code);

// This process's id, as the system's tools show it.
int CurrentProcessId();

// Whether process `pid` exists and has not ended: a zombie has ended
// (kill(0) and /proc/PID/stat on Linux; OpenProcess and GetExitCodeProcess on
// Windows, where an ended process can still be opened for a while).
bool ProcessAlive(int pid);

// The processor time (user and system) that process `pid` has used, in
// seconds; 0 when it cannot be read (/proc/PID/stat, GetProcessTimes).
double ProcessCpuSeconds(int pid);

// The computer's name as the system reports it; "localhost" when it cannot.
std::string HostName();

}  // namespace pm
