// The loopback runtime across processes: a child ndi-testsrc sends, the test
// receives through the NDI C interface (and sends, for the in-process cases).
// Each case has its own registry folder.
#include <arpa/inet.h>
#include <netinet/in.h>
#include <poll.h>
#include <signal.h>
#include <spawn.h>
#include <sys/socket.h>
#include <sys/wait.h>
#include <unistd.h>

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <chrono>
#include <filesystem>
#include <fstream>
#include <string>
#include <thread>
#include <vector>

#include "e2e_support.h"
#include "ndi-loopback/picture.h"
#include "ndi-loopback/registry.h"
#include "ndi-loopback/wire.h"
#include "ndi-testsrc/pattern.h"
#include "ndi/ndi_abi.h"
#include "support/wait.h"

extern char** environ;

namespace {

using namespace std::chrono_literals;
using nlohmann::json;
using pmtest::Sender;

std::vector<std::string> SourceNames() {
  void* finder = NDIlib_find_create_v2(nullptr);
  std::uint32_t count = 0;
  const ndi_source* sources = NDIlib_find_get_current_sources(finder, &count);
  std::vector<std::string> names;
  for (std::uint32_t i = 0; i < count; ++i) names.push_back(std::string(sources[i].ndi_name) + "@" + sources[i].url_address);
  NDIlib_find_destroy(finder);
  return names;
}

std::string Ramp(const ndi_video_frame_v2& v, std::int64_t* n = nullptr) {
  return ndits::CheckRamp(v.FourCC, v.xres, v.yres, v.line_stride_in_bytes, v.data, n);
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
  bool WaitConnected(std::chrono::milliseconds timeout = pmtest::kPatience) const {
    return pmtest::WaitFor([&] { return Connections() == 1; }, timeout);
  }
  // Captures until a frame of `type` arrives (others are freed); it is kept
  // in `v`, `a` or `m` when given, freed otherwise. False on timeout.
  bool CaptureType(std::int32_t type, ndi_video_frame_v2* v = nullptr, ndi_audio_frame_v2* a = nullptr,
                   ndi_metadata_frame* m = nullptr, std::chrono::milliseconds timeout = pmtest::kPatience) {
    const auto deadline = std::chrono::steady_clock::now() + timeout;
    while (std::chrono::steady_clock::now() < deadline) {
      ndi_video_frame_v2 vv{};
      ndi_audio_frame_v2 aa{};
      ndi_metadata_frame mm{};
      const std::int32_t got = NDIlib_recv_capture_v2(handle_, &vv, &aa, &mm, 100);
      if (got == type && got == kNdiFrameVideo && v != nullptr) return *v = vv, true;
      if (got == type && got == kNdiFrameAudio && a != nullptr) return *a = aa, true;
      if (got == type && got == kNdiFrameMetadata && m != nullptr) return *m = mm, true;
      if (got == kNdiFrameVideo) NDIlib_recv_free_video_v2(handle_, &vv);
      if (got == kNdiFrameAudio) NDIlib_recv_free_audio_v2(handle_, &aa);
      if (got == kNdiFrameMetadata) NDIlib_recv_free_metadata(handle_, &mm);
      if (got == type) return true;
    }
    return false;
  }
  // Captures one picture, shows it to `look`, frees it; false on timeout.
  bool Picture(const std::function<void(const ndi_video_frame_v2&)>& look) {
    ndi_video_frame_v2 v{};
    if (!CaptureType(kNdiFrameVideo, &v)) return false;
    look(v);
    NDIlib_recv_free_video_v2(handle_, &v);
    return true;
  }

 private:
  void* handle_ = nullptr;
};

std::vector<std::string> Small(std::initializer_list<std::string> more = {}) {
  std::vector<std::string> a = {"--width", "16", "--height", "8", "--fps", "10"};
  a.insert(a.end(), more);
  return a;
}

std::string Url(Sender& s) { return s.Find("ready").value("url", ""); }

class Loopback : public ::testing::Test {
 protected:
  void SetUp() override {
    std::filesystem::create_directories(folder_.Registry());
    ::setenv("NDI_LOOPBACK_DIR", folder_.Registry().c_str(), 1);
  }
  void TearDown() override { ::unsetenv("NDI_LOOPBACK_DIR"); }
  pmtest::Folder folder_;
};

// --- discovery ------------------------------------------------------------

// As with the vendor runtime, a sender that went stays listed for about a
// second, whether it ended in order or was killed and not yet reaped (a
// zombie, as a parent that has not looked yet leaves it); the finder's wait
// sees the change when it is listed no more.
TEST_F(Loopback, DiscoveryListsASenderThatWentForASecondMore) {
  for (const int sig : {SIGTERM, SIGKILL}) {
    SCOPED_TRACE(sig == SIGTERM ? "ended in order" : "killed");
    std::vector<std::string> args = {"ndi-testsrc", "--name", "Went", "--seconds", "60"};
    args.insert(args.end(), {"--width", "16", "--height", "8", "--fps", "10"});
    std::vector<char*> argv;
    for (std::string& a : args) argv.push_back(a.data());
    argv.push_back(nullptr);
    pid_t pid = -1;
    ASSERT_EQ(::posix_spawn(&pid, pmtest::BuiltPrograms().testsrc.c_str(), nullptr, nullptr, argv.data(), environ), 0);
    ASSERT_TRUE(pmtest::WaitFor([] { return SourceNames().size() == 1; }, pmtest::kPatience));
    EXPECT_THAT(SourceNames()[0], ::testing::MatchesRegex(".* \\(Went\\)@127\\.0\\.0\\.1:[0-9]+"));
    void* finder = NDIlib_find_create_v2(nullptr);
    std::uint32_t count = 0;
    NDIlib_find_get_current_sources(finder, &count);
    const auto went = std::chrono::steady_clock::now();
    ::kill(pid, sig);
    EXPECT_TRUE(NDIlib_find_wait_for_sources(finder, 5000)) << "the change is seen";
    EXPECT_GE(std::chrono::steady_clock::now() - went, std::chrono::milliseconds(ndilb::kListedAfterGoneMs));
    NDIlib_find_get_current_sources(finder, &count);
    EXPECT_EQ(count, 0u);
    EXPECT_FALSE(NDIlib_find_wait_for_sources(finder, 100)) << "no change, no wake-up";
    NDIlib_find_destroy(finder);
    int status = -1;
    ASSERT_EQ(::waitpid(pid, &status, 0), pid);
    EXPECT_TRUE(sig != SIGTERM || (WIFEXITED(status) && WEXITSTATUS(status) == 0)) << "SIGTERM ends the sender cleanly";
  }
}

TEST_F(Loopback, DiscoverySkipsMalformedEntriesAndListsEachNameOnceAsTheVendorRuntimeDoes) {
  pid_t dead = fork();
  if (dead == 0) _exit(0);
  ASSERT_GT(dead, 0);
  waitpid(dead, nullptr, 0);
  const std::string dir = folder_.Registry(), alive = std::to_string(getpid());
  const auto now = std::chrono::duration_cast<std::chrono::nanoseconds>(
                       std::chrono::system_clock::now().time_since_epoch()).count();
  auto write = [&](const std::string& file, const std::string& text) {
    std::ofstream(dir + "/" + file) << "ndi-loopback 1\n" << text;
  };
  auto exists = [&](const std::string& file) { return ::access((dir + "/" + file).c_str(), F_OK) == 0; };
  std::ofstream(dir + "/1-1.ndi") << "garbage\n";
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
  Sender there, named;
  ASSERT_TRUE(there.Start(folder_, "There", {"--width", "32", "--height", "8", "--fps", "30"}));
  ASSERT_TRUE(named.Start(folder_, "Named", {"--width", "16", "--height", "8", "--fps", "30"}));
  const std::string thereUrl = Url(there);
  const std::pair<const char*, int> cases[] = {{thereUrl.c_str(), 32}, {"127.0.0.1:1", 16}, {nullptr, 16}};
  for (const auto& [url, width] : cases) {
    SCOPED_TRACE(url ? url : "no url");
    Receiver rx(named.Name(), kNdiBandwidthHighest, url);
    ASSERT_TRUE(rx.Picture([&](const ndi_video_frame_v2& v) { EXPECT_EQ(v.xres, width); }));
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
    Sender src;
    ASSERT_TRUE(src.Start(folder_, "Ramp " + std::string(c.format),
                          {"--width", std::to_string(c.width), "--height", "36", "--fps", "100", "--format", c.format,
                           "--pattern", "ramp", "--no-audio", "--seconds", "10"}));
    Receiver rx(src.Name(), kNdiBandwidthHighest, nullptr, c.color);
    const bool as_sent = ndits::FourCCFromName(c.format) == c.delivered;
    std::int64_t last = -1, last_stamp = 0;
    for (int i = 0; i < 5; ++i) {
      ASSERT_TRUE(rx.Picture([&](const ndi_video_frame_v2& v) {
        EXPECT_EQ(v.FourCC, c.delivered);
        EXPECT_EQ(v.line_stride_in_bytes, ndilb::DeliveredStride(c.delivered, c.width));
        EXPECT_EQ(std::vector<int>({v.xres, v.yres, v.frame_rate_N}), std::vector<int>({c.width, 36, 100}));
        std::int64_t n = -1;
        EXPECT_EQ(as_sent ? Ramp(v, &n) : "", "");
        EXPECT_TRUE(!as_sent || n > last) << n << " after " << last;
        last = n;
        // The sender's clock, in 100 ns units.
        const std::int64_t now = std::chrono::duration_cast<std::chrono::microseconds>(
                                     std::chrono::system_clock::now().time_since_epoch()).count() * 10;
        EXPECT_GT(v.timestamp, last_stamp);
        EXPECT_LT(std::llabs(now - v.timestamp), 50'000'000) << "within 5 s of now";
        last_stamp = v.timestamp;
      }));
    }
  }
}

// --- metadata, tally, PTZ -------------------------------------------------------

TEST_F(Loopback, AnInProcessSenderCountsItsReceiversCombinesTheirTallyAndSendsMetadata) {
  ndi_send_create settings{"Combined", nullptr, false, false};
  void* sender = NDIlib_send_create(&settings);
  ASSERT_NE(sender, nullptr);
  auto live = std::make_unique<Receiver>(ndilb::FullSourceName("Combined"));
  Receiver look(ndilb::FullSourceName("Combined"));
  ASSERT_TRUE(live->WaitConnected() && look.WaitConnected());
  EXPECT_TRUE(pmtest::WaitFor([&] { return NDIlib_send_get_no_connections(sender, 0) == 2; }, pmtest::kPatience));
  ndi_tally t{};
  // Reported on every connection change (as the vendor runtime does), then
  // not again until something changes.
  EXPECT_TRUE(NDIlib_send_get_tally(sender, &t, 0));
  EXPECT_FALSE(t.on_program || t.on_preview);
  EXPECT_FALSE(NDIlib_send_get_tally(sender, &t, 0)) << "nothing changed since";
  std::string xml = "<shot value=\"1\"/>";
  ndi_metadata_frame frame{static_cast<int>(xml.size() + 1), 77, xml.data()};
  NDIlib_send_send_metadata(sender, &frame);
  // The sender's answer to the receiver's tally comes first, on connecting.
  for (const std::string expected : {"<ndi_tally_echo on_program=\"false\" on_preview=\"false\"/>", xml.c_str()}) {
    ndi_metadata_frame m{};
    ASSERT_TRUE(look.CaptureType(kNdiFrameMetadata, nullptr, nullptr, &m));
    EXPECT_EQ(std::string(m.data), expected);
    EXPECT_TRUE(expected != xml || m.timecode == 77) << m.timecode;
    NDIlib_recv_free_metadata(look.get(), &m);
  }
  const ndi_tally program{true, false}, preview{false, true};
  ASSERT_TRUE(NDIlib_recv_set_tally(live->get(), &program));
  ASSERT_TRUE(NDIlib_recv_set_tally(look.get(), &preview));
  EXPECT_TRUE(pmtest::WaitFor([&] {
    NDIlib_send_get_tally(sender, &t, 50);
    return t.on_program && t.on_preview;
  }, pmtest::kPatience));
  live.reset();  // its program tally goes with it
  EXPECT_TRUE(NDIlib_send_get_tally(sender, &t, 2000));
  EXPECT_FALSE(t.on_program);
  EXPECT_TRUE(t.on_preview);
  EXPECT_EQ(NDIlib_send_get_no_connections(sender, 0), 1);
  NDIlib_send_destroy(sender);
  EXPECT_TRUE(pmtest::WaitFor([&] { return look.Connections() == 0; }, 1s));
}

// As with the vendor runtime: a status change at once, before the
// connection, and one more when a sender that takes PTZ connects (its
// <ndi_capabilities ntk_ptz="true"/> is the runtime's, never captured); PTZ
// commands go out either way, each as exactly the text the vendor runtime
// sends for the same call.
TEST_F(Loopback, PtzSupportFollowsTheSendersAnnouncementAndEveryCallReachesItAsItsOwnCommand) {
  const std::pair<std::function<bool(void*)>, const char*> calls[] = {
      {[](void* r) { return NDIlib_recv_ptz_recall_preset(r, 3, 0.25f); }, R"(<ntk_ptz_recall_preset index="3" speed="0.250000"/>)"},
      {[](void* r) { return NDIlib_recv_ptz_store_preset(r, 7); }, R"(<ntk_ptz_store_preset index="7"/>)"},
      {[](void* r) { return NDIlib_recv_ptz_pan_tilt(r, -0.5f, 0.75f); }, R"(<ntk_ptz_pan_tilt pan="-0.500000" tilt="0.750000"/>)"},
      {[](void* r) { return NDIlib_recv_ptz_pan_tilt_speed(r, 0.125f, -1.0f); },
       R"(<ntk_ptz_pan_tilt_speed pan_speed="0.125000" tilt_speed="-1.000000"/>)"},
      {[](void* r) { return NDIlib_recv_ptz_zoom(r, 0.5f); }, R"(<ntk_ptz_zoom zoom="0.500000"/>)"},
      {[](void* r) { return NDIlib_recv_ptz_focus(r, 0.3f); }, R"(<ntk_ptz_focus mode="manual" distance="0.300000"/>)"},
      {[](void* r) { return NDIlib_recv_ptz_focus_speed(r, -0.2f); }, R"(<ntk_ptz_focus_speed mode="manual" distance="-0.200000"/>)"},
      {[](void* r) { return NDIlib_recv_ptz_auto_focus(r); }, R"(<ntk_ptz_focus mode="auto"/>)"},
      {[](void* r) { return NDIlib_recv_ptz_exposure_auto(r); }, R"(<ntk_ptz_exposure mode="auto"/>)"},
      {[](void* r) { return NDIlib_recv_ptz_exposure_manual(r, 0.6f); }, R"(<ntk_ptz_exposure mode="manual" value="0.600000"/>)"},
      {[](void* r) { return NDIlib_recv_ptz_white_balance_auto(r); }, R"(<ntk_ptz_white_balance mode="auto"/>)"},
      {[](void* r) { return NDIlib_recv_ptz_white_balance_indoor(r); }, R"(<ntk_ptz_white_balance mode="indoor"/>)"},
      {[](void* r) { return NDIlib_recv_ptz_white_balance_outdoor(r); }, R"(<ntk_ptz_white_balance mode="outdoor"/>)"},
      {[](void* r) { return NDIlib_recv_ptz_white_balance_oneshot(r); }, R"(<ntk_ptz_white_balance mode="one_shot"/>)"},
      {[](void* r) { return NDIlib_recv_ptz_white_balance_manual(r, 0.4f, 0.9f); },
       R"(<ntk_ptz_white_balance mode="manual" red="0.400000" blue="0.900000"/>)"},
  };
  for (bool ptz : {false, true}) {
    SCOPED_TRACE(ptz);
    Sender src;
    ASSERT_TRUE(src.Start(folder_, ptz ? "With PTZ" : "No PTZ", ptz ? Small({"--ptz"}) : Small()));
    Receiver rx(src.Name());
    ndi_metadata_frame m{};
    ASSERT_EQ(NDIlib_recv_capture_v2(rx.get(), nullptr, nullptr, &m, 0), kNdiFrameStatusChange);
    EXPECT_FALSE(NDIlib_recv_ptz_is_supported(rx.get()));
    ASSERT_TRUE(rx.WaitConnected());
    EXPECT_EQ(rx.CaptureType(kNdiFrameStatusChange, nullptr, nullptr, nullptr, ptz ? std::chrono::milliseconds(pmtest::kPatience) : 300ms), ptz);
    EXPECT_EQ(NDIlib_recv_ptz_is_supported(rx.get()), ptz);
    for (const auto& [call, xml] : calls) {
      EXPECT_TRUE(call(rx.get())) << xml;
      EXPECT_TRUE(src.WaitFor("ptz", [&](const json& e) { return e.value("xml", "") == xml; })) << xml;
    }
    EXPECT_FALSE(rx.CaptureType(kNdiFrameMetadata, nullptr, nullptr, &m, 300ms) &&
                 std::string(m.data).find("ndi_capabilities") != std::string::npos);
  }
}

// --- connection life --------------------------------------------------------------

TEST_F(Loopback, ReceiverReconnectsByItselfWhenItsSenderReturnsAtANewUrl) {
  // Pictures big enough (450 KB) that a kill lands inside one.
  const std::vector<std::string> args = {"--width", "640", "--height", "360", "--fps", "50", "--pattern", "ramp",
                                         "--no-audio"};
  auto first = std::make_unique<Sender>();
  ASSERT_TRUE(first->Start(folder_, "Phoenix", args));
  const std::string name = first->Name(), first_url = Url(*first);
  Receiver rx(name);
  ASSERT_TRUE(rx.CaptureType(kNdiFrameVideo));
  EXPECT_EQ(rx.Connections(), 1);
  first->Process().Signal(SIGKILL);  // mid-stream, possibly mid-frame
  EXPECT_TRUE(pmtest::WaitFor([&] { return rx.Connections() == 0; }, 1s));
  first.reset();
  ndi_tally tally{true, false};
  EXPECT_TRUE(NDIlib_recv_set_tally(rx.get(), &tally)) << "kept for the next connection, as the vendor runtime does";
  // Whatever was queued is whole; then nothing while the sender is away.
  for (;;) {
    ndi_video_frame_v2 v{};
    const std::int32_t got = NDIlib_recv_capture_v2(rx.get(), &v, nullptr, nullptr, 300);
    if (got == kNdiFrameNone) break;
    EXPECT_EQ(got == kNdiFrameVideo ? Ramp(v) : "", "");
    if (got == kNdiFrameVideo) NDIlib_recv_free_video_v2(rx.get(), &v);
  }
  Sender second;
  ASSERT_TRUE(second.Start(folder_, "Phoenix", args));
  EXPECT_EQ(second.Name(), name);
  EXPECT_NE(Url(second), first_url);
  EXPECT_TRUE(rx.WaitConnected(2s));
  ASSERT_TRUE(rx.Picture([](const ndi_video_frame_v2& v) { EXPECT_EQ(Ramp(v), ""); }));
  EXPECT_TRUE(NDIlib_recv_set_tally(rx.get(), &tally));
  EXPECT_TRUE(second.WaitFor("tally"));
}

// Each receiver gets the sender's connection metadata first, whatever its
// bandwidth.
TEST_F(Loopback, BandwidthAudioOnlyCarriesNoVideoMetadataOnlyTheTextsAndLowestTheProxyPicture) {
  Sender src;
  ASSERT_TRUE(src.Start(folder_, "Bw", {"--width", "1280", "--height", "720", "--fps", "50", "--pattern", "ramp",
                                        "--audio-samples", "480", "--seconds", "10", "--model", "Studio Cam 9"}));
  Receiver audio_only(src.Name(), kNdiBandwidthAudioOnly);
  Receiver metadata_only(src.Name(), kNdiBandwidthMetadataOnly);
  Receiver lowest(src.Name(), kNdiBandwidthLowest);
  ASSERT_TRUE(lowest.Picture([](const ndi_video_frame_v2& v) {
    EXPECT_EQ(std::vector<int>({v.xres, v.yres}), std::vector<int>({640, 360}));
    EXPECT_EQ(v.FourCC, kNdiFourCCUYVY);
  }));
  int audio = 0;
  std::vector<std::string> texts;
  const auto until = std::chrono::steady_clock::now() + 600ms;
  while (std::chrono::steady_clock::now() < until) {
    ndi_video_frame_v2 vv{};
    ndi_audio_frame_v2 aa{};
    ndi_metadata_frame mm{};
    std::int32_t got = NDIlib_recv_capture_v2(audio_only.get(), &vv, &aa, &mm, 50);
    EXPECT_NE(got, kNdiFrameVideo) << "audio only";
    if (got == kNdiFrameAudio) ++audio;
    if (got == kNdiFrameAudio) NDIlib_recv_free_audio_v2(audio_only.get(), &aa);
    got = NDIlib_recv_capture_v2(metadata_only.get(), &vv, &aa, &mm, 0);
    EXPECT_TRUE(got != kNdiFrameVideo && got != kNdiFrameAudio) << "metadata only";
    if (got == kNdiFrameMetadata) texts.emplace_back(mm.data, static_cast<std::size_t>(std::max(mm.length, 0)));
    if (got == kNdiFrameMetadata) NDIlib_recv_free_metadata(metadata_only.get(), &mm);
  }
  ASSERT_FALSE(texts.empty());
  EXPECT_EQ(texts[0], std::string("<ndi_product model_name=\"Studio Cam 9\"/>") + '\0') << "its length counts the zero";
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
  ASSERT_TRUE(rx.CaptureType(kNdiFrameVideo, &held[0]));
  ASSERT_TRUE(rx.CaptureType(kNdiFrameVideo, &held[1]));
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
    EXPECT_EQ(Ramp(v, &n), "");
    numbers.push_back(n);
    NDIlib_recv_free_video_v2(rx.get(), &v);
  }
  // Bounded at eight pictures: the oldest went first, the newest is kept.
  EXPECT_EQ(numbers, (std::vector<std::int64_t>{14, 15, 16, 17, 18, 19, 20, 21}));
  for (int i = 0; i < 2; ++i) {
    std::int64_t n = -1;
    EXPECT_EQ(Ramp(held[i], &n), "");
    EXPECT_EQ(n, i);
  }
  NDIlib_recv_free_video_v2(rx.get(), &held[1]);
  NDIlib_recv_free_video_v2(rx.get(), &held[0]);
  NDIlib_recv_free_video_v2(rx.get(), &held[0]);  // a second free is ignored
  NDIlib_send_destroy(sender);
}

