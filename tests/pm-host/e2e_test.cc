// The whole chain through real processes, each case in its own registry
// folder: ndi-testsrc -> loopback runtime -> task module in pm-runner ->
// shared memory -> the host library (the code behind `pm-host`).
#include <gtest/gtest.h>

#include <signal.h>
#include <unistd.h>

#include <atomic>
#include <mutex>
#include <thread>

#include "e2e_support.h"
#include "pm-host/checks.h"
#include "pm-host/receive.h"
#include "pm/shm/formats.h"
#include "support/wait.h"

namespace {

using nlohmann::json;
using namespace std::chrono_literals;

using pmtest::ExpectOrderlyEnd;
using pmtest::Folder;
using pmtest::ReceiveFrom;
using pmtest::Sender;
using pmtest::SegmentsOf;
using pmtest::kPatience;

// The two picture formats the runtime delivers for the task's colour format
// (UYVY_BGRA) reach the host byte for byte and in order: UYVY as '2vuy',
// BGRA as 'rgba'. (What the runtime makes of the other formats is the
// runtime's own case.)
TEST(EndToEnd, SenderFormatsArriveInTheHostCodeOfTheColourFormat) {
  const struct {
    const char* format;
    std::uint32_t code, stride;
  } cases[] = {{"uyvy", pm::kCode2vuy, 128}, {"bgra", pm::kCodeRgba, 256}};
  for (const auto& c : cases) {
    SCOPED_TRACE(c.format);
    Folder folder;
    Sender sender;
    ASSERT_TRUE(sender.Start(folder, "Formats", {"--format", c.format, "--pattern", "ramp", "--width", "64", "--height",
                                                 "16", "--fps", "30", "--no-audio"}));
    pmtest::RampSink sink;
    pmhost::ReceiveOptions o = ReceiveFrom(folder, sender.Name(), &sink);
    o.frames = 8;
    const pmhost::ReceiveResult result = pmhost::Receive(o);
    ExpectOrderlyEnd(result, folder);
    EXPECT_GE(sink.Pictures(), 8);
    EXPECT_EQ(sink.Problems(), std::vector<std::string>{});
    EXPECT_EQ(pmhost::CodeText(result.stats.videoCode), pmhost::CodeText(c.code));
    EXPECT_EQ(result.stats.stride, c.stride);
    EXPECT_EQ(std::vector<int>({result.stats.width, result.stats.height}), std::vector<int>({64, 16}));
  }
}

// The host's PTZ commands, tally and shot events reach the sender as values
// and exact texts, through the task's command handling and the runtime; at
// the host's audio-only bandwidth, with sound and no pictures.
TEST(EndToEnd, PtzTallyAndShotEventsReachTheSenderAndAudioOnlyBringsNoPictures) {
  Folder folder;
  Sender sender;
  ASSERT_TRUE(sender.Start(folder, "PTZ", {"--ptz", "--width", "64", "--height", "16", "--fps", "30"}));
  pmhost::ReceiveOptions o = ReceiveFrom(folder, sender.Name());
  o.bandwidth = "audio_only";
  std::atomic<int> sound{0};
  o.onAudio = [&](const pmhost::AudioFrame&) { ++sound; };
  o.ptz = {json{{"command", "Zoom"}, {"zoom", 0.5}}, json{{"command", "PanTilt"}, {"pan", 0.25}, {"tilt", -0.5}}};
  o.tally = "preview";
  o.shotEvents = {"X"};
  const std::vector<std::pair<std::string, std::function<bool(const json&)>>> expected = {
      {"ptz", [](const json& e) { return e.value("command", "") == "zoom" && e["values"].value("zoom", 0.0) == 0.5; }},
      {"ptz",
       [](const json& e) {
         return e.value("command", "") == "pan_tilt" && e["values"].value("pan", 0.0) == 0.25 &&
                e["values"].value("tilt", 0.0) == -0.5;
       }},
      {"tally", [](const json& e) { return e.value("preview", false) && !e.value("program", true); }},
      {"metadata",
       [](const json& e) {
         return e.value("xml", "") == "<skyrelay_ext>\n    <event value=\"X\" preview=\"1\" live=\"0\"/>\n</skyrelay_ext>\n";
       }},
  };
  auto arrived = [&](std::size_t i) { return !sender.Find(expected[i].first, expected[i].second).is_null(); };
  // A second of sound at least: about 30 pictures would have come with it.
  const pmhost::ReceiveResult result = pmtest::ReceiveUntil(o, [&] {
    for (std::size_t i = 0; i < expected.size(); ++i) {
      if (!arrived(i)) return false;
    }
    return sound > 30;
  });
  ExpectOrderlyEnd(result, folder);
  for (std::size_t i = 0; i < expected.size(); ++i) EXPECT_TRUE(arrived(i)) << "expected event " << i;
  EXPECT_GT(result.stats.audioBuffers, 30u);
  EXPECT_EQ(result.stats.frames, 0u);
}

// The loopback runtime keeps a sender that went listed for a second, as the
// vendor runtime does; senders here take ports as the vendor's do (the lowest
// free one), so the dead sender's port goes to the next sender at once.
TEST(EndToEnd, ASourceLedToAnotherSendersPortByAStaleListingComesToItsOwnSender) {
  Folder folder;
  folder.firstPort = 20000 + static_cast<int>(::getpid() % 10000);
  pmtest::ExpectASourceLedToAnotherSendersPortToComeToItsOwn(folder);
}

// Nothing of the run is left open in this process afterwards (queue and
// command connections, the runner's and the sender's pipes): the fixture.
using CrashedRunner = pmtest::OwnLevelKept;

TEST_F(CrashedRunner, ItsSegmentsAreRemovedAndUnmappedByTheHost) {
  pmtest::Chain c(/*ramp=*/false);
  ASSERT_NO_FATAL_FAILURE(c.Start("Crash", {"--width", "64", "--height", "16", "--fps", "30", "--no-audio"}));
  ASSERT_TRUE(c.Session().StartSource(c.id, json::object()));
  ASSERT_TRUE(pmtest::WaitFor([&] { return c.sink.Videos(c.id) > 3; }, kPatience));
  const std::vector<std::string> bases = c.Session().MemoryBases();
  ASSERT_EQ(bases.size(), 1u);
  ASSERT_GT(SegmentsOf(bases), 0);  // the runner's pool is there
  ::kill(c.Runner(), SIGKILL);
  ASSERT_TRUE(c.host.WaitRunner(kPatience).has_value());
  EXPECT_TRUE(pmtest::WaitFor([&] { return SegmentsOf(bases) == 0; }, kPatience));
  EXPECT_GT(c.host.RemovedSegments(), 0);
  EXPECT_EQ(c.host.Stop(), 128 + SIGKILL);
  for (const std::string& name : pmtest::SharedMemoryMappedBy(::getpid())) {
    EXPECT_NE(name.rfind(bases[0], 0), 0u) << name << " is still mapped";
  }
}

}  // namespace
