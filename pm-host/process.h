#pragma once
// A child process: the runner, or the test sender. Its stdout can be read
// line by line; its stderr can go to a file. Started with posix_spawn
// (process_posix.cc) or CreateProcessW (process_win.cc, which hands the
// child only its own standard handles).
//
// Threads: a watcher thread waits for the child's end (without reaping it
// first, so that no signal can reach a recycled process id; on Windows the
// process handle pins the id) and runs `onExit`; a reader thread delivers
// stdout lines (without their line end, "\n" or "\r\n") to `onLine` when
// stdout is captured. Both callbacks run on those threads and must not
// destroy the ChildProcess. The destructor kills a child that still runs
// (SIGKILL, TerminateProcess) and joins both threads.
//
// Lock: lock_ guards status_, exited_ and the signalling of the child (kill
// is sent only while the child is known not to have been reaped).

#include <chrono>
#include <condition_variable>
#include <functional>
#include <map>
#include <mutex>
#include <optional>
#include <string>
#include <thread>
#include <vector>

namespace pmhost {

struct ChildOptions {
  std::string path;                           // the program
  std::vector<std::string> args;              // without argv[0]
  std::map<std::string, std::string> env;     // added to (or replacing in) the inherited environment
  std::string stderrPath;                     // empty: inherit ours
  bool captureStdout = false;                 // lines to onLine; else inherited
  std::function<void(const std::string& line)> onLine;  // reader thread
  std::function<void(int status)> onExit;     // watcher thread; status as Wait gives it
};

class ChildProcess {
 public:
  ChildProcess() = default;
  ~ChildProcess();
  ChildProcess(const ChildProcess&) = delete;
  ChildProcess& operator=(const ChildProcess&) = delete;

  // Starts the child. False (logged) when it cannot be started.
  bool Start(ChildOptions options);
  int Pid() const { return pid_; }
  bool Running() const;
  // The exit status (0..255), or 128 + the signal's number when a signal
  // ended it; nullopt when it still runs after `limit`.
  std::optional<int> Wait(std::chrono::milliseconds limit);
  // Sends `signal` when the child still runs. Windows has no signals for a
  // console child: any signal ends it at once (exit status 137).
  void Signal(int signal);
  // SIGTERM, up to `grace` for the end, then SIGKILL; returns the status. On
  // Windows the child is ended at once.
  int Terminate(std::chrono::milliseconds grace = std::chrono::seconds(3));

 private:
  void Watch();
  // Delivers the lines `read` (a read of the pipe: bytes, 0 at its end)
  // brings until it ends.
  void ReadLines(const std::function<long long(char*, std::size_t)>& read);
  // The watcher's end, once the child has ended: reaps it under the lock
  // (`reap` gives its exit status), wakes Wait, runs onExit.
  void Exited(const std::function<int()>& reap);

  ChildOptions options_;
  int pid_ = -1;
  void* handle_ = nullptr;  // Windows: the process handle, closed by the destructor
  std::thread watcher_;
  std::thread reader_;
  mutable std::mutex lock_;  // guards exited_, status_ and kill()
  std::condition_variable changed_;
  bool exited_ = false;
  int status_ = -1;
};

// The directory of this program (from /proc/self/exe, GetModuleFileNameW),
// with a trailing separator; empty when it cannot be read.
std::string ProgramDirectory();

}  // namespace pmhost
