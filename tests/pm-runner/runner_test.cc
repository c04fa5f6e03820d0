// pm-runner as a process: the test plays the host (it listens on 127.0.0.1
// and starts the runner on a test task module) and checks what only the
// process shows: who answers, its exit statuses, its stderr lines, its
// signals, and when it ends. Messages, frames and handlers are tested in
// process with the dispatcher and the frame reader.
#include <gtest/gtest.h>

#include <signal.h>
#include <unistd.h>

#include <chrono>
#include <string>

#include "support/runner_child.h"

namespace {

using namespace std::chrono_literals;
using namespace pmtest;

// The orderly end: Shutdown, then the task is destroyed.
void ExpectOrderlyEnd(RunnerProcess& runner) {
  EXPECT_EQ(runner.Wait(), 0);
  const std::string err = runner.Stderr();
  ASSERT_NE(err.find("EchoTask: destroyed"), std::string::npos) << err;
  EXPECT_LT(err.find("EchoTask: Shutdown"), err.find("EchoTask: destroyed")) << err;
  EXPECT_EQ(err.find("did not stop"), std::string::npos) << err;
}

// The runner lives as long as one of its connections does: a connection that
// goes leaves the others served (how a bad frame ends one: the dispatcher's
// tests); the task stopping itself at its first connection's first request
// ends every connection and the runner, also the ones added after it.
TEST(Runner, OutlivesAClosedConnectionAndEndsWithTheTask) {
  HostListener first, second;
  RunnerProcess runner(Args(PM_ECHO_TASK_PATH, {first.Port(), second.Port()}));
  HostPeer a = first.Accept();
  HostPeer b = second.Accept();
  ASSERT_TRUE(a.Valid() && b.Valid());
  a.Close();
  EXPECT_EQ(pmtest::Ask(b, "test::echo", 1, {{"value", 1}})["value"], 1);
  EXPECT_FALSE(runner.Wait(200ms).has_value());

  HostListener third;
  RunnerProcess two(Args(PM_ECHO_TASK_PATH, {first.Port(), third.Port()}));
  HostPeer c = first.Accept();
  HostPeer d = third.Accept();
  ASSERT_TRUE(c.Valid() && d.Valid());
  ASSERT_TRUE(c.WriteJson(pmtest::Request("test::stop_task", 1)));
  EXPECT_TRUE(c.SeesEndOfStream());
  EXPECT_TRUE(d.SeesEndOfStream());
  ExpectOrderlyEnd(two);
  b.Close();
  EXPECT_EQ(runner.Wait(), 0);
}

// The host leaving, SIGTERM and SIGINT (0: the host leaves) all end the runner
// in order; it answers from its own process until then.
TEST(Runner, TheHostLeavingAndStopSignalsTakeTheOrderlyPath) {
  for (int signal : {0, SIGTERM, SIGINT}) {
    SCOPED_TRACE(signal);
    pmtest::RunnerOnPort r(PM_ECHO_TASK_PATH);
    ASSERT_TRUE(r.Ready());
    EXPECT_NE(pmtest::Ask(r.host, "test::echo", 1, {{"value", "x"}})["pid"], ::getpid());
    if (signal == 0) {
      r.host.Close();
    } else {
      r.runner.Signal(signal);
      EXPECT_TRUE(r.host.SeesEndOfStream());
    }
    ExpectOrderlyEnd(r.runner);
    EXPECT_EQ(r.runner.Stderr().find("stop signal received") != std::string::npos, signal != 0);
  }
}

// Every way the runner cannot start serving, with its exit status and the
// line that says why; none of them hangs or leaves a connection behind.
TEST(Runner, ExitStatusesAndLinesOfARunnerThatCannotServe) {
  const int closedPort = HostListener().Port();  // closed again at once
  HostListener listener;
  const struct {
    std::vector<std::string> args;
    int status;
    std::vector<std::string> lines;
  } cases[] = {
      // The module's own line reaches the runner's sink: it found the export.
      {Args(PM_NULL_TASK_PATH, {listener.Port()}), 3, {"NullTask: runtime unusable", "gave no task"}},
      {Args("/nonexistent/libtask.so", {listener.Port()}), 2, {"/nonexistent/libtask.so"}},
      {Args(PM_ECHO_TASK_PATH, {closedPort}), 4, {"cannot connect to port", "EchoTask: destroyed"}},
      {Args(PM_ECHO_TASK_PATH, {}), 2, {}},  // no --connect
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(::testing::PrintToString(c.args));
    RunnerProcess runner(c.args);
    EXPECT_EQ(runner.Wait(), c.status);
    for (const std::string& line : c.lines) EXPECT_NE(runner.Stderr().find(line), std::string::npos) << line;
  }
  EXPECT_FALSE(listener.Accept(100ms).Valid());
}

}  // namespace
