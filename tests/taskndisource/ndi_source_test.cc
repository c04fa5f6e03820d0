// The NDI source on a scripted runtime and a clock the test advances (no test
// waits for real seconds): video and audio intake frame by frame (formats
// requested, bytes copied, timestamps and their shared base, the produces
// mask, every kind of bad frame), metadata read from the sender, shot events,
// tally and PTZ commands sent to it, the settings panel and status texts, and
// the receiver loop's states, timing and reports.

#include <gtest/gtest.h>

#include <cstring>
#include <functional>
#include <limits>
#include <thread>

#include "ndi_harness.h"
#include "support/log_capture.h"
#include "support/wait.h"
#include "taskndisource/ndi_config.h"
#include "taskndisource/ndi_source.h"

namespace {

using nditest::AnyVideo;
using nditest::AudioCapture;
using nditest::Entry;
using nditest::VideoCapture;
using TaskNDISource::MediaInfo;
using TaskNDISource::NDISource;
using TaskNDISource::ReceiverState;
using Json = nlohmann::json;
using Lines = std::vector<std::string>;

constexpr char kName[] = "STUDIO (Cam 1)";
constexpr char kId[] = "NDICaptureDevice~STUDIO (Cam 1)";
constexpr char kUrl[] = "127.0.0.1:5961";
void* const kReceiver = reinterpret_cast<void*>(0x10);

// A shot event as the sender gets it.
std::string EventText(const std::string& value, char preview, char live) {
  return "<skyrelay_ext>\n    <event value=\"" + value + "\" preview=\"" + preview + "\" live=\"" + live +
         "\"/>\n</skyrelay_ext>\n";
}

// The sender is listed unless a test says otherwise. The source goes first,
// stopping its loop.
class NdiSource : public ::testing::Test {
 protected:
  NdiSource() { ndi.SetSources({Entry{kName, kUrl}}); }
  // Hands a video or audio capture to the source's intake.
  bool Deliver(const std::shared_ptr<nditest::Capture>& c, MediaInfo* info = nullptr) {
    return c->type == kNdiFrameVideo ? source->ProcessVideoFrame(c->video, info) : source->ProcessAudioFrame(c->audio, info);
  }
  // Wait (real time) until `done` holds.
  static void Until(const std::function<bool()>& done) { ASSERT_TRUE(pmtest::WaitFor(done)); }
  void UntilStates(std::vector<std::int32_t> states) { Until([&] { return callbacks->Seen().states == states; }); }

