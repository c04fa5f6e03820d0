// pm::Task as the runner relies on it: StopTask empties the dispatcher queue
// and stops each dispatcher once, stops and releases the server, and the
// destructor stops connections without running the derived Shutdown.
#include <gtest/gtest.h>

#include <memory>
#include <numeric>
#include <utility>
#include <vector>

#include "pm/ipc/dispatcher.h"
#include "pm/ipc/server.h"
#include "pm/task/task.h"
#include "support/manual_clock.h"

namespace {

struct CountingTask : pm::Task {
  void Shutdown() override { ++shutdowns; }
  static inline int shutdowns = 0;
};

// Dispatchers without a connection, each on a manual clock of its own, which
// counts Stop's grace sleep instead of sleeping it.
struct CountedDispatchers {
  std::vector<std::shared_ptr<pmtest::ManualClock>> clocks;
  std::shared_ptr<pm::RpcDispatcher> Make() {
    clocks.push_back(std::make_shared<pmtest::ManualClock>());
    auto dispatcher = std::make_shared<pm::RpcDispatcher>(nullptr, clocks.back());
    dispatcher->Start();
    return dispatcher;
  }
  int Stops() const {
    return std::accumulate(clocks.begin(), clocks.end(), 0, [](int n, const auto& c) { return n + c->Sleeps(); });
  }
};

TEST(TaskObject, StopTaskShutsDownThenStopsEveryDispatcherOnceAndTheDestructorOnlyStopsThem) {
  CountedDispatchers counted;
  const int& shutdowns = CountingTask::shutdowns;
  CountingTask task;
  task.AddDispatcher(counted.Make());
  task.AddDispatcher(counted.Make());
  std::shared_ptr<pm::ipc::Server> server = pm::ipc::Server::CreateListening();
  ASSERT_TRUE(server);
  std::weak_ptr<pm::ipc::Server> weakServer = server;
  task.SetServer(std::move(server));

  task.StopTask();
  EXPECT_EQ(std::make_pair(shutdowns, counted.Stops()), std::make_pair(1, 2));  // shutdowns, stops
  EXPECT_EQ(task.DispatcherCount(), 0u);
  EXPECT_TRUE(weakServer.expired());
  // Again (the destructor does it too): Shutdown runs, nothing is stopped twice.
  task.StopTask();
  EXPECT_EQ(std::make_pair(shutdowns, counted.Stops()), std::make_pair(2, 2));

  auto dispatcher = counted.Make();
  auto* other = new CountingTask();
  other->AddDispatcher(dispatcher);
  delete static_cast<pm::TaskBase*>(other);  // through the base, as the runner does
  EXPECT_EQ(std::make_pair(shutdowns, counted.Stops()), std::make_pair(2, 3));
  EXPECT_EQ(dispatcher.use_count(), 1);  // the queue let go
}

}  // namespace
