#pragma once
// The runner as a child process on the real task module, for the end-to-end
// tests: its own NDI loopback registry folder (so discovery sees only what the
// case puts there), stderr captured to a file, and the host's request helper.
// PM_RUNNER_PATH and PM_MODULE_PATH come from the build.
#include <unistd.h>

#include <atomic>
#include <chrono>
#include <filesystem>
#include <string>
#include <vector>

#include <gtest/gtest.h>
#include <nlohmann/json.hpp>

#include "pm-runner/runner_process.h"
#include "support/host_socket.h"

namespace e2e {

using namespace std::chrono_literals;
using pmtest::kExitLimit;

// A private registry folder, made before the runner starts and removed
// after it ended.
struct Registry {
  Registry() {
    static std::atomic<int> counter{0};
    path = ::testing::TempDir() + "pm-e2e-" + std::to_string(::getpid()) + "-" +
           std::to_string(counter.fetch_add(1)) + ".ndi";
    std::filesystem::create_directories(path);
  }
  ~Registry() {
    std::error_code ignored;
    std::filesystem::remove_all(path, ignored);
  }
  std::string path;
};

// The runner on the real module, connected to `port`, in its own registry.
class RunnerChild {
 public:
  explicit RunnerChild(int port)
      : process_({"--module", PM_MODULE_PATH, "--connect", std::to_string(port)},
                 {{"NDI_LOOPBACK_DIR", registry_.path}}) {}

  bool Started() const { return process_.Started(); }
  int Wait(std::chrono::milliseconds limit = kExitLimit) { return process_.Wait(limit); }
  std::string Stderr() const { return process_.Stderr(); }

 private:
  Registry registry_;  // first: outlives the process
  pmtest::RunnerProcess process_;
};

inline int Occurrences(const std::string& text, const std::string& what) {
  int n = 0;
  for (auto at = text.find(what); at != std::string::npos; at = text.find(what, at + 1)) ++n;
  return n;
}

// The host's end of one runner connection.
class Host {
 public:
  Host() : runner_(listener_.Port()) { peer_ = listener_.Accept(); }

  bool Ready() const { return runner_.Started() && peer_.Valid(); }
  RunnerChild& Runner() { return runner_; }
  pmtest::HostPeer& Peer() { return peer_; }

  // Sends a request and returns its reply; the task's own requests met on
  // the way (a source's "::start_queue") are kept in Requests().
  nlohmann::json Ask(const std::string& command, nlohmann::json body = nlohmann::json::object()) {
    const std::uint64_t id = ++requestId_;
    body["pm::command"] = command;
    body["pm::unique_id"] = id;
    body["pm::request"] = true;
    EXPECT_TRUE(peer_.WriteJson(body));
    for (;;) {
      const nlohmann::json frame = peer_.ReadJson(10s);
      if (!frame.is_object()) return nlohmann::json(nlohmann::json::value_t::discarded);
      if (frame.value("pm::response", false) && frame.value("pm::unique_id", std::uint64_t{0}) == id) return frame;
      if (!frame.value("pm::response", false)) requests_.push_back(frame);
    }
  }
  const std::vector<nlohmann::json>& Requests() const { return requests_; }

 private:
  pmtest::HostListener listener_;
  RunnerChild runner_;
  pmtest::HostPeer peer_;
  std::uint64_t requestId_ = 0;
  std::vector<nlohmann::json> requests_;
};

}  // namespace e2e
