#include <windows.h>

#include <condition_variable>
#include <mutex>

#include "pm-runner/stop_signal.h"
#include "pm/runtime/log.h"
#include "pm/runtime/system.h"

namespace pmrunner {
namespace {

// Lock: g_mutex guards g_stop and g_ended; nothing is called with it held.
std::mutex g_mutex;
std::condition_variable g_wake;
bool g_stop = false;
bool g_ended = false;

// Runs on a thread the system starts for the event.
BOOL WINAPI OnConsoleEvent(DWORD) {
  {
    std::lock_guard<std::mutex> lock(g_mutex);
    g_stop = true;
  }
  g_wake.notify_all();
  return TRUE;  // handled: the runner ends in order
}

}  // namespace

bool InstallStopHandlers() {
  if (!::SetConsoleCtrlHandler(OnConsoleEvent, TRUE)) {
    pm::Log(pm::LogType::Normal, "", "pm-runner: SetConsoleCtrlHandler failed: %s\n",
            pm::SystemErrorText(static_cast<int>(::GetLastError())).c_str());
    return false;
  }
  return true;
}

void NotifyEnded() {
  {
    std::lock_guard<std::mutex> lock(g_mutex);
    g_ended = true;
  }
  g_wake.notify_all();
}

Wake WaitForWake() {
  std::unique_lock<std::mutex> lock(g_mutex);
  g_wake.wait(lock, [] { return g_stop || g_ended; });
  if (g_stop) return Wake::kStop;
  g_ended = false;
  return Wake::kEnded;
}

struct StopSignalsBlocked::Saved {};

StopSignalsBlocked::StopSignalsBlocked() = default;
StopSignalsBlocked::~StopSignalsBlocked() = default;

}  // namespace pmrunner
