#pragma once
// The harness of the NDI source and discovery tests.
//
// ScriptedNdi: an NdiApi table of plain functions that act on the ScriptedNdi
// currently installed (one per test, reached through a process-wide atomic
// pointer), so a test decides what the finder lists, what each capture
// returns, whether tally and metadata sends succeed, and reads back every call
// the task made. Every member is guarded by its one mutex: the receiver or
// scan thread calls the table while the test thread scripts and inspects.
//
// FakeCallbacks: the host's side of a source, noting every call in order as
// text ("state 1", "reset", "production 3", "video 1234", "audio 0",
// "buildout 352800000", "ptz NDI3/Model", "gui"), with buffers over plain
// memory. TestEnvironment: a loop environment on the manual clock; a loop that
// misses the stop deadline aborts the test binary at once (production ends
// the process the same way).

#include <algorithm>
#include <atomic>
#include <chrono>
#include <condition_variable>
#include <cstdint>
#include <cstdlib>
#include <cstring>
#include <deque>
#include <functional>
#include <map>
#include <memory>
#include <mutex>
#include <optional>
#include <sstream>
#include <string>
#include <vector>

#include "pm/shm/formats.h"
#include "pm/task/source.h"
#include "support/manual_clock.h"
#include "taskndisource/loop_environment.h"
#include "taskndisource/ndi_api.h"

namespace nditest {

struct TestEnvironment {
  std::shared_ptr<pmtest::ManualClock> clock = std::make_shared<pmtest::ManualClock>();
  TaskNDISource::LoopEnvironment Make() const { return {clock, std::chrono::seconds(5), [] { std::abort(); }}; }
};

// One result of recv_capture_v2, with storage for the data it points at.
struct Capture {
  std::int32_t type = kNdiFrameNone;
  ndi_video_frame_v2 video{};
  ndi_audio_frame_v2 audio{};
  ndi_metadata_frame metadata{};
  std::vector<std::uint8_t> bytes;  // what video.data / audio.data / metadata.data point into
};

// A video frame of `height` lines of `stride` bytes (plus chroma lines for
// NV12), byte (row * 7 + column) & 0xFF, at 30000/1001.
inline std::shared_ptr<Capture> VideoCapture(std::uint32_t fourcc, int width, int height, int stride,
                                             std::int64_t timestamp = 0, bool progressive = true) {
  auto capture = std::make_shared<Capture>();
  capture->type = kNdiFrameVideo;
  const int rows = fourcc == kNdiFourCCNV12 ? height + height / 2 : height;
  const std::size_t size = stride > 0 && rows > 0 ? static_cast<std::size_t>(stride) * rows : 0;
  capture->bytes.resize(size);
  for (std::size_t i = 0; i < size; ++i) {
    capture->bytes[i] = static_cast<std::uint8_t>(i / static_cast<std::size_t>(stride) * 7 + i % static_cast<std::size_t>(stride));
  }
  capture->video = {width, height, fourcc, 30000, 1001, 0.0f,
                    progressive ? kNdiFrameFormatProgressive : kNdiFrameFormatInterleaved, 0,
                    size > 0 ? capture->bytes.data() : nullptr, stride, nullptr, timestamp};
  return capture;
}
// The frame every state test delivers.
inline std::shared_ptr<Capture> AnyVideo() { return VideoCapture(kNdiFourCCUYVY, 16, 4, 32); }

// Planar float audio: sample s of channel c is c * 1000 + s.
inline std::shared_ptr<Capture> AudioCapture(int rate, int channels, int samples, std::int64_t timestamp = 0) {
  auto capture = std::make_shared<Capture>();
  capture->type = kNdiFrameAudio;
  const std::size_t count = channels > 0 && samples > 0 ? static_cast<std::size_t>(channels) * samples : 0;
  capture->bytes.resize(count * sizeof(float));
  for (std::size_t i = 0; i < count; ++i) {
    const float value = static_cast<float>(i / static_cast<std::size_t>(samples) * 1000 + i % static_cast<std::size_t>(samples));
    std::memcpy(capture->bytes.data() + i * 4, &value, 4);
  }
  capture->audio = {rate, channels, samples, 0, count > 0 ? reinterpret_cast<float*>(capture->bytes.data()) : nullptr,
                    samples * 4, nullptr, timestamp};
  return capture;
}

// A metadata frame of `text` followed by its terminating zero (length counts
// it), or a result of `type` without a frame.
inline std::shared_ptr<Capture> MetadataCapture(const std::string& text, std::int32_t type = kNdiFrameMetadata) {
  auto capture = std::make_shared<Capture>();
  capture->type = type;
  capture->bytes.assign(text.begin(), text.end());
  capture->bytes.push_back(0);
  capture->metadata.length = static_cast<int>(capture->bytes.size());
  capture->metadata.data = reinterpret_cast<char*>(capture->bytes.data());
  return capture;
}

struct ReceiverCreated {
  std::string name;
  std::string url;
  std::int32_t colorFormat = 0;
  std::int32_t bandwidth = 0;
  bool allowFields = true;
  bool operator==(const ReceiverCreated&) const = default;
};

// A sender as the finder lists it (either text may be null); the texts must
// outlive the test.
using Entry = ndi_source;

// What the task did to the runtime, as one snapshot.
struct Observed {
  int findersCreated = 0;
  int findersDestroyed = 0;
  int maxLiveFinders = 0;  // most finders alive at one time
  int listCalls = 0;
  std::vector<ReceiverCreated> receivers;
  int receiversDestroyed = 0;
  std::vector<ndi_tally> tallies;
  // Every send tried, as its text without the zero its length must count.
  std::vector<std::string> metadataSent;
  std::vector<std::string> ptzCalls;      // "zoom(0.5)", "recall_preset(3,1)", ...
  int captures = 0;          // calls, with or without a frame to hand out
  bool freesMatched = true;  // every frame handed out was freed, each once
};

class ScriptedNdi {
 public:
  // Installs this object as the one the table's functions act on.
  ScriptedNdi() {
    if (installed_.exchange(this) != nullptr) std::abort();  // two at once
  }
  ~ScriptedNdi() { installed_.store(nullptr); }