// --- bad input --------------------------------------------------------------------

sockaddr_in Loopback127(std::uint16_t port) {
  sockaddr_in addr{};
  addr.sin_family = AF_INET;
  addr.sin_port = htons(port);
  inet_pton(AF_INET, "127.0.0.1", &addr.sin_addr);
  return addr;
}

int RawConnect(const std::string& url) {
  const sockaddr_in addr = Loopback127(static_cast<std::uint16_t>(std::stoi(url.substr(url.rfind(':') + 1))));
  const int fd = socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
  if (connect(fd, reinterpret_cast<const sockaddr*>(&addr), sizeof addr) == 0) return fd;
  close(fd);
  return -1;
}

bool SendAll(int fd, const void* bytes, std::size_t n) {
  return send(fd, bytes, n, MSG_NOSIGNAL) == static_cast<ssize_t>(n);
}
bool SendAll(int fd, const ndilb::EncodedHead& head) { return SendAll(fd, head.bytes, head.size); }

// True when the peer closes the socket within the timeout (whatever it sent first).
bool ClosedByPeer(int fd, std::chrono::milliseconds timeout) {
  const auto deadline = std::chrono::steady_clock::now() + timeout;
  char buffer[65536];
  while (std::chrono::steady_clock::now() < deadline) {
    pollfd p{fd, POLLIN, 0};
    if (poll(&p, 1, 50) > 0 && recv(fd, buffer, sizeof buffer, 0) <= 0) return true;
  }
  return false;
}

