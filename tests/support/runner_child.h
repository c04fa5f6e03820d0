#pragma once
// The runner (PM_RUNNER_PATH, from the build) as a child process, started by
// pm-host's process starter: its stderr goes to a file of its own, its
// environment may add entries (NDI_LOOPBACK_DIR for a private registry
// folder), and it is killed and reaped when the object goes.
#include <unistd.h>

#include <atomic>
#include <chrono>
#include <filesystem>
#include <fstream>
#include <initializer_list>
#include <map>
#include <optional>
#include <sstream>
#include <string>
#include <vector>

#include <gtest/gtest.h>
#include <nlohmann/json.hpp>

#include "pm-host/process.h"
#include "support/host_socket.h"

namespace pmtest {

using namespace std::chrono_literals;

// A fresh name under the test's temporary folder.
inline std::string TempName(const std::string& stem, const std::string& suffix) {
  static std::atomic<int> counter{0};
  return ::testing::TempDir() + stem + "-" + std::to_string(::getpid()) + "-" + std::to_string(counter++) + suffix;
}

// A private NDI loopback registry folder, made now and removed at the end.
struct Registry {
  Registry() { std::filesystem::create_directories(path); }
  ~Registry() {
    std::error_code ignored;
    std::filesystem::remove_all(path, ignored);
  }
  const std::string path = TempName("pm-registry", ".ndi");
};

class RunnerProcess {
 public:
  explicit RunnerProcess(std::vector<std::string> args, std::map<std::string, std::string> env = {}) {
    pmhost::ChildOptions options;
    options.path = PM_RUNNER_PATH;
    options.args = std::move(args);
    options.env = std::move(env);
    options.stderrPath = stderrPath_;
    started_ = child_.Start(std::move(options));
  }
  ~RunnerProcess() { ::unlink(stderrPath_.c_str()); }  // after child_ has killed and reaped it

  bool Started() const { return started_; }
  void Signal(int signal) { child_.Signal(signal); }
  // The exit status, 128 + the signal's number when a signal ended it,
  // nullopt while it still runs after `limit` (generous: the sanitizer builds
  // start processes slowly on a busy machine).
  std::optional<int> Wait(std::chrono::milliseconds limit = 20s) { return child_.Wait(limit); }
  std::string Stderr() const {
    std::ifstream in(stderrPath_);
    std::stringstream text;
    text << in.rdbuf();
    return text.str();
  }

 private:
  const std::string stderrPath_ = TempName("pm-runner", ".log");  // first: outlives the child
  pmhost::ChildProcess child_;
  bool started_ = false;
};

// "--module <module> --connect <port>..."
inline std::vector<std::string> Args(const std::string& module, std::initializer_list<int> ports) {
  std::vector<std::string> args = {"--module", module};
  for (int port : ports) args.insert(args.end(), {"--connect", std::to_string(port)});
  return args;
}

inline int Occurrences(const std::string& text, const std::string& what) {
  int n = 0;
  for (auto at = text.find(what); at != std::string::npos; at = text.find(what, at + what.size())) ++n;
  return n;
}

// A listener, the runner on `module` connected to it in a private registry
// folder, and the accepted connection.
struct RunnerOnPort {
  explicit RunnerOnPort(const std::string& module)
      : runner(Args(module, {listener.Port()}), {{"NDI_LOOPBACK_DIR", registry.path}}), host(listener.Accept()) {}
  bool Ready() const { return runner.Started() && host.Valid(); }

  Registry registry;  // first: outlives the runner
  HostListener listener;
  RunnerProcess runner;
  HostPeer host;
};

}  // namespace pmtest
