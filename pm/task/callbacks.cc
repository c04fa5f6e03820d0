#include "pm/task/callbacks.h"

#include <utility>

#include "pm/ipc/dispatcher.h"
#include "pm/runtime/ids.h"
#include "pm/runtime/json.h"
#include "pm/runtime/log.h"
#include "pm/shm/queue_record.h"
#include "pm/shm/shared_memory.h"
#include "pm/shm/shared_memory_queue.h"

namespace pm {
namespace {

using Json = nlohmann::json;
using ReleaseSegment = std::function<void(const std::shared_ptr<SharedMemory>&)>;

// A video buffer over one segment of the source's queue. Unsent, it gives its
// segment's hold back when destroyed; sent, the hold travels with the record.
class SourceVideoBuffer final : public VideoBuffer {
 public:
  SourceVideoBuffer(ReleaseSegment release, const VideoFormat& format, std::shared_ptr<SharedMemory> segment)
      : releaseSegment(std::move(release)), format(format), segment(std::move(segment)) {}
  ~SourceVideoBuffer() override {
    if (!sent && releaseSegment) releaseSegment(segment);
  }

  VideoPlanes Planes() override {
    const auto [data, stride] = segment->Lock();
    return LayoutPlanes(format, data, stride);
  }
  std::pair<std::uint8_t*, std::int32_t> MapData() override { return segment->Lock(); }
  void UnmapData() override { segment->Unlock(); }
  VideoFormat Format() const override { return format; }

  ReleaseSegment releaseSegment;
  const VideoFormat format;
  const std::shared_ptr<SharedMemory> segment;
  bool sent = false;
};

class SourceAudioBuffer final : public AudioBuffer {
 public:
  SourceAudioBuffer(ReleaseSegment release, const AudioFormat& format, std::shared_ptr<SharedMemory> segment,
                    std::int32_t sampleCount)
      : releaseSegment(std::move(release)), format(format), segment(std::move(segment)), sampleCount(sampleCount) {}
  ~SourceAudioBuffer() override {
    if (!sent && releaseSegment) releaseSegment(segment);
  }

  AudioFormat Format() const override { return format; }
  std::int32_t SampleCount() const override { return sampleCount; }
  std::int64_t ByteSize() const override {
    return std::int64_t{static_cast<std::int8_t>(format.channels)} * sampleCount * BytesPerSample(format.code);
  }
  void Fill(std::function<void(void*, std::int64_t)> fill) override {
    const auto mapped = segment->Lock();
    if (mapped.first != nullptr && fill) fill(mapped.first, ByteSize());
    segment->Unlock();
  }

