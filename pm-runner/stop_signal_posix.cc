#include <fcntl.h>
#include <poll.h>
#include <signal.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>

#include "pm-runner/stop_signal.h"
#include "pm/runtime/log.h"
#include "pm/runtime/syscall.h"

namespace pmrunner {
namespace {

// The self-pipe: written by the signal handlers ('S') and by dispatchers whose
// receiving side ended ('E'); read by the main thread.
int g_wakeRead = -1;
int g_wakeWrite = -1;

void Write(char reason) {
  const int saved = errno;
  [[maybe_unused]] ssize_t n = ::write(g_wakeWrite, &reason, 1);  // a full pipe already wakes
  errno = saved;
}

void OnStopSignal(int) { Write('S'); }

}  // namespace

bool InstallStopHandlers() {
  int fds[2];
  if (::pipe2(fds, O_CLOEXEC | O_NONBLOCK) != 0) {
    pm::Log(pm::LogType::Normal, "", "pm-runner: pipe failed: %s\n", pm::ErrnoText(errno).c_str());
    return false;
  }
  g_wakeRead = fds[0];
  g_wakeWrite = fds[1];
  struct sigaction action {};
  action.sa_handler = OnStopSignal;
  sigemptyset(&action.sa_mask);
  action.sa_flags = SA_RESTART;
  ::sigaction(SIGINT, &action, nullptr);
  ::sigaction(SIGTERM, &action, nullptr);
  // Sends use MSG_NOSIGNAL; this also covers a host that closed our stderr.
  ::signal(SIGPIPE, SIG_IGN);
  return true;
}

void NotifyEnded() { Write('E'); }

Wake WaitForWake() {
  pollfd pfd{g_wakeRead, POLLIN, 0};
  const int ready = ::poll(&pfd, 1, -1);
  if (ready < 0 && errno != EINTR) {
    pm::Log(pm::LogType::Normal, "", "pm-runner: poll failed: %s\n", pm::ErrnoText(errno).c_str());
    return Wake::kFailed;
  }
  char buffer[64];
  ssize_t n = 0;
  bool stop = false;
  while ((n = ::read(g_wakeRead, buffer, sizeof buffer)) > 0) {
    stop = stop || std::memchr(buffer, 'S', static_cast<std::size_t>(n)) != nullptr;
  }
  return stop ? Wake::kStop : Wake::kEnded;
}

struct StopSignalsBlocked::Saved {
  sigset_t previous;
};

StopSignalsBlocked::StopSignalsBlocked() : saved_(std::make_unique<Saved>()) {
  sigset_t set;
  sigemptyset(&set);
  sigaddset(&set, SIGINT);
  sigaddset(&set, SIGTERM);
  pthread_sigmask(SIG_BLOCK, &set, &saved_->previous);
}

StopSignalsBlocked::~StopSignalsBlocked() { pthread_sigmask(SIG_SETMASK, &saved_->previous, nullptr); }

}  // namespace pmrunner
