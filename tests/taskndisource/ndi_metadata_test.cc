// Metadata read from the sender, shot events and tally sent to it, and PTZ
// commands forwarded to it.

#include <gtest/gtest.h>

#include <deque>

#include "fakes.h"
#include "scripted_ndi.h"
#include "support/log_capture.h"
#include "support/wait.h"
#include "taskndisource/ndi_source.h"

namespace {

using nditest::Entry;
using nditest::VideoCapture;
using TaskNDISource::NDISource;
using TaskNDISource::ReceiverState;
using TaskNDISource::ShotEvent;

constexpr char kId[] = "NDICaptureDevice~STUDIO (Cam 1)";
void* const kReceiver = reinterpret_cast<void*>(0x10);

class MetadataTest : public ::testing::Test {
 protected:
  ~MetadataTest() override { source->Stop(); }

  void Metadata(const std::string& text) { source->ProcessMetadataFrame(nditest::MetadataCapture(text)->metadata); }

  std::vector<std::string> Ptz(std::vector<nlohmann::json> commands) {
    std::deque<nlohmann::json> queue(commands.begin(), commands.end());
    const std::size_t before = ndi.Seen().ptzCalls.size();
    source->RunPtzCommands(kReceiver, queue);
    EXPECT_TRUE(queue.empty());
    const auto calls = ndi.Seen().ptzCalls;
    return std::vector<std::string>(calls.begin() + static_cast<std::ptrdiff_t>(before), calls.end());
  }

