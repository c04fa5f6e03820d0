#pragma once
// A child ndi-testsrc for the loopback tests: started with posix_spawn, its
// JSON event lines collected by a reader thread.
#include <sys/types.h>

#include <chrono>
#include <condition_variable>
#include <functional>
#include <mutex>
#include <nlohmann/json.hpp>
#include <string>
#include <thread>
#include <vector>

namespace ndilbtest {

class TestSource {
 public:
  explicit TestSource(const std::vector<std::string>& args);
  ~TestSource();  // SIGKILL when still running, then reaped
  TestSource(const TestSource&) = delete;
  TestSource& operator=(const TestSource&) = delete;

  bool started() const { return pid_ > 0; }
  pid_t pid() const { return pid_; }
  // Waits for the "ready" line; false on timeout.
  bool WaitReady(std::chrono::milliseconds timeout = std::chrono::seconds(5));
  const std::string& name() const { return name_; }
  const std::string& url() const { return url_; }

  // The first event (from `from` on) that matches; null json on timeout.
  nlohmann::json WaitEvent(const std::function<bool(const nlohmann::json&)>& match,
                           std::chrono::milliseconds timeout = std::chrono::seconds(5), std::size_t* from = nullptr);
  std::vector<nlohmann::json> Events() const;

  void Signal(int sig);
  // Reaps the child; its exit status (or 128 + signal), -1 when it did not end in time.
  int Wait(std::chrono::milliseconds timeout = std::chrono::seconds(5));

 private:
  void Read();

  pid_t pid_ = -1;
  int out_fd_ = -1;
  bool reaped_ = false;
  std::thread reader_;
  std::string name_, url_;
  mutable std::mutex mutex_;  // guards events_
  std::condition_variable cv_;
  std::vector<nlohmann::json> events_;
};

// A private registry folder for one test case, set as NDI_LOOPBACK_DIR.
class RegistryDir {
 public:
  RegistryDir();
  ~RegistryDir();
  const std::string& path() const { return path_; }

 private:
  std::string path_;
};

}  // namespace ndilbtest
