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

// What each sender format becomes for the task's colour format (UYVY_BGRA),
// as with the vendor runtime: UYVY stays UYVY ('2vuy'), BGRA with alpha stays
// BGRA ('rgba'), both byte for byte (ramps); UYVA becomes BGRA and the 4:2:0
// formats UYVY, converted (numbered bars, read within a tolerance).
struct FormatCase {
  const char* format;
  const char* pattern;  // "ramp": compared exactly; "blocks": read
  int width, height;
  std::uint32_t code;
  std::uint32_t stride;  // the host's
};

void PrintTo(const FormatCase& c, std::ostream* os) { *os << c.format; }

class SenderFormats : public ::testing::TestWithParam<FormatCase> {};

TEST_P(SenderFormats, ArriveInTheHostCodeOfTheColourFormat) {
  const FormatCase c = GetParam();
  Folder folder;
  Sender sender;
  ASSERT_TRUE(sender.Start(folder, "Formats", {"--format", c.format, "--pattern", c.pattern, "--width",
                                               std::to_string(c.width), "--height", std::to_string(c.height), "--fps",
                                               "30", "--no-audio"}));
  std::atomic<int> intact{0}, damaged{0}, backwards{0};
  std::int64_t last = -1;  // reader thread only
  std::mutex problemLock;  // guards problem
  std::string problem;
  pmhost::ReceiveOptions o = ReceiveFrom(folder, sender.Name());
  o.frames = 8;
  o.seconds = -1;
  o.onVideo = [&](const pmhost::VideoFrame& frame) {
    std::int64_t n = -1;
    std::string check;
    if (std::string(c.pattern) == "ramp") {
      check = pmhost::CheckRampPicture(frame, &n);
    } else {
      const pmhost::BlocksReading r = pmhost::ReadBlocks(frame);
      check = r.problem;
      n = r.number;
    }
    ++(check.empty() ? intact : damaged);
    if (n <= last) ++backwards;
    last = n;
    std::lock_guard<std::mutex> guard(problemLock);
    if (!check.empty() && problem.empty()) problem = check;
  };
  const pmhost::ReceiveResult result = pmhost::Receive(o);
  ExpectOrderlyEnd(result, folder);
  EXPECT_GE(intact.load(), 8);
  EXPECT_EQ(damaged.load(), 0) << problem;
  EXPECT_EQ(backwards.load(), 0);
  EXPECT_EQ(pmhost::CodeText(result.stats.videoCode), pmhost::CodeText(c.code));
  EXPECT_EQ(result.stats.stride, c.stride);
  EXPECT_EQ(result.stats.width, c.width);
  EXPECT_EQ(result.stats.height, c.height);
}

INSTANTIATE_TEST_SUITE_P(Formats, SenderFormats,
                         ::testing::Values(FormatCase{"uyvy", "ramp", 64, 16, pm::kCode2vuy, 128},
                                           FormatCase{"bgra", "ramp", 64, 16, pm::kCodeRgba, 256},
                                           FormatCase{"uyva", "blocks", 160, 96, pm::kCodeRgba, 640},
                                           FormatCase{"nv12", "blocks", 160, 96, pm::kCode2vuy, 320},
                                           FormatCase{"i420", "blocks", 160, 96, pm::kCode2vuy, 320}),
                         [](const ::testing::TestParamInfo<FormatCase>& info) { return std::string(info.param.format); });

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

// A host sink that only counts.
struct CountingSink : pmhost::FrameSink {
  void OnVideo(const std::string&, const pmhost::VideoFrame&) override { ++videos; }
  void OnAudio(const std::string&, const pmhost::AudioFrame&) override {}
  std::atomic<int> videos{0};
};

TEST(EndToEnd, ACrashedRunnersSegmentsAreRemovedByTheHost) {
  const std::optional<pmtest::ProcessUsage> own = pmtest::OwnUsage();
  ASSERT_TRUE(own);
  std::vector<std::string> bases;
  {
    Folder folder;
    Sender sender;
    ASSERT_TRUE(sender.Start(folder, "Crash", {"--width", "64", "--height", "16", "--fps", "30", "--no-audio"}));
    CountingSink sink;
    pmhost::Host host(pmtest::HostOptionsFor(folder), {}, &sink);
    ASSERT_TRUE(host.Start());
    const std::string id = pmhost::kSourceIdPrefix + sender.Name();
    ASSERT_TRUE(host.GetSession().StartSource(id, json::object()));
    ASSERT_TRUE(pmtest::WaitFor([&] { return sink.videos > 3; }, kPatience));
    bases = host.GetSession().MemoryBases();
    ASSERT_EQ(bases.size(), 1u);
    ASSERT_GT(SegmentsOf(bases), 0);  // the runner's pool is there
    ::kill(host.RunnerPid(), SIGKILL);
    ASSERT_TRUE(host.WaitRunner(kPatience).has_value());
    EXPECT_TRUE(pmtest::WaitFor([&] { return SegmentsOf(bases) == 0; }, kPatience));
    EXPECT_GT(host.RemovedSegments(), 0);
    EXPECT_EQ(host.Stop(), 128 + SIGKILL);
    // The host let go of the dead runner's segments as well: none is mapped
    // here any more.
    for (const std::string& name : pmtest::SharedMemoryMappedBy(::getpid())) {
      EXPECT_NE(name.rfind(bases[0], 0), 0u) << name << " is still mapped";
    }
  }
  // Nothing of the run is left open in this process (queue and command
  // connections, the runner's and the sender's pipes).
  std::optional<pmtest::ProcessUsage> now;
  EXPECT_TRUE(pmtest::WaitFor([&] {
    now = pmtest::OwnUsage();
    return now && now->descriptors == own->descriptors;
  }, kPatience)) << (now ? now->descriptors : -1) << " descriptors, " << own->descriptors << " before";
  EXPECT_EQ(SegmentsOf(bases), 0);
}

}  // namespace