  pmtest::LogCapture logs;
  nditest::ScriptedNdi ndi;
  std::shared_ptr<nditest::FakeCallbacks> callbacks = std::make_shared<nditest::FakeCallbacks>();
  nditest::TestEnvironment env;
  std::shared_ptr<NDISource> source = std::make_shared<NDISource>(callbacks, kId, ndi.Api(), env.Make());
};

TEST_F(MetadataTest, ShotEventIsPrintedIndentedWithItsTerminatingZeroCounted) {
  std::deque<ShotEvent> queue{ShotEvent{"X", 1, 0}, ShotEvent{"a\"b<&>", 0, 1}};
  source->SendShotEvents(kReceiver, queue);
  EXPECT_TRUE(queue.empty());
  const auto sent = ndi.Seen().metadataSent;
  ASSERT_EQ(sent.size(), 2u);
  EXPECT_EQ(sent[0], "<skyrelay_ext>\n    <event value=\"X\" preview=\"1\" live=\"0\"/>\n</skyrelay_ext>\n");
  EXPECT_EQ(sent[1],
            "<skyrelay_ext>\n    <event value=\"a&quot;b&lt;&amp;&gt;\" preview=\"0\" live=\"1\"/>\n</skyrelay_ext>\n");
  EXPECT_EQ(ndi.Seen().metadataLengths[0], static_cast<int>(sent[0].size()) + 1);
}

TEST_F(MetadataTest, UnsentShotEventStaysFirstForTheNextPass) {
  std::deque<ShotEvent> queue{ShotEvent{"one", 0, 0}, ShotEvent{"two", 0, 0}};
  ndi.SetMetadataResult(false);
  source->SendShotEvents(kReceiver, queue);
  ASSERT_EQ(queue.size(), 2u);
  EXPECT_EQ(queue.front().name, "one");
  EXPECT_EQ(ndi.Seen().metadataLengths.size(), 1u);  // stopped at the first failure
  ndi.SetMetadataResult(true);
  source->SendShotEvents(kReceiver, queue);
  EXPECT_TRUE(queue.empty());
  ASSERT_EQ(ndi.Seen().metadataSent.size(), 2u);
  EXPECT_NE(ndi.Seen().metadataSent[0].find("\"one\""), std::string::npos);
  EXPECT_NE(ndi.Seen().metadataSent[1].find("\"two\""), std::string::npos);
}

TEST_F(MetadataTest, EveryPtzCommandReachesItsCallWithItsParameters) {
  EXPECT_EQ(Ptz({
                {{"command", "RecallPreset"}, {"preset", 3}, {"speed", 0.5}},
                {{"command", "StorePreset"}, {"preset", 7}},
                {{"command", "PanTilt"}, {"pan", -0.25}, {"tilt", 0.75}},
                {{"command", "PanTiltSpeed"}, {"pan", 1}, {"tilt", -1}},
                {{"command", "Zoom"}, {"zoom", 0.5}},
                {{"command", "AutoFocus"}},
                {{"command", "Focus"}, {"val", 0.25}},
                {{"command", "FocusSpeed"}, {"speed", -0.5}},
                {{"command", "AutoExposure"}},
                {{"command", "ExposureManual"}, {"level", 0.125}},
                {{"command", "BalanceMode"}, {"mode", "auto"}},
                {{"command", "BalanceMode"}, {"mode", "indoor"}},
                {{"command", "BalanceMode"}, {"mode", "outdoor"}},
                {{"command", "BalanceMode"}, {"mode", "oneshot"}},
                {{"command", "BalanceMode"}, {"mode", "manual"}, {"red", 0.5}, {"blue", 0.25}},
            }),
            (std::vector<std::string>{"recall_preset(3,0.5)", "store_preset(7)", "pan_tilt(-0.25,0.75)",
                                      "pan_tilt_speed(1,-1)", "zoom(0.5)", "auto_focus()", "focus(0.25)",
                                      "focus_speed(-0.5)", "exposure_auto()", "exposure_manual(0.125)",
                                      "white_balance_auto()", "white_balance_indoor()", "white_balance_outdoor()",
                                      "white_balance_oneshot()", "white_balance_manual(0.5,0.25)"}));
  EXPECT_EQ(logs.Lines(), std::vector<std::string>{"ptz_white_balance_oneshot\n"});
}

TEST_F(MetadataTest, PtzParametersAreReadLenientlyWithTheirDefaults) {
  EXPECT_EQ(Ptz({
                {{"command", "RecallPreset"}},
                {{"command", "RecallPreset"}, {"preset", "3"}},
                {{"command", "PanTilt"}, {"pan", 0.5}},
                {{"command", "Zoom"}, {"zoom", "0.5"}},
                {{"command", "Focus"}, {"val", true}},
                {{"command", "StorePreset"}, {"preset", 2.9}},
                {{"command", "BalanceMode"}, {"mode", "manual"}},
                {{"command", "Zoom"}, {"zoom", nullptr}},
                {{"command", "Zoom"}, {"zoom", {1, 2}}},
                {{"command", "Zoom"}, {"zoom", 1e300}},
                {{"command", "StorePreset"}, {"preset", 99999999999}},
            }),
            (std::vector<std::string>{"recall_preset(0,1)", "recall_preset(3,1)", "pan_tilt(0.5,0)", "zoom(0.5)",
                                      "focus(1)", "store_preset(2)", "white_balance_manual(0,0)", "zoom(0)",
                                      "zoom(0)", "zoom(3.40282e+38)", "store_preset(2147483647)"}));
}

TEST_F(MetadataTest, PtzOfAnyOtherShapeDoesNothing) {
  EXPECT_TRUE(Ptz({
                      nullptr,
                      42,
                      "Zoom",
                      nlohmann::json::array({"command", "Zoom"}),
                      nlohmann::json::object(),
                      {{"command", "zoom"}},
                      {{"command", " Zoom"}},
                      {{"command", 5}},
                      {{"command", "BalanceMode"}},
                      {{"command", "BalanceMode"}, {"mode", "Auto"}},
                      {{"Command", "Zoom"}},
                  })
                  .empty());
  EXPECT_TRUE(logs.Lines().empty());
}

TEST_F(MetadataTest, ModelNameIsLoggedWhenItChanges) {
  Metadata(R"(<ndi_product model_name="PTZ Cam 2000"/>)");
  Metadata(R"(<ndi_product model_name="PTZ Cam 2000" serial="1"/>)");
  EXPECT_EQ(logs.Lines(), std::vector<std::string>{"#ndisource: NDI source model name: PTZ Cam 2000\n"});
  EXPECT_EQ(source->ModelName(), "PTZ Cam 2000");
  Metadata("<ndi_product/>");
  EXPECT_EQ(source->ModelName(), "");
  EXPECT_EQ(logs.Count("NDI source model name"), 2);
}

// One frame each on a fresh source: what reaches the host and what is logged.
TEST_F(MetadataTest, FramesAreReadAsTheirXmlSays) {
  const std::string parseFailed = "#ndisource: failed to parse metadata frame\n";
  const std::string invalidBuildOut = "#ndisource: invalid buildOutDuration in NDI metadata frame\n";
  std::string deep;
  for (int i = 0; i < 10000; ++i) deep += "<a>";
  struct Case {
    std::string text;
    std::vector<std::string> calls;
    std::vector<std::string> log;
  } cases[] = {
      {"<metadata><buildOutDuration>0.5</buildOutDuration></metadata>", {"buildout 352800000"}, {}},
      {"<skyrelay_ext>\n  <other/>\n  <buildOutDuration> 2 </buildOutDuration></skyrelay_ext>",
       {"buildout 1411200000"}, {}},
      {"<other><buildOutDuration>0.5</buildOutDuration></other>", {}, {}},
      {"<metadata><buildOutDuration>soon</buildOutDuration></metadata>", {}, {}},
      {"<metadata><nested><buildOutDuration>1</buildOutDuration></nested></metadata>", {}, {}},
      {"<metadata><buildOutDuration>1e300</buildOutDuration></metadata>", {}, {invalidBuildOut}},
      {"<metadata><buildOutDuration>nan</buildOutDuration></metadata>", {}, {invalidBuildOut}},
      {"<metadata><buildOutDuration>-inf</buildOutDuration></metadata>", {}, {invalidBuildOut}},
      {"", {}, {parseFailed}},
      {"not xml at all", {}, {parseFailed}},
      {"<metadata><buildOutDuration>0.5</metadata>", {}, {parseFailed}},
      {"<!-- only a comment -->", {}, {"#ndisource: metadata frame has no root element\n"}},
      {std::string(1 << 20, '<'), {}, {parseFailed}},
      {deep, {}, {parseFailed}},
  };
  for (const Case& c : cases) {
    SCOPED_TRACE(c.text.substr(0, 80));
    auto fresh = std::make_shared<nditest::FakeCallbacks>();
    NDISource one(fresh, kId, ndi.Api(), env.Make());
    logs.Clear();
    one.ProcessMetadataFrame(nditest::MetadataCapture(c.text)->metadata);
    EXPECT_EQ(fresh->Seen().calls, c.calls);
    EXPECT_EQ(logs.Lines(), c.log);
  }
}

TEST_F(MetadataTest, FramesWithoutUsableDataAreDroppedWithTheirLine) {
  const std::pair<ndi_metadata_frame, const char*> cases[] = {
      {{0, 0, const_cast<char*>("<a/>")}, "#ndisource: invalid length in NDI metadata frame\n"},
      {{-5, 0, const_cast<char*>("<a/>")}, "#ndisource: invalid length in NDI metadata frame\n"},
      {{5, 0, nullptr}, "#ndisource: null data in NDI metadata frame\n"},
  };
  for (const auto& [frame, line] : cases) {
    logs.Clear();
    source->ProcessMetadataFrame(frame);
    EXPECT_EQ(logs.Lines(), std::vector<std::string>{line});
  }
  EXPECT_TRUE(callbacks->Seen().calls.empty());
}

TEST_F(MetadataTest, MetadataIsReadOnlyWithinItsLength) {
  // No terminating zero: exactly `length` bytes are read (ASan guards the end).
  const std::string text = "<metadata><buildOutDuration>1</buildOutDuration></metadata>";
  auto* exact = new char[text.size()];
  std::memcpy(exact, text.data(), text.size());
  ndi_metadata_frame frame{static_cast<int>(text.size()), 0, exact};
  source->ProcessMetadataFrame(frame);
  delete[] exact;
  // A zero inside the length ends the text there.
  std::string withZero = "<ndi_product model_name=\"A\"/>";
  withZero.push_back('\0');
  withZero += "garbage that is not XML";
  ndi_metadata_frame early{static_cast<int>(withZero.size()), 0, withZero.data()};
  source->ProcessMetadataFrame(early);
  EXPECT_EQ(callbacks->Seen().calls, std::vector<std::string>{"buildout 705600000"});
  EXPECT_EQ(source->ModelName(), "A");
}

TEST_F(MetadataTest, PtzSupportIsReportedWithTheModelName) {
  Metadata(R"(<ndi_product model_name="Model X"/>)");
  ndi.SetPtzSupported(true);
  source->ReportPtzSupport(kReceiver);
  ndi.SetPtzSupported(false);
  source->ReportPtzSupport(kReceiver);
  EXPECT_EQ(callbacks->Seen().calls, (std::vector<std::string>{"ptz NDI3/Model X", "ptz /"}));
  EXPECT_TRUE(logs.Contains("#ndisource: NDICaptureDevice~STUDIO (Cam 1) supports PTZ\n"));
}

// The vendor runtime's order: PTZ support first, the product metadata after.
TEST_F(MetadataTest, AModelNameArrivingAfterPtzSupportIsReportedAgain) {
  ndi.SetPtzSupported(true);
  source->ReportPtzSupport(kReceiver);
  Metadata(R"(<ndi_product model_name="Model Y"/>)");
  Metadata(R"(<ndi_product model_name="Model Y"/>)");
  ndi.SetPtzSupported(false);
  source->ReportPtzSupport(kReceiver);
  Metadata(R"(<ndi_product model_name="Model Z"/>)");
  EXPECT_EQ(callbacks->Seen().calls, (std::vector<std::string>{"ptz NDI3/", "ptz NDI3/Model Y", "ptz /"}));
}

// Through the receiver loop: tally, shot events and PTZ commands reach the
// sender only after a delivered frame, in order.
class MetadataLoopTest : public MetadataTest {
 protected:
  void StartReceiving() {
    ndi.SetSources({Entry{"STUDIO (Cam 1)", "127.0.0.1:1"}});
    ndi.Push(VideoCapture(kNdiFourCCUYVY, 16, 4, 32));
    source->Start();
    ASSERT_TRUE(pmtest::WaitFor([&] { return source->State() == ReceiverState::Receiving; }));
  }
};

TEST_F(MetadataLoopTest, TallyChangesBetweenTwoPassesAreSentAsOne) {
  StartReceiving();
  ndi.BlockCapture(true);
  const int captures = ndi.Seen().captures;
  ASSERT_TRUE(pmtest::WaitFor([&] { return ndi.Seen().captures > captures; }));
  const std::size_t before = ndi.Seen().tallies.size();
  source->HandleShotEvent("TALLY_LIVE_ON");
  source->HandleShotEvent("TALLY_PREVIEW_ON");
  ndi.BlockCapture(false);
  ASSERT_TRUE(pmtest::WaitFor([&] { return ndi.Seen().tallies.size() > before; }));
  ASSERT_TRUE(pmtest::WaitFor([&] { return ndi.Seen().captures > captures + 2; }));
  const auto tallies = ndi.Seen().tallies;
  ASSERT_EQ(tallies.size(), before + 1);
  EXPECT_TRUE(tallies.back().on_program);
  EXPECT_TRUE(tallies.back().on_preview);
}

TEST_F(MetadataLoopTest, ShotEventsWithStrayBlanksAreEventsAndCarryTheTally) {
  source->HandleShotEvent("Cut before start");
  StartReceiving();  // Start empties the queue: the event above is never sent
  source->HandleShotEvent("TALLY_PREVIEW_ON");
  source->HandleShotEvent(" TALLY_LIVE_ON");  // not a tally command
  source->HandleShotEvent("TALLY_LIVE_ON ");
  source->HandleShotEvent("Cut");
  // The loop may take the events in more than one batch; each batch goes
  // out after a delivered frame.
  for (int i = 0; i < 3; ++i) ndi.Push(VideoCapture(kNdiFourCCUYVY, 16, 4, 32));
  ASSERT_TRUE(pmtest::WaitFor([&] { return ndi.Seen().metadataSent.size() >= 5; }));
  const auto sent = ndi.Seen().metadataSent;
  ASSERT_EQ(sent.size(), 5u);
  EXPECT_EQ(sent[2], "<skyrelay_ext>\n    <event value=\" TALLY_LIVE_ON\" preview=\"1\" live=\"0\"/>\n</skyrelay_ext>\n");
  EXPECT_EQ(sent[3], "<skyrelay_ext>\n    <event value=\"TALLY_LIVE_ON \" preview=\"1\" live=\"0\"/>\n</skyrelay_ext>\n");
  EXPECT_EQ(sent[4], "<skyrelay_ext>\n    <event value=\"Cut\" preview=\"1\" live=\"0\"/>\n</skyrelay_ext>\n");
  ASSERT_TRUE(pmtest::WaitFor([&] { return !ndi.Seen().tallies.empty() && ndi.Seen().tallies.back().on_preview; }));
  EXPECT_FALSE(ndi.Seen().tallies.back().on_program);
}

TEST_F(MetadataLoopTest, PtzWhileStoppedIsDroppedAndInIdleWaitsForAFrame) {
  source->ExecutePtzCommand({{"command", "Zoom"}, {"zoom", 0.1}});
  StartReceiving();
  ndi.SetConnections(0);
  ASSERT_TRUE(pmtest::WaitFor([&] { return callbacks->Seen().states == std::vector<std::int32_t>{1, 2, 3}; }));
  source->ExecutePtzCommand({{"command", "Zoom"}, {"zoom", 0.5}});
  ASSERT_EQ(env.clock->AwaitWait(1), 5000);
  EXPECT_TRUE(ndi.Seen().ptzCalls.empty());
  ndi.SetConnections(1);
  ndi.Push(VideoCapture(kNdiFourCCUYVY, 16, 4, 32));
  env.clock->AdvanceMs(5000);
  ASSERT_TRUE(pmtest::WaitFor([&] { return !ndi.Seen().ptzCalls.empty(); }));
  EXPECT_EQ(ndi.Seen().ptzCalls, std::vector<std::string>{"zoom(0.5)"});
  source->Stop();
  source->ExecutePtzCommand({{"command", "Zoom"}, {"zoom", 0.9}});
  EXPECT_EQ(ndi.Seen().ptzCalls.size(), 1u);
}

TEST_F(MetadataLoopTest, StatusChangeAndMetadataFramesAreHandledAndFreed) {
  ndi.SetPtzSupported(true);
  ndi.Push(nditest::MetadataCapture(R"(<ndi_product model_name="Cam"/>)"));
  ndi.Push(nditest::TypeOnly(kNdiFrameStatusChange));
  ndi.Push(nditest::TypeOnly(kNdiFrameError));
  StartReceiving();  // the metadata frame counts as delivered
  ASSERT_TRUE(pmtest::WaitFor([&] { return callbacks->Count("ptz NDI3/Cam") == 1; }));
  ASSERT_TRUE(pmtest::WaitFor([&] { return ndi.Seen().queued == 0; }));
  source->Stop();
  EXPECT_EQ(ndi.Seen().frees[2], 1);
  EXPECT_EQ(ndi.Seen().frees[0], 1);
  EXPECT_TRUE(ndi.Seen().freesMatched);
}

}  // namespace
