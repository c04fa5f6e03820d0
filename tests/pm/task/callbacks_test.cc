// The host's side of a source and of discovery: every notification's exact
// JSON, the buffer queue's announcement, buffer requests and their limits,
// holds of sent and unsent buffers.
#include <gtest/gtest.h>

#include <cstring>

#include "pm/shm/shared_memory_queue.h"
#include "pm/task/callbacks.h"
#include "support/host_link.h"
#include "support/log_capture.h"
#include "support/wait.h"

namespace {

using nlohmann::json;

// The command's own keys of a notification: the envelope removed.
json Payload(json message) {
  message.erase("pm::unique_id");
  message.erase("pm::command");
  message.erase("pm::request");
  return message;
}

struct Fixture {
  pmtest::HostLink link;
  std::shared_ptr<pm::SourceCallbacks> callbacks =
      std::make_shared<pm::SourceCallbacks>(link.Dispatcher(), "NDICaptureDevice~HOST (Cam 1)");

  json Next(const std::string& command) {
    auto message = link.ReadCommand(command);
    EXPECT_TRUE(message.has_value()) << command;
    if (!message) return nullptr;
    EXPECT_EQ((*message)["pm::request"], true);
    EXPECT_TRUE((*message)["pm::unique_id"].is_number_unsigned());
    return Payload(*message);
  }

