#pragma once
// The reference host: listens on 127.0.0.1, starts `pm-runner --module PATH
// --connect PORT`, accepts the runner's connection and runs a Session on it.
// When the runner ends, whatever way, every segment of the memory bases it
// announced is removed from /dev/shm (a runner that crashed cannot remove its
// own).
//
// Threads: see Session (notifications, frames) and ChildProcess (the runner's
// end). Start, Stop and the destructor run on one owner thread.

#include <atomic>
#include <chrono>
#include <map>
#include <memory>
#include <mutex>
#include <optional>
#include <set>
#include <string>

#include "pm-host/process.h"
#include "pm-host/session.h"

namespace pmhost {

struct HostOptions {
  std::string runnerPath;                  // empty: pm-runner found beside this program (locate.h)
  std::string modulePath;                  // empty: libtaskndisource.so found from it (locate.h)
  std::map<std::string, std::string> env;  // for the runner (NDI_LOOPBACK_DIR)
  std::string runnerLog;                   // the runner's stderr; empty: ours
  std::chrono::milliseconds connectLimit{10000};
};

class Host {
 public:
  Host(HostOptions options, NotificationListener listener, FrameSink* sink);
  ~Host();
  Host(const Host&) = delete;
  Host& operator=(const Host&) = delete;

  // Starts the runner and waits for its connection. False (logged) when the
  // runner or the module cannot be found, the runner cannot be started or
  // does not connect in time (it is stopped).
  bool Start();
  // Closes the connection (an orderly runner ends by itself), waits up to
  // `grace`, then terminates the runner; removes its segments. Returns the
  // runner's exit status (or -1 when it never started).
  int Stop(std::chrono::milliseconds grace = std::chrono::seconds(6));

  Session& GetSession() { return *session_; }
  bool RunnerRunning() const { return runner_.Running(); }
  std::optional<int> WaitRunner(std::chrono::milliseconds limit) { return runner_.Wait(limit); }
  pid_t RunnerPid() const { return runner_.Pid(); }
  // Removes the segments of every memory base announced so far; returns how
  // many were removed.
  int RemoveSegments();
  // Segments removed by RemoveSegments so far (left behind by the runner).
  int RemovedSegments() const { return removed_.load(); }

 private:
  HostOptions options_;
  NotificationListener listener_;
  FrameSink* sink_;
  bool started_ = false;
  std::atomic<int> removed_{0};
  // Declared before runner_: the runner's watcher thread (joined when runner_
  // is destroyed, which happens first) uses them.
  std::mutex basesLock_;               // guards bases_ and the assignment of session_
  std::set<std::string> bases_;        // every memory base seen, kept after the session ends
  std::unique_ptr<Session> session_;
  ChildProcess runner_;
};

}  // namespace pmhost
