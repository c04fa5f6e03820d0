#pragma once
// The task object as the runner sees it: pm::TaskBase and pm::Task. Every
// task module's task derives from pm::Task (pm::TaskSource does); its factory
// returns it as a pm::TaskBase pointer that the runner owns and ends with the
// virtual (deleting) destructor.
//
// The runner and the module each compile this header, and the runner calls
// the virtual operations by position: declaration order is the slot order and
// the field order is the layout. Keep both as they are; add nothing to these
// two classes.
//
// Which thread calls what: the runner calls the constructor, AttachDispatcher,
// Shutdown and the destructor on its main thread; StopTask may also run on a
// dispatcher's receive thread (a command handler that ends the task).
//
// Lock order: taskLock_ is taken alone; nothing is called while it is held.

#include <cstdint>
#include <deque>
#include <functional>
#include <list>
#include <memory>
#include <mutex>
#include <string>

namespace pm {

class RpcDispatcher;
namespace ipc {
class Server;
}  // namespace ipc

class TaskBase {
 public:
  TaskBase() = default;
  TaskBase(const TaskBase&) = delete;
  TaskBase& operator=(const TaskBase&) = delete;

  virtual ~TaskBase();
  // Runner slot; does nothing here.
  virtual void RunnerSlot1(void* /*unused*/) {}
  // Registers the task's command handlers on a dispatcher that the runner has
  // just added to the task. Here: releases the pointer, nothing else.
  virtual void AttachDispatcher(std::shared_ptr<RpcDispatcher> /*dispatcher*/) {}
  // Stops the task's work (sources, discovery). Here: nothing.
  virtual void Shutdown() {}
  // Runner slot; releases the pointer, nothing else.
  virtual void RunnerSlot4(std::shared_ptr<void> /*unused*/) {}

 private:
  // Runner fields; nothing in a task module reads them.
  std::int64_t runnerId_ = -1;
  std::string runnerName_;
  std::function<void()> runnerCallable_;
};

class Task : public TaskBase {
 public:
  Task() = default;
  // Runs StopTask (as a plain Task, so Shutdown does nothing here: only the
  // dispatchers and the server are stopped).
  ~Task() override;

  // Runner slot; returns 0.
  virtual std::int64_t RunnerSlot5() { return 0; }

  // Ends the task's connections: Shutdown, then Stop on every attached
  // dispatcher in the order they were added (outside the lock, so a command
  // handler on a dispatcher's receive thread may call this), then stops and
  // releases the server. Safe to call more than once and from several threads.
  void StopTask();

  // The runner's side: adds a dispatcher to the queue that StopTask empties.
  void AddDispatcher(std::shared_ptr<RpcDispatcher> dispatcher);
  // The runner may hand the task its IPC server; StopTask stops it.
  void SetServer(std::shared_ptr<ipc::Server> server);
  std::size_t DispatcherCount() const;

 private:
  // Runner fields; nothing in a task module reads them.
  std::int64_t runnerId_ = -1;
  std::string runnerName_;

  std::shared_ptr<ipc::Server> server_;  // guarded by taskLock_

  // Runner fields.
  std::list<std::function<void()>> runnerCallables_;
  std::function<void()> runnerCallable_;

  mutable std::mutex taskLock_;  // guards dispatchers_ and server_
  std::deque<std::shared_ptr<RpcDispatcher>> dispatchers_;  // guarded by taskLock_

  std::shared_ptr<void> runnerShared_;  // runner field; released by the destructor
};

}  // namespace pm