TEST_F(Loopback, GarbageOnASendersPortDropsOnlyThatConnection) {
  Sender src;
  ASSERT_TRUE(src.Start(folder_, "Guarded", {"--width", "16", "--height", "8", "--fps", "20", "--pattern", "ramp"}));
  Receiver rx(src.Name());
  ASSERT_TRUE(rx.WaitConnected());
  const auto hello = ndilb::EncodeHello(100, false, false);
  const auto huge = ndilb::EncodeMetadata(ndilb::MessageType::Metadata, 0, 0xFFFFFFF0u);
  const struct {
    const char* what;
    std::string bytes;
    std::chrono::milliseconds limit;
  } cases[] = {
      {"garbage", std::string(100, 'Z'), 2s},
      {"a 4 GB text is refused, not awaited",
       std::string(reinterpret_cast<const char*>(hello.bytes), hello.size) +
           std::string(reinterpret_cast<const char*>(huge.bytes), huge.size),
       2s},
      {"a connection that never says hello is not kept", "", 4s},
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(c.what);
    const int fd = RawConnect(Url(src));
    ASSERT_GE(fd, 0);
    EXPECT_TRUE(c.bytes.empty() || SendAll(fd, c.bytes.data(), c.bytes.size()));
    EXPECT_TRUE(ClosedByPeer(fd, c.limit));
    close(fd);
  }
  // The real receiver kept its connection and its frames.
  EXPECT_EQ(rx.Connections(), 1);
  ASSERT_TRUE(rx.Picture([](const ndi_video_frame_v2& v) { EXPECT_EQ(Ramp(v), ""); }));
  src.Process().Signal(SIGTERM);
  EXPECT_EQ(src.Process().Wait(pmtest::kPatience), std::optional<int>(0));
}

