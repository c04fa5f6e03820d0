// The host's side of a source and of discovery: every notification's exact
// JSON, the buffer queue's announcement, buffer requests and their limits.
// (Holding a sent segment until its token returns is the queue's own test;
// the video record's contents reach the host in the whole-chain tests.)
#include <gtest/gtest.h>

#include <functional>

#include "pm/shm/formats.h"
#include "pm/task/callbacks.h"
#include "support/host_link.h"
#include "support/log_capture.h"
#include "support/video_format.h"

namespace {

using nlohmann::json;

constexpr const char* kId = "NDICaptureDevice~HOST (Cam 1)";

// A source's callbacks with the buffer queue open and a host reader on it.
class Callbacks : public ::testing::Test {
 protected:
  void SetUp() override {
    callbacks->OpenBufferQueue(link.Dispatcher(), kId);
    reader = std::make_unique<pmtest::QueueReader>(Next(std::string(kId) + "::start_queue")["port"].get<int>());
  }

  // The next `command` with its own keys only (the envelope is the dispatcher's).
  json Next(const std::string& command) {
    json message = link.ReadCommand(command).value_or(json::object());
    for (const char* key : {"pm::unique_id", "pm::command", "pm::request"}) message.erase(key);
    return message;
  }

  pmtest::HostLink link;
  std::shared_ptr<pm::SourceCallbacks> callbacks = std::make_shared<pm::SourceCallbacks>(link.Dispatcher(), kId);
  std::unique_ptr<pmtest::QueueReader> reader;
};

// Each notification carries exactly its keys (a float stays a float); a text
// that is not JSON goes as null.
TEST_F(Callbacks, NotificationsCarryExactlyTheirKeysAndTypes) {
  pm::DiscoveryCallbacks discovery(link.Dispatcher());
  pm::SourceInfo info;
  info.uniqueId = "NDICaptureDevice~A (b)";
  info.name = "A (b)";
  const struct {
    std::function<void()> call;
    const char* command;
    json payload;  // and the source's unique_id, unless it has one
  } cases[] = {
      {[&] { callbacks->UpdateMaximumLatencySeconds(0.25); }, "update_maximum_latency_seconds",
       {{"maximumLatencySeconds", 0.25}}},
      {[&] { callbacks->SetFixedLatencySeconds(2); }, "set_fixed_latency_seconds", {{"fixedLatencySeconds", 2.0}}},
      {[&] { callbacks->UpdateConfiguration("{\"bandwidth\":\"x\"}"); }, "update_configuration",
       {{"config", {{"bandwidth", "x"}}}}},
      {[&] { callbacks->UpdateGui("{\"a\":1}", {}); }, "update_gui", {{"gui", {{"a", 1}}}, {"widgets", json::array()}}},
      {[&] { callbacks->UpdateGui("not json", {"w1", "w2"}); }, "update_gui",
       {{"gui", nullptr}, {"widgets", {"w1", "w2"}}}},
      {[&] { callbacks->UpdateProduction(3); }, "update_production", {{"produces", 3u}}},
      {[&] { callbacks->UpdateBuildOutDuration(352800000); }, "update_build_out_duration", {{"duration", 352800000}}},
      {[&] { callbacks->UpdatePtzCommandSuite("NDI3", "Model X"); }, "update_ptz_command_suite",
       {{"suite", "NDI3"}, {"model", "Model X"}}},
      {[&] { callbacks->UpdateConnectionState(2); }, "update_connection_state", {{"state", 2}}},
      {[&] { callbacks->TriggerShutdown(); }, "trigger_shutdown", json::object()},
      {[&] { callbacks->TimestampReset(); }, "timestamp_reset", json::object()},
      {[&] { discovery.SourceAvailable(info); }, "source_available",
       {{"unique_id", "NDICaptureDevice~A (b)"}, {"name", "A (b)"}, {"categories", ""}, {"analyticsSubType", ""},
        {"analyticsTertiaryType", ""}, {"produces", 3u}, {"config", nullptr}, {"maximumLatencySeconds", 1.0}}},
      {[&] { discovery.SourceUnavailable("NDICaptureDevice~A (b)"); }, "source_unavailable",
       {{"unique_id", "NDICaptureDevice~A (b)"}}},
  };
  for (const auto& c : cases) {
    c.call();
    json want = c.payload;
    if (!want.contains("unique_id")) want["unique_id"] = kId;
    // Compared as text, where 2.0 and 2 differ.
    EXPECT_EQ(Next(std::string("pm::tsrc::") + c.command).dump(), want.dump()) << c.command;
  }
}

// Sized from channels, sample code and count; unknown codes, no samples, a
// channel byte that reads negative (128 and up) and sizes past 32 bits are
// refused before the pool (where a negative minimum would match the free
// segment the first request left).
TEST_F(Callbacks, AudioRequestsAreSizedOrRefusedBeforeThePool) {
  const struct {
    std::uint32_t code;
    int channels;
    std::int32_t samples;
    std::int64_t bytes;  // 0: refused
  } cases[] = {
      {pm::kCodeFl32, 2, 480, 3840},      {pm::kCodeSowt, 2, 480, 1920},         {pm::kCodeFl32, 127, 100, 127 * 100 * 4},
      {pm::FourCC('a', 'b', 'c', 'd'), 2, 480, 0}, {pm::kCodeFl32, 2, 0, 0},    {pm::kCodeFl32, 128, 480, 0},
      {pm::kCodeFl32, 200, 480, 0},       {pm::kCodeFl32, 255, 480, 0},          {pm::kCodeFl32, 127, 0x7FFFFFFF, 0},
  };
  for (const auto& c : cases) {
    auto buffer = callbacks->RequestAudioBuffer({c.code, 48000, static_cast<std::uint8_t>(c.channels)}, c.samples);
    EXPECT_EQ(buffer ? buffer->ByteSize() : 0, c.bytes) << c.channels << " x " << c.samples;
  }
  EXPECT_EQ(callbacks->AudioBufferCount(), 2);
}

TEST_F(Callbacks, VideoRequests_JpegNeedsAByteSizeAndGetsStrideOne) {
  pm::VideoFormat jpeg = pmtest::VideoFormatOf(pm::kCodeJpeg, 640, 480);
  pmtest::LogCapture capture;
  EXPECT_EQ(callbacks->RequestVideoBuffer(jpeg, 0), nullptr);
  EXPECT_EQ(capture.Lines(), (std::vector<std::string>{"Compressed buffer must have bytesize\n"}));
  jpeg.byteSize = 1000;
  auto buffer = callbacks->RequestVideoBuffer(jpeg, 0);
  ASSERT_TRUE(buffer);
  EXPECT_EQ(buffer->MapData().second, 1);
  buffer->UnmapData();
}

TEST_F(Callbacks, VideoRequests_StopCreatingSegmentsAtTheLimit) {
  callbacks->SetMaxVideoBuffers(2);
  pm::VideoFormat format = pmtest::VideoFormatOf(pm::kCode2vuy, 64, 64);
  auto a = callbacks->RequestVideoBuffer(format, 0);
  auto b = callbacks->RequestVideoBuffer(format, 0);
  ASSERT_TRUE(a && b);
  EXPECT_EQ(callbacks->RequestVideoBuffer(format, 0), nullptr);
  a.reset();  // unsent: its segment is free again at once
  EXPECT_NE(callbacks->RequestVideoBuffer(format, 0), nullptr);
}

// A video buffer of some other kind than the queue's.
struct ForeignVideoBuffer : pm::VideoBuffer {
  pm::VideoPlanes Planes() override { return {}; }
  std::pair<std::uint8_t*, std::int32_t> MapData() override { return {nullptr, 0}; }
  void UnmapData() override {}
  pm::VideoFormat Format() const override { return {}; }
};

TEST_F(Callbacks, VideoSends_OfForeignBuffersAreIgnored) {
  callbacks->SendVideoBuffer(0, std::make_shared<ForeignVideoBuffer>());
  callbacks->SendVideoBuffer(0, nullptr);
  std::uint32_t token;
  std::uint8_t record[60];
  EXPECT_FALSE(reader->ReadRecord(&token, record, 200));
}

TEST_F(Callbacks, AudioSends_FeedTheMediaClock) {
  callbacks->SendAudioBuffer(0, callbacks->RequestAudioBuffer({pm::kCodeFl32, 48000, 2}, 48000));
  EXPECT_EQ(callbacks->AudioTime(48000), 705600000);  // one second
}

}  // namespace
