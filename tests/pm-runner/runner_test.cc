// pm-runner end to end: the test plays the host. It listens on 127.0.0.1,
// starts the runner on a test task module and speaks the message framing:
// handlers, bad input on the wire, the task's own requests, and every way the
// runner ends (host gone, task stopped itself, signals, no task, no module).
#include <gtest/gtest.h>

#include <signal.h>
#include <unistd.h>

#include <chrono>
#include <string>

#include "pm-runner/runner_process.h"

namespace {

using Json = nlohmann::json;
using namespace std::chrono_literals;
using pmtest::Args;
using pmtest::Ask;
using pmtest::Echoes;
using pmtest::HostListener;
using pmtest::HostPeer;
using pmtest::RunnerProcess;

TEST(Runner, AnswersHandlersAndErrorsAndSkipsBadTextOnALiveConnection) {
  HostListener listener;
  RunnerProcess runner(Args(PM_ECHO_TASK_PATH, {listener.Port()}));
  ASSERT_TRUE(runner.Started());
  HostPeer host = listener.Accept();
  ASSERT_TRUE(host.Valid());

  const Json echo = Ask(host, "test::echo", 1, {{"value", "x"}});
  EXPECT_EQ(echo["value"], "x");
  EXPECT_EQ(echo["pm::unique_id"], 1);
  EXPECT_EQ(echo["pm::command"], "test::echo");
  EXPECT_EQ(echo["pm::response"], true);
  EXPECT_NE(echo["pid"], ::getpid());  // answered by the runner's process

  const Json unknown = Ask(host, "pm::tsrc::no_such_command", 2);
  EXPECT_EQ(unknown["pm::error"], "unknown command");
  EXPECT_EQ(unknown["pm::unique_id"], 2);

  const Json thrown = Ask(host, "test::throw", 3);
  EXPECT_EQ(thrown["pm::error"], "the handler failed on purpose");
  EXPECT_EQ(thrown["pm::unique_id"], 3);

  ASSERT_TRUE(host.WriteFrame("this is not json"));
  ASSERT_TRUE(host.WriteFrame("[\"an\",\"array\"]"));
  ASSERT_TRUE(host.WriteFrame(""));
  EXPECT_TRUE(Echoes(host, 4));  // the first frame back answers this request

  host.Close();
  EXPECT_EQ(runner.Wait(), 0);
  const std::string err = runner.Stderr();
  EXPECT_NE(err.find("message is not JSON, skipped: 'this is not json'"), std::string::npos) << err;
  EXPECT_NE(err.find("message is not a JSON object, skipped"), std::string::npos) << err;
  EXPECT_NE(err.find("the handler failed on purpose"), std::string::npos) << err;
  // The orderly end: Shutdown, then the task is destroyed.
  const auto shutdown = err.find("EchoTask: Shutdown");
  const auto destroyed = err.find("EchoTask: destroyed");
  ASSERT_NE(shutdown, std::string::npos) << err;
  ASSERT_NE(destroyed, std::string::npos) << err;
  EXPECT_LT(shutdown, destroyed);
}

TEST(Runner, OversizeLengthClosesOnlyThatConnection) {
  HostListener first;
  HostListener second;
  RunnerProcess runner(Args(PM_ECHO_TASK_PATH, {first.Port(), second.Port()}));
  ASSERT_TRUE(runner.Started());
  HostPeer a = first.Accept();
  HostPeer b = second.Accept();
  ASSERT_TRUE(a.Valid());
  ASSERT_TRUE(b.Valid());
  EXPECT_TRUE(Echoes(a, 1));
  EXPECT_TRUE(Echoes(b, 1));

  // A length prefix far over the limit and no body: the runner must neither
  // wait for the body nor die.
  ASSERT_TRUE(a.WriteRaw(HostPeer::Prefix(0xFFFFFFF0u)));
  EXPECT_TRUE(a.SeesEndOfStream());
  EXPECT_TRUE(Echoes(b, 2));
  EXPECT_EQ(runner.Wait(200ms), -2);  // still running for the other connection

  b.Close();
  EXPECT_EQ(runner.Wait(), 0);
  EXPECT_NE(runner.Stderr().find("exceeds 524288, closing the connection"), std::string::npos);
}

TEST(Runner, HostLeavingInsideAFrameEndsTheRunnerCleanly) {
  HostListener listener;
  RunnerProcess runner(Args(PM_ECHO_TASK_PATH, {listener.Port()}));
  HostPeer host = listener.Accept();
  ASSERT_TRUE(host.Valid());
  EXPECT_TRUE(Echoes(host, 1));
  ASSERT_TRUE(host.WriteRaw(HostPeer::Prefix(1000) + "{\"pm::command\":"));
  host.Close();
  EXPECT_EQ(runner.Wait(), 0);
  const std::string err = runner.Stderr();
  EXPECT_NE(err.find("connection ended inside a frame"), std::string::npos) << err;
  EXPECT_NE(err.find("EchoTask: destroyed"), std::string::npos) << err;
}

TEST(Runner, TaskStoppingItselfEndsEveryConnectionAndTheRunner) {
  HostListener first;
  HostListener second;
  RunnerProcess runner(Args(PM_ECHO_TASK_PATH, {first.Port(), second.Port()}));
  HostPeer a = first.Accept();
  HostPeer b = second.Accept();
  ASSERT_TRUE(a.Valid());
  ASSERT_TRUE(b.Valid());
  EXPECT_TRUE(Echoes(b, 1));

  ASSERT_TRUE(a.WriteJson({{"pm::command", "test::stop_task"}, {"pm::unique_id", 1}}));
  EXPECT_TRUE(a.SeesEndOfStream());
  EXPECT_TRUE(b.SeesEndOfStream());
  EXPECT_EQ(runner.Wait(), 0);
  const std::string err = runner.Stderr();
  EXPECT_NE(err.find("EchoTask: destroyed"), std::string::npos) << err;
  EXPECT_EQ(err.find("did not stop"), std::string::npos) << err;
}

TEST(Runner, RepliesToTheTasksOwnRequestsRunTheirCallbacks) {
  HostListener listener;
  RunnerProcess runner(Args(PM_ECHO_TASK_PATH, {listener.Port()}));
  HostPeer host = listener.Accept();
  ASSERT_TRUE(host.Valid());

  ASSERT_TRUE(host.WriteJson({{"pm::command", "test::ask_host"}, {"pm::unique_id", 5}, {"question", "why"}}));
  // The task's question and the reply to the host's request, in either order.
  Json question;
  Json reply;
  for (int i = 0; i < 2; ++i) {
    const Json frame = host.ReadJson(10s);
    ASSERT_TRUE(frame.is_object());
    if (frame.value("pm::request", false)) {
      question = frame;
    } else {
      reply = frame;
    }
  }
  EXPECT_EQ(question["pm::command"], "test::question");
  EXPECT_EQ(question["question"], "why");
  EXPECT_EQ(reply["pm::unique_id"], 5);
  EXPECT_EQ(reply["asked"], question["pm::unique_id"]);

  ASSERT_TRUE(host.WriteJson(
      {{"pm::response", true}, {"pm::unique_id", question["pm::unique_id"]}, {"answer", 42}}));
  const Json note = host.ReadJson(10s);
  EXPECT_EQ(note["pm::command"], "test::callback_ran");
  EXPECT_EQ(note["answer"], 42);
  EXPECT_EQ(note["error"], "");

  // A reply to a request that was never made is only logged.
  ASSERT_TRUE(host.WriteJson({{"pm::response", true}, {"pm::unique_id", 123456}}));
  EXPECT_TRUE(Echoes(host, 6));

  host.Close();
  EXPECT_EQ(runner.Wait(), 0);
  EXPECT_NE(runner.Stderr().find("reply to unknown request 123456"), std::string::npos);
}

TEST(Runner, StopSignalsTakeTheOrderlyPath) {
  for (int signal : {SIGTERM, SIGINT}) {
    SCOPED_TRACE(signal);
    HostListener listener;
    RunnerProcess runner(Args(PM_ECHO_TASK_PATH, {listener.Port()}));
    HostPeer host = listener.Accept();
    ASSERT_TRUE(host.Valid());
    EXPECT_TRUE(Echoes(host, 1));  // running and attached

    runner.Signal(signal);
    EXPECT_TRUE(host.SeesEndOfStream());
    EXPECT_EQ(runner.Wait(), 0);
    const std::string err = runner.Stderr();
    EXPECT_NE(err.find("stop signal received"), std::string::npos) << err;
    EXPECT_NE(err.find("EchoTask: Shutdown"), std::string::npos) << err;
    EXPECT_NE(err.find("EchoTask: destroyed"), std::string::npos) << err;
  }
}

TEST(Runner, FactoryWithoutATaskExitsWithStatus3) {
  HostListener listener;
  RunnerProcess runner(Args(PM_NULL_TASK_PATH, {listener.Port()}));
  EXPECT_EQ(runner.Wait(), 3);
  const std::string err = runner.Stderr();
  // The module's own line reaches the runner's sink: it found the export.
  EXPECT_NE(err.find("NullTask: runtime unusable"), std::string::npos) << err;
  EXPECT_NE(err.find("gave no task"), std::string::npos) << err;
  EXPECT_FALSE(listener.Accept(100ms).Valid());  // nothing was connected
}

TEST(Runner, MissingModuleOrUnreachableHostFailsWithoutHanging) {
  HostListener listener;
  {
    RunnerProcess runner(Args("/nonexistent/libtask.so", {listener.Port()}));
    EXPECT_EQ(runner.Wait(), 2);  // a usage error: the path names no file
    EXPECT_NE(runner.Stderr().find("/nonexistent/libtask.so"), std::string::npos);
  }
  int closedPort = 0;
  {
    HostListener gone;
    closedPort = gone.Port();
  }
  {
    RunnerProcess runner(Args(PM_ECHO_TASK_PATH, {closedPort}));
    EXPECT_EQ(runner.Wait(), 4);
    const std::string err = runner.Stderr();
    EXPECT_NE(err.find("cannot connect to port"), std::string::npos) << err;
    EXPECT_NE(err.find("EchoTask: destroyed"), std::string::npos) << err;
  }
  {
    RunnerProcess runner({"--module", PM_ECHO_TASK_PATH});  // no --connect
    EXPECT_EQ(runner.Wait(), 2);
  }
}

}  // namespace