  // The table: every entry a source or a discovery calls (the library calls
  // are the task's).
  std::shared_ptr<const TaskNDISource::NdiApi> Api() const;
  Observed Seen() {
    std::lock_guard<std::mutex> guard(mutex_);
    Observed seen = seen_;
    seen.freesMatched = seen_.freesMatched && handedOut_.empty();
    return seen;
  }

  // Script.
  void SetSources(std::vector<Entry> entries) { Edit([&] { entries_ = std::move(entries); }); }
  // Making a "finder" or a "receiver" fails; "" for neither.
  void FailCreate(std::string what) { Edit([&] { failing_ = std::move(what); }); }
  void SetConnections(int count) { Edit([&] { connections_ = count; }); }
  void SetTallyResult(bool ok) { Edit([&] { tallyOk_ = ok; }); }
  void SetMetadataResult(bool ok) { Edit([&] { metadataOk_ = ok; }); }
  void SetPtzSupported(bool supported) { Edit([&] { ptzSupported_ = supported; }); }
  // Captures are handed out in order; with none queued a capture waits up to
  // a millisecond (real time) and returns "none". While blocked, a capture
  // waits until unblocked.
  void Push(std::shared_ptr<nditest::Capture> capture) { Edit([&] { queue_.push_back(std::move(capture)); }); }
  void BlockCapture(bool block) { Edit([&] { block_ = block; }); }

 private:
  static inline std::atomic<ScriptedNdi*> installed_{nullptr};
  // Runs `act` on the installed object under its lock (a table used after its
  // test ended aborts).
  template <typename Act>
  static auto Locked(Act act) {
    std::lock_guard<std::mutex> guard(Current().mutex_);
    return act(Current());
  }
  static ScriptedNdi& Current() {
    if (installed_.load() == nullptr) std::abort();
    return *installed_.load();
  }
  template <typename Fn>
  void Edit(Fn edit) {
    std::lock_guard<std::mutex> guard(mutex_);
    edit();
    changed_.notify_all();
  }
  static std::int32_t Take(ndi_video_frame_v2* video, ndi_audio_frame_v2* audio, ndi_metadata_frame* metadata) {
    ScriptedNdi& n = Current();
    std::unique_lock<std::mutex> lock(n.mutex_);
    ++n.seen_.captures;
    n.changed_.wait(lock, [&] { return !n.block_; });
    if (n.queue_.empty()) n.changed_.wait_for(lock, std::chrono::milliseconds(1), [&] { return !n.queue_.empty(); });
    if (n.queue_.empty()) return kNdiFrameNone;
    std::shared_ptr<nditest::Capture> capture = n.queue_.front();
    n.queue_.pop_front();
    const void* data = nullptr;
    if (capture->type == kNdiFrameVideo) data = (*video = capture->video).data;
    if (capture->type == kNdiFrameAudio) data = (*audio = capture->audio).data;
    if (capture->type == kNdiFrameMetadata) data = (*metadata = capture->metadata).data;
    if (data != nullptr) n.handedOut_[data] = capture;
    return capture->type;
  }
  static void Free(const void* data) {
    Locked([&](ScriptedNdi& n) { n.seen_.freesMatched &= n.handedOut_.erase(data) == 1; });
  }
  // Records "name(a,b)" as a PTZ call.
  template <typename... Args>
  static bool Ptz(const char* name, Args... args) {
    std::ostringstream call;
    call << name << '(';
    [[maybe_unused]] const char* separator = "";
    ((call << separator << args, separator = ","), ...);
    Locked([&](ScriptedNdi& n) { n.seen_.ptzCalls.push_back(call.str() + ")"); });
    return true;
  }

