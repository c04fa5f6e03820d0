// The exported C interface of the loopback runtime. Every entry point accepts
// null handles and pointers and never lets an exception out.
#include <chrono>
#include <cstring>
#include <memory>
#include <string>
#include <thread>
#include <vector>

#include "ndi-loopback/receiver.h"
#include "ndi-loopback/registry.h"
#include "ndi-loopback/sender.h"
#include "pm/runtime/export.h"
#include "pm/runtime/log.h"
#include "ndi/ndi_abi.h"

#define NDILB_EXPORT extern "C" PM_EXPORT

namespace ndilb {
namespace {

// A finder lists the registry on demand; it has no thread of its own.
class Finder {
 public:
  // How often find_wait_for_sources looks at the registry.
  static constexpr int kPollMs = 50;

  const ndi_source* Current(std::uint32_t* count) {
    entries_ = ListRegistry();
    seen_ = entries_;
    sources_.clear();
    for (const RegistryEntry& e : entries_) sources_.push_back(ndi_source{e.name.c_str(), e.url.c_str()});
    if (count != nullptr) *count = static_cast<std::uint32_t>(sources_.size());
    return sources_.empty() ? nullptr : sources_.data();
  }

  bool Wait(std::uint32_t timeout_ms) {
    const auto deadline = std::chrono::steady_clock::now() + std::chrono::milliseconds(timeout_ms);
    for (;;) {
      std::vector<RegistryEntry> now = ListRegistry();
      if (now != seen_) {
        seen_ = std::move(now);
        return true;
      }
      const auto left = deadline - std::chrono::steady_clock::now();
      if (left <= std::chrono::milliseconds(0)) return false;
      std::this_thread::sleep_for(std::min<std::chrono::steady_clock::duration>(left, std::chrono::milliseconds(kPollMs)));
    }
  }

 private:
  std::vector<RegistryEntry> entries_;  // backs sources_ until the next Current
  std::vector<ndi_source> sources_;
  std::vector<RegistryEntry> seen_;     // the list as last seen by either call
};

template <class R, class F>
R Guard(R fallback, F&& f) noexcept {
  try {
    return f();
  } catch (const std::exception& e) {
    pm::Log(pm::LogType::Normal, "", "ndi-loopback: %s", e.what());
  } catch (...) {
    pm::LogText("", "ndi-loopback: unknown exception\n");
  }
  return fallback;
}

template <class F>
void GuardVoid(F&& f) noexcept {
  Guard(0, [&] {
    f();
    return 0;
  });
}

Receiver* R(void* p) { return static_cast<Receiver*>(p); }
Sender* S(void* p) { return static_cast<Sender*>(p); }

bool Ptz(void* receiver, const std::string& xml) {
  if (receiver == nullptr) return false;
  return Guard(false, [&] { return R(receiver)->SendPtz(xml); });
}

}  // namespace
}  // namespace ndilb

using ndilb::Guard;
using ndilb::GuardVoid;
using ndilb::PtzInteger;
using ndilb::PtzNumber;
using ndilb::PtzXml;

NDILB_EXPORT bool NDIlib_initialize(void) { return true; }
NDILB_EXPORT void NDIlib_destroy(void) {}
NDILB_EXPORT const char* NDIlib_version(void) { return "ndi-loopback 1.0"; }
NDILB_EXPORT bool NDIlib_is_supported_CPU(void) { return true; }

NDILB_EXPORT void* NDIlib_find_create_v2(const ndi_find_create*) {
  return Guard<void*>(nullptr, [] { return static_cast<void*>(new ndilb::Finder()); });
}
NDILB_EXPORT void NDIlib_find_destroy(void* finder) {
  GuardVoid([&] { delete static_cast<ndilb::Finder*>(finder); });
}
NDILB_EXPORT const ndi_source* NDIlib_find_get_current_sources(void* finder, std::uint32_t* count) {
  if (count != nullptr) *count = 0;
  if (finder == nullptr) return nullptr;
  return Guard<const ndi_source*>(nullptr, [&] { return static_cast<ndilb::Finder*>(finder)->Current(count); });
}
NDILB_EXPORT bool NDIlib_find_wait_for_sources(void* finder, std::uint32_t timeout_ms) {
  if (finder == nullptr) return false;
  return Guard(false, [&] { return static_cast<ndilb::Finder*>(finder)->Wait(timeout_ms); });
}

