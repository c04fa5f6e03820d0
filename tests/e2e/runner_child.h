#pragma once
// The runner as a child process on the real task module, for the end-to-end
// tests: its own NDI loopback registry folder (so discovery sees only what the
// case puts there), stderr captured to a file, and the host's request helper.
// PM_RUNNER_PATH and PM_MODULE_PATH come from the build.
#include <fcntl.h>
#include <signal.h>
#include <spawn.h>
#include <stdlib.h>
#include <sys/wait.h>
#include <unistd.h>

#include <atomic>
#include <chrono>
#include <filesystem>
#include <fstream>
#include <sstream>
#include <string>
#include <thread>
#include <vector>

#include <gtest/gtest.h>
#include <nlohmann/json.hpp>

#include "pm/runtime/host_socket.h"

extern char** environ;

namespace e2e {

using namespace std::chrono_literals;

// Generous: the sanitizer builds start processes slowly on a busy machine.
inline constexpr auto kExitLimit = 20s;

class RunnerChild {
 public:
  explicit RunnerChild(int port) {
    static std::atomic<int> counter{0};
    const std::string stem = ::testing::TempDir() + "pm-e2e-" + std::to_string(::getpid()) + "-" +
                             std::to_string(counter.fetch_add(1));
    stderrPath_ = stem + ".log";
    registry_ = stem + ".ndi";
    std::filesystem::create_directories(registry_);

    std::vector<std::string> args = {PM_RUNNER_PATH, "--module", PM_MODULE_PATH, "--connect", std::to_string(port)};
    std::vector<char*> argv;
    for (auto& arg : args) argv.push_back(arg.data());
    argv.push_back(nullptr);
    std::vector<std::string> env;
    for (char** e = environ; *e != nullptr; ++e) {
      if (std::string(*e).rfind("NDI_LOOPBACK_DIR=", 0) != 0) env.emplace_back(*e);
    }
    env.push_back("NDI_LOOPBACK_DIR=" + registry_);
    std::vector<char*> envp;
    for (auto& entry : env) envp.push_back(entry.data());
    envp.push_back(nullptr);

    posix_spawn_file_actions_t actions;
    posix_spawn_file_actions_init(&actions);
    posix_spawn_file_actions_addopen(&actions, STDERR_FILENO, stderrPath_.c_str(), O_WRONLY | O_CREAT | O_TRUNC,
                                     0600);
    if (posix_spawn(&pid_, PM_RUNNER_PATH, &actions, nullptr, argv.data(), envp.data()) != 0) pid_ = -1;
    posix_spawn_file_actions_destroy(&actions);
  }
  ~RunnerChild() {
    if (pid_ > 0) {
      ::kill(pid_, SIGKILL);
      int status = 0;
      ::waitpid(pid_, &status, 0);
    }
    ::unlink(stderrPath_.c_str());
    std::error_code ignored;
    std::filesystem::remove_all(registry_, ignored);
  }
  RunnerChild(const RunnerChild&) = delete;
  RunnerChild& operator=(const RunnerChild&) = delete;

  bool Started() const { return pid_ > 0; }

  // The exit status; -1 when it ended by a signal, -2 when still running
  // after the limit.
  int Wait(std::chrono::milliseconds limit = kExitLimit) {
    const auto deadline = std::chrono::steady_clock::now() + limit;
    for (;;) {
      int status = 0;
      const pid_t done = ::waitpid(pid_, &status, WNOHANG);
      if (done == pid_) {
        pid_ = -1;
        return WIFEXITED(status) ? WEXITSTATUS(status) : -1;
      }
      if (std::chrono::steady_clock::now() >= deadline) return -2;
      std::this_thread::sleep_for(5ms);
    }
  }

  std::string Stderr() const {
    std::ifstream in(stderrPath_);
    std::stringstream text;
    text << in.rdbuf();
    return text.str();
  }

 private:
  pid_t pid_ = -1;
  std::string stderrPath_;
  std::string registry_;
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
