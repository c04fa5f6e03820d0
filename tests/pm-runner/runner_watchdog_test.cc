// A task whose handler does not return keeps the runner from ending: it must
// give up after 5 seconds with exit status 1 instead of hanging.
#include <gtest/gtest.h>

#include <signal.h>

#include <chrono>

#include "pm-runner/runner_process.h"

namespace {

using namespace std::chrono_literals;

TEST(RunnerWatchdog, WorkerThatDoesNotStopEndsTheProcessWithStatus1) {
  pmtest::HostListener listener;
  pmtest::RunnerProcess runner(pmtest::Args(PM_ECHO_TASK_PATH, {listener.Port()}));
  pmtest::HostPeer host = listener.Accept();
  ASSERT_TRUE(host.Valid());
  EXPECT_TRUE(pmtest::Echoes(host, 1));
  ASSERT_TRUE(host.WriteJson({{"pm::command", "test::hang"}, {"pm::unique_id", 2}}));
  EXPECT_EQ(host.ReadJson(10s).value("pm::command", ""), "test::hanging");

  const auto start = std::chrono::steady_clock::now();
  runner.Signal(SIGTERM);
  EXPECT_EQ(runner.Wait(30s), 1);
  EXPECT_GE(std::chrono::steady_clock::now() - start, 4s);
  EXPECT_NE(runner.Stderr().find("did not stop within 5 seconds"), std::string::npos) << runner.Stderr();
}

}  // namespace