  std::mutex mutex_;  // guards everything below
  std::condition_variable changed_;
  Observed seen_;
  std::vector<Entry> entries_;
  std::vector<ndi_source> list_;  // handed out by the finder, valid until its next list
  std::string failing_;
  int connections_ = 1;
  bool tallyOk_ = true;
  bool metadataOk_ = true;
  bool ptzSupported_ = false;
  std::deque<std::shared_ptr<nditest::Capture>> queue_;
  std::map<const void*, std::shared_ptr<nditest::Capture>> handedOut_;
  bool block_ = false;
};

class FakeVideoBuffer : public pm::VideoBuffer {
 public:
  explicit FakeVideoBuffer(const pm::VideoFormat& format)
      : format_(format), memory(static_cast<std::size_t>(pm::FrameSize(format, 0))) {}
  // The host buffer's own copy (CopyFrame) lays the picture out over plain
  // memory, one row of the format each, so reading past a short frame shows.
  pm::VideoPlanes Planes() override { return pm::LayoutPlanes(format_, memory.data(), 0); }
  std::pair<std::uint8_t*, std::int32_t> MapData() override { return {nullptr, 0}; }
  void UnmapData() override {}
  pm::VideoFormat Format() const override { return format_; }

  pm::VideoFormat format_;
  std::vector<std::uint8_t> memory;
};

class FakeAudioBuffer : public pm::AudioBuffer {
 public:
  FakeAudioBuffer(const pm::AudioFormat& format, std::int32_t samples, std::int64_t bytes)
      : format_(format), samples_(samples), memory(static_cast<std::size_t>(bytes)) {}
  pm::AudioFormat Format() const override { return format_; }
  std::int32_t SampleCount() const override { return samples_; }
  void Fill(std::function<void(void*, std::int64_t)> fill) override { fill(memory.data(), ByteSize()); }
  std::int64_t ByteSize() const override { return static_cast<std::int64_t>(memory.size()); }

  pm::AudioFormat format_;
  std::int32_t samples_;
  std::vector<std::uint8_t> memory;
};

// Every call the source made, in order, and what came with it.
struct Heard {
  std::vector<std::string> calls;
  std::vector<std::int32_t> states;
  std::vector<std::string> guis;
  std::vector<std::shared_ptr<FakeVideoBuffer>> videoSent;
  std::vector<std::shared_ptr<FakeAudioBuffer>> audioSent;
};

// Also a discovery's callbacks, noting "+id name" and "-id".
class FakeCallbacks : public pm::Source::Callbacks, public pm::SourceDiscovery::Callbacks {
  // Notes `call` (unless empty) and runs `with`, under the lock.
  template <typename With = void (*)(Heard&)>
  auto Note(const std::string& call, With with = [](Heard&) {}) {
    std::lock_guard<std::mutex> guard(mutex_);
    if (!call.empty()) heard_.calls.push_back(call);
    return with(heard_);
  }

