#include "pm-host/process.h"

#include <fcntl.h>
#include <signal.h>
#include <spawn.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cerrno>
#include <climits>
#include <cstring>

#include "pm/runtime/log.h"
#include "pm/runtime/syscall.h"
#include "pm/runtime/thread_name.h"

extern char** environ;

namespace pmhost {

ChildProcess::~ChildProcess() {
  if (pid_ > 0) {
    Signal(SIGKILL);
    Wait(std::chrono::hours(1));
  }
  if (watcher_.joinable()) watcher_.join();
  if (reader_.joinable()) reader_.join();
}

bool ChildProcess::Start(ChildOptions options) {
  if (pid_ > 0) return false;
  options_ = std::move(options);
  std::vector<std::string> argvText = {options_.path};
  argvText.insert(argvText.end(), options_.args.begin(), options_.args.end());
  std::vector<char*> argv;
  for (auto& arg : argvText) argv.push_back(arg.data());
  argv.push_back(nullptr);

  std::vector<std::string> envText;
  for (char** e = environ; *e != nullptr; ++e) {
    const std::string entry = *e;
    const std::string key = entry.substr(0, entry.find('='));
    if (options_.env.count(key) == 0) envText.push_back(entry);
  }
  for (const auto& [key, value] : options_.env) envText.push_back(key + "=" + value);
  std::vector<char*> envp;
  for (auto& entry : envText) envp.push_back(entry.data());
  envp.push_back(nullptr);

  int pipeFds[2] = {-1, -1};
  if (options_.captureStdout && ::pipe2(pipeFds, O_CLOEXEC) != 0) {
    pm::Log(pm::LogType::Normal, "", "ChildProcess: pipe failed: %s\n", pm::ErrnoText(errno).c_str());
    return false;
  }
  posix_spawn_file_actions_t actions;
  posix_spawn_file_actions_init(&actions);
  if (options_.captureStdout) posix_spawn_file_actions_adddup2(&actions, pipeFds[1], STDOUT_FILENO);
  if (!options_.stderrPath.empty()) {
    posix_spawn_file_actions_addopen(&actions, STDERR_FILENO, options_.stderrPath.c_str(),
                                     O_WRONLY | O_CREAT | O_APPEND, 0600);
  }
  // The child starts with default signal handling and nothing blocked.
  posix_spawnattr_t attributes;
  posix_spawnattr_init(&attributes);
  sigset_t none, all;
  sigemptyset(&none);
  sigfillset(&all);
  posix_spawnattr_setsigmask(&attributes, &none);
  posix_spawnattr_setsigdefault(&attributes, &all);
  posix_spawnattr_setflags(&attributes, POSIX_SPAWN_SETSIGMASK | POSIX_SPAWN_SETSIGDEF);
  pid_t pid = -1;
  const int error = ::posix_spawn(&pid, options_.path.c_str(), &actions, &attributes, argv.data(), envp.data());
  posix_spawn_file_actions_destroy(&actions);
  posix_spawnattr_destroy(&attributes);
  if (options_.captureStdout) ::close(pipeFds[1]);
  if (error != 0) {
    pm::Log(pm::LogType::Normal, "", "ChildProcess: cannot start '%s': %s\n", options_.path.c_str(),
            pm::ErrnoText(error).c_str());
    if (options_.captureStdout) ::close(pipeFds[0]);
    return false;
  }
  pid_ = pid;
  watcher_ = std::thread([this] { Watch(); });
  if (options_.captureStdout) {
    const int fd = pipeFds[0];
    reader_ = std::thread([this, fd] { ReadLines(fd); });
  }
  return true;
}

void ChildProcess::Watch() {
  pm::SetThreadName("pm-host child");
  siginfo_t info{};
  // Waits for the end without reaping, so that Signal never reaches another
  // process that was given the same id.
  while (::waitid(P_PID, static_cast<id_t>(pid_), &info, WEXITED | WNOWAIT) != 0 && errno == EINTR) {
  }
  int status = 0;
  int result = 0;
  {
    std::lock_guard<std::mutex> guard(lock_);
    result = pm::RetryEintr([&] { return ::waitpid(pid_, &status, 0); });
    status_ = result == pid_ ? (WIFEXITED(status) ? WEXITSTATUS(status) : 128 + WTERMSIG(status)) : 255;
    exited_ = true;
  }
  changed_.notify_all();
  if (options_.onExit) options_.onExit(status_);
  pm::ClearThreadName();
}

void ChildProcess::ReadLines(int fd) {
  pm::SetThreadName("pm-host stdout");
  std::string pending;
  char buffer[4096];
  for (;;) {
    const ssize_t n = pm::RetryEintr([&] { return ::read(fd, buffer, sizeof buffer); });
    if (n <= 0) break;
    pending.append(buffer, static_cast<std::size_t>(n));
    std::size_t end = 0;
    while ((end = pending.find('\n')) != std::string::npos) {
      const std::string line = pending.substr(0, end);
      pending.erase(0, end + 1);
      if (options_.onLine) options_.onLine(line);
    }
    if (pending.size() > (1u << 20)) pending.clear();  // a line without end is dropped, not kept for ever
  }
  if (!pending.empty() && options_.onLine) options_.onLine(pending);
  ::close(fd);
  pm::ClearThreadName();
}

bool ChildProcess::Running() const {
  std::lock_guard<std::mutex> guard(lock_);
  return pid_ > 0 && !exited_;
}

std::optional<int> ChildProcess::Wait(std::chrono::milliseconds limit) {
  if (pid_ <= 0) return std::nullopt;
  std::unique_lock<std::mutex> lock(lock_);
  if (!changed_.wait_for(lock, limit, [this] { return exited_; })) return std::nullopt;
  return status_;
}

void ChildProcess::Signal(int signal) {
  std::lock_guard<std::mutex> guard(lock_);
  if (pid_ > 0 && !exited_) ::kill(pid_, signal);
}

int ChildProcess::Terminate(std::chrono::milliseconds grace) {
  Signal(SIGTERM);
  if (auto status = Wait(grace)) return *status;
  Signal(SIGKILL);
  return Wait(std::chrono::hours(1)).value_or(255);
}

std::string ProgramDirectory() {
  char path[PATH_MAX];
  const ssize_t n = ::readlink("/proc/self/exe", path, sizeof path - 1);
  if (n <= 0) return {};
  std::string text(path, static_cast<std::size_t>(n));
  const std::size_t slash = text.rfind('/');
  return slash == std::string::npos ? std::string() : text.substr(0, slash + 1);
}

}  // namespace pmhost
