#pragma once
// The host's side of a source and of discovery: every call of a source or a
// discovery becomes a notification on the request dispatcher of the
// connection that created it, and SourceCallbacks also owns the source's
// shared-memory buffer queue and its media clock.
//
// Notifications are fire-and-forget: RpcRequest with a 10 s timeout and no
// callback; the result is not looked at, so a source thread never blocks on
// the host. Payload keys are written in the JSON library's sorted order.
//
// Which thread calls this: a source calls the notifications, the clock and
// the buffer operations from its own frame thread; discovery from its scan
// thread; OpenBufferQueue runs on a host request thread before the source
// starts. Buffers handed out refer to this object without owning it: drop
// them before the callbacks object.

#include <cstdint>
#include <memory>
#include <string>
#include <vector>

#include "pm/task/media_clock.h"
#include "pm/task/source.h"

namespace pm {

class RpcDispatcher;
class SharedMemoryQueueProducer;

inline constexpr std::int64_t kNotificationTimeoutMs = 10000;

class SourceCallbacks : public Source::Callbacks {
 public:
  static constexpr std::int32_t kDefaultMaxVideoBuffers = 240;
  static constexpr std::int32_t kDefaultMaxAudioBuffers = 3840;

  // `clock` drives the media clock (the steady clock when none is given).
  SourceCallbacks(std::shared_ptr<RpcDispatcher> dispatcher, std::string sourceId,
                  std::shared_ptr<Clock> clock = nullptr);
  ~SourceCallbacks() override;

  void SetMaxVideoBuffers(std::int32_t count) override { maxVideoBuffers_ = count; }
  void SetMaxAudioBuffers(std::int32_t count) override { maxAudioBuffers_ = count; }
  void UpdateMaximumLatencySeconds(double seconds) override;
  void SetFixedLatencySeconds(double seconds) override;
  std::shared_ptr<VideoBuffer> RequestVideoBuffer(const VideoFormat& format, std::uint32_t minimumStride) override;
  std::shared_ptr<AudioBuffer> RequestAudioBuffer(const AudioFormat& format, std::int32_t sampleCount) override;
  void UpdateConfiguration(const std::string& configJson) override;
  void UpdateGui(std::string guiJson, std::vector<std::string> widgets) override;
  void UpdateProduction(std::uint32_t produces) override;
  void TimestampReset() override;
  void UpdateBuildOutDuration(std::int64_t ticks) override;
  void UpdatePtzCommandSuite(const std::string& suite, const std::string& model) override;
  std::int64_t CurrentTime() override { return clock_.CurrentTime(); }
  std::int64_t AudioTime(std::int32_t sampleRate) override { return clock_.AudioTime(sampleRate); }
  std::pair<std::int64_t, bool> NextVideoTime(std::uint32_t frameRate) override {
    return clock_.NextVideoTime(frameRate);
  }
  void SendAudioBuffer(std::int64_t mediaTime, std::shared_ptr<AudioBuffer> buffer) override;
  void SendVideoBuffer(std::int64_t mediaTime, std::shared_ptr<VideoBuffer> buffer) override;
  void UpdateConnectionState(std::int32_t state) override;
  void TriggerShutdown() override;

  // Announces the source's shared-memory pool to the host: the request
  // "<sourceId>::start_queue" with "port" and "memoryBase" (a fresh 22
  // character short id). Resets the segment creation counters.
  void OpenBufferQueue(std::shared_ptr<RpcDispatcher> dispatcher, const std::string& sourceId);

  const std::shared_ptr<SharedMemoryQueueProducer>& Producer() const { return producer_; }
  std::int32_t VideoBufferCount() const { return videoBufferCount_; }
  std::int32_t AudioBufferCount() const { return audioBufferCount_; }

  // The largest byte count one segment may hold; larger requests are refused.
  static constexpr std::int64_t kMaxSegmentBytes = 0x7FFFFFFF;

 private:
  void Notify(const char* command, nlohmann::json payload);

  std::shared_ptr<SharedMemoryQueueProducer> producer_;
  std::shared_ptr<RpcDispatcher> dispatcher_;
  std::string sourceId_;
  // Segment creation counters and limits: used by the source's frame thread only.
  std::int32_t videoBufferCount_ = 0;
  std::int32_t audioBufferCount_ = 0;
  std::int32_t maxVideoBuffers_ = kDefaultMaxVideoBuffers;
  std::int32_t maxAudioBuffers_ = kDefaultMaxAudioBuffers;
  MediaClock clock_;
};

class DiscoveryCallbacks : public SourceDiscovery::Callbacks {
 public:
  explicit DiscoveryCallbacks(std::shared_ptr<RpcDispatcher> dispatcher);
  void SourceAvailable(const SourceInfo& info) override;
  void SourceUnavailable(const std::string& uniqueId) override;

 private:
  std::shared_ptr<RpcDispatcher> dispatcher_;
};

}  // namespace pm
