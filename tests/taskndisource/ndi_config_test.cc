// The source's configuration, its settings panel and the status texts.

#include <gtest/gtest.h>

#include "fakes.h"
#include "scripted_ndi.h"
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

TEST(StatusText, BandwidthTextsMapToReceiveBandwidth) {
  const std::pair<const char*, std::uint32_t> cases[] = {{"ndi_bandwidth_highest", 100u}, {"ndi_bandwidth_lowest", 0u},
                                                         {"ndi_bandwidth_audio_only", 10u}, {"ndi_bandwidth_lowest ", 100u},
                                                         {"", 100u}};
  for (const auto& [text, bandwidth] : cases) EXPECT_EQ(TaskNDISource::BandwidthFromText(text), bandwidth) << text;
}

class ConfigTest : public ::testing::Test {
 protected:
  nditest::ScriptedNdi ndi;
  nditest::TestEnvironment env;
  std::shared_ptr<NDISource> source =
      std::make_shared<NDISource>(nullptr, "NDICaptureDevice~X", ndi.Api(), env.Make());
};

// The widgets' own JSON is pm::cfg's (its round trip pins a panel of this shape
// byte for byte); here: which widgets, in which order, with which values.
TEST_F(ConfigTest, StatusPanelHoldsItsWidgetsInOrder) {
  NDISource::Config config;
  config.bandwidth = "ndi_bandwidth_audio_only";
  const std::string text = source->BuildStatusGui(config, ReceiverState::Connecting);
  EXPECT_EQ(text.find('\n'), std::string::npos);
  const Json gui = Json::parse(text);
  ASSERT_EQ(gui.size(), 5u);
  const char* keys[] = {"bandwidth", "reconnect", "status", "video", "audio"};
  const char* titles[] = {"ndi_bandwidth_label", "ndi_reconnect_button", "p_status_label", "ndi_video_status_label",
                          "ndi_audio_status_label"};
  const char* types[] = {"popup", "button", "static_text", "static_text", "static_text"};
  for (int i = 0; i < 5; ++i) {
    EXPECT_EQ(gui[keys[i]]["pm::order"], i);
    EXPECT_EQ(gui[keys[i]]["title"], titles[i]);
    EXPECT_EQ(gui[keys[i]]["type"], types[i]);
  }
  EXPECT_EQ(gui["bandwidth"]["value"], 2);
  EXPECT_EQ(gui["bandwidth"]["values"], Json({"ndi_bandwidth_highest", "ndi_bandwidth_lowest", "ndi_bandwidth_audio_only"}));
  EXPECT_EQ(gui["reconnect"]["command"], "taskndisource::reconnect");
  EXPECT_EQ(gui["reconnect"]["action"], 1668641652);
  EXPECT_EQ(gui["status"]["value"], "ndi_state_connecting");
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

TEST_F(ConfigTest, GuiToConfigurationKeepsTheChosenBandwidthByName) {
  for (int index = 0; index < 3; ++index) {
    const std::string gui = Json{{"bandwidth", {{"value", index}}}}.dump();
    const Json config = Json::parse(source->GuiToConfiguration(gui));
    const char* names[] = {"ndi_bandwidth_highest", "ndi_bandwidth_lowest", "ndi_bandwidth_audio_only"};
    EXPECT_EQ(config, (Json{{"bandwidth", names[index]}}));
  }
  // Lenient index, out-of-range index (validated to the first entry).
  EXPECT_EQ(Json::parse(source->GuiToConfiguration(R"({"bandwidth":{"value":"1"}})"))["bandwidth"],
            "ndi_bandwidth_lowest");
  EXPECT_EQ(Json::parse(source->GuiToConfiguration(R"({"bandwidth":{"value":9}})"))["bandwidth"],
            "ndi_bandwidth_highest");
}

TEST_F(ConfigTest, PanelRoundTripKeepsTheOperatorsChoice) {
  for (const char* choice : {"ndi_bandwidth_highest", "ndi_bandwidth_lowest", "ndi_bandwidth_audio_only"}) {
    const std::string config = Json{{"bandwidth", choice}}.dump();
    const std::string back = source->GuiToConfiguration(source->ConfigurationToGui(config));
    EXPECT_EQ(Json::parse(back), Json::parse(config)) << choice;
  }
}

TEST_F(ConfigTest, TextsThatAreNotJsonGiveEmptyResults) {
  pmtest::LogCapture logs;
  EXPECT_EQ(source->GuiToConfiguration("{not json"), "");
  EXPECT_EQ(source->ConfigurationToGui("{not json"), "");
  EXPECT_EQ(source->GuiToConfiguration(""), "");
  EXPECT_EQ(source->ValidateGui("{not json"), "{not json");
  // JSON of another shape is read as far as it goes.
  EXPECT_EQ(Json::parse(source->GuiToConfiguration("[1,2]")), (Json{{"bandwidth", "ndi_bandwidth_highest"}}));
  EXPECT_EQ(Json::parse(source->ConfigurationToGui(R"({"bandwidth":5})"))["bandwidth"]["value"], 0);
}

TEST_F(ConfigTest, ConfigurationSetsBandwidthAndUnknownTextsSelectHighest) {
  source->SetConfiguration(R"({"bandwidth":"ndi_bandwidth_lowest"})");
  EXPECT_EQ(source->Bandwidth(), 0u);
  source->SetConfiguration(R"({"bandwidth":"fastest please"})");
  EXPECT_EQ(source->Bandwidth(), 100u);
  source->SetConfiguration(R"({"bandwidth":"ndi_bandwidth_audio_only"})");
  EXPECT_EQ(source->Bandwidth(), 10u);
  source->SetConfiguration("not json");  // read fails: values stay
  EXPECT_EQ(source->Bandwidth(), 10u);
  EXPECT_FALSE(source->Started());
}

}  // namespace
