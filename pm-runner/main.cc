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
// thread. Dispatchers report their end, and the system its stop requests,
// through stop_signal.h, on which the main thread waits.

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
#include "pm-runner/stop_signal.h"
#include "pm/ipc/dispatcher.h"
#include "pm/runtime/context.h"
#include "pm/runtime/export.h"
#include "pm/runtime/library.h"
#include "pm/runtime/log.h"
#include "pm/runtime/system.h"
#include "pm/task/task.h"

namespace {

pm::Context g_context;

constexpr int kExitFailed = 1;
constexpr int kExitUsage = 2;
constexpr int kExitModuleCannotRun = 3;
constexpr int kExitNoConnection = 4;
constexpr auto kStopLimit = std::chrono::seconds(5);

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
    switch (pmrunner::WaitForWake()) {
      case pmrunner::Wake::kStop:
        pm::Log(pm::LogType::Normal, "", "pm-runner: stop signal received\n");
        return;
      case pmrunner::Wake::kFailed:
        return;
      case pmrunner::Wake::kEnded:
        break;
    }
  }
}

using TaskFactory = pm::TaskBase* (*)();

}  // namespace

// The process-wide context of this runner and of every module it loads.
extern "C" PM_EXPORT pm::Context* QFProcessManagementGlobals() {
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
  if (!pmrunner::InstallStopHandlers()) return kExitFailed;

  void* module = pm::OpenLibrary(modulePath);
  if (module == nullptr) {
    const std::string reason = pm::LastLibraryError();
    pm::Log(pm::LogType::Normal, "", "pm-runner: cannot load '%s': %s\n", modulePath.c_str(), reason.c_str());
    return kExitModuleCannotRun;
  }
  auto factory = reinterpret_cast<TaskFactory>(pm::FindSymbol(module, "pmTask_Factory"));
  if (factory == nullptr) {
    pm::Log(pm::LogType::Normal, "", "pm-runner: '%s' has no pmTask_Factory\n", modulePath.c_str());
    return kExitModuleCannotRun;
  }

  std::vector<std::shared_ptr<pm::RpcDispatcher>> dispatchers;
  pm::TaskBase* base = nullptr;
  {
    // The worker threads (the task's own and the dispatchers') start with the
    // stop signals blocked; only the main thread takes them.
    pmrunner::StopSignalsBlocked blocked;
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
    // Receiving starts once every connection's dispatcher is in the task with
    // its handlers registered: no early request finds its command missing, and
    // a task that stops itself at the first request (StopTask on that
    // dispatcher's thread) finds every dispatcher there to stop. Started one by
    // one, a later connection joined after such a stop and kept the runner up.
    for (auto& dispatcher : dispatchers) dispatcher->Start([] { pmrunner::NotifyEnded(); });
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