 public:
  void SetMaxVideoBuffers(std::int32_t) override {}
  void SetMaxAudioBuffers(std::int32_t) override {}
  void UpdateMaximumLatencySeconds(double) override {}
  void SetFixedLatencySeconds(double) override {}
  std::shared_ptr<pm::VideoBuffer> RequestVideoBuffer(const pm::VideoFormat& format, std::uint32_t) override {
    return Note("video request", [&](Heard&) { return std::make_shared<FakeVideoBuffer>(videoOverride_.value_or(format)); });
  }
  std::shared_ptr<pm::AudioBuffer> RequestAudioBuffer(const pm::AudioFormat& format, std::int32_t count) override {
    return Note("audio request", [&](Heard&) -> std::shared_ptr<pm::AudioBuffer> {
      if (audioBytes_ && *audioBytes_ < 0) return nullptr;
      return std::make_shared<FakeAudioBuffer>(format, count, audioBytes_.value_or(std::int64_t{format.channels} * count * 4));
    });
  }
  void UpdateConfiguration(const std::string&) override {}
  void UpdateGui(std::string guiJson, std::vector<std::string> widgets) override {
    Note(widgets.empty() ? "gui" : "gui with widgets", [&](Heard& h) { h.guis.push_back(guiJson); });
  }
  void UpdateProduction(std::uint32_t produces) override { Note("production " + std::to_string(produces)); }
  void TimestampReset() override { Note("reset"); }
  void UpdateBuildOutDuration(std::int64_t ticks) override { Note("buildout " + std::to_string(ticks)); }
  void UpdatePtzCommandSuite(const std::string& suite, const std::string& model) override {
    Note("ptz " + suite + "/" + model);
  }
  std::int64_t CurrentTime() override { return 0; }
  std::int64_t AudioTime(std::int32_t) override { return 0; }
  std::pair<std::int64_t, bool> NextVideoTime(std::uint32_t) override { return {0, false}; }
  void SendAudioBuffer(std::int64_t time, std::shared_ptr<pm::AudioBuffer> buffer) override {
    Note("audio " + std::to_string(time),
         [&](Heard& h) { h.audioSent.push_back(std::static_pointer_cast<FakeAudioBuffer>(buffer)); });
  }
  void SendVideoBuffer(std::int64_t time, std::shared_ptr<pm::VideoBuffer> buffer) override {
    Note("video " + std::to_string(time),
         [&](Heard& h) { h.videoSent.push_back(std::static_pointer_cast<FakeVideoBuffer>(buffer)); });
  }
  void UpdateConnectionState(std::int32_t state) override {
    Note("state " + std::to_string(state), [&](Heard& h) { h.states.push_back(state); });
  }
  void TriggerShutdown() override {}
  void SourceAvailable(const pm::SourceInfo& info) override { Note("+" + info.uniqueId + " " + info.name); }
  void SourceUnavailable(const std::string& uniqueId) override { Note("-" + uniqueId); }

  // Script: the next video buffers of this format; audio buffers of this byte
  // size (none when negative).
  void OverrideVideoFormat(const pm::VideoFormat& format) { Note("", [&](Heard&) { videoOverride_ = format; }); }
  void OverrideAudioBytes(std::int64_t bytes) { Note("", [&](Heard&) { audioBytes_ = bytes; }); }

  Heard Seen() { return Note("", [](Heard& h) { return h; }); }
  int Count(const std::string& call) {
    return Note("", [&](Heard& h) { return static_cast<int>(std::count(h.calls.begin(), h.calls.end(), call)); });
  }

