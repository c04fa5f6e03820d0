#include "pm-host/process.h"

#include "pm/runtime/thread_name.h"

namespace pmhost {

void ChildProcess::ReadLines(const std::function<long long(char*, std::size_t)>& read) {
  pm::SetThreadName("pm-host stdout");
  auto deliver = [this](std::string line) {
    if (!line.empty() && line.back() == '\r') line.pop_back();  // a Windows child's text mode
    if (options_.onLine) options_.onLine(line);
  };
  std::string pending;
  char buffer[4096];
  for (;;) {
    const long long n = read(buffer, sizeof buffer);
    if (n <= 0) break;
    pending.append(buffer, static_cast<std::size_t>(n));
    std::size_t end = 0;
    while ((end = pending.find('\n')) != std::string::npos) {
      std::string line = pending.substr(0, end);
      pending.erase(0, end + 1);
      deliver(std::move(line));
    }
    if (pending.size() > (1u << 20)) pending.clear();  // a line without end is dropped, not kept for ever
  }
  if (!pending.empty()) deliver(std::move(pending));
  pm::ClearThreadName();
}

void ChildProcess::Exited(const std::function<int()>& reap) {
  int status = 0;
  {
    // Reaped under the lock, so that Signal never reaches a reaped id.
    std::lock_guard<std::mutex> guard(lock_);
    status = status_ = reap();
    exited_ = true;
  }
  changed_.notify_all();
  if (options_.onExit) options_.onExit(status);
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

}  // namespace pmhost
