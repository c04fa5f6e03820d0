#include "pm-host/host.h"

#include <thread>

#include "pm-host/locate.h"
#include "pm-host/segments.h"
#include "pm/ipc/server.h"
#include "pm/runtime/log.h"

namespace pmhost {

Host::Host(HostOptions options, NotificationListener listener, FrameSink* sink)
    : options_(std::move(options)), listener_(std::move(listener)), sink_(sink) {
  if (options_.runnerPath.empty()) options_.runnerPath = Locate(Companion::Runner);
  if (options_.modulePath.empty()) options_.modulePath = Locate(Companion::Module);
}

Host::~Host() {
  if (started_) Stop(std::chrono::seconds(2));
}

bool Host::Start() {
  if (started_ || options_.runnerPath.empty() || options_.modulePath.empty()) return false;
  std::unique_ptr<pm::ipc::Server> server = pm::ipc::Server::CreateListening();
  if (!server) {
    pm::Log(pm::LogType::Normal, "", "pm-host: cannot listen on 127.0.0.1\n");
    return false;
  }
  ChildOptions child;
  child.path = options_.runnerPath;
  child.args = {"--module", options_.modulePath, "--connect", std::to_string(server->GetPort())};
  child.env = options_.env;
  child.stderrPath = options_.runnerLog;
  // Runs on the watcher thread when the runner ends: its segments go, whether
  // it ended in order (then there are none) or crashed.
  child.onExit = [this](int) { RemoveSegments(); };
  if (!runner_.Start(std::move(child))) return false;
  started_ = true;

  std::unique_ptr<pm::ipc::Connection> connection;
  const auto deadline = std::chrono::steady_clock::now() + options_.connectLimit;
  while (!connection && runner_.Running() && std::chrono::steady_clock::now() < deadline) {
    connection = server->AcceptConnection(200);
  }
  server->Stop();
  if (!connection) {
    const std::optional<int> status = runner_.Wait(std::chrono::milliseconds(0));
    if (status) {
      pm::Log(pm::LogType::Normal, "", "pm-host: the runner ended with status %d before it connected\n", *status);
    } else {
      pm::Log(pm::LogType::Normal, "", "pm-host: the runner did not connect in time\n");
    }
    Stop(std::chrono::milliseconds(500));
    return false;
  }
  auto session = std::make_unique<Session>(
      std::shared_ptr<pm::ipc::Connection>(std::move(connection)),
      [this](const std::string& command, const nlohmann::json& message) {
        if (listener_) listener_(command, message);
      },
      sink_);
  {
    std::lock_guard<std::mutex> guard(basesLock_);
    session_ = std::move(session);
  }
  session_->Start();
  return true;
}

int Host::RemoveSegments() {
  std::set<std::string> bases;
  {
    std::lock_guard<std::mutex> guard(basesLock_);
    if (session_) {
      for (const std::string& base : session_->MemoryBases()) bases_.insert(base);
    }
    bases = bases_;
  }
  int removed = 0;
  for (const std::string& base : bases) removed += pmhost::RemoveSegments(base);
  removed_ += removed;
  if (removed > 0) pm::Log(pm::LogType::Normal, "", "pm-host: removed %d segments the runner left behind\n", removed);
  return removed;
}

int Host::Stop(std::chrono::milliseconds grace) {
  if (!started_) return -1;
  if (session_) {
    // Remember the bases before the session goes.
    std::lock_guard<std::mutex> guard(basesLock_);
    for (const std::string& base : session_->MemoryBases()) bases_.insert(base);
  }
  if (session_) session_->Stop();
  std::optional<int> status = runner_.Wait(grace);
  if (!status) {
    pm::Log(pm::LogType::Normal, "", "pm-host: the runner did not end in time; terminating it\n");
    status = runner_.Terminate();
  }
  RemoveSegments();
  started_ = false;
  return *status;
}

}  // namespace pmhost
