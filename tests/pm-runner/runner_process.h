#pragma once
// The runner as a child process for the end-to-end tests, and the host-side
// request helpers they share. The runner's path comes from PM_RUNNER_PATH.
#include <fcntl.h>
#include <signal.h>
#include <spawn.h>
#include <sys/wait.h>
#include <unistd.h>

#include <atomic>
#include <chrono>
#include <fstream>
#include <initializer_list>
#include <sstream>
#include <string>
#include <thread>
#include <utility>
#include <vector>

#include <gtest/gtest.h>
#include <nlohmann/json.hpp>

#include "support/host_socket.h"

extern char** environ;

namespace pmtest {

using namespace std::chrono_literals;

// Generous: the sanitizer builds start processes slowly on a busy machine.
inline constexpr auto kExitLimit = 20s;

// The runner as a child process; its stderr goes to a file. `env` entries
// are added to (or replace those of) the inherited environment.
class RunnerProcess {
 public:
  explicit RunnerProcess(const std::vector<std::string>& args,
                         const std::vector<std::pair<std::string, std::string>>& env = {}) {
    static std::atomic<int> counter{0};
    stderrPath_ = ::testing::TempDir() + "pm-runner-" + std::to_string(::getpid()) + "-" +
                  std::to_string(counter.fetch_add(1)) + ".log";
    std::vector<std::string> all = {PM_RUNNER_PATH};
    all.insert(all.end(), args.begin(), args.end());
    std::vector<char*> argv;
    for (auto& arg : all) argv.push_back(arg.data());
    argv.push_back(nullptr);

    std::vector<std::string> entries;
    for (char** e = environ; *e != nullptr; ++e) {
      const std::string entry = *e;
      bool replaced = false;
      for (const auto& [key, value] : env) replaced = replaced || entry.rfind(key + "=", 0) == 0;
      if (!replaced) entries.push_back(entry);
    }
    for (const auto& [key, value] : env) entries.push_back(key + "=" + value);
    std::vector<char*> envp;
    for (auto& entry : entries) envp.push_back(entry.data());
    envp.push_back(nullptr);

    posix_spawn_file_actions_t actions;
    posix_spawn_file_actions_init(&actions);
    posix_spawn_file_actions_addopen(&actions, STDERR_FILENO, stderrPath_.c_str(),
                                     O_WRONLY | O_CREAT | O_TRUNC, 0600);
    if (posix_spawn(&pid_, PM_RUNNER_PATH, &actions, nullptr, argv.data(), envp.data()) != 0) pid_ = -1;
    posix_spawn_file_actions_destroy(&actions);
  }
  ~RunnerProcess() {
    if (pid_ > 0) {
      ::kill(pid_, SIGKILL);
      int status = 0;
      ::waitpid(pid_, &status, 0);
    }
    ::unlink(stderrPath_.c_str());
  }
  RunnerProcess(const RunnerProcess&) = delete;
  RunnerProcess& operator=(const RunnerProcess&) = delete;

  bool Started() const { return pid_ > 0; }
  void Signal(int signal) { ::kill(pid_, signal); }

  // The exit status; -1 when it ended by a signal, -2 when it is still
  // running after the limit.
  int Wait(std::chrono::milliseconds limit = kExitLimit) {
    const auto deadline = std::chrono::steady_clock::now() + limit;
    while (std::chrono::steady_clock::now() < deadline) {
      int status = 0;
      const pid_t done = ::waitpid(pid_, &status, WNOHANG);
      if (done == pid_) {
        pid_ = -1;
        return WIFEXITED(status) ? WEXITSTATUS(status) : -1;
      }
      std::this_thread::sleep_for(5ms);
    }
    return -2;
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
};

inline std::vector<std::string> Args(const char* module, std::initializer_list<int> ports) {
  std::vector<std::string> args = {"--module", module};
  for (int port : ports) {
    args.push_back("--connect");
    args.push_back(std::to_string(port));
  }
  return args;
}

inline nlohmann::json Ask(HostPeer& host, const std::string& command, std::uint64_t id, nlohmann::json body = nlohmann::json::object()) {
  body["pm::command"] = command;
  body["pm::unique_id"] = id;
  body["pm::request"] = true;
  EXPECT_TRUE(host.WriteJson(body));
  return host.ReadJson(10s);
}

inline bool Echoes(HostPeer& host, std::uint64_t id) {
  const nlohmann::json reply = Ask(host, "test::echo", id, {{"value", id}});
  return reply.is_object() && reply.value("value", nlohmann::json()) == id && reply["pm::unique_id"] == id;
}

}  // namespace pmtest
