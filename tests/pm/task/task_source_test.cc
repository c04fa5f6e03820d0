// pm::TaskSource through a real dispatcher over loopback, with scripted
// sources and discovery that write every call into one script: what each
// source is given, which running source or discovery is stopped before it is
// replaced or released, Shutdown's order, and the task stopping itself.
#include "pm/task/task_source.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <atomic>
#include <functional>
#include <memory>
#include <mutex>
#include <stdexcept>
#include <string>
#include <vector>

#include "pm/ipc/connection.h"
#include "pm/ipc/dispatcher.h"
#include "support/host_socket.h"
#include "support/log_capture.h"
#include "support/wait.h"

namespace {

using Json = nlohmann::json;
using namespace std::chrono_literals;

// Every call of the scripted objects, in order, as one line each, and what
// the objects made from now on do (the flags are read on the dispatcher's
// thread).
struct Script {
  void Add(std::string line) {
    std::lock_guard<std::mutex> guard(mutex);
    lines.push_back(std::move(line));
  }
  // The lines so far; with `clear`, forgotten afterwards.
  std::vector<std::string> Lines(bool clear = false) {
    std::lock_guard<std::mutex> guard(mutex);
    return clear ? std::exchange(lines, {}) : lines;
  }

  std::mutex mutex;  // guards lines
  std::vector<std::string> lines;
  std::atomic<bool> throwOnConfiguration{false};
  std::atomic<bool> throwOnStart{false};           // after recording the start
  std::atomic<bool> throwOnDiscoveryStart{false};  // after the hold below
  std::atomic<bool> discoveryStarting{false};      // a discovery's Start was entered
  std::atomic<bool> discoveryMayStart{true};       // false holds every discovery's Start
};

// Each scripted object writes its calls, tagged "<id>#<serial>", into the script.
struct ScriptedSource : pm::Source {
  ScriptedSource(std::shared_ptr<Callbacks> callbacks, std::string id, int serial, Script* script)
      : Source(std::move(callbacks), std::move(id)), tag(UniqueId() + "#" + std::to_string(serial)), script(script) {}
  void Start() override {
    script->Add("start " + tag);
    if (script->throwOnStart) throw std::runtime_error("start failed on purpose");
  }
  void Stop() override { script->Add("stop " + tag); }
  void SetConfiguration(std::string text) override {
    script->Add("config " + tag + " " + text);
    if (script->throwOnConfiguration) throw std::runtime_error("bad configuration on purpose");
  }
  std::string ValidateGui(std::string text) override { return Answer("validate ", text); }
  std::string GuiToConfiguration(std::string text) override { return Answer("to_config ", text); }
  std::string ConfigurationToGui(std::string text) override { return Answer("to_gui ", text); }
  void ExecuteCustomActionCommand(std::string command) override { script->Add("action " + tag + " " + command); }
  void HandleShotEvent(std::string event) override { script->Add("shot " + tag + " " + event); }
  void SourceHotplugEvent() override { script->Add("hotplug " + tag); }
  // A source with the id "notjson" answers text that is not JSON.
  std::string Answer(const char* call, const std::string& text) {
    script->Add(call + tag + " " + text);
    return UniqueId() == "notjson" ? "{not json" : R"({"answer":1})";
  }

  const std::string tag;
  Script* const script;
};

struct ScriptedDiscovery : pm::SourceDiscovery {
  ScriptedDiscovery(std::shared_ptr<Callbacks> callbacks, int serial, Script* script)
      : SourceDiscovery(std::move(callbacks)), tag("discovery#" + std::to_string(serial)), script(script) {}
  void Start() override {
    script->Add("start " + tag);
    script->discoveryStarting = true;
    pmtest::WaitFor([this] { return script->discoveryMayStart.load(); }, 60s);
    if (script->throwOnDiscoveryStart) throw std::runtime_error("discovery start failed on purpose");
  }
  void Stop() override { script->Add("stop " + tag); }
  void DiscoveryHotplugEvent() override { script->Add("hotplug " + tag); }