  pmtest::LogCapture logs;
  nditest::ScriptedNdi ndi;
  std::shared_ptr<nditest::FakeCallbacks> callbacks = std::make_shared<nditest::FakeCallbacks>();
  nditest::TestEnvironment env;
  std::shared_ptr<NDISource> source = std::make_shared<NDISource>(callbacks, kId, ndi.Api(), env.Make());
};

// ===================================================================== Intake

// Each accepted FourCC is asked for as its host code, with the scan of the
// frame, and copied row by row (NV12's chroma rows too) from the frame's
// stride: padding past a row never ends up in the buffer. (VideoFormat is
// packed: its fields are read by value, never bound to a reference. The media
// format that goes with a picture is checked on the panel, by the loop test.)
TEST_F(NdiSource, EachPixelFormatIsRequestedAsItsHostCodeAndCopiedRowByRow) {
  struct Case {
    std::uint32_t fourcc, code;
    int stride;
    bool progressive;
    int rowBytes;
  } cases[] = {
      {kNdiFourCCUYVY, 0x32767579u /* '2vuy' */, 40, true, 32},
      {kNdiFourCCUYVA, pm::kCode2vuy, 32, false, 32},
      {kNdiFourCCNV12, pm::kCodeNV12, 24, true, 16},
      {kNdiFourCCBGRA, pm::kCodeRgba, 72, false, 64},
  };
  for (const Case& c : cases) {
    SCOPED_TRACE(c.fourcc);
    ASSERT_TRUE(Deliver(VideoCapture(c.fourcc, 16, 4, c.stride, 0, c.progressive)));
    const auto sent = callbacks->Seen().videoSent.back();
    const pm::VideoFormat r = sent->format_;
    EXPECT_EQ((std::vector<std::uint32_t>{r.code, std::uint32_t(r.width), std::uint32_t(r.height), std::uint32_t(r.scan)}),
              (std::vector<std::uint32_t>{c.code, 16, 4, std::uint32_t(c.progressive ? 'P' : 'U')}));
    // The same picture without padding.
    EXPECT_EQ(sent->memory, VideoCapture(c.fourcc, 16, 4, c.rowBytes)->bytes);
  }
}

// A bad frame is dropped with one line before a buffer is asked for; a video
// buffer of another format or an audio buffer too small (not written past) or
// none loses only that frame. (A refused video buffer is the fault suite's
// stalled host, whose pictures run the pool dry.)
TEST_F(NdiSource, BadFramesAndBuffersLoseOnlyThatFrameWithItsLine) {
  // A good frame spoilt one way.
  const auto spoilt = [](std::shared_ptr<nditest::Capture> capture, const std::function<void(nditest::Capture&)>& spoil) {
    spoil(*capture);
    return capture;
  };
  const std::shared_ptr<nditest::Capture> cases[] = {
      spoilt(AnyVideo(), [](auto& c) { c.video.data = nullptr; }),
      spoilt(AnyVideo(), [](auto& c) { c.video.line_stride_in_bytes = 0; }),
      spoilt(AnyVideo(), [](auto& c) { c.video.line_stride_in_bytes = -32; }),
      VideoCapture(kNdiFourCCUYVY, 16, 4, 31),  // rows of 32
      VideoCapture(kNdiFourCCNV12, 16, 4, 15),  // rows of 16
      VideoCapture(kNdiFourCCBGRA, 16, 4, 63),  // rows of 64
      spoilt(AnyVideo(), [](auto& c) { c.video.xres = 0; }),
      spoilt(AnyVideo(), [](auto& c) { c.video.yres = -4; }),
      spoilt(AnyVideo(), [](auto& c) { c.video.xres = 32768; }),  // past the host's 16 bits
      spoilt(AnyVideo(), [](auto& c) { c.video.yres = 40000; }),
      VideoCapture(kNdiFourCCI420, 16, 4, 16),
      VideoCapture(0x12345678, 16, 4, 32),
      AudioCapture(0, 2, 16),
      AudioCapture(-48000, 2, 16),
      AudioCapture(48000, 2, 0),
      AudioCapture(48000, 2, -5),
      AudioCapture(48000, 0, 16),
      spoilt(AudioCapture(48000, 2, 16), [](auto& c) { c.audio.data = nullptr; }),
  };
  for (std::size_t i = 0; i < std::size(cases); ++i) {
    logs.Clear();
    EXPECT_FALSE(Deliver(cases[i])) << i;
    EXPECT_EQ(logs.Lines().size(), 1u) << i;
  }
  EXPECT_TRUE(callbacks->Seen().calls.empty());
  // The largest describable frame is taken.
  ASSERT_TRUE(Deliver(VideoCapture(kNdiFourCCNV12, 32767, 1, 32767)));
  callbacks->OverrideVideoFormat(pm::VideoFormat{pm::kCode2vuy, 1920, 1080});
  EXPECT_FALSE(Deliver(AnyVideo()));
  EXPECT_EQ(callbacks->Seen().videoSent.size(), 1u);  // the largest
  callbacks->OverrideAudioBytes(2 * 16 * 4 - 1);
  EXPECT_FALSE(Deliver(AudioCapture(48000, 2, 16)));
  EXPECT_TRUE(logs.Contains("#ndisource: audio buffer too small for the NDI audio frame\n"));
  EXPECT_TRUE(callbacks->Seen().audioSent.empty());
  callbacks->OverrideAudioBytes(-1);
  EXPECT_FALSE(Deliver(AudioCapture(48000, 2, 16)));
  EXPECT_TRUE(logs.Contains("#ndisource: audio well ran dry\n"));
}

TEST_F(NdiSource, StereoAudioIsInterleavedIntoTheHostBuffer) {
  ASSERT_TRUE(Deliver(AudioCapture(48000, 2, 3)));
  const auto sent = callbacks->Seen().audioSent.at(0);
  const pm::AudioFormat format = sent->format_;
  EXPECT_EQ((std::vector<std::uint32_t>{format.code, format.sampleRate, format.channels, std::uint32_t(sent->samples_)}),
            (std::vector<std::uint32_t>{0x666C3332u /* 'fl32' */, 48000, 2, 3}));
  const float interleaved[] = {0, 1000, 1, 1001, 2, 1002};
  ASSERT_EQ(sent->memory.size(), sizeof interleaved);
  EXPECT_EQ(0, std::memcmp(sent->memory.data(), interleaved, sizeof interleaved));
}

// The record's channel byte is read as signed where sizes are computed, so
// sound of 128 channels and more is refused before a buffer is asked for. It
// is told once when it starts, not with every frame (anew when the count
// changes or after sound that was taken), and the panel's audio line says
// why there is no sound.
TEST_F(NdiSource, SoundOfTooManyChannelsIsToldOnceAndNamedOnThePanel) {
  const std::pair<int, const char*> cases[] = {
      {127, "127 Channels @ 48 kHz"},      {128, "128 Channels not supported"}, {255, "255 Channels not supported"},
      {256, "256 Channels not supported"}, {2, "Stereo @ 48 kHz"},              {256, "256 Channels not supported"},
  };
  for (const auto& [channels, status] : cases) {
    SCOPED_TRACE(channels);
    logs.Clear();
    const bool taken = channels < 128;
    const int requested = callbacks->Count("audio request");
    MediaInfo info;
    for (int frame = 0; frame < 5; ++frame) EXPECT_EQ(Deliver(AudioCapture(48000, channels, 4), &info), taken);
    EXPECT_EQ(callbacks->Count("audio request") - requested, taken ? 5 : 0);
    EXPECT_EQ(logs.Lines(), taken ? Lines{}
                                  : Lines{"#ndisource: too many channels in NDI audio frame (" + std::to_string(channels) +
                                          "): at most 127 are carried, its sound is dropped\n"});
    EXPECT_EQ(TaskNDISource::AudioStatusText(info), status);
  }
}

// Times count from the oldest sender timestamp across audio and video (1 s =
// 10,000,000 x 100 ns = 705,600,000 ticks); an older frame takes the base and
// resets the host's clock with the next frame delivered, even when it is
// dropped itself; timestamps far apart saturate. The first frame of each kind
// reports production once, until a Start clears it.
TEST_F(NdiSource, TimestampsCountFromTheOldestFrameAndProductionIsToldOnce) {
  constexpr std::int64_t kMin = std::numeric_limits<std::int64_t>::min(), kMax = std::numeric_limits<std::int64_t>::max();
  ASSERT_TRUE(Deliver(VideoCapture(kNdiFourCCUYVY, 16, 4, 32, 50'000'000)));
  ASSERT_TRUE(Deliver(VideoCapture(kNdiFourCCUYVY, 16, 4, 32, 60'000'000)));
  ASSERT_TRUE(Deliver(AudioCapture(48000, 2, 16, 55'000'000)));
  ASSERT_TRUE(Deliver(VideoCapture(kNdiFourCCUYVY, 16, 4, 32, 0)));  // no timestamp: time 0, base kept
  ASSERT_TRUE(Deliver(AudioCapture(48000, 2, 16, 40'000'000)));
  ASSERT_TRUE(Deliver(VideoCapture(kNdiFourCCUYVY, 16, 4, 32, 40'000'001)));
  EXPECT_FALSE(Deliver(VideoCapture(kNdiFourCCI420, 16, 4, 16, 10'000'000)));  // takes the base, no reset yet
  ASSERT_TRUE(Deliver(AudioCapture(48000, 1, 16, 20'000'000)));
  ASSERT_TRUE(Deliver(VideoCapture(kNdiFourCCUYVY, 16, 4, 32, kMin + 1)));
  ASSERT_TRUE(Deliver(VideoCapture(kNdiFourCCUYVY, 16, 4, 32, kMax)));
  EXPECT_EQ(callbacks->Seen().calls, (Lines{
                                         "video request", "reset", "production 1", "video 0",
                                         "video request", "video 705600000",
                                         "audio request", "production 3", "audio 352800000",
                                         "video request", "video 0",
                                         "audio request", "reset", "audio 0",
                                         "video request", "video 70",
                                         "audio request", "reset", "audio 705600000",
                                         "video request", "reset", "video 0",
                                         "video request", "video " + std::to_string(kMax),
                                     }));
  source->Start();
  source->Stop();
  ASSERT_TRUE(Deliver(AudioCapture(48000, 2, 16, 5)));
  EXPECT_EQ(callbacks->Count("production 2"), 1);
}

// ================================================================== Metadata

// Events go out in order, printed indented and escaped with the terminating
// zero counted; a refused send stops the pass and keeps the event first (so
// it is the one sent twice).
TEST_F(NdiSource, ShotEventsAreSentInOrderAndAnUnsentOneStaysFirst) {
  std::deque<TaskNDISource::ShotEvent> queue{TaskNDISource::ShotEvent{"X", 1, 0}, TaskNDISource::ShotEvent{"a\"b<&>", 0, 1}};
  ndi.SetMetadataResult(false);
  source->SendShotEvents(kReceiver, queue);
  ndi.SetMetadataResult(true);
  source->SendShotEvents(kReceiver, queue);
  EXPECT_TRUE(queue.empty());
  EXPECT_EQ(ndi.Seen().metadataSent,
            (Lines{EventText("X", '1', '0'), EventText("X", '1', '0'), EventText("a&quot;b&lt;&amp;&gt;", '0', '1')}));
}

// Each command reaches its call with its parameters (defaults for missing
// ones, clamped to the call's type; the lenient reading of each value is
// pmjson's); any other command or mode does nothing.
TEST_F(NdiSource, PtzCommandsReachTheirCallsAndOtherShapesDoNothing) {
  const std::pair<Json, const char*> cases[] = {
      {{{"command", "RecallPreset"}, {"preset", 3}, {"speed", 0.5}}, "recall_preset(3,0.5)"},
      {{{"command", "StorePreset"}, {"preset", 7}}, "store_preset(7)"},
      {{{"command", "PanTilt"}, {"pan", -0.25}, {"tilt", 0.75}}, "pan_tilt(-0.25,0.75)"},
      {{{"command", "PanTiltSpeed"}, {"pan", 1}, {"tilt", -1}}, "pan_tilt_speed(1,-1)"},
      {{{"command", "Zoom"}, {"zoom", 0.5}}, "zoom(0.5)"},
      {{{"command", "AutoFocus"}}, "auto_focus()"},
      {{{"command", "Focus"}, {"val", 0.25}}, "focus(0.25)"},
      {{{"command", "FocusSpeed"}, {"speed", -0.5}}, "focus_speed(-0.5)"},
      {{{"command", "AutoExposure"}}, "exposure_auto()"},
      {{{"command", "ExposureManual"}, {"level", 0.125}}, "exposure_manual(0.125)"},
      {{{"command", "BalanceMode"}, {"mode", "auto"}}, "white_balance_auto()"},
      {{{"command", "BalanceMode"}, {"mode", "indoor"}}, "white_balance_indoor()"},
      {{{"command", "BalanceMode"}, {"mode", "outdoor"}}, "white_balance_outdoor()"},
      {{{"command", "BalanceMode"}, {"mode", "oneshot"}}, "white_balance_oneshot()"},
      {{{"command", "BalanceMode"}, {"mode", "manual"}, {"red", 0.5}, {"blue", 0.25}}, "white_balance_manual(0.5,0.25)"},
      // Lenient parameters.
      {{{"command", "RecallPreset"}}, "recall_preset(0,1)"},
      {{{"command", "Zoom"}, {"zoom", 1e300}}, "zoom(3.40282e+38)"},
      {{{"command", "StorePreset"}, {"preset", 99999999999}}, "store_preset(2147483647)"},
      // Other shapes.
      {{{"command", "zoom"}}, nullptr},
      {{{"command", "BalanceMode"}}, nullptr},
  };
  std::deque<Json> queue;
  Lines expected;
  for (const auto& [command, call] : cases) {
    queue.push_back(command);
    if (call != nullptr) expected.push_back(call);
  }
  source->RunPtzCommands(kReceiver, queue);
  EXPECT_TRUE(queue.empty());
  EXPECT_EQ(ndi.Seen().ptzCalls, expected);
}

// Frames on a fresh source each: what reaches the host, what is logged and
// the model name kept. A frame is its text and zero, or exactly `length`
// bytes of its text (a read past them is the sanitizer's to catch).
TEST_F(NdiSource, MetadataFramesAreReadAsTheirXmlSaysWithinTheirLength) {
  constexpr int kWithZero = -1000;
  const std::string parseFailed = "#ndisource: failed to parse metadata frame\n";
  const std::string badBuildOut = "#ndisource: invalid buildOutDuration in NDI metadata frame\n";
  const std::string badLength = "#ndisource: invalid length in NDI metadata frame\n";
  const std::string modelLine = "#ndisource: NDI source model name: ";
  const std::string buildOne = "<metadata><buildOutDuration>1</buildOutDuration></metadata>";
  const std::string withZero = std::string("<ndi_product model_name=\"A\"/>") + '\0' + "garbage that is not XML";
  std::string deep;
  for (int i = 0; i < 10000; ++i) deep += "<a>";
  struct Frame {
    std::string text;
    int length = kWithZero;
    bool noData = false;
  };
  struct Case {
    std::vector<Frame> frames;
    Lines calls, log;
    std::string model;
  } cases[] = {
      {{{"<metadata><buildOutDuration>0.5</buildOutDuration></metadata>"}}, {"buildout 352800000"}, {}, ""},
      {{{"<skyrelay_ext>\n  <other/>\n  <buildOutDuration> 2 </buildOutDuration></skyrelay_ext>"}},
       {"buildout 1411200000"}, {}, ""},
      {{{"<other><buildOutDuration>0.5</buildOutDuration></other>"}}, {}, {}, ""},
      {{{"<metadata><buildOutDuration>soon</buildOutDuration></metadata>"}}, {}, {}, ""},
      {{{"<metadata><nested><buildOutDuration>1</buildOutDuration></nested></metadata>"}}, {}, {}, ""},
      {{{"<metadata><buildOutDuration>1e300</buildOutDuration></metadata>"}}, {}, {badBuildOut}, ""},
      {{{"<metadata><buildOutDuration>nan</buildOutDuration></metadata>"}}, {}, {badBuildOut}, ""},
      {{{""}}, {}, {parseFailed}, ""},
      {{{"<metadata><buildOutDuration>0.5</metadata>"}}, {}, {parseFailed}, ""},
      {{{"<!-- only a comment -->"}}, {}, {"#ndisource: metadata frame has no root element\n"}, ""},
      {{{deep}}, {}, {parseFailed}, ""},
      {{{"<a/>", 0}}, {}, {badLength}, ""},
      {{{"<a/>", -5}}, {}, {badLength}, ""},
      {{{"<a/>", 5, true}}, {}, {"#ndisource: null data in NDI metadata frame\n"}, ""},
      {{{buildOne, static_cast<int>(buildOne.size())}}, {"buildout 705600000"}, {}, ""},  // no zero
      {{{withZero, static_cast<int>(withZero.size())}}, {}, {modelLine + "A\n"}, "A"},   // a zero ends the text
      // The model name is logged when it changes, and forgotten by a product without one.
      {{{R"(<ndi_product model_name="PTZ Cam 2000"/>)"}, {R"(<ndi_product model_name="PTZ Cam 2000" serial="1"/>)"}},
       {}, {modelLine + "PTZ Cam 2000\n"}, "PTZ Cam 2000"},
      {{{R"(<ndi_product model_name="B"/>)"}, {"<ndi_product/>"}}, {}, {modelLine + "B\n", modelLine + "\n"}, ""},
  };
  for (const Case& c : cases) {
    SCOPED_TRACE(c.frames[0].text.substr(0, 80));
    auto fresh = std::make_shared<nditest::FakeCallbacks>();
    NDISource one(fresh, kId, ndi.Api(), env.Make());
    logs.Clear();
    for (const Frame& f : c.frames) {
      std::vector<char> exact(f.text.begin(), f.text.end());
      if (f.length == kWithZero) exact.push_back('\0');
      const int length = f.length == kWithZero ? static_cast<int>(exact.size()) : f.length;
      one.ProcessMetadataFrame(ndi_metadata_frame{length, 0, f.noData ? nullptr : exact.data()});
    }
    EXPECT_EQ(fresh->Seen().calls, c.calls);
    EXPECT_EQ(logs.Lines(), c.log);
    EXPECT_EQ(one.ModelName(), c.model);
  }
}

// The suite goes with the model name; the vendor runtime reports PTZ support
// before the product metadata, so a model name arriving (or changing) after
// the support was reported is reported again.
TEST_F(NdiSource, PtzSupportIsReportedWithTheModelNameAndAgainWhenTheNameArrives) {
  ndi.SetPtzSupported(true);
  source->ReportPtzSupport(kReceiver);
  source->ProcessMetadataFrame(nditest::MetadataCapture(R"(<ndi_product model_name="Model Y"/>)")->metadata);
  source->ProcessMetadataFrame(nditest::MetadataCapture(R"(<ndi_product model_name="Model Y"/>)")->metadata);
  ndi.SetPtzSupported(false);
  source->ReportPtzSupport(kReceiver);
  source->ProcessMetadataFrame(nditest::MetadataCapture(R"(<ndi_product model_name="Model Z"/>)")->metadata);
  ndi.SetPtzSupported(true);
  source->ReportPtzSupport(kReceiver);
  EXPECT_EQ(callbacks->Seen().calls, (Lines{"ptz NDI3/", "ptz NDI3/Model Y", "ptz /", "ptz NDI3/Model Z"}));
}

// A connection lost while receiving sends the loop to Idle (the media texts
// emptied); PTZ commands then wait for a frame, which comes when the sender is
// back on the same receiver; while stopped they are dropped.
TEST_F(NdiSource, PtzWhileStoppedIsDroppedAndInIdleWaitsForAFrame) {
  source->ExecutePtzCommand({{"command", "Zoom"}, {"zoom", 0.1}});
  ndi.SetConnections(0);
  ndi.Push(AnyVideo());
  source->Start();
  UntilStates({1, 2, 3});
  EXPECT_EQ(source->PublishedMediaInfo(), MediaInfo{});
  source->ExecutePtzCommand({{"command", "Zoom"}, {"zoom", 0.5}});
  ASSERT_EQ(env.clock->AwaitWait(1), 5000);
  EXPECT_TRUE(ndi.Seen().ptzCalls.empty());
  ndi.SetConnections(1);
  ndi.Push(AnyVideo());
  env.clock->AdvanceMs(5000);
  UntilStates({1, 2, 3, 1, 2});
  EXPECT_EQ(ndi.Seen().receivers.size(), 1u);
  source->Stop();
  source->ExecutePtzCommand({{"command", "Zoom"}, {"zoom", 0.9}});
  EXPECT_EQ(ndi.Seen().ptzCalls, Lines{"zoom(0.5)"});
}

// ============================================================ Panel and texts

// Video: size and rate to two decimals (none without a rate); audio: channels
// and rate to one decimal under 48 kHz; empty without a size or channels.
TEST(StatusText, VideoAndAudioLines) {
  const std::pair<MediaInfo, const char*> cases[] = {
      {{1920, 1080, 25, 2}, "1920x1080 @ 12.50 fps"},
      {{1280, 720, 30, 0}, "1280x720"},
      {{1280, -1, 30, 1}, ""},
      {{16, 16, 2147483647, 1}, "16x16 @ 2147483647 fps"},  // would overflow when scaled
      {{0, 0, 0, 0, 44100, 1}, "Mono @ 44.1 kHz"},
      {{0, 0, 0, 0, 22050, 2}, "Stereo @ 22.0 kHz"},
      {{0, 0, 0, 0, 0, 2}, "Stereo"},
      {{0, 0, 0, 0, 48000, 0}, ""},
  };
  for (const auto& [info, text] : cases) {
    EXPECT_EQ(TaskNDISource::VideoStatusText(info) + TaskNDISource::AudioStatusText(info), text);
  }
}

// The pop-up's index becomes the bandwidth's name (leniently read, out of
// range the first), and a configuration comes back through the panel as it
// was; text that is not JSON gives nothing. The panel's button sends the
// command a reconnect is run by.
TEST_F(NdiSource, PanelAndConfigurationTranslateBothWays) {
  const std::pair<const char*, const char*> cases[] = {
      {R"({"bandwidth":{"value":0}})", "ndi_bandwidth_highest"},
      {R"({"bandwidth":{"value":2}})", "ndi_bandwidth_audio_only"},
      {R"({"bandwidth":{"value":"1"}})", "ndi_bandwidth_lowest"},
      {R"({"bandwidth":{"value":9}})", "ndi_bandwidth_highest"},
  };
  for (const auto& [gui, name] : cases) {
    const Json config = Json{{"bandwidth", name}};
    EXPECT_EQ(Json::parse(source->GuiToConfiguration(gui)), config) << gui;
    EXPECT_EQ(Json::parse(source->GuiToConfiguration(source->ConfigurationToGui(config.dump()))), config) << name;
  }
  EXPECT_EQ(source->GuiToConfiguration("{not json"), "");
  EXPECT_EQ(source->ConfigurationToGui("{not json"), "");
  EXPECT_EQ(Json::parse(source->ConfigurationToGui(R"({"bandwidth":5})"))["bandwidth"]["value"], 0);
  EXPECT_EQ(Json::parse(source->ConfigurationToGui("{}"))["reconnect"]["command"], "taskndisource::reconnect");
}

// ============================================================= Receiver loop

// A sender not listed is looked for every 250 ms, with a line each time, and
// the waits count toward the retry limit: found after it, its receiver is
// made and the loop goes idle without a capture. (With an id too short to
// carry a name: the empty name is looked for.)
TEST_F(NdiSource, SenderNotFoundIsLookedForEvery250MsAndFoundLateSendsTheLoopToIdle) {
  ndi.SetConnections(0);
  source = std::make_shared<NDISource>(callbacks, "short", ndi.Api(), env.Make());
  source->Start();
  for (int attempt = 1; attempt <= 130; ++attempt) {
    ASSERT_EQ(env.clock->AwaitWait(attempt), 250) << attempt;
    ASSERT_EQ(logs.Count("#ndisource: waiting for source to be found\n"), attempt);
    if (attempt == 130) ndi.SetSources({Entry{"", kUrl}});
    env.clock->AdvanceMs(250);
  }
  UntilStates({1, 3});
  EXPECT_EQ(ndi.Seen().captures, 0);
  EXPECT_EQ(ndi.Seen().findersCreated, 1);  // one finder for the whole loop
}

// A finder or receiver that cannot be made, or a sender listed without a
// URL, is an error: told, on the panel, and kept (the sender coming back with
// a URL does not end it) until a reconnect.
TEST_F(NdiSource, ErrorsAreToldAndKeptUntilAReconnect) {
  const std::pair<std::function<void()>, const char*> cases[] = {
      {[&] { ndi.FailCreate("finder"); }, "#ndisource: failed to create NDI finder\n"},
      {[&] { ndi.FailCreate("receiver"); }, "#ndisource: failed to create NDI receiver\n"},
      {[&] { ndi.SetSources({Entry{kName, ""}}); }, "#ndisource: source has no url\n"},
  };
  for (const auto& [fault, line] : cases) {
    SCOPED_TRACE(line);
    fault();
    env.clock = std::make_shared<pmtest::ManualClock>();  // each run's waits counted from 1
    const std::size_t told = callbacks->Seen().guis.size();
    source = std::make_shared<NDISource>(callbacks, kId, ndi.Api(), env.Make());  // the last one stops as it goes
    source->Start();
    // The panel is told just after the state changes.
    Until([&] {
      const auto guis = callbacks->Seen().guis;
      return guis.size() > told && guis.back().find("\"indication\":101") != std::string::npos;  // Error
    });
    EXPECT_TRUE(logs.Contains(line));
    ndi.FailCreate("");
  }
  ASSERT_EQ(env.clock->AwaitWait(1), 5000);
  ndi.SetSources({Entry{kName, kUrl}});
  env.clock->AdvanceMs(5000);
  ASSERT_EQ(env.clock->AwaitWait(2), 5000);
  EXPECT_EQ(source->State(), ReceiverState::Error);
  EXPECT_TRUE(ndi.Seen().receivers.empty());
  for (std::int32_t state : callbacks->Seen().states) EXPECT_NE(state, 4);
  source->ExecuteCustomActionCommand("taskndisource::reconnect");
  ndi.Push(AnyVideo());
  Until([&] { return source->State() == ReceiverState::Receiving; });
}

// The first sender listed with the name is taken, with the task's receiver
// settings, told the tally and both documents, then received. Shot events
// (with stray blanks they are events, not tally) and a changed tally reach
// the sender after a delivered frame, in order; an event before Start is
// never sent. A status change reports PTZ support with the model name of the
// metadata before it; every frame handed out is freed.
TEST_F(NdiSource, ConnectedSenderIsToldTallyDocumentsAndEventsThenReceives) {
  ndi.SetSources({Entry{"OTHER (x)", "10.0.0.1:1"}, Entry{nullptr, "10.0.0.2:1"}, Entry{kName, kUrl},
                  Entry{kName, "10.0.0.3:1"}});
  ndi.SetPtzSupported(true);
  source->HandleShotEvent("TALLY_PREVIEW_ON");
  source->HandleShotEvent("Cut before start");
  ndi.Push(AnyVideo());
  ndi.Push(nditest::MetadataCapture(R"(<ndi_product model_name="Cam"/>)"));
  ndi.Push(nditest::MetadataCapture("", kNdiFrameStatusChange));
  ndi.Push(nditest::MetadataCapture("", kNdiFrameError));
  source->Start();
  UntilStates({1, 2});
  // One panel for Connecting, one for Receiving with the media format (each
  // told before its state).
  const std::string gui = callbacks->Seen().guis.at(1);
  EXPECT_NE(gui.find("ndi_state_receiving"), std::string::npos) << gui;
  EXPECT_NE(gui.find("16x4 @ 29.97 fps"), std::string::npos) << gui;
  EXPECT_EQ(ndi.Seen().receivers.at(0), (nditest::ReceiverCreated{kName, kUrl, 1, 100, false}));
  const ndi_tally tally = ndi.Seen().tallies.at(0);
  EXPECT_EQ(std::make_pair(tally.on_program, tally.on_preview), std::make_pair(false, true));
  for (const char* event : {" TALLY_LIVE_ON", "TALLY_LIVE_ON ", "Cut", "TALLY_LIVE_ON"}) source->HandleShotEvent(event);
  // The loop may take the events in more than one batch; each batch goes
  // out after a delivered frame.
  for (int i = 0; i < 3; ++i) ndi.Push(AnyVideo());
  Until([&] {
    const nditest::Observed seen = ndi.Seen();
    return seen.metadataSent.size() >= 5 && seen.tallies.back().on_program && callbacks->Count("ptz NDI3/Cam") == 1;
  });
  EXPECT_EQ(ndi.Seen().metadataSent,
            (Lines{"<metadata>\n    <receiver_info name=\"Skyrelay\" vendor=\"Quillfront LLC\" protocol_version=\"1\"/>\n"
                   "</metadata>\n",
                   "<metadata>\n    <media_settings width=\"1280\" height=\"720\" framerate=\"1\"/>\n</metadata>\n",
                   EventText(" TALLY_LIVE_ON", '1', '0'), EventText("TALLY_LIVE_ON ", '1', '0'), EventText("Cut", '1', '0')}));
  source->Stop();
  EXPECT_TRUE(ndi.Seen().freesMatched);
}

TEST_F(NdiSource, RefusedTallyOrMetadataCountsAsAnAttemptAndRetriesAfter250Ms) {
  ndi.SetTallyResult(false);
  source->Start();
  ASSERT_EQ(env.clock->AwaitWait(1), 250);
  ndi.SetTallyResult(true);
  ndi.SetMetadataResult(false);
  env.clock->AdvanceMs(250);
  ASSERT_EQ(env.clock->AwaitWait(2), 250);
  EXPECT_EQ(ndi.Seen().captures, 0);
  ndi.SetMetadataResult(true);
  ndi.Push(AnyVideo());
  env.clock->AdvanceMs(250);
  UntilStates({1, 2});
}

// The runtime keeps a dead sender's URL listed for a while, and a receiver
// takes whichever sender listens at its URL: when the finder lists the sender
// at another URL than its receiver was made for, the receiver is made again
// for the listed one, while connecting as while receiving. The list is looked
// at every 250 ms; a sender missing from it for a moment keeps its receiver.
struct ListedCase {
  bool receiving;             // else still connecting, with a receiver
  std::vector<Entry> listed;  // the list from then on
  const char* madeAgainFor;   // null: the receiver stays
  std::vector<std::int32_t> states;
};

class ListedUrl : public NdiSource, public ::testing::WithParamInterface<ListedCase> {};

TEST_P(ListedUrl, MakesTheReceiverAgainOnlyForAnotherListedUrl) {
  const ListedCase& c = GetParam();
  if (c.receiving) ndi.Push(AnyVideo());
  source->Start();
  if (c.receiving) UntilStates({1, 2});
  Until([&] { return ndi.Seen().captures >= 3; });
  ndi.SetSources(c.listed);
  const int lists = ndi.Seen().listCalls, captures = ndi.Seen().captures;
  Until([&] { return ndi.Seen().captures >= captures + 20; });
  EXPECT_EQ(ndi.Seen().listCalls, lists) << "not looked at before 250 ms have passed";
  env.clock->AdvanceMs(250);
  if (c.madeAgainFor != nullptr) {
    Until([&] { return ndi.Seen().receivers.size() == 2; });
    EXPECT_EQ(ndi.Seen().receivers.at(1).url, c.madeAgainFor);
    EXPECT_EQ(ndi.Seen().receiversDestroyed, 1);
    ndi.Push(AnyVideo());
  } else {
    Until([&] { return ndi.Seen().captures >= captures + 40; });
    EXPECT_EQ(ndi.Seen().receivers.size(), 1u);
  }
  UntilStates(c.states);
}

// Moved while receiving, moved while connecting, missing from the list,
// listed without a URL, still listed first at its URL.
INSTANTIATE_TEST_SUITE_P(NdiSource, ListedUrl,
                         ::testing::Values(ListedCase{true, {Entry{kName, "10.0.0.9:2"}}, "10.0.0.9:2", {1, 2, 1, 2}},
                                           ListedCase{false, {Entry{kName, "10.0.0.9:2"}}, "10.0.0.9:2", {1, 2}},
                                           ListedCase{true, {}, nullptr, {1, 2}},
                                           ListedCase{true, {Entry{kName, ""}}, nullptr, {1, 2}},
                                           ListedCase{true, {Entry{kName, kUrl}, Entry{kName, "10.0.0.9:2"}}, nullptr, {1, 2}}));

// After the retry limit the loop goes Idle, reports at once and polls every
// 5 s; Stop or release ends a waiting loop at once.
TEST_F(NdiSource, AfterRetryLimitIdlePollsEvery5sUntilStopOrReleaseEndsItAtOnce) {
  ndi.SetConnections(0);
  source->Start();
  ASSERT_EQ(env.clock->AwaitWait(1), 5000);
  EXPECT_EQ(ndi.Seen().captures, 120);
  EXPECT_EQ(callbacks->Seen().states, (std::vector<std::int32_t>{1, 3}));
  env.clock->AdvanceMs(5000);
  ASSERT_EQ(env.clock->AwaitWait(2), 5000);
  source->Stop();
  EXPECT_EQ(source->State(), ReceiverState::None);
  EXPECT_EQ(ndi.Seen().receiversDestroyed, 1);
  EXPECT_EQ(ndi.Seen().findersDestroyed, 1);
  // A source released while its loop runs stops it.
  source->Start();
  Until([&] { return ndi.Seen().findersCreated == 2; });
  source.reset();
  EXPECT_EQ(ndi.Seen().findersDestroyed, 2);
}

TEST_F(NdiSource, LoopStuckPastTheStopDeadlineEndsTheProcess) {
  ndi.BlockCapture(true);
  // The hook lets the loop go, so Stop returns only when it was called.
  TaskNDISource::LoopEnvironment stuck = env.Make();
  stuck.stopTimeout = std::chrono::milliseconds(20);
  stuck.exitProcess = [&] { ndi.BlockCapture(false); };
  source = std::make_shared<NDISource>(callbacks, kId, ndi.Api(), stuck);
  source->Start();
  Until([&] { return ndi.Seen().captures >= 1; });
  source->Stop();
  EXPECT_TRUE(logs.Contains("#ndisource: failed to exit receiver loop\n"));
}

// Reconnect and configuration restart a started source (with the new
// bandwidth) and only store on a stopped one. A bandwidth text of no known
// name selects the highest; a text that does not read keeps the value.
TEST_F(NdiSource, StartedSourceRestartsOnReconnectAndConfiguration) {
  source->ExecuteCustomActionCommand("taskndisource::reconnect");
  source->SetConfiguration(R"({"bandwidth":"ndi_bandwidth_audio_only"})");
  source->SetConfiguration("not json");
  EXPECT_FALSE(source->Started());
  EXPECT_EQ(ndi.Seen().findersCreated, 0);
  // Each change once the loop made its receiver.
  const auto made = [&](std::size_t count) { Until([&] { return ndi.Seen().receivers.size() == count; }); };
  source->Start();
  made(1);
  source->SetConfiguration(R"({"bandwidth":"ndi_bandwidth_lowest "})");
  made(2);
  source->SetConfiguration(R"({"bandwidth":"ndi_bandwidth_lowest"})");
  made(3);
  source->ExecuteCustomActionCommand("taskndisource::reconnect");
  made(4);
  std::vector<std::int32_t> bandwidths;
  for (const auto& receiver : ndi.Seen().receivers) bandwidths.push_back(receiver.bandwidth);
  EXPECT_EQ(bandwidths, (std::vector<std::int32_t>{10, 100, 0, 0}));
  EXPECT_EQ(ndi.Seen().receiversDestroyed, 3);
}

TEST_F(NdiSource, ConcurrentReconnectsNeverRunTwoLoops) {
  source->Start();
  const std::function<void(int)> actions[] = {
      [&](int) { source->ExecuteCustomActionCommand("taskndisource::reconnect"); },
      [&](int i) { source->SetConfiguration(i % 2 ? R"({"bandwidth":"ndi_bandwidth_lowest"})" : "{}"); },
      [&](int) { source->Start(); },  // a start over a running loop is refused
  };
  std::vector<std::thread> threads;
  for (const auto& act : actions) {
    threads.emplace_back([&act] {
      for (int i = 0; i < 20; ++i) act(i);
    });
  }
  for (auto& thread : threads) thread.join();
  Until([&] { return ndi.Seen().findersCreated - ndi.Seen().findersDestroyed == 1; });
  EXPECT_EQ(ndi.Seen().maxLiveFinders, 1);
  source->Stop();
  EXPECT_EQ(ndi.Seen().findersCreated, ndi.Seen().findersDestroyed);
}

// Without callbacks frames are dropped with their lines, and the loop still
// runs and idles without spinning.
TEST_F(NdiSource, LoopWithoutCallbacksDropsFramesAndIdlesWithoutSpinning) {
  ndi.SetConnections(0);
  ndi.Push(AnyVideo());
  ndi.Push(AudioCapture(48000, 2, 16));
  source = std::make_shared<NDISource>(nullptr, kId, ndi.Api(), env.Make());
  source->Start();
  ASSERT_EQ(env.clock->AwaitWait(1), 5000);
  EXPECT_EQ(source->State(), ReceiverState::Idle);
  EXPECT_TRUE(logs.Contains("#ndisource: expected video data callback when processing NDI video frame\n"));
  EXPECT_TRUE(logs.Contains("#ndisource: no callbacks\n"));
}

}  // namespace
