// Metadata read from the sender, shot events and tally sent to it, and PTZ
// commands forwarded to it.

#include <gtest/gtest.h>

#include "ndi_harness.h"
#include "support/log_capture.h"
#include "support/wait.h"
#include "taskndisource/ndi_source.h"

namespace {

using nditest::AnyVideo;
using TaskNDISource::NDISource;
using TaskNDISource::ShotEvent;
using Lines = std::vector<std::string>;

constexpr char kId[] = "NDICaptureDevice~STUDIO (Cam 1)";
void* const kReceiver = reinterpret_cast<void*>(0x10);

class MetadataTest : public ::testing::Test {
 protected:
  ~MetadataTest() override { source->Stop(); }

  void Metadata(const std::string& text) { source->ProcessMetadataFrame(nditest::MetadataCapture(text)->metadata); }
  bool WaitFor(const std::function<bool()>& done) { return pmtest::WaitFor(done); }
  // Starts the loop on a listed sender and waits until a frame was delivered.
  void StartReceiving() {
    ndi.SetSources({nditest::Entry{"STUDIO (Cam 1)", "127.0.0.1:1"}});
    ndi.Push(AnyVideo());
    source->Start();
    ASSERT_TRUE(WaitFor([&] { return source->State() == TaskNDISource::ReceiverState::Receiving; }));
  }

