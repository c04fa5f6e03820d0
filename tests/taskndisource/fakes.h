#pragma once
// Test doubles for the NDI source and discovery: a loop environment on the
// manual clock, host callbacks that record every call, and buffers over plain
// memory.

#include <atomic>
#include <chrono>
#include <functional>
#include <condition_variable>
#include <cstdint>
#include <cstring>
#include <memory>
#include <mutex>
#include <string>
#include <vector>

#include "pm/task/source.h"
#include "support/manual_clock.h"
#include "taskndisource/loop_environment.h"

namespace nditest {

// A loop environment on `clock`, with a stop deadline and an exit hook that
// counts instead of ending the process.
struct TestEnvironment {
  std::shared_ptr<pmtest::ManualClock> clock = std::make_shared<pmtest::ManualClock>();
  std::shared_ptr<std::atomic<int>> exits = std::make_shared<std::atomic<int>>(0);
  TaskNDISource::LoopEnvironment Make(std::chrono::milliseconds stopTimeout = std::chrono::seconds(5),
                                      std::function<void()> onExit = nullptr) const;
};

class FakeVideoBuffer : public pm::VideoBuffer {
 public:
  explicit FakeVideoBuffer(const pm::VideoFormat& format);
  pm::VideoPlanes Planes() override;
  std::pair<std::uint8_t*, std::int32_t> MapData() override;
  void UnmapData() override {}
  pm::VideoFormat Format() const override { return format_; }
  // Copies height rows (and NV12's chroma rows) of one row of the format
  // each, as the host buffer does, so reading past a short frame shows.
  void CopyFrame(const std::uint8_t* source, std::int32_t sourceStride) override;

  std::int32_t RowBytes() const;
  std::int32_t Rows() const;
  pm::VideoFormat format_;
  std::vector<std::uint8_t> memory;
  int copies = 0;
  std::int32_t copiedStride = 0;
};

class FakeAudioBuffer : public pm::AudioBuffer {
 public:
  FakeAudioBuffer(const pm::AudioFormat& format, std::int32_t samples, std::int64_t bytes);
  pm::AudioFormat Format() const override { return format_; }
  std::int32_t SampleCount() const override { return samples_; }
  void Fill(std::function<void(void*, std::int64_t)> fill) override;
  std::int64_t ByteSize() const override { return static_cast<std::int64_t>(memory.size()); }

  std::vector<float> Samples() const;
  pm::AudioFormat format_;
  std::int32_t samples_;
  std::vector<std::uint8_t> memory;
};

// Every call the source made, in order, as text ("state 1", "reset",
// "production 3", "video 1234", "audio 0", "buildout 352800000",
// "ptz NDI3/Model", "gui"), and what came with it.
struct Heard {
  std::vector<std::string> calls;
  std::vector<std::int32_t> states;
  std::vector<std::string> guis;
  std::vector<pm::VideoFormat> videoRequests;
  std::vector<std::pair<pm::AudioFormat, std::int32_t>> audioRequests;
  std::vector<std::shared_ptr<FakeVideoBuffer>> videoSent;
  std::vector<std::shared_ptr<FakeAudioBuffer>> audioSent;
};

class FakeCallbacks : public pm::Source::Callbacks {
 public:
  void SetMaxVideoBuffers(std::int32_t) override {}
  void SetMaxAudioBuffers(std::int32_t) override {}
  void UpdateMaximumLatencySeconds(double) override {}
  void SetFixedLatencySeconds(double) override {}
  std::shared_ptr<pm::VideoBuffer> RequestVideoBuffer(const pm::VideoFormat& format, std::uint32_t minimumStride) override;
  std::shared_ptr<pm::AudioBuffer> RequestAudioBuffer(const pm::AudioFormat& format, std::int32_t sampleCount) override;
  void UpdateConfiguration(const std::string&) override {}
  void UpdateGui(std::string guiJson, std::vector<std::string> widgets) override;
  void UpdateProduction(std::uint32_t produces) override { Note("production " + std::to_string(produces)); }
  void TimestampReset() override { Note("reset"); }
  void UpdateBuildOutDuration(std::int64_t ticks) override { Note("buildout " + std::to_string(ticks)); }
  void UpdatePtzCommandSuite(const std::string& suite, const std::string& model) override {
    Note("ptz " + suite + "/" + model);
  }
  std::int64_t CurrentTime() override { return 0; }
  std::int64_t AudioTime(std::int32_t) override { return 0; }
  std::pair<std::int64_t, bool> NextVideoTime(std::uint32_t) override { return {0, false}; }
  void SendAudioBuffer(std::int64_t mediaTime, std::shared_ptr<pm::AudioBuffer> buffer) override;
  void SendVideoBuffer(std::int64_t mediaTime, std::shared_ptr<pm::VideoBuffer> buffer) override;
  void UpdateConnectionState(std::int32_t state) override;
  void TriggerShutdown() override {}

  // Script.
  void SetDry(bool video, bool audio);
  // The next buffers come with this format / this byte size instead.
  void OverrideVideoFormat(const pm::VideoFormat& format);
  void OverrideAudioBytes(std::int64_t bytes);

  Heard Seen();
  int Count(const std::string& call);

 private:
  void Note(std::string call);

  std::mutex mutex_;  // guards everything below
  Heard heard_;
  bool videoDry_ = false;
  bool audioDry_ = false;
  bool overrideVideo_ = false;
  pm::VideoFormat videoOverride_;
  std::int64_t audioBytes_ = -1;
};

// Discovery announcements in order ("+id name", "-id") and the infos given.
struct Announced {
  std::vector<std::string> calls;
  std::vector<pm::SourceInfo> infos;
};

class FakeDiscoveryCallbacks : public pm::SourceDiscovery::Callbacks {
 public:
  void SourceAvailable(const pm::SourceInfo& info) override;
  void SourceUnavailable(const std::string& uniqueId) override;
  Announced Seen();

 private:
  std::mutex mutex_;  // guards seen_
  Announced seen_;
};

}  // namespace nditest
