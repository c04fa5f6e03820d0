#pragma once
// How the runner's main thread learns that it is time to end: a stop request
// from the system, or a dispatcher whose receiving side ended. One
// implementation per platform: stop_signal_posix.cc (SIGINT and SIGTERM
// through a self-pipe; SIGPIPE ignored), stop_signal_win.cc (the console's
// Ctrl-C, Ctrl-Break, close, logoff and shutdown events, through a condition
// variable).
//
// Threads: InstallStopHandlers and WaitForWake on the main thread;
// NotifyEnded from any thread.
#include <memory>

namespace pmrunner {

// Installs the handlers; false (logged) when it cannot.
bool InstallStopHandlers();

// A dispatcher's receiving side ended: wakes WaitForWake.
void NotifyEnded();

enum class Wake { kStop, kEnded, kFailed };
// Sleeps until a stop request (kStop), a NotifyEnded since the last call
// (kEnded), or a failure of the wait itself (kFailed, logged).
Wake WaitForWake();

// Keeps the stop signals away from the threads started while it lives, so
// that they land on the main thread (POSIX); nothing on Windows, where the
// console's events arrive on a thread of their own.
class StopSignalsBlocked {
 public:
  StopSignalsBlocked();
  ~StopSignalsBlocked();
  StopSignalsBlocked(const StopSignalsBlocked&) = delete;
  StopSignalsBlocked& operator=(const StopSignalsBlocked&) = delete;

 private:
  struct Saved;
  std::unique_ptr<Saved> saved_;
};

}  // namespace pmrunner