 private:
  std::mutex mutex_;  // guards everything below
  Heard heard_;
  std::optional<pm::VideoFormat> videoOverride_;
  std::optional<std::int64_t> audioBytes_;
};

// --- The table ---------------------------------------------------------------

inline std::shared_ptr<const TaskNDISource::NdiApi> ScriptedNdi::Api() const {
  auto api = std::make_shared<TaskNDISource::NdiApi>();
  api->find_create_v2 = [](const ndi_find_create* settings) {
    return Locked([&](ScriptedNdi& n) -> void* {
      if (n.failing_ == "finder" || settings == nullptr || !settings->show_local_sources) return nullptr;
      ++n.seen_.findersCreated;
      n.seen_.maxLiveFinders = std::max(n.seen_.maxLiveFinders, n.seen_.findersCreated - n.seen_.findersDestroyed);
      return &n;  // any handle will do
    });
  };
  api->find_get_current_sources = [](void*, std::uint32_t* count) {
    return Locked([&](ScriptedNdi& n) -> const ndi_source* {
      ++n.seen_.listCalls;
      n.list_ = n.entries_;
      *count = static_cast<std::uint32_t>(n.list_.size());
      return n.list_.empty() ? nullptr : n.list_.data();
    });
  };
  api->find_destroy = [](void*) { Locked([](ScriptedNdi& n) { ++n.seen_.findersDestroyed; }); };
  api->recv_create_v2 = [](const ndi_recv_create* s) {
    return Locked([&](ScriptedNdi& n) -> void* {
      if (n.failing_ == "receiver") return nullptr;
      const ndi_source& to = s->source_to_connect_to;
      n.seen_.receivers.push_back(ReceiverCreated{to.ndi_name ? to.ndi_name : "", to.url_address ? to.url_address : "",
                                                  s->color_format, s->bandwidth, s->allow_video_fields});
      return &n;  // any handle will do
    });
  };
  api->recv_destroy = [](void*) { Locked([](ScriptedNdi& n) { ++n.seen_.receiversDestroyed; }); };
  api->recv_get_no_connections = [](void*) { return Locked([](ScriptedNdi& n) { return n.connections_; }); };
  api->recv_capture_v2 = [](void*, ndi_video_frame_v2* v, ndi_audio_frame_v2* a, ndi_metadata_frame* m,
                            std::uint32_t) { return Take(v, a, m); };
  api->recv_free_video_v2 = [](void*, const ndi_video_frame_v2* v) { Free(v->data); };
  api->recv_free_audio_v2 = [](void*, const ndi_audio_frame_v2* a) { Free(a->data); };
  api->recv_free_metadata = [](void*, const ndi_metadata_frame* m) { Free(m->data); };
  api->recv_set_tally = [](void*, const ndi_tally* t) {
    return Locked([&](ScriptedNdi& n) {
      n.seen_.tallies.push_back(*t);
      return n.tallyOk_;
    });
  };
  api->recv_send_metadata = [](void*, const ndi_metadata_frame* m) {
    return Locked([&](ScriptedNdi& n) {
      const bool counted = m->length > 0 && m->data[m->length - 1] == '\0';
      n.seen_.metadataSent.push_back(counted ? std::string(m->data, std::size_t(m->length) - 1) : "(length wrong)");
      return n.metadataOk_;
    });
  };
  api->recv_ptz_is_supported = [](void*) { return Locked([](ScriptedNdi& n) { return n.ptzSupported_; }); };
  api->recv_ptz_recall_preset = [](void*, int preset, float speed) { return Ptz("recall_preset", preset, speed); };
  api->recv_ptz_store_preset = [](void*, int preset) { return Ptz("store_preset", preset); };
  api->recv_ptz_pan_tilt = [](void*, float p, float t) { return Ptz("pan_tilt", p, t); };
  api->recv_ptz_pan_tilt_speed = [](void*, float p, float t) { return Ptz("pan_tilt_speed", p, t); };
  api->recv_ptz_zoom = [](void*, float z) { return Ptz("zoom", z); };
  api->recv_ptz_focus = [](void*, float f) { return Ptz("focus", f); };
  api->recv_ptz_focus_speed = [](void*, float f) { return Ptz("focus_speed", f); };
  api->recv_ptz_auto_focus = [](void*) { return Ptz("auto_focus"); };
  api->recv_ptz_exposure_auto = [](void*) { return Ptz("exposure_auto"); };
  api->recv_ptz_exposure_manual = [](void*, float l) { return Ptz("exposure_manual", l); };
  api->recv_ptz_white_balance_auto = [](void*) { return Ptz("white_balance_auto"); };
  api->recv_ptz_white_balance_indoor = [](void*) { return Ptz("white_balance_indoor"); };
  api->recv_ptz_white_balance_outdoor = [](void*) { return Ptz("white_balance_outdoor"); };
  api->recv_ptz_white_balance_oneshot = [](void*) { return Ptz("white_balance_oneshot"); };
  api->recv_ptz_white_balance_manual = [](void*, float r, float b) { return Ptz("white_balance_manual", r, b); };
  api->util_audio_to_interleaved_32f_v2 = [](const ndi_audio_frame_v2* src, ndi_audio_frame_interleaved_32f* dst) {
    for (int s = 0; s < src->no_samples; ++s) {
      for (int c = 0; c < src->no_channels; ++c) {
        std::memcpy(&dst->data[std::ptrdiff_t{s} * src->no_channels + c],
                    reinterpret_cast<const std::uint8_t*>(src->data) + std::ptrdiff_t{c} * src->channel_stride_in_bytes + s * 4, 4);
      }
    }
  };
  return api;
}

}  // namespace nditest
