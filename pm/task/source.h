#pragma once
// The interfaces a concrete source task implements (pm::Source,
// pm::SourceDiscovery) and the callbacks through which sources and discovery
// talk to the host. Declaration order is the virtual slot order; keep it.

#include <cstdint>
#include <memory>
#include <string>
#include <utility>
#include <vector>

#include <nlohmann/json.hpp>

#include "pm/shm/formats.h"
#include "pm/task/buffers.h"

namespace pm {

// The record that announces one available source.
struct SourceInfo {
  std::string uniqueId;
  std::string name;
  std::string categories;
  std::string analyticsSubType;
  std::string analyticsTertiaryType;
  std::uint32_t produces = 3;  // bit 0 video, bit 1 audio
  double maximumLatencySeconds = 1.0;
  std::string config;          // JSON text
};

class Source : public std::enable_shared_from_this<Source> {
 public:
  // What a source calls to reach the host. Which thread calls this: the
  // source's own thread (frames, clock, state) or a host request thread.
  class Callbacks {
   public:
    virtual ~Callbacks() = default;
    virtual void SetMaxVideoBuffers(std::int32_t count) = 0;
    virtual void SetMaxAudioBuffers(std::int32_t count) = 0;
    virtual void UpdateMaximumLatencySeconds(double seconds) = 0;
    virtual void SetFixedLatencySeconds(double seconds) = 0;
    virtual std::shared_ptr<VideoBuffer> RequestVideoBuffer(const VideoFormat& format, std::uint32_t minimumStride) = 0;
    virtual std::shared_ptr<AudioBuffer> RequestAudioBuffer(const AudioFormat& format, std::int32_t sampleCount) = 0;
    virtual void UpdateConfiguration(const std::string& configJson) = 0;
    virtual void UpdateGui(std::string guiJson, std::vector<std::string> widgets) = 0;
    virtual void UpdateProduction(std::uint32_t produces) = 0;
    virtual void TimestampReset() = 0;
    virtual void UpdateBuildOutDuration(std::int64_t ticks) = 0;
    virtual void UpdatePtzCommandSuite(const std::string& suite, const std::string& model) = 0;
    // Media times count 705,600,000 ticks per second.
    virtual std::int64_t CurrentTime() = 0;
    virtual std::int64_t AudioTime(std::int32_t sampleRate) = 0;
    // frameRate: frames in the low 16 bits, seconds in the high 16 bits.
    // Returns (media time, discontinuity).
    virtual std::pair<std::int64_t, bool> NextVideoTime(std::uint32_t frameRate) = 0;
    virtual void SendAudioBuffer(std::int64_t mediaTime, std::shared_ptr<AudioBuffer> buffer) = 0;
    virtual void SendVideoBuffer(std::int64_t mediaTime, std::shared_ptr<VideoBuffer> buffer) = 0;
    virtual void UpdateConnectionState(std::int32_t state) = 0;
    virtual void TriggerShutdown() = 0;
  };

  Source(std::shared_ptr<Callbacks> callbacks, std::string uniqueId)
      : callbacks_(std::move(callbacks)), uniqueId_(std::move(uniqueId)) {}
  virtual ~Source() = default;
  virtual void Start() {}
  virtual void Stop() {}
  virtual void SetConfiguration(std::string configJson) = 0;
  virtual std::string ValidateGui(std::string guiJson) = 0;
  virtual std::string GuiToConfiguration(std::string guiJson) = 0;
  virtual std::string ConfigurationToGui(std::string configJson) = 0;
  virtual void ExecuteCustomActionCommand(std::string /*command*/) {}
  virtual void ExecutePtzCommand(const nlohmann::json& /*request*/) {}
  virtual void HandleShotEvent(std::string /*event*/) {}
  virtual void SourceHotplugEvent() {}

  const std::shared_ptr<Callbacks>& GetCallbacks() const { return callbacks_; }
  const std::string& UniqueId() const { return uniqueId_; }

 private:
  std::shared_ptr<Callbacks> callbacks_;
  std::string uniqueId_;
};

class SourceDiscovery : public std::enable_shared_from_this<SourceDiscovery> {
 public:
  // Which thread calls this: the discovery's scan thread.
  class Callbacks {
   public:
    virtual ~Callbacks() = default;
    virtual void SourceAvailable(const SourceInfo& info) = 0;
    virtual void SourceUnavailable(const std::string& uniqueId) = 0;
  };

  explicit SourceDiscovery(std::shared_ptr<Callbacks> callbacks) : callbacks_(std::move(callbacks)) {}
  virtual ~SourceDiscovery() = default;
  virtual void Start() {}
  virtual void Stop() {}
  virtual void DiscoveryHotplugEvent() {}

  const std::shared_ptr<Callbacks>& GetCallbacks() const { return callbacks_; }

 protected:
  // Announces a source with the SourceInfo defaults (produces 3, latency 1.0).
  void AnnounceSource(const std::string& uniqueId, const std::string& name) {
    if (!callbacks_) return;
    SourceInfo info;
    info.uniqueId = uniqueId;
    info.name = name;
    callbacks_->SourceAvailable(info);
  }

 private:
  std::shared_ptr<Callbacks> callbacks_;
};

}  // namespace pm
