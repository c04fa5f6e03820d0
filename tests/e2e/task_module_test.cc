// The task module end to end: the test is the host, pm-runner loads the real
// libtaskndisource.so (which loads the loopback NDI runtime), and every
// command travels over a real connection. Each case has its own empty NDI
// registry, so no sender is ever found and sources stay connecting.
#include <gtest/gtest.h>

#include <set>
#include <string>
#include <utility>

#include "e2e/runner_child.h"

namespace {

using Json = nlohmann::json;
using namespace std::chrono_literals;
using e2e::Host;
using e2e::Occurrences;

const char kSource[] = "NDICaptureDevice~NOBODY (absent)";

std::set<std::string> Keys(const Json& reply) {
  std::set<std::string> keys;
  if (reply.is_object()) {
    for (const auto& item : reply.items()) keys.insert(item.key());
  }
  return keys;
}

std::set<std::string> EnvelopeAnd(std::initializer_list<std::string> more) {
  std::set<std::string> keys = {"pm::unique_id", "pm::command", "pm::response"};
  keys.insert(more.begin(), more.end());
  return keys;
}

TEST(TaskModule, EveryCommandEchoesAndAnswersWithItsOwnKeys) {
  Host host;
  ASSERT_TRUE(host.Ready());

  for (const char* command : {"pm::tsrc::start_discovery", "pm::tsrc::discovery_hotplug_event",
                              "pm::tsrc::stop_discovery"}) {
    const Json reply = host.Ask(command, {{"unique_id", "d"}});
    EXPECT_EQ(Keys(reply), EnvelopeAnd({"unique_id"})) << command << " " << reply;
    EXPECT_EQ(reply["unique_id"], "d");
  }

  Json reply = host.Ask("pm::tsrc::start_source", {{"unique_id", kSource}, {"config", Json::object()}});
  EXPECT_EQ(Keys(reply), EnvelopeAnd({})) << reply;
  // The source announced its buffer queue under its id.
  bool announced = false;
  for (const Json& request : host.Requests()) {
    if (request.value("pm::command", "") == std::string(kSource) + "::start_queue") {
      announced = request.contains("port") && request.contains("memoryBase");
    }
  }
  EXPECT_TRUE(announced);

  reply = host.Ask("pm::tsrc::configuration_to_gui", {{"unique_id", kSource}, {"config", Json::object()}});
  EXPECT_EQ(Keys(reply), EnvelopeAnd({"unique_id", "gui"})) << reply;
  EXPECT_TRUE(reply["gui"].is_object()) << reply;
  const Json gui = reply["gui"];
  reply = host.Ask("pm::tsrc::gui_to_configuration", {{"unique_id", kSource}, {"gui", gui}});
  EXPECT_EQ(Keys(reply), EnvelopeAnd({"unique_id", "config"})) << reply;
  reply = host.Ask("pm::tsrc::validate_gui", {{"unique_id", kSource}, {"gui", gui}});
  EXPECT_EQ(Keys(reply), EnvelopeAnd({"unique_id", "gui"})) << reply;
  // Without "gui" the source is asked about the text null; the key is there.
  reply = host.Ask("pm::tsrc::validate_gui", {{"unique_id", kSource}});
  EXPECT_EQ(Keys(reply), EnvelopeAnd({"unique_id", "gui"})) << reply;

  for (const char* command : {"pm::tsrc::execute_custom_action_command", "pm::tsrc::execute_ptz_command",
                              "pm::tsrc::handle_shot_event", "pm::tsrc::source_hotplug_event",
                              "pm::tsrc::set_configuration"}) {
    reply = host.Ask(command, {{"unique_id", kSource}, {"config", Json::object()}, {"event", "e"}});
    EXPECT_EQ(Keys(reply), EnvelopeAnd({"unique_id"})) << command << " " << reply;
    EXPECT_EQ(reply["unique_id"], kSource);
  }

  // The last source stopped with no discovery: the task ends itself.
  ASSERT_TRUE(host.Peer().WriteJson({{"pm::command", "pm::tsrc::stop_source"}, {"pm::unique_id", 1000},
                                     {"pm::request", true}, {"unique_id", kSource}}));
  EXPECT_TRUE(host.Peer().SeesEndOfStream(10s));
  EXPECT_EQ(host.Runner().Wait(), 0);
  const std::string err = host.Runner().Stderr();
  EXPECT_EQ(Occurrences(err, "#ndisource: Initialized NDIlib ("), 1) << err;
  EXPECT_EQ(Occurrences(err, std::string("#ndisource: creating '") + kSource + "' in pid "), 1) << err;
  EXPECT_EQ(Occurrences(err, "#ndisource: creating discovery in pid "), 1) << err;
}

TEST(TaskModule, LastSourceStoppedByANumericIdEndsTheTask) {
  Host host;
  ASSERT_TRUE(host.Ready());
  host.Ask("pm::tsrc::start_source", {{"unique_id", "5"}});
  ASSERT_TRUE(host.Peer().WriteJson({{"pm::command", "pm::tsrc::stop_source"}, {"pm::unique_id", 1000},
                                     {"pm::request", true}, {"unique_id", 5}}));
  EXPECT_TRUE(host.Peer().SeesEndOfStream(10s));
  EXPECT_EQ(host.Runner().Wait(), 0);
  EXPECT_EQ(Occurrences(host.Runner().Stderr(), "#ndisource: creating '5' in pid "), 1);
}

TEST(TaskModule, LastSourceStoppedWhileDiscoveryRunsKeepsTheTask) {
  Host host;
  ASSERT_TRUE(host.Ready());
  host.Ask("pm::tsrc::start_discovery");
  host.Ask("pm::tsrc::start_source", {{"unique_id", "a"}});
  host.Ask("pm::tsrc::stop_source", {{"unique_id", "a"}});
  // stop_discovery does not end the task either.
  EXPECT_EQ(host.Ask("pm::tsrc::stop_discovery", {{"unique_id", "x"}})["unique_id"], "x");
  EXPECT_EQ(host.Ask("pm::tsrc::source_hotplug_event", {{"unique_id", "a"}})["unique_id"], "a");
  EXPECT_EQ(host.Runner().Wait(100ms), -2);
  host.Peer().Close();
  EXPECT_EQ(host.Runner().Wait(), 0);
}

TEST(TaskModule, StartWithANumericIdIsLoggedWithTheRequestAndChangesNothing) {
  Host host;
  ASSERT_TRUE(host.Ready());
  const Json reply = host.Ask("pm::tsrc::start_source", {{"unique_id", 5}, {"config", {{"a", 1}}}});
  EXPECT_EQ(Keys(reply), EnvelopeAnd({})) << reply;
  // Nothing was made: the task still has no source to stop, so it stays.
  host.Ask("pm::tsrc::stop_source", {{"unique_id", "5"}});
  EXPECT_EQ(host.Ask("pm::tsrc::stop_discovery")["unique_id"], "");
  host.Peer().Close();
  EXPECT_EQ(host.Runner().Wait(), 0);
  const std::string err = host.Runner().Stderr();
  EXPECT_EQ(Occurrences(err, "pm::tsrc::start_source : Caught exception : {\n    \""), 1) << err;
  EXPECT_NE(err.find("\n    \"unique_id\": 5\n}"), std::string::npos) << err;
  EXPECT_EQ(Occurrences(err, "#ndisource: creating '"), 0) << err;
}

TEST(TaskModule, BadInputIsAnsweredOrLoggedAndTheConnectionKeepsServing) {
  Host host;
  ASSERT_TRUE(host.Ready());
  pmtest::HostPeer& peer = host.Peer();
  // Messages that are not objects are skipped by the runner.
  ASSERT_TRUE(peer.WriteFrame("[\"pm::tsrc::start_source\"]"));
  ASSERT_TRUE(peer.WriteFrame("\"pm::tsrc::stop_source\""));
  ASSERT_TRUE(peer.WriteFrame("{\"pm::command\":"));

  const Json values[] = {Json(), Json(true), Json(7), Json(-3), Json(1.5), Json("text"), Json::array(),
                         Json::object(), Json::parse(R"([1,{"b":null}])"), Json::parse(R"({"a":{"b":[1]}})")};
  const char* commands[] = {"pm::tsrc::start_source", "pm::tsrc::stop_source", "pm::tsrc::validate_gui",
                            "pm::tsrc::gui_to_configuration", "pm::tsrc::configuration_to_gui",
                            "pm::tsrc::execute_custom_action_command", "pm::tsrc::execute_ptz_command",
                            "pm::tsrc::handle_shot_event", "pm::tsrc::source_hotplug_event",
                            "pm::tsrc::set_configuration", "pm::tsrc::start_discovery",
                            "pm::tsrc::stop_discovery", "pm::tsrc::discovery_hotplug_event"};
  // Discovery runs throughout, so stopping the one source that a string id
  // started does not end the task.
  host.Ask("pm::tsrc::start_discovery");
  // Ids of every type, and requests without any key.
  for (const char* command : commands) {
    if (std::string(command) == "pm::tsrc::stop_discovery") continue;
    EXPECT_TRUE(host.Ask(command).is_object()) << command;
    for (const Json& id : values) {
      const Json reply = host.Ask(command, {{"unique_id", id}, {"gui", id}, {"config", id}});
      ASSERT_TRUE(reply.is_object()) << command << " " << id;
    }
  }
  // A real source given configurations and panels of every type, and texts
  // that are not JSON.
  host.Ask("pm::tsrc::start_source", {{"unique_id", kSource}});
  for (const Json& value : values) {
    for (const char* command : {"pm::tsrc::set_configuration", "pm::tsrc::configuration_to_gui",
                                "pm::tsrc::validate_gui", "pm::tsrc::gui_to_configuration",
                                "pm::tsrc::execute_custom_action_command", "pm::tsrc::handle_shot_event",
                                "pm::tsrc::execute_ptz_command"}) {
      const Json reply =
          host.Ask(command, {{"unique_id", kSource}, {"config", value}, {"gui", value}, {"command", value},
                             {"event", value}, {"zoom", value}, {"preset", value}});
      ASSERT_TRUE(reply.is_object()) << command << " " << value;
      EXPECT_EQ(reply["unique_id"], kSource);
    }
  }
  for (const char* text : {"{not json", "", "[1,", "{\"a\":}"}) {
    host.Ask("pm::tsrc::validate_gui", {{"unique_id", kSource}, {"gui", std::string(text)}});
    host.Ask("pm::tsrc::configuration_to_gui", {{"unique_id", kSource}, {"config", std::string(text)}});
  }
  // Starting the same id again with configurations of every type.
  for (const Json& value : values) {
    host.Ask("pm::tsrc::start_source", {{"unique_id", kSource}, {"config", value}});
  }
  // Still serving, and still running after all of it.
  EXPECT_EQ(host.Ask("pm::tsrc::source_hotplug_event", {{"unique_id", kSource}})["unique_id"], kSource);
  EXPECT_EQ(host.Ask("pm::tsrc::stop_discovery", {{"unique_id", Json::array()}})["unique_id"], "");
  EXPECT_EQ(host.Runner().Wait(10ms), -2);
  host.Peer().Close();
  EXPECT_EQ(host.Runner().Wait(), 0);
}

// A message nested a quarter of a million levels deep (about 500 KB, under the
// frame limit) in the field a command reads would end the runner on its
// stack wherever the value is copied or printed. The receiving side refuses
// it before building anything, with one line, like text that is not JSON; the
// connection stays and the next request is answered.
TEST(TaskModule, MessagesNestedTooDeepAreSkippedWithOneLineEachAndTheRunnerServesOn) {
  Host host;
  ASSERT_TRUE(host.Ready());
  host.Ask("pm::tsrc::start_discovery");
  host.Ask("pm::tsrc::start_source", {{"unique_id", kSource}});
  const std::pair<const char*, const char*> commands[] = {
      {"pm::tsrc::start_source", "config"},
      {"pm::tsrc::stop_source", "unique_id"},
      {"pm::tsrc::validate_gui", "gui"},
      {"pm::tsrc::gui_to_configuration", "gui"},
      {"pm::tsrc::configuration_to_gui", "config"},
      {"pm::tsrc::execute_custom_action_command", "command"},
      {"pm::tsrc::execute_ptz_command", "zoom"},
      {"pm::tsrc::handle_shot_event", "event"},
      {"pm::tsrc::source_hotplug_event", "unique_id"},
      {"pm::tsrc::set_configuration", "config"},
      {"pm::tsrc::start_discovery", "unique_id"},
      {"pm::tsrc::stop_discovery", "unique_id"},
      {"pm::tsrc::discovery_hotplug_event", "unique_id"},
  };
  constexpr std::size_t kDepth = 250000;
  const std::string deep = std::string(kDepth, '[') + std::string(kDepth, ']');
  for (const auto& [command, key] : commands) {
    Json envelope = {{"pm::command", command}, {"pm::unique_id", 7}, {"pm::request", true}};
    if (std::string(key) != "unique_id") envelope["unique_id"] = kSource;
    std::string text = envelope.dump();
    text.back() = ',';
    text += "\"" + std::string(key) + "\":" + deep + "}";
    ASSERT_LT(text.size(), 524288u);
    ASSERT_TRUE(host.Peer().WriteFrame(text)) << command;
  }
  const Json reply = host.Ask("pm::tsrc::source_hotplug_event", {{"unique_id", kSource}});
  ASSERT_TRUE(reply.is_object()) << "the runner ended with " << host.Runner().Wait(5s) << " (-1: a signal)";
  EXPECT_EQ(reply["unique_id"], kSource);
  EXPECT_EQ(host.Runner().Wait(10ms), -2);
  host.Peer().Close();
  EXPECT_EQ(host.Runner().Wait(), 0);
  const std::string err = host.Runner().Stderr();
  EXPECT_EQ(Occurrences(err, "RpcDispatcher: message nests deeper than 256 levels, skipped: '{\"pm::command\":"),
            static_cast<int>(std::size(commands)))
      << err.substr(0, 4000);
}

}  // namespace
