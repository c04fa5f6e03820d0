#include "scripted_ndi.h"

#include <algorithm>
#include <atomic>
#include <chrono>
#include <cstdio>
#include <cstring>
#include <stdexcept>

namespace nditest {

namespace {

std::atomic<ScriptedNdi*> g_current{nullptr};

ScriptedNdi& Current() {
  ScriptedNdi* current = g_current.load();
  if (current == nullptr) std::abort();  // a table used after its test ended
  return *current;
}

std::string Text(float value) {
  char text[32];
  std::snprintf(text, sizeof text, "%g", static_cast<double>(value));
  return text;
}
std::string Text(int value) { return std::to_string(value); }

// Records "name(a,b)" as a PTZ call.
template <typename... Args>
bool PtzCall(const char* name, Args... args) {
  std::string call = std::string(name) + "(";
  [[maybe_unused]] const char* separator = "";
  ((call += separator + Text(args), separator = ","), ...);
  return Current().Ptz(call + ")");
}

void Interleave(const ndi_audio_frame_v2* src, ndi_audio_frame_interleaved_32f* dst) {
  for (int s = 0; s < src->no_samples; ++s) {
    for (int c = 0; c < src->no_channels; ++c) {
      const auto* channel = reinterpret_cast<const std::uint8_t*>(src->data) +
                            static_cast<std::ptrdiff_t>(c) * src->channel_stride_in_bytes;
      float sample;
      std::memcpy(&sample, channel + static_cast<std::ptrdiff_t>(s) * 4, 4);
      dst->data[static_cast<std::ptrdiff_t>(s) * src->no_channels + c] = sample;
    }
  }
}

}  // namespace

std::shared_ptr<Capture> VideoCapture(std::uint32_t fourcc, int width, int height, int stride, std::int64_t timestamp,
                                      bool progressive) {
  auto capture = std::make_shared<Capture>();
  capture->type = kNdiFrameVideo;
  const int rows = fourcc == kNdiFourCCNV12 ? height + height / 2 : height;
  const std::size_t size = stride > 0 && rows > 0 ? static_cast<std::size_t>(stride) * rows : 0;
  capture->bytes.resize(size);
  for (std::size_t i = 0; i < size; ++i) {
    const std::size_t row = i / static_cast<std::size_t>(stride);
    const std::size_t column = i % static_cast<std::size_t>(stride);
    capture->bytes[i] = static_cast<std::uint8_t>(row * 7 + column);
  }
  capture->video.xres = width;
  capture->video.yres = height;
  capture->video.FourCC = fourcc;
  capture->video.frame_rate_N = 30000;
  capture->video.frame_rate_D = 1001;
  capture->video.frame_format_type = progressive ? kNdiFrameFormatProgressive : kNdiFrameFormatInterleaved;
  capture->video.data = size > 0 ? capture->bytes.data() : nullptr;
  capture->video.line_stride_in_bytes = stride;
  capture->video.timestamp = timestamp;
  return capture;
}

std::shared_ptr<Capture> AudioCapture(int rate, int channels, int samples, std::int64_t timestamp) {
  auto capture = std::make_shared<Capture>();
  capture->type = kNdiFrameAudio;
  const std::size_t count = channels > 0 && samples > 0 ? static_cast<std::size_t>(channels) * samples : 0;
  capture->bytes.resize(count * sizeof(float));
  for (int c = 0; c < channels; ++c) {
    for (int s = 0; s < samples; ++s) {
      const float value = static_cast<float>(c * 1000 + s);
      std::memcpy(capture->bytes.data() + (static_cast<std::size_t>(c) * samples + s) * 4, &value, 4);
    }
  }
  capture->audio.sample_rate = rate;
  capture->audio.no_channels = channels;
  capture->audio.no_samples = samples;
  capture->audio.data = count > 0 ? reinterpret_cast<float*>(capture->bytes.data()) : nullptr;
  capture->audio.channel_stride_in_bytes = samples * 4;
  capture->audio.timestamp = timestamp;
  return capture;
}

std::shared_ptr<Capture> MetadataCapture(const std::string& text) {
  auto capture = std::make_shared<Capture>();
  capture->type = kNdiFrameMetadata;
  capture->bytes.assign(text.begin(), text.end());
  capture->bytes.push_back(0);
  capture->metadata.length = static_cast<int>(capture->bytes.size());
  capture->metadata.data = reinterpret_cast<char*>(capture->bytes.data());
  return capture;
}

std::shared_ptr<Capture> TypeOnly(std::int32_t type) {
  auto capture = std::make_shared<Capture>();
  capture->type = type;
  return capture;
}

ScriptedNdi::ScriptedNdi() {
  ScriptedNdi* expected = nullptr;
  if (!g_current.compare_exchange_strong(expected, this)) throw std::logic_error("two ScriptedNdi at once");
}

ScriptedNdi::~ScriptedNdi() { g_current.store(nullptr); }

std::shared_ptr<const TaskNDISource::NdiApi> ScriptedNdi::Api() const {
  auto api = std::make_shared<TaskNDISource::NdiApi>();
  api->is_supported_CPU = [] { return true; };
  api->initialize = [] { return true; };
  api->version = [] { return "scripted"; };
  api->destroy = [] {};
  api->find_create_v2 = [](const ndi_find_create* s) { return Current().FindCreate(s); };
  api->find_get_current_sources = [](void* f, std::uint32_t* count) { return Current().FindList(f, count); };
  api->find_destroy = [](void* f) { Current().FindDestroy(f); };
  api->recv_create_v2 = [](const ndi_recv_create* s) { return Current().RecvCreate(s); };
  api->recv_destroy = [](void* r) { Current().RecvDestroy(r); };
  api->recv_get_no_connections = [](void* r) { return Current().Connections(r); };
  api->recv_capture_v2 = [](void* r, ndi_video_frame_v2* v, ndi_audio_frame_v2* a, ndi_metadata_frame* m,
                            std::uint32_t timeoutMs) { return Current().Capture(r, v, a, m, timeoutMs); };
  api->recv_free_video_v2 = [](void*, const ndi_video_frame_v2* v) { Current().Free(0, v->data); };
  api->recv_free_audio_v2 = [](void*, const ndi_audio_frame_v2* a) { Current().Free(1, a->data); };
  api->recv_free_metadata = [](void*, const ndi_metadata_frame* m) { Current().Free(2, m->data); };
  api->recv_set_tally = [](void*, const ndi_tally* t) { return Current().SetTally(t); };
  api->recv_send_metadata = [](void*, const ndi_metadata_frame* m) { return Current().SendMetadata(m); };
  api->recv_ptz_is_supported = [](void*) { return Current().PtzSupported(); };
  api->recv_ptz_recall_preset = [](void*, int preset, float speed) { return PtzCall("recall_preset", preset, speed); };
  api->recv_ptz_store_preset = [](void*, int preset) { return PtzCall("store_preset", preset); };
  api->recv_ptz_pan_tilt = [](void*, float p, float t) { return PtzCall("pan_tilt", p, t); };
  api->recv_ptz_pan_tilt_speed = [](void*, float p, float t) { return PtzCall("pan_tilt_speed", p, t); };
  api->recv_ptz_zoom = [](void*, float z) { return PtzCall("zoom", z); };
  api->recv_ptz_focus = [](void*, float f) { return PtzCall("focus", f); };
  api->recv_ptz_focus_speed = [](void*, float f) { return PtzCall("focus_speed", f); };
  api->recv_ptz_auto_focus = [](void*) { return PtzCall("auto_focus"); };
  api->recv_ptz_exposure_auto = [](void*) { return PtzCall("exposure_auto"); };
  api->recv_ptz_exposure_manual = [](void*, float l) { return PtzCall("exposure_manual", l); };
  api->recv_ptz_white_balance_auto = [](void*) { return PtzCall("white_balance_auto"); };
  api->recv_ptz_white_balance_indoor = [](void*) { return PtzCall("white_balance_indoor"); };
  api->recv_ptz_white_balance_outdoor = [](void*) { return PtzCall("white_balance_outdoor"); };
  api->recv_ptz_white_balance_oneshot = [](void*) { return PtzCall("white_balance_oneshot"); };
  api->recv_ptz_white_balance_manual = [](void*, float r, float b) { return PtzCall("white_balance_manual", r, b); };
  api->util_audio_to_interleaved_32f_v2 = Interleave;
  return api;
}

#define LOCKED std::lock_guard<std::mutex> guard(mutex_)

void ScriptedNdi::SetSources(std::vector<Entry> entries) { LOCKED; entries_ = std::move(entries); }
void ScriptedNdi::FailFinderCreate(bool fail) { LOCKED; failFinder_ = fail; }
void ScriptedNdi::FailReceiverCreate(bool fail) { LOCKED; failReceiver_ = fail; }
void ScriptedNdi::SetConnections(int count) { LOCKED; connections_ = count; }
void ScriptedNdi::SetTallyResult(bool ok) { LOCKED; tallyOk_ = ok; }
void ScriptedNdi::SetMetadataResult(bool ok) { LOCKED; metadataOk_ = ok; }
void ScriptedNdi::SetPtzSupported(bool supported) { LOCKED; ptzSupported_ = supported; }

Observed ScriptedNdi::Seen() {
  LOCKED;
  Observed seen = seen_;
  seen.queued = static_cast<int>(queue_.size());
  seen.freesMatched = seen_.freesMatched && handedOut_.empty();
  return seen;
}

void ScriptedNdi::Push(std::shared_ptr<nditest::Capture> capture) {
  LOCKED;
  queue_.push_back(std::move(capture));
  changed_.notify_all();
}

void ScriptedNdi::BlockCapture(bool block) {
  LOCKED;
  block_ = block;
  changed_.notify_all();
}

void* ScriptedNdi::FindCreate(const ndi_find_create* settings) {
  LOCKED;
  if (failFinder_ || settings == nullptr || !settings->show_local_sources) return nullptr;
  ++seen_.findersCreated;
  seen_.maxLiveFinders = std::max(seen_.maxLiveFinders, seen_.findersCreated - seen_.findersDestroyed);
  return &handleSpace_[++handles_ % 64];
}

void ScriptedNdi::FindDestroy(void*) { LOCKED; ++seen_.findersDestroyed; }

const ndi_source* ScriptedNdi::FindList(void*, std::uint32_t* count) {
  LOCKED;
  ++seen_.listCalls;
  list_.clear();
  for (const Entry& entry : entries_) {
    list_.push_back(ndi_source{entry.name ? entry.name->c_str() : nullptr, entry.url ? entry.url->c_str() : nullptr});
  }
  *count = static_cast<std::uint32_t>(list_.size());
  return list_.empty() ? nullptr : list_.data();
}

void* ScriptedNdi::RecvCreate(const ndi_recv_create* settings) {
  LOCKED;
  if (failReceiver_) return nullptr;
  ReceiverCreated created;
  created.name = settings->source_to_connect_to.ndi_name ? settings->source_to_connect_to.ndi_name : "";
  created.url = settings->source_to_connect_to.url_address ? settings->source_to_connect_to.url_address : "";
  created.colorFormat = settings->color_format;
  created.bandwidth = settings->bandwidth;
  created.allowFields = settings->allow_video_fields;
  seen_.receivers.push_back(created);
  return &handleSpace_[++handles_ % 64];
}

void ScriptedNdi::RecvDestroy(void*) { LOCKED; ++seen_.receiversDestroyed; }

int ScriptedNdi::Connections(void*) {
  LOCKED;
  ++seen_.connectionQueries;
  return connections_;
}

std::int32_t ScriptedNdi::Capture(void*, ndi_video_frame_v2* video, ndi_audio_frame_v2* audio,
                                  ndi_metadata_frame* metadata, std::uint32_t) {
  std::unique_lock<std::mutex> lock(mutex_);
  ++seen_.captures;
  changed_.notify_all();
  changed_.wait(lock, [this] { return !block_; });
  if (queue_.empty()) changed_.wait_for(lock, std::chrono::milliseconds(1), [this] { return !queue_.empty(); });
  if (queue_.empty()) return kNdiFrameNone;
  std::shared_ptr<nditest::Capture> capture = queue_.front();
  queue_.pop_front();
  switch (capture->type) {
    case kNdiFrameVideo:
      *video = capture->video;
      handedOut_[video->data] = capture;
      break;
    case kNdiFrameAudio:
      *audio = capture->audio;
      handedOut_[audio->data] = capture;
      break;
    case kNdiFrameMetadata:
      *metadata = capture->metadata;
      handedOut_[metadata->data] = capture;
      break;
    default:
      break;
  }
  return capture->type;
}

void ScriptedNdi::Free(int kind, const void* data) {
  LOCKED;
  ++seen_.frees[kind];
  if (handedOut_.erase(data) != 1) seen_.freesMatched = false;
}

bool ScriptedNdi::SetTally(const ndi_tally* tally) {
  LOCKED;
  seen_.tallies.push_back(*tally);
  return tallyOk_;
}

bool ScriptedNdi::SendMetadata(const ndi_metadata_frame* frame) {
  LOCKED;
  seen_.metadataLengths.push_back(frame->length);
  if (!metadataOk_) return false;
  seen_.metadataSent.emplace_back(frame->data, frame->length > 0 ? static_cast<std::size_t>(frame->length) - 1 : 0);
  return true;
}

bool ScriptedNdi::PtzSupported() { LOCKED; return ptzSupported_; }

bool ScriptedNdi::Ptz(const std::string& call) {
  LOCKED;
  seen_.ptzCalls.push_back(call);
  return true;
}

#undef LOCKED

}  // namespace nditest
