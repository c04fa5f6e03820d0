// Metadata both ways, PTZ and tally.
//
// Read from the sender (root element decides):
//   <ndi_product model_name="..."/>                   the sender's model
//   <skyrelay_ext|metadata><buildOutDuration>0.5</buildOutDuration></...>
// Written to the sender (the XML library's default, indented printer):
//   <skyrelay_ext>
//       <event value="NAME" preview="1" live="0"/>
//   </skyrelay_ext>
//
// Host request threads only record the tally and queue shot events and PTZ
// commands (under the mutex); the receiver thread parses, prints and makes
// every NDI call.

#include <cmath>
#include <cstring>
#include <limits>
#include <string>

#include <tinyxml2.h>

#include "pm/runtime/json.h"
#include "pm/runtime/log.h"
#include "taskndisource/ndi_source.h"

namespace TaskNDISource {

namespace {

constexpr double kTicksPerSecond = 705'600'000.0;

// JSON numbers of any size into the runtime's float parameters: values beyond
// the float range are clamped rather than converted with undefined results.
float ToFloat(double value) {
  if (std::isnan(value)) return std::numeric_limits<float>::quiet_NaN();
  if (value > std::numeric_limits<float>::max()) return std::numeric_limits<float>::max();
  if (value < std::numeric_limits<float>::lowest()) return std::numeric_limits<float>::lowest();
  return static_cast<float>(value);
}

int ToPreset(std::int64_t value) {
  if (value > std::numeric_limits<int>::max()) return std::numeric_limits<int>::max();
  if (value < std::numeric_limits<int>::min()) return std::numeric_limits<int>::min();
  return static_cast<int>(value);
}

}  // namespace

void NDISource::HandleShotEvent(std::string event) {
  std::lock_guard<std::mutex> guard(mutex_);
  if (event == "TALLY_PREVIEW_ON") {
    tallyPreview_ = true;
  } else if (event == "TALLY_PREVIEW_OFF") {
    tallyPreview_ = false;
  } else if (event == "TALLY_LIVE_ON") {
    tallyLive_ = true;
  } else if (event == "TALLY_LIVE_OFF") {
    tallyLive_ = false;
  } else {
    eventQueue_.push_back(ShotEvent{std::move(event), static_cast<std::uint8_t>(tallyPreview_ ? 1 : 0),
                                    static_cast<std::uint8_t>(tallyLive_ ? 1 : 0)});
  }
}

void NDISource::ExecutePtzCommand(const nlohmann::json& request) {
  std::lock_guard<std::mutex> guard(mutex_);
  if (loopRunning_) ptzQueue_.push_back(request);
}

bool NDISource::SendMetadata(void* receiver, const tinyxml2::XMLDocument& document) {
  tinyxml2::XMLPrinter printer;  // default: indented, four spaces per level
  document.Print(&printer);
  ndi_metadata_frame frame{};
  frame.length = printer.CStrSize();  // the text and its terminating zero
  frame.timecode = kNdiSendTimecodeSynthesize;
  frame.data = const_cast<char*>(printer.CStr());
  return api_->recv_send_metadata(receiver, &frame);
}

void NDISource::SendShotEvents(void* receiver, std::deque<ShotEvent>& queue) {
  while (!queue.empty()) {
    const ShotEvent& event = queue.front();
    tinyxml2::XMLDocument document;
    tinyxml2::XMLElement* root = document.NewElement("skyrelay_ext");
    document.InsertEndChild(root);
    tinyxml2::XMLElement* element = document.NewElement("event");
    element->SetAttribute("value", event.name.c_str());
    element->SetAttribute("preview", event.preview != 0 ? 1 : 0);
    element->SetAttribute("live", event.live != 0 ? 1 : 0);
    root->InsertEndChild(element);
    if (!SendMetadata(receiver, document)) return;  // stays first for the next pass
    queue.pop_front();
  }
}

void NDISource::RunPtzCommands(void* receiver, std::deque<nlohmann::json>& queue) {
  while (!queue.empty()) {
    const nlohmann::json request = std::move(queue.front());
    queue.pop_front();
    const std::string command = pmjson::FieldAsString(request, "command", "");
    auto number = [&request](const char* key) { return ToFloat(pmjson::FieldAsDouble(request, key, 0.0)); };
    if (command == "RecallPreset") {
      api_->recv_ptz_recall_preset(receiver, ToPreset(pmjson::FieldAsInteger(request, "preset", 0)),
                                   ToFloat(pmjson::FieldAsDouble(request, "speed", 1.0)));
    } else if (command == "StorePreset") {
      api_->recv_ptz_store_preset(receiver, ToPreset(pmjson::FieldAsInteger(request, "preset", 0)));
    } else if (command == "PanTilt") {
      api_->recv_ptz_pan_tilt(receiver, number("pan"), number("tilt"));
    } else if (command == "PanTiltSpeed") {
      api_->recv_ptz_pan_tilt_speed(receiver, number("pan"), number("tilt"));
    } else if (command == "Zoom") {
      api_->recv_ptz_zoom(receiver, number("zoom"));
    } else if (command == "AutoFocus") {
      api_->recv_ptz_auto_focus(receiver);
    } else if (command == "Focus") {
      api_->recv_ptz_focus(receiver, number("val"));
    } else if (command == "FocusSpeed") {
      api_->recv_ptz_focus_speed(receiver, number("speed"));
    } else if (command == "AutoExposure") {
      api_->recv_ptz_exposure_auto(receiver);
    } else if (command == "ExposureManual") {
      api_->recv_ptz_exposure_manual(receiver, number("level"));
    } else if (command == "BalanceMode") {
      const std::string mode = pmjson::FieldAsString(request, "mode", "");
      if (mode == "auto") {
        api_->recv_ptz_white_balance_auto(receiver);
      } else if (mode == "indoor") {
        api_->recv_ptz_white_balance_indoor(receiver);
      } else if (mode == "outdoor") {
        api_->recv_ptz_white_balance_outdoor(receiver);
      } else if (mode == "oneshot") {
        pm::LogText("", "ptz_white_balance_oneshot\n");
        api_->recv_ptz_white_balance_oneshot(receiver);
      } else if (mode == "manual") {
        api_->recv_ptz_white_balance_manual(receiver, number("red"), number("blue"));
      }
    }
  }
}

void NDISource::ProcessMetadataFrame(const ndi_metadata_frame& frame) {
  if (frame.length <= 0) {
    pm::LogText(kLogTag, "invalid length in NDI metadata frame");
    return;
  }
  if (frame.data == nullptr) {
    pm::LogText(kLogTag, "null data in NDI metadata frame");
    return;
  }
  // Exactly `length` bytes are ours to read; the text ends at the first zero
  // within them (normally the terminating one), or at `length` without one.
  std::size_t size = static_cast<std::size_t>(frame.length);
  if (const void* zero = std::memchr(frame.data, 0, size)) {
    size = static_cast<std::size_t>(static_cast<const char*>(zero) - frame.data);
  }
  tinyxml2::XMLDocument document;
  if (document.Parse(frame.data, size) != tinyxml2::XML_SUCCESS) {
    pm::LogText(kLogTag, "failed to parse metadata frame");
    return;
  }
  const tinyxml2::XMLElement* root = document.RootElement();
  if (root == nullptr) {
    pm::LogText(kLogTag, "metadata frame has no root element");
    return;
  }
  const std::string rootName = root->Name();
  if (rootName == "ndi_product") {
    const char* attribute = root->Attribute("model_name");
    const std::string model = attribute != nullptr ? attribute : "";
    if (model != modelName_) {
      pm::Log(pm::LogType::Normal, kLogTag, "NDI source model name: %s", model.c_str());
      modelName_ = model;
      // The vendor runtime signals PTZ support (a status change) before it
      // delivers the sender's product metadata: a suite already reported
      // goes out again with the model it now has.
      if (ptzReported_) {
        if (const std::shared_ptr<Callbacks>& callbacks = GetCallbacks()) {
          callbacks->UpdatePtzCommandSuite("NDI3", modelName_);
        }
      }
    }
  } else if (rootName == "skyrelay_ext" || rootName == "metadata") {
    const tinyxml2::XMLElement* child = root->FirstChildElement("buildOutDuration");
    double seconds = 0.0;
    if (child == nullptr || child->QueryDoubleText(&seconds) != tinyxml2::XML_SUCCESS) return;
    const double ticks = std::trunc(seconds * kTicksPerSecond);
    // A duration without a tick count (not a number, or beyond 64 bits) is
    // dropped instead of converted with an undefined result.
    if (!(ticks > -9223372036854775808.0 && ticks < 9223372036854775808.0)) {
      pm::LogText(kLogTag, "invalid buildOutDuration in NDI metadata frame");
      return;
    }
    if (const std::shared_ptr<Callbacks>& callbacks = GetCallbacks()) {
      callbacks->UpdateBuildOutDuration(static_cast<std::int64_t>(ticks));
    }
  }
}

void NDISource::ReportPtzSupport(void* receiver) {
  const std::shared_ptr<Callbacks>& callbacks = GetCallbacks();
  ptzReported_ = api_->recv_ptz_is_supported(receiver);
  if (ptzReported_) {
    pm::Log(pm::LogType::Normal, kLogTag, "%s supports PTZ\n", UniqueId().c_str());
    if (callbacks) callbacks->UpdatePtzCommandSuite("NDI3", modelName_);
  } else if (callbacks) {
    callbacks->UpdatePtzCommandSuite("", "");
  }
}

}  // namespace TaskNDISource
