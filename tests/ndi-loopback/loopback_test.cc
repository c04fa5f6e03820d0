// The loopback runtime across processes: a child ndi-testsrc sends, the test
// receives through the NDI C interface. Each case has its own registry folder.
#include <arpa/inet.h>
#include <netinet/in.h>
#include <poll.h>
#include <signal.h>
#include <sys/socket.h>
#include <sys/wait.h>
#include <unistd.h>

#include <gtest/gtest.h>

#include <chrono>
#include <cstring>
#include <fstream>
#include <string>
#include <thread>
#include <vector>

#include "child.h"
#include "ndi-loopback/picture.h"
#include "ndi-loopback/registry.h"
#include "ndi-loopback/wire.h"
#include "ndi-testsrc/pattern.h"
#include "support/wait.h"
#include "ndi/ndi_abi.h"

namespace {

using namespace std::chrono_literals;
using ndilbtest::TestSource;
using nlohmann::json;

std::vector<std::string> SourceNames() {
  void* finder = NDIlib_find_create_v2(nullptr);
  std::uint32_t count = 0;
  const ndi_source* sources = NDIlib_find_get_current_sources(finder, &count);
  std::vector<std::string> names;
  for (std::uint32_t i = 0; i < count; ++i) names.push_back(std::string(sources[i].ndi_name) + "@" + sources[i].url_address);
  NDIlib_find_destroy(finder);
  return names;
}

// A receiver that frees what it captures unless told to keep it.
class Receiver {
 public:
  explicit Receiver(const std::string& name, std::int32_t bandwidth = kNdiBandwidthHighest, const char* url = nullptr,
                    std::int32_t color_format = kNdiColorUyvyBgra) {
    ndi_recv_create settings{};
    settings.source_to_connect_to.ndi_name = name.empty() ? nullptr : name.c_str();
    settings.source_to_connect_to.url_address = url;
    settings.color_format = color_format;
    settings.bandwidth = bandwidth;
    handle_ = NDIlib_recv_create_v2(&settings);
  }
  ~Receiver() { NDIlib_recv_destroy(handle_); }
  void* get() const { return handle_; }
  int Connections() const { return NDIlib_recv_get_no_connections(handle_); }
  bool WaitConnected(std::chrono::milliseconds timeout = 5s) const {
    return pmtest::WaitFor([&] { return Connections() == 1; }, timeout);
  }
  // Captures until a frame of `type` arrives (others are freed); false on timeout.
  bool CaptureType(std::int32_t type, ndi_video_frame_v2* v, ndi_audio_frame_v2* a, ndi_metadata_frame* m,
                   std::chrono::milliseconds timeout = 5s) {
    const auto deadline = std::chrono::steady_clock::now() + timeout;
    while (std::chrono::steady_clock::now() < deadline) {
      ndi_video_frame_v2 vv{};
      ndi_audio_frame_v2 aa{};
      ndi_metadata_frame mm{};
      const std::int32_t got = NDIlib_recv_capture_v2(handle_, &vv, &aa, &mm, 100);
      if (got == type) {
        if (v != nullptr) *v = vv;
        if (a != nullptr) *a = aa;
        if (m != nullptr) *m = mm;
        if (got == kNdiFrameStatusChange) return true;
        if (v == nullptr && got == kNdiFrameVideo) NDIlib_recv_free_video_v2(handle_, &vv);
        if (a == nullptr && got == kNdiFrameAudio) NDIlib_recv_free_audio_v2(handle_, &aa);
        if (m == nullptr && got == kNdiFrameMetadata) NDIlib_recv_free_metadata(handle_, &mm);
        return true;
      }
      if (got == kNdiFrameVideo) NDIlib_recv_free_video_v2(handle_, &vv);
      if (got == kNdiFrameAudio) NDIlib_recv_free_audio_v2(handle_, &aa);
      if (got == kNdiFrameMetadata) NDIlib_recv_free_metadata(handle_, &mm);
    }
    return false;
  }