  pmtest::LogCapture logs;
  nditest::ScriptedNdi ndi;
  std::shared_ptr<nditest::FakeCallbacks> callbacks = std::make_shared<nditest::FakeCallbacks>();
  nditest::TestEnvironment env;
  std::shared_ptr<NDISource> source = std::make_shared<NDISource>(callbacks, kId, ndi.Api(), env.Make());
};

// Events go out in order, printed indented and escaped with the terminating
// zero counted; a refused send stops the pass and keeps the event first.
TEST_F(MetadataTest, ShotEventsAreSentInOrderAndAnUnsentOneStaysFirst) {
  std::deque<ShotEvent> queue{ShotEvent{"X", 1, 0}, ShotEvent{"a\"b<&>", 0, 1}};
  ndi.SetMetadataResult(false);
  source->SendShotEvents(kReceiver, queue);
  ASSERT_EQ(queue.size(), 2u);
  EXPECT_EQ(ndi.Seen().metadataLengths.size(), 1u);
  ndi.SetMetadataResult(true);
  source->SendShotEvents(kReceiver, queue);
  EXPECT_TRUE(queue.empty());
  const auto sent = ndi.Seen().metadataSent;
  EXPECT_EQ(sent, (Lines{"<skyrelay_ext>\n    <event value=\"X\" preview=\"1\" live=\"0\"/>\n</skyrelay_ext>\n",
                         "<skyrelay_ext>\n    <event value=\"a&quot;b&lt;&amp;&gt;\" preview=\"0\" live=\"1\"/>\n"
                         "</skyrelay_ext>\n"}));
  EXPECT_EQ(ndi.Seen().metadataLengths[1], static_cast<int>(sent[0].size()) + 1);
}

// Each command reaches its call with its parameters read leniently (defaults
// for missing ones, clamped to the call's type); any other shape does nothing.
TEST_F(MetadataTest, PtzCommandsReachTheirCallsAndOtherShapesDoNothing) {
  const std::pair<nlohmann::json, const char*> cases[] = {
      {{{"command", "RecallPreset"}, {"preset", 3}, {"speed", 0.5}}, "recall_preset(3,0.5)"},
      {{{"command", "StorePreset"}, {"preset", 7}}, "store_preset(7)"},
      {{{"command", "PanTilt"}, {"pan", -0.25}, {"tilt", 0.75}}, "pan_tilt(-0.25,0.75)"},
      {{{"command", "PanTiltSpeed"}, {"pan", 1}, {"tilt", -1}}, "pan_tilt_speed(1,-1)"},
      {{{"command", "Zoom"}, {"zoom", 0.5}}, "zoom(0.5)"},
      {{{"command", "AutoFocus"}}, "auto_focus()"},
      {{{"command", "Focus"}, {"val", 0.25}}, "focus(0.25)"},
      {{{"command", "FocusSpeed"}, {"speed", -0.5}}, "focus_speed(-0.5)"},
      {{{"command", "AutoExposure"}}, "exposure_auto()"},
      {{{"command", "ExposureManual"}, {"level", 0.125}}, "exposure_manual(0.125)"},
      {{{"command", "BalanceMode"}, {"mode", "auto"}}, "white_balance_auto()"},
      {{{"command", "BalanceMode"}, {"mode", "indoor"}}, "white_balance_indoor()"},
      {{{"command", "BalanceMode"}, {"mode", "outdoor"}}, "white_balance_outdoor()"},
      {{{"command", "BalanceMode"}, {"mode", "oneshot"}}, "white_balance_oneshot()"},
      {{{"command", "BalanceMode"}, {"mode", "manual"}, {"red", 0.5}, {"blue", 0.25}}, "white_balance_manual(0.5,0.25)"},
      // Lenient parameters.
      {{{"command", "RecallPreset"}}, "recall_preset(0,1)"},
      {{{"command", "RecallPreset"}, {"preset", "3"}}, "recall_preset(3,1)"},
      {{{"command", "PanTilt"}, {"pan", 0.5}}, "pan_tilt(0.5,0)"},
      {{{"command", "Zoom"}, {"zoom", "0.5"}}, "zoom(0.5)"},
      {{{"command", "Focus"}, {"val", true}}, "focus(1)"},
      {{{"command", "StorePreset"}, {"preset", 2.9}}, "store_preset(2)"},
      {{{"command", "BalanceMode"}, {"mode", "manual"}}, "white_balance_manual(0,0)"},
      {{{"command", "Zoom"}, {"zoom", nullptr}}, "zoom(0)"},
      {{{"command", "Zoom"}, {"zoom", {1, 2}}}, "zoom(0)"},
      {{{"command", "Zoom"}, {"zoom", 1e300}}, "zoom(3.40282e+38)"},
      {{{"command", "StorePreset"}, {"preset", 99999999999}}, "store_preset(2147483647)"},
      // Other shapes.
      {nullptr, nullptr},
      {42, nullptr},
      {"Zoom", nullptr},
      {nlohmann::json::array({"command", "Zoom"}), nullptr},
      {nlohmann::json::object(), nullptr},
      {{{"command", "zoom"}}, nullptr},
      {{{"command", " Zoom"}}, nullptr},
      {{{"command", 5}}, nullptr},
      {{{"command", "BalanceMode"}}, nullptr},
      {{{"command", "BalanceMode"}, {"mode", "Auto"}}, nullptr},
      {{{"Command", "Zoom"}}, nullptr},
  };
  std::deque<nlohmann::json> queue;
  Lines expected;
  for (const auto& [command, call] : cases) {
    queue.push_back(command);
    if (call != nullptr) expected.push_back(call);
  }
  source->RunPtzCommands(kReceiver, queue);
  EXPECT_TRUE(queue.empty());
  EXPECT_EQ(ndi.Seen().ptzCalls, expected);
  EXPECT_EQ(logs.Lines(), Lines{"ptz_white_balance_oneshot\n"});
}

// Frames on a fresh source each: what reaches the host, what is logged and
// the model name kept. A frame is its text and zero, or exactly `length`
// bytes of its text (a read past them is the sanitizer's to catch).
TEST_F(MetadataTest, FramesAreReadAsTheirXmlSaysWithinTheirLength) {
  constexpr int kWithZero = -1000;
  const std::string parseFailed = "#ndisource: failed to parse metadata frame\n";
  const std::string badBuildOut = "#ndisource: invalid buildOutDuration in NDI metadata frame\n";
  const std::string badLength = "#ndisource: invalid length in NDI metadata frame\n";
  const std::string modelLine = "#ndisource: NDI source model name: ";
  const std::string buildOne = "<metadata><buildOutDuration>1</buildOutDuration></metadata>";
  const std::string withZero = std::string("<ndi_product model_name=\"A\"/>") + '\0' + "garbage that is not XML";
  std::string deep;
  for (int i = 0; i < 10000; ++i) deep += "<a>";
  struct Frame {
    std::string text;
    int length = kWithZero;
    bool noData = false;
  };
  struct Case {
    std::vector<Frame> frames;
    Lines calls, log;
    std::string model;
  } cases[] = {
      {{{"<metadata><buildOutDuration>0.5</buildOutDuration></metadata>"}}, {"buildout 352800000"}, {}, ""},
      {{{"<skyrelay_ext>\n  <other/>\n  <buildOutDuration> 2 </buildOutDuration></skyrelay_ext>"}},
       {"buildout 1411200000"}, {}, ""},
      {{{"<other><buildOutDuration>0.5</buildOutDuration></other>"}}, {}, {}, ""},
      {{{"<metadata><buildOutDuration>soon</buildOutDuration></metadata>"}}, {}, {}, ""},
      {{{"<metadata><nested><buildOutDuration>1</buildOutDuration></nested></metadata>"}}, {}, {}, ""},
      {{{"<metadata><buildOutDuration>1e300</buildOutDuration></metadata>"}}, {}, {badBuildOut}, ""},
      {{{"<metadata><buildOutDuration>nan</buildOutDuration></metadata>"}}, {}, {badBuildOut}, ""},
      {{{"<metadata><buildOutDuration>-inf</buildOutDuration></metadata>"}}, {}, {badBuildOut}, ""},
      {{{""}}, {}, {parseFailed}, ""},
      {{{"not xml at all"}}, {}, {parseFailed}, ""},
      {{{"<metadata><buildOutDuration>0.5</metadata>"}}, {}, {parseFailed}, ""},
      {{{"<!-- only a comment -->"}}, {}, {"#ndisource: metadata frame has no root element\n"}, ""},
      {{{std::string(1 << 20, '<')}}, {}, {parseFailed}, ""},
      {{{deep}}, {}, {parseFailed}, ""},
      {{{"<a/>", 0}}, {}, {badLength}, ""},
      {{{"<a/>", -5}}, {}, {badLength}, ""},
      {{{"<a/>", 5, true}}, {}, {"#ndisource: null data in NDI metadata frame\n"}, ""},
      {{{buildOne, static_cast<int>(buildOne.size())}}, {"buildout 705600000"}, {}, ""},  // no zero
      {{{withZero, static_cast<int>(withZero.size())}}, {}, {modelLine + "A\n"}, "A"},   // a zero ends the text
      // The model name is logged when it changes, and forgotten by a product without one.
      {{{R"(<ndi_product model_name="PTZ Cam 2000"/>)"}, {R"(<ndi_product model_name="PTZ Cam 2000" serial="1"/>)"}},
       {}, {modelLine + "PTZ Cam 2000\n"}, "PTZ Cam 2000"},
      {{{R"(<ndi_product model_name="B"/>)"}, {"<ndi_product/>"}}, {}, {modelLine + "B\n", modelLine + "\n"}, ""},
  };
  for (const Case& c : cases) {
    SCOPED_TRACE(c.frames[0].text.substr(0, 80));
    auto fresh = std::make_shared<nditest::FakeCallbacks>();
    NDISource one(fresh, kId, ndi.Api(), env.Make());
    logs.Clear();
    for (const Frame& f : c.frames) {
      if (f.length == kWithZero) {
        one.ProcessMetadataFrame(nditest::MetadataCapture(f.text)->metadata);
        continue;
      }
      std::unique_ptr<char[]> exact(new char[f.text.size()]);
      std::memcpy(exact.get(), f.text.data(), f.text.size());
      one.ProcessMetadataFrame(ndi_metadata_frame{f.length, 0, f.noData ? nullptr : exact.get()});
    }
    EXPECT_EQ(fresh->Seen().calls, c.calls);
    EXPECT_EQ(logs.Lines(), c.log);
    EXPECT_EQ(one.ModelName(), c.model);
  }
}

// The suite goes with the model name; the vendor runtime reports PTZ support
// before the product metadata, so a model name arriving (or changing) after
// the support was reported is reported again.
TEST_F(MetadataTest, PtzSupportIsReportedWithTheModelNameAndAgainWhenTheNameArrives) {
  ndi.SetPtzSupported(true);
  source->ReportPtzSupport(kReceiver);
  Metadata(R"(<ndi_product model_name="Model Y"/>)");
  Metadata(R"(<ndi_product model_name="Model Y"/>)");
  ndi.SetPtzSupported(false);
  source->ReportPtzSupport(kReceiver);
  Metadata(R"(<ndi_product model_name="Model Z"/>)");
  ndi.SetPtzSupported(true);
  source->ReportPtzSupport(kReceiver);
  EXPECT_EQ(callbacks->Seen().calls, (Lines{"ptz NDI3/", "ptz NDI3/Model Y", "ptz /", "ptz NDI3/Model Z"}));
  EXPECT_TRUE(logs.Contains("#ndisource: NDICaptureDevice~STUDIO (Cam 1) supports PTZ\n"));
}

// Through the receiver loop: tally, shot events and PTZ commands reach the
// sender only after a delivered frame, in order.
TEST_F(MetadataTest, TallyChangesBetweenTwoPassesAreSentAsOne) {
  StartReceiving();
  ndi.BlockCapture(true);
  const int captures = ndi.Seen().captures;
  ASSERT_TRUE(WaitFor([&] { return ndi.Seen().captures > captures; }));
  const std::size_t before = ndi.Seen().tallies.size();
  source->HandleShotEvent("TALLY_LIVE_ON");
  source->HandleShotEvent("TALLY_PREVIEW_ON");
  ndi.BlockCapture(false);
  ASSERT_TRUE(WaitFor([&] { return ndi.Seen().tallies.size() > before && ndi.Seen().captures > captures + 2; }));
  const auto tallies = ndi.Seen().tallies;
  ASSERT_EQ(tallies.size(), before + 1);
  EXPECT_TRUE(tallies.back().on_program);
  EXPECT_TRUE(tallies.back().on_preview);
}

TEST_F(MetadataTest, ShotEventsWithStrayBlanksAreEventsAndCarryTheTally) {
  source->HandleShotEvent("Cut before start");
  StartReceiving();  // Start empties the queue: the event above is never sent
  for (const char* event : {"TALLY_PREVIEW_ON", " TALLY_LIVE_ON", "TALLY_LIVE_ON ", "Cut"}) source->HandleShotEvent(event);
  // The loop may take the events in more than one batch; each batch goes
  // out after a delivered frame.
  for (int i = 0; i < 3; ++i) ndi.Push(AnyVideo());
  ASSERT_TRUE(WaitFor([&] { return ndi.Seen().metadataSent.size() >= 5; }));
  const auto sent = ndi.Seen().metadataSent;
  const auto event = [](const std::string& name) {
    return "<skyrelay_ext>\n    <event value=\"" + name + "\" preview=\"1\" live=\"0\"/>\n</skyrelay_ext>\n";
  };
  EXPECT_EQ(Lines(sent.begin() + 2, sent.end()), (Lines{event(" TALLY_LIVE_ON"), event("TALLY_LIVE_ON "), event("Cut")}));
  ASSERT_TRUE(WaitFor([&] { return !ndi.Seen().tallies.empty() && ndi.Seen().tallies.back().on_preview; }));
  EXPECT_FALSE(ndi.Seen().tallies.back().on_program);
}

TEST_F(MetadataTest, PtzWhileStoppedIsDroppedAndInIdleWaitsForAFrame) {
  source->ExecutePtzCommand({{"command", "Zoom"}, {"zoom", 0.1}});
  StartReceiving();
  ndi.SetConnections(0);
  ASSERT_TRUE(WaitFor([&] { return callbacks->Seen().states == std::vector<std::int32_t>{1, 2, 3}; }));
  source->ExecutePtzCommand({{"command", "Zoom"}, {"zoom", 0.5}});
  ASSERT_EQ(env.clock->AwaitWait(1), 5000);
  EXPECT_TRUE(ndi.Seen().ptzCalls.empty());
  ndi.SetConnections(1);
  ndi.Push(AnyVideo());
  env.clock->AdvanceMs(5000);
  ASSERT_TRUE(WaitFor([&] { return !ndi.Seen().ptzCalls.empty(); }));
  source->Stop();
  source->ExecutePtzCommand({{"command", "Zoom"}, {"zoom", 0.9}});
  EXPECT_EQ(ndi.Seen().ptzCalls, Lines{"zoom(0.5)"});
}

TEST_F(MetadataTest, StatusChangeAndMetadataFramesAreHandledAndFreed) {
  ndi.SetPtzSupported(true);
  ndi.Push(nditest::MetadataCapture(R"(<ndi_product model_name="Cam"/>)"));
  ndi.Push(nditest::MetadataCapture("", kNdiFrameStatusChange));
  ndi.Push(nditest::MetadataCapture("", kNdiFrameError));
  StartReceiving();  // the metadata frame counts as delivered
  ASSERT_TRUE(WaitFor([&] { return callbacks->Count("ptz NDI3/Cam") == 1 && ndi.Seen().queued == 0; }));
  source->Stop();
  EXPECT_EQ(ndi.Seen().frees[2], 1);
  EXPECT_EQ(ndi.Seen().frees[0], 1);
  EXPECT_TRUE(ndi.Seen().freesMatched);
}

}  // namespace