  const std::string tag;
  Script* const script;
};

// A task with scripted factories, one dispatcher attached as the runner
// attaches it, and the host's end of that connection.
class TaskSourceTest : public ::testing::Test {
 protected:
  void SetUp() override {
    task_ = std::make_unique<pm::TaskSource>();
    task_->SetSourceFactory([this](std::shared_ptr<pm::Source::Callbacks> callbacks, std::string id) {
      return std::make_shared<ScriptedSource>(std::move(callbacks), std::move(id), ++sourceSerial_, &script_);
    });
    task_->SetDiscoveryFactory([this](std::shared_ptr<pm::SourceDiscovery::Callbacks> callbacks) {
      return std::make_shared<ScriptedDiscovery>(std::move(callbacks), ++discoverySerial_, &script_);
    });
    host_ = Attach(listener_, &dispatcher_);
  }
  void TearDown() override {
    script_.discoveryMayStart = true;
    task_.reset();
    dispatcher_.reset();
  }

  // Attaches a connection from `listener` as the runner attaches it; returns
  // the host's end.
  pmtest::HostPeer Attach(pmtest::HostListener& listener, std::shared_ptr<pm::RpcDispatcher>* kept = nullptr) {
    auto dispatcher = std::make_shared<pm::RpcDispatcher>(pm::ipc::Connection::Open(listener.Port()));
    pmtest::HostPeer peer = listener.Accept();
    EXPECT_TRUE(peer.Valid());
    task_->AddDispatcher(dispatcher);
    task_->AttachDispatcher(dispatcher);
    dispatcher->Start();
    if (kept != nullptr) *kept = dispatcher;
    return peer;
  }

  // Sends a command and returns its reply, skipping the task's own requests
  // (a started source announces its buffer queue).
  Json Ask(const std::string& command, Json body = Json::object()) {
    return pmtest::Ask(host_, command, ++requestId_, std::move(body));
  }
  // Starts `id` with `config` (none when discarded).
  void StartSource(const std::string& id, const Json& config = Json::value_t::discarded) {
    Json body = {{"unique_id", id}};
    if (!config.is_discarded()) body["config"] = config;
    Ask("pm::tsrc::start_source", body);
  }

