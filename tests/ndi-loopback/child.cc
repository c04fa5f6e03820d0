#include "child.h"

#include <dirent.h>
#include <fcntl.h>
#include <signal.h>
#include <spawn.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cstdlib>
#include <cstring>

extern char** environ;

namespace ndilbtest {

TestSource::TestSource(const std::vector<std::string>& args) {
  int pipe_fds[2];
  if (::pipe2(pipe_fds, O_CLOEXEC) != 0) return;
  std::vector<std::string> all = {NDI_TESTSRC_PATH};
  all.insert(all.end(), args.begin(), args.end());
  std::vector<char*> argv;
  for (auto& a : all) argv.push_back(a.data());
  argv.push_back(nullptr);
  posix_spawn_file_actions_t actions;
  posix_spawn_file_actions_init(&actions);
  posix_spawn_file_actions_adddup2(&actions, pipe_fds[1], STDOUT_FILENO);
  if (::posix_spawn(&pid_, NDI_TESTSRC_PATH, &actions, nullptr, argv.data(), environ) != 0) pid_ = -1;
  posix_spawn_file_actions_destroy(&actions);
  ::close(pipe_fds[1]);
  out_fd_ = pipe_fds[0];
  reader_ = std::thread([this] { Read(); });
}

TestSource::~TestSource() {
  if (pid_ > 0 && !reaped_) {
    ::kill(pid_, SIGKILL);
    Wait(std::chrono::seconds(5));
  }
  if (reader_.joinable()) reader_.join();
  if (out_fd_ >= 0) ::close(out_fd_);
}

void TestSource::Read() {
  std::string pending;
  char buffer[4096];
  for (;;) {
    const ssize_t n = ::read(out_fd_, buffer, sizeof buffer);
    if (n < 0 && errno == EINTR) continue;
    if (n <= 0) break;
    pending.append(buffer, static_cast<std::size_t>(n));
    std::size_t nl;
    while ((nl = pending.find('\n')) != std::string::npos) {
      const std::string line = pending.substr(0, nl);
      pending.erase(0, nl + 1);
      nlohmann::json event = nlohmann::json::parse(line, nullptr, false);
      if (event.is_discarded()) event = {{"event", "unparsed"}, {"line", line}};
      std::lock_guard<std::mutex> lock(mutex_);
      events_.push_back(std::move(event));
      cv_.notify_all();
    }
  }
}

bool TestSource::WaitReady(std::chrono::milliseconds timeout) {
  nlohmann::json ready = WaitEvent([](const nlohmann::json& e) { return e.value("event", "") == "ready"; }, timeout);
  if (ready.is_null()) return false;
  name_ = ready.value("name", "");
  url_ = ready.value("url", "");
  return true;
}

nlohmann::json TestSource::WaitEvent(const std::function<bool(const nlohmann::json&)>& match,
                                     std::chrono::milliseconds timeout, std::size_t* from) {
  std::unique_lock<std::mutex> lock(mutex_);
  std::size_t next = from != nullptr ? *from : 0;
  nlohmann::json found;
  cv_.wait_for(lock, timeout, [&] {
    for (; next < events_.size(); ++next) {
      if (match(events_[next])) {
        found = events_[next];
        ++next;
        return true;
      }
    }
    return false;
  });
  if (from != nullptr) *from = next;
  return found;
}

std::vector<nlohmann::json> TestSource::Events() const {
  std::lock_guard<std::mutex> lock(mutex_);
  return events_;
}

void TestSource::Signal(int sig) {
  if (pid_ > 0 && !reaped_) ::kill(pid_, sig);
}

int TestSource::Wait(std::chrono::milliseconds timeout) {
  if (pid_ <= 0 || reaped_) return -1;
  const auto deadline = std::chrono::steady_clock::now() + timeout;
  for (;;) {
    int status = 0;
    const pid_t r = ::waitpid(pid_, &status, WNOHANG);
    if (r == pid_) {
      reaped_ = true;
      return WIFEXITED(status) ? WEXITSTATUS(status) : 128 + WTERMSIG(status);
    }
    if (std::chrono::steady_clock::now() >= deadline) return -1;
    std::this_thread::sleep_for(std::chrono::milliseconds(5));
  }
}

RegistryDir::RegistryDir() {
  char tmpl[] = "/tmp/ndilb-test-XXXXXX";
  if (::mkdtemp(tmpl) != nullptr) path_ = tmpl;
  ::setenv("NDI_LOOPBACK_DIR", path_.c_str(), 1);
}

RegistryDir::~RegistryDir() {
  if (DIR* d = ::opendir(path_.c_str())) {
    while (dirent* e = ::readdir(d)) {
      if (std::strcmp(e->d_name, ".") != 0 && std::strcmp(e->d_name, "..") != 0) {
        ::unlink((path_ + "/" + e->d_name).c_str());
      }
    }
    ::closedir(d);
  }
  ::rmdir(path_.c_str());
  ::unsetenv("NDI_LOOPBACK_DIR");
}

}  // namespace ndilbtest
