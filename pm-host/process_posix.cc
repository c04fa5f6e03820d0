#include <fcntl.h>
#include <signal.h>
#include <spawn.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cerrno>
#include <climits>
#include <cstring>

#include "pm-host/process.h"

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
  pid_ = static_cast<int>(pid);
  watcher_ = std::thread([this] { Watch(); });
  if (options_.captureStdout) {
    const int fd = pipeFds[0];
    reader_ = std::thread([this, fd] {
      ReadLines([fd](char* buffer, std::size_t size) -> long long {
        return pm::RetryEintr([&] { return ::read(fd, buffer, size); });
      });
      ::close(fd);
    });
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
  Exited([this] {
    int status = 0;
    const pid_t result = pm::RetryEintr([&] { return ::waitpid(static_cast<pid_t>(pid_), &status, 0); });
    if (result != pid_) return 255;
    return WIFEXITED(status) ? WEXITSTATUS(status) : 128 + WTERMSIG(status);
  });
  pm::ClearThreadName();
}

void ChildProcess::Signal(int signal) {
  std::lock_guard<std::mutex> guard(lock_);
  if (pid_ > 0 && !exited_) ::kill(static_cast<pid_t>(pid_), signal);
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
