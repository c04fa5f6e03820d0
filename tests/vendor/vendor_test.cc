// The whole chain on the vendor NDI runtime: ndi-testsrc senders and the task
// module in pm-runner both on libndi.so.5, discovery through the sandbox's
// avahi-daemon, the host library reading shared memory. The vendor's codec is
// lossy, so pictures carry the "blocks" pattern (bars checked within a
// tolerance, picture numbers read from their cells) and sound the ramp.
//
// Runs only inside scripts/ndi-sandbox (PM_NDI_SANDBOX=1): anywhere else every
// case is skipped with the reason, and no vendor discovery starts. The cases
// share one 1080p camera (sent for the whole run); each receive starts its
// own runner and ends it with the last stop_source.
#include <gtest/gtest.h>

#include <signal.h>

#include <algorithm>
#include <atomic>
#include <cstdlib>
#include <memory>
#include <mutex>
#include <set>
#include <thread>

#include "e2e_support.h"
#include "pm-host/checks.h"
#include "pm-host/receive.h"
#include "pm/shm/formats.h"
#include "support/wait.h"

namespace {

using nlohmann::json;
using namespace std::chrono_literals;
using pmtest::BlocksArgs;
using pmtest::Folder;
using pmtest::Sender;

bool InSandbox() {
  const char* value = std::getenv("PM_NDI_SANDBOX");
  return value != nullptr && std::string(value) == "1";
}

// ctest reports the run as skipped on this text (SKIP_REGULAR_EXPRESSION).
constexpr char kSkipped[] =
    "vendor tests skipped: not inside scripts/ndi-sandbox (PM_NDI_SANDBOX is not 1), and the vendor runtime's "
    "discovery never runs on the machine's own network";

// The camera every case may use: 1920x1080 UYVY at 30 fps with 48 kHz stereo,
// PTZ and a model name.
struct Camera : ::testing::Environment {
  void SetUp() override {
    if (!InSandbox()) return;
    folder = std::make_unique<Folder>();
    sender = std::make_unique<Sender>();
    up = sender->Start(*folder, "Vendor Camera",
                       BlocksArgs(1920, 1080, {"--ptz", "--model", "PX-7", "--audio-rate", "48000", "--audio-channels",
                                               "2", "--seconds", "900"}));
  }
  void TearDown() override {
    sender.reset();
    folder.reset();
  }
  std::unique_ptr<Folder> folder;
  std::unique_ptr<Sender> sender;
  bool up = false;
};
Camera* const g_camera = static_cast<Camera*>(::testing::AddGlobalTestEnvironment(new Camera));

// What one receive run saw: pictures by number, sound, states, notifications.
struct Seen {
  // Neighbouring pictures whose numbers do not follow each other: lost,
  // repeated and reordered pictures all count.
  int Irregular() const {
    int n = 0;
    for (std::size_t i = 1; i < numbers.size(); ++i) n += numbers[i] == numbers[i - 1] + 1 ? 0 : 1;
    return n;
  }
  int Pictures() const { return static_cast<int>(numbers.size()); }
  std::vector<std::int64_t> numbers;
  int damaged = 0, soundIntact = 0, soundDamagedOrGaps = 0;
  std::int64_t nextSample = -1;
  std::string problem;
  std::vector<int> states;
  std::vector<json> suites;  // {suite, model} of each update_ptz_command_suite
};

class Watch {
 public:
  void Attach(pmhost::ReceiveOptions& o) {
    o.onVideo = [this](const pmhost::VideoFrame& frame) {
      const pmhost::BlocksReading r = pmhost::ReadBlocks(frame);
      std::lock_guard<std::mutex> guard(lock_);
      seen_.numbers.push_back(r.number);
      if (!r.problem.empty() && seen_.problem.empty()) seen_.problem = r.problem;
      seen_.damaged += r.problem.empty() ? 0 : 1;
    };
    o.onAudio = [this](const pmhost::AudioFrame& frame) {
      std::int64_t first = -1;
      // The runtime carries sound with about 16 bits: 1e-4 keeps every
      // sample apart from its neighbours' values (steps of 1/1024).
      const std::string check = pmhost::CheckRampSound(frame, &first, 1e-4f);
      std::lock_guard<std::mutex> guard(lock_);
      ++(check.empty() ? seen_.soundIntact : seen_.soundDamagedOrGaps);
      if (!check.empty() && seen_.problem.empty()) seen_.problem = "sound: " + check;
      if (seen_.nextSample >= 0 && first != seen_.nextSample % 1024) ++seen_.soundDamagedOrGaps;
      seen_.nextSample = first + frame.samples;
    };
    o.onNotification = [this](const std::string& command, const json& message) {
      std::lock_guard<std::mutex> guard(lock_);
      if (command == "pm::tsrc::update_connection_state") seen_.states.push_back(message.value("state", 0));
      if (command == "pm::tsrc::update_ptz_command_suite") {
        seen_.suites.push_back({{"suite", message.value("suite", "")}, {"model", message.value("model", "")}});
      }
    };
  }
  Seen Now() {
    std::lock_guard<std::mutex> guard(lock_);
    return seen_;
  }

