// The task object: TaskBase and Task.
#include "pm/task/task.h"

#include <utility>

#include "pm/ipc/dispatcher.h"
#include "pm/ipc/server.h"

namespace pm {

TaskBase::~TaskBase() = default;

Task::~Task() {
  StopTask();
  runnerShared_.reset();
}

void Task::StopTask() {
  Shutdown();
  std::deque<std::shared_ptr<RpcDispatcher>> dispatchers;
  std::shared_ptr<ipc::Server> server;
  {
    std::lock_guard<std::mutex> guard(taskLock_);
    dispatchers.swap(dispatchers_);
    server = std::move(server_);
  }
  for (const std::shared_ptr<RpcDispatcher>& dispatcher : dispatchers) {
    if (dispatcher) dispatcher->Stop();
  }
  dispatchers.clear();
  if (server) {
    server->Stop();
    server.reset();
  }
}

void Task::AddDispatcher(std::shared_ptr<RpcDispatcher> dispatcher) {
  std::lock_guard<std::mutex> guard(taskLock_);
  dispatchers_.push_back(std::move(dispatcher));
}

void Task::SetServer(std::shared_ptr<ipc::Server> server) {
  std::lock_guard<std::mutex> guard(taskLock_);
  server_ = std::move(server);
}

std::size_t Task::DispatcherCount() const {
  std::lock_guard<std::mutex> guard(taskLock_);
  return dispatchers_.size();
}

}  // namespace pm
