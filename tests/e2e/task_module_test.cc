// The task module as the runner loads it: pm-runner on the real
// libtaskndisource.so (which loads the loopback NDI runtime), in an empty
// registry folder of its own, the test as the host. What the commands do is
// tested in process (tests/pm/task); here, what a message off the wire does
// to the process.
#include <gtest/gtest.h>

#include <cstdint>
#include <string>
#include <utility>

#include "support/runner_child.h"

namespace {

using Json = nlohmann::json;
using namespace std::chrono_literals;
using pmtest::Occurrences;

const char kSource[] = "NDICaptureDevice~NOBODY (absent)";

// Every command, with the field it reads.
const std::pair<std::string, std::string> kCommands[] = {
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

// A message nested a quarter of a million levels deep (about 500 KB, under the
// frame limit) in the field a command reads would end the runner on its
// stack wherever the value is copied or printed. The receiving side refuses
// it before building anything, with one line, like text that is not JSON; the
// connection stays and the next request is answered.
TEST(TaskModule, MessagesNestedTooDeepAreSkippedWithOneLineEachAndTheRunnerServesOn) {
  pmtest::RunnerOnPort r(PM_MODULE_PATH);
  ASSERT_TRUE(r.Ready());
  pmtest::Ask(r.host, "pm::tsrc::start_discovery", 1);
  pmtest::Ask(r.host, "pm::tsrc::start_source", 2, {{"unique_id", kSource}});
  constexpr std::size_t kDepth = 250000;
  const std::string deep = std::string(kDepth, '[') + std::string(kDepth, ']');
  for (const auto& [command, key] : kCommands) {
    Json envelope = pmtest::Request(command, 7);
    if (key != "unique_id") envelope["unique_id"] = kSource;
    std::string text = envelope.dump();
    text.back() = ',';
    text += "\"" + key + "\":" + deep + "}";
    ASSERT_LT(text.size(), 524288u);
    ASSERT_TRUE(r.host.WriteFrame(text)) << command;
  }
  const Json reply = pmtest::Ask(r.host, "pm::tsrc::source_hotplug_event", 3, {{"unique_id", kSource}});
  ASSERT_TRUE(reply.is_object()) << "the runner ended with " << ::testing::PrintToString(r.runner.Wait(5s));
  EXPECT_EQ(reply["unique_id"], kSource);
  EXPECT_FALSE(r.runner.Wait(10ms).has_value());
  r.host.Close();
  EXPECT_EQ(r.runner.Wait(), 0);
  const std::string err = r.runner.Stderr();
  EXPECT_EQ(Occurrences(err, "RpcDispatcher: message nests deeper than 256 levels, skipped: '{\"pm::command\":"),
            static_cast<int>(std::size(kCommands)))
      << err.substr(0, 4000);
  // The module found its runtime once, and made the one source once.
  EXPECT_EQ(Occurrences(err, "#ndisource: Initialized NDIlib ("), 1) << err.substr(0, 4000);
  EXPECT_EQ(Occurrences(err, std::string("#ndisource: creating '") + kSource + "' in pid "), 1);
}

// Every field a command reads given values of every JSON type, for an id of
// that value and for a real source: each request is answered and the
// runner serves on. (Discovery runs throughout, so the source that a string
// id started is never the last thing keeping the task.)
TEST(TaskModule, ValuesOfEveryTypeInEveryFieldAreAnsweredAndTheRunnerServesOn) {
  pmtest::RunnerOnPort r(PM_MODULE_PATH);
  ASSERT_TRUE(r.Ready());
  pmtest::Ask(r.host, "pm::tsrc::start_discovery", 1);
  const Json values[] = {Json(), Json(true), Json(7), Json(-3), Json(1.5), Json("text"), Json("{\"a\":}"),
                         Json::array(), Json::object(), Json::parse(R"([1,{"b":null}])"),
                         Json::parse(R"({"a":{"b":[1]}})")};
  std::uint64_t id = 10;
  for (const auto& [command, key] : kCommands) {
    if (command == "pm::tsrc::stop_discovery") continue;
    for (const Json& value : values) {
      for (const Json& source : {value, Json(kSource)}) {
        if (command == "pm::tsrc::stop_source" && source == kSource) continue;
        const Json body = {{"unique_id", source}, {"config", value}, {"gui", value},   {"command", value},
                           {"event", value},      {"zoom", value},   {"preset", value}};
        ASSERT_TRUE(pmtest::Ask(r.host, command, ++id, body).is_object()) << command << " " << source << " " << value;
      }
    }
  }
  EXPECT_EQ(pmtest::Ask(r.host, "pm::tsrc::source_hotplug_event", 2, {{"unique_id", kSource}})["unique_id"], kSource);
  EXPECT_FALSE(r.runner.Wait(10ms).has_value());
  r.host.Close();
  EXPECT_EQ(r.runner.Wait(), 0);
}

}  // namespace