  // Opens the queue and connects a host reader to it.
  std::unique_ptr<pmtest::QueueReader> OpenQueue() {
    callbacks->OpenBufferQueue(link.Dispatcher(), "NDICaptureDevice~HOST (Cam 1)");
    json start = Next("NDICaptureDevice~HOST (Cam 1)::start_queue");
    return std::make_unique<pmtest::QueueReader>(start["port"].get<int>());
  }
};

// A source's callbacks with the buffer queue open and a host reader on it.
class QueueTest : public ::testing::Test, public Fixture {
 protected:
  void SetUp() override { reader = OpenQueue(); }
  std::unique_ptr<pmtest::QueueReader> reader;
};

pm::VideoFormat Video(std::uint32_t code, int width, int height) {
  pm::VideoFormat format;
  format.code = code;
  format.width = static_cast<std::int16_t>(width);
  format.height = static_cast<std::int16_t>(height);
  return format;
}

TEST(SourceNotifications, CarryExactlyTheirKeysAndTypes) {
  Fixture f;
  const std::string id = "NDICaptureDevice~HOST (Cam 1)";
  f.callbacks->UpdateMaximumLatencySeconds(0.25);
  EXPECT_EQ(f.Next("pm::tsrc::update_maximum_latency_seconds"),
            json({{"unique_id", id}, {"maximumLatencySeconds", 0.25}}));
  f.callbacks->SetFixedLatencySeconds(2);
  json fixed = f.Next("pm::tsrc::set_fixed_latency_seconds");
  EXPECT_TRUE(fixed["fixedLatencySeconds"].is_number_float());
  f.callbacks->UpdateConfiguration("{\"bandwidth\":\"x\"}");
  EXPECT_EQ(f.Next("pm::tsrc::update_configuration"),
            json({{"unique_id", id}, {"config", {{"bandwidth", "x"}}}}));
  f.callbacks->UpdateConfiguration("");
  EXPECT_EQ(f.Next("pm::tsrc::update_configuration"), json({{"unique_id", id}, {"config", nullptr}}));
  f.callbacks->UpdateGui("{\"a\":1}", {});
  EXPECT_EQ(f.Next("pm::tsrc::update_gui"),
            json({{"unique_id", id}, {"gui", {{"a", 1}}}, {"widgets", json::array()}}));
  f.callbacks->UpdateGui("not json", {"w1", "w2"});
  EXPECT_EQ(f.Next("pm::tsrc::update_gui"),
            json({{"unique_id", id}, {"gui", nullptr}, {"widgets", {"w1", "w2"}}}));
  f.callbacks->UpdateProduction(3);
  json production = f.Next("pm::tsrc::update_production");
  EXPECT_EQ(production["produces"], 3);
  f.callbacks->UpdateBuildOutDuration(352800000);
  EXPECT_EQ(f.Next("pm::tsrc::update_build_out_duration"), json({{"unique_id", id}, {"duration", 352800000}}));
  f.callbacks->UpdatePtzCommandSuite("NDI3", "Model X");
  EXPECT_EQ(f.Next("pm::tsrc::update_ptz_command_suite"),
            json({{"unique_id", id}, {"suite", "NDI3"}, {"model", "Model X"}}));
  f.callbacks->UpdateConnectionState(2);
  EXPECT_EQ(f.Next("pm::tsrc::update_connection_state"), json({{"unique_id", id}, {"state", 2}}));
  f.callbacks->TriggerShutdown();
  EXPECT_EQ(f.Next("pm::tsrc::trigger_shutdown"), json({{"unique_id", id}}));
  f.callbacks->TimestampReset();
  EXPECT_EQ(f.Next("pm::tsrc::timestamp_reset"), json({{"unique_id", id}}));
}

TEST(DiscoveryNotifications, AnnounceAndWithdrawSources) {
  pmtest::HostLink link;
  pm::DiscoveryCallbacks callbacks(link.Dispatcher());
  pm::SourceInfo info;
  info.uniqueId = "NDICaptureDevice~A (b)";
  info.name = "A (b)";
  callbacks.SourceAvailable(info);
  auto available = link.ReadCommand("pm::tsrc::source_available");
  ASSERT_TRUE(available);
  json expected = {{"unique_id", "NDICaptureDevice~A (b)"}, {"name", "A (b)"}, {"categories", ""},
                   {"analyticsSubType", ""}, {"analyticsTertiaryType", ""}, {"produces", 3u},
                   {"config", nullptr}, {"maximumLatencySeconds", 1.0}};
  EXPECT_EQ(Payload(*available), expected);
  EXPECT_TRUE((*available)["produces"].is_number_unsigned());
  EXPECT_TRUE((*available)["maximumLatencySeconds"].is_number_float());
  callbacks.SourceUnavailable("NDICaptureDevice~A (b)");
  auto gone = link.ReadCommand("pm::tsrc::source_unavailable");
  ASSERT_TRUE(gone);
  EXPECT_EQ(Payload(*gone), json({{"unique_id", "NDICaptureDevice~A (b)"}}));
}

TEST_F(QueueTest, AudioRequests_AreSizedFromChannelsSampleCodeAndCount) {
  auto buffer = callbacks->RequestAudioBuffer({pm::kCodeFl32, 48000, 2}, 480);
  ASSERT_TRUE(buffer);
  EXPECT_EQ(buffer->ByteSize(), 3840);
  auto pcm = callbacks->RequestAudioBuffer({pm::kCodeSowt, 48000, 2}, 480);
  ASSERT_TRUE(pcm);
  EXPECT_EQ(pcm->ByteSize(), 1920);
  EXPECT_EQ(callbacks->RequestAudioBuffer({pm::FourCC('a', 'b', 'c', 'd'), 48000, 2}, 480), nullptr);
  EXPECT_EQ(callbacks->RequestAudioBuffer({pm::kCodeFl32, 48000, 2}, 0), nullptr);
  EXPECT_EQ(callbacks->RequestAudioBuffer({pm::kCodeFl32, 48000, 127}, 100)->ByteSize(), 127 * 100 * 4);
}

TEST_F(QueueTest, AudioRequests_NegativeOrOverflowingSizesNeverReachThePool) {
  // A free segment is in the pool: a negative minimum would match it.
  callbacks->RequestAudioBuffer({pm::kCodeFl32, 48000, 2}, 480).reset();
  for (int channels : {128, 200, 255}) {
    EXPECT_EQ(callbacks->RequestAudioBuffer({pm::kCodeFl32, 48000, static_cast<std::uint8_t>(channels)}, 480),
              nullptr)
        << channels;
  }
  // 127 x 4 x 2^31-1 does not fit 32 bits; it is refused, not wrapped.
  EXPECT_EQ(callbacks->RequestAudioBuffer({pm::kCodeFl32, 48000, 127}, 0x7FFFFFFF), nullptr);
  EXPECT_EQ(callbacks->AudioBufferCount(), 1);
}

TEST_F(QueueTest, VideoRequests_JpegNeedsAByteSizeAndGetsStrideOne) {
  pm::VideoFormat jpeg = Video(pm::kCodeJpeg, 640, 480);
  {
    pmtest::LogCapture capture;
    EXPECT_EQ(callbacks->RequestVideoBuffer(jpeg, 0), nullptr);
    EXPECT_EQ(capture.Lines(), (std::vector<std::string>{"Compressed buffer must have bytesize\n"}));
  }
  jpeg.byteSize = 1000;
  auto buffer = callbacks->RequestVideoBuffer(jpeg, 0);
  ASSERT_TRUE(buffer);
  EXPECT_EQ(buffer->MapData().second, 1);
  buffer->UnmapData();
}

TEST_F(QueueTest, VideoRequests_StopCreatingSegmentsAtTheLimit) {
  callbacks->SetMaxVideoBuffers(2);
  pm::VideoFormat format = Video(pm::kCode2vuy, 64, 64);
  auto a = callbacks->RequestVideoBuffer(format, 0);
  auto b = callbacks->RequestVideoBuffer(format, 0);
  ASSERT_TRUE(a && b);
  EXPECT_EQ(callbacks->RequestVideoBuffer(format, 0), nullptr);
  a.reset();  // unsent: its segment is free again at once
  EXPECT_NE(callbacks->RequestVideoBuffer(format, 0), nullptr);
}

TEST_F(QueueTest, VideoSends_HoldTheSegmentUntilTheHostReturnsTheToken) {
  callbacks->SetMaxVideoBuffers(1);
  pm::VideoFormat format = Video(pm::kCode2vuy, 64, 64);
  format.scan = 'P';
  auto buffer = callbacks->RequestVideoBuffer(format, 0);
  ASSERT_TRUE(buffer);
  std::vector<std::uint8_t> picture(64 * 2 * 64, 0x5A);
  buffer->CopyFrame(picture.data(), 128);
  // A record sent before the host's connection arrived would be released at once.
  ASSERT_TRUE(pmtest::WaitFor([&] { return callbacks->Producer()->HostConnected(); }));
  callbacks->SendVideoBuffer(123456789, buffer);
  buffer.reset();
  std::uint32_t token = 0;
  std::uint8_t record[60];
  ASSERT_TRUE(reader->ReadRecord(&token, record));
  std::int64_t time = 0;
  std::memcpy(&time, record + 24, 8);
  EXPECT_EQ(time, 123456789);
  EXPECT_EQ(std::memcmp(record + 32, &format, sizeof format), 0);
  EXPECT_EQ(callbacks->RequestVideoBuffer(format, 0), nullptr);  // still held, limit reached
  reader->ReturnToken(token);
  EXPECT_TRUE(pmtest::WaitFor([&] { return callbacks->RequestVideoBuffer(format, 0) != nullptr; }));
}

TEST_F(QueueTest, VideoSends_WhileMappedLogTheOutstandingMappingAndStillSend) {
  pm::VideoFormat format = Video(pm::kCodeRgba, 16, 16);
  auto buffer = callbacks->RequestVideoBuffer(format, 0);
  ASSERT_TRUE(buffer);
  buffer->MapData();
  pmtest::LogCapture capture;
  callbacks->SendVideoBuffer(0, buffer);
  EXPECT_EQ(capture.Count("Source has outstanding mapping while sending buffer"), 1);
  buffer->UnmapData();
}

class ForeignVideoBuffer : public pm::VideoBuffer {
 public:
  pm::VideoPlanes Planes() override { return {}; }
  std::pair<std::uint8_t*, std::int32_t> MapData() override { return {nullptr, 0}; }
  void UnmapData() override {}
  pm::VideoFormat Format() const override { return {}; }
};

TEST_F(QueueTest, VideoSends_OfForeignBuffersAreIgnored) {
  callbacks->SendVideoBuffer(0, std::make_shared<ForeignVideoBuffer>());
  callbacks->SendVideoBuffer(0, nullptr);
  std::uint32_t token;
  std::uint8_t record[60];
  EXPECT_FALSE(reader->ReadRecord(&token, record, 200));
}

TEST_F(QueueTest, AudioSends_FeedTheMediaClock) {
  for (int i = 0; i < 30; ++i) {
    auto buffer = callbacks->RequestAudioBuffer({pm::kCodeFl32, 48000, 2}, 1600);
    ASSERT_TRUE(buffer);
    callbacks->SendAudioBuffer(callbacks->AudioTime(48000), buffer);
  }
  EXPECT_EQ(callbacks->AudioTime(48000), 705600000);
}

}  // namespace