// A fake sender: a listening socket in this process with a registry entry.
class FakeSender {
 public:
  FakeSender(const std::string& registry, const std::string& name) {
    sockaddr_in addr = Loopback127(0);
    socklen_t len = sizeof addr;
    EXPECT_EQ(bind(listener_, reinterpret_cast<sockaddr*>(&addr), sizeof addr), 0);
    EXPECT_EQ(listen(listener_, 4), 0);
    getsockname(listener_, reinterpret_cast<sockaddr*>(&addr), &len);
    std::ofstream(registry + "/fake.ndi") << "ndi-loopback 1\nname=" << name << "\nurl=127.0.0.1:"
                                          << ntohs(addr.sin_port) << "\npid=" << getpid() << "\n";
  }
  ~FakeSender() { close(listener_); }
  // The next connection of a receiver; -1 when none comes.
  int Accept() {
    pollfd p{listener_, POLLIN, 0};
    return poll(&p, 1, 3000) == 1 ? accept4(listener_, nullptr, nullptr, SOCK_CLOEXEC) : -1;
  }

 private:
  const int listener_ = socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
};

ndilb::EncodedHead UyvyHead(int width, int height, std::uint64_t payload) {
  ndilb::VideoInfo info;
  info.xres = width;
  info.yres = height;
  info.fourcc = kNdiFourCCUYVY;
  info.line_stride = width * 2;
  return ndilb::EncodeVideo(info, 0, payload);
}