  pmtest::HostListener listener_;
  pmtest::HostPeer host_;
  std::shared_ptr<pm::RpcDispatcher> dispatcher_;
  std::unique_ptr<pm::TaskSource> task_;
  Script script_;
  std::atomic<int> sourceSerial_{0};
  std::atomic<int> discoverySerial_{0};
  std::uint64_t requestId_ = 0;
  pmtest::HostListener anotherListener_;
};

using Lines = std::vector<std::string>;

// Every object started and not the survivor was stopped, and the survivor was not.
void ExpectOnlySurvivorRunning(const Lines& lines, const std::string& prefix, const std::string& survivor) {
  int started = 0;
  for (const std::string& line : lines) {
    if (line.rfind("start " + prefix, 0) != 0) continue;
    ++started;
    const std::string tag = line.substr(6);
    const bool stopped = std::find(lines.begin(), lines.end(), "stop " + tag) != lines.end();
    EXPECT_EQ(stopped, tag != survivor) << tag;
  }
  EXPECT_GT(started, 1);
}

TEST_F(TaskSourceTest, EmptyConfigurationsGiveEmptyTextAndOthersStayExact) {
  const std::pair<Json, const char*> cases[] = {  // first: no configuration at all
      {Json::value_t::discarded, ""}, {Json::object(), ""}, {Json::array(), ""}, {Json(), ""},
      {Json::parse(R"({"a":1})"), R"({"a":1})"}, {Json::parse(R"([1,"x"])"), R"([1,"x"])"}, {Json("text"), R"("text")"},
      {Json(0), "0"}, {Json(false), "false"}};
  for (std::size_t i = 0; i < std::size(cases); ++i) {
    const std::string id = "s" + std::to_string(i);
    StartSource(id, cases[i].first);
    EXPECT_EQ(script_.Lines(true)[0], "config " + id + "#" + std::to_string(i + 1) + " " + cases[i].second);
  }
  EXPECT_EQ(task_->SourceCount(), 9u);
}

TEST_F(TaskSourceTest, CommandsPassNullForAbsentKeysAndAnswersThatAreNotJson) {
  StartSource("a");
  script_.Lines(true);
  EXPECT_EQ(Ask("pm::tsrc::set_configuration", {{"unique_id", "a"}})["unique_id"], "a");
  const Json answer = {{"answer", 1}};
  EXPECT_EQ(Ask("pm::tsrc::validate_gui", {{"unique_id", "a"}})["gui"], answer);
  EXPECT_EQ(Ask("pm::tsrc::gui_to_configuration", {{"unique_id", "a"}, {"gui", {{"x", 2}}}})["config"], answer);
  EXPECT_EQ(Ask("pm::tsrc::configuration_to_gui", {{"unique_id", "a"}, {"config", Json::object()}})["gui"], answer);
  Ask("pm::tsrc::execute_custom_action_command", {{"unique_id", "a"}});
  Ask("pm::tsrc::handle_shot_event", {{"unique_id", "a"}, {"event", 7}});
  EXPECT_EQ(script_.Lines(), (Lines{"config a#1 null", "validate a#1 null", R"(to_config a#1 {"x":2})",
                                     "to_gui a#1 {}", "action a#1 ", "shot a#1 7"}));
  // A source's answer that is not JSON becomes null, with a line.
  StartSource("notjson");
  pmtest::LogCapture log;
  const Json reply = Ask("pm::tsrc::validate_gui", {{"unique_id", "notjson"}, {"gui", "g"}});
  EXPECT_EQ(reply.value("gui", Json("absent")), nullptr);
  EXPECT_TRUE(log.Contains("pmjson::Parse failed: validate_gui '{not json'"));
}

// A start or configuration that throws, or an id that is not text, leaves no
// source behind (a started one is stopped) and logs the whole request,
// indented by 4.
TEST_F(TaskSourceTest, FailedStartOrConfigurationLeavesNothingAndLogsTheRequest) {
  struct Case {
    Json id;
    bool throwOnConfiguration;
    Lines journal;
  } cases[] = {{"a", false, {"config a#1 ", "start a#1", "stop a#1"}}, {"a", true, {"config a#2 "}}, {5, false, {}}};
  for (const Case& c : cases) {
    script_.throwOnStart = true;
    script_.throwOnConfiguration = c.throwOnConfiguration;
    script_.Lines(true);
    pmtest::LogCapture log;
    const Json reply = Ask("pm::tsrc::start_source", {{"unique_id", c.id}});
    EXPECT_FALSE(reply.contains("pm::error"));
    EXPECT_TRUE(c.id.is_string() || !reply.contains("unique_id"));
    EXPECT_EQ(script_.Lines(), c.journal);
    EXPECT_EQ(task_->SourceCount(), 0u);
    EXPECT_EQ(log.Count("pm::tsrc::start_source : Caught exception : {\n    \"pm::command\""), 1);
    EXPECT_TRUE(log.Contains("\n    \"unique_id\": " + c.id.dump() + "\n}"));
  }
}

// A second start of a running id or of discovery stops the running one before
// the new one starts, and hotplug events reach the new ones; Shutdown stops
// discovery, then the sources in id order, and keeps the table.
TEST_F(TaskSourceTest, ASecondStartStopsTheRunningOneFirstAndShutdownStopsInOrder) {
  StartSource("b");
  StartSource("b");
  StartSource("a");
  Ask("pm::tsrc::start_discovery");
  Ask("pm::tsrc::start_discovery");
  Ask("pm::tsrc::source_hotplug_event", {{"unique_id", "b"}});
  Ask("pm::tsrc::discovery_hotplug_event");
  EXPECT_EQ(script_.Lines(true), (Lines{"config b#1 ", "start b#1", "stop b#1", "config b#2 ", "start b#2", "config a#3 ",
                                         "start a#3", "start discovery#1", "stop discovery#1", "start discovery#2",
                                         "hotplug b#2", "hotplug discovery#2"}));
  task_->Shutdown();
  EXPECT_EQ(script_.Lines(), (Lines{"stop discovery#2", "stop a#3", "stop b#2"}));
  EXPECT_EQ(task_->SourceCount(), 2u);
  EXPECT_TRUE(task_->FindSource("a"));
}

// The last stop_source ends the connections only when no discovery runs;
// stop_discovery never does.
TEST_F(TaskSourceTest, StopOfTheLastSourceWithoutDiscoveryEndsTheConnections) {
  StartSource("a");
  Ask("pm::tsrc::start_discovery");
  Ask("pm::tsrc::stop_source", {{"unique_id", "a"}});
  EXPECT_EQ(Ask("pm::tsrc::stop_discovery", {{"unique_id", "x"}})["unique_id"], "x");
  Ask("pm::tsrc::stop_discovery");  // a second stop stops nothing
  StartSource("5");
  StartSource("6");
  Ask("pm::tsrc::stop_source", {{"unique_id", 5}});  // read leniently as "5"
  EXPECT_EQ(task_->SourceCount(), 1u);
  EXPECT_FALSE(dispatcher_->Ended());
  ASSERT_TRUE(host_.WriteJson(pmtest::Request("pm::tsrc::stop_source", 99, {{"unique_id", "6"}})));
  EXPECT_TRUE(host_.SeesEndOfStream());
  EXPECT_TRUE(pmtest::WaitFor([&] { return dispatcher_->Ended(); }));
  EXPECT_EQ(task_->DispatcherCount(), 0u);
  const Lines lines = script_.Lines();
  EXPECT_EQ(Lines(lines.end() - 2, lines.end()), (Lines{"stop 5#2", "stop 6#3"}));
  EXPECT_EQ(std::count(lines.begin(), lines.end(), "stop discovery#1"), 1);
}

// The discovery is stored before its Start runs: a last stop_source on
// another connection meanwhile finds work and leaves the task and both
// connections running. A Start that throws takes its discovery out again,
// stopped.
TEST_F(TaskSourceTest, DiscoveryIsStoredBeforeItStartsAndAFailedStartIsTakenOut) {
  pmtest::HostPeer other = Attach(anotherListener_);
  StartSource("a");
  script_.discoveryMayStart = false;
  ASSERT_TRUE(host_.WriteJson(pmtest::Request("pm::tsrc::start_discovery", 900)));
  ASSERT_TRUE(pmtest::WaitFor([&] { return script_.discoveryStarting.load(); }));
  EXPECT_FALSE(pmtest::Ask(other, "pm::tsrc::stop_source", 1, {{"unique_id", "a"}}).is_discarded());
  script_.discoveryMayStart = true;
  EXPECT_FALSE(Ask("pm::tsrc::discovery_hotplug_event").is_discarded());
  EXPECT_FALSE(pmtest::Ask(other, "pm::tsrc::source_hotplug_event", 2, {{"unique_id", "a"}}).is_discarded());
  EXPECT_EQ(task_->DispatcherCount(), 2u);
  EXPECT_EQ(script_.Lines(),
            (Lines{"config a#1 ", "start a#1", "start discovery#1", "stop a#1", "hotplug discovery#1"}));

  script_.throwOnDiscoveryStart = true;
  script_.Lines(true);
  EXPECT_TRUE(Ask("pm::tsrc::start_discovery").contains("pm::error"));
  EXPECT_EQ(script_.Lines(), (Lines{"stop discovery#1", "start discovery#2", "stop discovery#2"}));
  EXPECT_FALSE(task_->CurrentDiscovery());
}

TEST_F(TaskSourceTest, ConcurrentStartsOnTwoConnectionsLeaveOneRunningAndStopTheRest) {
  pmtest::HostPeer second = Attach(anotherListener_);

  const auto drive = [](pmtest::HostPeer& peer) {
    for (int i = 0; i < 15; ++i) {
      EXPECT_FALSE(pmtest::Ask(peer, "pm::tsrc::start_discovery", 2 * i + 1).is_discarded());
      EXPECT_FALSE(pmtest::Ask(peer, "pm::tsrc::start_source", 2 * i + 2, {{"unique_id", "a"}}).is_discarded());
    }
  };
  std::thread other([&] { drive(second); });
  drive(host_);
  other.join();

  auto discovery = std::dynamic_pointer_cast<ScriptedDiscovery>(task_->CurrentDiscovery());
  auto source = std::dynamic_pointer_cast<ScriptedSource>(task_->FindSource("a"));
  ASSERT_TRUE(discovery && source);
  ExpectOnlySurvivorRunning(script_.Lines(), "discovery#", discovery->tag);
  ExpectOnlySurvivorRunning(script_.Lines(), "a#", source->tag);
  EXPECT_EQ(task_->SourceCount(), 1u);
}

TEST_F(TaskSourceTest, DestroyingTheTaskReleasesSourcesWithoutStoppingAndEndsHandlers) {
  StartSource("a");
  Ask("pm::tsrc::start_discovery");
  script_.Lines(true);
  task_.reset();
  EXPECT_TRUE(script_.Lines().empty());
  EXPECT_TRUE(dispatcher_->Ended());
  // The handlers no longer own the dispatcher: the test's reference is the last.
  EXPECT_EQ(dispatcher_.use_count(), 1);
}

}  // namespace