NDILB_EXPORT void* NDIlib_recv_create_v2(const ndi_recv_create* settings) {
  if (settings == nullptr) return nullptr;
  return Guard<void*>(nullptr, [&] { return static_cast<void*>(new ndilb::Receiver(*settings)); });
}
NDILB_EXPORT void NDIlib_recv_destroy(void* receiver) {
  GuardVoid([&] { delete ndilb::R(receiver); });
}
NDILB_EXPORT int NDIlib_recv_get_no_connections(void* receiver) {
  return receiver == nullptr ? 0 : ndilb::R(receiver)->Connections();
}
NDILB_EXPORT std::int32_t NDIlib_recv_capture_v2(void* receiver, ndi_video_frame_v2* video, ndi_audio_frame_v2* audio,
                                                 ndi_metadata_frame* metadata, std::uint32_t timeout_ms) {
  if (receiver == nullptr) return kNdiFrameNone;
  return Guard<std::int32_t>(kNdiFrameError,
                             [&] { return ndilb::R(receiver)->Capture(video, audio, metadata, timeout_ms); });
}
NDILB_EXPORT void NDIlib_recv_free_video_v2(void* receiver, const ndi_video_frame_v2* video) {
  if (receiver == nullptr || video == nullptr) return;
  GuardVoid([&] { ndilb::R(receiver)->FreeVideo(*video); });
}
NDILB_EXPORT void NDIlib_recv_free_audio_v2(void* receiver, const ndi_audio_frame_v2* audio) {
  if (receiver == nullptr || audio == nullptr) return;
  GuardVoid([&] { ndilb::R(receiver)->FreeAudio(*audio); });
}
NDILB_EXPORT void NDIlib_recv_free_metadata(void* receiver, const ndi_metadata_frame* metadata) {
  if (receiver == nullptr || metadata == nullptr) return;
  GuardVoid([&] { ndilb::R(receiver)->FreeMetadata(*metadata); });
}
NDILB_EXPORT bool NDIlib_recv_set_tally(void* receiver, const ndi_tally* tally) {
  if (receiver == nullptr || tally == nullptr) return false;
  return Guard(false, [&] { return ndilb::R(receiver)->SetTally(*tally); });
}
NDILB_EXPORT bool NDIlib_recv_send_metadata(void* receiver, const ndi_metadata_frame* metadata) {
  if (receiver == nullptr || metadata == nullptr) return false;
  return Guard(false, [&] { return ndilb::R(receiver)->SendMetadata(*metadata); });
}

NDILB_EXPORT bool NDIlib_recv_ptz_is_supported(void* receiver) {
  return receiver != nullptr && ndilb::R(receiver)->PtzSupported();
}
NDILB_EXPORT bool NDIlib_recv_ptz_recall_preset(void* receiver, int preset, float speed) {
  return ndilb::Ptz(receiver, PtzXml("recall_preset", {PtzInteger("index", preset), PtzNumber("speed", speed)}));
}
NDILB_EXPORT bool NDIlib_recv_ptz_store_preset(void* receiver, int preset) {
  return ndilb::Ptz(receiver, PtzXml("store_preset", {PtzInteger("index", preset)}));
}
NDILB_EXPORT bool NDIlib_recv_ptz_pan_tilt(void* receiver, float pan, float tilt) {
  return ndilb::Ptz(receiver, PtzXml("pan_tilt", {PtzNumber("pan", pan), PtzNumber("tilt", tilt)}));
}
NDILB_EXPORT bool NDIlib_recv_ptz_pan_tilt_speed(void* receiver, float pan_speed, float tilt_speed) {
  return ndilb::Ptz(receiver,
                    PtzXml("pan_tilt_speed", {PtzNumber("pan_speed", pan_speed), PtzNumber("tilt_speed", tilt_speed)}));
}
NDILB_EXPORT bool NDIlib_recv_ptz_zoom(void* receiver, float zoom) {
  return ndilb::Ptz(receiver, PtzXml("zoom", {PtzNumber("zoom", zoom)}));
}
NDILB_EXPORT bool NDIlib_recv_ptz_focus(void* receiver, float focus) {
  return ndilb::Ptz(receiver, PtzXml("focus", {{"mode", "manual"}, PtzNumber("distance", focus)}));
}
// The vendor runtime calls the speed "distance" too.
NDILB_EXPORT bool NDIlib_recv_ptz_focus_speed(void* receiver, float focus_speed) {
  return ndilb::Ptz(receiver, PtzXml("focus_speed", {{"mode", "manual"}, PtzNumber("distance", focus_speed)}));
}
NDILB_EXPORT bool NDIlib_recv_ptz_auto_focus(void* receiver) {
  return ndilb::Ptz(receiver, PtzXml("focus", {{"mode", "auto"}}));
}
NDILB_EXPORT bool NDIlib_recv_ptz_exposure_auto(void* receiver) {
  return ndilb::Ptz(receiver, PtzXml("exposure", {{"mode", "auto"}}));
}
NDILB_EXPORT bool NDIlib_recv_ptz_exposure_manual(void* receiver, float level) {
  return ndilb::Ptz(receiver, PtzXml("exposure", {{"mode", "manual"}, PtzNumber("value", level)}));
}
NDILB_EXPORT bool NDIlib_recv_ptz_white_balance_auto(void* receiver) {
  return ndilb::Ptz(receiver, PtzXml("white_balance", {{"mode", "auto"}}));
}
NDILB_EXPORT bool NDIlib_recv_ptz_white_balance_indoor(void* receiver) {
  return ndilb::Ptz(receiver, PtzXml("white_balance", {{"mode", "indoor"}}));
}
NDILB_EXPORT bool NDIlib_recv_ptz_white_balance_outdoor(void* receiver) {
  return ndilb::Ptz(receiver, PtzXml("white_balance", {{"mode", "outdoor"}}));
}
NDILB_EXPORT bool NDIlib_recv_ptz_white_balance_oneshot(void* receiver) {
  return ndilb::Ptz(receiver, PtzXml("white_balance", {{"mode", "one_shot"}}));
}
NDILB_EXPORT bool NDIlib_recv_ptz_white_balance_manual(void* receiver, float red, float blue) {
  return ndilb::Ptz(receiver, PtzXml("white_balance", {{"mode", "manual"}, PtzNumber("red", red), PtzNumber("blue", blue)}));
}