 private:
  std::mutex lock_;  // guards seen_
  Seen seen_;
};

class Vendor : public ::testing::Test {
 protected:
  void SetUp() override {
    if (!InSandbox()) GTEST_SKIP() << kSkipped;
    ASSERT_TRUE(g_camera->up) << "the camera did not start";
  }
  static Folder& Place() { return *g_camera->folder; }
  static Sender& Cam() { return *g_camera->sender; }
  // Receives a source by its unique id (the source itself finds the sender).
  static pmhost::ReceiveOptions From(Sender& sender, Watch& watch) {
    pmhost::ReceiveOptions o = pmtest::ReceiveFrom(Place(), pmhost::kSourceIdPrefix + sender.Name());
    watch.Attach(o);
    return o;
  }
};

TEST_F(Vendor, DiscoveryListsTwoSendersAndWithdrawsAKilledOne) {
  Sender other;
  ASSERT_TRUE(other.Start(Place(), "Vendor Brief", BlocksArgs(640, 360, {"--no-audio"})));
  std::mutex lock;  // guards seen, gone
  std::set<std::string> seen, gone;
  std::atomic<bool> stop{false};
  pmhost::ListOptions list;
  list.host = pmtest::HostOptionsFor(Place());
  list.seconds = 120;
  list.out = stderr;
  list.interrupted = &stop;
  list.onChange = [&](bool available, const std::string& id, const std::string& name) {
    std::lock_guard<std::mutex> guard(lock);
    (available ? seen : gone).insert(name);
    EXPECT_EQ(id, pmhost::kSourceIdPrefix + name);
  };
  int status = -1;
  std::thread listing([&] { status = pmhost::Discover(list); });
  auto has = [&](const std::set<std::string>& set, const std::string& name) {
    std::lock_guard<std::mutex> guard(lock);
    return set.count(name) == 1;
  };
  EXPECT_TRUE(pmtest::WaitFor([&] { return has(seen, Cam().Name()) && has(seen, other.Name()); }, 20s));
  other.Process().Signal(SIGKILL);
  EXPECT_TRUE(pmtest::WaitFor([&] { return has(gone, other.Name()); }, 30s));
  stop = true;
  listing.join();
  EXPECT_EQ(status, 0);
  EXPECT_FALSE(has(gone, Cam().Name()));
}

// At the audio-only bandwidth: sound and no pictures.
TEST_F(Vendor, TallyMetadataShotEventsAndPtzGoBothWaysExactlyAndAudioOnlyBringsNoPictures) {
  Watch watch;
  pmhost::ReceiveOptions o = From(Cam(), watch);
  o.bandwidth = "audio_only";
  o.seconds = 3;
  o.tally = "preview";
  o.shotEvents = {"Vendor shot"};
  o.ptz = {json{{"command", "Zoom"}, {"zoom", 0.5}}, json{{"command", "PanTilt"}, {"pan", 0.25}, {"tilt", -0.5}}};
  const pmhost::ReceiveResult result = pmhost::Receive(o);
  pmtest::ExpectOrderlyEnd(result, Place());
  for (const char* xml :
       {"<metadata>\n    <receiver_info name=\"Skyrelay\" vendor=\"Quillfront LLC\" protocol_version=\"1\"/>\n"
        "</metadata>\n",
        "<metadata>\n    <media_settings width=\"1280\" height=\"720\" framerate=\"1\"/>\n</metadata>\n",
        "<skyrelay_ext>\n    <event value=\"Vendor shot\" preview=\"1\" live=\"0\"/>\n</skyrelay_ext>\n"}) {
    EXPECT_TRUE(Cam().WaitFor("metadata", [xml](const json& e) { return e.value("xml", "") == xml; })) << xml;
  }
  EXPECT_TRUE(Cam().WaitFor("tally", [](const json& e) { return e.value("preview", false) && !e.value("program", true); }));
  EXPECT_TRUE(Cam().WaitFor("ptz", [](const json& e) {
    return e.value("command", "") == "zoom" && e["values"].value("zoom", 0.0) == 0.5;
  }));
  EXPECT_TRUE(Cam().WaitFor("ptz", [](const json& e) {
    return e.value("command", "") == "pan_tilt" && e["values"].value("pan", 0.0) == 0.25 &&
           e["values"].value("tilt", 0.0) == -0.5;
  }));
  const Seen seen = watch.Now();
  EXPECT_NE(std::find(seen.suites.begin(), seen.suites.end(), json{{"suite", "NDI3"}, {"model", "PX-7"}}),
            seen.suites.end())
      << ::testing::PrintToString(seen.suites);
  // The camera's sound whole and without gaps.
  EXPECT_GT(seen.soundIntact, 20);
  EXPECT_EQ(seen.soundDamagedOrGaps, 0) << seen.problem;
  EXPECT_EQ(std::vector<int>({result.stats.audioRate, result.stats.audioChannels}), std::vector<int>({48000, 2}));
  EXPECT_EQ(result.stats.frames, 0u);
}

// What a sender's pictures become, given the receiver's colour format
// (UYVY_BGRA): pictures without alpha arrive as UYVY, with alpha as BGRA;
// each whole and in order.
TEST_F(Vendor, SendersArriveWholeAndInOrderInTheHostCodeOfTheColourFormat) {
  const std::tuple<const char*, const char*, int, int> cases[] = {
      {"uyvy", "2vuy", 1920, 1080}, {"bgra", "2vuy", 640, 360}, {"uyva", "rgba", 640, 360}, {"nv12", "2vuy", 640, 360}};
  for (const auto& [format, code, width, height] : cases) {
    SCOPED_TRACE(format);
    Sender sender;
    ASSERT_TRUE(sender.Start(Place(), std::string("Vendor ") + format,
                             BlocksArgs(width, height, {"--format", format, "--no-audio"})));
    Watch watch;
    pmhost::ReceiveOptions o = From(sender, watch);
    o.frames = 30;
    o.seconds = 60;
    const pmhost::ReceiveResult result = pmhost::Receive(o);
    pmtest::ExpectOrderlyEnd(result, Place());
    EXPECT_EQ(pmhost::CodeText(result.stats.videoCode), code);
    EXPECT_EQ(std::vector<int>({result.stats.width, result.stats.height}), std::vector<int>({width, height}));
    const Seen seen = watch.Now();
    EXPECT_GE(seen.Pictures(), o.frames);
    EXPECT_EQ(seen.damaged, 0) << seen.problem;
    EXPECT_EQ(seen.Irregular(), 0) << "lost, repeated or reordered pictures";
  }
}

TEST_F(Vendor, AKilledSenderGives3AndItsReturn1Then2AndPicturesAgain) {
  const std::vector<std::string> args = BlocksArgs(640, 360, {"--no-audio"});
  Sender first, again;
  ASSERT_TRUE(first.Start(Place(), "Vendor Phoenix", args));
  Watch watch;
  std::atomic<bool> stop{false};
  bool restarted = false;
  std::vector<int> afterDeath, afterReturn;
  int before = 0;
  pmhost::ReceiveOptions o = From(first, watch);
  o.seconds = 120;
  o.interrupted = &stop;
  o.whileReceiving = [&](pmhost::Session&, const std::string&) {
    // The states reported after the first `mark`.
    auto since = [&](std::size_t mark) {
      const std::vector<int> s = watch.Now().states;
      return std::vector<int>(s.begin() + static_cast<long>(std::min(mark, s.size())), s.end());
    };
    if (pmtest::WaitFor([&] { return watch.Now().Pictures() > 0; }, 20s)) {
      const std::size_t mark = watch.Now().states.size();
      first.Process().Signal(SIGKILL);
      first.Process().Wait(10s);
      pmtest::WaitFor([&] { return std::ranges::count(since(mark), 3) > 0; }, 20s);
      afterDeath = since(mark);
      const std::size_t back = watch.Now().states.size();
      restarted = again.Start(Place(), "Vendor Phoenix", args);
      before = watch.Now().Pictures();
      pmtest::WaitFor([&] { return std::ranges::count(since(back), 2) > 0 && watch.Now().Pictures() > before; }, 40s);
      afterReturn = since(back);
    }
    stop = true;
  };
  const pmhost::ReceiveResult result = pmhost::Receive(o);
  pmtest::ExpectOrderlyEnd(result, Place());
  EXPECT_TRUE(restarted);
  EXPECT_GT(std::ranges::count(afterDeath, 3), 0) << ::testing::PrintToString(afterDeath);
  // Started again as soon as it was reported gone: its pictures come with
  // the first 2, not after a second 1, 2.
  EXPECT_EQ(afterReturn, (std::vector<int>{1, 2}));
  const Seen seen = watch.Now();
  EXPECT_GT(seen.Pictures(), before);
  EXPECT_EQ(seen.damaged, 0) << seen.problem;
}

// The runtime's discovery keeps a dead sender's URL listed for a second or
// two, and a receiver made for a URL takes whichever sender listens there.
TEST_F(Vendor, ASourceLedToAnotherSendersPortByAStaleListingComesToItsOwnSender) {
  pmtest::ExpectASourceLedToAnotherSendersPortToComeToItsOwn(Place());
}

}  // namespace
