// The task module as the runner loads it: pm-runner on the real
// libtaskndisource.so (which loads the loopback NDI runtime), in an empty
// registry folder of its own, the test as the host. What the commands do is
// tested in process (tests/pm/task); here, what a message off the wire does
// to the process.
#include <gtest/gtest.h>

#include <cstdint>
#include <string>

#include "support/runner_child.h"

namespace {

using Json = nlohmann::json;
using namespace std::chrono_literals;
using pmtest::Occurrences;

const char kSource[] = "NDICaptureDevice~NOBODY (absent)";

// Every command but stop_discovery (discovery runs throughout the case below).
const std::string kCommands[] = {
    "pm::tsrc::start_source", "pm::tsrc::stop_source", "pm::tsrc::validate_gui", "pm::tsrc::gui_to_configuration",
    "pm::tsrc::configuration_to_gui", "pm::tsrc::execute_custom_action_command", "pm::tsrc::execute_ptz_command",
    "pm::tsrc::handle_shot_event", "pm::tsrc::source_hotplug_event", "pm::tsrc::set_configuration",
    "pm::tsrc::start_discovery", "pm::tsrc::discovery_hotplug_event"};

// Every field a command reads given values of every JSON type, for an id of
// that value and for a real source: each request is answered and the
// runner serves on. (Discovery runs throughout, so the source that a string
// id started is never the last thing keeping the task.) A message nested too
// deep to copy or print is the dispatcher's case (tests/pm/ipc).
TEST(TaskModule, ValuesOfEveryTypeInEveryFieldAreAnsweredAndTheRunnerServesOn) {
  pmtest::RunnerOnPort r(PM_MODULE_PATH);
  ASSERT_TRUE(r.Ready());
  pmtest::Ask(r.host, "pm::tsrc::start_discovery", 1);
  const Json values[] = {Json(), Json(true), Json(7), Json(-3), Json(1.5), Json("text"), Json("{\"a\":}"),
                         Json::array(), Json::object(), Json::parse(R"([1,{"b":null}])"),
                         Json::parse(R"({"a":{"b":[1]}})")};
  std::uint64_t id = 10;
  for (const std::string& command : kCommands) {
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
  const std::string err = r.runner.Stderr();
  EXPECT_EQ(Occurrences(err, "#ndisource: Initialized NDIlib ("), 1) << err.substr(0, 4000);
}

}  // namespace
