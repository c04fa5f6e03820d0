// Video and audio intake of the NDI source, driven frame by frame without a
// receiver loop: formats requested, bytes copied, timestamps and their shared
// base, the produces mask, and every kind of bad frame.

#include <gtest/gtest.h>

#include <cstring>
#include <functional>
#include <limits>

#include "fakes.h"
#include "scripted_ndi.h"
#include "support/log_capture.h"
#include "taskndisource/ndi_config.h"
#include "taskndisource/ndi_source.h"

namespace {

using nditest::AudioCapture;
using nditest::VideoCapture;
using TaskNDISource::MediaInfo;
using TaskNDISource::NDISource;

constexpr char kId[] = "NDICaptureDevice~STUDIO (Cam 1)";

// VideoFormat is packed: its fields are read by value, never bound to a
// reference (gtest's comparisons take references).
struct Requested {
  std::uint32_t code, byteSize;
  int width, height, field, scan, extras;
};
Requested Read(const pm::VideoFormat& f) {
  return Requested{f.code, f.byteSize, f.width, f.height, f.field, f.scan,
                   f.extra1 | f.extra2 | f.extraWidth | f.extraHeight};
}

class IntakeTest : public ::testing::Test {
 protected:
  nditest::ScriptedNdi ndi;
  std::shared_ptr<nditest::FakeCallbacks> callbacks = std::make_shared<nditest::FakeCallbacks>();
  nditest::TestEnvironment env;
  std::shared_ptr<NDISource> source = std::make_shared<NDISource>(callbacks, kId, ndi.Api(), env.Make());
  pmtest::LogCapture logs;