 private:
  void* handle_ = nullptr;
};

std::vector<std::string> Args(const std::string& name, std::initializer_list<std::string> more) {
  std::vector<std::string> a = {"--name", name};
  a.insert(a.end(), more);
  return a;
}

auto IsEvent(const std::string& kind) {
  return [kind](const json& e) { return e.value("event", "") == kind; };
}

class Loopback : public ::testing::Test {
 protected:
  ndilbtest::RegistryDir dir_;
};

// --- discovery ------------------------------------------------------------

// As with the vendor runtime, a sender that went stays listed for about a
// second, whether it ended in order or was killed (and not yet reaped); the
// finder's wait sees the change when it is listed no more.
TEST_F(Loopback, DiscoveryListsASenderThatWentForASecondMore) {
  for (const int sig : {SIGTERM, SIGKILL}) {
    SCOPED_TRACE(sig == SIGTERM ? "ended in order" : "killed");
    TestSource src(Args("Went", {"--width", "16", "--height", "8", "--fps", "10"}));
    ASSERT_TRUE(src.WaitReady());
    EXPECT_NE(src.name().find(" (Went)"), std::string::npos);
    EXPECT_EQ(src.url().rfind("127.0.0.1:", 0), 0u) << src.url();
    void* finder = NDIlib_find_create_v2(nullptr);
    std::uint32_t count = 0;
    NDIlib_find_get_current_sources(finder, &count);
    EXPECT_EQ(count, 1u);
    const auto went = std::chrono::steady_clock::now();
    src.Signal(sig);
    EXPECT_TRUE(NDIlib_find_wait_for_sources(finder, 5000)) << "the change is seen";
    EXPECT_GE(std::chrono::steady_clock::now() - went, std::chrono::milliseconds(ndilb::kListedAfterGoneMs));
    NDIlib_find_get_current_sources(finder, &count);
    EXPECT_EQ(count, 0u);
    EXPECT_FALSE(NDIlib_find_wait_for_sources(finder, 100)) << "no change, no wake-up";
    NDIlib_find_destroy(finder);
    if (sig == SIGTERM) {
      EXPECT_EQ(src.Wait(), 0) << "SIGTERM ends the sender cleanly";
    }
  }
}

TEST_F(Loopback, DiscoverySkipsMalformedEntriesAndListsEachNameOnceAsTheVendorRuntimeDoes) {
  pid_t dead = fork();
  if (dead == 0) _exit(0);
  ASSERT_GT(dead, 0);
  waitpid(dead, nullptr, 0);
  const std::string alive = std::to_string(getpid());
  const auto now = std::chrono::duration_cast<std::chrono::nanoseconds>(
                       std::chrono::system_clock::now().time_since_epoch()).count();
  auto write = [&](const std::string& file, const std::string& text) {
    std::ofstream(dir_.path() + "/" + file) << "ndi-loopback 1\n" << text;
  };
  auto exists = [&](const std::string& file) { return ::access((dir_.path() + "/" + file).c_str(), F_OK) == 0; };
  std::ofstream(dir_.path() + "/1-1.ndi") << "garbage\n";
  write("2-2.ndi", "name=NO PID\nurl=127.0.0.1:1\n");
  write("3-3.ndi", std::string(10000, 'x'));
  write("notes.txt", "name=OTHER FILE\nurl=127.0.0.1:6\npid=" + alive + "\n");
  write("5-5.ndi", "name=ALIVE (x)\nurl=127.0.0.1:5\npid=" + alive + "\n");
  // A process that died: listed for a second from when it is found gone.
  write("4-4.ndi", "name=DEAD (x)\nurl=127.0.0.1:4\npid=" + std::to_string(dead) + "\n");
  // One name, three entries: the one made first while it is listed.
  write("7-7.ndi", "name=BACK (x)\nurl=127.0.0.1:7\npid=" + alive + "\nsince=" + std::to_string(now) + "\n");
  write("8-8.gone", "name=BACK (x)\nurl=127.0.0.1:8\npid=" + alive + "\nsince=" + std::to_string(now - 2) +
                        "\ngone=" + std::to_string(now) + "\n");
  write("9-9.gone", "name=BACK (x)\nurl=127.0.0.1:9\npid=" + alive + "\nsince=" + std::to_string(now - 3) +
                        "\ngone=" + std::to_string(now - 2'000'000'000) + "\n");
  // Gone long ago: removed by the reader that finds it.
  write("6-6.gone", "name=LONG GONE (x)\nurl=127.0.0.1:6\npid=" + alive + "\ngone=" +
                        std::to_string(now - 20'000'000'000) + "\n");
  EXPECT_EQ(SourceNames(), (std::vector<std::string>{"ALIVE (x)@127.0.0.1:5", "BACK (x)@127.0.0.1:8",
                                                     "DEAD (x)@127.0.0.1:4"}));
  EXPECT_FALSE(exists("4-4.ndi"));
  EXPECT_TRUE(exists("4-4.gone"));
  EXPECT_FALSE(exists("6-6.gone"));
  EXPECT_TRUE(pmtest::WaitFor([&] {
    return SourceNames() == std::vector<std::string>{"ALIVE (x)@127.0.0.1:5", "BACK (x)@127.0.0.1:7"};
  }));
}

// As with the vendor runtime, a receiver made for a URL takes whichever
// sender listens there, and finds its sender by name when nothing answers.
TEST_F(Loopback, ReceiverTakesTheSenderAtItsUrlElseTheOneListedForItsName) {
  TestSource there(Args("There", {"--width", "32", "--height", "8", "--fps", "30"}));
  TestSource named(Args("Named", {"--width", "16", "--height", "8", "--fps", "30"}));
  ASSERT_TRUE(there.WaitReady() && named.WaitReady());
  struct Case {
    const char* url;
    int width;
  };
  for (const Case c : {Case{there.url().c_str(), 32}, Case{"127.0.0.1:1", 16}, Case{nullptr, 16}}) {
    SCOPED_TRACE(c.url ? c.url : "no url");
    Receiver rx(named.name(), kNdiBandwidthHighest, c.url);
    ndi_video_frame_v2 v{};
    ASSERT_TRUE(rx.CaptureType(kNdiFrameVideo, &v, nullptr, nullptr));
    EXPECT_EQ(v.xres, c.width);
    NDIlib_recv_free_video_v2(rx.get(), &v);
  }
}

// --- video, audio -------------------------------------------------------------

// Each picture format meets each colour format as with the vendor runtime
// (picture.h): as it was sent when the receiver takes that FourCC, byte for
// byte (ramps intact, rows at the 16-pixel stride), converted otherwise.
TEST_F(Loopback, PicturesArriveInTheFourCCOfTheColourFormat) {
  struct Case {
    const char* format;
    int width;
    std::int32_t color;
    std::uint32_t delivered;
  };
  const Case cases[] = {
      {"uyvy", 64, kNdiColorUyvyBgra, kNdiFourCCUYVY}, {"uyvy", 72, kNdiColorUyvyBgra, kNdiFourCCUYVY},
      {"uyva", 64, kNdiColorFastest, kNdiFourCCUYVA},  {"bgra", 64, kNdiColorUyvyBgra, kNdiFourCCBGRA},
      {"bgra", 64, kNdiColorBgrxBgra, kNdiFourCCBGRA}, {"bgrx", 64, kNdiColorBgrxBgra, kNdiFourCCBGRX},
      {"rgba", 64, kNdiColorRgbxRgba, kNdiFourCCRGBA}, {"rgbx", 64, kNdiColorRgbxRgba, kNdiFourCCRGBX},
      {"uyva", 64, kNdiColorUyvyBgra, kNdiFourCCBGRA}, {"nv12", 64, kNdiColorUyvyBgra, kNdiFourCCUYVY},
      {"i420", 64, kNdiColorUyvyBgra, kNdiFourCCUYVY}, {"yv12", 72, kNdiColorUyvyRgba, kNdiFourCCUYVY},
      {"rgbx", 64, kNdiColorUyvyBgra, kNdiFourCCUYVY}, {"uyvy", 64, kNdiColorRgbxRgba, kNdiFourCCRGBX},
  };
  for (const Case& c : cases) {
    SCOPED_TRACE(std::string(c.format) + " " + std::to_string(c.width) + " colour " + std::to_string(c.color));
    TestSource src(Args("Ramp " + std::string(c.format), {"--width", std::to_string(c.width), "--height", "36", "--fps",
                                                         "100", "--format", c.format, "--pattern", "ramp", "--no-audio",
                                                         "--seconds", "10"}));
    ASSERT_TRUE(src.WaitReady());
    Receiver rx(src.name(), kNdiBandwidthHighest, nullptr, c.color);
    const bool as_sent = ndits::FourCCFromName(c.format) == c.delivered;
    std::int64_t last = -1, last_stamp = 0;
    for (int i = 0; i < 5; ++i) {
      ndi_video_frame_v2 v{};
      ASSERT_TRUE(rx.CaptureType(kNdiFrameVideo, &v, nullptr, nullptr));
      EXPECT_EQ(v.FourCC, c.delivered);
      EXPECT_EQ(v.line_stride_in_bytes, ndilb::DeliveredStride(c.delivered, c.width));
      EXPECT_EQ(v.xres, c.width);
      EXPECT_EQ(v.yres, 36);
      EXPECT_EQ(v.frame_rate_N, 100);
      if (as_sent) {
        std::int64_t n = -1;
        EXPECT_EQ(ndits::CheckRamp(v.FourCC, v.xres, v.yres, v.line_stride_in_bytes, v.data, &n), "");
        EXPECT_GT(n, last);
        last = n;
      }
      // The sender's clock, in 100 ns units.
      const std::int64_t now = std::chrono::duration_cast<std::chrono::microseconds>(
                                   std::chrono::system_clock::now().time_since_epoch()).count() * 10;
      EXPECT_GT(v.timestamp, last_stamp);
      EXPECT_LT(std::llabs(now - v.timestamp), 50'000'000) << "within 5 s of now";
      last_stamp = v.timestamp;
      NDIlib_recv_free_video_v2(rx.get(), &v);
    }
  }
}

TEST_F(Loopback, AudioArrivesPlanarAndInterleavesThroughTheUtility) {
  TestSource src(Args("Audio", {"--width", "16", "--height", "8", "--fps", "50", "--pattern", "ramp",
                                "--audio-channels", "3", "--audio-samples", "480", "--seconds", "10"}));
  ASSERT_TRUE(src.WaitReady());
  Receiver rx(src.name());
  std::int64_t expect_next = -1;
  for (int f = 0; f < 4; ++f) {
    ndi_audio_frame_v2 a{};
    ASSERT_TRUE(rx.CaptureType(kNdiFrameAudio, nullptr, &a, nullptr));
    ASSERT_EQ(a.no_channels, 3);
    ASSERT_EQ(a.no_samples, 480);
    EXPECT_EQ(a.sample_rate, 48000);
    ASSERT_GE(a.channel_stride_in_bytes, 480 * 4);
    auto at = [&](int c, int s) {
      return reinterpret_cast<const float*>(reinterpret_cast<const std::uint8_t*>(a.data) +
                                            static_cast<std::size_t>(c) * a.channel_stride_in_bytes)[s];
    };
    const std::int64_t start = static_cast<std::int64_t>(at(0, 0) * 1024.0f);
    if (expect_next >= 0) {
      EXPECT_EQ(start, expect_next % 1024) << "audio frames follow each other";
    }
    expect_next = start + 480;
    for (int c = 0; c < 3; ++c) {
      for (int s = 0; s < 480; ++s) ASSERT_EQ(at(c, s), ndits::AudioRampSample(start + s, c)) << c << "/" << s;
    }
    std::vector<float> out(3 * 480);
    ndi_audio_frame_interleaved_32f dst{a.sample_rate, 3, 480, 0, out.data()};
    NDIlib_util_audio_to_interleaved_32f_v2(&a, &dst);
    for (int s = 0; s < 480; ++s) {
      for (int c = 0; c < 3; ++c) ASSERT_EQ(out[static_cast<std::size_t>(s) * 3 + c], at(c, s));
    }
    NDIlib_recv_free_audio_v2(rx.get(), &a);
  }
}

// --- metadata, tally, PTZ -------------------------------------------------------

TEST_F(Loopback, ConnectionMetadataComesFirstAndMetadataReachesTheSender) {
  TestSource src(Args("Meta", {"--width", "16", "--height", "8", "--fps", "10", "--model", "Studio Cam 9"}));
  ASSERT_TRUE(src.WaitReady());
  Receiver rx(src.name());
  ndi_metadata_frame m{};
  ASSERT_TRUE(rx.CaptureType(kNdiFrameMetadata, nullptr, nullptr, &m));
  EXPECT_EQ(std::string(m.data), "<ndi_product model_name=\"Studio Cam 9\"/>");
  EXPECT_EQ(m.length, static_cast<int>(std::strlen(m.data) + 1));
  NDIlib_recv_free_metadata(rx.get(), &m);
  EXPECT_TRUE(rx.WaitConnected());

  const std::string xml = "<metadata>\n    <receiver_info name=\"x &amp; y\"/>\n</metadata>\n";
  ndi_metadata_frame out{static_cast<int>(xml.size() + 1), 0, const_cast<char*>(xml.c_str())};
  EXPECT_TRUE(NDIlib_recv_send_metadata(rx.get(), &out));
  json got = src.WaitEvent(IsEvent("metadata"));
  EXPECT_EQ(got.value("xml", ""), xml) << "exactly as sent";
  EXPECT_FALSE(src.WaitEvent(IsEvent("ptz"), 100ms).is_object()) << "plain metadata is not a PTZ command";
}

TEST_F(Loopback, MetadataFromAnInProcessSenderReachesTheReceiver) {
  ndi_send_create settings{"Local", nullptr, false, false};
  void* sender = NDIlib_send_create(&settings);
  ASSERT_NE(sender, nullptr);
  Receiver rx(ndilb::FullSourceName("Local"));
  ASSERT_TRUE(rx.WaitConnected());
  EXPECT_EQ(NDIlib_send_get_no_connections(sender, 1000), 1);
  std::string xml = "<shot value=\"1\"/>";
  ndi_metadata_frame frame{static_cast<int>(xml.size() + 1), 77, xml.data()};
  NDIlib_send_send_metadata(sender, &frame);
  ndi_metadata_frame m{};
  // The sender's answer to the receiver's tally comes first, on connecting.
  ASSERT_TRUE(rx.CaptureType(kNdiFrameMetadata, nullptr, nullptr, &m));
  EXPECT_EQ(std::string(m.data), "<ndi_tally_echo on_program=\"false\" on_preview=\"false\"/>");
  NDIlib_recv_free_metadata(rx.get(), &m);
  ASSERT_TRUE(rx.CaptureType(kNdiFrameMetadata, nullptr, nullptr, &m));
  EXPECT_EQ(std::string(m.data), xml);
  EXPECT_EQ(m.timecode, 77);
  NDIlib_recv_free_metadata(rx.get(), &m);
  NDIlib_send_destroy(sender);
  EXPECT_TRUE(pmtest::WaitFor([&] { return rx.Connections() == 0; }, 1s));
}

TEST_F(Loopback, TallyChangesReachTheSender) {
  TestSource src(Args("Tally", {"--width", "16", "--height", "8", "--fps", "10"}));
  ASSERT_TRUE(src.WaitReady());
  Receiver rx(src.name());
  ndi_tally program{true, false};
  EXPECT_TRUE(pmtest::WaitFor([&] { return NDIlib_recv_set_tally(rx.get(), &program); }, 5s))
      << "accepted once connected";
  // Each change, in order (a connection change also reports the tally).
  auto tally = [](bool program, bool preview) {
    return [=](const json& e) {
      return e.value("event", "") == "tally" && e.value("program", !program) == program &&
             e.value("preview", !preview) == preview;
    };
  };
  std::size_t from = 0;
  EXPECT_TRUE(src.WaitEvent(tally(true, false), 5s, &from).is_object());
  ndi_tally preview{false, true};
  EXPECT_TRUE(NDIlib_recv_set_tally(rx.get(), &preview));
  EXPECT_TRUE(src.WaitEvent(tally(false, true), 5s, &from).is_object());
  EXPECT_TRUE(src.WaitEvent(IsEvent("connections")).is_object());
}

TEST_F(Loopback, SenderCombinesTheTallyOfItsReceiversAndCountsThem) {
  ndi_send_create settings{"Combined", nullptr, false, false};
  void* sender = NDIlib_send_create(&settings);
  ASSERT_NE(sender, nullptr);
  auto live = std::make_unique<Receiver>(ndilb::FullSourceName("Combined"));
  Receiver look(ndilb::FullSourceName("Combined"));
  ASSERT_TRUE(live->WaitConnected());
  ASSERT_TRUE(look.WaitConnected());
  EXPECT_TRUE(pmtest::WaitFor([&] { return NDIlib_send_get_no_connections(sender, 0) == 2; }, 2s));
  ndi_tally t{};
  // Reported on every connection change (as the vendor runtime does), then
  // not again until something changes.
  EXPECT_TRUE(NDIlib_send_get_tally(sender, &t, 0));
  EXPECT_FALSE(t.on_program || t.on_preview);
  EXPECT_FALSE(NDIlib_send_get_tally(sender, &t, 0)) << "nothing changed since";
  const ndi_tally program{true, false}, preview{false, true};
  ASSERT_TRUE(NDIlib_recv_set_tally(live->get(), &program));
  ASSERT_TRUE(NDIlib_recv_set_tally(look.get(), &preview));
  EXPECT_TRUE(pmtest::WaitFor([&] {
    NDIlib_send_get_tally(sender, &t, 50);
    return t.on_program && t.on_preview;
  }, 2s));
  live.reset();  // its program tally goes with it
  EXPECT_TRUE(NDIlib_send_get_tally(sender, &t, 2000));
  EXPECT_FALSE(t.on_program);
  EXPECT_TRUE(t.on_preview);
  EXPECT_EQ(NDIlib_send_get_no_connections(sender, 0), 1);
  NDIlib_send_destroy(sender);
}

// As with the vendor runtime: a status change at once, before the
// connection, and one more when a sender that takes PTZ connects (its
// <ndi_capabilities ntk_ptz="true"/> is the runtime's, never captured); PTZ
// commands go out either way.
TEST_F(Loopback, PtzSupportFollowsTheSendersAnnouncement) {
  for (bool ptz : {false, true}) {
    SCOPED_TRACE(ptz);
    std::vector<std::string> args = Args(ptz ? "With PTZ" : "No PTZ", {"--width", "16", "--height", "8", "--fps", "10"});
    if (ptz) args.push_back("--ptz");
    TestSource src(args);
    ASSERT_TRUE(src.WaitReady());
    Receiver rx(src.name());
    ndi_metadata_frame m{};
    ASSERT_EQ(NDIlib_recv_capture_v2(rx.get(), nullptr, nullptr, &m, 0), kNdiFrameStatusChange);
    EXPECT_FALSE(NDIlib_recv_ptz_is_supported(rx.get()));
    ASSERT_TRUE(rx.WaitConnected());
    EXPECT_EQ(rx.CaptureType(kNdiFrameStatusChange, nullptr, nullptr, nullptr, ptz ? 5s : 300ms), ptz);
    EXPECT_EQ(NDIlib_recv_ptz_is_supported(rx.get()), ptz);
    EXPECT_TRUE(NDIlib_recv_ptz_zoom(rx.get(), 0.5f));
    EXPECT_TRUE(src.WaitEvent(IsEvent("ptz")).is_object());
    EXPECT_FALSE(rx.CaptureType(kNdiFrameMetadata, nullptr, nullptr, &m, 300ms) &&
                 std::string(m.data).find("ndi_capabilities") != std::string::npos);
  }
}

TEST_F(Loopback, EveryPtzCallReachesTheSenderAsItsOwnCommand) {
  TestSource src(Args("Ptz", {"--width", "16", "--height", "8", "--fps", "10", "--ptz"}));
  ASSERT_TRUE(src.WaitReady());
  Receiver rx(src.name());
  ASSERT_TRUE(pmtest::WaitFor([&] { return NDIlib_recv_ptz_is_supported(rx.get()); }, 5s));
  void* r = rx.get();
  EXPECT_TRUE(NDIlib_recv_ptz_recall_preset(r, 3, 0.25f));
  EXPECT_TRUE(NDIlib_recv_ptz_store_preset(r, 7));
  EXPECT_TRUE(NDIlib_recv_ptz_pan_tilt(r, -0.5f, 0.75f));
  EXPECT_TRUE(NDIlib_recv_ptz_pan_tilt_speed(r, 0.125f, -1.0f));
  EXPECT_TRUE(NDIlib_recv_ptz_zoom(r, 0.5f));
  EXPECT_TRUE(NDIlib_recv_ptz_focus(r, 0.3f));
  EXPECT_TRUE(NDIlib_recv_ptz_focus_speed(r, -0.2f));
  EXPECT_TRUE(NDIlib_recv_ptz_auto_focus(r));
  EXPECT_TRUE(NDIlib_recv_ptz_exposure_auto(r));
  EXPECT_TRUE(NDIlib_recv_ptz_exposure_manual(r, 0.6f));
  EXPECT_TRUE(NDIlib_recv_ptz_white_balance_auto(r));
  EXPECT_TRUE(NDIlib_recv_ptz_white_balance_indoor(r));
  EXPECT_TRUE(NDIlib_recv_ptz_white_balance_outdoor(r));
  EXPECT_TRUE(NDIlib_recv_ptz_white_balance_oneshot(r));
  EXPECT_TRUE(NDIlib_recv_ptz_white_balance_manual(r, 0.4f, 0.9f));
  // Exactly the texts the vendor runtime sends for the same calls.
  const std::vector<std::string> expected = {
      R"(<ntk_ptz_recall_preset index="3" speed="0.250000"/>)",
      R"(<ntk_ptz_store_preset index="7"/>)",
      R"(<ntk_ptz_pan_tilt pan="-0.500000" tilt="0.750000"/>)",
      R"(<ntk_ptz_pan_tilt_speed pan_speed="0.125000" tilt_speed="-1.000000"/>)",
      R"(<ntk_ptz_zoom zoom="0.500000"/>)",
      R"(<ntk_ptz_focus mode="manual" distance="0.300000"/>)",
      R"(<ntk_ptz_focus_speed mode="manual" distance="-0.200000"/>)",
      R"(<ntk_ptz_focus mode="auto"/>)",
      R"(<ntk_ptz_exposure mode="auto"/>)",
      R"(<ntk_ptz_exposure mode="manual" value="0.600000"/>)",
      R"(<ntk_ptz_white_balance mode="auto"/>)",
      R"(<ntk_ptz_white_balance mode="indoor"/>)",
      R"(<ntk_ptz_white_balance mode="outdoor"/>)",
      R"(<ntk_ptz_white_balance mode="one_shot"/>)",
      R"(<ntk_ptz_white_balance mode="manual" red="0.400000" blue="0.900000"/>)",
  };
  std::size_t from = 0;
  for (const std::string& xml : expected) {
    json e = src.WaitEvent(IsEvent("ptz"), 5s, &from);
    ASSERT_TRUE(e.is_object()) << "missing " << xml;
    EXPECT_EQ(e.value("xml", ""), xml);
  }
}

// --- connection life --------------------------------------------------------------

TEST_F(Loopback, ReceiverReconnectsByItselfWhenItsSenderReturnsAtANewUrl) {
  // Pictures big enough (450 KB) that a kill lands inside one.
  auto args = Args("Phoenix", {"--width", "640", "--height", "360", "--fps", "50", "--pattern", "ramp", "--no-audio"});
  auto first = std::make_unique<TestSource>(args);
  ASSERT_TRUE(first->WaitReady());
  const std::string name = first->name(), first_url = first->url();
  Receiver rx(name);
  ASSERT_TRUE(rx.CaptureType(kNdiFrameVideo, nullptr, nullptr, nullptr));
  EXPECT_EQ(rx.Connections(), 1);

  first->Signal(SIGKILL);  // mid-stream, possibly mid-frame
  EXPECT_TRUE(pmtest::WaitFor([&] { return rx.Connections() == 0; }, 1s));
  first.reset();
  ndi_tally tally{true, false};
  EXPECT_TRUE(NDIlib_recv_set_tally(rx.get(), &tally)) << "kept for the next connection, as the vendor runtime does";
  // Whatever was queued is whole; then nothing while the sender is away.
  for (;;) {
    ndi_video_frame_v2 v{};
    const std::int32_t got = NDIlib_recv_capture_v2(rx.get(), &v, nullptr, nullptr, 300);
    if (got == kNdiFrameNone) break;
    if (got == kNdiFrameVideo) {
      EXPECT_EQ(ndits::CheckRamp(v.FourCC, v.xres, v.yres, v.line_stride_in_bytes, v.data, nullptr), "");
      NDIlib_recv_free_video_v2(rx.get(), &v);
    }
  }

  TestSource second(args);
  ASSERT_TRUE(second.WaitReady());
  EXPECT_EQ(second.name(), name);
  EXPECT_NE(second.url(), first_url);
  EXPECT_TRUE(rx.WaitConnected(2s));
  ndi_video_frame_v2 v{};
  ASSERT_TRUE(rx.CaptureType(kNdiFrameVideo, &v, nullptr, nullptr));
  EXPECT_EQ(ndits::CheckRamp(v.FourCC, v.xres, v.yres, v.line_stride_in_bytes, v.data, nullptr), "");
  NDIlib_recv_free_video_v2(rx.get(), &v);
  EXPECT_TRUE(NDIlib_recv_set_tally(rx.get(), &tally));
  EXPECT_TRUE(second.WaitEvent(IsEvent("tally")).is_object());
}

TEST_F(Loopback, BandwidthAudioOnlyCarriesNoVideoAndLowestTheProxyPicture) {
  TestSource src(Args("Bw", {"--width", "1280", "--height", "720", "--fps", "50", "--pattern", "ramp", "--audio-samples",
                             "480", "--seconds", "10"}));
  ASSERT_TRUE(src.WaitReady());
  Receiver audio_only(src.name(), kNdiBandwidthAudioOnly);
  Receiver metadata_only(src.name(), kNdiBandwidthMetadataOnly);
  Receiver lowest(src.name(), kNdiBandwidthLowest);
  ndi_video_frame_v2 v{};
  ASSERT_TRUE(lowest.CaptureType(kNdiFrameVideo, &v, nullptr, nullptr));
  EXPECT_EQ(v.xres, 640);
  EXPECT_EQ(v.yres, 360);
  EXPECT_EQ(v.FourCC, kNdiFourCCUYVY);
  NDIlib_recv_free_video_v2(lowest.get(), &v);

  int audio = 0;
  const auto until = std::chrono::steady_clock::now() + 600ms;
  while (std::chrono::steady_clock::now() < until) {
    ndi_video_frame_v2 vv{};
    ndi_audio_frame_v2 aa{};
    ndi_metadata_frame mm{};
    std::int32_t got = NDIlib_recv_capture_v2(audio_only.get(), &vv, &aa, &mm, 50);
    EXPECT_NE(got, kNdiFrameVideo) << "audio only";
    if (got == kNdiFrameAudio) {
      ++audio;
      NDIlib_recv_free_audio_v2(audio_only.get(), &aa);
    }
    got = NDIlib_recv_capture_v2(metadata_only.get(), &vv, &aa, &mm, 0);
    EXPECT_TRUE(got != kNdiFrameVideo && got != kNdiFrameAudio) << "metadata only";
  }
  EXPECT_GT(audio, 5);
  EXPECT_EQ(metadata_only.Connections(), 1);
}

TEST_F(Loopback, QueuesDropTheOldestFramesOfASlowReceiverAndHeldFramesStayIntact) {
  ndi_send_create settings{"Flood", nullptr, false, false};
  void* sender = NDIlib_send_create(&settings);
  ASSERT_NE(sender, nullptr);
  Receiver rx(ndilb::FullSourceName("Flood"));
  ASSERT_TRUE(rx.WaitConnected());
  const auto planes = ndits::PictureLayout(kNdiFourCCUYVY, 64, 16);
  std::vector<std::uint8_t> picture(ndits::PictureSize(planes));
  auto send = [&](std::int64_t n) {
    ndits::FillRamp(planes, n, picture.data());
    ndi_video_frame_v2 f{};
    f.xres = 64;
    f.yres = 16;
    f.FourCC = kNdiFourCCUYVY;
    f.frame_rate_N = 30;
    f.frame_rate_D = 1;
    f.data = picture.data();
    f.line_stride_in_bytes = 128;
    NDIlib_send_send_video_v2(sender, &f);
  };
  // Two frames held by the caller while twenty more go through.
  send(0);
  send(1);
  ndi_video_frame_v2 held[2]{};
  ASSERT_TRUE(rx.CaptureType(kNdiFrameVideo, &held[0], nullptr, nullptr));
  ASSERT_TRUE(rx.CaptureType(kNdiFrameVideo, &held[1], nullptr, nullptr));
  for (int n = 2; n < 22; ++n) send(n);
  // A metadata frame after the pictures: once it can be captured (pictures
  // stay queued while only metadata is asked for), every picture is queued.
  std::string end = "<end/>";
  ndi_metadata_frame marker{static_cast<int>(end.size() + 1), 0, end.data()};
  NDIlib_send_send_metadata(sender, &marker);
  ndi_metadata_frame got{};
  ASSERT_EQ(NDIlib_recv_capture_v2(rx.get(), nullptr, nullptr, &got, 5000), kNdiFrameMetadata);
  EXPECT_EQ(std::string(got.data), end);
  NDIlib_recv_free_metadata(rx.get(), &got);
  std::vector<std::int64_t> numbers;
  for (;;) {
    ndi_video_frame_v2 v{};
    if (NDIlib_recv_capture_v2(rx.get(), &v, nullptr, nullptr, 100) != kNdiFrameVideo) break;
    std::int64_t n = -1;
    EXPECT_EQ(ndits::CheckRamp(v.FourCC, v.xres, v.yres, v.line_stride_in_bytes, v.data, &n), "");
    numbers.push_back(n);
    NDIlib_recv_free_video_v2(rx.get(), &v);
  }
  ASSERT_FALSE(numbers.empty());
  EXPECT_EQ(numbers.size(), 8u) << "bounded at eight pictures";
  EXPECT_EQ(numbers.front(), 14) << "the oldest went first";
  EXPECT_EQ(numbers.back(), 21) << "the newest frame is kept";
  for (std::size_t i = 1; i < numbers.size(); ++i) EXPECT_EQ(numbers[i], numbers[i - 1] + 1);
  for (int i = 0; i < 2; ++i) {
    std::int64_t n = -1;
    EXPECT_EQ(ndits::CheckRamp(held[i].FourCC, held[i].xres, held[i].yres, held[i].line_stride_in_bytes, held[i].data, &n), "");
    EXPECT_EQ(n, i);
  }
  NDIlib_recv_free_video_v2(rx.get(), &held[1]);
  NDIlib_recv_free_video_v2(rx.get(), &held[0]);
  NDIlib_recv_free_video_v2(rx.get(), &held[0]);  // a second free is ignored
  NDIlib_send_destroy(sender);
}

// --- bad input --------------------------------------------------------------------

TEST_F(Loopback, ReceiverForAMissingSourceWaitsWithNoConnections) {
  Receiver rx("NOWHERE (nothing)");
  ndi_video_frame_v2 v{};
  EXPECT_EQ(NDIlib_recv_capture_v2(rx.get(), &v, nullptr, nullptr, 250), kNdiFrameStatusChange) << "at once";
  const auto start = std::chrono::steady_clock::now();
  EXPECT_EQ(NDIlib_recv_capture_v2(rx.get(), &v, nullptr, nullptr, 250), kNdiFrameNone);
  EXPECT_GE(std::chrono::steady_clock::now() - start, 240ms) << "capture waits its timeout";
  EXPECT_EQ(rx.Connections(), 0);
  ndi_tally tally{true, true};
  EXPECT_TRUE(NDIlib_recv_set_tally(rx.get(), &tally)) << "kept for a connection to come";
  std::string xml = "<x/>";
  ndi_metadata_frame m{5, 0, xml.data()};
  EXPECT_FALSE(NDIlib_recv_send_metadata(rx.get(), &m));
  EXPECT_FALSE(NDIlib_recv_ptz_is_supported(rx.get()));

  Receiver by_url("", kNdiBandwidthHighest, "127.0.0.1:1");
  EXPECT_EQ(NDIlib_recv_capture_v2(by_url.get(), &v, nullptr, nullptr, 100), kNdiFrameStatusChange);
  EXPECT_EQ(NDIlib_recv_capture_v2(by_url.get(), &v, nullptr, nullptr, 100), kNdiFrameNone);
  EXPECT_EQ(by_url.Connections(), 0);
}

int RawConnect(const std::string& url) {
  const std::size_t colon = url.rfind(':');
  sockaddr_in addr{};
  addr.sin_family = AF_INET;
  addr.sin_port = htons(static_cast<std::uint16_t>(std::stoi(url.substr(colon + 1))));
  inet_pton(AF_INET, "127.0.0.1", &addr.sin_addr);
  const int fd = socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
  if (connect(fd, reinterpret_cast<sockaddr*>(&addr), sizeof addr) != 0) {
    close(fd);
    return -1;
  }
  return fd;
}

// True when the peer closes the socket within the timeout (whatever it sent first).
bool ClosedByPeer(int fd, std::chrono::milliseconds timeout) {
  const auto deadline = std::chrono::steady_clock::now() + timeout;
  char buffer[65536];
  while (std::chrono::steady_clock::now() < deadline) {
    pollfd p{fd, POLLIN, 0};
    if (poll(&p, 1, 50) <= 0) continue;
    const ssize_t n = recv(fd, buffer, sizeof buffer, 0);
    if (n <= 0) return true;
  }
  return false;
}

TEST_F(Loopback, GarbageOnASendersPortDropsOnlyThatConnection) {
  TestSource src(Args("Guarded", {"--width", "16", "--height", "8", "--fps", "20", "--pattern", "ramp"}));
  ASSERT_TRUE(src.WaitReady());
  Receiver rx(src.name());
  ASSERT_TRUE(rx.WaitConnected());

  const int garbage = RawConnect(src.url());
  ASSERT_GE(garbage, 0);
  const std::string junk(100, 'Z');
  ASSERT_EQ(send(garbage, junk.data(), junk.size(), MSG_NOSIGNAL), 100);
  EXPECT_TRUE(ClosedByPeer(garbage, 2s));
  close(garbage);

  const int oversize = RawConnect(src.url());
  ASSERT_GE(oversize, 0);
  ndilb::EncodedHead hello = ndilb::EncodeHello(100, false, false);
  ndilb::EncodedHead meta = ndilb::EncodeMetadata(ndilb::MessageType::Metadata, 0, 0xFFFFFFF0u);
  ASSERT_GT(send(oversize, hello.bytes, hello.size, MSG_NOSIGNAL), 0);
  ASSERT_GT(send(oversize, meta.bytes, meta.size, MSG_NOSIGNAL), 0);
  EXPECT_TRUE(ClosedByPeer(oversize, 2s)) << "a 4 GB text is refused, not awaited";
  close(oversize);

  const int silent = RawConnect(src.url());
  ASSERT_GE(silent, 0);
  EXPECT_TRUE(ClosedByPeer(silent, 4s)) << "a connection that never says hello is not kept";
  close(silent);

  // The real receiver kept its connection and its frames.
  EXPECT_EQ(rx.Connections(), 1);
  ndi_video_frame_v2 v{};
  ASSERT_TRUE(rx.CaptureType(kNdiFrameVideo, &v, nullptr, nullptr));
  EXPECT_EQ(ndits::CheckRamp(v.FourCC, v.xres, v.yres, v.line_stride_in_bytes, v.data, nullptr), "");
  NDIlib_recv_free_video_v2(rx.get(), &v);
  src.Signal(SIGTERM);
  EXPECT_EQ(src.Wait(), 0);
}

TEST_F(Loopback, GarbageFromASenderDropsTheConnectionAndTheReceiverTriesAgain) {
  // A fake sender: a listening socket in this process with a registry entry.
  int port = 0;
  const int listener = socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
  sockaddr_in addr{};
  addr.sin_family = AF_INET;
  inet_pton(AF_INET, "127.0.0.1", &addr.sin_addr);
  socklen_t len = sizeof addr;
  ASSERT_EQ(bind(listener, reinterpret_cast<sockaddr*>(&addr), sizeof addr), 0);
  ASSERT_EQ(listen(listener, 4), 0);
  getsockname(listener, reinterpret_cast<sockaddr*>(&addr), &len);
  port = ntohs(addr.sin_port);
  std::ofstream(dir_.path() + "/fake.ndi") << "ndi-loopback 1\nname=FAKE (x)\nurl=127.0.0.1:" << port
                                           << "\npid=" << getpid() << "\n";
  Receiver rx("FAKE (x)");

  auto accept_one = [&] {
    pollfd p{listener, POLLIN, 0};
    if (poll(&p, 1, 3000) != 1) return -1;
    return accept4(listener, nullptr, nullptr, SOCK_CLOEXEC);
  };
  // Garbage, then a frame header with an impossible payload length.
  std::vector<std::vector<std::uint8_t>> attacks;
  attacks.emplace_back(64, 0xEE);
  ndilb::VideoInfo info;
  info.xres = 16;
  info.yres = 8;
  info.fourcc = kNdiFourCCUYVY;
  info.line_stride = 32;
  ndilb::EncodedHead huge = ndilb::EncodeVideo(info, 0, std::uint64_t{1} << 40);
  attacks.emplace_back(huge.bytes, huge.bytes + huge.size);
  ndilb::EncodedHead liar = ndilb::EncodeVideo(info, 0, 16 * 8 * 2 + 1);
  attacks.emplace_back(liar.bytes, liar.bytes + liar.size);
  for (const auto& attack : attacks) {
    const int fd = accept_one();
    ASSERT_GE(fd, 0) << "the receiver (re)connects";
    ASSERT_EQ(send(fd, attack.data(), attack.size(), MSG_NOSIGNAL), static_cast<ssize_t>(attack.size()));
    EXPECT_TRUE(ClosedByPeer(fd, 2s));
    close(fd);
    EXPECT_EQ(rx.Connections(), 0);
  }
  ndi_video_frame_v2 v{};
  ndi_metadata_frame m{};
  EXPECT_EQ(NDIlib_recv_capture_v2(rx.get(), &v, nullptr, &m, 50), kNdiFrameStatusChange) << "the one of its making";
  EXPECT_EQ(NDIlib_recv_capture_v2(rx.get(), &v, nullptr, &m, 50), kNdiFrameNone) << "nothing half-made is delivered";
  close(listener);
}

TEST_F(Loopback, DestroyingAReceiverInTheMiddleOfAFrameReturnsPromptly) {
  const int listener = socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
  sockaddr_in addr{};
  addr.sin_family = AF_INET;
  inet_pton(AF_INET, "127.0.0.1", &addr.sin_addr);
  socklen_t len = sizeof addr;
  ASSERT_EQ(bind(listener, reinterpret_cast<sockaddr*>(&addr), sizeof addr), 0);
  ASSERT_EQ(listen(listener, 4), 0);
  getsockname(listener, reinterpret_cast<sockaddr*>(&addr), &len);
  std::ofstream(dir_.path() + "/stall.ndi") << "ndi-loopback 1\nname=STALL (x)\nurl=127.0.0.1:" << ntohs(addr.sin_port)
                                            << "\npid=" << getpid() << "\n";
  auto rx = std::make_unique<Receiver>("STALL (x)");
  pollfd p{listener, POLLIN, 0};
  ASSERT_EQ(poll(&p, 1, 3000), 1);
  const int fd = accept4(listener, nullptr, nullptr, SOCK_CLOEXEC);
  ASSERT_GE(fd, 0);
  ndilb::VideoInfo info;
  info.xres = 1920;
  info.yres = 1080;
  info.fourcc = kNdiFourCCUYVY;
  info.line_stride = 3840;
  ndilb::EncodedHead head = ndilb::EncodeVideo(info, 0, 3840u * 1080);
  ndilb::EncodedHead ready = ndilb::EncodeReady(false);
  ASSERT_GT(send(fd, ready.bytes, ready.size, MSG_NOSIGNAL), 0);
  ASSERT_GT(send(fd, head.bytes, head.size, MSG_NOSIGNAL), 0);
  const std::vector<std::uint8_t> half(3840u * 540, 7);
  ASSERT_GT(send(fd, half.data(), half.size(), MSG_NOSIGNAL), 0);
  EXPECT_TRUE(rx->WaitConnected());
  std::this_thread::sleep_for(50ms);  // the receiver is now waiting for the rest of the picture
  ndi_video_frame_v2 v{};
  EXPECT_NE(NDIlib_recv_capture_v2(rx->get(), &v, nullptr, nullptr, 50), kNdiFrameVideo) << "half a frame is no frame";
  const auto start = std::chrono::steady_clock::now();
  rx.reset();
  EXPECT_LT(std::chrono::steady_clock::now() - start, 1s);
  close(fd);
  close(listener);
}

}  // namespace
