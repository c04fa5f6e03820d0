// The loopback runtime across processes: a child ndi-testsrc sends, the test
// receives through the NDI C interface (and sends, for the in-process cases).
// Each case has its own registry folder.
//
// What the whole chain (tests/pm-host, tests/faults) already drives through
// the runtime is not repeated here: UYVY and BGRA pictures byte for byte,
// sound, the audio-only bandwidth, tally and PTZ values reaching the sender,
// receivers reconnecting by themselves to a sender that came back (the task
// relies on it from its idle state) and a stale listing's URL.
#include <poll.h>
#include <signal.h>
#include <sys/socket.h>
#include <sys/wait.h>
#include <unistd.h>

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <chrono>
#include <fstream>
#include <functional>
#include <string>
#include <tuple>
#include <vector>

#include "e2e_support.h"
#include "ndi-loopback/net.h"
#include "ndi-loopback/registry.h"
#include "ndi-loopback/wire.h"
#include "ndi-testsrc/pattern.h"
#include "ndi/ndi_abi.h"
#include "support/wait.h"

namespace {

using namespace std::chrono_literals;
using pmtest::kPatience;
using pmtest::Sender;
using Clock = std::chrono::steady_clock;

std::string Ramp(const ndi_video_frame_v2& v, std::int64_t* n = nullptr) {
  return ndits::CheckRamp(v.FourCC, v.xres, v.yres, v.line_stride_in_bytes, v.data, n);
}

// One capture of a picture, metadata or a status change (sound stays
// queued, at most 32 frames), held until the receiver frees it.
struct Frame {
  std::int32_t type = kNdiFrameNone;
  ndi_video_frame_v2 v{};
  ndi_metadata_frame m{};
};

struct Receiver {
  explicit Receiver(const std::string& name, std::int32_t bandwidth = kNdiBandwidthHighest, const char* url = nullptr) {
    const ndi_recv_create settings{{name.c_str(), url}, kNdiColorUyvyBgra, bandwidth, false};
    handle = NDIlib_recv_create_v2(&settings);
  }
  ~Receiver() { NDIlib_recv_destroy(handle); }
  int Connections() const { return NDIlib_recv_get_no_connections(handle); }
  bool WaitConnected() const { return pmtest::WaitFor([&] { return Connections() == 1; }, kPatience); }
  Frame Capture(std::uint32_t timeout_ms) {
    Frame f;
    f.type = NDIlib_recv_capture_v2(handle, &f.v, nullptr, &f.m, timeout_ms);
    return f;
  }
  void Free(const Frame& f) {
    if (f.type == kNdiFrameVideo) NDIlib_recv_free_video_v2(handle, &f.v);
    if (f.type == kNdiFrameMetadata) NDIlib_recv_free_metadata(handle, &f.m);
  }
  // Captures until a frame of `type` comes (freeing the others) and returns
  // it held; of type kNdiFrameNone on timeout.
  Frame Take(std::int32_t type, std::chrono::milliseconds timeout = kPatience) {
    for (const auto deadline = Clock::now() + timeout; Clock::now() < deadline;) {
      Frame f = Capture(100);
      if (f.type == type) return f;
      Free(f);
    }
    return {};
  }
  // Take, shown to `look`, freed; false on timeout.
  bool Next(std::int32_t type, const std::function<void(const Frame&)>& look = {},
            std::chrono::milliseconds timeout = kPatience) {
    const Frame f = Take(type, timeout);
    if (f.type == type && look) look(f);
    Free(f);
    return f.type == type;
  }
  void* handle = nullptr;
};

bool Write(ndilb::SocketHandle fd, const void* bytes, std::size_t n) {
  ndilb::Piece piece{bytes, n};
  return ndilb::WriteAll(fd, &piece, 1);
}

// Waits for the socket to be readable; false after `timeout`.
bool Readable(ndilb::SocketHandle fd, std::chrono::milliseconds timeout) {
  pollfd p{static_cast<int>(fd), POLLIN, 0};
  return ::poll(&p, 1, static_cast<int>(timeout.count())) == 1;
}

// Writes `bytes` to the peer and closes the socket; true when the peer closed
// it first, within the timeout (whatever it sent before).
bool DroppedAfter(ndilb::SocketHandle fd, const std::string& bytes, std::chrono::milliseconds timeout) {
  char buffer[65536];
  bool closed = false;
  const bool written = bytes.empty() || Write(fd, bytes.data(), bytes.size());
  for (const auto deadline = Clock::now() + timeout; written && !closed && Clock::now() < deadline;) {
    closed = Readable(fd, 50ms) && ::recv(fd, buffer, sizeof buffer, 0) <= 0;
  }
  ndilb::CloseSocket(fd);
  return closed;
}

class Loopback : public ::testing::Test {
 protected:
  void SetUp() override { ::setenv("NDI_LOOPBACK_DIR", folder_.Registry().c_str(), 1); }
  void TearDown() override { ::unsetenv("NDI_LOOPBACK_DIR"); }
  pmtest::Folder folder_;
};

// --- discovery ------------------------------------------------------------

// What a finder lists from the folder (each entry's own format is the
// registry's case in wire_test), as the vendor runtime would: a sender that
// ended stays listed for about a second, and so does one whose process died
// (here a zombie, as a parent that has not looked yet leaves it), from when
// it is found dead; a name is listed once, with its entry made first while
// that is listed; a sender's full name is the host's in capitals, then its
// own. Entries that are no entries are skipped; one gone long ago is removed
// by the reader that finds it.
TEST_F(Loopback, TheListingKeepsTheGoneForASecondAndEachNameOnce) {
  const pid_t dead = fork();  // while this process has one thread
  if (dead == 0) _exit(0);
  siginfo_t info{};
  ASSERT_EQ(::waitid(P_PID, static_cast<id_t>(dead), &info, WEXITED | WNOWAIT), 0);  // a zombie now
  Sender ended;
  ASSERT_TRUE(ended.Start(folder_, "Ended", {"--width", "16", "--height", "8", "--fps", "10"}));
  ended.Process().Signal(SIGTERM);
  ASSERT_EQ(ended.Process().Wait(kPatience), std::optional<int>(0)) << "SIGTERM ends the sender cleanly";
  const std::string dir = ndilb::RegistryDir(), alive = std::to_string(getpid());
  const std::int64_t now = std::chrono::duration_cast<std::chrono::nanoseconds>(
                               std::chrono::system_clock::now().time_since_epoch()).count();
  auto write = [&](const std::string& file, const std::string& name, int port, const std::string& pid,
                   std::int64_t since, std::int64_t gone = 0) {
    std::ofstream(dir + "/" + file) << "ndi-loopback 1\nname=" << name << "\nurl=127.0.0.1:" << port << "\npid=" << pid
                                    << "\nsince=" << since << (gone != 0 ? "\ngone=" + std::to_string(gone) : "") << "\n";
  };
  std::ofstream(dir + "/1-1.ndi") << "garbage\n";
  write("notes.txt", "OTHER FILE (x)", 2, alive, now);
  write("5-5.ndi", "ALIVE (x)", 5, alive, now);
  write("4-4.ndi", "DEAD (x)", 4, std::to_string(dead), now);
  write("7-7.ndi", "BACK (x)", 7, alive, now);
  write("8-8.gone", "BACK (x)", 8, alive, now - 2, now);
  write("9-9.gone", "BACK (x)", 9, alive, now - 3, now - 2'000'000'000);
  write("6-6.gone", "LONG GONE (x)", 6, alive, now - 30'000'000'000, now - 20'000'000'000);
  auto listed = [] {
    std::vector<std::string> names;
    for (const ndilb::RegistryEntry& e : ndilb::ListRegistry()) names.push_back(e.name + "@" + e.url);
    return names;
  };
  EXPECT_THAT(listed(), ::testing::UnorderedElementsAre("ALIVE (x)@127.0.0.1:5", "BACK (x)@127.0.0.1:8",
                                                        "DEAD (x)@127.0.0.1:4",
                                                        ::testing::MatchesRegex("[^a-z]+ \\(Ended\\)@127\\.0\\.0\\.1:[0-9]+")));
  EXPECT_FALSE(std::ifstream(dir + "/6-6.gone").good());
  EXPECT_TRUE(pmtest::WaitFor(
      [&] { return listed() == std::vector<std::string>{"ALIVE (x)@127.0.0.1:5", "BACK (x)@127.0.0.1:7"}; }, kPatience));
  ::waitpid(dead, nullptr, 0);
}

// As with the vendor runtime, a receiver made for a URL takes whichever
// sender listens there, and finds its sender by name when nothing answers.
TEST_F(Loopback, ReceiverTakesTheSenderAtItsUrlElseTheOneListedForItsName) {
  Sender there, named;
  ASSERT_TRUE(there.Start(folder_, "There", {"--width", "32", "--height", "8", "--fps", "30"}));
  ASSERT_TRUE(named.Start(folder_, "Named", {"--width", "16", "--height", "8", "--fps", "30"}));
  const std::string thereUrl = there.Find("ready").value("url", "");
  const std::pair<const char*, int> cases[] = {{thereUrl.c_str(), 32}, {"127.0.0.1:1", 16}, {nullptr, 16}};
  for (const auto& [url, width] : cases) {
    SCOPED_TRACE(url ? url : "no url");
    Receiver rx(named.Name(), kNdiBandwidthHighest, url);
    ASSERT_TRUE(rx.Next(kNdiFrameVideo, [&](const Frame& f) { EXPECT_EQ(f.v.xres, width); }));
  }
}

// --- pictures -------------------------------------------------------------

// What the receiver makes of each sender's picture for the task's colour
// format (UYVY_BGRA; the other formats' FourCCs and the conversions' values
// are wire_test's): as it was sent when that FourCC is delivered, byte for
// byte with rows at the 16-pixel stride; converted otherwise; stamped with
// the sender's clock.
TEST_F(Loopback, PicturesArriveInTheFourCCAndStrideTheTaskIsGiven) {
  // Sender format and width; the FourCC and stride delivered.
  const std::tuple<std::string, int, std::uint32_t, int> cases[] = {
      {"uyvy", 72, kNdiFourCCUYVY, 160}, {"uyva", 64, kNdiFourCCBGRA, 256}, {"nv12", 64, kNdiFourCCUYVY, 128},
      {"yv12", 72, kNdiFourCCUYVY, 160}, {"rgbx", 64, kNdiFourCCUYVY, 128}};
  for (const auto& [format, width, delivered, stride] : cases) {
    SCOPED_TRACE(format + " " + std::to_string(width));
    Sender src;
    ASSERT_TRUE(src.Start(folder_, "Ramp " + format,
                          {"--width", std::to_string(width), "--height", "36", "--fps", "100", "--format", format,
                           "--pattern", "ramp", "--no-audio", "--seconds", "10"}));
    Receiver rx(src.Name());
    const bool as_sent = ndits::FourCCFromName(format) == delivered;
    for (int i = 0; i < 5; ++i) {
      ASSERT_TRUE(rx.Next(kNdiFrameVideo, [&](const Frame& f) {
        const ndi_video_frame_v2& v = f.v;
        EXPECT_EQ(std::make_tuple(v.FourCC, v.line_stride_in_bytes, v.xres, v.yres, v.frame_rate_N),
                  std::make_tuple(delivered, stride, width, 36, 100));
        EXPECT_EQ(as_sent ? Ramp(v) : "", "");
        // The sender's clock, in 100 ns units.
        const std::int64_t now = std::chrono::duration_cast<std::chrono::microseconds>(
                                     std::chrono::system_clock::now().time_since_epoch()).count() * 10;
        EXPECT_LT(std::llabs(now - v.timestamp), 50'000'000) << "within 5 s of now";
      }));
    }
  }
}

// Lowest bandwidth, as the task may ask: the vendor's proxy picture; and
// first of all the sender's connection metadata (the task reads the camera's
// model there).
TEST_F(Loopback, LowestBandwidthGetsTheConnectionMetadataThenTheProxyPicture) {
  Sender src;
  ASSERT_TRUE(src.Start(folder_, "Bw", {"--width", "1280", "--height", "720", "--fps", "50", "--no-audio", "--model",
                                        "Studio Cam 9"}));
  Receiver lowest(src.Name(), kNdiBandwidthLowest);
  ASSERT_TRUE(lowest.Next(kNdiFrameMetadata, [](const Frame& f) {
    EXPECT_EQ(std::string(f.m.data, static_cast<std::size_t>(f.m.length)),
              std::string("<ndi_product model_name=\"Studio Cam 9\"/>") + '\0') << "its length counts the zero";
  }));
  ASSERT_TRUE(lowest.Next(kNdiFrameVideo, [](const Frame& f) {
    EXPECT_EQ(std::make_pair(f.v.xres, f.v.yres), std::make_pair(640, 360));
  }));
}

TEST_F(Loopback, QueuesDropTheOldestFramesOfASlowReceiverAndHeldFramesStayIntact) {
  ndi_send_create settings{"Flood", nullptr, false, false};
  void* sender = NDIlib_send_create(&settings);
  ASSERT_NE(sender, nullptr);
  Receiver rx(ndilb::FullSourceName("Flood"));
  ASSERT_TRUE(rx.WaitConnected());
  const auto planes = ndits::PictureLayout(kNdiFourCCUYVY, 64, 16);
  std::vector<std::uint8_t> picture(ndits::PictureSize(planes));
  const ndi_video_frame_v2 frame{64, 16, kNdiFourCCUYVY, 30, 1, 0, 0, 0, picture.data(), 128, nullptr, 0};
  auto send = [&](std::int64_t n) {
    ndits::FillRamp(planes, n, picture.data());
    NDIlib_send_send_video_v2(sender, &frame);
  };
  // Two frames held by the caller while twenty more go through.
  for (int n = 0; n < 2; ++n) send(n);
  const Frame held[2] = {rx.Take(kNdiFrameVideo), rx.Take(kNdiFrameVideo)};
  for (int n = 2; n < 22; ++n) send(n);
  // A metadata frame after the pictures: once it can be captured (pictures
  // stay queued while only metadata is asked for), every picture is queued.
  char end[] = "<end/>";
  ndi_metadata_frame marker{sizeof end, 0, end};
  NDIlib_send_send_metadata(sender, &marker);
  ndi_metadata_frame got{};
  ASSERT_EQ(NDIlib_recv_capture_v2(rx.handle, nullptr, nullptr, &got, 5000), kNdiFrameMetadata);
  EXPECT_STREQ(got.data, end);
  NDIlib_recv_free_metadata(rx.handle, &got);
  // A picture's number; -1 when it is no intact ramp.
  auto number = [](const Frame& f) {
    std::int64_t n = -1;
    return Ramp(f.v, &n).empty() ? n : -1;
  };
  std::vector<std::int64_t> numbers;
  for (Frame f = rx.Capture(0); f.type == kNdiFrameVideo; rx.Free(f), f = rx.Capture(0)) numbers.push_back(number(f));
  numbers.insert(numbers.end(), {number(held[0]), number(held[1])});
  // Bounded at eight pictures: the oldest went first, the newest is kept; the
  // held ones last.
  EXPECT_EQ(numbers, (std::vector<std::int64_t>{14, 15, 16, 17, 18, 19, 20, 21, 0, 1}));
  rx.Free(held[1]);
  rx.Free(held[0]);
  rx.Free(held[0]);  // a second free is ignored
  NDIlib_send_destroy(sender);
}

// --- metadata, tally, PTZ -------------------------------------------------

// An in-process sender (as ndi-testsrc is) counts its receivers and combines
// their tally; a receiver that goes takes its tally with it.
TEST_F(Loopback, AnInProcessSenderCountsItsReceiversAndCombinesTheirTally) {
  ndi_send_create settings{"Combined", nullptr, false, false};
  void* sender = NDIlib_send_create(&settings);
  ASSERT_NE(sender, nullptr);
  auto live = std::make_unique<Receiver>(ndilb::FullSourceName("Combined"));
  Receiver look(ndilb::FullSourceName("Combined"));
  ASSERT_TRUE(live->WaitConnected() && look.WaitConnected());
  EXPECT_TRUE(pmtest::WaitFor([&] { return NDIlib_send_get_no_connections(sender, 0) == 2; }, kPatience));
  ndi_tally t{};
  const ndi_tally program{true, false}, preview{false, true};
  ASSERT_TRUE(NDIlib_recv_set_tally(live->handle, &program));
  ASSERT_TRUE(NDIlib_recv_set_tally(look.handle, &preview));
  EXPECT_TRUE(pmtest::WaitFor([&] {
    NDIlib_send_get_tally(sender, &t, 50);
    return t.on_program && t.on_preview;
  }, kPatience));
  live.reset();  // its program tally goes with it
  EXPECT_TRUE(NDIlib_send_get_tally(sender, &t, 2000));
  EXPECT_EQ(std::make_pair(t.on_program, t.on_preview), std::make_pair(false, true));
  EXPECT_EQ(NDIlib_send_get_no_connections(sender, 0), 1);
  NDIlib_send_destroy(sender);
  EXPECT_TRUE(pmtest::WaitFor([&] { return look.Connections() == 0; }, kPatience));
}

// As with the vendor runtime: a status change at once, before the
// connection, and one more when a sender that takes PTZ connects (it says so
// in its <ndi_capabilities ntk_ptz="true"/>); PTZ commands go out either way, as the text the vendor runtime sends for the
// same call (one call of each shape: zoom and pan/tilt come through the
// whole chain).
TEST_F(Loopback, PtzSupportFollowsTheSendersAnnouncementAndCallsReachItAsTheVendorsTexts) {
  const std::pair<std::function<bool(void*)>, const char*> calls[] = {
      {[](void* r) { return NDIlib_recv_ptz_recall_preset(r, 3, 0.25f); }, R"(<ntk_ptz_recall_preset index="3" speed="0.250000"/>)"},
      {[](void* r) { return NDIlib_recv_ptz_focus(r, 0.3f); }, R"(<ntk_ptz_focus mode="manual" distance="0.300000"/>)"},
      {[](void* r) { return NDIlib_recv_ptz_white_balance_manual(r, 0.4f, 0.9f); },
       R"(<ntk_ptz_white_balance mode="manual" red="0.400000" blue="0.900000"/>)"},
  };
  for (bool ptz : {false, true}) {
    SCOPED_TRACE(ptz);
    Sender src;
    ASSERT_TRUE(src.Start(folder_, ptz ? "With PTZ" : "No PTZ",
                          {"--width", "16", "--height", "8", "--fps", "10", ptz ? "--ptz" : "--no-audio"}));
    Receiver rx(src.Name());
    ASSERT_EQ(rx.Capture(0).type, kNdiFrameStatusChange);
    EXPECT_FALSE(NDIlib_recv_ptz_is_supported(rx.handle));
    ASSERT_TRUE(rx.WaitConnected());
    EXPECT_EQ(rx.Next(kNdiFrameStatusChange, {}, ptz ? kPatience : 300ms), ptz);
    EXPECT_EQ(NDIlib_recv_ptz_is_supported(rx.handle), ptz);
    for (const auto& [call, xml] : calls) {
      EXPECT_TRUE(call(rx.handle)) << xml;
      EXPECT_TRUE(src.WaitFor("ptz", [&](const nlohmann::json& e) { return e.value("xml", "") == xml; })) << xml;
    }
  }
}

// --- bad input ------------------------------------------------------------

TEST_F(Loopback, GarbageOnASendersPortDropsOnlyThatConnection) {
  Sender src;
  ASSERT_TRUE(src.Start(folder_, "Guarded", {"--width", "16", "--height", "8", "--fps", "20", "--pattern", "ramp"}));
  Receiver rx(src.Name());
  ASSERT_TRUE(rx.WaitConnected());
  // Garbage, and a connection that never says hello (the decoder's refusals
  // are wire_test's).
  for (const std::string& bytes : {std::string(100, 'Z'), std::string()}) {
    SCOPED_TRACE(bytes);
    EXPECT_TRUE(DroppedAfter(ndilb::ConnectTo(src.Find("ready").value("url", ""), 1000), bytes, 4s));
  }
  // The real receiver kept its connection and its frames.
  EXPECT_EQ(rx.Connections(), 1);
  ASSERT_TRUE(rx.Next(kNdiFrameVideo, [](const Frame& f) { EXPECT_EQ(Ramp(f.v), ""); }));
}

// A fake sender (a listening socket here with a registry entry) against a
// real receiver: garbage drops the connection, the receiver comes again
// with its tally, a tally set after its hello follows the hello even before
// the sender's Ready (it was once kept and never sent), half a picture is
// never delivered, and destroying the receiver in the middle of a picture
// does not wait for the rest.
TEST_F(Loopback, AFakeSendersGarbageAndHalfPictureReachNothingAndTheReceiverTriesAgain) {
  int port = 0;
  const ndilb::SocketHandle listener = ndilb::ListenLoopback(&port);
  ASSERT_NE(ndilb::WriteRegistryEntry({"FAKE (x)", "127.0.0.1:" + std::to_string(port), ::getpid(), 0, 0}), "");
  auto rx = std::make_unique<Receiver>("FAKE (x)");
  auto accept = [&] { return Readable(listener, kPatience) ? ndilb::AcceptFrom(listener) : ndilb::kNoSocket; };
  // The messages from the receiver until one with `on_preview` comes.
  ndilb::Decoder from_receiver(ndilb::SenderSideLimits(), nullptr);
  auto tally = [&](ndilb::SocketHandle fd, bool on_preview) {
    std::uint8_t bytes[256];
    for (std::int64_t n = 0; Readable(fd, kPatience) && (n = ::recv(fd, bytes, sizeof bytes, 0)) > 0;) {
      if (!from_receiver.Feed(bytes, static_cast<std::size_t>(n))) return false;
      while (auto m = from_receiver.Pop()) {
        if (m->on_preview == on_preview && m->on_program) return true;
      }
    }
    return false;
  };
  EXPECT_TRUE(DroppedAfter(accept(), std::string(64, 'Z'), 2s));
  const ndi_tally program{true, false}, both{true, true};
  EXPECT_TRUE(NDIlib_recv_set_tally(rx->handle, &program)) << "taken between connections";
  const ndilb::SocketHandle fd = accept();
  ASSERT_NE(fd, ndilb::kNoSocket) << "the receiver comes again";
  EXPECT_TRUE(tally(fd, false)) << "the tally set between connections";
  EXPECT_TRUE(NDIlib_recv_set_tally(rx->handle, &both));
  EXPECT_TRUE(tally(fd, true)) << "the tally set before the sender's Ready";
  const ndilb::EncodedHead ready = ndilb::EncodeReady(false),
                           head = ndilb::EncodeVideo({.xres = 1920, .yres = 1080, .fourcc = kNdiFourCCUYVY,
                                                      .line_stride = 3840}, 0, 3840u * 1080);
  const std::vector<std::uint8_t> half(3840u * 540, 7);
  ASSERT_TRUE(Write(fd, ready.bytes, ready.size) && Write(fd, head.bytes, head.size) && Write(fd, half.data(), half.size()));
  EXPECT_TRUE(rx->WaitConnected());
  EXPECT_EQ(rx->Capture(0).type, kNdiFrameStatusChange) << "the one of its making";
  const auto start = Clock::now();
  EXPECT_NE(rx->Capture(250).type, kNdiFrameVideo) << "half a picture is no picture";
  EXPECT_GE(Clock::now() - start, 240ms) << "capture waits its timeout";
  rx.reset();
  EXPECT_LT(Clock::now() - start, 1250ms) << "destroyed without waiting for the rest of the picture";
  ndilb::CloseSocket(fd);
  ndilb::CloseSocket(listener);
}

}  // namespace
