#pragma once
// The NDI source's settings (one: the receive bandwidth) and its settings
// panel (bandwidth choice, reconnect button, three status lines), on the
// pm::cfg model, and the status texts the panel shows.
//
//   configuration: {"bandwidth": "ndi_bandwidth_highest" | "ndi_bandwidth_lowest" |
//                   "ndi_bandwidth_audio_only"}   (any other text: highest)
//   gui:           popup "bandwidth", button "reconnect" (command
//                  "taskndisource::reconnect"), static texts "status", "video", "audio"

#include <cstdint>
#include <string>

#include "pm/cfg/object.h"
#include "pm/cfg/widgets.h"
#include "taskndisource/ndi_source.h"

namespace TaskNDISource {

inline constexpr char kBandwidthHighest[] = "ndi_bandwidth_highest";
inline constexpr char kBandwidthLowest[] = "ndi_bandwidth_lowest";
inline constexpr char kBandwidthAudioOnly[] = "ndi_bandwidth_audio_only";
inline constexpr char kReconnectCommand[] = "taskndisource::reconnect";

struct NDISource::Config : pm::cfg::Configuration {
  Config();
  pm::cfg::MemberT<std::string> bandwidth;
};

struct NDISource::Gui : pm::cfg::Gui {
  Gui();
  pm::cfg::Popup bandwidth;
  pm::cfg::Button reconnect;
  pm::cfg::StaticText status;
  pm::cfg::StaticText video;
  pm::cfg::StaticText audio;
};

// "ndi_bandwidth_lowest" -> 0, "ndi_bandwidth_audio_only" -> 10, else 100.
std::uint32_t BandwidthFromText(const std::string& text);
// The status key of a state ("ndi_state_connecting", ...); empty for 0.
std::string StatusKey(ReceiverState state);
// "1920x1080 @ 29.97 fps", "1280x720", or empty.
std::string VideoStatusText(const MediaInfo& info);
// "Stereo @ 48 kHz", "Mono @ 44.1 kHz", "6 Channels @ 48 kHz", or empty;
// "200 Channels not supported" for sound that is refused.
std::string AudioStatusText(const MediaInfo& info);

}  // namespace TaskNDISource