  bool Video(const std::shared_ptr<nditest::Capture>& c, MediaInfo* info = nullptr) {
    return source->ProcessVideoFrame(c->video, info);
  }
  bool Audio(const std::shared_ptr<nditest::Capture>& c, MediaInfo* info = nullptr) {
    return source->ProcessAudioFrame(c->audio, info);
  }
};

// Each accepted FourCC is asked for as its host code, with the scan of the
// frame, and copied row by row (NV12's chroma rows too) from the frame's
// stride: padding past a row never ends up in the buffer.
TEST_F(IntakeTest, EachPixelFormatIsRequestedAsItsHostCodeAndCopiedRowByRow) {
  struct Case {
    std::uint32_t fourcc, code;
    int stride;
    bool progressive;
    int rows, rowBytes;
  } cases[] = {
      {kNdiFourCCUYVY, 0x32767579u /* '2vuy' */, 40, true, 4, 32},
      {kNdiFourCCUYVA, pm::kCode2vuy, 32, false, 4, 32},
      {kNdiFourCCNV12, pm::kCodeNV12, 24, true, 6, 16},
      {kNdiFourCCBGRA, pm::kCodeRgba, 72, false, 4, 64},
  };
  for (const Case& c : cases) {
    SCOPED_TRACE(c.fourcc);
    auto frame = VideoCapture(c.fourcc, 16, 4, c.stride, 0, c.progressive);
    MediaInfo info;
    ASSERT_TRUE(Video(frame, &info));
    const Requested r = Read(callbacks->Seen().videoRequests.back());
    EXPECT_EQ(r.code, c.code);
    EXPECT_EQ(r.width, 16);
    EXPECT_EQ(r.height, 4);
    EXPECT_EQ(r.byteSize, 0u);
    EXPECT_EQ(r.field, 0);
    EXPECT_EQ(r.scan, c.progressive ? 'P' : 'U');
    EXPECT_EQ(r.extras, 0);
    const auto sent = callbacks->Seen().videoSent.back();
    EXPECT_EQ(sent->copiedStride, c.stride);
    for (int row = 0; row < c.rows; ++row) {
      ASSERT_EQ(0, std::memcmp(sent->memory.data() + row * c.rowBytes, frame->bytes.data() + row * c.stride,
                               static_cast<std::size_t>(c.rowBytes)))
          << row;
    }
    EXPECT_EQ(info, (MediaInfo{16, 4, 30000, 1001, 0, 0}));
  }
}

TEST_F(IntakeTest, BadVideoFramesAreDroppedWithTheirLineAndNoBufferRequested) {
  // A good 16x4 UYVY frame at stride 32, spoilt one way.
  const auto spoilt = [](const std::function<void(ndi_video_frame_v2&)>& spoil) {
    auto capture = VideoCapture(kNdiFourCCUYVY, 16, 4, 32);
    spoil(capture->video);
    return capture;
  };
  struct Case {
    std::shared_ptr<nditest::Capture> frame;
    const char* line;
  };
  const Case cases[] = {
      {spoilt([](auto& v) { v.data = nullptr; }), "#ndisource: null data in NDI video frame\n"},
      {spoilt([](auto& v) { v.line_stride_in_bytes = 0; }), "#ndisource: invalid stride in NDI video frame\n"},
      {spoilt([](auto& v) { v.line_stride_in_bytes = -32; }), "#ndisource: invalid stride in NDI video frame\n"},
      {VideoCapture(kNdiFourCCUYVY, 16, 4, 31), "#ndisource: invalid stride in NDI video frame\n"},  // rows of 32
      {VideoCapture(kNdiFourCCNV12, 16, 4, 15), "#ndisource: invalid stride in NDI video frame\n"},  // rows of 16
      {VideoCapture(kNdiFourCCBGRA, 16, 4, 63), "#ndisource: invalid stride in NDI video frame\n"},  // rows of 64
      {spoilt([](auto& v) { v.xres = 0; }), "#ndisource: invalid resolution in NDI video frame\n"},
      {spoilt([](auto& v) { v.yres = -4; }), "#ndisource: invalid resolution in NDI video frame\n"},
      {spoilt([](auto& v) { v.xres = 32768; }), "#ndisource: NDI video frame too large (32768x4)\n"},
      {spoilt([](auto& v) { v.yres = 40000; }), "#ndisource: NDI video frame too large (16x40000)\n"},
      {VideoCapture(kNdiFourCCI420, 16, 4, 16), "#ndisource: unexpected raster format\n"},
      {VideoCapture(0x12345678, 16, 4, 32), "#ndisource: unexpected raster format\n"},
  };
  for (const Case& c : cases) {
    logs.Clear();
    EXPECT_FALSE(Video(c.frame)) << c.line;
    EXPECT_EQ(logs.Lines(), std::vector<std::string>{c.line});
  }
  EXPECT_TRUE(callbacks->Seen().videoRequests.empty());
  EXPECT_TRUE(callbacks->Seen().calls.empty());
  // The source still takes good frames.
  EXPECT_TRUE(Video(VideoCapture(kNdiFourCCUYVY, 16, 4, 32)));
}

TEST_F(IntakeTest, LargestDescribableFrameIsTaken) {
  auto frame = VideoCapture(kNdiFourCCNV12, 32767, 1, 32767);
  ASSERT_TRUE(Video(frame));
  EXPECT_EQ(Read(callbacks->Seen().videoRequests.back()).width, 32767);
}

TEST_F(IntakeTest, VideoWellRanDryLosesOnlyThatFrame) {
  callbacks->SetDry(true, false);
  EXPECT_FALSE(Video(VideoCapture(kNdiFourCCUYVY, 16, 4, 32)));
  EXPECT_TRUE(logs.Contains("#ndisource: video well ran dry\n"));
  callbacks->SetDry(false, false);
  EXPECT_TRUE(Video(VideoCapture(kNdiFourCCUYVY, 16, 4, 32)));
}

TEST_F(IntakeTest, BufferOfAnotherFormatIsNotCopiedInto) {
  pm::VideoFormat bigger;
  bigger.code = pm::kCode2vuy;
  bigger.width = 1920;
  bigger.height = 1080;
  callbacks->OverrideVideoFormat(bigger);
  EXPECT_FALSE(Video(VideoCapture(kNdiFourCCUYVY, 16, 4, 32)));
  EXPECT_TRUE(callbacks->Seen().videoSent.empty());
}

TEST_F(IntakeTest, NoCallbacksDropsFramesWithTheirLines) {
  NDISource lonely(nullptr, kId, ndi.Api(), env.Make());
  auto video = VideoCapture(kNdiFourCCUYVY, 16, 4, 32);
  auto audio = AudioCapture(48000, 2, 16);
  EXPECT_FALSE(lonely.ProcessVideoFrame(video->video, nullptr));
  EXPECT_FALSE(lonely.ProcessAudioFrame(audio->audio, nullptr));
  EXPECT_TRUE(logs.Contains("#ndisource: expected video data callback when processing NDI video frame\n"));
  EXPECT_TRUE(logs.Contains("#ndisource: no callbacks\n"));
}

TEST_F(IntakeTest, StereoAudioIsInterleavedIntoTheHostBuffer) {
  MediaInfo info;
  ASSERT_TRUE(Audio(AudioCapture(48000, 2, 1600), &info));
  const auto requests = callbacks->Seen().audioRequests;
  ASSERT_EQ(requests.size(), 1u);
  EXPECT_EQ(requests[0].first.code, 0x666C3332u);
  EXPECT_EQ(requests[0].first.sampleRate, 48000u);
  EXPECT_EQ(requests[0].first.channels, 2);
  EXPECT_EQ(requests[0].second, 1600);
  const auto samples = callbacks->Seen().audioSent.at(0)->Samples();
  ASSERT_EQ(samples.size(), 3200u);
  EXPECT_EQ(samples[0], 0.0f);     // channel 0, sample 0
  EXPECT_EQ(samples[1], 1000.0f);  // channel 1, sample 0
  EXPECT_EQ(samples[2], 1.0f);     // channel 0, sample 1
  EXPECT_EQ(samples[3199], 2599.0f);
  EXPECT_EQ(info, (MediaInfo{0, 0, 0, 0, 48000, 2}));
}

TEST_F(IntakeTest, BadAudioFramesAreDroppedWithTheirLine) {
  struct Case {
    std::shared_ptr<nditest::Capture> frame;
    const char* line;
  };
  auto nullData = AudioCapture(48000, 2, 16);
  nullData->audio.data = nullptr;
  const Case cases[] = {
      {AudioCapture(0, 2, 16), "#ndisource: unexpected audio sample rate\n"},
      {AudioCapture(-48000, 2, 16), "#ndisource: unexpected audio sample rate\n"},
      {AudioCapture(48000, 2, 0), "#ndisource: unexpected audio sample count\n"},
      {AudioCapture(48000, 2, -5), "#ndisource: unexpected audio sample count\n"},
      {AudioCapture(48000, 0, 16), "#ndisource: unexpected audio channel count\n"},
      {nullData, "#ndisource: null audio sample data\n"},
  };
  for (const Case& c : cases) {
    logs.Clear();
    EXPECT_FALSE(Audio(c.frame)) << c.line;
    EXPECT_EQ(logs.Lines(), std::vector<std::string>{c.line});
  }
  EXPECT_TRUE(callbacks->Seen().audioRequests.empty());
  EXPECT_TRUE(Audio(AudioCapture(48000, 127, 4)));
}

// The record's channel byte is read as signed where sizes are computed, so
// sound of 128 channels and more is refused before a buffer is asked for. It
// is told once when it starts, not with every frame (anew when the count
// changes or after sound that was taken), and the panel's audio line says
// why there is no sound.
TEST_F(IntakeTest, SoundOfTooManyChannelsIsToldOnceAndNamedOnThePanel) {
  struct Case {
    int channels;
    std::vector<std::string> lines;  // for five frames
    std::string status;
  };
  const auto line = [](int channels) {
    return "#ndisource: too many channels in NDI audio frame (" + std::to_string(channels) +
           "): at most 127 are carried, its sound is dropped\n";
  };
  const Case cases[] = {
      {127, {}, "127 Channels @ 48 kHz"},
      {128, {line(128)}, "128 Channels not supported"},
      {255, {line(255)}, "255 Channels not supported"},
      {256, {line(256)}, "256 Channels not supported"},
      {2, {}, "Stereo @ 48 kHz"},
      {256, {line(256)}, "256 Channels not supported"},
  };
  for (const Case& c : cases) {
    SCOPED_TRACE(c.channels);
    logs.Clear();
    const std::size_t requested = callbacks->Seen().audioRequests.size();
    MediaInfo info;
    for (int frame = 0; frame < 5; ++frame) EXPECT_EQ(Audio(AudioCapture(48000, c.channels, 4), &info), c.lines.empty());
    EXPECT_EQ(callbacks->Seen().audioRequests.size() - requested, c.lines.empty() ? 5u : 0u);
    EXPECT_EQ(logs.Lines(), c.lines);
    EXPECT_EQ(TaskNDISource::AudioStatusText(info), c.status);
  }
}

TEST_F(IntakeTest, AudioBufferSmallerThanTheFrameIsNotWrittenPast) {
  callbacks->OverrideAudioBytes(2 * 16 * 4 - 1);
  EXPECT_FALSE(Audio(AudioCapture(48000, 2, 16)));
  EXPECT_TRUE(logs.Contains("#ndisource: audio buffer too small for the NDI audio frame\n"));
  EXPECT_TRUE(callbacks->Seen().audioSent.empty());
  callbacks->SetDry(false, true);
  EXPECT_FALSE(Audio(AudioCapture(48000, 2, 16)));
  EXPECT_TRUE(logs.Contains("#ndisource: audio well ran dry\n"));
}

TEST_F(IntakeTest, TimestampsCountFromTheOldestFrameAcrossAudioAndVideo) {
  // 10,000,000 x 100 ns = 1 s = 705,600,000 ticks.
  ASSERT_TRUE(Video(VideoCapture(kNdiFourCCUYVY, 16, 4, 32, 50'000'000)));
  ASSERT_TRUE(Video(VideoCapture(kNdiFourCCUYVY, 16, 4, 32, 60'000'000)));
  ASSERT_TRUE(Audio(AudioCapture(48000, 2, 16, 55'000'000)));
  ASSERT_TRUE(Video(VideoCapture(kNdiFourCCUYVY, 16, 4, 32, 0)));  // no timestamp: time 0, base kept
  // Audio older than every video frame: new base for both, host clock reset.
  ASSERT_TRUE(Audio(AudioCapture(48000, 2, 16, 40'000'000)));
  ASSERT_TRUE(Video(VideoCapture(kNdiFourCCUYVY, 16, 4, 32, 40'000'001)));
  EXPECT_EQ(callbacks->Seen().calls, (std::vector<std::string>{
                                    "video request", "reset", "production 1", "video 0",
                                    "video request", "video 705600000",
                                    "audio request", "production 3", "audio 352800000",
                                    "video request", "video 0",
                                    "audio request", "reset", "audio 0",
                                    "video request", "video 70",
                                }));
}

TEST_F(IntakeTest, NewBaseOfADroppedFrameResetsTheHostWithTheNextDeliveredFrame) {
  ASSERT_TRUE(Video(VideoCapture(kNdiFourCCUYVY, 16, 4, 32, 50'000'000)));
  EXPECT_FALSE(Video(VideoCapture(kNdiFourCCI420, 16, 4, 16, 10'000'000)));  // takes the base, no reset yet
  EXPECT_EQ(callbacks->Count("reset"), 1);
  ASSERT_TRUE(Audio(AudioCapture(48000, 1, 16, 20'000'000)));
  const auto calls = callbacks->Seen().calls;
  EXPECT_EQ(std::vector<std::string>(calls.end() - 4, calls.end()),
            (std::vector<std::string>{"audio request", "reset", "production 3", "audio 705600000"}));
}

TEST_F(IntakeTest, FirstFrameOfEachKindReportsProductionOnceAndStartClearsIt) {
  ASSERT_TRUE(Audio(AudioCapture(48000, 2, 16)));
  ASSERT_TRUE(Audio(AudioCapture(48000, 2, 16)));
  ASSERT_TRUE(Video(VideoCapture(kNdiFourCCUYVY, 16, 4, 32)));
  ASSERT_TRUE(Video(VideoCapture(kNdiFourCCUYVY, 16, 4, 32)));
  EXPECT_EQ(callbacks->Count("production 2"), 1);
  EXPECT_EQ(callbacks->Count("production 3"), 1);
  EXPECT_EQ(source->ProducesMask(), 3u);
  source->Start();
  source->Stop();
  EXPECT_EQ(source->ProducesMask(), 0u);
  ASSERT_TRUE(Video(VideoCapture(kNdiFourCCUYVY, 16, 4, 32, 5)));
  EXPECT_EQ(callbacks->Count("production 1"), 1);
}

TEST(TicksFrom100ns, ConvertsExactlyAndSaturatesInsteadOfOverflowing) {
  EXPECT_EQ(TaskNDISource::TicksFrom100ns(10'000'000), 705'600'000);
  EXPECT_EQ(TaskNDISource::TicksFrom100ns(1), 70);    // 70.56 truncated
  EXPECT_EQ(TaskNDISource::TicksFrom100ns(-1), -70);  // toward zero
  EXPECT_EQ(TaskNDISource::TicksFrom100ns(std::numeric_limits<std::int64_t>::max()),
            std::numeric_limits<std::int64_t>::max());
}

TEST_F(IntakeTest, TimestampsFarApartDoNotOverflow) {
  ASSERT_TRUE(Video(VideoCapture(kNdiFourCCUYVY, 16, 4, 32, std::numeric_limits<std::int64_t>::min() + 1)));
  ASSERT_TRUE(Video(VideoCapture(kNdiFourCCUYVY, 16, 4, 32, std::numeric_limits<std::int64_t>::max())));
  EXPECT_EQ(callbacks->Seen().calls.back(), "video " + std::to_string(std::numeric_limits<std::int64_t>::max()));
}

}  // namespace
