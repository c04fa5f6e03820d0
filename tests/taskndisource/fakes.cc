#include "fakes.h"

#include <algorithm>
#include <atomic>

namespace nditest {

TaskNDISource::LoopEnvironment TestEnvironment::Make(std::chrono::milliseconds stopTimeout,
                                                     std::function<void()> onExit) const {
  TaskNDISource::LoopEnvironment env;
  env.clock = clock;
  env.stopTimeout = stopTimeout;
  auto counter = exits;
  env.exitProcess = [counter, onExit] {
    ++*counter;
    if (onExit) onExit();
  };
  return env;
}

FakeVideoBuffer::FakeVideoBuffer(const pm::VideoFormat& format) : format_(format) {
  memory.resize(static_cast<std::size_t>(RowBytes()) * static_cast<std::size_t>(Rows()));
}

std::int32_t FakeVideoBuffer::RowBytes() const {
  if (format_.code == pm::kCodeRgba) return format_.width * 4;
  if (format_.code == pm::kCode2vuy || format_.code == pm::kCodeYuvs) return format_.width * 2;
  if (format_.code == pm::kCodeNV12) return format_.width;
  return 0;
}

std::int32_t FakeVideoBuffer::Rows() const {
  return format_.code == pm::kCodeNV12 ? format_.height + format_.height / 2 : format_.height;
}

pm::VideoPlanes FakeVideoBuffer::Planes() {
  pm::VideoPlanes planes;
  planes.planeCount = 1;
  planes.plane[0] = pm::Plane{memory.data(), Rows(), RowBytes()};
  return planes;
}

std::pair<std::uint8_t*, std::int32_t> FakeVideoBuffer::MapData() { return {memory.data(), RowBytes()}; }

void FakeVideoBuffer::CopyFrame(const std::uint8_t* source, std::int32_t sourceStride) {
  ++copies;
  copiedStride = sourceStride;
  const std::int32_t row = RowBytes();
  for (std::int32_t r = 0; r < Rows(); ++r) {
    std::memcpy(memory.data() + static_cast<std::ptrdiff_t>(r) * row,
                source + static_cast<std::ptrdiff_t>(r) * sourceStride, static_cast<std::size_t>(row));
  }
}

FakeAudioBuffer::FakeAudioBuffer(const pm::AudioFormat& format, std::int32_t samples, std::int64_t bytes)
    : format_(format), samples_(samples) {
  memory.resize(static_cast<std::size_t>(bytes));
}

void FakeAudioBuffer::Fill(std::function<void(void*, std::int64_t)> fill) {
  fill(memory.data(), static_cast<std::int64_t>(memory.size()));
}

std::vector<float> FakeAudioBuffer::Samples() const {
  std::vector<float> samples(memory.size() / sizeof(float));
  std::memcpy(samples.data(), memory.data(), samples.size() * sizeof(float));
  return samples;
}

void FakeCallbacks::Note(std::string call) {
  std::lock_guard<std::mutex> guard(mutex_);
  heard_.calls.push_back(std::move(call));
}

std::shared_ptr<pm::VideoBuffer> FakeCallbacks::RequestVideoBuffer(const pm::VideoFormat& format, std::uint32_t) {
  std::lock_guard<std::mutex> guard(mutex_);
  heard_.videoRequests.push_back(format);
  heard_.calls.push_back("video request");
  if (videoDry_) return nullptr;
  return std::make_shared<FakeVideoBuffer>(overrideVideo_ ? videoOverride_ : format);
}

std::shared_ptr<pm::AudioBuffer> FakeCallbacks::RequestAudioBuffer(const pm::AudioFormat& format,
                                                                   std::int32_t sampleCount) {
  std::lock_guard<std::mutex> guard(mutex_);
  heard_.audioRequests.emplace_back(format, sampleCount);
  heard_.calls.push_back("audio request");
  if (audioDry_) return nullptr;
  const std::int64_t bytes =
      audioBytes_ >= 0 ? audioBytes_ : std::int64_t{format.channels} * sampleCount * static_cast<std::int64_t>(sizeof(float));
  return std::make_shared<FakeAudioBuffer>(format, sampleCount, bytes);
}

void FakeCallbacks::UpdateGui(std::string guiJson, std::vector<std::string> widgets) {
  std::lock_guard<std::mutex> guard(mutex_);
  heard_.guis.push_back(guiJson);
  heard_.calls.push_back(widgets.empty() ? "gui" : "gui with widgets");
}

void FakeCallbacks::SendAudioBuffer(std::int64_t mediaTime, std::shared_ptr<pm::AudioBuffer> buffer) {
  std::lock_guard<std::mutex> guard(mutex_);
  heard_.audioSent.push_back(std::static_pointer_cast<FakeAudioBuffer>(buffer));
  heard_.calls.push_back("audio " + std::to_string(mediaTime));
}

void FakeCallbacks::SendVideoBuffer(std::int64_t mediaTime, std::shared_ptr<pm::VideoBuffer> buffer) {
  std::lock_guard<std::mutex> guard(mutex_);
  heard_.videoSent.push_back(std::static_pointer_cast<FakeVideoBuffer>(buffer));
  heard_.calls.push_back("video " + std::to_string(mediaTime));
}

void FakeCallbacks::UpdateConnectionState(std::int32_t state) {
  std::lock_guard<std::mutex> guard(mutex_);
  heard_.states.push_back(state);
  heard_.calls.push_back("state " + std::to_string(state));
}

void FakeCallbacks::SetDry(bool video, bool audio) {
  std::lock_guard<std::mutex> guard(mutex_);
  videoDry_ = video;
  audioDry_ = audio;
}

void FakeCallbacks::OverrideVideoFormat(const pm::VideoFormat& format) {
  std::lock_guard<std::mutex> guard(mutex_);
  overrideVideo_ = true;
  videoOverride_ = format;
}

void FakeCallbacks::OverrideAudioBytes(std::int64_t bytes) {
  std::lock_guard<std::mutex> guard(mutex_);
  audioBytes_ = bytes;
}

Heard FakeCallbacks::Seen() {
  std::lock_guard<std::mutex> guard(mutex_);
  return heard_;
}

int FakeCallbacks::Count(const std::string& call) {
  std::lock_guard<std::mutex> guard(mutex_);
  return static_cast<int>(std::count(heard_.calls.begin(), heard_.calls.end(), call));
}

void FakeDiscoveryCallbacks::SourceAvailable(const pm::SourceInfo& info) {
  std::lock_guard<std::mutex> guard(mutex_);
  seen_.calls.push_back("+" + info.uniqueId + " " + info.name);
  seen_.infos.push_back(info);
}

void FakeDiscoveryCallbacks::SourceUnavailable(const std::string& uniqueId) {
  std::lock_guard<std::mutex> guard(mutex_);
  seen_.calls.push_back("-" + uniqueId);
}

Announced FakeDiscoveryCallbacks::Seen() {
  std::lock_guard<std::mutex> guard(mutex_);
  return seen_;
}

}  // namespace nditest
