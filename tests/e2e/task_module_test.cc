// The task module as the runner loads it: pm-runner on the real
// libtaskndisource.so (which loads the loopback NDI runtime), in an empty
// registry folder of its own, the test as the host. What the commands do is
// tested in process (tests/pm/task); here, what a message off the wire does
// to the process.
#include <gtest/gtest.h>

#include <string>
#include <utility>

#include "support/runner_child.h"

namespace {

using Json = nlohmann::json;
using namespace std::chrono_literals;
using pmtest::Occurrences;

const char kSource[] = "NDICaptureDevice~NOBODY (absent)";

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
    Json envelope = pmtest::Request(command, 7);
    if (std::string(key) != "unique_id") envelope["unique_id"] = kSource;
    std::string text = envelope.dump();
    text.back() = ',';
    text += "\"" + std::string(key) + "\":" + deep + "}";
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
            static_cast<int>(std::size(commands)))
      << err.substr(0, 4000);
  // The module found its runtime once, and made the one source once.
  EXPECT_EQ(Occurrences(err, "#ndisource: Initialized NDIlib ("), 1) << err.substr(0, 4000);
  EXPECT_EQ(Occurrences(err, std::string("#ndisource: creating '") + kSource + "' in pid "), 1);
}

}  // namespace