  ReleaseSegment releaseSegment;
  const AudioFormat format;
  const std::shared_ptr<SharedMemory> segment;
  const std::int32_t sampleCount;
  bool sent = false;
};

}  // namespace

SourceCallbacks::SourceCallbacks(std::shared_ptr<RpcDispatcher> dispatcher, std::string sourceId,
                                 std::shared_ptr<Clock> clock)
    : producer_(std::make_shared<SharedMemoryQueueProducer>()),
      dispatcher_(std::move(dispatcher)),
      sourceId_(std::move(sourceId)),
      clock_(std::move(clock)) {}

SourceCallbacks::~SourceCallbacks() = default;

void SourceCallbacks::Notify(const char* command, Json payload) {
  payload["unique_id"] = sourceId_;
  if (dispatcher_) dispatcher_->RpcRequest(command, payload, kNotificationTimeoutMs, {});
}

void SourceCallbacks::UpdateMaximumLatencySeconds(double seconds) {
  Notify("pm::tsrc::update_maximum_latency_seconds", {{"maximumLatencySeconds", seconds}});
}

void SourceCallbacks::SetFixedLatencySeconds(double seconds) {
  Notify("pm::tsrc::set_fixed_latency_seconds", {{"fixedLatencySeconds", seconds}});
}

void SourceCallbacks::UpdateConfiguration(const std::string& configJson) {
  Notify("pm::tsrc::update_configuration", {{"config", pmjson::Parse(configJson, "UpdateConfiguration")}});
}

void SourceCallbacks::UpdateGui(std::string guiJson, std::vector<std::string> widgets) {
  Json payload = Json::object();
  payload["gui"] = pmjson::Parse(guiJson, "UpdateGui");
  payload["widgets"] = Json::array();
  for (auto& widget : widgets) payload["widgets"].push_back(std::move(widget));
  Notify("pm::tsrc::update_gui", std::move(payload));
}

void SourceCallbacks::UpdateProduction(std::uint32_t produces) {
  Notify("pm::tsrc::update_production", {{"produces", produces}});
}

void SourceCallbacks::TimestampReset() {
  clock_.Reset();
  Notify("pm::tsrc::timestamp_reset", Json::object());
}

void SourceCallbacks::UpdateBuildOutDuration(std::int64_t ticks) {
  Notify("pm::tsrc::update_build_out_duration", {{"duration", ticks}});
}

void SourceCallbacks::UpdatePtzCommandSuite(const std::string& suite, const std::string& model) {
  Notify("pm::tsrc::update_ptz_command_suite", {{"suite", suite}, {"model", model}});
}

void SourceCallbacks::UpdateConnectionState(std::int32_t state) {
  Notify("pm::tsrc::update_connection_state", {{"state", state}});
}

void SourceCallbacks::TriggerShutdown() { Notify("pm::tsrc::trigger_shutdown", Json::object()); }

void SourceCallbacks::OpenBufferQueue(std::shared_ptr<RpcDispatcher> dispatcher, const std::string& sourceId) {
  videoBufferCount_ = 0;
  audioBufferCount_ = 0;
  producer_->StartQueue(std::move(dispatcher), sourceId, NewShortId(), {});
}

std::shared_ptr<VideoBuffer> SourceCallbacks::RequestVideoBuffer(const VideoFormat& format,
                                                                 std::uint32_t minimumStride) {
  const auto getSegment = [&](bool reuseOnly) -> std::shared_ptr<SharedMemory> {
    if (format.code != kCodeJpeg) return producer_->AllocateVideoBuffer(format, minimumStride, reuseOnly);
    if (format.byteSize == 0) {
      LogText("", "Compressed buffer must have bytesize\n");
      return nullptr;
    }
    std::shared_ptr<SharedMemory> segment;
    if (reuseOnly) {
      segment = producer_->FindFreeBuffer(format.byteSize);
    } else {
      producer_->DeleteSmallestFreeBuffer();
      segment = producer_->AllocateCpuBuffer(format.byteSize);
    }
    if (segment) segment->descriptor.stride = 1;
    return segment;
  };

  std::shared_ptr<SharedMemory> segment = getSegment(true);
  if (!segment && format.code == kCodeJpeg && format.byteSize == 0) return nullptr;
  if (!segment && videoBufferCount_ < maxVideoBuffers_) {
    segment = getSegment(false);
    if (segment) ++videoBufferCount_;
  }
  if (!segment) return nullptr;
  std::weak_ptr<SharedMemoryQueueProducer> producer = producer_;
  auto release = [producer](const std::shared_ptr<SharedMemory>& s) {
    if (auto p = producer.lock()) p->ReturnBuffer(s);
  };
  return std::make_shared<SourceVideoBuffer>(std::move(release), format, std::move(segment));
}

std::shared_ptr<AudioBuffer> SourceCallbacks::RequestAudioBuffer(const AudioFormat& format,
                                                                 std::int32_t sampleCount) {
  // The channel byte is signed where sizes are computed: 128 to 255 channels
  // give a negative size, which is refused like 0. The product is formed in
  // 64 bits, so it cannot overflow, and a size beyond one segment is refused.
  const std::int64_t size =
      std::int64_t{static_cast<std::int8_t>(format.channels)} * BytesPerSample(format.code) * sampleCount;
  if (size <= 0 || size > kMaxSegmentBytes) return nullptr;

  std::shared_ptr<SharedMemory> segment = producer_->FindFreeBuffer(static_cast<std::uint64_t>(size));
  if (!segment && audioBufferCount_ < maxAudioBuffers_) {
    segment = producer_->AllocateCpuBuffer(static_cast<std::uint64_t>(size));
    ++audioBufferCount_;
  }
  if (!segment) return nullptr;
  std::weak_ptr<SharedMemoryQueueProducer> producer = producer_;
  auto release = [producer](const std::shared_ptr<SharedMemory>& s) {
    if (auto p = producer.lock()) p->ReturnBuffer(s);
  };
  return std::make_shared<SourceAudioBuffer>(std::move(release), format, std::move(segment), sampleCount);
}

void SourceCallbacks::SendVideoBuffer(std::int64_t mediaTime, std::shared_ptr<VideoBuffer> buffer) {
  auto* video = dynamic_cast<SourceVideoBuffer*>(buffer.get());
  if (video == nullptr) return;
  if (video->segment->IsLocked()) LogText("", "Source has outstanding mapping while sending buffer\n");
  VideoPayload payload;
  payload.mediaTime = mediaTime;
  payload.format = video->format;
  video->sent = true;
  // A refused record keeps its hold with the buffer, which gives it back.
  if (!producer_->SendBuffer(video->segment, payload)) video->sent = false;
}

void SourceCallbacks::SendAudioBuffer(std::int64_t mediaTime, std::shared_ptr<AudioBuffer> buffer) {
  auto* audio = dynamic_cast<SourceAudioBuffer*>(buffer.get());
  if (audio == nullptr) return;
  AudioPayload payload;
  payload.mediaTime = mediaTime;
  payload.code = audio->format.code;
  payload.samples = audio->sampleCount;
  payload.sampleRate = audio->format.sampleRate;
  payload.channels = audio->format.channels;
  clock_.AudioSent(audio->sampleCount);
  audio->sent = true;
  if (!producer_->SendBuffer(audio->segment, payload)) audio->sent = false;
}

DiscoveryCallbacks::DiscoveryCallbacks(std::shared_ptr<RpcDispatcher> dispatcher)
    : dispatcher_(std::move(dispatcher)) {}

void DiscoveryCallbacks::SourceAvailable(const SourceInfo& info) {
  Json payload = {
      {"unique_id", info.uniqueId},
      {"name", info.name},
      {"categories", info.categories},
      {"analyticsSubType", info.analyticsSubType},
      {"analyticsTertiaryType", info.analyticsTertiaryType},
      {"produces", info.produces},
      {"config", pmjson::Parse(info.config, "SourceAvailable")},
      {"maximumLatencySeconds", info.maximumLatencySeconds},
  };
  if (dispatcher_) dispatcher_->RpcRequest("pm::tsrc::source_available", payload, kNotificationTimeoutMs, {});
}

void DiscoveryCallbacks::SourceUnavailable(const std::string& uniqueId) {
  Json payload = {{"unique_id", uniqueId}};
  if (dispatcher_) dispatcher_->RpcRequest("pm::tsrc::source_unavailable", payload, kNotificationTimeoutMs, {});
}

}  // namespace pm
