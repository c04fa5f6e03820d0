// The source's configuration, its settings panel and the status texts.

#include <gtest/gtest.h>

#include "ndi_harness.h"
#include "support/log_capture.h"
#include "taskndisource/ndi_config.h"
#include "taskndisource/ndi_source.h"

namespace {

using TaskNDISource::AudioStatusText;
using TaskNDISource::MediaInfo;
using TaskNDISource::NDISource;
using TaskNDISource::ReceiverState;
using TaskNDISource::VideoStatusText;
using Json = nlohmann::json;

MediaInfo Video(int w, int h, int n, int d) { return MediaInfo{w, h, n, d, 0, 0}; }
MediaInfo Audio(int rate, int channels) { return MediaInfo{0, 0, 0, 0, rate, channels}; }

// Video: size and rate to two decimals (none without a rate); audio: channels
// and rate to one decimal under 48 kHz; empty without a size or channels.
TEST(StatusText, VideoAndAudioLines) {
  const std::pair<MediaInfo, const char*> video[] = {
      {Video(1920, 1080, 30000, 1001), "1920x1080 @ 29.97 fps"},
      {Video(1920, 1080, 25, 1), "1920x1080 @ 25 fps"},
      {Video(1920, 1080, 25, 2), "1920x1080 @ 12.50 fps"},
      {Video(1920, 1080, 60000, 1001), "1920x1080 @ 59.94 fps"},
      {Video(640, 480, 1, 16), "640x480 @ 0.06 fps"},
      {Video(1280, 720, 0, 0), "1280x720"},
      {Video(1280, 720, 30, 0), "1280x720"},
      {Video(0, 0, 30, 1), ""},
      {Video(1280, -1, 30, 1), ""},
      {Video(16, 16, 2147483647, 1), "16x16 @ 2147483647 fps"},  // would overflow when scaled
  };
  for (const auto& [info, text] : video) EXPECT_EQ(VideoStatusText(info), text);
  const std::pair<MediaInfo, const char*> audio[] = {
      {Audio(48000, 2), "Stereo @ 48 kHz"},     {Audio(44100, 1), "Mono @ 44.1 kHz"},
      {Audio(22050, 2), "Stereo @ 22.0 kHz"},   {Audio(48000, 6), "6 Channels @ 48 kHz"},
      {Audio(0, 2), "Stereo"},                  {Audio(48000, 0), ""},
  };
  for (const auto& [info, text] : audio) EXPECT_EQ(AudioStatusText(info), text);
}

class ConfigTest : public ::testing::Test {
 protected:
  nditest::ScriptedNdi ndi;
  nditest::TestEnvironment env;
  std::shared_ptr<NDISource> source =
      std::make_shared<NDISource>(nullptr, "NDICaptureDevice~X", ndi.Api(), env.Make());
};

// The panel as the host gets it, byte for byte.
TEST_F(ConfigTest, StatusPanelIsExact) {
  NDISource::Config config;
  config.bandwidth = "ndi_bandwidth_audio_only";
  EXPECT_EQ(source->BuildStatusGui(config, ReceiverState::Error),
            R"({"audio":{"ghosted":false,"indication":0,"justification":108,"pm::order":4,)"
            R"("title":"ndi_audio_status_label","type":"static_text","value":"","visible":true},)"
            R"("bandwidth":{"ghosted":false,"pm::order":0,"title":"ndi_bandwidth_label","type":"popup",)"
            R"("value":2,"valueSetID":"","values":["ndi_bandwidth_highest","ndi_bandwidth_lowest",)"
            R"("ndi_bandwidth_audio_only"],"visible":true},)"
            R"("reconnect":{"action":1668641652,"command":"taskndisource::reconnect","ghosted":false,)"
            R"("pm::order":1,"title":"ndi_reconnect_button","type":"button","visible":true},)"
            R"("status":{"ghosted":false,"indication":101,"justification":108,"pm::order":2,)"
            R"("title":"p_status_label","type":"static_text","value":"taskvistafeed_status_error",)"
            R"("visible":true},)"
            R"("video":{"ghosted":false,"indication":0,"justification":108,"pm::order":3,)"
            R"("title":"ndi_video_status_label","type":"static_text","value":"","visible":true}})");
}

TEST_F(ConfigTest, StatusKeyAndErrorIndicationFollowTheState) {
  NDISource::Config config;
  const std::pair<ReceiverState, const char*> cases[] = {
      {ReceiverState::None, ""},
      {ReceiverState::Connecting, "ndi_state_connecting"},
      {ReceiverState::Receiving, "ndi_state_receiving"},
      {ReceiverState::Idle, "ndi_state_idle"},
      {ReceiverState::Error, "taskvistafeed_status_error"},
      {ReceiverState::Exiting, "ndi_state_exiting"},
      {static_cast<ReceiverState>(77), ""},
  };
  for (const auto& [state, key] : cases) {
    const Json gui = Json::parse(source->BuildStatusGui(config, state));
    EXPECT_EQ(gui["status"]["value"], key);
    EXPECT_EQ(gui["status"]["indication"], state == ReceiverState::Error ? 101 : 0);
  }
}

// The pop-up's index becomes the bandwidth's name (leniently read, out of
// range the first), and a configuration comes back through the panel as it was.
TEST_F(ConfigTest, PanelAndConfigurationTranslateBothWays) {
  const std::pair<const char*, const char*> cases[] = {
      {R"({"bandwidth":{"value":0}})", "ndi_bandwidth_highest"},
      {R"({"bandwidth":{"value":1}})", "ndi_bandwidth_lowest"},
      {R"({"bandwidth":{"value":2}})", "ndi_bandwidth_audio_only"},
      {R"({"bandwidth":{"value":"1"}})", "ndi_bandwidth_lowest"},
      {R"({"bandwidth":{"value":9}})", "ndi_bandwidth_highest"},
      {"[1,2]", "ndi_bandwidth_highest"},  // JSON of another shape is read as far as it goes
  };
  for (const auto& [gui, name] : cases) {
    const Json config = Json{{"bandwidth", name}};
    EXPECT_EQ(Json::parse(source->GuiToConfiguration(gui)), config) << gui;
    EXPECT_EQ(Json::parse(source->GuiToConfiguration(source->ConfigurationToGui(config.dump()))), config) << name;
  }
  pmtest::LogCapture logs;
  EXPECT_EQ(source->GuiToConfiguration("{not json"), "");
  EXPECT_EQ(source->ConfigurationToGui("{not json"), "");
  EXPECT_EQ(source->GuiToConfiguration(""), "");
  EXPECT_EQ(source->ValidateGui("{not json"), "{not json");
  EXPECT_EQ(Json::parse(source->ConfigurationToGui(R"({"bandwidth":5})"))["bandwidth"]["value"], 0);
}

// Unknown texts select the highest; a text that does not read keeps the value.
TEST_F(ConfigTest, ConfigurationSetsTheReceiveBandwidth) {
  const std::pair<const char*, std::uint32_t> cases[] = {
      {R"({"bandwidth":"ndi_bandwidth_lowest"})", 0u},   {R"({"bandwidth":"ndi_bandwidth_highest"})", 100u},
      {R"({"bandwidth":"ndi_bandwidth_lowest"})", 0u},   {R"({"bandwidth":"fastest please"})", 100u},
      {R"({"bandwidth":"ndi_bandwidth_audio_only"})", 10u}, {"not json", 10u},
      {R"({"bandwidth":"ndi_bandwidth_lowest "})", 100u},
  };
  for (const auto& [text, bandwidth] : cases) {
    source->SetConfiguration(text);
    EXPECT_EQ(source->Bandwidth(), bandwidth) << text;
  }
  EXPECT_FALSE(source->Started());
}

}  // namespace
