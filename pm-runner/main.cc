// pm-runner: the host's worker process for one task module.
//
//   pm-runner --module PATH --connect PORT [--connect PORT]...
//
// Loads the module, builds its task with pmTask_Factory, opens one loopback
// connection per --connect with a request dispatcher on each, and runs until
// every connection has ended (the host closed it, or the task stopped
// itself) or SIGINT/SIGTERM arrives. Then it shuts the task down, destroys it
// and exits 0.
//
// Exit status: 0 after an orderly end; 1 when the task did not stop within 5
// seconds (or the runner cannot set up its signal handling); 2 for a bad command line (a --module that names no file among
// it); 3 when the module cannot run here (it cannot be loaded, has no
// pmTask_Factory, or the factory gives no task); 4 when a connection cannot be
// opened.
//
// Threads: the main thread does all the set-up and the shutdown; each
// dispatcher has a receive thread (runs the task's handlers) and an expiry
// thread. Dispatchers report their end through a self-pipe that the main
// thread polls; the signal handlers only write to that pipe.

#include <dlfcn.h>
#include <fcntl.h>
#include <poll.h>
#include <signal.h>
#include <unistd.h>

#include <cerrno>
#include <chrono>
#include <condition_variable>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <exception>
#include <memory>
#include <mutex>
#include <string>
#include <thread>
#include <vector>

#include <CLI/CLI.hpp>

#include "pm/ipc/connection.h"
#include "pm/ipc/dispatcher.h"
#include "pm/runtime/context.h"
#include "pm/runtime/log.h"
#include "pm/runtime/syscall.h"
#include "pm/task/task.h"

