#include "taskndisource/ndi_config.h"

#include <exception>

#include "pm/runtime/json.h"
#include "pm/runtime/log.h"

namespace TaskNDISource {

NDISource::Config::Config()
    : pm::cfg::Configuration(nullptr, "", "configuration", /*ordered=*/false),
      bandwidth(this, "bandwidth", kBandwidthHighest) {}

NDISource::Gui::Gui()
    : pm::cfg::Gui(nullptr, "", "gui", /*ordered=*/true),
      bandwidth(this, "bandwidth", "ndi_bandwidth_label",
                {kBandwidthHighest, kBandwidthLowest, kBandwidthAudioOnly}),
      reconnect(this, "reconnect", "ndi_reconnect_button", kReconnectCommand),
      status(this, "status", "p_status_label"),
      video(this, "video", "ndi_video_status_label"),
      audio(this, "audio", "ndi_audio_status_label") {}

std::uint32_t BandwidthFromText(const std::string& text) {
  if (text == kBandwidthLowest) return 0;
  if (text == kBandwidthAudioOnly) return 10;
  return 100;
}

std::string StatusKey(ReceiverState state) {
  switch (state) {
    case ReceiverState::Connecting:
      return "ndi_state_connecting";
    case ReceiverState::Receiving:
      return "ndi_state_receiving";
    case ReceiverState::Idle:
      return "ndi_state_idle";
    case ReceiverState::Error:
      return "taskvistafeed_status_error";
    case ReceiverState::Exiting:
      return "ndi_state_exiting";
    default:
      return {};
  }
}

std::string VideoStatusText(const MediaInfo& info) {
  if (info.videoWidth <= 0 || info.videoHeight <= 0) return {};
  std::string text = std::to_string(info.videoWidth) + "x" + std::to_string(info.videoHeight);
  if (info.frameRateN > 0 && info.frameRateD > 0) {
    // Hundredths of a frame per second, computed in 64 bits so that a large
    // numerator from a sender cannot overflow.
    const std::int64_t r = std::int64_t{info.frameRateN} * 100 / info.frameRateD;
    text += " @ " + std::to_string(r / 100);
    if (r % 100 != 0) {
      const std::int64_t hundredths = r % 100;
      text += hundredths < 10 ? ".0" : ".";
      text += std::to_string(hundredths);
    }
    text += " fps";
  }
  return text;
}

std::string AudioStatusText(const MediaInfo& info) {
  if (info.audioChannels <= 0) return {};
  if (info.audioRefused) return std::to_string(info.audioChannels) + " Channels not supported";
  std::string text;
  if (info.audioChannels == 1) {
    text = "Mono";
  } else if (info.audioChannels == 2) {
    text = "Stereo";
  } else {
    text = std::to_string(info.audioChannels) + " Channels";
  }
  if (info.audioSampleRate > 0) {
    text += " @ " + std::to_string(info.audioSampleRate / 1000);
    if (info.audioSampleRate % 1000 != 0) text += "." + std::to_string((info.audioSampleRate % 1000) / 100);
    text += " kHz";
  }
  return text;
}

std::string NDISource::BuildStatusGui(const Config& config, ReceiverState state) {
  Gui gui;
  gui.bandwidth.SelectText(config.bandwidth.value);
  gui.status.value = StatusKey(state);
  if (state == ReceiverState::Error) gui.status.indication = pm::cfg::VisualIndication::Error;
  MediaInfo info;
  {
    std::lock_guard<std::mutex> guard(mutex_);
    info = mediaInfo_;
  }
  gui.video.value = VideoStatusText(info);
  gui.audio.value = AudioStatusText(info);
  pm::cfg::Json out;
  gui.ToJson(out);
  return pmjson::Dump(out);
}

void NDISource::ApplyConfiguration(const std::string& configJson) {
  config_->FromJsonText(configJson, "SetConfiguration");
  bandwidth_ = BandwidthFromText(config_->bandwidth.value);
  mediaInfo_ = MediaInfo{};
}

void NDISource::SetConfiguration(std::string configJson) {
  Reconnect([this, &configJson] { ApplyConfiguration(configJson); });
}

std::string NDISource::ValidateGui(std::string guiJson) { return guiJson; }

std::string NDISource::GuiToConfiguration(std::string guiJson) {
  try {
    if (!pm::cfg::Json::accept(guiJson)) {
      pmjson::Parse(guiJson, "GuiToConfiguration");  // logs the text
      return {};
    }
    Gui gui;
    gui.FromJsonText(guiJson, "GuiToConfiguration");
    Config config;
    // The selected entry's text, not its index: the configuration holds the
    // bandwidth by name.
    config.bandwidth = gui.bandwidth.SelectedText();
    pm::cfg::Json out;
    config.ToJson(out);
    return pmjson::Dump(out);
  } catch (const std::exception& e) {
    pm::Log(pm::LogType::Normal, kLogTag, "GuiToConfiguration failed: %s", e.what());
    return {};
  }
}

std::string NDISource::ConfigurationToGui(std::string configJson) {
  try {
    if (!pm::cfg::Json::accept(configJson)) {
      pmjson::Parse(configJson, "ConfigurationToGui");  // logs the text
      return {};
    }
    Config config;
    config.FromJsonText(configJson, "ConfigurationToGui");
    return BuildStatusGui(config, State());
  } catch (const std::exception& e) {
    pm::Log(pm::LogType::Normal, kLogTag, "ConfigurationToGui failed: %s", e.what());
    return {};
  }
}

}  // namespace TaskNDISource
