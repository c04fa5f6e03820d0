// pm-runner end to end: the test plays the host. It listens on 127.0.0.1,
// starts the runner on a test task module and speaks the message framing:
// handlers, bad input on the wire, the task's own requests, and every way the
// runner ends (host gone, task stopped itself, signals, no task, no module).
#include <gtest/gtest.h>

#include <fcntl.h>
#include <signal.h>
#include <spawn.h>
#include <sys/wait.h>
#include <unistd.h>

#include <atomic>
#include <chrono>
#include <fstream>
#include <sstream>
#include <string>
#include <thread>
#include <vector>

#include "pm/runtime/host_socket.h"

extern char** environ;

namespace {

using Json = nlohmann::json;
using namespace std::chrono_literals;
using pmtest::HostListener;
using pmtest::HostPeer;

// Generous: the sanitizer builds start processes slowly on a busy machine.
constexpr auto kExitLimit = 20s;

// The runner as a child process; its stderr goes to a file.
class RunnerProcess {
 public:
  explicit RunnerProcess(const std::vector<std::string>& args) {
    static std::atomic<int> counter{0};
    stderrPath_ = ::testing::TempDir() + "pm-runner-" + std::to_string(::getpid()) + "-" +
                  std::to_string(counter.fetch_add(1)) + ".log";
    std::vector<std::string> all = {PM_RUNNER_PATH};
    all.insert(all.end(), args.begin(), args.end());
    std::vector<char*> argv;
    for (auto& arg : all) argv.push_back(arg.data());
    argv.push_back(nullptr);

    posix_spawn_file_actions_t actions;
    posix_spawn_file_actions_init(&actions);
    posix_spawn_file_actions_addopen(&actions, STDERR_FILENO, stderrPath_.c_str(),
                                     O_WRONLY | O_CREAT | O_TRUNC, 0600);
    if (posix_spawn(&pid_, PM_RUNNER_PATH, &actions, nullptr, argv.data(), environ) != 0) pid_ = -1;
    posix_spawn_file_actions_destroy(&actions);
  }
  ~RunnerProcess() {
    if (pid_ > 0) {
      ::kill(pid_, SIGKILL);
      int status = 0;
      ::waitpid(pid_, &status, 0);
    }
    ::unlink(stderrPath_.c_str());
  }
  RunnerProcess(const RunnerProcess&) = delete;
  RunnerProcess& operator=(const RunnerProcess&) = delete;

  bool Started() const { return pid_ > 0; }
  void Signal(int signal) { ::kill(pid_, signal); }

  // The exit status; -1 when it ended by a signal, -2 when it is still
  // running after the limit.
  int Wait(std::chrono::milliseconds limit = kExitLimit) {
    const auto deadline = std::chrono::steady_clock::now() + limit;
    while (std::chrono::steady_clock::now() < deadline) {
      int status = 0;
      const pid_t done = ::waitpid(pid_, &status, WNOHANG);
      if (done == pid_) {
        pid_ = -1;
        return WIFEXITED(status) ? WEXITSTATUS(status) : -1;
      }
      std::this_thread::sleep_for(5ms);
    }
    return -2;
  }

  std::string Stderr() const {
    std::ifstream in(stderrPath_);
    std::stringstream text;
    text << in.rdbuf();
    return text.str();
  }

 private:
  pid_t pid_ = -1;
  std::string stderrPath_;
};

std::vector<std::string> Args(const char* module, std::initializer_list<int> ports) {
  std::vector<std::string> args = {"--module", module};
  for (int port : ports) {
    args.push_back("--connect");
    args.push_back(std::to_string(port));
  }
  return args;
}

Json Ask(HostPeer& host, const std::string& command, std::uint64_t id, Json body = Json::object()) {
  body["pm::command"] = command;
  body["pm::unique_id"] = id;
  body["pm::request"] = true;
  EXPECT_TRUE(host.WriteJson(body));
  return host.ReadJson(10s);
}

bool Echoes(HostPeer& host, std::uint64_t id) {
  const Json reply = Ask(host, "test::echo", id, {{"value", id}});
  return reply.is_object() && reply.value("value", Json()) == id && reply["pm::unique_id"] == id;
}

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
    EXPECT_EQ(runner.Wait(), 2);
    EXPECT_NE(runner.Stderr().find("cannot load"), std::string::npos);
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
