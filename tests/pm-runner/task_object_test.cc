// pm::Task as the runner relies on it: StopTask empties the dispatcher queue
// and stops each dispatcher once, stops and releases the server, and the
// destructor stops connections without running the derived Shutdown.
#include <gtest/gtest.h>

#include <atomic>
#include <memory>

#include "pm/ipc/dispatcher.h"
#include "pm/ipc/server.h"
#include "pm/task/task.h"

namespace {

class CountingTask : public pm::Task {
 public:
  explicit CountingTask(std::atomic<int>* shutdowns) : shutdowns_(shutdowns) {}
  void Shutdown() override { shutdowns_->fetch_add(1); }

 private:
  std::atomic<int>* shutdowns_;
};

// A dispatcher without a connection whose Stop is counted instead of slept.
std::shared_ptr<pm::RpcDispatcher> CountedDispatcher(std::atomic<int>* stops) {
  pm::DispatcherTiming timing = pm::DispatcherTiming::Steady();
  timing.sleep = [stops](std::int64_t) { stops->fetch_add(1); };
  auto dispatcher = std::make_shared<pm::RpcDispatcher>(nullptr, timing);
  dispatcher->Start();
  return dispatcher;
}

TEST(TaskObject, StopTaskShutsDownThenStopsEveryDispatcherOnceAndReleasesTheServer) {
  std::atomic<int> shutdowns{0};
  std::atomic<int> stops{0};
  CountingTask task(&shutdowns);
  task.AddDispatcher(CountedDispatcher(&stops));
  task.AddDispatcher(CountedDispatcher(&stops));
  std::shared_ptr<pm::ipc::Server> server = pm::ipc::Server::CreateListening();
  ASSERT_TRUE(server);
  std::weak_ptr<pm::ipc::Server> weakServer = server;
  task.SetServer(std::move(server));

  task.StopTask();
  EXPECT_EQ(shutdowns.load(), 1);
  EXPECT_EQ(stops.load(), 2);
  EXPECT_EQ(task.DispatcherCount(), 0u);
  EXPECT_TRUE(weakServer.expired());

  // Again (the destructor does it too): Shutdown runs, nothing is stopped twice.
  task.StopTask();
  EXPECT_EQ(shutdowns.load(), 2);
  EXPECT_EQ(stops.load(), 2);
}

TEST(TaskObject, DestructorStopsDispatchersButNotTheDerivedWork) {
  std::atomic<int> shutdowns{0};
  std::atomic<int> stops{0};
  auto dispatcher = CountedDispatcher(&stops);
  pm::TaskBase* task = new CountingTask(&shutdowns);
  static_cast<pm::Task*>(task)->AddDispatcher(dispatcher);
  delete task;  // through the base, as the runner does
  EXPECT_EQ(shutdowns.load(), 0);
  EXPECT_EQ(stops.load(), 1);
  EXPECT_EQ(dispatcher.use_count(), 1);  // the queue let go
}

}  // namespace