NDILB_EXPORT void NDIlib_util_audio_to_interleaved_32f_v2(const ndi_audio_frame_v2* src,
                                                          ndi_audio_frame_interleaved_32f* dst) {
  if (src == nullptr || dst == nullptr || src->data == nullptr || dst->data == nullptr) return;
  const int channels = src->no_channels;
  const int samples = src->no_samples;
  if (channels <= 0 || samples <= 0) return;
  const std::size_t stride = src->channel_stride_in_bytes > 0 ? static_cast<std::size_t>(src->channel_stride_in_bytes)
                                                              : static_cast<std::size_t>(samples) * sizeof(float);
  const auto* base = reinterpret_cast<const std::uint8_t*>(src->data);
  for (int c = 0; c < channels; ++c) {
    const auto* in = reinterpret_cast<const float*>(base + stride * static_cast<std::size_t>(c));
    float* out = dst->data + c;
    for (int s = 0; s < samples; ++s) out[static_cast<std::size_t>(s) * static_cast<std::size_t>(channels)] = in[s];
  }
  dst->sample_rate = src->sample_rate;
  dst->no_channels = channels;
  dst->no_samples = samples;
  dst->timecode = src->timecode;
}

NDILB_EXPORT void* NDIlib_send_create(const ndi_send_create* settings) {
  if (settings == nullptr) return nullptr;
  return Guard<void*>(nullptr, [&] { return static_cast<void*>(ndilb::Sender::Create(*settings).release()); });
}
NDILB_EXPORT void NDIlib_send_destroy(void* sender) {
  GuardVoid([&] { delete ndilb::S(sender); });
}
NDILB_EXPORT void NDIlib_send_send_video_v2(void* sender, const ndi_video_frame_v2* video) {
  if (sender == nullptr || video == nullptr) return;
  GuardVoid([&] { ndilb::S(sender)->SendVideo(*video); });
}
NDILB_EXPORT void NDIlib_send_send_audio_v2(void* sender, const ndi_audio_frame_v2* audio) {
  if (sender == nullptr || audio == nullptr) return;
  GuardVoid([&] { ndilb::S(sender)->SendAudio(*audio); });
}
NDILB_EXPORT void NDIlib_send_send_metadata(void* sender, const ndi_metadata_frame* metadata) {
  if (sender == nullptr || metadata == nullptr) return;
  GuardVoid([&] { ndilb::S(sender)->SendMetadata(*metadata); });
}
NDILB_EXPORT std::int32_t NDIlib_send_capture(void* sender, ndi_metadata_frame* metadata, std::uint32_t timeout_ms) {
  if (sender == nullptr) return kNdiFrameNone;
  return Guard<std::int32_t>(kNdiFrameError, [&] { return ndilb::S(sender)->Capture(metadata, timeout_ms); });
}
NDILB_EXPORT void NDIlib_send_free_metadata(void* sender, const ndi_metadata_frame* metadata) {
  if (sender == nullptr || metadata == nullptr) return;
  GuardVoid([&] { ndilb::S(sender)->FreeMetadata(*metadata); });
}
NDILB_EXPORT bool NDIlib_send_get_tally(void* sender, ndi_tally* tally, std::uint32_t timeout_ms) {
  if (sender == nullptr) return false;
  return Guard(false, [&] { return ndilb::S(sender)->GetTally(tally, timeout_ms); });
}
NDILB_EXPORT int NDIlib_send_get_no_connections(void* sender, std::uint32_t timeout_ms) {
  if (sender == nullptr) return 0;
  return Guard(0, [&] { return ndilb::S(sender)->GetConnections(timeout_ms); });
}
NDILB_EXPORT void NDIlib_send_add_connection_metadata(void* sender, const ndi_metadata_frame* metadata) {
  if (sender == nullptr || metadata == nullptr) return;
  GuardVoid([&] { ndilb::S(sender)->AddConnectionMetadata(*metadata); });
}
NDILB_EXPORT void NDIlib_send_clear_connection_metadata(void* sender) {
  if (sender == nullptr) return;
  GuardVoid([&] { ndilb::S(sender)->ClearConnectionMetadata(); });
}
