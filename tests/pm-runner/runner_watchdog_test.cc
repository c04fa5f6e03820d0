// A task whose handler does not return keeps the runner from ending: it must
// give up after 5 seconds with exit status 1 instead of hanging.
#include <gtest/gtest.h>

#include <signal.h>

#include <chrono>

#include "support/runner_child.h"

namespace {

using namespace std::chrono_literals;

TEST(RunnerWatchdog, WorkerThatDoesNotStopEndsTheProcessWithStatus1) {
  pmtest::RunnerOnPort r(PM_ECHO_TASK_PATH);
  ASSERT_TRUE(r.Ready());
  ASSERT_TRUE(r.host.WriteJson(pmtest::Request("test::hang", 2)));
  EXPECT_EQ(r.host.ReadJson(10s).value("pm::command", ""), "test::hanging");

  const auto start = std::chrono::steady_clock::now();
  r.runner.Signal(SIGTERM);
  EXPECT_EQ(r.runner.Wait(30s), 1);
  EXPECT_GE(std::chrono::steady_clock::now() - start, 4s);
  EXPECT_NE(r.runner.Stderr().find("did not stop within 5 seconds"), std::string::npos) << r.runner.Stderr();
}

}  // namespace