namespace {

pm::Context g_context;

// The self-pipe: written by the signal handlers ('S') and by dispatchers whose
// receiving side ended ('E'); read by the main thread.
int g_wakeRead = -1;
int g_wakeWrite = -1;

constexpr int kExitFailed = 1;
constexpr int kExitUsage = 2;
constexpr int kExitModuleCannotRun = 3;
constexpr int kExitNoConnection = 4;
constexpr auto kStopLimit = std::chrono::seconds(5);

void Wake(char reason) {
  const int saved = errno;
  [[maybe_unused]] ssize_t n = ::write(g_wakeWrite, &reason, 1);  // a full pipe already wakes
  errno = saved;
}

void OnStopSignal(int) { Wake('S'); }

bool InstallSignalHandlers() {
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

// Keeps SIGINT/SIGTERM away from the worker threads started while it lives,
// so that they land on the main thread.
class BlockStopSignals {
 public:
  BlockStopSignals() {
    sigset_t set;
    sigemptyset(&set);
    sigaddset(&set, SIGINT);
    sigaddset(&set, SIGTERM);
    pthread_sigmask(SIG_BLOCK, &set, &previous_);
  }
  ~BlockStopSignals() { pthread_sigmask(SIG_SETMASK, &previous_, nullptr); }
  BlockStopSignals(const BlockStopSignals&) = delete;
  BlockStopSignals& operator=(const BlockStopSignals&) = delete;

 private:
  sigset_t previous_;
};

// Ends the process with status 1 when the orderly shutdown has not finished
// within kStopLimit: a worker that does not stop must not keep it alive.
class StopWatchdog {
 public:
  StopWatchdog() : thread_([this] { Run(); }) {}
  ~StopWatchdog() {
    {
      std::lock_guard<std::mutex> guard(mutex_);
      done_ = true;
    }
    condition_.notify_all();
    thread_.join();
  }
  StopWatchdog(const StopWatchdog&) = delete;
  StopWatchdog& operator=(const StopWatchdog&) = delete;

 private:
  void Run() {
    std::unique_lock<std::mutex> lock(mutex_);
    if (condition_.wait_for(lock, kStopLimit, [this] { return done_; })) return;
    pm::Log(pm::LogType::Normal, "", "pm-runner: the task did not stop within 5 seconds\n");
    std::_Exit(kExitFailed);
  }

  std::mutex mutex_;  // guards done_
  std::condition_variable condition_;
  bool done_ = false;
  std::thread thread_;
};

// Waits until a stop signal arrives or every dispatcher's receiving side has
// ended.
void WaitForTheEnd(const std::vector<std::shared_ptr<pm::RpcDispatcher>>& dispatchers) {
  for (;;) {
    bool allEnded = true;
    for (const auto& dispatcher : dispatchers) allEnded = allEnded && dispatcher->Ended();
    if (allEnded) {
      pm::Log(pm::LogType::Normal, "", "pm-runner: every connection has ended\n");
      return;
    }
    pollfd pfd{g_wakeRead, POLLIN, 0};
    const int ready = ::poll(&pfd, 1, -1);
    if (ready < 0 && errno != EINTR) {
      pm::Log(pm::LogType::Normal, "", "pm-runner: poll failed: %s\n", pm::ErrnoText(errno).c_str());
      return;
    }
    char buffer[64];
    ssize_t n = 0;
    while ((n = ::read(g_wakeRead, buffer, sizeof buffer)) > 0) {
      if (std::memchr(buffer, 'S', static_cast<std::size_t>(n)) != nullptr) {
        pm::Log(pm::LogType::Normal, "", "pm-runner: stop signal received\n");
        return;
      }
    }
  }
}

using TaskFactory = pm::TaskBase* (*)();

}  // namespace

// The process-wide context of this runner and of every module it loads.
extern "C" __attribute__((visibility("default"))) pm::Context* QFProcessManagementGlobals() {
  return &g_context;
}

int main(int argc, char** argv) {
  CLI::App app{"pm-runner: runs a task module and connects it to its host.\n"
               "Exit status: 0 orderly end, 1 the task did not stop within 5 s, 2 a usage error,\n"
               "3 the module cannot run here, 4 a connection cannot be opened."};
  app.set_version_flag("--version", "pm-runner " PM_VERSION);
  std::string modulePath;
  std::vector<int> ports;
  app.add_option("--module", modulePath, "the task module (shared library) to load")
      ->required()
      ->check(CLI::ExistingFile);
  app.add_option("--connect", ports, "a port on 127.0.0.1 to connect to; one dispatcher each")
      ->required()
      ->check(CLI::Range(1, 65535));
  try {
    app.parse(argc, argv);
  } catch (const CLI::ParseError& e) {
    return app.exit(e) == 0 ? 0 : kExitUsage;
  }

  // Every line of the runner and of the task goes to stderr unchanged.
  pm::Context* context = pm::GetContext();
  context->logSink = [](pm::LogType, const char* line) { pm::WriteToStderr(line); };
  if (!InstallSignalHandlers()) return kExitFailed;

  void* module = ::dlopen(modulePath.c_str(), RTLD_NOW | RTLD_LOCAL);
  if (module == nullptr) {
    pm::Log(pm::LogType::Normal, "", "pm-runner: cannot load '%s': %s\n", modulePath.c_str(), ::dlerror());
    return kExitModuleCannotRun;
  }
  auto factory = reinterpret_cast<TaskFactory>(::dlsym(module, "pmTask_Factory"));
  if (factory == nullptr) {
    pm::Log(pm::LogType::Normal, "", "pm-runner: '%s' has no pmTask_Factory\n", modulePath.c_str());
    return kExitModuleCannotRun;
  }

  std::vector<std::shared_ptr<pm::RpcDispatcher>> dispatchers;
  pm::TaskBase* base = nullptr;
  {
    // The worker threads (the task's own and the dispatchers') start with the
    // stop signals blocked; only the main thread takes them.
    BlockStopSignals blocked;
    try {
      base = factory();
    } catch (const std::exception& e) {
      pm::Log(pm::LogType::Normal, "", "pm-runner: pmTask_Factory threw: %s\n", e.what());
    } catch (...) {
      pm::Log(pm::LogType::Normal, "", "pm-runner: pmTask_Factory threw\n");
    }
    if (base == nullptr) {
      pm::Log(pm::LogType::Normal, "", "pm-runner: pmTask_Factory of '%s' gave no task; it cannot run here\n",
              modulePath.c_str());
      return kExitModuleCannotRun;
    }
    // Every task module's task derives from pm::Task.
    auto* task = static_cast<pm::Task*>(base);

    std::vector<std::shared_ptr<pm::ipc::Connection>> connections;
    for (int port : ports) {
      std::shared_ptr<pm::ipc::Connection> connection = pm::ipc::Connection::Open(port);
      if (!connection) {
        pm::Log(pm::LogType::Normal, "", "pm-runner: cannot connect to port %d\n", port);
        base->Shutdown();
        delete base;
        return kExitNoConnection;
      }
      connections.push_back(std::move(connection));
    }
    for (auto& connection : connections) {
      auto dispatcher = std::make_shared<pm::RpcDispatcher>(std::move(connection));
      task->AddDispatcher(dispatcher);
      try {
        task->AttachDispatcher(dispatcher);
      } catch (const std::exception& e) {
        pm::Log(pm::LogType::Normal, "", "pm-runner: AttachDispatcher threw: %s\n", e.what());
      }
      dispatchers.push_back(dispatcher);
    }
    // Receiving starts once the task's handlers are registered, so that no
    // early request finds its command missing, and once the task holds every
    // dispatcher: a request on one connection that stops the task must stop
    // them all, or the runner would wait for a connection nobody ends.
    for (const auto& dispatcher : dispatchers) dispatcher->Start([] { Wake('E'); });
  }

  WaitForTheEnd(dispatchers);

  {
    StopWatchdog watchdog;
    try {
      base->Shutdown();
    } catch (const std::exception& e) {
      pm::Log(pm::LogType::Normal, "", "pm-runner: Shutdown threw: %s\n", e.what());
    }
    delete base;  // stops the dispatchers still attached, and the server
    for (auto& dispatcher : dispatchers) dispatcher->Stop();
    dispatchers.clear();  // joins what the task stopped from its own threads
  }
  pm::Log(pm::LogType::Normal, "", "pm-runner: done\n");
  return 0;
}