TEST_F(Loopback, GarbageFromASenderDropsTheConnectionAndTheReceiverTriesAgain) {
  FakeSender fake(folder_.Registry(), "FAKE (x)");
  Receiver rx("FAKE (x)");
  // Garbage, then a frame header with an impossible payload length, then one
  // whose length does not match its picture.
  std::vector<std::vector<std::uint8_t>> attacks;
  attacks.emplace_back(64, 0xEE);
  for (const ndilb::EncodedHead& head : {UyvyHead(16, 8, std::uint64_t{1} << 40), UyvyHead(16, 8, 16 * 8 * 2 + 1)}) {
    attacks.emplace_back(head.bytes, head.bytes + head.size);
  }
  for (const auto& attack : attacks) {
    const int fd = fake.Accept();
    ASSERT_GE(fd, 0) << "the receiver (re)connects";
    ASSERT_TRUE(SendAll(fd, attack.data(), attack.size()));
    EXPECT_TRUE(ClosedByPeer(fd, 2s));
    close(fd);
    EXPECT_EQ(rx.Connections(), 0);
  }
  ndi_video_frame_v2 v{};
  ndi_metadata_frame m{};
  EXPECT_EQ(NDIlib_recv_capture_v2(rx.get(), &v, nullptr, &m, 50), kNdiFrameStatusChange) << "the one of its making";
  const auto start = std::chrono::steady_clock::now();
  EXPECT_EQ(NDIlib_recv_capture_v2(rx.get(), &v, nullptr, &m, 250), kNdiFrameNone) << "nothing half-made is delivered";
  EXPECT_GE(std::chrono::steady_clock::now() - start, 240ms) << "capture waits its timeout";
}

TEST_F(Loopback, DestroyingAReceiverInTheMiddleOfAFrameReturnsPromptly) {
  FakeSender fake(folder_.Registry(), "STALL (x)");
  auto rx = std::make_unique<Receiver>("STALL (x)");
  const int fd = fake.Accept();
  ASSERT_GE(fd, 0);
  const std::vector<std::uint8_t> half(3840u * 540, 7);
  ASSERT_TRUE(SendAll(fd, ndilb::EncodeReady(false)));
  ASSERT_TRUE(SendAll(fd, UyvyHead(1920, 1080, 3840u * 1080)));
  ASSERT_TRUE(SendAll(fd, half.data(), half.size()));
  EXPECT_TRUE(rx->WaitConnected());
  std::this_thread::sleep_for(50ms);  // the receiver is now waiting for the rest of the picture
  ndi_video_frame_v2 v{};
  EXPECT_NE(NDIlib_recv_capture_v2(rx->get(), &v, nullptr, nullptr, 50), kNdiFrameVideo) << "half a frame is no frame";
  const auto start = std::chrono::steady_clock::now();
  rx.reset();
  EXPECT_LT(std::chrono::steady_clock::now() - start, 1s);
  close(fd);
}

}  // namespace
